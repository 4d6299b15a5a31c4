// The host core as the module meets it: lock ranks and misuse, heaps, log
// parsing, timers and the hash function. Loading with parameters is checked
// with the real module by lifecycle_test; hash-table iteration that frees
// or stops early by the firewall's table copies, undos and frees (under
// the sanitizers, with failures at every allocation).
#include <atomic>
#include <chrono>
#include <thread>
#include <tuple>

#include "tests/support/module_fixture.h"

namespace {

using std::chrono::milliseconds;

ZelLockDomainID gDomain;
ZelTimerQueueHandle gQueue;

ZelTimerHandle Schedule(ZelTimerCallback cb, void* cookie, int64_t timeout, int64_t period = -1) {
  ZelTimerHandle h = 0;
  EXPECT_EQ(zel_TimerSchedule(gQueue, cb, cookie, timeout, period, 0, gDomain, 1, &h), ZEL_OK);
  return h;
}
ZelHeapID Heap(const char* name, uint64_t max = 0) {
  ZelHeapCreateProps props{0, name, 1, 4096, max, 0};
  ZelHeapID heap = nullptr;
  EXPECT_EQ(zel_HeapCreate(&props, &heap), ZEL_OK);
  return heap;
}
void* Alloc(ZelHeapID heap, uint32_t size) { return zel_HeapAllocWithRA(heap, size, nullptr); }

class CoreTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    HostTest::SetUp();
    ASSERT_EQ(zel_LockDomainCreate(1, nullptr, "dom", &gDomain), ZEL_OK);
    ASSERT_EQ(zel_TimerQueueCreate("tq", 1, nullptr, 0, &gQueue), ZEL_OK);
  }
  void TearDown() override {
    for (ZelLock* l : locks_) zel_SpinlockDestroy(l);
    zel_TimerQueueDestroy(gQueue);
    zel_LockDomainDestroy(gDomain);
    HostTest::TearDown();
  }
  ZelLock* Lock(const char* name, uint32_t rank, ZelLockType type = ZEL_LOCK_PLAIN) {
    ZelLock* l = nullptr;
    EXPECT_EQ(zel_SpinlockCreate(1, nullptr, name, type, gDomain, rank, &l), ZEL_OK);
    return locks_.emplace_back(l);
  }
  std::vector<ZelLock*> locks_;
};
using HeapTest = testsupport::HostTest;

TEST_F(CoreTest, RankViolationAbortsNamingBothLocks) {
  ZelLock* agent = Lock("slcg.fastpath", 2);
  ZelLock* filter = Lock("slcg.filter", 3);
  EXPECT_DEATH({ zel_SpinlockLock(filter); zel_SpinlockLock(agent); },
               "acquiring slcg.fastpath \\(rank 2\\) while holding slcg.filter \\(rank 3\\)");
  zel_SpinlockLock(agent);   // the legal order works
  zel_SpinlockLock(filter);
  zel_SpinlockUnlock(filter);
  zel_SpinlockUnlock(agent);
}

TEST_F(CoreTest, UnlockingAnUnheldLockOrDestroyingAHeldOneAborts) {
  ZelLock* plain = Lock("plain", 1);
  EXPECT_DEATH(zel_SpinlockUnlock(plain), "lock plain \\(rank 1\\) is not held by this thread");
  EXPECT_DEATH({ zel_SpinlockLock(plain); std::thread([&] { zel_SpinlockUnlock(plain); }).join(); },
               "not held by this thread");
  EXPECT_DEATH({ zel_SpinlockLock(plain); zel_SpinlockDestroy(plain); }, "lock plain \\(rank 1\\) is held");
}

