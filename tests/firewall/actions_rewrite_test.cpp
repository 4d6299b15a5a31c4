// Packet-modifying actions other than GRE: the L2 rewrite in both
// directions (in place and through a partial copy), the DSCP mark on IPv4
// (checked against headers built independently, checksum included) and
// IPv6, the 802.1p mark and the resource-pool tag.
//
// Read-only packets are made with writable = false: the host aborts when a
// frame it handed out read-only has been written, so every "copy" case also
// proves the original was left alone.

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

constexpr char kRewriteMac[] = "0a:0b:0c:0d:0e:0f";

class RewriteActions : public PacketPathTest {
 protected:
  // Runs one packet and returns it as it stands in the list afterwards (or
  // null when it left the list); the list lives until the next call.
  ZelPkt* RunOne(const host::PacketSpec& spec, uint32_t direction) {
    list_ = std::make_unique<host::PacketList>();
    list_->Append(host::Packets::Make(spec));
    EXPECT_EQ(host::Sluice::Deliver(id_, *list_, direction), ZEL_OK);
    std::vector<ZelPkt*> left = list_->Packets();
    return left.empty() ? nullptr : left[0];
  }
  static host::PacketSpec Spec(const Bytes& frame, bool writable = true) {
    host::PacketSpec spec;
    spec.frame = frame;
    spec.writable = writable;
    return spec;
  }
  void TearDown() override {
    list_.reset();
    PacketPathTest::TearDown();
  }
  std::unique_ptr<host::PacketList> list_;
};

// The frame with the destination MAC replaced (and, when turned around, the
// old destination as the source).
Bytes Rewritten(Bytes f, bool turnedAround) {
  frames::MacAddr mac = frames::Mac(kRewriteMac);
  if (turnedAround) std::copy(f.begin(), f.begin() + 6, f.begin() + 6);
  std::copy(mac.begin(), mac.end(), f.begin());
  return f;
}

TEST_F(RewriteActions, FromTheSwitchTurnsThePacketAroundInOrder) {
  ApplyText(ExactTcp4("l2rewrite", 1234, 80, std::string("rewrite=") + kRewriteMac));
  const Bytes a = Tcp4(1234, 80, 1), b = Tcp4(1234, 80, 2), other = Tcp4(1, 2);
  host::PacketSpec roB = Spec(b, false);  // needs a copy
  std::vector<Bytes> passed =
      Run({host::Packets::Make(a), host::Packets::Make(other), host::Packets::Make(roB)}, 1);
  EXPECT_EQ(passed, (std::vector<Bytes>{other}));
  EXPECT_EQ(Issued(), (std::vector<Handed>{{2, {Rewritten(a, true), Rewritten(b, true)}}}));
  EXPECT_TRUE(Faulted().empty());
}

TEST_F(RewriteActions, TowardTheSwitchOnlyReplacesTheDestination) {
  ApplyText(ExactTcp4("l2rewrite", 1234, 80, std::string("rewrite=") + kRewriteMac));
  const Bytes a = Tcp4();
  for (bool writable : {true, false}) {
    SCOPED_TRACE(writable ? "in place" : "copy");
    ZelPkt* left = RunOne(Spec(a, writable), 2);
    ASSERT_NE(left, nullptr);
    EXPECT_EQ(host::Packets::Frame(left), Rewritten(a, false));
    EXPECT_EQ(zel_PktIsBufDescWritable(left), true);  // the copy is writable
  }
  EXPECT_TRUE(Issued().empty());
}

TEST_F(RewriteActions, ShortMappedPartIsCopiedAndCopyFailuresAreLogged) {
  // A general rule, since a packet with less than 26 mapped bytes has no
  // fields to match on.
  ApplyText(std::string("action=l2rewrite rawflags=0x3ff rewrite=") + kRewriteMac);
  const Bytes a = Tcp4();
  host::PacketSpec shortMap = Spec(a);
  shortMap.sgSizes = {10, static_cast<uint32_t>(a.size() - 10)};
  ZelPkt* left = RunOne(shortMap, 2);
  ASSERT_NE(left, nullptr);
  EXPECT_EQ(host::Packets::Frame(left), Rewritten(a, false));

  // Writable and mapped: no copy is asked for.
  host::Faults::Fail("zel_PktPartialCopy", ZEL_NO_MEMORY, 1, true);
  EXPECT_EQ(host::Packets::Frame(RunOne(Spec(a), 2)), Rewritten(a, false));
  EXPECT_EQ(host::Faults::Seen("zel_PktPartialCopy"), 0u);

  // A copy that fails leaves the packet as it was, in the list.
  host::Log::Clear();
  EXPECT_EQ(Run({host::Packets::Make(Spec(a, false)), host::Packets::Make(Spec(a, false))}, 1),
            (std::vector<Bytes>{a, a}));
  EXPECT_EQ(host::Log::Count("copy error when forwarding pkt", 2), 2u);
  EXPECT_TRUE(Issued().empty());
}

// --- DSCP ------------------------------------------------------------------------

FrameBuilder V4(uint8_t tos) {
  return Base()
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Tos(tos)
      .IpId(0x1c46)
      .Tcp(1234, 80)
      .Payload(12);
}

