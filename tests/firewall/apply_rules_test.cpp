// Applying rulesets: replace and add, merging and mirroring of exact rules,
// counters, pool tags, the ioctl gate, refused headers, read-back round
// trips and clearing.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <random>
#include <string>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::FirewallTest;
using testsupport::FwModel;
using testsupport::SameRecord;

constexpr const char* kL2 =
    "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=6";

// An exact IPv4 TCP rule from a:sp to b:dp.
std::string Exact(const std::string& a, int sp, const std::string& b, int dp,
                  const std::string& extra = "") {
  return std::string(kL2) + " sa=" + a + " sport=" + std::to_string(sp) + " da=" + b +
         " dport=" + std::to_string(dp) + " " + extra + "\n";
}

std::vector<uint8_t> Rs(const std::string& text) { return rules::ParseRuleset(text); }

std::vector<FWRule> Records(const std::vector<uint8_t>& ruleset) {
  return rules::DecodeRuleset(ruleset).rules;
}

// Records sorted bytewise, for comparing sets of exact rules.
std::vector<std::string> Sorted(const std::vector<FWRule>& rs) {
  std::vector<std::string> out;
  for (const FWRule& r : rs) out.emplace_back(reinterpret_cast<const char*>(&r), sizeof(r));
  std::sort(out.begin(), out.end());
  return out;
}

std::vector<FWRule> RulesOf(const std::vector<FWRuleEntry*>& entries) {
  std::vector<FWRule> out;
  for (FWRuleEntry* e : entries) out.push_back(e->rule);
  return out;
}

using ApplyTest = FirewallTest;

TEST_F(ApplyTest, ReplaceInstallsHeaderExactAndGeneralRules) {
  auto rs = Rs("ruleset version=8 features=0x3 frag=drop\n" +
               Exact("10.0.0.1", 1, "10.0.0.2", 80, "action=drop pkts=5 bytes=700") +
               "action=punt da=10.0.0.9\n" + Exact("10.0.0.3", 2, "10.0.0.4", 80) +
               "action=copy sport=22\n");
  ASSERT_EQ(Apply(rs), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains(
      "Applying 4 fastpath firewall rules (with replace: 1) fwFeatures = 0x3", 1));
  EXPECT_NE(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->numRules, 4u);
  EXPECT_EQ(ctx_->fwFeatures, 3u);
  EXPECT_EQ(ctx_->fragOverride, 1u);
  EXPECT_EQ(ctx_->version, 8u);
  EXPECT_EQ(ctx_->ioctl, 1u);
  auto records = Records(rs);
  auto general = GeneralEntries();
  ASSERT_EQ(general.size(), 2u);
  EXPECT_TRUE(SameRecord(general[0]->rule, records[1]));
  EXPECT_TRUE(SameRecord(general[1]->rule, records[3]));
  FWRuleEntry* first = FindExact(records[0]);
  ASSERT_NE(first, nullptr);
  EXPECT_TRUE(SameRecord(first->rule, records[0]));  // counters from the record
  EXPECT_EQ(ExactEntries().size(), 2u);
}

TEST_F(ApplyTest, AddKeepsFormerRulesTheirCountersAndScanOrder) {
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80) + "action=drop sport=1\n")), ZEL_OK);
  FWRuleEntry* e = ExactEntries()[0];
  e->rule.pktCount = 42;
  GeneralEntries()[0]->rule.byteCount = 99;
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.5", 1, "10.0.0.6", 80, "pkts=3") + "action=punt sport=2\n"),
                  /*replace=*/false),
            ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 4u);
  auto general = GeneralEntries();
  ASSERT_EQ(general.size(), 2u);
  EXPECT_EQ(+general[0]->rule.byteCount, 99u);  // earlier ruleset scanned first
  EXPECT_EQ(+general[1]->rule.action, SLCGenericActionPunt);
  FWRuleEntry* kept = FindExact(rules::ParseRule(Exact("10.0.0.1", 1, "10.0.0.2", 80)));
  ASSERT_NE(kept, nullptr);
  EXPECT_EQ(+kept->rule.pktCount, 42u);
  EXPECT_EQ(+FindExact(rules::ParseRule(Exact("10.0.0.5", 1, "10.0.0.6", 80)))->rule.pktCount, 3u);

  // Replacing starts every rule from its record again.
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80))), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 1u);
  EXPECT_EQ(+ExactEntries()[0]->rule.pktCount, 0u);
  EXPECT_TRUE(GeneralEntries().empty());
}

