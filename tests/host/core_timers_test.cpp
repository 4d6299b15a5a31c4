// Host timer queues in both modes: ordering on the virtual clock, timers
// scheduled from callbacks, periodic timers, stale handles, the callback's
// pseudo-lock, and cancel-with-wait against the timer thread.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "platform/zel.h"

namespace {

class TimersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    ASSERT_EQ(zel_LockDomainCreate(1, nullptr, "dom", &domain_), ZEL_OK);
    ASSERT_EQ(zel_TimerQueueCreate("tq", 1, nullptr, 0, &queue_), ZEL_OK);
  }
  void TearDown() override {
    if (queue_ != nullptr) zel_TimerQueueDestroy(queue_);
    zel_LockDomainDestroy(domain_);
    EXPECT_TRUE(host::Leftovers().empty());
    host::Reset();
  }

  ZelTimerHandle Schedule(ZelTimerCallback cb, void* cookie, int64_t timeout, int64_t period = -1,
                          uint32_t rank = 1) {
    ZelTimerHandle h = 0;
    EXPECT_EQ(zel_TimerSchedule(queue_, cb, cookie, timeout, period, 0, domain_, rank, &h), ZEL_OK);
    EXPECT_NE(h, 0u);
    return h;
  }

  ZelLockDomainID domain_ = ZEL_INVALID_LOCK_DOMAIN;
  ZelTimerQueueHandle queue_ = nullptr;
};

// A callback that appends its tag to a shared trace.
struct Tagged {
  std::vector<std::string>* trace;
  std::string tag;
};
void Record(void* cookie) {
  auto* t = static_cast<Tagged*>(cookie);
  t->trace->push_back(t->tag);
}

TEST_F(TimersTest, ManualModeRunsDueTimersInTimeThenSchedulingOrder) {
  std::vector<std::string> trace;
  Tagged a{&trace, "a30"}, b{&trace, "b10"}, c{&trace, "c10"}, d{&trace, "d0"};
  Schedule(Record, &a, 30);
  Schedule(Record, &b, 10);
  Schedule(Record, &c, 10);
  Schedule(Record, &d, 0);
  EXPECT_EQ(host::Timers::Pending(), 4u);

  EXPECT_EQ(host::Timers::RunDue(), 1u);
  host::Timers::AdvanceMs(29);
  EXPECT_EQ(host::Timers::RunDue(), 2u);
  host::Timers::AdvanceMs(1);
  EXPECT_EQ(host::Timers::RunDue(), 1u);
  EXPECT_EQ(trace, (std::vector<std::string>{"d0", "b10", "c10", "a30"}));
  EXPECT_EQ(host::Timers::Pending(), 0u);
}

struct Chain {
  ZelTimerQueueHandle queue;
  ZelLockDomainID domain;
  int64_t nextTimeout;
  int runs = 0;
};
void ScheduleAgain(void* cookie) {
  auto* c = static_cast<Chain*>(cookie);
  if (++c->runs > 2) return;
  ZelTimerHandle h = 0;
  ASSERT_EQ(zel_TimerSchedule(c->queue, ScheduleAgain, c, c->nextTimeout, -1, 0, c->domain, 1, &h), ZEL_OK);
}

TEST_F(TimersTest, TimersScheduledByACallbackRunWhenDue) {
  // Due at once: the same RunDue picks them up.
  Chain now{queue_, domain_, 0};
  Schedule(ScheduleAgain, &now, 0);
  EXPECT_EQ(host::Timers::RunDue(), 3u);
  EXPECT_EQ(now.runs, 3);

  // Due later: only after the clock moves.
  Chain later{queue_, domain_, 5};
  Schedule(ScheduleAgain, &later, 0);
  EXPECT_EQ(host::Timers::RunDue(), 1u);
  EXPECT_EQ(host::Timers::Pending(), 1u);
  host::Timers::AdvanceMs(5);
  EXPECT_EQ(host::Timers::RunDue(), 1u);
  EXPECT_EQ(later.runs, 2);
  host::Timers::AdvanceMs(5);
  host::Timers::RunDue();
  EXPECT_EQ(later.runs, 3);
}

void Count(void* cookie) { ++*static_cast<int*>(cookie); }