TEST_F(RewriteActions, DscpOnIpv4KeepsEcnAndRecomputesTheChecksum) {
  ApplyText("action=dscp ipv4 proto=tcp dscp=46");
  struct Case {
    const char* name;
    FrameBuilder before, after;
    size_t l3;
  };
  const Bytes opts = {0x94, 0x04, 0, 0, 0x01, 0x01, 0x01, 0x00};
  std::vector<Case> cases = {
      {"plain", V4(0x01), V4(0xb9), 14},
      {"options", V4(0x02).Ipv4Options(opts), V4(0xba).Ipv4Options(opts), 14},
      {"802.1Q over 802.3", V4(0xff).Vlan(3).Llc(), V4(0xbb).Vlan(3).Llc(), 26},
  };
  for (Case& c : cases) {
    SCOPED_TRACE(c.name);
    for (bool writable : {true, false}) {
      ZelPkt* left = RunOne(Spec(c.before.Build(), writable), 1);
      ASSERT_NE(left, nullptr);
      Bytes got = host::Packets::Frame(left);
      EXPECT_EQ(frames::Hex(got), frames::Hex(c.after.Build()));
      EXPECT_TRUE(frames::Ipv4HeaderChecksumOk(got, c.l3));
    }
  }
}

TEST_F(RewriteActions, DscpHeaderBeyondTheMappedPartIsMarkedOnACopy) {
  ApplyText("action=dscp ipv4 proto=udp dscp=10");
  const Bytes opts(40, 0x01);  // IHL 15: the header ends at 74
  Bytes before = Base().Ipv4({}, {}).Tos(0x03).Ipv4Options(opts).Udp(1, 2).Payload(40).Build();
  Bytes after = Base().Ipv4({}, {}).Tos(0x2b).Ipv4Options(opts).Udp(1, 2).Payload(40).Build();
  host::PacketSpec spec = Spec(before);
  spec.sgSizes = {34, static_cast<uint32_t>(before.size() - 34)};
  spec.mappedLen = 34;
  ZelPkt* left = RunOne(spec, 2);
  ASSERT_NE(left, nullptr);
  EXPECT_EQ(host::Packets::Frame(left), after);

  // A failed copy skips the mark silently.
  host::Faults::Fail("zel_PktPartialCopy", ZEL_NO_MEMORY);
  host::Log::Clear();
  EXPECT_EQ(host::Packets::Frame(RunOne(spec, 2)), before);
  EXPECT_TRUE(host::Log::Records().empty());
}

TEST_F(RewriteActions, DscpOnIpv6KeepsVersionEcnAndFlowLabel) {
  ApplyText("action=dscp ipv6 proto=udp dscp=46");
  auto v6 = [](uint8_t tc) {
    return Base()
        .Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::2"))
        .TrafficClass(tc)
        .FlowLabel(0xabcde)
        .HopByHop()
        .Udp(1, 2)
        .Build();
  };
  for (uint8_t ecn : {0, 1, 2, 3}) {
    ZelPkt* left = RunOne(Spec(v6(static_cast<uint8_t>(0x10 | ecn))), 1);
    EXPECT_EQ(frames::Hex(host::Packets::Frame(left)),
              frames::Hex(v6(static_cast<uint8_t>(46 << 2 | ecn))));
  }
}

TEST_F(RewriteActions, DscpSkipsWhatItCannotMarkButTheCombinedActionStillSetsPriority) {
  ApplyText("action=dscp+dot1p rawflags=0x3ff dscp=46 dot1p=6");
  struct Case {
    const char* name;
    Bytes frame;
  };
  std::vector<Case> cases = {
      {"IHL below 5", Base().Ipv4({}, {}).Ihl(4).Udp(1, 2).Build()},
      {"IHL past the frame", Base().Ipv4({}, {}).Ihl(15).Udp(1, 2).Build()},
      {"not IP", Base().Arp(1, kSrcMac, {}, {}, {}).Build()},
      {"unparsed", Bytes(20, 0x45)},
  };
  for (Case& c : cases) {
    SCOPED_TRACE(c.name);
    ZelPkt* left = RunOne(Spec(c.frame, false), 1);
    ASSERT_NE(left, nullptr);
    EXPECT_EQ(host::Packets::Frame(left), c.frame);
    EXPECT_EQ(host::Packets::Priority(left), 6);
  }
  // Marked through a copy: the priority lands on the packet in the list.
  ZelPkt* left = RunOne(Spec(V4(0).Build(), false), 1);
  EXPECT_EQ(host::Packets::Frame(left), V4(46 << 2).Build());
  EXPECT_EQ(host::Packets::Priority(left), 6);
}

// --- Metadata marks ------------------------------------------------------------------

TEST_F(RewriteActions, Dot1pAndPoolTagSetMetadataOnly) {
  host::ResPools::Define("gold", 7);
  ApplyText(ExactTcp4("dot1p", 1, 1, "dot1p=5") + "\n" + ExactTcp4("pooltag", 2, 2, "pool=gold") +
            "\n" + ExactTcp4("pooltag", 3, 3, "pool=nosuchpool"));
  struct Case {
    uint16_t port;
    uint8_t priority;
    uint16_t tag;
  };
  for (Case c : {Case{1, 5, 0}, Case{2, 0, 7}, Case{3, 0, 0xffff}}) {
    SCOPED_TRACE(c.port);
    const Bytes f = Tcp4(c.port, c.port);
    ZelPkt* left = RunOne(Spec(f, false), 2);
    ASSERT_NE(left, nullptr);
    EXPECT_EQ(host::Packets::Frame(left), f);
    EXPECT_EQ(host::Packets::Priority(left), c.priority);
    EXPECT_EQ(host::Packets::ResPoolTag(left), c.tag);
  }
}

}  // namespace
