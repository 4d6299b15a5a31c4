// Parsing frames into packet summaries: L2 shapes, the metadata VLAN tag,
// IPv4 and IPv6 headers with fragments and extension chains, port bounds,
// headers beyond the mapped part and across scatter-gather elements, and the
// packet tuple against the rule tuple.

#include <cstring>

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

constexpr uint32_t kL2L3V4 = FW_PKT_RPTAG | FW_PKT_L2 | FW_PKT_L3 | FW_PKT_IPV4;
constexpr uint32_t kL2L3V6 = FW_PKT_RPTAG | FW_PKT_L2 | FW_PKT_L3 | FW_PKT_IPV6;

class PacketParse : public testsupport::HostTest {
 protected:
  void TearDown() override {
    for (ZelPkt* p : pkts_) zel_PktRelease(p);
    pkts_.clear();
    HostTest::TearDown();
  }

  FWPktSummary Parse(host::PacketSpec spec, uint32_t fragOverride = 0) {
    ZelPkt* p = host::Packets::Make(spec);
    pkts_.push_back(p);  // the summary points into the frame
    frame_ = zel_PktFrameMappedPointerGet(p);
    FWPktSummary s;
    std::memset(&s, 0xcc, sizeof(s));  // nothing may depend on old contents
    FWParsePacket(p, fragOverride, &s);
    return s;
  }
  FWPktSummary Parse(const Bytes& frame, uint32_t fragOverride = 0) {
    host::PacketSpec spec;
    spec.frame = frame;
    return Parse(spec, fragOverride);
  }
  // Offset of a summary pointer in the frame last parsed.
  ptrdiff_t Off(const uint8_t* p) const { return p - frame_; }
  static uint16_t Port(const uint8_t* p) { return FWNet16(p); }

  std::vector<ZelPkt*> pkts_;
  const uint8_t* frame_ = nullptr;
};

TEST_F(PacketParse, FramesShorterThanTheEthernetParseHaveOnlyThePoolTagBit) {
  Bytes full = Tcp4();
  EXPECT_EQ(Parse(Bytes(full.begin(), full.begin() + 25)).presence, FW_PKT_RPTAG);

  host::PacketSpec shortMap;
  shortMap.frame = full;
  shortMap.sgSizes = {25, static_cast<uint32_t>(full.size() - 25)};
  EXPECT_EQ(Parse(shortMap).presence, FW_PKT_RPTAG);

  // 26 bytes: L2 only, the IPv4 header does not fit.
  FWPktSummary s = Parse(Bytes(full.begin(), full.begin() + 26));
  EXPECT_EQ(s.presence, FW_PKT_RPTAG | FW_PKT_L2);
  EXPECT_EQ(Off(s.dMac), 0);
  EXPECT_EQ(Off(s.sMac), 6);
  EXPECT_EQ(FWNet16(s.ethType), 0x0800);
}

struct L2Case {
  const char* name;
  FrameBuilder builder;
  ptrdiff_t l3;
};

TEST_F(PacketParse, EthernetShapesPlaceTheEtherTypeAndL3) {
  const frames::Ip4Addr sa = frames::Ip4("10.0.0.1"), da = frames::Ip4("10.0.0.2");
  std::vector<L2Case> cases = {
      {"ethernet II", Base().Ipv4(sa, da).Udp(1, 2), 14},
      {"802.3 LLC/SNAP", Base().Llc().Ipv4(sa, da).Udp(1, 2), 22},
      {"802.1Q", Base().Vlan(5).Ipv4(sa, da).Udp(1, 2), 18},
      {"802.1Q over 802.3", Base().Vlan(5).Llc().Ipv4(sa, da).Udp(1, 2), 26},
      {"802.3 length 1500", Base().Llc().LlcLength(1500).Ipv4(sa, da).Udp(1, 2), 22},
      {"802.1Q over 802.3 length 1500",
       Base().Vlan(5).Llc().LlcLength(1500).Ipv4(sa, da).Udp(1, 2), 26},
  };
  for (L2Case& c : cases) {
    SCOPED_TRACE(c.name);
    FWPktSummary s = Parse(c.builder.Build());
    EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_UDP);
    EXPECT_EQ(FWNet16(s.ethType), 0x0800);
    EXPECT_EQ(Off(s.ipSa), c.l3 + 12);
    EXPECT_EQ(Off(s.ipDa), c.l3 + 16);
    EXPECT_EQ(Port(s.sPort), 1);
    EXPECT_EQ(Port(s.dPort), 2);
  }
  // 1501 is no 802.3 length, and like any other EtherType stops after L2.
  FWPktSummary odd = Parse(Base().EtherType(1501).Payload(40).Build());
  EXPECT_EQ(odd.presence, FW_PKT_RPTAG | FW_PKT_L2);
  EXPECT_EQ(FWNet16(odd.ethType), 1501);
  odd = Parse(Base().Vlan(5).EtherType(1501).Payload(40).Build());
  EXPECT_EQ(FWNet16(odd.ethType), 1501);
  FWPktSummary arp = Parse(Base()
                               .Arp(1, kSrcMac, frames::Ip4("10.0.0.1"), {},
                                    frames::Ip4("10.0.0.2"))
                               .Build());
  EXPECT_EQ(arp.presence, FW_PKT_RPTAG | FW_PKT_L2);
  EXPECT_EQ(FWNet16(arp.ethType), 0x0806);
}