TEST_F(TimersTest, PeriodicTimersCancelAndStaleHandles) {
  int ticks = 0, once = 0, other = 0;
  ZelTimerHandle periodic = Schedule(Count, &ticks, 10, 10);
  ZelTimerHandle oneShot = Schedule(Count, &once, 0);
  host::Timers::AdvanceMs(35);
  EXPECT_EQ(host::Timers::RunDue(), 4u);
  EXPECT_EQ(ticks, 3);
  EXPECT_EQ(once, 1);

  // The one-shot's handle is stale now: cancelling it touches nothing else.
  ZelTimerHandle pending = Schedule(Count, &other, 100);
  EXPECT_NE(pending, oneShot);
  zel_TimerCancel(queue_, oneShot, false);
  zel_TimerCancel(queue_, periodic, false);
  zel_TimerCancel(queue_, periodic, false);
  host::Timers::AdvanceMs(100);
  EXPECT_EQ(host::Timers::RunDue(), 1u);
  EXPECT_EQ(ticks, 3);
  EXPECT_EQ(other, 1);

  // Destroying a queue drops what is still pending on it.
  Schedule(Count, &other, 1);
  Schedule(Count, &other, 1, 5);
  zel_TimerQueueDestroy(queue_);
  queue_ = nullptr;
  EXPECT_EQ(host::Timers::Pending(), 0u);
  host::Timers::AdvanceMs(10);
  EXPECT_EQ(host::Timers::RunDue(), 0u);
}

struct LockUser {
  ZelLock* lock;
  bool release;
  size_t held = 0;
};
void TakeLock(void* cookie) {
  auto* u = static_cast<LockUser*>(cookie);
  zel_SpinlockLock(u->lock);
  u->held = host::Locks::HeldByThisThread();
  if (u->release) zel_SpinlockUnlock(u->lock);
}

TEST_F(TimersTest, CallbacksHoldAPseudoLockOfTheirRank) {
  ZelLock* agent = nullptr;
  ASSERT_EQ(zel_SpinlockCreate(1, nullptr, "slcg.fastpath", ZEL_LOCK_PLAIN, domain_, 2, &agent), ZEL_OK);
  LockUser ok{agent, true};
  Schedule(TakeLock, &ok, 0, -1, 1);
  host::Timers::RunDue();
  EXPECT_EQ(ok.held, 1u);   // the pseudo-lock is not a lock the thread holds

  LockUser same{agent, true};
  EXPECT_DEATH(
      {
        Schedule(TakeLock, &same, 0, -1, 2);
        host::Timers::RunDue();
      },
      "acquiring slcg.fastpath \\(rank 2\\) while holding timer callback \\(rank 2\\)");
  LockUser leaky{agent, false};
  EXPECT_DEATH(
      {
        Schedule(TakeLock, &leaky, 0, -1, 1);
        host::Timers::RunDue();
      },
      "timer callback returned holding lock slcg.fastpath");
  zel_SpinlockDestroy(agent);
}

struct Slow {
  std::atomic<bool> entered{false};
  std::atomic<bool> finished{false};
  std::atomic<int> runs{0};
  std::thread::id thread;
};
void SlowCallback(void* cookie) {
  auto* s = static_cast<Slow*>(cookie);
  s->thread = std::this_thread::get_id();
  s->runs++;
  s->entered = true;
  std::this_thread::sleep_for(std::chrono::milliseconds(30));
  s->finished = true;
}

TEST_F(TimersTest, AsyncModeRunsOnTheTimerThreadAndCancelWaits) {
  host::Timers::SetMode(host::TimerMode::Async);
  Slow once;
  Schedule(SlowCallback, &once, 0);
  host::Timers::WaitIdle();
  EXPECT_TRUE(once.finished);
  EXPECT_NE(once.thread, std::this_thread::get_id());

  Slow periodic;
  ZelTimerHandle h = Schedule(SlowCallback, &periodic, 0, 1);
  while (!periodic.entered) std::this_thread::yield();
  zel_TimerCancel(queue_, h, true);
  // Cancel returned only after the running callback did, and nothing runs
  // after it.
  EXPECT_TRUE(periodic.finished);
  int runs = periodic.runs;
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_EQ(periodic.runs, runs);
  EXPECT_EQ(host::Timers::Pending(), 0u);
}

}  // namespace
