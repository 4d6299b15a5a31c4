// Verdicts on the packet path: lookup order, counters, the list actions
// (drop, punt, copy) by attachment state and failure policy, the feature
// checks, the fragment override, and the hand-off of slow-path lists.

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

using PacketVerdict = PacketPathTest;

TEST_F(PacketVerdict, ExactRuleWinsAndEveryMatchIsCounted) {
  // The general drop comes first in the ruleset; the exact accept still wins
  // for its flow. The third packet matches nothing and passes uncounted.
  ApplyText("action=drop ipv4 proto=tcp dport=80\n" + ExactTcp4("accept", 1234, 80));
  const Bytes hit = Tcp4(1234, 80, 10), general = Tcp4(999, 80, 30), none = Tcp4(999, 81);
  std::vector<Bytes> passed = RunFrames({hit, general, none, hit}, 1);
  EXPECT_EQ(passed, (std::vector<Bytes>{hit, none, hit}));

  FWRuleEntry* exact = Exact(ExactTcp4("accept"));
  ASSERT_NE(exact, nullptr);
  EXPECT_EQ(Pkts(exact), 2u);
  EXPECT_EQ(Octets(exact), 2 * hit.size());
  FWRuleEntry* drop = General(0);
  ASSERT_NE(drop, nullptr);
  EXPECT_EQ(Pkts(drop), 1u);
  EXPECT_EQ(Octets(drop), general.size());
  EXPECT_EQ(host::Packets::Live(), 0u);  // the dropped packet was released
}

TEST_F(PacketVerdict, ExactRuleOfTheOtherDirectionFallsThroughToGeneralRules) {
  ApplyText(ExactTcp4("drop", 1234, 80, "dir=to") + "\naction=copy ipv4 proto=tcp");
  EXPECT_EQ(RunFrames({Tcp4()}, 1).size(), 1u);  // from the switch: general copy
  EXPECT_EQ(Pkts(Exact(ExactTcp4("drop"))), 0u);
  EXPECT_EQ(Pkts(General(0)), 1u);
  EXPECT_EQ(Faulted().size(), 1u);
  EXPECT_TRUE(RunFrames({Tcp4()}, 2).empty());  // to the switch: exact drop
  EXPECT_EQ(Pkts(Exact(ExactTcp4("drop"))), 1u);
}

TEST_F(PacketVerdict, UnparsedAndNonIpFramesMatchOnlyRulesWildcardingWhatTheyLack) {
  ApplyText(
      "action=drop ethtype=0x0806\n"           // needs L2
      "action=copy rawflags=0x3ff\n");         // wildcards every field
  Bytes arp = Base().Arp(1, kSrcMac, frames::Ip4("10.0.0.1"), {}, frames::Ip4("10.0.0.2")).Build();
  Bytes tiny(20, 0xee);
  EXPECT_EQ(RunFrames({arp, tiny}, 1), (std::vector<Bytes>{tiny}));
  EXPECT_EQ(Pkts(General(0)), 1u);
  EXPECT_EQ(Pkts(General(1)), 1u);
  std::vector<Handed> copies = Faulted();
  ASSERT_EQ(copies.size(), 1u);
  EXPECT_EQ(copies[0].frames, (std::vector<Bytes>{tiny}));
}

TEST_F(PacketVerdict, PuntFollowsAttachStateAndFailurePolicy) {
  ApplyText(ExactTcp4("punt"));
  const Bytes a = Tcp4(1234, 80, 1), b = Tcp4(1234, 80, 2), other = Tcp4(1, 1);

  // Attaching, failure policy 0: punted packets are dropped.
  StartAttaching();
  EXPECT_EQ(RunFrames({a, other}, 1), (std::vector<Bytes>{other}));
  EXPECT_TRUE(Faulted().empty());

  // Failure policy 1: they pass.
  filter_->failurePolicy = 1;
  EXPECT_EQ(RunFrames({a, other}, 1), (std::vector<Bytes>{a, other}));
  EXPECT_TRUE(Faulted().empty());

  // Attached: one hand-off per list, in order, with the call's direction.
  FinishAttach();
  EXPECT_EQ(RunFrames({a, other, b}, 2), (std::vector<Bytes>{other}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{2, {a, b}}}));
  EXPECT_EQ(Pkts(Exact(ExactTcp4("punt"))), 4u);  // counted whatever happened
}

