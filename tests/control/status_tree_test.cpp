// The status tree: node table, agents, filter instance names, ruleset
// summaries, rule positions, agent creation, and failures that leave no
// lock held.
#include <cstring>
#include <string>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"

namespace {

using controltest::Bytes;
using controltest::IoctlStatus;
using controltest::Push;
using controltest::Ruleset;
using host::QryValue;
using host::StatusTree;

const std::string kAgent = testsupport::kDefaultAgent;
const std::string kRuleA = "action=drop dir=both ipv4 proto=tcp dport=22";
const std::string kRuleB = "action=punt dir=to ipv4 proto=udp sa=10.0.0.1-10.0.0.9";
const std::string kRuleC = "action=accept dir=from ipv4 proto=tcp sport=443";

std::vector<QryValue> Strings(std::initializer_list<const char*> names) {
  std::vector<QryValue> v;
  for (const char* n : names) v.emplace_back(std::string(n));
  return v;
}

class StatusTreeTest : public testsupport::ModuleTest {
 protected:
  // Every handler returns with no lock held, whatever it answered.
  void TearDown() override {
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
    ModuleTest::TearDown();
  }

  ZelStatus List(const StatusTree::Path& path, std::vector<QryValue>* out) {
    ZelStatus s = StatusTree::List(path, out);
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
    return s;
  }

  std::vector<QryValue> Filters(const std::string& agent = kAgent) {
    std::vector<QryValue> out;
    EXPECT_EQ(List({"agents", agent, "filters"}, &out), ZEL_OK);
    return out;
  }

