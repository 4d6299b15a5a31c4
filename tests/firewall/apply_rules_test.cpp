// Applying rulesets: what a merge of exact rules logs, pool tags, and
// read-back round trips with mirrors. Replace and add with their counters,
// mirrors and merged records are compared whole with the reference model by
// classifier_test; refused headers and the ioctl gate by property_test and
// ioctl_protocol_test; version-7 read-back by property_test.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {


// An exact IPv4 TCP rule from sa:1 to 10.0.0.2:80.
std::string Exact(const std::string& extra = "", const std::string& sa = "10.0.0.1") {
  return "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=6 sa=" +
         sa + " sport=1 da=10.0.0.2 dport=80 " + extra + "\n";
}
std::vector<uint8_t> Rs(const std::string& text) { return rules::ParseRuleset(text); }
FWRule R(const std::string& line) { return rules::ParseRule(line); }

using ApplyTest = testsupport::FirewallTest;

TEST_F(ApplyTest, RepeatedExactRulesMergeIntoTheFirst) {
  ASSERT_EQ(Apply(Rs(Exact("dir=to action=drop") + Exact("dir=to action=accept pkts=9"))), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring", 2), 1u);
  EXPECT_EQ(ctx_->numRules, 1u);
  EXPECT_EQ(+ExactEntries()[0]->rule.action, SLCGenericActionDrop);
  EXPECT_EQ(+ExactEntries()[0]->rule.pktCount, 0u);

  // The other direction widens to both, silently; a mirrored-half record
  // of the same direction only sets bidirectional 2.
  host::Log::Clear();
  ASSERT_EQ(Apply(Rs(Exact("dir=from action=punt") + Exact("dir=both bidir=2")), false), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring"), 0u);
  EXPECT_EQ(ctx_->numRules, 1u);
  FWRuleEntry* e = ExactEntries()[0];
  EXPECT_EQ(e->rule.direction, SLCGenericDirectionBidirectional);
  EXPECT_EQ(e->rule.bidirectional, 2);
  EXPECT_EQ(+e->rule.action, SLCGenericActionDrop);
}

TEST_F(ApplyTest, PoolTagsAreTakenOncePerEntryAndHandedBack) {
  host::ResPools::Define("gold", 12);
  ASSERT_EQ(Apply(Rs(Exact("action=pooltag pool=gold bidir dir=to") +
                     Exact("action=pooltag pool=gold dir=to") + "action=pooltag pool=nosuch\n")),
            ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Got resource pool tag of 12 for pool gold", 1));
  EXPECT_TRUE(host::Log::Contains("Invalid resource pool nosuch specified", 2));
  // The rule and its mirror hold one each; the merged repeat handed its own back.
  EXPECT_EQ(host::ResPools::Outstanding(12), 2);
  EXPECT_EQ(host::ResPools::Outstanding(0xffff), 1);

  // A pool name filling the whole field without a NUL is cut at 128.
  FWRule noNul = R("raw action=pooltag sport=9");
  std::memset(noNul.resourcePool, 'x', sizeof(noNul.resourcePool));
  ASSERT_EQ(Apply(rules::RulesetBuilder().Add(noNul).Bytes()), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Invalid resource pool " + std::string(128, 'x') + " specified"));
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 1);
}

// Reading back and applying again installs the same entries, mirrors
// included, whichever half comes first.
TEST_F(ApplyTest, ReadBackAndReapplyInstallsTheSameRules) {
  ASSERT_EQ(Apply(Rs(Exact("dir=to action=drop bidir") +
                     Exact("dir=both action=punt bidir pkts=8", "10.0.0.3") +
                     "action=drop ipv6 sa=2001:db8::-2001:db8::ff\naction=punt dport=53\n")),
            ZEL_OK);
  auto installed = [this] {
    std::vector<std::string> out;
    for (FWRuleEntry* e : ExactEntries()) out.push_back(rules::FormatRule(e->rule));
    std::sort(out.begin(), out.end());  // table order is no contract
    for (FWRuleEntry* e : GeneralEntries()) out.push_back(rules::FormatRule(e->rule));
    return out;
  };
  const std::vector<std::string> first = installed();
  ASSERT_EQ(first.size(), 6u);
  for (int round = 0; round < 2; round++) {
    ASSERT_EQ(Apply(Populate()), ZEL_OK);
    EXPECT_EQ(installed(), first);
    EXPECT_EQ(ctx_->numRules, 6u);
  }
  EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring"), 0u);
}

}  // namespace
