// All or nothing: a replace or an add that runs out of memory at any of its
// allocations leaves the filter exactly as it was (rules, counters, header
// values, table, list links, socket and tag ownership) and leaks nothing;
// once memory is there, the same ruleset installs as the model says.
#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <string>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::FirewallTest;
using testsupport::FwModel;
using testsupport::SameRecord;

std::string Exact(const std::string& a, int sp, const std::string& b, int dp,
                  const std::string& extra) {
  return "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=17 sa=" +
         a + " sport=" + std::to_string(sp) + " da=" + b + " dport=" + std::to_string(dp) + " " +
         extra + "\n";
}

// In force before each attempt: exact rules (one mirrored, one pool-tagged,
// one GRE) and general rules (one pool-tagged).
const std::string kBefore = "ruleset version=7 features=0x1 frag=drop\n" +
                            Exact("10.0.0.1", 1, "10.0.0.2", 2, "action=drop dir=to bidir") +
                            Exact("10.0.0.3", 3, "10.0.0.4", 4, "action=pooltag pool=gold") +
                            Exact("10.0.0.5", 5, "10.0.0.6", 6, "action=gre gre=192.0.2.9") +
                            "action=pooltag pool=gold sport=7\n" +
                            "action=gre gre=192.0.2.9 dport=8\n" + "action=punt sa=10.9.0.0-10.9.0.9\n";

// Applied over it: a repeat of an installed rule (merge), new exact rules,
// a mirrored pair whose halves are both new, a pool-tagged mirrored pair,
// general rules (one pool-tagged).
const std::string kNext = "ruleset version=8 features=0x2 frag=punt\n" +
                          Exact("10.0.0.3", 3, "10.0.0.4", 4, "action=accept dir=from") +
                          Exact("10.1.0.1", 1, "10.1.0.2", 2, "action=punt") +
                          "action=drop sport=9\n" +
                          Exact("10.1.0.3", 3, "10.1.0.4", 4, "action=copy bidir dir=to") +
                          "action=pooltag pool=gold dport=10 rptag=4\n" +
                          Exact("10.1.0.5", 5, "10.1.0.6", 6, "action=pooltag pool=gold bidir") +
                          Exact("10.1.0.7", 7, "10.1.0.8", 8, "action=pooltag pool=nosuch") +
                          "action=accept dmac=02:00:00:00:00:00/ff:00:00:00:00:00\n";

class UndoTest : public FirewallTest {
 protected:
  void SetUp() override {
    FirewallTest::SetUp();
    host::ResPools::Define("gold", 21);
    ASSERT_EQ(Apply(rules::ParseRuleset(kBefore)), ZEL_OK);
    // Traffic has counted on the rules and opened GRE sockets (as the
    // packet path does on first use). Both halves of a mirrored pair get
    // the same count, so that the model can rebuild this state from the
    // read-back ruleset (re-applying gives a mirror its first half's count).
    for (FWRuleEntry* e : ExactEntries()) {
      e->rule.pktCount = 100 + FWNet16(e->rule.sPort) + FWNet16(e->rule.dPort);
    }
    uint64_t n = 1;
    for (FWRuleEntry* e : GeneralEntries()) e->rule.byteCount = 1000 * n++;
    for (FWRuleEntry* e : ExactEntries()) {
      if (e->rule.action == SLCGenericActionGRE) OpenSocket(e);
    }
    for (FWRuleEntry* e : GeneralEntries()) {
      if (e->rule.action == SLCGenericActionGRE) OpenSocket(e);
    }
    ASSERT_EQ(host::Sockets::Open(), 2u);
  }

  void OpenSocket(FWRuleEntry* e) {
    ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &e->greSocket), ZEL_OK);
    e->greSocketOpen = 1;
  }

  // Fails allocation n = 1, 2, ... of the application until it succeeds;
  // returns the number of allocations it needed. `messages` collects the
  // failure messages seen.
  // `staged`: an addition through FWAddRuleset, built under the shared
  // hold beside the rules in force.
  uint64_t FailEveryAllocation(bool replace, std::set<std::string>* messages,
                               bool staged = false) {
    const auto rs = rules::ParseRuleset(kNext);
    const Fingerprint before = Capture();
    for (uint64_t n = 1;; n++) {
      host::Log::Clear();
      host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, n);
      std::vector<uint8_t> copy(rs);
      const ZelStatus status =
          staged ? FWAddRuleset(filter_, reinterpret_cast<FWRuleset*>(copy.data()), 1)
                 : Apply(rs, replace);
      const bool injected = host::Faults::Injected("zel_HeapAllocWithRA") > 0;
      host::Faults::ClearAll();
      if (!injected) {
        EXPECT_EQ(status, ZEL_OK);
        return n - 1;
      }
      EXPECT_EQ(status, ZEL_FAILURE) << "allocation " << n;
      EXPECT_TRUE(Capture() == before) << "allocation " << n << " changed the filter";
      if (host::Log::Contains("Failed to allocate firewall ruleset hash", 2)) {
        EXPECT_EQ(host::Log::Count("Undoing ..."), 0u);
        messages->insert("Failed to allocate firewall ruleset hash");
        continue;
      }
      EXPECT_EQ(host::Log::Count("Undoing ...", 2), 1u) << "allocation " << n;
      for (const char* m : {"Failed to copy hash entries", "Failed to allocate rule list entry",
                            "Failed to insert hash entry",
                            "Failed to insert second half of bidirectional rule",
                            "Failed to allocate general rule index"}) {
        if (host::Log::Contains(m)) messages->insert(m);
      }
      if (HasFailure()) return 0;
    }
  }

  void ExpectModel(const FwModel& model) {
    EXPECT_EQ(ctx_->numRules, model.NumRules());
    std::vector<std::string> got, want;
    for (FWRuleEntry* e : ExactEntries()) got.emplace_back(reinterpret_cast<char*>(&e->rule), 281);
    for (const FWRule& r : model.Exact()) want.emplace_back(reinterpret_cast<const char*>(&r), 281);
    std::sort(got.begin(), got.end());
    std::sort(want.begin(), want.end());
    EXPECT_EQ(got, want);
    auto general = GeneralEntries();
    ASSERT_EQ(general.size(), model.General().size());
    for (size_t i = 0; i < general.size(); i++) {
      EXPECT_TRUE(SameRecord(general[i]->rule, model.General()[i])) << i;
    }
  }

  // The model of the state SetUp made, counters included.
  FwModel ModelOfBefore() {
    FwModel model;
    model.Apply(Populate(), true);
    return model;
  }
};

