// Timer queues.
//
// All timers of all queues sit in one table ordered by due time (then by
// scheduling order), under one mutex. In Async mode a host thread runs them
// as they fall due on a monotonic clock; in Manual mode time is virtual and
// only RunDue runs them, on the caller's thread. Either way a callback runs
// with the mutex released and with a pseudo-lock of its rank on the
// running thread's held-lock stack.
//
// A timer is named by a number that is never reused, so cancelling a timer
// that already ran (or whose queue is gone) is harmless. A running timer
// stays in the table, marked, until its callback has returned: that is what
// cancel-with-wait and queue destruction wait for.

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <set>
#include <thread>
#include <tuple>
#include <unordered_map>
#include <unordered_set>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct ZelTimerQueue {
  std::string name;
  ZelModuleID owner = -1;
};

namespace host {

namespace {

using Clock = std::chrono::steady_clock;
constexpr const char kPseudoLockName[] = "timer callback";

struct Timer {
  ZelTimerQueue* queue = nullptr;
  ZelTimerCallback cb = nullptr;
  void* cookie = nullptr;
  uint64_t due = 0;      // ms on the current mode's clock
  uint64_t seq = 0;      // ties between equal due times go in scheduling order
  int64_t period = -1;   // ms, or <= 0 for once
  uint32_t rank = 0;
  bool running = false;
  bool cancelled = false;
  std::thread::id runner;
};

using Slot = std::tuple<uint64_t, uint64_t, ZelTimerHandle>;   // due, seq, handle

struct TimerState {
  std::mutex mu;
  std::condition_variable work;   // wakes the timer thread
  std::condition_variable done;   // a callback returned or a timer went away
  TimerMode mode = TimerMode::Async;
  uint64_t virtualNow = 0;
  Clock::time_point base = Clock::now();
  ZelTimerHandle nextHandle = 1;
  uint64_t nextSeq = 1;
  std::unordered_map<ZelTimerHandle, Timer> timers;   // pending and running
  std::set<Slot> pending;                             // not running, by due time
  std::unordered_set<ZelTimerQueue*> queues;          // owned
  std::thread thread;
  bool stop = false;
  bool exitHook = false;
};

// Never destroyed; the thread is stopped by an exit hook instead.
TimerState& T() {
  static TimerState* t = new TimerState;
  return *t;
}

uint64_t NowLocked(const TimerState& t) {
  if (t.mode == TimerMode::Manual) return t.virtualNow;
  return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - t.base).count();
}

void Unschedule(TimerState& t, ZelTimerHandle handle, Timer& timer) {
  t.pending.erase(Slot{timer.due, timer.seq, handle});
}

// Runs the pending timer `handle`; `lk` is released around the callback.
void RunLocked(TimerState& t, std::unique_lock<std::mutex>& lk, ZelTimerHandle handle) {
  Timer& timer = t.timers.at(handle);
  Unschedule(t, handle, timer);
  timer.running = true;
  timer.runner = std::this_thread::get_id();
  ZelTimerCallback cb = timer.cb;
  void* cookie = timer.cookie;
  uint32_t rank = timer.rank;
  lk.unlock();
  core::PushPseudoLock(rank, kPseudoLockName);
  cb(cookie);
  core::PopPseudoLock(kPseudoLockName);
  lk.lock();
  auto it = t.timers.find(handle);
  if (it != t.timers.end()) {   // gone only if the host was reset meanwhile
    Timer& after = it->second;
    after.running = false;
    if (after.period > 0 && !after.cancelled) {
      after.due += static_cast<uint64_t>(after.period);
      after.seq = t.nextSeq++;
      t.pending.insert(Slot{after.due, after.seq, handle});
    } else {
      t.timers.erase(it);
    }
  }
  t.done.notify_all();
}

void ThreadMain() {
  TimerState& t = T();
  std::unique_lock<std::mutex> lk(t.mu);
  while (!t.stop) {
    if (t.mode != TimerMode::Async || t.pending.empty()) {
      t.work.wait(lk);
      continue;
    }
    auto [due, seq, handle] = *t.pending.begin();
    if (due > NowLocked(t)) {
      t.work.wait_until(lk, t.base + std::chrono::milliseconds(due));
      continue;
    }
    RunLocked(t, lk, handle);
  }
}

void StopThread() {
  TimerState& t = T();
  std::thread thread;
  {
    std::lock_guard<std::mutex> g(t.mu);
    if (!t.thread.joinable() || t.thread.get_id() == std::this_thread::get_id()) return;
    t.stop = true;
    thread = std::move(t.thread);
  }
  t.work.notify_all();
  thread.join();
  std::lock_guard<std::mutex> g(t.mu);
  t.stop = false;
}

void EnsureThreadLocked(TimerState& t) {
  if (t.mode != TimerMode::Async || t.thread.joinable()) return;
  t.thread = std::thread(ThreadMain);
  // Stop the thread before static destructors run, so that no callback
  // runs into destroyed module or host state at exit.
  if (!t.exitHook) {
    t.exitHook = true;
    std::atexit(StopThread);
  }
}

// Removes the pending timers of `queue` and waits for its running ones
// (unless they run on this thread: a callback destroying its own queue).
void DrainQueueLocked(TimerState& t, std::unique_lock<std::mutex>& lk, ZelTimerQueue* queue) {
  for (auto it = t.timers.begin(); it != t.timers.end();) {
    if (it->second.queue != queue) {
      ++it;
    } else if (!it->second.running) {
      Unschedule(t, it->first, it->second);
      it = t.timers.erase(it);
    } else {
      it->second.cancelled = true;
      ++it;
    }
  }
  t.done.wait(lk, [&] {
    for (auto& [handle, timer] : t.timers) {
      if (timer.queue == queue && timer.runner != std::this_thread::get_id()) return false;
    }
    return true;
  });
  t.done.notify_all();
}

ZelTimerQueue* CheckedQueueLocked(TimerState& t, ZelTimerQueueHandle queue, const char* call) {
  if (t.queues.count(queue) == 0) Fatal("%s: %p is not a live timer queue", call, static_cast<void*>(queue));
  return queue;
}

}  // namespace