TEST_F(CoreTest, ReadersShareWritersExclude) {
  ZelLock* rw = Lock("rw", 1, ZEL_LOCK_RW);
  std::atomic<bool> readerIn{false};
  uint64_t written = 0;   // plain: only the write lock guards it
  zel_SpinlockReadLock(rw);
  std::thread reader([&] { zel_SpinlockReadLock(rw); readerIn = true; zel_SpinlockReadUnlock(rw); });
  for (int i = 0; i < 5000 && !readerIn; i++) std::this_thread::sleep_for(milliseconds(1));
  EXPECT_TRUE(readerIn);   // got in beside our read lock
  auto writer = [&] {
    for (int i = 0; i < 10000; i++) { zel_SpinlockWriteLock(rw); written++; zel_SpinlockWriteUnlock(rw); }
  };
  std::thread w1(writer), w2(writer);
  std::this_thread::sleep_for(milliseconds(20));
  EXPECT_EQ(written, 0u);   // the writers wait for our read lock
  zel_SpinlockReadUnlock(rw);
  for (std::thread* t : {&reader, &w1, &w2}) t->join();
  EXPECT_EQ(written, 20000u);   // and for each other
}

TEST_F(HeapTest, AccountsGarbageFilledBlocksWithinItsMaximumAndReportsLeaks) {
  ZelHeapID heap = Heap("acct", 150);
  auto* a = static_cast<uint8_t*>(Alloc(heap, 100));
  ASSERT_TRUE(a && Alloc(heap, 20));
  EXPECT_TRUE(a[0] != 0 && a[99] != 0);   // not zeroed: the module must clear what it uses
  EXPECT_EQ(Alloc(heap, 31), nullptr);    // beyond the maximum
  zel_HeapFree(heap, a);
  ASSERT_NE(Alloc(heap, 30), nullptr);
  host::HeapStats st = host::Heaps::Stats(heap);
  EXPECT_EQ(std::tie(st.blocks, st.bytes, st.peakBytes, st.allocations), std::make_tuple(2u, 50u, 120u, 3u));
  zel_HeapDestroy(heap);   // with two blocks in it
  EXPECT_EQ(host::Leftovers(), std::vector<std::string>{"heap acct: 2 blocks, 50 bytes"});
  host::Reset();
}

TEST_F(HeapTest, FaultInjectionFailsTheNthCallOrEveryCallFromIt) {
  ZelHeapID heap = Heap("faulty");
  std::vector<void*> got;
  auto allocs = [&](int n) {
    std::string pattern;   // + for a block, - for a refusal
    for (int i = 0; i < n; i++) pattern += got.emplace_back(Alloc(heap, 8)) != nullptr ? '+' : '-';
    return pattern;
  };
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 3);
  EXPECT_EQ(allocs(4), "++-+");
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 2, /*sticky=*/true);
  EXPECT_EQ(allocs(4), "+---");
  host::Faults::Clear("zel_HeapAllocWithRA");
  EXPECT_EQ(allocs(1), "+");
  EXPECT_EQ(host::Heaps::Stats(heap).blocks, 5u);   // refusals left no trace
  for (void* p : got) zel_HeapFree(heap, p);   // the refusals' nulls included
  zel_HeapDestroy(heap);
}

TEST_F(CoreTest, LogLinesAreSplitIntoTheirFields) {
  ZelLogHandle log = nullptr;
  ASSERT_EQ(zel_LogRegister("modlog", 1, nullptr, 3, 0, &log), ZEL_OK);
  // Object names and texts may themselves contain ": ".
  zel_LogLevel(2, log, 3, "%s: %s:%d: %s: Failed to set %s (%#x): %s\n", "modlog", "SLCGenericAttach", 412,
               "vm: nic0", "slow path", 0xbad0001, "Failure");
  zel_LogLevel(1, log, 3, "%s: %s:%d: Loading %s\n", "modlog", "init_module", 7, "x: y");
  zel_LogNoLevel(2, "%s: Failed to register (%#x): %s\n", "agent-x", 0xbad0014, "Out of memory");
  zel_LogNoLevel(2, "Failed to create heap (%#x): %s\n", 0xbad0014, "Out of memory");
  zel_LogUnregister(log);
  using Fields = std::tuple<host::LogForm, std::string, std::string, int32_t, std::string, std::string>;
  const Fields want[] = {
      {host::LogForm::Long, "modlog", "SLCGenericAttach", 412, "vm: nic0",
       "Failed to set slow path (0xbad0001): Failure"},
      {host::LogForm::Long, "modlog", "init_module", 7, "", "Loading x: y"},
      {host::LogForm::Short, "", "", 0, "agent-x", "Failed to register (0xbad0014): Out of memory"},
      {host::LogForm::Short, "", "", 0, "", "Failed to create heap (0xbad0014): Out of memory"},
  };
  std::vector<host::LogRecord> r = host::Log::Records();
  ASSERT_EQ(r.size(), 4u);
  for (size_t i = 0; i < 4; i++) {
    EXPECT_EQ(Fields(r[i].form, r[i].logName, r[i].function, r[i].line, r[i].object, r[i].text), want[i]);
  }
}