TEST_F(PacketVerdict, CopyClonesToTheSlowPathEvenWhenDetached) {
  ApplyText(ExactTcp4("copy"));
  ASSERT_EQ(ctx_->spAttachState, SLCGenericSpDetached);
  const Bytes a = Tcp4(1234, 80, 5);
  EXPECT_EQ(RunFrames({a, a}, 1), (std::vector<Bytes>{a, a}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {a, a}}}));

  // A failed clone loses only the copy.
  host::Faults::Fail("zel_PktClone", ZEL_NO_MEMORY);
  EXPECT_EQ(RunFrames({a, a}, 1), (std::vector<Bytes>{a, a}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {a}}}));
}

TEST_F(PacketVerdict, DropFeatureForBridgeProtocolMacs) {
  ApplyText("ruleset features=1\naction=accept rawflags=0x3ff");
  auto to = [](const char* mac) {
    return FrameBuilder().Eth(frames::Mac(mac), kSrcMac).Llc().EtherType(0x4242).Payload(30).Build();
  };
  const Bytes bpdu = to("01:80:c2:00:00:00"), cdp = to("01:00:0c:cc:cc:cd"),
              near = to("01:80:c2:00:00:01");
  EXPECT_EQ(RunFrames({bpdu, near, cdp}, 1), (std::vector<Bytes>{near}));
  EXPECT_EQ(RunFrames({bpdu}, 2), (std::vector<Bytes>{}));
  EXPECT_EQ(Pkts(General(0)), 1u);  // dropped packets are not counted
}

TEST_F(PacketVerdict, DropFeatureForDhcpServersOnTheirWayToTheSwitch) {
  ApplyText("ruleset features=2\naction=accept rawflags=0x3ff");
  const Bytes v4server = Udp4(67, 68), v4other = Udp4(547, 546);
  const Bytes v6server = Base()
                             .Ipv6(frames::Ip6("fe80::1"), frames::Ip6("ff02::1:2"))
                             .Udp(547, 546)
                             .Build();
  const Bytes tcp67 = Tcp4(67, 68);
  EXPECT_EQ(RunFrames({v4server, v4other, v6server, tcp67}, 2),
            (std::vector<Bytes>{v4other, tcp67}));
  EXPECT_EQ(RunFrames({v4server, v6server}, 1), (std::vector<Bytes>{v4server, v6server}));
  EXPECT_EQ(Pkts(General(0)), 4u);

  // Without the feature bit the same packets are counted and pass.
  ApplyText("action=accept rawflags=0x3ff");
  EXPECT_EQ(RunFrames({v4server}, 2).size(), 1u);
}

Bytes Fragment4(uint16_t offset, bool more) {
  return Base()
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Fragment(offset, more)
      .Tcp(1234, 80)
      .Build();
}

TEST_F(PacketVerdict, FragmentOverrideDecidesFragmentsWithoutARule) {
  ApplyText("ruleset frag=drop\n" + ExactTcp4("accept") + "\naction=accept rawflags=0x3ff");
  const Bytes first = Fragment4(0, true), later = Fragment4(10, false), whole = Tcp4();
  EXPECT_EQ(RunFrames({first, later, whole}, 1), (std::vector<Bytes>{whole}));
  EXPECT_EQ(Pkts(Exact(ExactTcp4("accept"))), 1u);
  EXPECT_EQ(Pkts(General(0)), 0u);

  // Without an override a first fragment has ports and finds its exact rule;
  // a later one has none and only a port-less rule sees it.
  ApplyText(ExactTcp4("copy") + "\naction=drop ipv4 proto=tcp sport=* dport=*");
  EXPECT_EQ(RunFrames({first, later}, 1), (std::vector<Bytes>{first}));
  EXPECT_EQ(Pkts(Exact(ExactTcp4("copy"))), 1u);
  EXPECT_EQ(Pkts(General(0)), 1u);
  EXPECT_EQ(Faulted().size(), 1u);
}