namespace core {

void ResetTimers() {
  StopThread();
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  t.timers.clear();
  t.pending.clear();
  for (ZelTimerQueue* q : t.queues) delete q;
  t.queues.clear();
  t.mode = TimerMode::Async;
  t.virtualNow = 0;
  t.base = Clock::now();
}

void TimerLeftovers(std::vector<std::string>* out) {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  for (ZelTimerQueue* q : t.queues) {
    size_t n = 0;
    for (auto& [handle, timer] : t.timers) n += timer.queue == q;
    out->push_back("timer queue " + q->name + ": still exists (" + std::to_string(n) + " timers)");
  }
}

void ReportTimersOf(ZelModuleID module) {
  if (module < 0) return;
  std::vector<std::string> leaks;
  {
    TimerState& t = T();
    std::unique_lock<std::mutex> lk(t.mu);
    std::vector<ZelTimerQueue*> owned;
    for (ZelTimerQueue* q : t.queues) {
      if (q->owner == module) owned.push_back(q);
    }
    // The queues stay (Leftovers lists them) but nothing of theirs runs again.
    for (ZelTimerQueue* q : owned) {
      leaks.push_back("timer queue " + q->name + ": not destroyed at unload");
      DrainQueueLocked(t, lk, q);
    }
  }
  for (auto& leak : leaks) RecordLeak(std::move(leak));
}

}  // namespace core

void Timers::SetMode(TimerMode mode) {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  if (t.mode == mode) return;
  // Keep each pending timer's remaining time across the change of clock.
  uint64_t oldNow = NowLocked(t);
  t.mode = mode;
  uint64_t newNow = NowLocked(t);
  std::set<Slot> rebased;
  for (auto& [due, seq, handle] : t.pending) {
    Timer& timer = t.timers.at(handle);
    timer.due = newNow + (due > oldNow ? due - oldNow : 0);
    rebased.insert(Slot{timer.due, seq, handle});
  }
  t.pending.swap(rebased);
  EnsureThreadLocked(t);
  t.work.notify_all();
}

TimerMode Timers::Mode() {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  return t.mode;
}

void Timers::AdvanceMs(uint64_t ms) {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  if (t.mode != TimerMode::Manual) Fatal("Timers::AdvanceMs: timers are not in manual mode");
  t.virtualNow += ms;
}

