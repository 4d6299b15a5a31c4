// The frame builder and the capture files: layouts are checked against
// hand-written bytes and independent checksum arithmetic, captures against
// the classic pcap layout.
#include "tools/lib/frames.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>

namespace {

using frames::Bytes;
using frames::FrameBuilder;

const frames::MacAddr kDst = frames::Mac("02:00:00:00:00:02");
const frames::MacAddr kSrc = frames::Mac("02:00:00:00:00:01");

uint16_t At16(const Bytes& b, size_t i) { return static_cast<uint16_t>(b[i] << 8 | b[i + 1]); }

// Independent ones'-complement sum: adds 16-bit words, folds at the end.
uint16_t OnesSum(const Bytes& b, size_t from, size_t len, uint64_t sum = 0) {
  for (size_t i = 0; i < len; i += 2) {
    sum += static_cast<uint64_t>(b[from + i]) << 8;
    if (i + 1 < len) sum += b[from + i + 1];
  }
  while (sum > 0xffff) sum = (sum >> 16) + (sum & 0xffff);
  return static_cast<uint16_t>(sum);
}

TEST(FrameLiterals, ParseAddresses) {
  EXPECT_EQ(frames::Mac("0a:Bb:cc:00:01:ff"), (frames::MacAddr{0x0a, 0xbb, 0xcc, 0, 1, 0xff}));
  EXPECT_EQ(frames::Ip4("192.168.0.199"), (frames::Ip4Addr{192, 168, 0, 199}));
  frames::Ip6Addr v6 = frames::Ip6("2001:db8::10:1");
  EXPECT_EQ(frames::Hex(v6), "20 01 0d b8 00 00 00 00 00 00 00 00 00 10 00 01");
  EXPECT_EQ(frames::Ip6("::")[15], 0);
  EXPECT_EQ(frames::Ip6("::9")[15], 9);
  EXPECT_EQ(frames::Ip6("fe80::")[0], 0xfe);
  EXPECT_EQ(frames::Ip6("1:2:3:4:5:6:7:8")[15], 8);
  EXPECT_DEATH(frames::Ip4("10.0.0.256"), "malformed");
  EXPECT_DEATH(frames::Ip6("1::2::3"), "malformed");
  EXPECT_DEATH(frames::Mac("02:00:00:00:00"), "malformed");
}

TEST(FrameChecksum, KnownIpv4HeaderVector) {
  // A textbook header whose checksum is 0xb861.
  Bytes f = FrameBuilder()
                .Ipv4(frames::Ip4("192.168.0.1"), frames::Ip4("192.168.0.199"))
                .IpId(0)
                .DontFragment()
                .Ttl(64)
                .IpProto(17)
                .Payload(0x73 - 20)
                .Build();
  ASSERT_EQ(f.size(), 0x73u);
  EXPECT_EQ(frames::Hex(std::span(f).first(20)),
            "45 00 00 73 00 00 40 00 40 11 b8 61 c0 a8 00 01 c0 a8 00 c7");
  EXPECT_TRUE(frames::Ipv4HeaderChecksumOk(f, 0));
  f[8] = 63;
  EXPECT_FALSE(frames::Ipv4HeaderChecksumOk(f, 0));
}

TEST(FrameLayout, EthernetIpv4TcpFields) {
  FrameBuilder b;
  b.Eth(kDst, kSrc)
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Tos(0x01)
      .Tcp(1234, 80, frames::kTcpSyn, 7)
      .Payload(10);
  Bytes f = b.Build();
  ASSERT_EQ(f.size(), 14u + 20 + 20 + 10);
  EXPECT_EQ(b.L3Offset(), 14u);
  EXPECT_EQ(b.L4Offset(), 34u);
  EXPECT_EQ(frames::Hex(std::span(f).first(14)), "02 00 00 00 00 02 02 00 00 00 00 01 08 00");
  EXPECT_EQ(f[14], 0x45);
  EXPECT_EQ(f[15], 0x01);
  EXPECT_EQ(At16(f, 16), 50);
  EXPECT_EQ(f[23], 6);
  EXPECT_EQ(OnesSum(f, 14, 20), 0xffff);
  EXPECT_EQ(At16(f, 34), 1234);
  EXPECT_EQ(At16(f, 36), 80);
  EXPECT_EQ(f[46], 0x50);  // data offset 5
  EXPECT_EQ(f[47], frames::kTcpSyn);
  // TCP checksum over the pseudo header and the segment.
  uint64_t pseudo = 0x0a00 + 0x0001 + 0x0a00 + 0x0002 + 6 + 30;
  EXPECT_EQ(OnesSum(f, 34, 30, pseudo), 0xffff);
}

TEST(FrameLayout, Ipv4OptionsFragmentsAndOverrides) {
  FrameBuilder b;
  b.Eth(kDst, kSrc)
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Ipv4Options({0x94, 0x04, 0x00})  // router alert, padded to 4
      .Fragment(185, true)
      .Udp(67, 68)
      .Payload(4);
  Bytes f = b.Build();
  EXPECT_EQ(f[14], 0x46);
  EXPECT_EQ(b.L4Offset(), 14u + 24);
  EXPECT_EQ(frames::Hex(std::span(f).subspan(34, 4)), "94 04 00 00");
  EXPECT_EQ(At16(f, 20), 0x2000 | 185);
  EXPECT_EQ(OnesSum(f, 14, 24), 0xffff);
  EXPECT_EQ(At16(f, 38), 67);
  EXPECT_EQ(At16(f, 42), 12);  // UDP length

  Bytes bad = FrameBuilder().Eth(kDst, kSrc).Ipv4({}, {}).Ihl(3).Ipv4Checksum(0x1234).Build();
  EXPECT_EQ(bad[14], 0x43);
  EXPECT_EQ(At16(bad, 24), 0x1234);
  EXPECT_EQ(bad.size(), 34u);  // still a 20-byte header
}

TEST(FrameLayout, LlcSnapAndVlanTag) {
  FrameBuilder b;
  b.Eth(kDst, kSrc).Vlan(0x123, 5).Llc().Ipv4(frames::Ip4("1.2.3.4"), frames::Ip4("5.6.7.8"));
  Bytes f = b.Build();
  EXPECT_EQ(b.L3Offset(), 26u);
  EXPECT_EQ(frames::Hex(std::span(f).subspan(12, 14)),
            "81 00 a1 23 00 1c aa aa 03 00 00 00 08 00");
  EXPECT_EQ(f[26], 0x45);

  Bytes plain = FrameBuilder().Eth(kDst, kSrc).Llc().EtherType(0x86dd).LlcLength(1500).Build();
  EXPECT_EQ(frames::Hex(std::span(plain).subspan(12)), "05 dc aa aa 03 00 00 00 86 dd");

  Bytes tagged = FrameBuilder().Eth(kDst, kSrc).Vlan(7).Ipv6({}, {}).Build();
  EXPECT_EQ(frames::Hex(std::span(tagged).subspan(12, 6)), "81 00 00 07 86 dd");
}

TEST(FrameLayout, Ipv6ExtensionChainWalksToUpperLayer) {
  FrameBuilder b;
  b.Eth(kDst, kSrc)
      .Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::2"))
      .TrafficClass(0xb9)
      .FlowLabel(0x12345)
      .HopByHop()
      .Routing(1)
      .Ah(0x100, 12)
      .DestOpts(2)
      .Fragment6(0, false)
      .Udp(547, 546)
      .Payload(3);
  Bytes f = b.Build();
  // Version 6, traffic class b9, flow label 12345.
  EXPECT_EQ(frames::Hex(std::span(f).subspan(14, 4)), "6b 91 23 45");
  // Walk the chain with the lengths each header declares.
  uint8_t nh = f[20];
  size_t o = 54;
  std::vector<uint8_t> seen;
  while (nh != frames::kProtoUdp) {
    ASSERT_LT(o + 2, f.size());
    seen.push_back(nh);
    uint8_t next = f[o];
    if (nh == frames::kExtAh) o += 8 + 4 * f[o + 1];
    else if (nh == frames::kExtFragment) o += 8;
    else o += 8 + 8 * f[o + 1];
    nh = next;
  }
  EXPECT_EQ(seen, (std::vector<uint8_t>{0, 43, 51, 60, 44}));
  EXPECT_EQ(o, b.L4Offset());
  EXPECT_EQ(o, 54u + 8 + 16 + 24 + 24 + 8);
  EXPECT_EQ(At16(f, 18), f.size() - 54);  // payload length
  EXPECT_EQ(At16(f, o), 547);
  // UDP checksum with the IPv6 pseudo header (the upper-layer length).
  uint64_t pseudo = OnesSum(f, 22, 32) + (f.size() - o) + 17;
  EXPECT_EQ(OnesSum(f, o, f.size() - o, pseudo), 0xffff);

  Bytes frag = FrameBuilder().Ipv6({}, {}).Fragment6(100, true, 9).IpProto(6).Build();
  EXPECT_EQ(frames::Hex(std::span(frag).subspan(40)), "06 00 03 21 00 00 00 09");
}

TEST(FrameLayout, ArpIcmpAndPadding) {
  Bytes arp = FrameBuilder()
                  .Eth(frames::Mac("ff:ff:ff:ff:ff:ff"), kSrc)
                  .Arp(1, kSrc, frames::Ip4("10.0.0.1"), {}, frames::Ip4("10.0.0.2"))
                  .PadTo(60)
                  .Build();
  ASSERT_EQ(arp.size(), 60u);
  EXPECT_EQ(frames::Hex(std::span(arp).subspan(12, 10)), "08 06 00 01 08 00 06 04 00 01");
  EXPECT_EQ(arp[41], 2);  // last byte of the target address

  Bytes icmp = FrameBuilder().Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
                   .Icmp(8, 0, 0x00010002)
                   .Payload(5)
                   .Build();
  EXPECT_EQ(icmp[9], 1);
  EXPECT_EQ(OnesSum(icmp, 20, 13), 0xffff);  // no pseudo header for ICMPv4
}

TEST(Capture, ClassicPcapLayoutAndRoundTrip) {
  std::vector<frames::CaptureRecord> in = {
      {1, FrameBuilder().Eth(kDst, kSrc).Ipv4({}, {}).Build(), 0},
      {2, Bytes{1, 2, 3}, 1500},
  };
  Bytes enc = frames::EncodeCapture(in);
  ASSERT_EQ(enc.size(), 24u + 16 + 34 + 16 + 3);
  EXPECT_EQ(frames::Hex(std::span(enc).first(24)),
            "d4 c3 b2 a1 02 00 04 00 00 00 00 00 00 00 00 00 ff ff 00 00 01 00 00 00");
  // Second record: seconds 1, microseconds = direction 2, lengths 3 and 1500.
  EXPECT_EQ(frames::Hex(std::span(enc).subspan(74, 16)),
            "01 00 00 00 02 00 00 00 03 00 00 00 dc 05 00 00");

  std::string path = ::testing::TempDir() + "/frames_roundtrip.pcap";
  ASSERT_TRUE(frames::WriteCapture(path, in));
  std::vector<frames::CaptureRecord> out;
  std::string err;
  ASSERT_TRUE(frames::ReadCapture(path, &out, &err)) << err;
  ASSERT_EQ(out.size(), 2u);
  EXPECT_EQ(out[0].direction, 1u);
  EXPECT_EQ(out[0].frame, in[0].frame);
  EXPECT_EQ(out[0].origLen, 34u);
  EXPECT_EQ(out[1].direction, 2u);
  EXPECT_EQ(out[1].origLen, 1500u);
  std::remove(path.c_str());
}

TEST(Capture, ReadsBigEndianAndRejectsDamage) {
  // A big-endian, nanosecond file with one 2-byte record, direction field 7
  // (not a direction of ours).
  Bytes be = {0xa1, 0xb2, 0x3c, 0x4d, 0, 2, 0, 4, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff,
              0, 0, 0, 1,
              0, 0, 0, 5, 0, 0, 0, 7, 0, 0, 0, 2, 0, 0, 0, 2, 0xab, 0xcd};
  std::vector<frames::CaptureRecord> out;
  std::string err;
  ASSERT_TRUE(frames::DecodeCapture(be, &out, &err)) << err;
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(out[0].direction, 0u);
  EXPECT_EQ(out[0].frame, (Bytes{0xab, 0xcd}));

  Bytes truncated(be.begin(), be.end() - 1);
  EXPECT_FALSE(frames::DecodeCapture(truncated, &out, &err));
  EXPECT_EQ(err, "truncated record");
  EXPECT_TRUE(out.empty());

  Bytes wrongLink = be;
  wrongLink[23] = 113;
  EXPECT_FALSE(frames::DecodeCapture(wrongLink, &out, &err));
  Bytes notPcap(30, 0);
  EXPECT_FALSE(frames::DecodeCapture(notPcap, &out, &err));
  EXPECT_FALSE(frames::DecodeCapture(Bytes{0xd4, 0xc3}, &out, &err));
  Bytes huge = be;
  huge[32] = 0x7f;  // record length far beyond any frame
  EXPECT_FALSE(frames::DecodeCapture(huge, &out, &err));
  EXPECT_FALSE(frames::ReadCapture("/nonexistent/x.pcap", &out, &err));
}

}  // namespace
