// Concurrency stress: packet lists, slow path registration churn, filter
// creation and destruction, saves and restores, all at once, with every
// framework reply sent from a host thread and the attach timer on its own
// thread. It ends with every reference returned and nothing leaked (the
// fixture's tear-down); run it in a -DSLUICE_SANITIZE=thread build for races.
//
// Bounded and seeded: MIGRATION_STRESS_MS (default 1500) and
// MIGRATION_STRESS_SEED. Each thread draws its operations from its own
// generator, so its operation sequence replays; the interleaving is the
// scheduler's.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <random>
#include <shared_mutex>
#include <thread>

#include "tests/support/migration_support.h"
#include "tools/lib/frames.h"

namespace {

using namespace migsupport;
using Clock = std::chrono::steady_clock;

constexpr size_t kSlots = 4;
constexpr uint32_t kSlowPathIds[] = {11, 12, 13};

// Retries `op` while it answers busy (a reply still holds the object), for
// at most ten seconds.
template <typename Op>
ZelStatus UntilNotBusy(Op op) {
  const auto giveUp = Clock::now() + std::chrono::seconds(10);
  ZelStatus status;
  while ((status = op()) == ZEL_BUSY && Clock::now() < giveUp) std::this_thread::yield();
  return status;
}

using MigrationStressTest = MigrationTest;

TEST_F(MigrationStressTest, EverythingAtOnceLeavesNothingBehind) {
  host::Timers::SetMode(host::TimerMode::Async);
  SetPolicy(host::RequestKind::SetSlowPath, host::ReplyMode::OtherThread);
  SetPolicy(host::RequestKind::RestoreState, host::ReplyMode::OtherThread);
  SetPolicy(host::RequestKind::RetrieveState, host::ReplyMode::OtherThread, Bytes(300, 0x3c));
  // Packet, save and restore work holds a slot's mutex shared; replacing its
  // filter holds it exclusively: the framework's promise that no callback
  // reaches a filter being destroyed. Policy 1: restores drop a slow path
  // part they cannot deliver.
  std::shared_mutex mu[kSlots];
  host::FilterId ids[kSlots];
  auto newFilter = [&](size_t s) {
    EXPECT_EQ(Install(Filter(ids[s] = NewFilter("stress" + std::to_string(s), 1)), SampleRules()),
              ZEL_OK);
  };
  for (size_t s = 0; s < kSlots; s++) newFilter(s);
  std::vector<Bytes> frameSet;  // the exact rule, the general one, none
  for (const char* da : {"10.0.0.2", "10.9.0.5", "10.7.7.7"}) {
    frames::FrameBuilder frame;
    frame.Eth(frames::Mac(kGwMac), frames::Mac(kVmMac))
        .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4(da));
    frameSet.push_back(frames::FrameBuilder(frame).Tcp(1000, 80).Payload(40).Build());
    frameSet.push_back(frame.Udp(53, 53).Build());
  }
  std::atomic<bool> stop{false};
  std::atomic<uint64_t> delivered{0}, saved{0}, restored{0}, recreated{0}, churned{0};

  auto packets = [&](std::mt19937_64 rng) {
    while (!stop) {
      const size_t s = rng() % kSlots;
      std::vector<Bytes> list(1 + rng() % 8);
      for (Bytes& frame : list) frame = frameSet[rng() % frameSet.size()];
      std::shared_lock hold(mu[s]);
      EXPECT_EQ(Deliver(ids[s], list, 1 + static_cast<uint32_t>(rng() % 2)), ZEL_OK);
      DrainFaulted(ids[s]);
      DrainIssued(ids[s]);
      delivered += list.size();
      hold.unlock();
      std::this_thread::yield();  // lets a waiting destroy in
    }
  };
  auto slowPaths = [&](std::mt19937_64 rng) {
    bool registered[std::size(kSlowPathIds)] = {};
    for (const char* agent = testsupport::kDefaultAgent; !stop; churned++) {
      const uint32_t k = rng() % std::size(kSlowPathIds), id = kSlowPathIds[k];
      EXPECT_EQ(registered[k]
                    ? UntilNotBusy([&] { return host::Sluice::UnregisterSlowPath(agent, id); })
                    : host::Sluice::RegisterSlowPath(agent, id),
                ZEL_OK);
      registered[k] = !registered[k];
      std::this_thread::sleep_for(std::chrono::microseconds(rng() % 500));
    }
  };
  auto lifecycle = [&](std::mt19937_64 rng) {
    for (; !stop; recreated++) {
      const size_t s = rng() % kSlots;
      std::unique_lock hold(mu[s]);  // the packet threads drained what they delivered
      EXPECT_EQ(UntilNotBusy([&] { return host::Sluice::DestroyFilter(ids[s]); }), ZEL_OK);
      newFilter(s);
      hold.unlock();
      std::this_thread::sleep_for(std::chrono::microseconds(rng() % 2000));
    }
  };
  // Prefetch, wait a little for the reply, save; then restore into another
  // filter. Two of these run at once, so each meets the other's states.
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
        // Empty when still fetching (then sometimes abandoned: a late reply
        // finds the filter idle), or when the other thread got there first.
        saved += !(state = Save(f)).empty();
        EXPECT_EQ(state.empty() && rng() % 2 == 0 ? SLCGenericGetSavedStateLen(f, nullptr) : ZEL_OK,
                  ZEL_OK);
        const uint32_t change = rng() % 8;  // sometimes add or replace rules meanwhile
        EXPECT_EQ(change < 2 ? Install(f, SampleRules(), change) : ZEL_OK, ZEL_OK);
      }
      if (state.empty()) continue;
      std::shared_lock hold(mu[to]);
      // Failure: busy with another restore or a save, or the request was refused.
      const ZelStatus status = SLCGenericRestoreState(Filter(ids[to]), state.data(), state.size());
      EXPECT_TRUE(status == ZEL_OK || status == ZEL_FAILURE) << status;
      restored += status == ZEL_OK;
    }
  };

  std::vector<std::thread> threads;
  const std::function<void(std::mt19937_64)> bodies[] = {packets,   packets, packets, slowPaths,
                                                         lifecycle, migrate, migrate};
  uint64_t seed = EnvOr("MIGRATION_STRESS_SEED", 77);  // one generator per thread
  for (const auto& body : bodies) threads.emplace_back(body, std::mt19937_64(seed++));
  std::this_thread::sleep_for(std::chrono::milliseconds(EnvOr("MIGRATION_STRESS_MS", 1500)));
  stop = true;
  for (std::thread& t : threads) t.join();
  // An attach pass may still be running and sending requests; wait until no
  // timer is pending and every reply is in.
  const auto giveUp = Clock::now() + std::chrono::seconds(10);
  do {
    host::Sluice::WaitReplies();
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  } while (host::Timers::Pending() != 0 && Clock::now() < giveUp);
  host::Sluice::WaitReplies();

  // Every reference returned; idle, or ready from a prefetch without a save.
  for (host::FilterId id : ids) {  // idle, or ready from a prefetch nobody saved
    EXPECT_EQ(Of(Filter(id)).refs, 1u);
    EXPECT_NE(Of(Filter(id)).state, SLCGenericStateFetching);
    EXPECT_NE(Of(Filter(id)).state, SLCGenericStateRestoring);
  }
  for (auto* count : {&delivered, &saved, &restored, &recreated, &churned}) EXPECT_GT(*count, 0u);
}

}  // namespace