TEST_F(ApplyTest, RepeatedExactRulesMergeIntoTheFirst) {
  const std::string a = Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=to action=drop");
  ASSERT_EQ(Apply(Rs(a + Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=to action=accept pkts=9"))),
            ZEL_OK);
  EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring", 2), 1u);
  EXPECT_EQ(ctx_->numRules, 1u);
  FWRuleEntry* e = ExactEntries()[0];
  EXPECT_EQ(+e->rule.action, SLCGenericActionDrop);
  EXPECT_EQ(+e->rule.pktCount, 0u);

  // Other direction widens to both, silently; a mirrored-half record with the
  // same direction only sets bidirectional 2.
  host::Log::Clear();
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=from action=punt") +
                     Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=both bidir=2")),
                  /*replace=*/false),
            ZEL_OK);
  EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring"), 0u);
  EXPECT_EQ(ctx_->numRules, 1u);
  e = ExactEntries()[0];  // adding copies the table
  EXPECT_EQ(e->rule.direction, SLCGenericDirectionBidirectional);
  EXPECT_EQ(e->rule.bidirectional, 2);
  EXPECT_EQ(+e->rule.action, SLCGenericActionDrop);
}

TEST_F(ApplyTest, BidirectionalExactRuleInstallsItsMirror) {
  auto rs = Rs(
      "action=drop dir=to bidir dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x86dd "
      "vlan=none proto=17 sa=2001:db8::a sport=1000 da=2001:db8::b dport=2000 pkts=4 "
      "bytes=400\n");
  ASSERT_EQ(Apply(rs), ZEL_OK);
  ASSERT_EQ(ctx_->numRules, 2u);
  FWRule rule = Records(rs)[0];
  FWRule mirror = rules::ParseRule(
      "action=drop dir=from bidir=2 dmac=02:00:00:00:00:0b smac=02:00:00:00:00:0a "
      "ethtype=0x86dd vlan=none proto=17 sa=2001:db8::b sport=2000 da=2001:db8::a dport=1000 "
      "pkts=4 bytes=400");
  FWRuleEntry* m = FindExact(mirror);
  ASSERT_NE(m, nullptr);
  EXPECT_TRUE(SameRecord(m->rule, mirror));
  EXPECT_TRUE(SameRecord(FindExact(rule)->rule, rule));

  // A mirror that meets an installed rule of the other direction merges.
  const std::string reply =
      "dmac=02:00:00:00:00:0b smac=02:00:00:00:00:0a ethtype=0x0800 vlan=none proto=6 "
      "sa=10.0.0.2 sport=80 da=10.0.0.1 dport=1 dir=to action=accept\n";
  ASSERT_EQ(Apply(Rs(reply + Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=to action=drop bidir"))),
            ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 2u);
  FWRuleEntry* merged = FindExact(rules::ParseRule(reply));
  EXPECT_EQ(merged->rule.direction, SLCGenericDirectionBidirectional);
  EXPECT_EQ(merged->rule.bidirectional, 2);
  EXPECT_EQ(+merged->rule.action, SLCGenericActionAccept);

  // bidirectional means nothing on a general rule.
  ASSERT_EQ(Apply(Rs("action=drop bidir sa=10.0.0.1 da=10.0.0.2 sport=1 dport=2\n")), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 1u);
}

TEST_F(ApplyTest, EmptyRulesetReplacesWithEmptyTableOrAddsNothing) {
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80) + "action=drop sport=1\n")), ZEL_OK);
  ASSERT_EQ(Apply(Rs("ruleset version=8\n"), /*replace=*/false), ZEL_OK);
  EXPECT_EQ(ctx_->numRules, 2u);
  ASSERT_EQ(Apply(Rs("ruleset version=8\n")), ZEL_OK);
  EXPECT_NE(ctx_->ruleHash, nullptr);
  EXPECT_TRUE(List_IsEmpty(&ctx_->ruleList));
  EXPECT_EQ(ctx_->numRules, 0u);
  EXPECT_EQ(Populate().size(), 15u);
}

TEST_F(ApplyTest, PropertyAndRestoreRulesetsAreIgnoredAfterAnIoctlRuleset) {
  ASSERT_EQ(Apply(Rs("action=drop sport=1\n"), true, /*fromIoctl=*/false), ZEL_OK);
  EXPECT_EQ(ctx_->ioctl, 0u);
  ASSERT_EQ(Apply(Rs("ruleset features=0x1\naction=drop sport=2\n"), true, true), ZEL_OK);
  auto before = Capture();
  host::Log::Clear();
  EXPECT_EQ(Apply(Rs("action=accept sport=3\n"), true, /*fromIoctl=*/false), ZEL_OK);
  std::vector<uint8_t> v9 = Rs("ruleset version=8\n");
  v9[0] = 9;
  EXPECT_EQ(Apply(v9, true, /*fromIoctl=*/false), ZEL_OK);
  EXPECT_TRUE(Capture() == before);
  EXPECT_TRUE(host::Log::Records().empty());
}

