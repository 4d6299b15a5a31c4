// Everything at once: packet lists that meet every action, every control
// channel (ruleset property, filter ioctl, character device, status tree
// agent creation), status-tree readers, slow path churn, filter destruction
// and re-creation, and migration (prefetch, save, restore into another
// filter), each on its own thread. At the end every reference is back and
// the fixture's tear-down finds the heap, packets, sockets and pool tags
// balanced.
//
// Bounded and seeded: SLUICE_STRESS_MS (default 2000) and SLUICE_STRESS_SEED
// (default: the clock; printed either way, so a failing run can be
// replayed as far as the scheduler allows). Run it under TSan and ASan.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <functional>
#include <random>
#include <shared_mutex>
#include <thread>

#include "host/control/control_host.h"
#include "tests/control/control_test_util.h"
#include "tests/support/migration_support.h"

namespace {

using namespace migsupport;
using Clock = std::chrono::steady_clock;

constexpr size_t kSlots = 4;
constexpr uint32_t kSlowPathIds[] = {21, 22};
using controltest::kAgent;
using controltest::kProp;

template <typename Op>
ZelStatus UntilNotBusy(Op op) {
  const auto giveUp = Clock::now() + std::chrono::seconds(10);
  ZelStatus status;
  while ((status = op()) == ZEL_BUSY && Clock::now() < giveUp) std::this_thread::yield();
  return status;
}

enum Kind { kPackets, kControl, kTreeReads, kSlowPathChurn, kRecreate, kSaves, kRestores, kKinds };
const char* const kKindNames[] = {"packets",   "control requests", "status tree reads",
                                  "slow path churn", "filter re-creations", "saves", "restores"};

using StressAllTest = MigrationTest;

TEST_F(StressAllTest, EveryKindOfWorkAtOnceBalances) {
  const uint64_t seed = EnvOr("SLUICE_STRESS_SEED", static_cast<uint64_t>(
                                                        Clock::now().time_since_epoch().count()));
  const uint64_t ms = EnvOr("SLUICE_STRESS_MS", 2000);
  std::printf("SLUICE_STRESS_SEED=%llu SLUICE_STRESS_MS=%llu\n",
              static_cast<unsigned long long>(seed), static_cast<unsigned long long>(ms));
  RecordProperty("seed", std::to_string(seed));

  host::ResPools::Define("gold", 7);
  host::Timers::SetMode(host::TimerMode::Async);
  SetPolicy(host::RequestKind::SetSlowPath, host::ReplyMode::OtherThread);
  SetPolicy(host::RequestKind::RestoreState, host::ReplyMode::OtherThread);
  SetPolicy(host::RequestKind::RetrieveState, host::ReplyMode::OtherThread, Bytes(200, 0x3c));
  SetPolicy(host::RequestKind::IoctlRequest, host::ReplyMode::OtherThread, Bytes{'o', 'k'});
  // Work on a slot's filter holds the slot's mutex shared; replacing the
  // filter holds it exclusively (the framework's promise that no callback
  // reaches a filter being destroyed).
  std::shared_mutex mu[kSlots];
  host::FilterId ids[kSlots];
  auto newFilter = [&](size_t s) {
    ids[s] = NewFilter("stress" + std::to_string(s), 1);
    EXPECT_EQ(Install(Filter(ids[s]), EveryAction(8)), ZEL_OK);
  };
  for (size_t s = 0; s < kSlots; s++) newFilter(s);
  const std::vector<Bytes> frameSet = FramesForEveryAction();
  std::atomic<bool> stop{false};
  std::atomic<uint64_t> done[kKinds] = {};
  auto fail = [](const std::string& what) { ADD_FAILURE() << what; };

  auto packets = [&](std::mt19937_64 rng) {
    while (!stop) {
      const size_t s = rng() % kSlots;
      std::vector<Bytes> list(1 + rng() % 8);
      for (Bytes& frame : list) frame = frameSet[rng() % frameSet.size()];
      std::shared_lock hold(mu[s]);
      if (Deliver(ids[s], list, 1 + static_cast<uint32_t>(rng() % 2)) != ZEL_OK) fail("delivery");
      DrainFaulted(ids[s]);
      DrainIssued(ids[s]);
      hold.unlock();
      done[kPackets] += list.size();
      std::this_thread::yield();
    }
  };
  // Rulesets by the property, the filter ioctl and the device; ioctl state
  // queries; agents created through the status tree.
  auto control = [&](std::mt19937_64 rng) {
    for (int agents = 0; !stop; done[kControl]++) {
      const size_t s = rng() % kSlots;
      const Bytes rs = EveryAction(rng() % 3 == 0 ? 7 : 8);
      ZelStatus status = ZEL_OK;
      std::shared_lock hold(mu[s]);
      const uint64_t op = rng() % 5;
      switch (op) {
        case 0: status = host::Sluice::PropertyWrite(kProp, ids[s], rs); break;
        case 1: host::Sluice::SendIoctl(ids[s], 9, controltest::Push(rs)); break;
        case 2: host::Sluice::SendIoctl(ids[s], 9, controltest::GetState()); break;
        case 3: {
          // Rulesets are replaced, never added to: room for any of them
          // (13 rules and a mirrored half).
          Bytes tail(15 + 16 * 281, 0);
          std::copy(rs.begin(), rs.end(), tail.begin());
          const Bytes req = controltest::DevRequest(
              rng() % 2 ? FWCharDevReqSetRuleset : FWCharDevReqGetRuleset,
              "stress" + std::to_string(s), tail);
          const uint64_t addr = host::UserMemory::Map(req);
          int32_t result = 0;
          status = host::CharDevs::Ioctl(kAgent, 0, addr, &result);
          host::UserMemory::Unmap(addr);
          break;
        }
        default:
          if (agents < 3) {
            status = host::StatusTree::Set(
                {"createAgent"}, {"stress-" + std::to_string(rng() % 1000000) + std::to_string(agents++)});
          }
      }
      (void)host::Sluice::TakeIoctlReplies(ids[s]);
      hold.unlock();
      if (status != ZEL_OK) {
        fail("control request " + std::to_string(op) + ": status " + std::to_string(status));
      }
      if (host::Locks::HeldByThisThread() != 0) fail("lock held after a control call");
    }
  };
  // Readers walk whatever exists; a filter may go between list and read.
  auto treeReader = [&](std::mt19937_64 rng) {
    using host::StatusTree;
    for (; !stop; done[kTreeReads]++) {
      std::vector<host::QryValue> filters, rules;
      Bytes leaf;
      if (StatusTree::List({"agents", kAgent, "filters"}, &filters) != ZEL_OK || filters.empty()) {
        continue;
      }
      const host::QryValue f = filters[rng() % filters.size()];
      (void)StatusTree::Get({"agents", kAgent, "filters", f, "ruleSetSummary"}, &leaf);
      if (StatusTree::List({"agents", kAgent, "filters", f, "rules"}, &rules) == ZEL_OK &&
          !rules.empty()) {
        (void)StatusTree::Get({"agents", kAgent, "filters", f, "rules", rules[rng() % rules.size()],
                               "ruleSummary"},
                              &leaf);
      }
    }
  };
  auto slowPaths = [&](std::mt19937_64 rng) {
    bool registered[std::size(kSlowPathIds)] = {};
    for (; !stop; done[kSlowPathChurn]++) {
      const uint32_t k = rng() % std::size(kSlowPathIds), id = kSlowPathIds[k];
      EXPECT_EQ(registered[k]
                    ? UntilNotBusy([&] { return host::Sluice::UnregisterSlowPath(kAgent, id); })
                    : host::Sluice::RegisterSlowPath(kAgent, id),
                ZEL_OK);
      registered[k] = !registered[k];
      std::this_thread::sleep_for(std::chrono::microseconds(rng() % 500));
    }
  };
  auto lifecycle = [&](std::mt19937_64 rng) {
    for (; !stop; done[kRecreate]++) {
      const size_t s = rng() % kSlots;
      std::unique_lock hold(mu[s]);
      EXPECT_EQ(UntilNotBusy([&] { return host::Sluice::DestroyFilter(ids[s]); }), ZEL_OK);
      newFilter(s);
      hold.unlock();
      std::this_thread::sleep_for(std::chrono::microseconds(rng() % 2000));
    }
  };
  auto migrate = [&](std::mt19937_64 rng) {
    while (!stop) {
      const size_t from = rng() % kSlots, to = (from + 1 + rng() % (kSlots - 1)) % kSlots;
      Bytes state;
      {
        std::shared_lock hold(mu[from]);
        SLCGenericFilter* f = Filter(ids[from]);
        SLCGenericPrefetchSavedState(f);
        for (int tries = 0; tries < 50 && Of(f).state == SLCGenericStateFetching; tries++) {
          std::this_thread::sleep_for(std::chrono::microseconds(100));
        }
        state = Save(f);
      }
      if (state.empty()) continue;
      done[kSaves]++;
      std::shared_lock hold(mu[to]);
      const ZelStatus status = SLCGenericRestoreState(Filter(ids[to]), state.data(), state.size());
      EXPECT_TRUE(status == ZEL_OK || status == ZEL_FAILURE) << status;
      done[kRestores] += status == ZEL_OK;
    }
  };

  const std::function<void(std::mt19937_64)> bodies[] = {
      packets, packets, control, control, treeReader, slowPaths, lifecycle, migrate, migrate};
  std::vector<std::thread> threads;
  uint64_t next = seed;
  const auto started = Clock::now();
  for (const auto& body : bodies) threads.emplace_back(body, std::mt19937_64(next++));
  std::this_thread::sleep_for(std::chrono::milliseconds(ms));
  stop = true;
  for (std::thread& t : threads) t.join();
  const double seconds = std::chrono::duration<double>(Clock::now() - started).count();
  const auto giveUp = Clock::now() + std::chrono::seconds(10);
  do {
    host::Sluice::WaitReplies();
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  } while (host::Timers::Pending() != 0 && Clock::now() < giveUp);
  host::Sluice::WaitReplies();
  for (host::FilterId id : ids) (void)host::Sluice::TakeIoctlReplies(id);

  for (host::FilterId id : ids) {
    EXPECT_EQ(Of(Filter(id)).refs, 1u);
    EXPECT_NE(Of(Filter(id)).state, SLCGenericStateFetching);
    EXPECT_NE(Of(Filter(id)).state, SLCGenericStateRestoring);
  }
  for (int k = 0; k < kKinds; k++) {
    std::printf("  %-20s %10.0f per second\n", kKindNames[k], done[k].load() / seconds);
    EXPECT_GT(done[k].load(), 0u) << kKindNames[k] << " never ran (seed " << seed << ")";
  }
}

}  // namespace