TEST_F(PacketParse, VlanTagComesFromMetadataNotTheFrame) {
  host::PacketSpec spec;
  spec.frame = Base().Vlan(0x777, 7).Ipv4({}, {}).Build();
  FWPktSummary s = Parse(spec);
  EXPECT_EQ(FWNet32(s.vlan1QTag), 0u);  // in-frame tag ignored

  spec.vlanId = 0x123;
  spec.priority = 5;
  EXPECT_EQ(FWNet32(Parse(spec).vlan1QTag), 0x8100a123u);
  spec.vlanId = 0;
  spec.priority = 3;
  EXPECT_EQ(FWNet32(Parse(spec).vlan1QTag), 0x81006000u);
  spec.vlanId = 0xfff;
  spec.priority = 0;
  EXPECT_EQ(FWNet32(Parse(spec).vlan1QTag), 0x81000fffu);
}

TEST_F(PacketParse, Ipv4OptionsAndIhlAsItStands) {
  FWPktSummary s = Parse(Base()
                             .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
                             .Ipv4Options({0x94, 0x04, 0, 0, 1, 1, 1, 0})
                             .Tcp(443, 8443)
                             .Build());
  EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_TCP);
  EXPECT_EQ(s.ipProto, 6);
  EXPECT_EQ(Port(s.sPort), 443);
  EXPECT_EQ(Port(s.dPort), 8443);

  // IHL 3: the "transport header" starts 12 bytes into the IP header, so
  // the ports are the source address's bytes. Nothing is read out of bounds.
  s = Parse(Base()
                .Ipv4(frames::Ip4("1.2.3.4"), frames::Ip4("10.0.0.2"))
                .Ihl(3)
                .Udp(1, 2)
                .Build());
  EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_UDP);
  EXPECT_EQ(Port(s.sPort), 0x0102);
  EXPECT_EQ(Port(s.dPort), 0x0304);

  // A header cut by the mapped length: L2 only.
  Bytes f = Tcp4();
  host::PacketSpec spec;
  spec.frame = f;
  spec.mappedLen = 14 + 19;
  EXPECT_EQ(Parse(spec).presence, FW_PKT_RPTAG | FW_PKT_L2);
}

TEST_F(PacketParse, Ipv4FragmentsAndTheOverride) {
  auto frag = [](uint16_t offset, bool more, bool df = false) {
    return Base()
        .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
        .DontFragment(df)
        .Fragment(offset, more)
        .Udp(53, 53)
        .Build();
  };
  EXPECT_EQ(Parse(frag(0, true)).presence,
            kL2L3V4 | FW_PKT_FIRST_FRAG | FW_PKT_PORTS | FW_PKT_UDP);
  EXPECT_EQ(Parse(frag(0, true), SLCGenericActionDrop).presence, kL2L3V4 | FW_PKT_FIRST_FRAG);
  EXPECT_EQ(Parse(frag(3, true)).presence, kL2L3V4 | FW_PKT_LATER_FRAG);
  EXPECT_EQ(Parse(frag(3, false)).presence, kL2L3V4 | FW_PKT_LATER_FRAG);
  // Don't-fragment alone is no fragment; the override then changes nothing.
  EXPECT_EQ(Parse(frag(0, false, true), SLCGenericActionDrop).presence,
            kL2L3V4 | FW_PKT_PORTS | FW_PKT_UDP);
}