TEST_F(UndoTest, ReplaceFailingAtAnyAllocationChangesNothing) {
  FwModel model = ModelOfBefore();
  std::set<std::string> messages;
  const uint64_t allocations = FailEveryAllocation(/*replace=*/true, &messages);
  // Table and buckets, 7 new exact entries (two of them mirrors), 3 general,
  // the scan index of the general rules.
  EXPECT_EQ(allocations, 2u + 7u + 3u + 1u);
  EXPECT_EQ(messages, (std::set<std::string>{
                          "Failed to allocate firewall ruleset hash",
                          "Failed to allocate rule list entry", "Failed to insert hash entry",
                          "Failed to insert second half of bidirectional rule",
                          "Failed to allocate general rule index"}));
  model.Apply(rules::ParseRuleset(kNext), true);
  ExpectModel(model);
  EXPECT_EQ(ctx_->version, 8u);
  EXPECT_EQ(ctx_->fwFeatures, 2u);
  EXPECT_EQ(ctx_->fragOverride, 3u);
  // The former rules went with their sockets and tags.
  EXPECT_EQ(host::Sockets::Open(), 0u);
  EXPECT_EQ(host::ResPools::Outstanding(21), 3);  // two mirrored halves, one general
  EXPECT_EQ(host::ResPools::Outstanding(0xffff), 1);
}

class AddUndoTest : public UndoTest, public ::testing::WithParamInterface<bool> {};

TEST_P(AddUndoTest, FailingAtAnyAllocationChangesNothing) {
  const bool staged = GetParam();
  FwModel model = ModelOfBefore();
  const uint32_t exactBefore = static_cast<uint32_t>(ExactEntries().size());
  std::set<std::string> messages;
  const uint64_t allocations = FailEveryAllocation(/*replace=*/false, &messages, staged);
  // Table and buckets, a copy of every former exact entry (staged: and the
  // block pairing each copy with its original), the new entries (the first
  // record merges into its copy), the scan index.
  EXPECT_EQ(allocations, 2u + (staged ? 1u : 0u) + exactBefore + 6u + 3u + 1u);
  EXPECT_EQ(messages, (std::set<std::string>{
                          "Failed to allocate firewall ruleset hash", "Failed to copy hash entries",
                          "Failed to allocate rule list entry", "Failed to insert hash entry",
                          "Failed to insert second half of bidirectional rule",
                          "Failed to allocate general rule index"}));
  model.Apply(rules::ParseRuleset(kNext), false);
  ExpectModel(model);
  // Copies now own the former sockets and tags.
  EXPECT_EQ(host::Sockets::Open(), 2u);
  EXPECT_EQ(host::ResPools::Outstanding(21), 2 + 3);
  for (FWRuleEntry* e : ExactEntries()) {
    if (e->rule.action == SLCGenericActionGRE) {
      EXPECT_EQ(e->greSocketOpen, 1);
    }
  }
}
INSTANTIATE_TEST_SUITE_P(Roads, AddUndoTest, ::testing::Values(false, true),
                         [](const auto& info) { return info.param ? "Staged" : "InPlace"; });

// Adding to a filter that never had a table (nothing to copy).
TEST_F(FirewallTest, AddToAFilterWithoutRulesUndoesToNoTable) {
  ASSERT_EQ(Apply(rules::ParseRuleset("ruleset version=8\n")), ZEL_OK);  // ioctl flag set
  Clear();
  const auto before = Capture();
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 5);
  EXPECT_EQ(Apply(rules::ParseRuleset(kNext), /*replace=*/false), ZEL_FAILURE);
  host::Faults::ClearAll();
  EXPECT_TRUE(Capture() == before);
  EXPECT_EQ(ctx_->ruleHash, nullptr);
}

}  // namespace
