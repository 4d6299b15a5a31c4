// Lock domains and spin locks with rank checking.
//
// A lock is one 32-bit word: a writer bit, a writer-waiting bit (new readers
// hold back while a writer waits, so a stream of packet readers cannot
// starve an update) and a reader count. Plain locks use only the writer bit.
// Waiters spin briefly, then yield: host threads may be preempted while
// holding a lock, unlike a real kernel's spin lock holders.
//
// Every thread keeps the locks it holds on a fixed-size stack. Ranks on the
// stack strictly increase from bottom to top (each acquisition is checked
// against the top, and removing any entry keeps the order), so the rank rule
// is a single comparison with the top entry. Timer callbacks push a
// pseudo-lock (no lock object) of their rank.
//
// The acquire/release paths take no global lock and allocate nothing; the
// registry mutex is used only to create and destroy locks and domains.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <mutex>
#include <thread>
#include <unordered_set>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct ZelLock {
  static constexpr uint64_t kLive = 0x6b636f6c2d6c657a;
  static constexpr uint64_t kDead = 0x646165642d6b636f;
  static constexpr uint32_t kWriter = 1u << 31;
  static constexpr uint32_t kWriterWaiting = 1u << 30;

  // Hot: the word and the counter share a line with the fields every
  // acquisition reads.
  alignas(64) std::atomic<uint32_t> state{0};
  uint32_t rank = 0;
  std::atomic<uint64_t> magic{kLive};
  std::atomic<uint64_t> acquisitions{0};
  // Write holds: when the current one began, and the longest so far.
  std::chrono::steady_clock::time_point writeSince{};
  std::atomic<uint64_t> longestWriteNs{0};
  ZelLockType type = ZEL_LOCK_PLAIN;
  ZelModuleID owner = -1;
  ZelLockDomainID domain = ZEL_INVALID_LOCK_DOMAIN;
  std::string name;
};

