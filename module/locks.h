// RAII holds on host spin locks. Every lock of the module is taken through
// one of these, so no path returns with a lock held.
#pragma once

#include "platform/zel.h"

class [[nodiscard]] SLCGenericSpinGuard {
 public:
  explicit SLCGenericSpinGuard(ZelLock* lock) : lock_(lock) { zel_SpinlockLock(lock_); }
  ~SLCGenericSpinGuard() {
    if (held_) zel_SpinlockUnlock(lock_);
  }
  SLCGenericSpinGuard(const SLCGenericSpinGuard&) = delete;
  SLCGenericSpinGuard& operator=(const SLCGenericSpinGuard&) = delete;

  // For the few places that give the lock up early or around a host call.
  void Unlock() {
    zel_SpinlockUnlock(lock_);
    held_ = false;
  }
  void Relock() {
    zel_SpinlockLock(lock_);
    held_ = true;
  }

 private:
  ZelLock* lock_;
  bool held_ = true;
};

class [[nodiscard]] SLCGenericReadGuard {
 public:
  explicit SLCGenericReadGuard(ZelLock* lock) : lock_(lock) { zel_SpinlockReadLock(lock_); }
  // Takes over a shared hold that the caller already has (handed on by a
  // guard that was Dismiss()ed); does not lock again.
  struct Adopt {};
  SLCGenericReadGuard(ZelLock* lock, Adopt) : lock_(lock) {}
  ~SLCGenericReadGuard() {
    if (held_) zel_SpinlockReadUnlock(lock_);
  }
  SLCGenericReadGuard(const SLCGenericReadGuard&) = delete;
  SLCGenericReadGuard& operator=(const SLCGenericReadGuard&) = delete;

  void Unlock() {
    zel_SpinlockReadUnlock(lock_);
    held_ = false;
  }
  // Hands the hold on to a callee that adopts and releases it; this guard
  // no longer releases it.
  void Dismiss() { held_ = false; }

 private:
  ZelLock* lock_;
  bool held_ = true;
};

class [[nodiscard]] SLCGenericWriteGuard {
 public:
  explicit SLCGenericWriteGuard(ZelLock* lock) : lock_(lock) { zel_SpinlockWriteLock(lock_); }
  ~SLCGenericWriteGuard() { zel_SpinlockWriteUnlock(lock_); }
  SLCGenericWriteGuard(const SLCGenericWriteGuard&) = delete;
  SLCGenericWriteGuard& operator=(const SLCGenericWriteGuard&) = delete;

 private:
  ZelLock* lock_;
};
