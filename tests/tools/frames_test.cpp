// The frame builder's checksums, checked by independent arithmetic.
#include "tools/lib/frames.h"

#include <gtest/gtest.h>

#include <cstdio>

namespace {

using frames::Bytes;
using frames::FrameBuilder;

// Ones'-complement sum of 16-bit words from `from`, folded; 0xffff over a
// span whose checksum is right.
uint16_t OnesSum(const Bytes& b, size_t from, size_t len, uint64_t sum = 0) {
  for (size_t i = 0; i < len; i += 2) {
    sum += static_cast<uint64_t>(b[from + i]) << 8;
    if (i + 1 < len) sum += b[from + i + 1];
  }
  while (sum > 0xffff) sum = (sum >> 16) + (sum & 0xffff);
  return static_cast<uint16_t>(sum);
}

TEST(FrameChecksum, HeadersAndTransportOverTheirPseudoHeaders) {
  const frames::MacAddr mac = frames::Mac("02:00:00:00:00:02");
  // Options padded to 4 bytes.
  const Bytes tcp =
      FrameBuilder().Eth(mac, mac).Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
          .Ipv4Options({0x94, 0x04, 0x00}).Tcp(1234, 80, frames::kTcpSyn, 7).Payload(11).Build();
  EXPECT_EQ(OnesSum(tcp, 14, 24), 0xffff);
  EXPECT_TRUE(frames::Ipv4HeaderChecksumOk(tcp, 14));
  EXPECT_EQ(OnesSum(tcp, 38, 31, 0x0a00 + 0x0001 + 0x0a00 + 0x0002 + 6 + 31), 0xffff);

  FrameBuilder b;
  b.Eth(mac, mac).Vlan(7).Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::2"));
  b.HopByHop().Routing(1).Ah(0x100, 12).Fragment6(0, false).Udp(547, 546).Payload(3);
  const Bytes udp = b.Build();
  const size_t l4 = b.L4Offset(), len = udp.size() - l4;
  ASSERT_EQ(l4, 18u + 40 + 8 + 16 + 24 + 8);
  EXPECT_EQ(OnesSum(udp, l4, len, OnesSum(udp, 26, 32) + len + 17), 0xffff);

  const Bytes icmp = FrameBuilder().Ipv4({}, {}).Icmp(8, 0, 0x00010002).Payload(5).Build();
  EXPECT_EQ(OnesSum(icmp, 20, 13), 0xffff);  // no pseudo header for ICMPv4
}

}  // namespace