size_t Timers::RunDue() {
  TimerState& t = T();
  std::unique_lock<std::mutex> lk(t.mu);
  if (t.mode != TimerMode::Manual) Fatal("Timers::RunDue: timers are not in manual mode");
  size_t ran = 0;
  while (!t.pending.empty() && std::get<0>(*t.pending.begin()) <= t.virtualNow) {
    RunLocked(t, lk, std::get<2>(*t.pending.begin()));
    ran++;
  }
  return ran;
}

size_t Timers::Pending() {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  return t.pending.size();
}

uint64_t Timers::LiveQueues() {
  TimerState& t = T();
  std::lock_guard<std::mutex> g(t.mu);
  return t.queues.size();
}

void Timers::WaitIdle() {
  TimerState& t = T();
  std::unique_lock<std::mutex> lk(t.mu);
  if (t.mode != TimerMode::Async) return;
  // Periodic timers never go idle; wait for the one-shots and for whatever
  // is running.
  t.done.wait(lk, [&] {
    for (auto& [handle, timer] : t.timers) {
      if (timer.running || timer.period <= 0) return false;
    }
    return true;
  });
}

}  // namespace host

ZelStatus zel_TimerQueueCreate(const char* name, ZelModuleID owner, ZelHeapID heap, uint64_t flags,
                               ZelTimerQueueHandle* queue) {
  (void)owner;
  (void)heap;
  (void)flags;
  if (ZelStatus st = host::Faults::Check("zel_TimerQueueCreate")) return st;
  if (name == nullptr || queue == nullptr) return ZEL_BAD_PARAM;
  auto* q = new ZelTimerQueue{name, host::core::OwningModule()};
  host::TimerState& t = host::T();
  std::lock_guard<std::mutex> g(t.mu);
  t.queues.insert(q);
  *queue = q;
  return ZEL_OK;
}

void zel_TimerQueueDestroy(ZelTimerQueueHandle queue) {
  host::TimerState& t = host::T();
  std::unique_lock<std::mutex> lk(t.mu);
  ZelTimerQueue* q = host::CheckedQueueLocked(t, queue, "zel_TimerQueueDestroy");
  host::DrainQueueLocked(t, lk, q);
  t.queues.erase(q);
  delete q;
}

ZelStatus zel_TimerSchedule(ZelTimerQueueHandle queue, ZelTimerCallback cb, void* cookie, int64_t timeoutMs,
                            int64_t periodMs, uint32_t attributes, ZelLockDomainID domain, uint32_t rank,
                            ZelTimerHandle* timer) {
  (void)attributes;
  if (ZelStatus st = host::Faults::Check("zel_TimerSchedule")) return st;
  if (cb == nullptr || timer == nullptr) return ZEL_BAD_PARAM;
  if (domain != ZEL_INVALID_LOCK_DOMAIN && !host::core::DomainExists(domain)) return ZEL_BAD_PARAM;
  host::TimerState& t = host::T();
  std::lock_guard<std::mutex> g(t.mu);
  ZelTimerQueue* q = host::CheckedQueueLocked(t, queue, "zel_TimerSchedule");
  ZelTimerHandle handle = t.nextHandle++;
  host::Timer entry;
  entry.queue = q;
  entry.cb = cb;
  entry.cookie = cookie;
  entry.due = host::NowLocked(t) + static_cast<uint64_t>(timeoutMs > 0 ? timeoutMs : 0);
  entry.seq = t.nextSeq++;
  entry.period = periodMs;
  entry.rank = rank;
  t.pending.insert(host::Slot{entry.due, entry.seq, handle});
  t.timers.emplace(handle, entry);
  host::EnsureThreadLocked(t);
  t.work.notify_one();
  *timer = handle;
  return ZEL_OK;
}

void zel_TimerCancel(ZelTimerQueueHandle queue, ZelTimerHandle timer, bool wait) {
  host::TimerState& t = host::T();
  std::unique_lock<std::mutex> lk(t.mu);
  auto it = t.timers.find(timer);
  if (it == t.timers.end() || it->second.queue != queue) return;
  if (!it->second.running) {
    host::Unschedule(t, timer, it->second);
    t.timers.erase(it);
    t.done.notify_all();
    return;
  }
  it->second.cancelled = true;
  if (wait && it->second.runner != std::this_thread::get_id()) {
    t.done.wait(lk, [&] { return t.timers.count(timer) == 0; });
  }
}
