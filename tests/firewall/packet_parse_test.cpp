// Parsing frames into packet summaries, one row per frame shape; for some
// rows, the packet tuple against the tuple of the exact rule for it.
#include <cstring>

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;
using frames::Ip4;
using frames::Ip6;

constexpr uint32_t kL2 = FW_PKT_RPTAG | FW_PKT_L2;
constexpr uint32_t kV4 = kL2 | FW_PKT_L3 | FW_PKT_IPV4, kV6 = kL2 | FW_PKT_L3 | FW_PKT_IPV6;
constexpr uint32_t kTcp = FW_PKT_PORTS | FW_PKT_TCP, kUdp = FW_PKT_PORTS | FW_PKT_UDP;
constexpr uint32_t kFirst = FW_PKT_FIRST_FRAG, kLater = FW_PKT_LATER_FRAG;
constexpr uint32_t kDrop = SLCGenericActionDrop;

host::PacketSpec P(const Bytes& f, uint32_t m = UINT32_MAX) { return Pkt(f, true, {}, m); }
// Two scatter-gather elements, the first `at` bytes long.
host::PacketSpec Split(const Bytes& f, uint32_t at, uint32_t mapped = UINT32_MAX) {
  return Pkt(f, true, {at, static_cast<uint32_t>(f.size() - at)}, mapped);
}
Bytes Cut(const Bytes& f, size_t n) { return Bytes(f.begin(), f.begin() + n); }

struct ParseRow {
  const char* name;
  host::PacketSpec pkt;
  uint32_t presence;
  int l3 = -1;     // IP header offset, checked through the address pointers
  int proto = -1;  // ipProto, when checked
  uint16_t sport = 0, dport = 0;
  uint32_t fragOverride = 0;
  uint16_t ethType = 0;  // checked when not 0
  int hideSg = -1;       // element whose lookup fails
  uint32_t vlanTag = 0;
  std::string exactRule = "";  // its tuple and hash must be the packet's
};

using PacketParse = testsupport::HostTest;

