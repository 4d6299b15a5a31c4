// The read-only trace: each way a verdict is reached is reported as the walk
// reaches it, with the deciding rule at the position the serialised ruleset
// gives it, also beside walks and applies. That the traced rule is the one
// whose counters rise, and that tracing counts nothing, is checked on a
// whole capture in tools/run_test.
#include <atomic>
#include <thread>

#include "firewall/fw_trace.h"
#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

class Trace : public PacketPathTest {
 protected:
  FWTrace TraceOf(const Bytes& frame, uint32_t direction) {
    ZelPkt* pkt = host::Packets::Make(frame);
    FWTrace t{};
    EXPECT_EQ(FWTracePacket(filter_, pkt, direction, &t), ZEL_OK);
    zel_PktRelease(pkt);
    return t;
  }
  // The serialised rule at `position` (as the status tree and readers see it).
  FWRule PopulatedAt(uint32_t position) {
    const std::vector<uint8_t> rs = Populate();
    FWRule r{};
    std::memcpy(&r, rs.data() + FW_RULESET_HEADER_SIZE + position * FW_RULE_SIZE_V8,
                sizeof(r));
    return r;
  }
};

TEST_F(Trace, EachDecisionIsReportedWithItsRuleAndPosition) {
  // Without a ruleset the default action decides.
  const FWTrace none = TraceOf(Tcp4(), 1);
  EXPECT_EQ(none.decision, +FWTraceNoRuleset);
  EXPECT_EQ(none.action, ctx_->defaultAction);
  EXPECT_EQ(FWTracePacket(filter_, nullptr, 1, nullptr), ZEL_BAD_PARAM);

  // Two exact rules, then three general ones; the general rules follow the
  // exact ones in serialised order.
  ApplyText("ruleset features=3 frag=drop\n" + ExactTcp4("accept") + "\n" +
            ExactTcp4("dscp", 5, 5, "dscp=46") +
            "\naction=punt ipv4 proto=udp dport=53\n"
            "action=drop ipv4 proto=tcp dport=22\n"
            "action=l2rewrite ipv4 proto=tcp rewrite=0a:0b:0c:0d:0e:0f\n");
  const Bytes bpdu = FrameBuilder()
                         .Eth(frames::Mac("01:80:c2:00:00:00"), {})
                         .Llc()
                         .EtherType(0x4242)
                         .Payload(30)
                         .Build();
  struct Case {
    const char* name;
    Bytes frame;
    uint32_t direction;
    uint32_t decision, action, feature;
    uint8_t probed;
    int generalIndex;  // -1: no general rule
  };
  const Case cases[] = {
      {"exact hit", Tcp4(), 1, FWTraceExactRule, SLCGenericActionAccept, 0, 1, -1},
      {"exact hit, marking rule", Tcp4(5, 5), 2, FWTraceExactRule, SLCGenericActionDSCPMark, 0, 1,
       -1},
      {"exact miss, second general rule", Tcp4(9, 22), 1, FWTraceGeneralRule,
       SLCGenericActionDrop, 0, 1, 1},
      {"general rule for a packet with no exact probe", V4().IpProto(6).Build(), 1,
       FWTraceGeneralRule, SLGenericActionL2Rewrite, 0, 0, 2},
      {"no rule", V4().Udp(1, 2).Build(), 1, FWTraceNoRule, SLCGenericActionAccept, 0, 1, -1},
      {"bridge protocol feature", bpdu, 1, FWTraceFeature, SLCGenericActionDrop,
       FW_FEATURE_DROP_BPDU, 0, -1},
      {"dhcp server feature toward the switch", V4().Udp(67, 68).Build(), 2, FWTraceFeature,
       SLCGenericActionDrop, FW_FEATURE_DROP_DHCP_SERVER, 0, -1},
      {"dhcp server from the switch goes to the rules", V4().Udp(67, 53).Build(), 1,
       FWTraceGeneralRule, SLCGenericActionPunt, 0, 1, 0},
      {"fragment override", V4().Fragment(10, false).Tcp(1234, 80).Build(), 1,
       FWTraceFragOverride, SLCGenericActionDrop, 0, 0, -1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const FWTrace t = TraceOf(c.frame, c.direction);
    EXPECT_EQ(t.decision, c.decision);
    EXPECT_EQ(t.action, c.action);
    EXPECT_EQ(t.feature, c.feature);
    EXPECT_EQ(t.exactProbed, c.probed);
    EXPECT_EQ(t.numRules, 5u);
    EXPECT_EQ(t.fragOverride, +SLCGenericActionDrop);
    if (c.decision == FWTraceExactRule || c.decision == FWTraceGeneralRule) {
      EXPECT_EQ(t.exactHit, c.decision == FWTraceExactRule);
      EXPECT_EQ(+t.rule.action, c.action);
      // The position names the same record the serialised ruleset holds there.
      const FWRule at = PopulatedAt(t.position);
      EXPECT_EQ(+at.action, +t.rule.action);
      EXPECT_EQ(0, std::memcmp(at.dPort, t.rule.dPort, 2));
      if (c.generalIndex >= 0) {
        EXPECT_EQ(t.generalIndex, static_cast<uint32_t>(c.generalIndex));
        EXPECT_EQ(t.position, 2u + t.generalIndex);
      } else {
        EXPECT_LT(t.position, 2u);
      }
    }
  }
}

// Traces run beside walks that raise counters and beside rulesets being
// replaced: each trace sees one whole ruleset, so every packet finds its
// rule in its table, and the hold it takes never blocks the others for
// good. Run under TSan for races.
TEST_F(PacketPathTest, TraceRunsBesideWalksAndApplies) {
  const std::string drop = "action=drop ipv4 proto=tcp dport=80\n" + ExactTcp4("drop");
  const std::string accept = "action=accept ipv4 proto=tcp dport=80\n" + ExactTcp4("accept");
  ApplyText(drop);
  const Bytes exact = Tcp4(), general = Tcp4(9, 80);
  std::atomic<bool> running{true};
  std::thread walker([&] {
    while (running.load()) {
      host::PacketList list;
      list.Append(host::Packets::Make(exact));
      list.Append(host::Packets::Make(general));
      (void)host::Sluice::Deliver(id_, list, 1);
    }
  });
  std::thread applier([&] {
    for (int i = 0; i < 200; i++) {
      EXPECT_EQ(Apply(rules::ParseRuleset(i % 2 ? drop : accept)), ZEL_OK);
    }
  });
  for (int i = 0; i < 2000; i++) {
    ZelPkt* pkt = host::Packets::Make(i % 2 ? exact : general);
    FWTrace t{};
    ASSERT_EQ(FWTracePacket(filter_, pkt, 1, &t), ZEL_OK);
    zel_PktRelease(pkt);
    // A ruleset seen half applied would miss a rule or count one.
    ASSERT_EQ(t.decision, i % 2 ? +FWTraceExactRule : +FWTraceGeneralRule);
    ASSERT_EQ(t.numRules, 2u);
    ASSERT_EQ(t.action, +t.rule.action);
  }
  applier.join();
  running = false;
  walker.join();
}

}  // namespace
