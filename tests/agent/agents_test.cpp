// Agents: the create-agent property's splitting, creation in order, repeats,
// and creation failing at each of its steps.

#include <thread>

#include "control/control.h"
#include "module/module.h"
#include "tests/support/module_fixture.h"

namespace {

using testsupport::ModuleTest;

std::vector<std::string> AgentNames() {
  std::vector<std::string> names;
  for (ListLinks* l = agentList.next; l != &agentList; l = l->next) {
    names.push_back(SLCGenericAgentFromLink(l)->name);
  }
  return names;
}

using AgentProperty = ModuleTest;

// Names in order, each with the configuration after its first colon; a
// repeat compares only the name and changes nothing.
TEST_F(AgentProperty, CreatesEachNameInOrderWithItsConfigurationAndSkipsRepeats) {
  EXPECT_EQ(CreateAgents("alpha dropper:default-action=ACTION_DROP:x"), ZEL_OK);
  EXPECT_EQ(AgentNames(),
            (std::vector<std::string>{"sluice-generic-quelmar", "alpha", "dropper"}));
  EXPECT_TRUE(host::Sluice::AgentRegistered("alpha"));
  SLCGenericFastPath* fp = Agent("dropper");
  ASSERT_NE(fp, nullptr);
  EXPECT_STREQ(fp->configPtr, "default-action=ACTION_DROP:x");
  EXPECT_EQ(Ctx(CreateFilter("dropper"))->defaultAction, SLCGenericActionDrop);

  EXPECT_EQ(CreateAgents("alpha dropper:default-action=ACTION_PUNT"), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Agent alpha already exists. Not recreating", 1), 1u);
  EXPECT_EQ(host::Log::Count("Agent dropper already exists. Not recreating", 1), 1u);
  EXPECT_STREQ(fp->configPtr, "default-action=ACTION_DROP:x");
  EXPECT_EQ(AgentNames().size(), 3u);
}

TEST_F(AgentProperty, EmptyPiecesCreateNothing) {
  // A trailing space adds no piece; a leading or doubled space passes an
  // empty piece, which is announced but creates nothing.
  EXPECT_EQ(CreateAgents("solo "), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Registering new fastpath 'solo'"), 1u);
  EXPECT_EQ(host::Log::Count("Registering new fastpath ''"), 0u);

  EXPECT_EQ(CreateAgents(" lead"), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Registering new fastpath ''"), 1u);
  EXPECT_EQ(CreateAgents("x  y"), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Registering new fastpath ''"), 2u);
  EXPECT_EQ(CreateAgents(""), ZEL_OK);
  EXPECT_EQ(CreateAgents("tab\tbed"), ZEL_OK);  // only spaces separate
  // No name at all (or no text) creates nothing, silently.
  host::Log::Clear();
  char text[] = ":default-action=ACTION_DROP";
  EXPECT_EQ(SLCGenericInitFastPathAgent(text), ZEL_OK);
  EXPECT_EQ(SLCGenericInitFastPathAgent(nullptr), ZEL_OK);
  EXPECT_TRUE(host::Log::Records().empty());
  EXPECT_EQ(AgentNames(), (std::vector<std::string>{"sluice-generic-quelmar", "solo", "lead", "x",
                                                    "y", "tab\tbed"}));
}

// A refused name buffer creates nothing; a failed agent ends the list,
// keeping the agents made before it.
TEST_F(AgentProperty, StopsAtFirstFailureKeepingEarlierAgents) {
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(CreateAgents("nobuf"), ZEL_FAILURE);
  EXPECT_TRUE(host::Log::Contains("Failed to allocate memory for agent names", 2));
  EXPECT_EQ(AgentNames().size(), 1u);
  host::Faults::Fail("zel_SluiceRegisterFastPath", ZEL_FAILURE, 2);
  EXPECT_EQ(CreateAgents("one two three"), ZEL_FAILURE);
  EXPECT_EQ(AgentNames(), (std::vector<std::string>{"sluice-generic-quelmar", "one"}));
  EXPECT_EQ(host::Log::Count("Registering new fastpath 'three'"), 0u);
}

TEST_F(AgentProperty, NamesAreCutToFit) {
  std::string longName(150, 'n');
  EXPECT_EQ(CreateAgents(longName + ":" + std::string(200, 'c')), ZEL_OK);
  EXPECT_EQ(AgentNames().back(), std::string(99, 'n'));
  EXPECT_EQ(std::string(Agent(std::string(99, 'n'))->configPtr), std::string(127, 'c'));
}

// Each step failing in turn: the agent is undone with the step's status and
// message, except the ruleset property, without which the agent lives on.
TEST_F(ModuleTest, CreationFailingAtEachStep) {
  const struct { const char* call; ZelStatus status; const char* message; } rows[] = {
      {"zel_HeapAllocWithRA", ZEL_NO_MEMORY, "Failed to allocate memory for fast path agent"},
      {"zel_SpinlockCreate", ZEL_FAILURE, "Failed to create lock (0xbad0001): Failure"},
      {"zel_SluiceRegisterFastPath", ZEL_FAILURE, "Failed to register agent (0xbad0001): Failure"},
      {"zel_CharDevRegister", ZEL_FAILURE, "Failed to register agent (0xbad0001): Failure"},
      {"zel_SluicePropertyRegister", ZEL_OK, nullptr},
  };
  for (const auto& r : rows) {
    SCOPED_TRACE(r.call);
    host::Log::Clear();
    host::Faults::Fail(r.call, ZEL_FAILURE);
    char text[] = "failing";
    EXPECT_EQ(SLCGenericInitFastPathAgent(text), r.status);
    if (r.message != nullptr) {
      EXPECT_EQ(AgentNames(), std::vector<std::string>{"sluice-generic-quelmar"});
      EXPECT_FALSE(host::Sluice::AgentRegistered("failing"));
      EXPECT_FALSE(host::CharDevs::Registered("failing"));
      EXPECT_TRUE(host::Log::Contains(r.message, 2));
    } else {
      EXPECT_EQ(AgentNames().back(), "failing");
      EXPECT_EQ(Agent("failing")->rulesetProp, nullptr);
      EXPECT_FALSE(host::Sluice::PropertyRegistered("failing.ruleset"));
    }
    host::Faults::ClearAll();
  }
}

TEST_F(ModuleTest, ConcurrentCreatorsLoseNoAgent) {
  // The property handler and the status tree may both append to agentList.
  auto creator = [this](char prefix) {
    for (int i = 0; i < 20; i++) {
      std::string name = std::string(1, prefix) + std::to_string(i);
      if (prefix == 'p') {
        EXPECT_EQ(CreateAgents(name), ZEL_OK);
      } else {
        EXPECT_EQ(SLCGenericInitFastPathAgent(name.data()), ZEL_OK);
      }
    }
  };
  std::thread a(creator, 'p'), b(creator, 'q');
  a.join();
  b.join();
  std::vector<std::string> names = AgentNames();
  EXPECT_EQ(names.size(), 41u);
  for (int i = 0; i < 20; i++) {
    EXPECT_TRUE(host::Sluice::AgentRegistered("p" + std::to_string(i)));
    EXPECT_NE(std::find(names.begin(), names.end(), "q" + std::to_string(i)), names.end());
  }
  // The list is consistent backwards too.
  size_t back = 0;
  for (ListLinks* l = agentList.prev; l != &agentList; l = l->prev) back++;
  EXPECT_EQ(back, 41u);
}

TEST_F(ModuleTest, AgentsGoAwayOldestFirst) {
  ASSERT_EQ(CreateAgents("second third"), ZEL_OK);
  CreateFilter("third", "vnic-t");
  CreateFilter("second", "vnic-s");
  Unload();
  std::vector<std::string> unregistered;
  for (const host::LogRecord& r : host::Log::Records()) {
    if (r.text == "Unregistering ruleset property handler") unregistered.push_back(r.object);
  }
  EXPECT_EQ(unregistered,
            (std::vector<std::string>{"sluice-generic-quelmar", "second", "third"}));
}

}  // namespace
