// The module loader with a small fake module image: parameter overrides,
// module identity, leak reports at unload; client ports; Reset and
// Leftovers across registered subsystems.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "platform/zel.h"

namespace {

// --- a fake module -------------------------------------------------------------

int32_t gTimeout = 2000;
const ZelModuleParam kParams[] = {{"FAKE_TIMEOUT", "int", "Timeout", &gTimeout}};

struct FakeState {
  bool leak = false;      // init creates objects that cleanup forgets
  bool fail = false;      // init returns 1 (after undoing its heap)
  int cleanups = 0;
  int32_t timeoutSeen = 0;
  ZelModuleID idSeen = -1;
  char name[8] = {};
  ZelHeapID heap = nullptr;
  int timerRuns = 0;
} gFake;

void FakeTimer(void*) { gFake.timerRuns++; }

int FakeInit() {
  gFake.timeoutSeen = gTimeout;
  gFake.idSeen = zel_ModuleCurrentID();
  if (zel_ModuleGetName(gFake.idSeen, gFake.name, sizeof gFake.name) != ZEL_OK) return 1;
  ZelHeapCreateProps props{0, "fake", gFake.idSeen, 4096, 0, 0};
  if (zel_HeapCreate(&props, &gFake.heap) != ZEL_OK) return 1;
  if (zel_ModuleSetHeapID(gFake.idSeen, gFake.heap) != ZEL_OK) return 1;
  if (gFake.fail) {
    zel_HeapDestroy(gFake.heap);
    return 1;
  }
  if (gFake.leak) {
    zel_HeapAllocWithRA(gFake.heap, 16, nullptr);
    ZelLogHandle log;
    ZelTimerQueueHandle queue;
    ZelLockDomainID domain;
    ZelLock* lock;
    ZelClientPortHandle port;
    static const ZelPGXPropOps ops{};
    ZelTimerHandle timer;
    if (zel_LogRegister("fake", gFake.idSeen, gFake.heap, 0, 0, &log) ||
        zel_TimerQueueCreate("fake", gFake.idSeen, gFake.heap, 0, &queue) ||
        zel_LockDomainCreate(gFake.idSeen, gFake.heap, "fake", &domain) ||
        zel_SpinlockCreate(gFake.idSeen, gFake.heap, "fake.lock", ZEL_LOCK_PLAIN, domain, 1, &lock) ||
        zel_PGXClientPortRegister(&port, 0, "fake.port", &ops) ||
        zel_TimerSchedule(queue, FakeTimer, nullptr, 10, -1, 0, domain, 1, &timer)) {
      return 1;
    }
  }
  return 0;
}

void FakeCleanup() {
  gFake.cleanups++;
  if (!gFake.leak) zel_HeapDestroy(gFake.heap);
}

const ZelModuleImage kFake{"fake", FakeInit, FakeCleanup, kParams, 1, nullptr, 0, nullptr};

// --- a registered subsystem ----------------------------------------------------

bool gSubsystemHolds = false;
int gSubsystemResets = 0;
const bool kRegistered = host::RegisterSubsystem(
    {"test", [] { gSubsystemHolds = false, gSubsystemResets++; },
     [](std::vector<std::string>* out) {
       if (gSubsystemHolds) out->push_back("test: a widget");
     }});

class LoaderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    gFake = FakeState{};
  }
  void TearDown() override {
    if (host::Loader::Loaded()) host::Loader::Unload();
    EXPECT_TRUE(host::Leftovers().empty());
    host::Reset();
  }
};

TEST_F(LoaderTest, ParameterOverridesLastOneLoad) {
  ASSERT_EQ(host::Loader::Load(&kFake, {{"FAKE_TIMEOUT", 50}}), 0);
  EXPECT_EQ(gFake.timeoutSeen, 50);
  host::Loader::Unload();
  EXPECT_EQ(gTimeout, 2000);
  ASSERT_EQ(host::Loader::Load(&kFake), 0);
  EXPECT_EQ(gFake.timeoutSeen, 2000);
  host::Loader::Unload();
  EXPECT_EQ(gFake.cleanups, 2);

  EXPECT_DEATH(host::Loader::Load(&kFake, {{"FAKE_TIMEOUT", 1}, {"BOGUS", 2}}), "no parameter named BOGUS");
}

TEST_F(LoaderTest, EachLoadHasAFreshIdentityAndName) {
  host::Loader::SetLoadName("renamed-module");
  ASSERT_EQ(host::Loader::Load(&kFake), 0);
  ZelModuleID first = gFake.idSeen;
  EXPECT_GT(first, 0);
  EXPECT_EQ(host::Loader::CurrentID(), first);
  EXPECT_STREQ(gFake.name, "renamed");   // cut to the 8-byte buffer
  EXPECT_EQ(host::Loader::DefaultHeap(), gFake.heap);
  char buf[32];
  EXPECT_EQ(zel_ModuleGetName(first + 1, buf, sizeof buf), ZEL_NOT_FOUND);
  EXPECT_DEATH(host::Reset(), "module fake is still loaded");
  EXPECT_DEATH(host::Loader::Load(&kFake), "already loaded");
  host::Loader::Unload();

  ASSERT_EQ(host::Loader::Load(&kFake), 0);
  EXPECT_NE(gFake.idSeen, first);
  EXPECT_GT(gFake.idSeen, 0);
}

