// Host spin locks: rank checking, misuse that must abort, and real mutual
// exclusion (shared readers, exclusive writers).

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "platform/zel.h"

namespace {

class LocksTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::Reset();
    ASSERT_EQ(zel_LockDomainCreate(1, nullptr, "test-domain", &domain_), ZEL_OK);
  }
  void TearDown() override {
    for (ZelLock* l : locks_) zel_SpinlockDestroy(l);
    zel_LockDomainDestroy(domain_);
    EXPECT_TRUE(host::Leftovers().empty());
    host::Reset();
  }

  ZelLock* Make(const char* name, uint32_t rank, ZelLockType type = ZEL_LOCK_PLAIN) {
    ZelLock* l = nullptr;
    EXPECT_EQ(zel_SpinlockCreate(1, nullptr, name, type, domain_, rank, &l), ZEL_OK);
    locks_.push_back(l);
    return l;
  }

  ZelLockDomainID domain_ = ZEL_INVALID_LOCK_DOMAIN;
  std::vector<ZelLock*> locks_;
};

TEST_F(LocksTest, RankViolationsAbortNamingBothLocks) {
  ZelLock* agent = Make("slcg.fastpath", 2);
  ZelLock* filter = Make("slcg.filter", 3);
  ZelLock* config = Make("slcg.fw.config", 4, ZEL_LOCK_RW);

  EXPECT_DEATH(
      {
        zel_SpinlockLock(filter);
        zel_SpinlockLock(agent);
      },
      "acquiring slcg.fastpath \\(rank 2\\) while holding slcg.filter \\(rank 3\\)");
  // Equal rank is a violation too: it catches taking the same lock twice.
  EXPECT_DEATH(
      {
        zel_SpinlockReadLock(config);
        zel_SpinlockReadLock(config);
      },
      "acquiring slcg.fw.config \\(rank 4\\) while holding slcg.fw.config \\(rank 4\\)");

  // The legal order works, and releasing out of order keeps the check right.
  zel_SpinlockLock(agent);
  zel_SpinlockLock(filter);
  zel_SpinlockUnlock(agent);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 1u);
  EXPECT_DEATH(zel_SpinlockLock(agent), "acquiring slcg.fastpath \\(rank 2\\) while holding slcg.filter");
  zel_SpinlockWriteLock(config);
  zel_SpinlockWriteUnlock(config);
  zel_SpinlockUnlock(filter);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
}

TEST_F(LocksTest, MisuseAborts) {
  ZelLock* plain = Make("plain", 1);
  ZelLock* rw = Make("rw", 2, ZEL_LOCK_RW);

  EXPECT_DEATH(zel_SpinlockUnlock(plain), "lock plain \\(rank 1\\) is not held by this thread");
  // Held by another thread is not held by this one.
  EXPECT_DEATH(
      {
        zel_SpinlockLock(plain);
        std::thread([&] { zel_SpinlockUnlock(plain); }).join();
      },
      "not held by this thread");
  EXPECT_DEATH(
      {
        zel_SpinlockReadLock(rw);
        zel_SpinlockWriteUnlock(rw);
      },
      "lock rw is held for read, not write");
  EXPECT_DEATH(zel_SpinlockReadLock(plain), "lock plain is a plain lock");
  EXPECT_DEATH(
      {
        zel_SpinlockLock(plain);
        zel_SpinlockDestroy(plain);
      },
      "lock plain \\(rank 1\\) is held");
  EXPECT_DEATH(zel_LockDomainDestroy(domain_), "test-domain still has 2 locks: (plain, rw|rw, plain)");

  ZelLock* l = nullptr;
  EXPECT_EQ(zel_SpinlockCreate(1, nullptr, "orphan", ZEL_LOCK_PLAIN, domain_ + 100, 1, &l), ZEL_BAD_PARAM);
}

TEST_F(LocksTest, ReadersShareWritersExclude) {
  ZelLock* rw = Make("rw", 1, ZEL_LOCK_RW);

  // Two readers inside at once: each waits (bounded) for the other while
  // holding the lock.
  std::atomic<int> inside{0};
  std::atomic<bool> sawBoth[2] = {false, false};
  auto reader = [&](int i) {
    zel_SpinlockReadLock(rw);
    inside++;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (inside.load() < 2 && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    sawBoth[i] = inside.load() == 2;
    zel_SpinlockReadUnlock(rw);
  };
  std::thread a(reader, 0), b(reader, 1);
  a.join();
  b.join();
  EXPECT_TRUE(sawBoth[0] && sawBoth[1]);

  // Writers and readers against a plain (non-atomic) pair of counters: a
  // reader must never see them differ.
  uint64_t x = 0, y = 0;
  std::atomic<bool> torn{false};
  constexpr int kRounds = 20000;
  auto writer = [&] {
    for (int i = 0; i < kRounds; i++) {
      zel_SpinlockWriteLock(rw);
      x++;
      y++;
      zel_SpinlockWriteUnlock(rw);
    }
  };
  auto checker = [&] {
    for (int i = 0; i < kRounds; i++) {
      zel_SpinlockReadLock(rw);
      if (x != y) torn = true;
      zel_SpinlockReadUnlock(rw);
    }
  };
  std::thread w1(writer), w2(writer), r1(checker);
  w1.join();
  w2.join();
  r1.join();
  EXPECT_EQ(x, 2u * kRounds);
  EXPECT_FALSE(torn);
  EXPECT_EQ(host::Locks::Acquisitions("rw"), 2u + 3u * kRounds);
}

TEST_F(LocksTest, AcquisitionsSurviveDestruction) {
  ZelLock* a = Make("same", 1);
  ZelLock* b = Make("same", 2);
  for (ZelLock* l : {a, b, a}) {
    zel_SpinlockLock(l);
    zel_SpinlockUnlock(l);
  }
  zel_SpinlockDestroy(a);
  locks_.erase(locks_.begin());
  EXPECT_EQ(host::Locks::Acquisitions("same"), 3u);
  EXPECT_EQ(host::Locks::Acquisitions("other"), 0u);
  EXPECT_EQ(host::Locks::LiveLocks(), 1u);
}

}  // namespace
