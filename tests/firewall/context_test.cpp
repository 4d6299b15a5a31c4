// The firewall context: the default action from the agent's configuration,
// the attachment-state copy, and the no-ruleset packet path.

#include <cstring>

#include "tests/support/module_fixture.h"

namespace {

using testsupport::kDefaultAgent;
using testsupport::ModuleTest;

struct ConfigCase {
  const char* config;
  uint32_t action;
  const char* complaint;   // logged text, or null
};

class DefaultActionConfig : public ModuleTest, public ::testing::WithParamInterface<ConfigCase> {};

TEST_P(DefaultActionConfig, ChoosesTheAction) {
  const ConfigCase& c = GetParam();
  ASSERT_EQ(CreateAgents(std::string("cfg:") + c.config), ZEL_OK);
  host::Log::Clear();
  host::FilterId a = CreateFilter("cfg", "one");
  host::FilterId b = CreateFilter("cfg", "two");
  EXPECT_EQ(Ctx(a)->defaultAction, c.action);
  EXPECT_EQ(Ctx(b)->defaultAction, c.action);
  if (c.complaint != nullptr) {
    EXPECT_EQ(host::Log::Count(c.complaint, 2), 2u);  // once per filter
  } else {
    EXPECT_EQ(host::Log::CountContaining("Invalid default action"), 0u);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Keywords, DefaultActionConfig,
    ::testing::Values(
        ConfigCase{"", SLCGenericActionAccept, nullptr},
        ConfigCase{"default-action=ACTION_PUNT", SLCGenericActionPunt, nullptr},
        ConfigCase{"default-action=ACTION_DROP", SLCGenericActionDrop, nullptr},
        ConfigCase{"default-action=ACTION_ACCEPT", SLCGenericActionAccept, nullptr},
        ConfigCase{"default-action=ACTION_DROPPED,extra", SLCGenericActionDrop, nullptr},
        ConfigCase{"default-action=action_drop", SLCGenericActionAccept,
                   "Invalid default action specified: action_drop"},
        ConfigCase{"default-action=ACTION_PUN", SLCGenericActionAccept,
                   "Invalid default action specified: ACTION_PUN"},
        ConfigCase{"x default-action=ACTION_DROP", SLCGenericActionAccept, nullptr},
        ConfigCase{"default-action", SLCGenericActionAccept, nullptr}));

TEST_F(ModuleTest, AttachStateIsCopiedUnderTheConfigLock) {
  host::FilterId id = CreateFilter();
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, testsupport::Replies(host::ReplyMode::Deferred));
  ASSERT_EQ(host::Sluice::RegisterSlowPath(kDefaultAgent, 4), ZEL_OK);
  EXPECT_EQ(Ctx(id)->spAttachState, SLCGenericSpDetached);
  host::Timers::RunDue();
  EXPECT_EQ(Ctx(id)->spAttachState, SLCGenericSpAttaching);
  host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
  EXPECT_EQ(Ctx(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
}

// --- No ruleset: the whole list by the default action ------------------------

std::vector<std::vector<uint8_t>> Frames(size_t n) {
  std::vector<std::vector<uint8_t>> frames;
  for (size_t i = 0; i < n; i++) {
    frames.emplace_back(60 + i, static_cast<uint8_t>(i + 1));
  }
  return frames;
}

class NoRuleset : public ModuleTest {
 protected:
  host::FilterId Make(const char* action, uint32_t failurePolicy) {
    EXPECT_EQ(CreateAgents(std::string("def:default-action=") + action), ZEL_OK);
    host::FilterConfig config;
    config.failurePolicy = failurePolicy;
    return CreateFilter("def", config);
  }
  void MakeAttaching(host::FilterId id) {
    host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, testsupport::Replies(host::ReplyMode::Deferred));
    ASSERT_EQ(host::Sluice::RegisterSlowPath("def", 1), ZEL_OK);
    host::Timers::RunDue();
    ASSERT_EQ(Ctx(id)->spAttachState, SLCGenericSpAttaching);
  }
};

TEST_F(NoRuleset, AcceptPassesEverything) {
  host::FilterId id = Make("ACTION_ACCEPT", 0);
  std::vector<std::vector<uint8_t>> passed;
  EXPECT_EQ(Deliver(id, Frames(5), 1, &passed), ZEL_OK);
  EXPECT_EQ(passed, Frames(5));
  EXPECT_EQ(host::Sluice::FaultedCount(id), 0u);
}

TEST_F(NoRuleset, DropReleasesEverything) {
  host::FilterId id = Make("ACTION_DROP", 1);
  std::vector<std::vector<uint8_t>> passed;
  EXPECT_EQ(Deliver(id, Frames(5), 2, &passed), ZEL_OK);
  EXPECT_TRUE(passed.empty());
  EXPECT_EQ(host::Packets::Live(), 0u);
}

TEST_F(NoRuleset, PuntWhileDetachedFollowsTheFailurePolicy) {
  std::vector<std::vector<uint8_t>> passed;
  host::FilterId closed = Make("ACTION_PUNT", 0);
  EXPECT_EQ(Deliver(closed, Frames(3), 1, &passed), ZEL_OK);
  EXPECT_TRUE(passed.empty());
  EXPECT_EQ(host::Sluice::FaultedCount(closed), 0u);

  host::FilterConfig open;
  open.name = "open";
  open.failurePolicy = 1;
  host::FilterId openId = CreateFilter("def", open);
  EXPECT_EQ(Deliver(openId, Frames(3), 1, &passed), ZEL_OK);
  EXPECT_EQ(passed, Frames(3));
  EXPECT_EQ(host::Sluice::FaultedCount(openId), 0u);
}

TEST_F(NoRuleset, PuntWhileAttachingHandsTheListOverInOneCall) {
  host::FilterId id = Make("ACTION_PUNT", 0);
  MakeAttaching(id);
  std::vector<std::vector<uint8_t>> passed;
  EXPECT_EQ(Deliver(id, Frames(4), 2, &passed), ZEL_OK);
  EXPECT_TRUE(passed.empty());
  std::vector<host::Delivery> faulted = host::Sluice::TakeFaulted(id);
  ASSERT_EQ(faulted.size(), 1u);
  EXPECT_EQ(faulted[0].direction, 2u);
  ASSERT_EQ(faulted[0].packets.size(), 4u);
  for (size_t i = 0; i < 4; i++) {
    EXPECT_EQ(host::Packets::Frame(faulted[0].packets[i]), Frames(4)[i]);
  }
  testsupport::ReleaseDeliveries(&faulted);
  host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
}

TEST_F(NoRuleset, UnknownDefaultActionTouchesNothing) {
  host::FilterId id = Make("ACTION_ACCEPT", 0);
  Ctx(id)->defaultAction = 42;
  std::vector<std::vector<uint8_t>> passed;
  EXPECT_EQ(Deliver(id, Frames(3), 1, &passed), ZEL_FAILURE);
  EXPECT_EQ(passed, Frames(3));
  EXPECT_EQ(host::Sluice::FaultedCount(id), 0u);
}

}  // namespace