namespace host {

namespace {

enum Mode : uint8_t { kPlain, kRead, kWrite, kPseudo };

const char* ModeName(uint8_t mode) {
  switch (mode) {
    case kPlain: return "plain";
    case kRead: return "read";
    case kWrite: return "write";
    default: return "timer";
  }
}

struct Held {
  const ZelLock* lock;   // null for a timer pseudo-lock
  const char* name;
  uint32_t rank;
  uint8_t mode;
};

constexpr uint32_t kMaxHeld = 32;

// Trivially constructible so that access needs no initialisation guard.
struct HeldStack {
  Held entries[kMaxHeld];
  uint32_t depth;
};
thread_local HeldStack tHeld;

inline void Relax(uint32_t* spins) {
  if (++*spins < 128) {
#if defined(__x86_64__) || defined(__i386__)
    __builtin_ia32_pause();
#endif
  } else {
    std::this_thread::yield();
  }
}

// --- the lock word ---------------------------------------------------------

void AcquireExclusive(ZelLock* l) {
  uint32_t spins = 0;
  for (;;) {
    uint32_t s = l->state.load(std::memory_order_relaxed);
    if ((s & ~ZelLock::kWriterWaiting) == 0) {
      // Taking the lock also clears the waiting bit; other waiting writers
      // set it again on their next pass.
      if (l->state.compare_exchange_weak(s, ZelLock::kWriter, std::memory_order_acquire,
                                         std::memory_order_relaxed)) {
        return;
      }
      continue;
    }
    if ((s & ZelLock::kWriterWaiting) == 0) {
      l->state.fetch_or(ZelLock::kWriterWaiting, std::memory_order_relaxed);
    }
    Relax(&spins);
  }
}

void ReleaseExclusive(ZelLock* l) { l->state.fetch_and(~ZelLock::kWriter, std::memory_order_release); }

void AcquireShared(ZelLock* l) {
  constexpr uint32_t kBlocked = ZelLock::kWriter | ZelLock::kWriterWaiting;
  for (;;) {
    uint32_t s = l->state.fetch_add(1, std::memory_order_acquire);
    if ((s & kBlocked) == 0) return;
    l->state.fetch_sub(1, std::memory_order_relaxed);
    uint32_t spins = 0;
    while (l->state.load(std::memory_order_relaxed) & kBlocked) Relax(&spins);
  }
}

void ReleaseShared(ZelLock* l) { l->state.fetch_sub(1, std::memory_order_release); }

// --- checks -----------------------------------------------------------------

inline ZelLock* Checked(ZelLock* l, const char* call, ZelLockType type) {
  if (l == nullptr) Fatal("%s: null lock", call);
  uint64_t magic = l->magic.load(std::memory_order_relaxed);
  if (magic != ZelLock::kLive) {
    Fatal("%s: %p is not a live lock%s", call, static_cast<void*>(l),
          magic == ZelLock::kDead ? " (destroyed)" : "");
  }
  if (l->type != type) {
    Fatal("%s: lock %s is a %s lock", call, l->name.c_str(),
          l->type == ZEL_LOCK_RW ? "reader/writer" : "plain");
  }
  return l;
}

[[noreturn]] void RankViolation(const char* what, uint32_t rank, const Held& top) {
  Fatal("lock rank violation: acquiring %s (rank %u) while holding %s (rank %u)", what, rank,
        top.name, top.rank);
}

inline void Push(const ZelLock* l, const char* name, uint32_t rank, uint8_t mode) {
  HeldStack& hs = tHeld;
  if (hs.depth == kMaxHeld) Fatal("more than %u locks held by one thread", kMaxHeld);
  hs.entries[hs.depth++] = Held{l, name, rank, mode};
}

inline void CheckRank(const ZelLock* l) {
  const HeldStack& hs = tHeld;
  if (hs.depth != 0 && l->rank <= hs.entries[hs.depth - 1].rank) {
    RankViolation(l->name.c_str(), l->rank, hs.entries[hs.depth - 1]);
  }
}

// Takes `l` off the calling thread's stack; aborts unless it is held there
// in `mode`.
inline void Pop(const ZelLock* l, uint8_t mode, const char* call) {
  HeldStack& hs = tHeld;
  uint32_t i = hs.depth;
  while (i > 0 && hs.entries[i - 1].lock != l) i--;
  if (i == 0) Fatal("%s: lock %s (rank %u) is not held by this thread", call, l->name.c_str(), l->rank);
  if (hs.entries[i - 1].mode != mode) {
    Fatal("%s: lock %s is held for %s, not %s", call, l->name.c_str(),
          ModeName(hs.entries[i - 1].mode), ModeName(mode));
  }
  for (; i < hs.depth; i++) hs.entries[i - 1] = hs.entries[i];
  hs.depth--;
}

// --- registry ----------------------------------------------------------------

struct Domain {
  std::string name;
  ZelModuleID owner = -1;
  uint64_t liveLocks = 0;
};

struct LockRegistry {
  std::mutex mu;
  ZelLockDomainID nextDomain = 1;
  std::map<ZelLockDomainID, Domain> domains;
  std::unordered_set<ZelLock*> locks;
  std::map<std::string, uint64_t, std::less<>> retiredAcquisitions;   // from destroyed locks
};

LockRegistry& R() {
  static LockRegistry* r = new LockRegistry;
  return *r;
}

}  // namespace

namespace core {

void PushPseudoLock(uint32_t rank, const char* what) {
  const HeldStack& hs = tHeld;
  if (hs.depth != 0 && rank <= hs.entries[hs.depth - 1].rank) {
    RankViolation(what, rank, hs.entries[hs.depth - 1]);
  }
  Push(nullptr, what, rank, kPseudo);
}

void PopPseudoLock(const char* what) {
  HeldStack& hs = tHeld;
  if (hs.depth == 0) Fatal("%s: pseudo-lock missing from the held-lock stack", what);
  const Held& top = hs.entries[hs.depth - 1];
  if (top.mode != kPseudo) Fatal("%s returned holding lock %s (rank %u)", what, top.name, top.rank);
  hs.depth--;
}

bool DomainExists(ZelLockDomainID domain) {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return r.domains.count(domain) != 0;
}

size_t RealLocksHeld() {
  const HeldStack& hs = tHeld;
  size_t n = 0;
  for (uint32_t i = 0; i < hs.depth; i++) n += hs.entries[i].lock != nullptr;
  return n;
}

void ResetLocks() {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (ZelLock* l : r.locks) delete l;
  r.locks.clear();
  r.domains.clear();
  r.retiredAcquisitions.clear();
  tHeld.depth = 0;
}

void LockLeftovers(std::vector<std::string>* out) {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  std::vector<std::string> names;
  for (ZelLock* l : r.locks) {
    names.push_back("lock " + l->name + " (rank " + std::to_string(l->rank) + "): still exists");
  }
  std::sort(names.begin(), names.end());
  out->insert(out->end(), names.begin(), names.end());
  for (auto& [id, d] : r.domains) out->push_back("lock domain " + d.name + ": still exists");
  const HeldStack& hs = tHeld;
  for (uint32_t i = 0; i < hs.depth; i++) {
    out->push_back(std::string("lock ") + hs.entries[i].name + ": still held by this thread");
  }
}

void ReportLocksOf(ZelModuleID module) {
  if (module < 0) return;
  std::vector<std::string> leaks;
  {
    LockRegistry& r = R();
    std::lock_guard<std::mutex> g(r.mu);
    for (ZelLock* l : r.locks) {
      if (l->owner == module) leaks.push_back("lock " + l->name + ": not destroyed at unload");
    }
    std::sort(leaks.begin(), leaks.end());
    for (auto& [id, d] : r.domains) {
      if (d.owner == module) leaks.push_back("lock domain " + d.name + ": not destroyed at unload");
    }
  }
  for (auto& leak : leaks) RecordLeak(std::move(leak));
}

}  // namespace core

size_t Locks::HeldByThisThread() { return core::RealLocksHeld(); }

uint64_t Locks::LiveLocks() {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return r.locks.size();
}

uint64_t Locks::LiveDomains() {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return r.domains.size();
}

uint64_t Locks::Acquisitions(std::string_view name) {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  uint64_t n = 0;
  auto it = r.retiredAcquisitions.find(name);
  if (it != r.retiredAcquisitions.end()) n = it->second;
  for (ZelLock* l : r.locks) {
    if (l->name == name) n += l->acquisitions.load(std::memory_order_relaxed);
  }
  return n;
}

uint64_t Locks::LongestWriteHoldNs(std::string_view name) {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  uint64_t most = 0;
  for (ZelLock* l : r.locks) {
    if (l->name == name) most = std::max(most, l->longestWriteNs.load(std::memory_order_relaxed));
  }
  return most;
}

void Locks::ResetWriteHolds(std::string_view name) {
  LockRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (ZelLock* l : r.locks) {
    if (l->name == name) l->longestWriteNs.store(0, std::memory_order_relaxed);
  }
}

}  // namespace host