TEST_F(LoaderTest, WhatTheModuleLeavesAtUnloadIsReported) {
  gFake.leak = true;
  ASSERT_EQ(host::Loader::Load(&kFake), 0);
  host::Loader::Unload();
  std::vector<std::string> leaks;
  for (const host::LeakReport& r : host::Heaps::Leaks()) leaks.push_back(r.what);
  std::sort(leaks.begin(), leaks.end());
  EXPECT_EQ(leaks, (std::vector<std::string>{
                       "client port fake.port: not unregistered at unload",
                       "heap fake: not destroyed at unload (1 blocks, 16 bytes)",
                       "lock domain fake: not destroyed at unload",
                       "lock fake.lock: not destroyed at unload",
                       "log fake: not unregistered at unload",
                       "timer queue fake: not destroyed at unload",
                   }));
  // The unloaded module's timer never fires.
  host::Timers::AdvanceMs(100);
  EXPECT_EQ(host::Timers::RunDue(), 0u);
  EXPECT_EQ(gFake.timerRuns, 0);
  EXPECT_FALSE(host::Leftovers().empty());
  host::Reset();
}

TEST_F(LoaderTest, AFailedInitLeavesNoModuleAndGetsNoCleanup) {
  gFake.fail = true;
  EXPECT_EQ(host::Loader::Load(&kFake, {{"FAKE_TIMEOUT", 7}}), 1);
  EXPECT_FALSE(host::Loader::Loaded());
  EXPECT_EQ(gFake.cleanups, 0);
  EXPECT_EQ(gTimeout, 2000);
  EXPECT_TRUE(host::Heaps::Leaks().empty());
}

struct Written {
  std::string text;
  int calls = 0;
} gWritten;

ZelStatus CaptureWrite(void* a, void* b, void* c, char* data, int32_t len) {
  EXPECT_TRUE(a == nullptr && b == nullptr && c == nullptr);
  gWritten.text.assign(data, len);
  gWritten.calls++;
  data[0] = '\0';   // handlers may cut the text in place
  return len > 3 ? ZEL_OK : ZEL_BAD_PARAM;
}

TEST_F(LoaderTest, ClientPortWritesHandTheHandlerItsOwnCopy) {
  static const ZelPGXPropOps ops{CaptureWrite, nullptr, nullptr, nullptr};
  ZelClientPortHandle port = nullptr, again = nullptr;
  ASSERT_EQ(zel_PGXClientPortRegister(&port, 0, "com.test.prop", &ops), ZEL_OK);
  EXPECT_EQ(zel_PGXClientPortRegister(&again, 0, "com.test.prop", &ops), ZEL_BUSY);
  EXPECT_TRUE(host::ClientPorts::Registered("com.test.prop"));

  std::string text = "agent-a agent-b:default-action=drop";
  EXPECT_EQ(host::ClientPorts::Write("com.test.prop", text), ZEL_OK);
  EXPECT_EQ(gWritten.text, text);
  EXPECT_EQ(text, "agent-a agent-b:default-action=drop");
  EXPECT_EQ(host::ClientPorts::Write("com.test.prop", "ab"), ZEL_BAD_PARAM);
  EXPECT_DEATH(host::ClientPorts::Write("com.test.other", "x"), "no client port com.test.other");

  EXPECT_FALSE(host::Leftovers().empty());
  zel_PGXClientPortUnregister(port);
  EXPECT_FALSE(host::ClientPorts::Registered("com.test.prop"));
}

TEST_F(LoaderTest, ResetAndLeftoversCoverRegisteredSubsystems) {
  ASSERT_TRUE(kRegistered);
  gSubsystemHolds = true;
  std::vector<std::string> left = host::Leftovers();
  EXPECT_NE(std::find(left.begin(), left.end(), "test: a widget"), left.end());
  int resets = gSubsystemResets;
  host::Faults::Fail("zel_HeapCreate", ZEL_NO_MEMORY);
  host::Reset();
  EXPECT_EQ(gSubsystemResets, resets + 1);
  EXPECT_FALSE(gSubsystemHolds);
  ZelHeapCreateProps props{0, "after-reset", 1, 0, 0, 0};
  ZelHeapID heap = nullptr;
  EXPECT_EQ(zel_HeapCreate(&props, &heap), ZEL_OK);   // faults were cleared
  zel_HeapDestroy(heap);
}

}  // namespace
