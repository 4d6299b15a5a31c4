// Applying rulesets: replace and add with their counters, merging of exact
// rules, pool tags, the ioctl gate, refused headers and read-back round
// trips. Mirrors and merged records are compared whole with the reference
// model by lookup_model_test.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::SameRecord;

// An exact IPv4 TCP rule from sa:1 to 10.0.0.2:80.
std::string Exact(const std::string& extra = "", const std::string& sa = "10.0.0.1") {
  return "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=6 sa=" +
         sa + " sport=1 da=10.0.0.2 dport=80 " + extra + "\n";
}
std::vector<uint8_t> Rs(const std::string& text) { return rules::ParseRuleset(text); }
FWRule R(const std::string& line) { return rules::ParseRule(line); }

using ApplyTest = testsupport::FirewallTest;

TEST_F(ApplyTest, ReplaceStartsFromTheRecordsAddKeepsFormerRulesAndCounters) {
  const auto rs = Rs("ruleset version=8 features=0x3 frag=drop\n" + Exact("pkts=5 bytes=700") +
                     "action=punt da=10.0.0.9\naction=copy sport=22\n");
  const std::vector<FWRule> records = rules::DecodeRuleset(rs).rules;
  ASSERT_EQ(Apply(rs), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains(
      "Applying 3 fastpath firewall rules (with replace: 1) fwFeatures = 0x3", 1));
  EXPECT_EQ(ctx_->numRules, 3u);
  ASSERT_NE(FindExact(records[0]), nullptr);
  EXPECT_TRUE(SameRecord(FindExact(records[0])->rule, records[0]));  // counters included
  ASSERT_EQ(GeneralEntries().size(), 2u);
  EXPECT_TRUE(SameRecord(GeneralEntries()[0]->rule, records[1]));
  EXPECT_TRUE(SameRecord(GeneralEntries()[1]->rule, records[2]));

  FindExact(records[0])->rule.pktCount = 42;
  GeneralEntries()[0]->rule.byteCount = 99;
  ASSERT_EQ(Apply(Rs(Exact("pkts=3", "10.0.0.5") + "action=drop sport=2\n"), false), ZEL_OK);
  ASSERT_EQ(Apply(Rs("ruleset version=8\n"), /*replace=*/false), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 5u);
  EXPECT_EQ(+FindExact(records[0])->rule.pktCount, 42u);
  EXPECT_EQ(+FindExact(R(Exact("", "10.0.0.5")))->rule.pktCount, 3u);
  ASSERT_EQ(GeneralEntries().size(), 3u);
  EXPECT_EQ(+GeneralEntries()[0]->rule.byteCount, 99u);  // the earlier ruleset is scanned first
  EXPECT_EQ(FWNet16(GeneralEntries()[2]->rule.sPort), 2);

  ASSERT_EQ(Apply(rs), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 3u);
  EXPECT_EQ(+FindExact(records[0])->rule.pktCount, 5u);
  EXPECT_EQ(+GeneralEntries()[0]->rule.byteCount, 0u);
  ASSERT_EQ(Apply(Rs("ruleset version=8\n")), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 0u);
  EXPECT_TRUE(ExactEntries().empty() && GeneralEntries().empty());
}

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

// A refused header changes nothing but the ioctl flag and reads no record:
// the buffer handed over is the 15-byte header alone, whatever its count.
// Once the flag is set, property and restore rulesets are ignored silently.
TEST_F(ApplyTest, RefusedHeadersLeaveTheRulesAloneAndTheIoctlFlagGates) {
  ASSERT_EQ(Apply(Rs(Exact() + "action=drop sport=1\n"), true, /*fromIoctl=*/false), ZEL_OK);
  for (bool fromIoctl : {false, true}) {
    for (uint8_t version : {0, 6, 9, 255}) {
      const auto before = Capture();
      const FWRulesetHeader h{version, 8, 7, fromIoctl ? 3u : 0xffffffffu, 0x3, 1};
      std::vector<uint8_t> header(sizeof(h));
      std::memcpy(header.data(), &h, sizeof(h));
      host::Log::Clear();
      EXPECT_EQ(Apply(header, true, fromIoctl), ZEL_NOT_SUPPORTED);
      EXPECT_TRUE(host::Log::Contains(
          "Invalid ruleset version. Got " + std::to_string(version) + ", expecting 8", 1));
      auto after = Capture();
      EXPECT_EQ(after.ioctl, fromIoctl ? 1u : 0u);
      after.ioctl = before.ioctl;
      EXPECT_TRUE(after == before);
    }
  }
  const auto before = Capture();
  host::Log::Clear();
  EXPECT_EQ(Apply(Rs("action=accept sport=3\n"), true, /*fromIoctl=*/false), ZEL_OK);
  EXPECT_TRUE(Capture() == before);
  EXPECT_TRUE(host::Log::Records().empty());
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

// A version-7 ruleset reads back as sent but for the counters: exact rules
// first, general ones in order, bit 9 clear again in 259-byte records.
TEST_F(ApplyTest, Version7ReadsBackAsSentButForItsCounters) {
  const std::string head = "ruleset version=7 features=0x1 frag=drop\n";
  const std::string general = "action=punt sa=10.0.0.0-10.0.0.255\n"
                              "raw action=copy smac=02:00:00:00:00:01/00:00:00:00:00:00\n";
  ASSERT_EQ(Apply(Rs(head + Exact("pkts=3 bytes=5") + general)), ZEL_OK);
  ExactEntries()[0]->rule.pktCount = 4;
  ExactEntries()[0]->rule.byteCount = 60;
  const auto back = Populate();
  EXPECT_EQ(back.size(), 15u + 3 * 259);
  EXPECT_EQ(back, Rs(head + Exact("pkts=4 bytes=60") + general));
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