using host::Checked;

ZelStatus zel_LockDomainCreate(ZelModuleID module, ZelHeapID heap, const char* name,
                               ZelLockDomainID* domain) {
  (void)module;
  (void)heap;
  if (ZelStatus st = host::Faults::Check("zel_LockDomainCreate")) return st;
  if (name == nullptr || domain == nullptr) return ZEL_BAD_PARAM;
  host::LockRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  ZelLockDomainID id = r.nextDomain++;
  r.domains[id] = host::Domain{name, host::core::OwningModule(), 0};
  *domain = id;
  return ZEL_OK;
}

void zel_LockDomainDestroy(ZelLockDomainID domain) {
  host::LockRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  auto it = r.domains.find(domain);
  if (it == r.domains.end()) {
    host::Fatal("zel_LockDomainDestroy: no lock domain %lld", static_cast<long long>(domain));
  }
  if (it->second.liveLocks != 0) {
    std::string names;
    for (ZelLock* l : r.locks) {
      if (l->domain == domain) names += (names.empty() ? "" : ", ") + l->name;
    }
    host::Fatal("zel_LockDomainDestroy: lock domain %s still has %llu locks: %s", it->second.name.c_str(),
                static_cast<unsigned long long>(it->second.liveLocks), names.c_str());
  }
  r.domains.erase(it);
}

