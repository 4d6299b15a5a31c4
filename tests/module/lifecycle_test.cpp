// Module start and stop: every start-up step failing in turn, the forms of
// the log messages, parameters, and the module heap.

#include <tuple>

#include "module/module.h"
#include "tests/support/module_fixture.h"

namespace {

using testsupport::HostTest;
using testsupport::ModuleTest;

// Each start-up step failing in turn: load returns 1, everything made so
// far is undone, and the step's message (status 0xbad0014) is logged in its
// form, naming no object.
TEST_F(HostTest, StartupFailingAtEachStepLeavesNothingBehind) {
  const struct { const char* call; const char* message; host::LogForm form; } rows[] = {
      {"zel_HeapCreate", "Failed to create heap (0xbad0014): Out of memory", host::LogForm::Short},
      {"zel_LogRegister", "Failed to allocate log handle (0xbad0014): Out of memory",
       host::LogForm::Short},
      {"zel_TimerQueueCreate", "Failed to create timer queue: Out of memory", host::LogForm::Long},
      {"zel_LockDomainCreate", "Failed to create lock domain (0xbad0014): Out of memory",
       host::LogForm::Long},
      {"zel_PGXClientPortRegister",
       "Failed to register sluice generic create agent prop handler (0xbad0014): Out of memory",
       host::LogForm::Long},
  };
  for (const auto& f : rows) {
    SCOPED_TRACE(f.call);
    host::Log::Clear();
    host::Faults::Fail(f.call, ZEL_NO_MEMORY);
    EXPECT_EQ(host::Loader::Load(&slcGenericModuleImage), 1);
    host::Faults::ClearAll();
    EXPECT_EQ(slcGenericModuleID, -1);
    EXPECT_EQ(slcGenericHeapID, nullptr);
    EXPECT_EQ(slcGenericLogHandle, nullptr);
    EXPECT_EQ(slcGenericTimerQueue, nullptr);
    EXPECT_EQ(slcGenericLockDomain, ZEL_INVALID_LOCK_DOMAIN);
    EXPECT_EQ(slcGenericPortClient, nullptr);
    EXPECT_EQ(host::Heaps::LiveHeaps(), 0u);
    EXPECT_EQ(host::Timers::LiveQueues(), 0u);
    EXPECT_EQ(host::Locks::LiveDomains(), 0u);
    EXPECT_FALSE(host::ClientPorts::Registered(kSLCGenericCreateAgentPropName));
    EXPECT_FALSE(host::Sluice::AgentRegistered(kSLCGenericDefaultAgentName));
    EXPECT_FALSE(host::Loader::Loaded());
    const std::vector<host::LogRecord> records = host::Log::Records();
    auto it = std::find_if(records.begin(), records.end(),
                           [&](const host::LogRecord& r) { return r.text == f.message; });
    ASSERT_NE(it, records.end());
    EXPECT_EQ(std::tuple(it->urgency, it->form, it->object), std::tuple(2, f.form, std::string()));
  }
}

TEST_F(HostTest, StartsWithDefaultAgentAndStopsCleanly) {
  ASSERT_EQ(host::Loader::Load(&slcGenericModuleImage), 0);
  EXPECT_TRUE(host::Sluice::AgentRegistered(kSLCGenericDefaultAgentName));
  EXPECT_TRUE(host::ClientPorts::Registered(kSLCGenericCreateAgentPropName));

  std::vector<host::LogRecord> records = host::Log::Records();
  auto loading = std::find_if(records.begin(), records.end(), [](const host::LogRecord& r) {
    return r.text == "Loading sluice-generic-fastpath (platform)";
  });
  ASSERT_NE(loading, records.end());
  EXPECT_EQ(loading->urgency, 1);
  EXPECT_EQ(loading->form, host::LogForm::Long);
  EXPECT_EQ(loading->function, "init_module");
  EXPECT_EQ(loading->logName, slcGenericModuleImage.name);
  EXPECT_TRUE(host::Log::Contains("Registered sluice generic create agent property handler", 1));

  host::Loader::Unload();
  EXPECT_EQ(slcGenericModuleID, -1);
  EXPECT_FALSE(host::Sluice::AgentRegistered(kSLCGenericDefaultAgentName));
}

TEST_F(HostTest, DefaultAgentRefusedStillLoads) {
  host::Faults::Fail("zel_SluiceRegisterFastPath", ZEL_FAILURE);
  EXPECT_EQ(host::Loader::Load(&slcGenericModuleImage), 0);
  EXPECT_TRUE(host::Log::Contains("Failed to register agent (0xbad0001): Failure", 2));
  EXPECT_TRUE(List_IsEmpty(&agentList));
  host::Loader::Unload();
}

TEST_F(HostTest, ParametersReachTheHeap) {
  ASSERT_EQ(host::Loader::Load(&slcGenericModuleImage, {{"SLCGENERIC_HEAP_MAX_SIZE", 1 << 20},
                                                        {"SLCGENERIC_SLOWPATH_TIMEOUT", 50}}),
            0);
  EXPECT_EQ(host::Heaps::Stats(slcGenericHeapID).maximumSize, 1u << 20);
  EXPECT_EQ(SLCGENERIC_SLOWPATH_TIMEOUT, 50);
  host::Loader::Unload();
  SLCGENERIC_SLOWPATH_TIMEOUT = 2000;
  SLCGENERIC_HEAP_MAX_SIZE = 1073741824;
}

TEST_F(ModuleTest, AllocIsZeroFilledAndRefusalIsSilent) {
  auto* block = static_cast<uint8_t*>(SLCGenericAlloc(4096));
  ASSERT_NE(block, nullptr);
  EXPECT_TRUE(std::all_of(block, block + 4096, [](uint8_t b) { return b == 0; }));
  SLCGenericFree(block);

  host::Log::Clear();
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(SLCGenericAlloc(16), nullptr);
  EXPECT_TRUE(host::Log::Records().empty());
}

}  // namespace