TEST_F(PacketParse, TransportHeaderMustFitTheFrame) {
  Bytes tcp = Base().Ipv4({}, {}).Tcp(1, 2).Build();  // L4 at 34, 54 bytes
  EXPECT_EQ(Parse(Bytes(tcp.begin(), tcp.end() - 1)).presence, kL2L3V4);
  EXPECT_EQ(Parse(tcp).presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_TCP);

  Bytes udp = Base().Ipv4({}, {}).Udp(1, 2).Build();  // 42 bytes
  EXPECT_EQ(Parse(Bytes(udp.begin(), udp.end() - 1)).presence, kL2L3V4);
  EXPECT_EQ(Parse(udp).presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_UDP);

  // Other protocols never get ports.
  EXPECT_EQ(Parse(Base().Ipv4({}, {}).Icmp(8, 0).Payload(30).Build()).presence, kL2L3V4);
}

TEST_F(PacketParse, PortsBeyondTheMappedPartComeFromTheirElement) {
  Bytes tcp = Base().Ipv4({}, {}).Tcp(1000, 2000).Payload(10).Build();
  Bytes udp = Base().Ipv4({}, {}).Udp(1000, 2000).Payload(10).Build();
  auto split = [](const Bytes& f, std::vector<uint32_t> sizes, uint32_t mapped) {
    host::PacketSpec spec;
    spec.frame = f;
    spec.sgSizes = sizes;
    spec.mappedLen = mapped;
    return spec;
  };
  const uint32_t t = static_cast<uint32_t>(tcp.size()), u = static_cast<uint32_t>(udp.size());

  // Transport header wholly in element 1.
  FWPktSummary s = Parse(split(tcp, {34, t - 34}, 34));
  EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_TCP);
  EXPECT_EQ(Port(s.sPort), 1000);
  EXPECT_EQ(Port(s.dPort), 2000);
  s = Parse(split(udp, {34, u - 34}, 34));
  EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_UDP);
  EXPECT_EQ(Port(s.dPort), 2000);

  // Element 0 ends 4 bytes into the transport header: TCP fetches only the
  // ports, which fit; UDP fetches its 8 bytes, which straddle.
  s = Parse(split(tcp, {38, t - 38}, 34));
  EXPECT_EQ(s.presence, kL2L3V4 | FW_PKT_PORTS | FW_PKT_TCP);
  EXPECT_EQ(Port(s.dPort), 2000);
  EXPECT_EQ(Parse(split(udp, {38, u - 38}, 34)).presence, kL2L3V4);

  // A missing element leaves the packet without ports.
  host::PacketSpec hidden = split(tcp, {34, t - 34}, 34);
  ZelPkt* p = host::Packets::Make(hidden);
  pkts_.push_back(p);
  host::Packets::HideSgElement(p, 1);
  FWPktSummary h;
  FWParsePacket(p, 0, &h);
  EXPECT_EQ(h.presence, kL2L3V4);
}

TEST_F(PacketParse, Ipv6ExtensionChainsReachTheUpperLayer) {
  const frames::Ip6Addr sa = frames::Ip6("2001:db8::1"), da = frames::Ip6("2001:db8::2");
  FWPktSummary s = Parse(
      Base().Ipv6(sa, da).HopByHop().Routing(1).Fragment6(0, false).Tcp(22, 2222).Build());
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_PORTS | FW_PKT_TCP);
  EXPECT_EQ(s.ipProto, 6);
  EXPECT_EQ(Off(s.ipSa), 14 + 8);
  EXPECT_EQ(Off(s.ipDa), 14 + 24);
  EXPECT_EQ(Port(s.sPort), 22);
  EXPECT_EQ(Port(s.dPort), 2222);

  s = Parse(Base().Ipv6(sa, da).DestOpts(2).Ah(0x100, 20).Udp(547, 546).Build());
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_PORTS | FW_PKT_UDP);
  EXPECT_EQ(Port(s.sPort), 547);

  s = Parse(Base().Ipv6(sa, da).Fragment6(0, true).Udp(1, 2).Build());
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_FIRST_FRAG | FW_PKT_PORTS | FW_PKT_UDP);
  s = Parse(Base().Ipv6(sa, da).Fragment6(0, true).Udp(1, 2).Build(), SLCGenericActionDrop);
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_FIRST_FRAG);
  s = Parse(Base().Ipv6(sa, da).HopByHop().Fragment6(7, false).Udp(1, 2).Build());
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_LATER_FRAG);
  EXPECT_EQ(s.ipProto, 17);
  // Only the reserved bits set: not a fragment.
  s = Parse(Base().Ipv6(sa, da).RawExt(44, {0, 0, 0, 6, 0, 0, 0, 1}).Udp(1, 2).Build());
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_PORTS | FW_PKT_UDP);

  s = Parse(Base().Ipv6(sa, da).HopByHop().Icmp6(128, 0).Payload(8).Build());
  EXPECT_EQ(s.presence, kL2L3V6);
  EXPECT_EQ(s.ipProto, 58);
}