TEST_F(PacketVerdict, FragmentOverrideWithListActions) {
  const Bytes first = Fragment4(0, true), later = Fragment4(10, false);
  ApplyText("ruleset frag=copy\naction=drop rawflags=0x3ff");
  EXPECT_EQ(RunFrames({first, later}, 2), (std::vector<Bytes>{first, later}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{2, {first, later}}}));

  ApplyText("ruleset frag=punt\naction=drop rawflags=0x3ff");
  Attach();
  EXPECT_TRUE(RunFrames({first, later}, 1).empty());
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, {first, later}}}));
  EXPECT_EQ(Pkts(General(0)), 0u);
}

// Overrides naming an action that needs rule parameters have none to use:
// the fragments pass untouched, and nothing is sent, tagged or marked.
TEST_F(PacketVerdict, FragmentOverrideWithRuleParameterActionsPasses) {
  const Bytes first = Fragment4(0, true), later = Fragment4(10, false);
  for (const char* action : {"l2rewrite", "gre", "pooltag", "dscp", "dot1p", "dscp+dot1p"}) {
    SCOPED_TRACE(action);
    ApplyText(std::string("ruleset frag=") + action + "\naction=drop rawflags=0x3ff");
    host::PacketSpec spec;
    spec.frame = first;
    spec.writable = false;  // any write in place would be caught
    ZelPkt* ro = host::Packets::Make(spec);
    std::vector<Bytes> passed = Run({ro, host::Packets::Make(later)}, 1);
    EXPECT_EQ(passed, (std::vector<Bytes>{first, later}));
    EXPECT_TRUE(Issued().empty());
    EXPECT_TRUE(host::Sockets::Sent().empty());
    EXPECT_EQ(Pkts(General(0)), 0u);
  }
}

TEST_F(PacketVerdict, MixedListKeepsOrderInEveryOutput) {
  Attach();
  ApplyText(ExactTcp4("punt", 1, 1) + "\n" + ExactTcp4("drop", 2, 2) + "\n" +
            ExactTcp4("copy", 3, 3) + "\n" + ExactTcp4("accept", 4, 4));
  const Bytes p1 = Tcp4(1, 1, 1), p2 = Tcp4(1, 1, 2), d = Tcp4(2, 2), c = Tcp4(3, 3),
              a = Tcp4(4, 4), n = Tcp4(5, 5);
  EXPECT_EQ(RunFrames({p1, d, c, a, p2, n, c}, 2), (std::vector<Bytes>{c, a, n, c}));
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{2, {p1, c, p2, c}}}));
  EXPECT_TRUE(Issued().empty());
}

TEST_F(PacketVerdict, SlowPathPacketsAreReissuedUnchanged) {
  ApplyText(ExactTcp4("drop"));  // rules do not apply to them
  const Bytes a = Tcp4(), b = Udp4(1, 2);
  for (uint32_t dir : {1u, 2u}) {
    host::PacketList list;
    list.Append(host::Packets::Make(a));
    list.Append(host::Packets::Make(b));
    EXPECT_EQ(host::Sluice::DeliverFromSlowPath(id_, list, dir), ZEL_OK);
    EXPECT_EQ(list.Count(), 0u);
    EXPECT_EQ(Issued(), (std::vector<Handed>{{dir, {a, b}}}));
  }
  EXPECT_EQ(Pkts(Exact(ExactTcp4("drop"))), 0u);
}

TEST_F(PacketVerdict, DefaultActionAppliesOnlyWithoutARuleset) {
  ctx_->defaultAction = SLCGenericActionDrop;  // fixed at creation; set here for the test
  EXPECT_TRUE(RunFrames({Tcp4()}, 1).empty());
  ApplyText(ExactTcp4("copy", 9, 9));
  EXPECT_EQ(RunFrames({Tcp4()}, 1).size(), 1u);  // no rule: passes despite the default
  Clear();
  EXPECT_TRUE(RunFrames({Tcp4()}, 1).empty());
}

}  // namespace

// The walk takes a pipelined shape for large exact tables (parsing packets
// ahead of their verdicts). Both shapes must give every packet of a long
// list the same verdict, keep every output in order, and count the same.
class WalkShapes : public PacketPathTest, public ::testing::WithParamInterface<uint32_t> {};

