// The firewall context: the default action from the agent's configuration
// and the no-ruleset packet path. The attachment-state copy is asserted by
// every packet-path test that attaches a slow path (packet_fixture.h).

#include <cstring>

#include "tests/support/module_fixture.h"

namespace {

using testsupport::ModuleTest;

// The keyword must be exact and in first place; once per filter, a bad one
// is logged and accept used.
TEST_F(ModuleTest, DefaultActionComesFromTheAgentConfiguration) {
  const struct { const char* config; uint32_t action; const char* complaint; } rows[] = {
      {"", SLCGenericActionAccept, nullptr},
      {"default-action=ACTION_PUNT", SLCGenericActionPunt, nullptr},
      {"default-action=ACTION_DROP", SLCGenericActionDrop, nullptr},
      {"default-action=ACTION_ACCEPT", SLCGenericActionAccept, nullptr},
      {"default-action=ACTION_DROPPED,extra", SLCGenericActionDrop, nullptr},
      {"default-action=action_drop", SLCGenericActionAccept,
       "Invalid default action specified: action_drop"},
      {"default-action=ACTION_PUN", SLCGenericActionAccept,
       "Invalid default action specified: ACTION_PUN"},
      {"x default-action=ACTION_DROP", SLCGenericActionAccept, nullptr},
      {"default-action", SLCGenericActionAccept, nullptr},
  };
  for (size_t i = 0; i < std::size(rows); i++) {
    SCOPED_TRACE(rows[i].config);
    const std::string agent = "cfg" + std::to_string(i);
    ASSERT_EQ(CreateAgents(agent + ":" + rows[i].config), ZEL_OK);
    host::Log::Clear();
    EXPECT_EQ(Ctx(CreateFilter(agent, "one"))->defaultAction, rows[i].action);
    EXPECT_EQ(Ctx(CreateFilter(agent, "two"))->defaultAction, rows[i].action);
    EXPECT_EQ(host::Log::CountContaining("Invalid default action"), rows[i].complaint ? 2u : 0u);
    if (rows[i].complaint) {
      EXPECT_EQ(host::Log::Count(rows[i].complaint, 2), 2u);
    }
  }
}

// Without a ruleset the default action takes the whole list: punt needs a
// slow path (attaching is enough, one hand-over per list), else the failure
// policy drops (0) or passes (1); an unknown action touches nothing.
TEST_F(ModuleTest, WithoutARulesetTheDefaultActionTakesTheWholeList) {
  std::vector<std::vector<uint8_t>> frames;
  for (uint8_t i = 0; i < 4; i++) frames.emplace_back(60 + i, static_cast<uint8_t>(i + 1));
  const struct { const char* action; uint32_t policy; bool attaching; ZelStatus status;
                 bool passes, faulted; } rows[] = {
      {"ACTION_ACCEPT", 0, false, ZEL_OK, true, false},
      {"ACTION_DROP", 1, false, ZEL_OK, false, false},
      {"ACTION_PUNT", 0, false, ZEL_OK, false, false},
      {"ACTION_PUNT", 1, false, ZEL_OK, true, false},
      {"ACTION_PUNT", 0, true, ZEL_OK, false, true},
      {"bogus", 0, false, ZEL_FAILURE, true, false},
  };
  for (size_t i = 0; i < std::size(rows); i++) {
    const auto& r = rows[i];
    SCOPED_TRACE(i);
    const std::string agent = "def" + std::to_string(i);
    ASSERT_EQ(CreateAgents(agent + ":default-action=" + r.action), ZEL_OK);
    host::FilterConfig config;
    config.failurePolicy = r.policy;
    const host::FilterId id = CreateFilter(agent, config);
    if (std::string(r.action) == "bogus") Ctx(id)->defaultAction = 42;
    if (r.attaching) {
      host::Sluice::SetPolicy(host::RequestKind::SetSlowPath,
                              testsupport::Replies(host::ReplyMode::Deferred));
      ASSERT_EQ(host::Sluice::RegisterSlowPath(agent, 1), ZEL_OK);
      host::Timers::RunDue();
      ASSERT_EQ(Ctx(id)->spAttachState, SLCGenericSpAttaching);
    }
    std::vector<std::vector<uint8_t>> passed;
    EXPECT_EQ(Deliver(id, frames, 2, &passed), r.status);
    EXPECT_EQ(passed, r.passes ? frames : decltype(frames){});
    std::vector<host::Delivery> faulted = host::Sluice::TakeFaulted(id);
    ASSERT_EQ(faulted.size(), r.faulted ? 1u : 0u);
    if (r.faulted) {
      EXPECT_EQ(faulted[0].direction, 2u);
      std::vector<std::vector<uint8_t>> handed;
      for (ZelPkt* p : faulted[0].packets) handed.push_back(host::Packets::Frame(p));
      EXPECT_EQ(handed, frames);
      testsupport::ReleaseDeliveries(&faulted);
      host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    }
  }
}

}  // namespace