TEST_F(PacketParse, Ipv6WalkFailuresGiveProtocol255AndNoPorts) {
  const frames::Ip6Addr sa = frames::Ip6("2001:db8::1"), da = frames::Ip6("2001:db8::2");
  Bytes chain = Base().Ipv6(sa, da).HopByHop().Routing().Tcp(1, 2).Build();

  // The routing header (at 62) straddles elements 0 and 1 at 63.
  host::PacketSpec spec;
  spec.frame = chain;
  spec.sgSizes = {63, static_cast<uint32_t>(chain.size() - 63)};
  spec.mappedLen = 54;
  FWPktSummary s = Parse(spec);
  EXPECT_EQ(s.presence, kL2L3V6);
  EXPECT_EQ(s.ipProto, 255);
  // Beyond the mapped part but inside one element: walked.
  spec.sgSizes = {64, static_cast<uint32_t>(chain.size() - 64)};
  s = Parse(spec);
  EXPECT_EQ(s.presence, kL2L3V6 | FW_PKT_PORTS | FW_PKT_TCP);
  EXPECT_EQ(Port(s.dPort), 2);

  // A header length that runs past the frame; a chain that ends at the
  // frame's end; a fragment header cut short.
  Bytes runaway = Base().Ipv6(sa, da).RawExt(0, {0, 255, 1, 4, 0, 0, 0, 0}).Tcp(1, 2).Build();
  EXPECT_EQ(Parse(runaway).ipProto, 255);
  Bytes noNext = Base().Ipv6(sa, da).HopByHop().Build();
  noNext[54] = 59;
  s = Parse(noNext);
  EXPECT_EQ(s.ipProto, 255);
  EXPECT_EQ(s.presence, kL2L3V6);
  Bytes cut = Base().Ipv6(sa, da).Fragment6(0, false).Udp(1, 2).Build();
  s = Parse(Bytes(cut.begin(), cut.begin() + 54 + 7));
  EXPECT_EQ(s.ipProto, 255);

  // The IPv6 header itself must be mapped.
  host::PacketSpec shortV6;
  shortV6.frame = chain;
  shortV6.mappedLen = 53;
  EXPECT_EQ(Parse(shortV6).presence, FW_PKT_RPTAG | FW_PKT_L2);
}

TEST_F(PacketParse, PacketTupleEqualsTheExactRuleTuple) {
  struct Case {
    Bytes frame;
    std::string rule;
    host::PacketSpec spec;
  };
  host::PacketSpec tagged;
  tagged.vlanId = 0x123;
  tagged.priority = 5;
  std::vector<Case> cases = {
      {Tcp4(1234, 80), ExactTcp4("accept"), {}},
      {Base().Vlan(0x123, 5).Ipv4(frames::Ip4("10.9.8.7"), frames::Ip4("10.0.0.2")).Udp(5, 6).Build(),
       "action=drop dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 vlan=0x123/5 "
       "sa=10.9.8.7 da=10.0.0.2 proto=udp sport=5 dport=6",
       tagged},
      {Base().Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::2")).HopByHop().Tcp(7, 8).Build(),
       "action=drop dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x86dd vlan=none "
       "sa=2001:db8::1 da=2001:db8::2 proto=tcp sport=7 dport=8",
       {}},
  };
  for (Case& c : cases) {
    SCOPED_TRACE(c.rule);
    c.spec.frame = c.frame;
    FWPktSummary s = Parse(c.spec);
    ASSERT_TRUE(s.presence & FW_PKT_PORTS);
    FWRuleTuple fromPacket, fromRule;
    std::memset(&fromPacket, 0, sizeof(fromPacket));
    std::memset(&fromRule, 0, sizeof(fromRule));
    FWRule rule = rules::ParseRule(c.rule);
    uint64_t ph = FWPacketTuple(&s, &fromPacket);
    uint64_t rh = FWCreateTupleFromRule(&rule, &fromRule);
    EXPECT_EQ(frames::Hex(fromPacket.bytes), frames::Hex(fromRule.bytes));
    EXPECT_EQ(fromPacket.isIPv4, fromRule.isIPv4);
    EXPECT_EQ(ph, rh);
  }
}

}  // namespace