TEST_P(WalkShapes, LongMixedListGetsTheSameVerdictsInEitherShape) {
  Attach();
  rules::RulesetBuilder b;
  b.Add(ExactTcp4("punt", 1, 1)).Add(ExactTcp4("drop", 2, 2)).Add(ExactTcp4("copy", 3, 3));
  b.Add(ExactTcp4("accept", 4, 4)).Add(ExactTcp4("dscp", 6, 6, "dscp=46"));
  b.Add(ExactTcp4("l2rewrite", 8, 8, "rewrite=0a:0b:0c:0d:0e:0f"));
  b.Add("action=copy ipv4 proto=udp");
  FWRule filler = rules::ParseRule(ExactTcp4("drop", 7, 7));
  for (uint32_t i = 0; i < GetParam(); i++) {
    filler.ipSa[1] = static_cast<uint8_t>(i >> 8);
    filler.ipSa[2] = static_cast<uint8_t>(i);
    b.Add(filler);
  }
  ASSERT_EQ(Apply(b.Bytes()), ZEL_OK);
  ASSERT_EQ(ctx_->ruleHash->numBuckets > 65536, GetParam() > 0);

  std::vector<ZelPkt*> in;
  std::vector<Bytes> passed, faulted, issued;
  for (uint16_t i = 0; i < 45; i++) {
    const size_t len = 10 + i;  // every frame distinct
    switch (i % 9) {
      case 0:
        in.push_back(host::Packets::Make(Tcp4(1, 1, len)));
        faulted.push_back(Tcp4(1, 1, len));
        break;
      case 1:
        in.push_back(host::Packets::Make(Tcp4(2, 2, len)));
        break;
      case 2:
        in.push_back(host::Packets::Make(Tcp4(3, 3, len)));
        passed.push_back(Tcp4(3, 3, len));
        faulted.push_back(Tcp4(3, 3, len));
        break;
      case 3:
        in.push_back(host::Packets::Make(Tcp4(4, 4, len)));
        passed.push_back(Tcp4(4, 4, len));
        break;
      case 4:
        in.push_back(host::Packets::Make(Tcp4(5, 5, len)));
        passed.push_back(Tcp4(5, 5, len));
        break;
      case 5: {
        host::PacketSpec ro;
        ro.frame = Tcp4(6, 6, len);
        ro.writable = false;  // marked on a copy that takes its place
        in.push_back(host::Packets::Make(ro));
        passed.push_back(Base()
                             .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
                             .Tos(46 << 2)
                             .Tcp(6, 6)
                             .Payload(len)
                             .Build());
        break;
      }
      case 6: {
        in.push_back(host::Packets::Make(Tcp4(8, 8, len)));
        Bytes r = Tcp4(8, 8, len);
        std::copy(r.begin(), r.begin() + 6, r.begin() + 6);
        const frames::MacAddr mac = frames::Mac("0a:0b:0c:0d:0e:0f");
        std::copy(mac.begin(), mac.end(), r.begin());
        issued.push_back(r);
        break;
      }
      case 7:
        in.push_back(host::Packets::Make(Bytes(len, static_cast<uint8_t>(i))));
        passed.push_back(Bytes(len, static_cast<uint8_t>(i)));
        break;
      case 8:
        in.push_back(host::Packets::Make(Udp4(9, 9, len)));
        passed.push_back(Udp4(9, 9, len));
        faulted.push_back(Udp4(9, 9, len));
        break;
    }
  }
  EXPECT_EQ(Run(in, 1), passed);
  EXPECT_EQ(Faulted(), (std::vector<Handed>{{1, faulted}}));
  EXPECT_EQ(Issued(), (std::vector<Handed>{{2, issued}}));
  for (uint16_t port : {1, 2, 3, 4, 6, 8}) {
    const char* action = "accept";  // the lookup compares match fields only
    EXPECT_EQ(Pkts(Exact(ExactTcp4(action, port, port))), 5u) << port;
  }
  EXPECT_EQ(Pkts(General(0)), 5u);
}

INSTANTIATE_TEST_SUITE_P(DirectAndPipelined, WalkShapes, ::testing::Values(0u, 20000u));