// A refused header changes nothing but the ioctl flag and reads no record:
// the buffer handed over is only the 15-byte header.
TEST_F(ApplyTest, RefusedHeadersLeaveTheRulesAlone) {
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80) + "action=drop sport=1\n"), true,
                  /*fromIoctl=*/false),
            ZEL_OK);
  for (uint8_t version : {0, 6, 9, 255}) {
    auto before = Capture();
    FWRulesetHeader h{version, 8, 7, 0xffffffffu, 0x3, 1};
    std::vector<uint8_t> header(sizeof(h));
    std::memcpy(header.data(), &h, sizeof(h));
    host::Log::Clear();
    EXPECT_EQ(Apply(header, true, /*fromIoctl=*/false), ZEL_NOT_SUPPORTED);
    EXPECT_TRUE(host::Log::Contains(
        "Invalid ruleset version. Got " + std::to_string(version) + ", expecting 8", 1));
    EXPECT_TRUE(Capture() == before);
  }
  FWRulesetHeader h{9, 0, 0, 3, 0, 0};
  std::vector<uint8_t> header(sizeof(h));
  std::memcpy(header.data(), &h, sizeof(h));
  EXPECT_EQ(Apply(header, true, /*fromIoctl=*/true), ZEL_NOT_SUPPORTED);
  EXPECT_EQ(ctx_->ioctl, 1u);
  EXPECT_EQ(ctx_->numRules, 2u);

  auto before = Capture();
  host::Faults::Fail("Hash_Alloc", ZEL_NO_MEMORY);
  EXPECT_EQ(Apply(Rs("ruleset features=0x2\naction=drop\n")), ZEL_FAILURE);
  EXPECT_TRUE(host::Log::Contains("Failed to allocate firewall ruleset hash", 2));
  EXPECT_TRUE(Capture() == before);
}

TEST_F(ApplyTest, PoolTagsAreLookedUpOncePerEntryAndHandedBack) {
  host::ResPools::Define("gold", 12);
  const std::string pooled = "action=pooltag pool=gold ";
  ASSERT_EQ(Apply(Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80, pooled + "bidir dir=to") +
                     pooled + "sport=7\n" + "action=pooltag pool=nosuch sport=8\n" +
                     Exact("10.0.0.1", 1, "10.0.0.2", 80, pooled + "dir=to"))),
            ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Got resource pool tag of 12 for pool gold", 1));
  EXPECT_TRUE(host::Log::Contains("Invalid resource pool nosuch specified", 2));
  for (FWRuleEntry* e : ExactEntries()) EXPECT_EQ(e->poolTag, 12);  // rule and mirror
  auto general = GeneralEntries();
  EXPECT_EQ(general[0]->poolTag, 12);
  EXPECT_EQ(general[1]->poolTag, 0xffff);
  // One reference per entry: the merged repeat handed its own back.
  EXPECT_EQ(host::ResPools::Outstanding(12), 3);
  EXPECT_EQ(host::ResPools::Outstanding(0xffff), 1);

  // A pool name filling the whole field without a NUL is cut at 128.
  FWRule noNul = rules::ParseRule("action=pooltag sport=9");
  std::memset(noNul.resourcePool, 'x', sizeof(noNul.resourcePool));
  ASSERT_EQ(Apply(rules::RulesetBuilder().Add(noNul).Bytes()), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Invalid resource pool " + std::string(128, 'x') +
                                  " specified"));
  EXPECT_EQ(host::ResPools::Outstanding(12), 0);
  EXPECT_EQ(host::ResPools::Outstanding(0xffff), 1);
  Clear();
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 0);
}

TEST_F(ApplyTest, ClearDropsRulesButKeepsVersionFragOverrideAndIoctl) {
  host::ResPools::Define("gold", 3);
  ASSERT_EQ(Apply(Rs("ruleset version=7 features=0x3 frag=punt\n" +
                     Exact("10.0.0.1", 1, "10.0.0.2", 80, "action=pooltag pool=gold") +
                     "action=pooltag pool=gold sport=1\n")),
            ZEL_OK);
  Clear();
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_TRUE(List_IsEmpty(&ctx_->ruleList));
  EXPECT_EQ(ctx_->numRules, 0u);
  EXPECT_EQ(ctx_->fwFeatures, 0u);
  EXPECT_EQ(ctx_->version, 7u);
  EXPECT_EQ(ctx_->fragOverride, 3u);
  EXPECT_EQ(ctx_->ioctl, 1u);
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 0);
  Clear();  // nothing left to clear
  EXPECT_EQ(Populate().size(), 15u);
}