TEST_F(PacketParse, EveryFrameShape) {
  const Bytes tcp = Tcp4(1000, 2000, 10), udp = V4().Udp(1000, 2000).Payload(10).Build();
  auto udpOver = [](FrameBuilder b) {
    return P(b.Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.2")).Udp(1, 2).Build());
  };
  auto frag4 = [](uint16_t offset, bool more, bool df = false) {
    return P(V4().DontFragment(df).Fragment(offset, more).Udp(53, 53).Build());
  };
  auto v6 = [] { return Base().Ipv6(Ip6("2001:db8::1"), Ip6("2001:db8::2")); };
  const Bytes chain = v6().HopByHop().Routing().Tcp(1, 2).Build();  // routing header at 62
  const Bytes first6 = v6().Fragment6(0, true).Udp(1, 2).Build();
  host::PacketSpec tagged = P(Base().Vlan(0x777, 7).Ipv4(Ip4("10.9.8.7"), {}).Udp(5, 6).Build());
  tagged.vlanId = 0x123;
  tagged.priority = 5;
  const std::string l2 = "dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ";
  const std::vector<ParseRow> rows = {
      {"25 bytes", P(Cut(tcp, 25)), FW_PKT_RPTAG},
      {"25 bytes mapped", Split(tcp, 25), FW_PKT_RPTAG},
      {"26 bytes", P(Cut(tcp, 26)), kL2, -1, -1, 0, 0, 0, 0x0800},
      {"Ethernet II", udpOver(Base()), kV4 | kUdp, 14, 17, 1, 2},
      {"802.3 LLC/SNAP", udpOver(Base().Llc()), kV4 | kUdp, 22, 17, 1, 2},
      {"802.1Q", udpOver(Base().Vlan(5)), kV4 | kUdp, 18, 17, 1, 2},
      {"802.1Q, 802.3", udpOver(Base().Vlan(5).Llc()), kV4 | kUdp, 26, 17, 1, 2},
      {"length 1500", udpOver(Base().Vlan(5).Llc().LlcLength(1500)), kV4 | kUdp, 26, 17, 1, 2},
      {"EtherType 1501", P(Base().EtherType(1501).Payload(40).Build()), kL2, -1, -1, 0, 0, 0, 1501},
      {"ARP", P(Base().Arp(1, {}, {}, {}, {}).Build()), kL2, -1, -1, 0, 0, 0, 0x0806},
      {"tag from metadata, not frame", tagged, kV4 | kUdp, 18, 17, 5, 6, 0, 0, -1, 0x8100a123,
       l2 + "ethtype=0x0800 vlan=0x123/5 sa=10.9.8.7 da=0.0.0.0 proto=udp sport=5 dport=6"},
      {"IPv4 TCP", P(Tcp4()), kV4 | kTcp, 14, 6, 1234, 80, 0, 0, -1, 0, ExactTcp4("accept")},
      {"IPv4 options", P(V4().Ipv4Options({0x94, 4, 0, 0, 1, 1, 1, 0}).Tcp(443, 8443).Build()),
       kV4 | kTcp, 14, 6, 443, 8443},
      // IHL 3: the ports are read from the source address, within the frame.
      {"IHL 3", P(Base().Ipv4(Ip4("1.2.3.4"), {}).Ihl(3).Udp(1, 2).Build()), kV4 | kUdp, 14, 17,
       0x0102, 0x0304},
      {"IPv4 header not mapped", P(tcp, 33), kL2},
      {"first fragment", frag4(0, true), kV4 | kFirst | kUdp, 14, 17, 53, 53},
      {"first fragment, override", frag4(0, true), kV4 | kFirst, 14, 17, 0, 0, kDrop},
      {"later fragment", frag4(3, true), kV4 | kLater, 14, 17},
      {"last fragment", frag4(3, false), kV4 | kLater, 14, 17},
      {"don't-fragment only", frag4(0, false, true), kV4 | kUdp, 14, 17, 53, 53, kDrop},
      {"TCP header short", P(Cut(V4().Tcp(1, 2).Build(), 53)), kV4, 14, 6},
      {"UDP header short", P(Cut(V4().Udp(1, 2).Build(), 41)), kV4, 14, 17},
      {"ICMP", P(V4().Icmp(8, 0).Payload(30).Build()), kV4, 14, 1},
      {"UDP in element 1", Split(udp, 34, 34), kV4 | kUdp, 14, 17, 1000, 2000},
      // TCP fetches only the 4 port bytes; UDP fetches its whole header.
      {"TCP ports in element 0", Split(tcp, 38, 34), kV4 | kTcp, 14, 6, 1000, 2000},
      {"UDP header straddles", Split(udp, 38, 34), kV4, 14, 17},
      {"element missing", Split(tcp, 34, 34), kV4, 14, 6, 0, 0, 0, 0, 1},
      {"IPv6 HBH, routing, fragment",
       P(v6().HopByHop().Routing(1).Fragment6(0, false).Tcp(7, 8).Build()), kV6 | kTcp, 14, 6, 7,
       8, 0, 0, -1, 0,
       l2 + "ethtype=0x86dd vlan=none sa=2001:db8::1 da=2001:db8::2 proto=tcp sport=7 dport=8"},
      {"IPv6 DO, AH", P(v6().DestOpts(2).Ah(0x100, 20).Udp(1, 2).Build()), kV6 | kUdp, 14, 17, 1,
       2},
      {"IPv6 first fragment", P(first6), kV6 | kFirst | kUdp, 14, 17, 1, 2},
      {"IPv6 first fragment, override", P(first6), kV6 | kFirst, 14, 17, 0, 0, kDrop},
      {"IPv6 later fragment", P(v6().HopByHop().Fragment6(7, false).Udp(1, 2).Build()),
       kV6 | kLater, 14, 17},
      {"ICMPv6", P(v6().HopByHop().Icmp6(128, 0).Payload(8).Build()), kV6, 14, 58},
      {"IPv6 header straddles elements", Split(chain, 63, 54), kV6, 14, 255},
      {"IPv6 header unmapped, one element", Split(chain, 64, 54), kV6 | kTcp, 14, 6, 1, 2},
      {"IPv6 length past frame", P(v6().RawExt(0, {0, 255, 1, 4, 0, 0, 0, 0}).Tcp(1, 2).Build()),
       kV6, 14, 255},
      {"IPv6 chain ends with frame", P(v6().HopByHop().IpProto(59).Build()), kV6, 14, 255},
      {"IPv6 fragment header cut", P(Cut(v6().Fragment6(0, false).Build(), 61)), kV6, 14, 255},
      {"IPv6 header not mapped", P(chain, 53), kL2},
  };
  for (const ParseRow& r : rows) {
    SCOPED_TRACE(r.name);
    ZelPkt* p = host::Packets::Make(r.pkt);
    if (r.hideSg >= 0) host::Packets::HideSgElement(p, static_cast<uint16_t>(r.hideSg));
    const uint8_t* frame = zel_PktFrameMappedPointerGet(p);
    FWPktSummary s;
    std::memset(&s, 0xcc, sizeof(s));  // nothing may depend on old contents
    FWParsePacket(p, r.fragOverride, &s);
    EXPECT_EQ(s.presence, r.presence);
    if (r.presence & FW_PKT_L2) {
      EXPECT_EQ(s.dMac - frame, 0);
      EXPECT_EQ(s.sMac - frame, 6);
      EXPECT_EQ(FWNet32(s.vlan1QTag), r.vlanTag);
      EXPECT_TRUE(r.ethType == 0 || FWNet16(s.ethType) == r.ethType);
    }
    if (r.l3 >= 0) {
      const bool v4 = r.presence & FW_PKT_IPV4;
      EXPECT_EQ(s.ipSa - frame, r.l3 + (v4 ? 12 : 8));
      EXPECT_EQ(s.ipDa - frame, r.l3 + (v4 ? 16 : 24));
    }
    EXPECT_TRUE(r.proto < 0 || s.ipProto == r.proto) << +s.ipProto;
    if (r.presence & FW_PKT_PORTS) {
      EXPECT_EQ(FWNet16(s.sPort), r.sport);
      EXPECT_EQ(FWNet16(s.dPort), r.dport);
    }
    if (!r.exactRule.empty()) {
      FWRuleTuple fromPacket{}, fromRule{};
      const FWRule rule = rules::ParseRule(r.exactRule);
      EXPECT_EQ(FWPacketTuple(&s, &fromPacket), FWCreateTupleFromRule(&rule, &fromRule));
      EXPECT_EQ(frames::Hex(fromPacket.bytes), frames::Hex(fromRule.bytes));
      EXPECT_EQ(fromPacket.isIPv4, fromRule.isIPv4);
    }
    zel_PktRelease(p);
  }
}

}  // namespace