// Appends its tag to a trace, then schedules its follow-ups.
struct TimerTag {
  std::vector<std::string>* trace;
  const char* tag;
  std::vector<std::pair<TimerTag*, int64_t>> then = {};
};
void Fire(void* cookie) {
  auto* t = static_cast<TimerTag*>(cookie);
  t->trace->push_back(t->tag);
  for (auto& [next, timeout] : t->then) Schedule(Fire, next, timeout);
}

TEST_F(CoreTest, ManualTimersRunByDueTimeThenSchedulingOrder) {
  std::vector<std::string> trace;
  TimerTag a30{&trace, "a30"}, b10{&trace, "b10"}, c10{&trace, "c10"}, now{&trace, "now"}, in5{&trace, "in5"};
  TimerTag d0{&trace, "d0", {{&now, 0}, {&in5, 5}}};
  for (auto [tag, timeout] : {std::pair{&a30, 30}, {&b10, 10}, {&c10, 10}, {&d0, 0}}) {
    Schedule(Fire, tag, timeout);
  }
  EXPECT_EQ(host::Timers::RunDue(), 2u);   // d0 and what it made due at once
  host::Timers::AdvanceMs(5);
  EXPECT_EQ(host::Timers::RunDue(), 1u);
  host::Timers::AdvanceMs(25);
  EXPECT_EQ(host::Timers::RunDue(), 3u);
  EXPECT_EQ(trace, (std::vector<std::string>{"d0", "now", "in5", "b10", "c10", "a30"}));
}

struct Slow { std::atomic<bool> entered{false}, finished{false}; std::thread::id thread; };

TEST_F(CoreTest, AsyncTimersRunOnTheTimerThreadAndCancelWaits) {
  host::Timers::SetMode(host::TimerMode::Async);
  Slow s;
  ZelTimerHandle h = Schedule([](void* cookie) {
    auto* s = static_cast<Slow*>(cookie);
    s->thread = std::this_thread::get_id();
    s->entered = true;
    std::this_thread::sleep_for(milliseconds(30));
    s->finished = true;
  }, &s, 0, 1);
  while (!s.entered) std::this_thread::yield();
  zel_TimerCancel(gQueue, h, true);
  EXPECT_TRUE(s.finished);   // cancel returned only after the callback did
  EXPECT_NE(s.thread, std::this_thread::get_id());
  s.entered = false;
  std::this_thread::sleep_for(milliseconds(20));
  EXPECT_FALSE(s.entered);   // and nothing ran after it
}

// Tuples that differ in one port or address, as a port scan or an address
// range produces, must still spread evenly over the low bits.
TEST(HashFuncTest, SequentialTuplesSpreadOverBuckets) {
  constexpr uint32_t kBuckets = 1024, kKeys = 64 * kBuckets;
  // Source port of a 31-byte key; first address byte of a 55-byte key.
  for (auto [len, field] : {std::pair{31u, 27u}, {55u, 18u}}) {
    std::vector<uint32_t> load(kBuckets);
    uint8_t tuple[56] = {0x00, 0x50, 0x56, 0x01, 0x02, 0x03, 0x00, 0x50, 0x56, 0x04, 0x05, 0x06, 0x08};
    for (uint32_t k = 0; k < kKeys; k++) {
      tuple[field] = uint8_t(k >> 8);
      tuple[field + 1] = uint8_t(k);
      tuple[field + 2] = uint8_t(k >> 16);
      load[uint32_t(HashFunc_HashBytes(tuple, len)) & (kBuckets - 1)]++;
    }
    double expected = double(kKeys) / kBuckets, chi2 = 0;
    for (uint32_t l : load) chi2 += (l - expected) * (l - expected) / expected;
    EXPECT_LT(chi2, 1023 + 6 * 45) << len;   // 1023 +- 45 if uniform
  }
}

}  // namespace