ZelStatus zel_SpinlockCreate(ZelModuleID module, ZelHeapID heap, const char* name, ZelLockType type,
                             ZelLockDomainID domain, uint32_t rank, ZelLock** lock) {
  (void)module;
  (void)heap;
  if (ZelStatus st = host::Faults::Check("zel_SpinlockCreate")) return st;
  if (name == nullptr || lock == nullptr) return ZEL_BAD_PARAM;
  if (type != ZEL_LOCK_PLAIN && type != ZEL_LOCK_RW) return ZEL_BAD_PARAM;
  host::LockRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  auto it = r.domains.find(domain);
  if (it == r.domains.end()) return ZEL_BAD_PARAM;
  auto* l = new ZelLock;
  l->rank = rank;
  l->type = type;
  l->owner = host::core::OwningModule();
  l->domain = domain;
  l->name = name;
  r.locks.insert(l);
  it->second.liveLocks++;
  *lock = l;
  return ZEL_OK;
}

void zel_SpinlockDestroy(ZelLock* lock) {
  if (lock == nullptr) return;
  host::LockRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  if (r.locks.count(lock) == 0) {
    host::Fatal("zel_SpinlockDestroy: %p is not a live lock", static_cast<void*>(lock));
  }
  if (lock->state.load(std::memory_order_acquire) & ~ZelLock::kWriterWaiting) {
    host::Fatal("zel_SpinlockDestroy: lock %s (rank %u) is held", lock->name.c_str(), lock->rank);
  }
  r.locks.erase(lock);
  auto d = r.domains.find(lock->domain);
  if (d != r.domains.end()) d->second.liveLocks--;
  r.retiredAcquisitions[lock->name] += lock->acquisitions.load(std::memory_order_relaxed);
  lock->magic.store(ZelLock::kDead, std::memory_order_relaxed);
  delete lock;
}

// The acquisition order in every entry point: validate, check the rank
// (before blocking, so an inversion aborts instead of deadlocking), take the
// word, count, then record the hold.

void zel_SpinlockLock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockLock", ZEL_LOCK_PLAIN);
  host::CheckRank(l);
  host::AcquireExclusive(l);
  // Exclusive: no other thread updates the counter while we hold the lock.
  l->acquisitions.store(l->acquisitions.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
  host::Push(l, l->name.c_str(), l->rank, host::kPlain);
}

void zel_SpinlockUnlock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockUnlock", ZEL_LOCK_PLAIN);
  host::Pop(l, host::kPlain, "zel_SpinlockUnlock");
  host::ReleaseExclusive(l);
}

void zel_SpinlockReadLock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockReadLock", ZEL_LOCK_RW);
  host::CheckRank(l);
  host::AcquireShared(l);
  l->acquisitions.fetch_add(1, std::memory_order_relaxed);
  host::Push(l, l->name.c_str(), l->rank, host::kRead);
}

void zel_SpinlockReadUnlock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockReadUnlock", ZEL_LOCK_RW);
  host::Pop(l, host::kRead, "zel_SpinlockReadUnlock");
  host::ReleaseShared(l);
}

void zel_SpinlockWriteLock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockWriteLock", ZEL_LOCK_RW);
  host::CheckRank(l);
  host::AcquireExclusive(l);
  l->acquisitions.fetch_add(1, std::memory_order_relaxed);
  host::Push(l, l->name.c_str(), l->rank, host::kWrite);
  l->writeSince = std::chrono::steady_clock::now();
}

void zel_SpinlockWriteUnlock(ZelLock* lock) {
  ZelLock* l = Checked(lock, "zel_SpinlockWriteUnlock", ZEL_LOCK_RW);
  host::Pop(l, host::kWrite, "zel_SpinlockWriteUnlock");
  // Still exclusive: writeSince is ours, and only writers raise the maximum.
  const uint64_t held = static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now() -
                                                           l->writeSince)
          .count());
  if (held > l->longestWriteNs.load(std::memory_order_relaxed)) {
    l->longestWriteNs.store(held, std::memory_order_relaxed);
  }
  host::ReleaseExclusive(l);
}
