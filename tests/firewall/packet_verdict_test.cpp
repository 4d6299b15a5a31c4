// Verdicts on the packet path: lookup order and counters, punt and copy by
// attachment state and failure policy, the feature bits, the fragment
// override, and both shapes of the walk. Lists sent back by a slow path
// pass without the rules: slowpath_test.sh's punted datagrams come back.
#include <map>
#include <tuple>

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

using PacketVerdict = PacketPathTest;

TEST_F(PacketVerdict, ExactRuleWinsAndEveryMatchIsCounted) {
  // The general drop comes first in the ruleset; the exact accept still wins
  // for its flow. The third packet matches nothing and passes uncounted.
  ApplyText("action=drop ipv4 proto=tcp dport=80\n" + ExactTcp4("accept"));
  const Bytes hit = Tcp4(1234, 80, 10), general = Tcp4(999, 80, 30), none = Tcp4(999, 81);
  EXPECT_EQ(RunFrames({hit, general, none, hit}, 1), (Frames{hit, none, hit}));
  FWRuleEntry* exact = FindExact(rules::ParseRule(ExactTcp4("accept")));
  ASSERT_NE(exact, nullptr);
  EXPECT_EQ(+exact->rule.pktCount, 2u);
  EXPECT_EQ(+exact->rule.byteCount, 2 * hit.size());
  EXPECT_EQ(GeneralPkts(0), 1u);
  EXPECT_EQ(+GeneralEntries()[0]->rule.byteCount, general.size());
}

// A filter with general rules only gives packets no exact tuple; exact
// rules added beside them must be probed again, and go unprobed once a
// replacement leaves general rules only.
TEST_F(PacketVerdict, ExactRulesAddedBesideGeneralOnesAreProbed) {
  const std::string general = "action=drop ipv4 proto=tcp dport=80";
  const Bytes hit = Tcp4(1234, 80, 10);
  ApplyText(general);
  EXPECT_EQ(RunFrames({hit}, 1), Frames{});
  ASSERT_EQ(Apply(rules::ParseRuleset(ExactTcp4("accept")), /*replace=*/false), ZEL_OK);
  EXPECT_EQ(RunFrames({hit}, 1), Frames{hit});
  ApplyText(general);
  EXPECT_EQ(RunFrames({hit}, 1), Frames{});
}

// Punted packets need an attached slow path, else the failure policy drops
// (0) or passes (1) them; copies are cloned whatever the state.
TEST_F(PacketVerdict, PuntAndCopyFollowAttachStateAndFailurePolicy) {
  ApplyText(ExactTcp4("punt") + "\n" + ExactTcp4("copy", 5, 5));
  const Bytes a = Tcp4(1234, 80, 1), b = Tcp4(1234, 80, 2), c = Tcp4(5, 5), other = Tcp4(1, 1);
  EXPECT_EQ(RunFrames({a, c, other}, 1), (Frames{c, other}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {c}}}));
  Attach(/*finish=*/false);
  EXPECT_EQ(RunFrames({a, other}, 1), (Frames{other}));
  filter_->failurePolicy = 1;
  EXPECT_EQ(RunFrames({a, other}, 1), (Frames{a, other}));
  EXPECT_TRUE(Faulted().empty());
  // Attached: one hand-off per list, in order, with the call's direction.
  FinishAttach();
  EXPECT_EQ(RunFrames({a, c, other, b}, 2), (Frames{c, other}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{2, {a, c, b}}}));
  EXPECT_EQ(ExactPkts(ExactTcp4("punt")), 5u);  // counted whatever happened
  host::Faults::Fail("zel_PktClone", ZEL_NO_MEMORY);  // loses only the copy
  EXPECT_EQ(RunFrames({c, c}, 1), (Frames{c, c}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {c}}}));
}

// Bit 0 drops bridge-protocol destinations; bit 1 drops DHCP server packets
// on their way to the switch. Such drops are not counted.
TEST_F(PacketVerdict, FeatureBitsDropWithoutCounting) {
  auto to = [](const char* mac) {
    return FrameBuilder().Eth(frames::Mac(mac), {}).Llc().EtherType(0x4242).Payload(30).Build();
  };
  const Bytes bpdu = to("01:80:c2:00:00:00"), cdp = to("01:00:0c:cc:cc:cd"),
              near = to("01:80:c2:00:00:01"), tcp67 = Tcp4(67, 68);
  const Bytes dhcp4 = V4().Udp(67, 68).Build(), v4Other = V4().Udp(547, 546).Build();
  const Bytes dhcp6 = Base().Ipv6({}, {}).Udp(547, 546).Build();
  ApplyText("ruleset features=1\naction=accept rawflags=0x3ff");
  EXPECT_EQ(RunFrames({bpdu, near, cdp, dhcp4}, 1), (Frames{near, dhcp4}));
  EXPECT_EQ(RunFrames({bpdu, dhcp4}, 2), (Frames{dhcp4}));
  EXPECT_EQ(GeneralPkts(0), 3u);

  ApplyText("ruleset features=2\naction=accept rawflags=0x3ff");
  EXPECT_EQ(RunFrames({dhcp4, v4Other, dhcp6, tcp67, bpdu}, 2), (Frames{v4Other, tcp67, bpdu}));
  EXPECT_EQ(RunFrames({dhcp4, dhcp6}, 1), (Frames{dhcp4, dhcp6}));
  EXPECT_EQ(GeneralPkts(0), 5u);
}