  ZelStatus Summary(const std::string& agent, const std::string& filter,
                    SLCGeneric_RuleSetSummary* out) {
    Bytes bytes;
    ZelStatus s = StatusTree::Get({"agents", agent, "filters", filter, "ruleSetSummary"}, &bytes);
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
    if (s == ZEL_OK) {
      EXPECT_EQ(bytes.size(), sizeof(*out));
      std::memcpy(out, bytes.data(), sizeof(*out));
    }
    return s;
  }
};

TEST_F(StatusTreeTest, TablesDescribeTheSevenNodesInOrder) {
  EXPECT_EQ(slcGenericModuleImage.qry, &slcGenericQryTables);
  std::vector<QRY_Node> nodes = StatusTree::Nodes();
  ASSERT_EQ(nodes.size(), 7u);
  const char* names[] = {"root",           "agents", "createAgent", "filters",
                         "ruleSetSummary", "rules",  "ruleSummary"};
  for (size_t i = 0; i < 7; ++i) EXPECT_STREQ(nodes[i].name, names[i]);
  // Children in order: createAgent before agents, rules before ruleSetSummary.
  EXPECT_EQ(nodes[0].firstChild, 2);
  EXPECT_EQ(nodes[2].nextSibling, 1);
  EXPECT_EQ(nodes[3].firstChild, 5);
  EXPECT_EQ(nodes[5].nextSibling, 4);
  EXPECT_EQ(StatusTree::Type(nodes[4].outputType)->size, 1040u);
  EXPECT_EQ(StatusTree::Type(nodes[6].outputType)->size, 5192u);
  EXPECT_STREQ(StatusTree::Type(SLCGenericQryTypeActionEnum)->elems[11].description,
               "mark packets with dscp tag and 802.1p tag");
}

TEST_F(StatusTreeTest, AgentsAreListedOldestFirst) {
  ASSERT_EQ(CreateAgents("beta alpha"), ZEL_OK);
  std::vector<QryValue> out;
  EXPECT_EQ(List({"agents"}, &out), ZEL_OK);
  EXPECT_EQ(out, Strings({"sluice-generic-quelmar", "beta", "alpha"}));

  host::Faults::Fail("QRY_ParamListAddString", ZEL_NO_MEMORY, 2);
  EXPECT_EQ(List({"agents"}, &out), ZEL_NO_MEMORY);
  EXPECT_EQ(out, Strings({"sluice-generic-quelmar"}));
}

TEST_F(StatusTreeTest, InstanceNamesFollowListPositionAndRenumber) {
  host::FilterId vnic0 = CreateFilter(kAgent, "vnic0");
  CreateFilter(kAgent, "vnic1");
  EXPECT_EQ(Filters(), Strings({"vnic0-0", "vnic1-1"}));

  ASSERT_EQ(host::Sluice::DestroyFilter(vnic0), ZEL_OK);
  EXPECT_EQ(Filters(), Strings({"vnic1-0"}));
  SLCGeneric_RuleSetSummary s;
  EXPECT_EQ(Summary(kAgent, "vnic1-1", &s), ZEL_NOT_FOUND);
  EXPECT_EQ(Summary(kAgent, "vnic1-0", &s), ZEL_OK);
}

TEST_F(StatusTreeTest, SameNamedFiltersResolveToTheirOwnRecords) {
  host::FilterId first = CreateFilter(kAgent, "fw");
  host::FilterId second = CreateFilter(kAgent, "fw");
  ASSERT_EQ(IoctlStatus(second, Push(Ruleset({kRuleA, kRuleB}))), 1);
  EXPECT_EQ(Filters(), Strings({"fw-0", "fw-1"}));
  SLCGeneric_RuleSetSummary s;
  ASSERT_EQ(Summary(kAgent, "fw-0", &s), ZEL_OK);
  EXPECT_EQ(uint32_t{s.numRules}, 0u);
  ASSERT_EQ(Summary(kAgent, "fw-1", &s), ZEL_OK);
  EXPECT_EQ(uint32_t{s.numRules}, 2u);
  (void)first;
}

TEST_F(StatusTreeTest, FreshFilterSummary) {
  CreateFilter(kAgent, "vnic0");
  SLCGeneric_RuleSetSummary s;
  ASSERT_EQ(Summary(kAgent, "vnic0-0", &s), ZEL_OK);
  EXPECT_EQ(s.version, 8);
  EXPECT_EQ(s.highestSupportedVersion, 8);
  EXPECT_EQ(s.lowestSupportedVersion, 7);
  EXPECT_EQ(uint32_t{s.numRules}, 0u);
  EXPECT_EQ(uint32_t{s.defaultAction}, uint32_t(SLCGenericActionAccept));
  EXPECT_EQ(uint32_t{s.fragOverride}, 0u);
  EXPECT_STREQ(s.fwFeatures, "None");
  EXPECT_EQ(s.ioctl, 0);

  std::string text;
  ASSERT_EQ(StatusTree::Render({"agents", kAgent, "filters", "vnic0-0", "ruleSetSummary"}, &text),
            ZEL_OK);
  EXPECT_NE(text.find("defaultAction: SLCGenericActionAccept (accept packets)"), std::string::npos)
      << text;
  EXPECT_NE(text.find("fwFeatures: None"), std::string::npos) << text;
}

TEST_F(StatusTreeTest, SummaryAfterIoctlPushShowsTheRulesetAndTheFlag) {
  ASSERT_EQ(CreateAgents("dropper:default-action=ACTION_DROP"), ZEL_OK);
  host::FilterId id = CreateFilter("dropper", "vnic0");
  rules::RulesetBuilder b(7);
  b.FragOverride(SLCGenericActionPunt).Features(FW_FEATURE_DROP_BPDU).Add(kRuleA).Add(kRuleC);
  ASSERT_EQ(IoctlStatus(id, Push(b.Bytes())), 1);
  SLCGeneric_RuleSetSummary s;
  ASSERT_EQ(Summary("dropper", "vnic0-0", &s), ZEL_OK);
  EXPECT_EQ(s.version, 7);
  EXPECT_EQ(uint32_t{s.numRules}, 2u);
  EXPECT_EQ(uint32_t{s.defaultAction}, uint32_t(SLCGenericActionDrop));
  EXPECT_EQ(uint32_t{s.fragOverride}, uint32_t(SLCGenericActionPunt));
  EXPECT_STREQ(s.fwFeatures, "None");
  EXPECT_EQ(s.ioctl, 1);
}

TEST_F(StatusTreeTest, RulePositionsFollowTheRuleCount) {
  host::FilterId id = CreateFilter(kAgent, "vnic0");
  std::vector<QryValue> out;
  EXPECT_EQ(List({"agents", kAgent, "filters", "vnic0-0", "rules"}, &out), ZEL_OK);
  EXPECT_TRUE(out.empty());
  ASSERT_EQ(IoctlStatus(id, Push(Ruleset({kRuleA, kRuleB, kRuleC}))), 1);
  EXPECT_EQ(List({"agents", kAgent, "filters", "vnic0-0", "rules"}, &out), ZEL_OK);
  EXPECT_EQ(out, (std::vector<QryValue>{int64_t(0), int64_t(1), int64_t(2)}));

  host::Faults::Fail("QRY_ParamListAddInt", ZEL_NO_MEMORY, 3);
  EXPECT_EQ(List({"agents", kAgent, "filters", "vnic0-0", "rules"}, &out), ZEL_NO_MEMORY);
  EXPECT_EQ(out.size(), 2u);
}

TEST_F(StatusTreeTest, FailedAddEndsTheFilterList) {
  CreateFilter(kAgent, "vnic0");
  CreateFilter(kAgent, "vnic1");
  host::Faults::Fail("QRY_ParamListAddString", ZEL_NO_MEMORY, 2);
  std::vector<QryValue> out;
  EXPECT_EQ(List({"agents", kAgent, "filters"}, &out), ZEL_NO_MEMORY);
  EXPECT_EQ(out, Strings({"vnic0-0"}));
}

TEST_F(StatusTreeTest, CreateAgentMakesAListedAgentWithItsConfiguration) {
  EXPECT_EQ(StatusTree::Set({"createAgent"}, {QryValue(std::string("made:default-action=ACTION_PUNT"))}),
            ZEL_OK);
  std::vector<QryValue> out;
  EXPECT_EQ(List({"agents"}, &out), ZEL_OK);
  EXPECT_EQ(out, Strings({"sluice-generic-quelmar", "made"}));
  host::FilterId id = CreateFilter("made", "vnic0");
  EXPECT_EQ(Ctx(id)->defaultAction, uint32_t(SLCGenericActionPunt));
  EXPECT_EQ(Filters("made"), Strings({"vnic0-0"}));

  // Reading createAgent yields nothing.
  Bytes bytes;
  EXPECT_EQ(StatusTree::Get({"createAgent"}, &bytes), ZEL_OK);
  EXPECT_TRUE(bytes.empty());
}

TEST_F(StatusTreeTest, CreateAgentFailuresReturnTheirStatus) {
  EXPECT_EQ(StatusTree::Set({"createAgent"}, {QryValue(int64_t(5))}), ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(StatusTree::Set({"createAgent"}, {}), ZEL_NOT_FOUND);
  host::Faults::Fail("zel_SluiceRegisterFastPath", ZEL_BUSY);
  EXPECT_EQ(StatusTree::Set({"createAgent"}, {QryValue(std::string("refused"))}), ZEL_BUSY);
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(StatusTree::Set({"createAgent"}, {QryValue(std::string("nomem"))}), ZEL_NO_MEMORY);
  std::vector<QryValue> out;
  EXPECT_EQ(List({"agents"}, &out), ZEL_OK);
  EXPECT_EQ(out, Strings({"sluice-generic-quelmar"}));
}

TEST_F(StatusTreeTest, BadPathsFailWithNoLockHeld) {
  CreateFilter(kAgent, "vnic0");
  SLCGeneric_RuleSetSummary s;
  std::vector<QryValue> out;
  EXPECT_EQ(Summary("nobody", "vnic0-0", &s), ZEL_NOT_FOUND);
  EXPECT_EQ(Summary(kAgent, "vnic0-1", &s), ZEL_NOT_FOUND);
  EXPECT_EQ(Summary(kAgent, "vnic0", &s), ZEL_NOT_FOUND);
  EXPECT_EQ(List({"agents", "nobody", "filters"}, &out), ZEL_NOT_FOUND);
  EXPECT_EQ(List({"agents", kAgent, "filters", "none-0", "rules"}, &out), ZEL_NOT_FOUND);

  Bytes bytes;
  EXPECT_EQ(StatusTree::Get({"agents", int64_t(1), "filters", "vnic0-0", "ruleSetSummary"}, &bytes),
            ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  EXPECT_EQ(StatusTree::Get({"agents", kAgent, "filters", int64_t(0), "ruleSetSummary"}, &bytes),
            ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  EXPECT_EQ(List({"agents", int64_t(0), "filters"}, &out), ZEL_BAD_PARAM_TYPE);
}

}  // namespace