// A version-7 ruleset reads back byte for byte: exact rules first, then the
// general ones in order, bit 9 clear again, header as the module writes it.
TEST_F(ApplyTest, Version7ReadsBackAsSent) {
  auto rs = Rs("ruleset version=7 features=0x1 frag=drop\n" +
               Exact("10.0.0.1", 1, "10.0.0.2", 80, "action=drop pkts=3 bytes=5") +
               "action=punt sa=10.0.0.0-10.0.0.255\n" + "action=copy smac=02:00:00:00:00:01/"
               "00:00:00:00:00:00\n");
  ASSERT_EQ(Apply(rs), ZEL_OK);
  EXPECT_EQ(Populate(), rs);
}

// Reading back and applying again installs the same entries, mirrors
// included, whichever half comes first. (A mirror that merged into a rule
// of another action is not such a pair: there the read-back order decides.)
TEST_F(ApplyTest, ReadBackAndReapplyInstallsTheSameRules) {
  auto rs = Rs(Exact("10.0.0.1", 1, "10.0.0.2", 80, "dir=to action=drop bidir") +
               Exact("10.0.0.3", 1, "10.0.0.4", 80, "dir=both action=punt bidir pkts=8") +
               "action=drop ipv6 sa=2001:db8::-2001:db8::ff\n" + "action=punt dport=53\n");
  ASSERT_EQ(Apply(rs), ZEL_OK);
  const auto exact = Sorted(RulesOf(ExactEntries()));
  const auto general = RulesOf(GeneralEntries());
  const uint32_t numRules = ctx_->numRules;
  auto back = Populate();
  for (int round = 0; round < 2; round++) {
    host::Log::Clear();
    ASSERT_EQ(Apply(back), ZEL_OK);
    EXPECT_EQ(ctx_->numRules, numRules);
    EXPECT_EQ(Sorted(RulesOf(ExactEntries())), exact);
    auto g = RulesOf(GeneralEntries());
    ASSERT_EQ(g.size(), general.size());
    for (size_t i = 0; i < g.size(); i++) EXPECT_TRUE(SameRecord(g[i], general[i]));
    EXPECT_EQ(host::Log::Count("Firewall rule already present, ignoring"), 0u);
    back = Populate();
  }
}

// Random records, random bytes included, install as the model says: the
// same number of entries, the same exact records, the same general order.
TEST_F(ApplyTest, RandomRecordsInstallAsTheModelSays) {
  std::mt19937 rng(1234);
  FwModel model;
  for (int iter = 0; iter < 300; iter++) {
    const uint8_t version = (rng() & 1) ? 8 : 7;
    rules::RulesetBuilder b(version);
    const int n = rng() % 12;
    for (int i = 0; i < n; i++) {
      FWRule r;
      auto* bytes = reinterpret_cast<uint8_t*>(&r);
      for (size_t k = 0; k < sizeof(r); k++) bytes[k] = static_cast<uint8_t>(rng());
      if (version == 7) std::memset(bytes + 259, 0, 281 - 259);
      // Few distinct keys so repeats and mirrors meet; half of them exact.
      if (rng() & 1) r.ruleFlags &= ~FW_GENERAL_RULE_MASK;
      std::memset(r.ipSa + 1, 0, 15);
      std::memset(r.ipDa + 1, 0, 15);
      r.ipSa[0] %= 3;
      r.ipDa[0] %= 3;
      std::memset(r.dMac, 0, 12);
      r.sPort[1] %= 2;
      r.dPort[1] %= 2;
      r.sPort[0] = r.dPort[0] = 0;
      r.ipProto = 6;
      r.bidirectional %= 3;
      r.direction %= 4;
      if (r.action == SLCGenericActionResourcePoolTag || (rng() % 8) == 0) {
        r.action = SLCGenericActionResourcePoolTag;
      }
      b.Add(r);
    }
    auto rs = b.Bytes();
    const bool replace = (rng() % 3) != 0;
    ASSERT_EQ(Apply(rs, replace), ZEL_OK);
    model.Apply(rs, replace);
    ASSERT_EQ(ctx_->numRules, model.NumRules()) << "iteration " << iter;
    ASSERT_EQ(Sorted(RulesOf(ExactEntries())), Sorted(model.Exact())) << "iteration " << iter;
    auto g = RulesOf(GeneralEntries());
    ASSERT_EQ(g.size(), model.General().size());
    for (size_t i = 0; i < g.size(); i++) ASSERT_TRUE(SameRecord(g[i], model.General()[i]));
  }
  Clear();
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 0);
}

}  // namespace