// The override takes fragments past every rule, uncounted. Actions that need
// rule parameters have none: the fragments pass untouched, nothing is sent.
TEST_F(PacketVerdict, FragmentOverrideDecidesFragmentsWithoutARule) {
  Attach();
  const Bytes first = V4().Fragment(0, true).Tcp(1234, 80).Build(),
              later = V4().Fragment(10, false).Tcp(1234, 80).Build(), whole = Tcp4();
  // Override action, whether the fragments pass, whether they go to the slow path.
  for (auto [frag, passes, toSlowPath] : std::vector<std::tuple<std::string, bool, bool>>{
           {"drop", false, false}, {"copy", true, true}, {"punt", false, true},
           {"l2rewrite", true, false}, {"gre", true, false}, {"pooltag", true, false},
           {"dscp", true, false}, {"dot1p", true, false}, {"dscp+dot1p", true, false}}) {
    SCOPED_TRACE(frag);
    ApplyText("ruleset frag=" + frag + "\naction=drop rawflags=0x3ff");
    const std::vector<ZelPkt*> left = Run({Pkt(first, false), Pkt(later), Pkt(whole)}, 1);
    const Frames both = {first, later};
    EXPECT_EQ(FramesOf(left), passes ? both : Frames{});
    for (ZelPkt* p : left) EXPECT_EQ(host::Packets::Priority(p), 0);
    EXPECT_EQ(Faulted(), (toSlowPath ? std::vector<Handed>{{1, both}} : std::vector<Handed>{}));
    EXPECT_TRUE(Issued().empty());
    EXPECT_TRUE(host::Sockets::Sent().empty());
    EXPECT_EQ(GeneralPkts(0), 1u);  // the whole packet only
  }
  // No override: a first fragment has ports and finds its exact rule; a
  // later one has none and only a port-less rule sees it.
  ApplyText(ExactTcp4("copy") + "\naction=drop ipv4 proto=tcp sport=* dport=*");
  EXPECT_EQ(RunFrames({first, later}, 1), (Frames{first}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {first}}}));
  EXPECT_EQ(GeneralPkts(0), 1u);
}

// Large exact tables take a staged walk (a burst of packets parsed before
// the first of their verdicts, eight at a time). Both shapes must give
// every packet of a list longer than a burst, ending in a short burst and
// a short group of eight, the same verdict, keep every output in order,
// and count alike.
class WalkShapes : public PacketPathTest, public ::testing::WithParamInterface<uint32_t> {};

TEST_P(WalkShapes, LongMixedListGetsTheSameVerdictsInEitherShape) {
  Attach();
  rules::RulesetBuilder b;
  const char* actions[] = {"punt", "drop", "copy", "accept"};
  for (uint16_t i = 1; i <= 4; i++) b.Add(ExactTcp4(actions[i - 1], i, i));
  b.Add(ExactTcp4("dscp", 6, 6, "dscp=46")).Add("action=copy ipv4 proto=udp");
  b.Add(ExactTcp4("l2rewrite", 8, 8, std::string("rewrite=") + kRewriteMac));
  FWRule filler = rules::ParseRule(ExactTcp4("drop", 7, 7));
  for (uint32_t i = 0; i < GetParam(); i++) {
    filler.ipSa[0] = static_cast<uint8_t>(11 + (i >> 16));
    filler.ipSa[1] = static_cast<uint8_t>(i >> 8);
    filler.ipSa[2] = static_cast<uint8_t>(i);
    b.Add(filler);
  }
  ASSERT_EQ(Apply(b.Bytes()), ZEL_OK);
  ASSERT_EQ(ctx_->ruleHash->numBuckets > 65536, GetParam() > 0);

  // Port 5 matches nothing, 0 is an unparsed frame, 9 is UDP.
  const uint16_t ports[9] = {1, 2, 3, 4, 5, 6, 8, 0, 9};
  std::vector<host::PacketSpec> in;
  Frames passed, faulted, issued;
  std::map<uint16_t, uint64_t> sent;  // by port
  for (uint16_t i = 0; i < 77; i++) {  // 64 + 8 + 5 and 4 * 16 + 8 + 5
    const size_t len = 10 + i;  // every frame distinct
    const uint16_t port = ports[i % 9];
    sent[port]++;
    const Bytes f = port == 0   ? Bytes(len, static_cast<uint8_t>(i))
                    : port == 9 ? V4().Udp(9, 9).Payload(len).Build()
                                : Tcp4(port, port, len);
    in.push_back(Pkt(f, port != 6));  // the DSCP mark goes on a copy
    if (port == 1 || port == 3 || port == 9) faulted.push_back(f);
    if (port == 8) issued.push_back(Rewritten(f, true));
    if (port == 6) passed.push_back(V4().Tos(46 << 2).Tcp(6, 6).Payload(len).Build());
    if (port == 0 || port == 3 || port == 4 || port == 5 || port == 9) passed.push_back(f);
  }
  EXPECT_EQ(FramesOf(Run(in, 1)), passed);
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, faulted}}));
  EXPECT_EQ(Issued(), (std::vector<Handed>{{2, issued}}));
  for (uint16_t port : {1, 2, 3, 4, 6, 8}) {
    EXPECT_EQ(ExactPkts(ExactTcp4("accept", port, port)), sent[port]) << port;  // found by key
  }
  EXPECT_EQ(GeneralPkts(0), sent[9]);
}

// 20,000 rules take bursts of 16, 140,000 bursts of 64.
INSTANTIATE_TEST_SUITE_P(DirectAndStaged, WalkShapes, ::testing::Values(0u, 20000u, 140000u));

}  // namespace
