// Fault injection: any host call that returns a status can be made to fail
// on demand, by name ("zel_HeapCreate", "zel_SluiceSetSlowPath", ...).
//
// Thread-safe. The check on a call that nobody armed costs one relaxed
// atomic load, so hot-path calls may check too.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/zel_status.h"

namespace host {

class Faults {
 public:
  // The `nth` call of `call` from now on (1 = the next one) fails with
  // `status`; when `sticky`, every call from the nth on fails.
  static void Fail(std::string_view call, ZelStatus status, uint64_t nth = 1, bool sticky = false);
  // Disarms `call`, or every call.
  static void Clear(std::string_view call);
  static void ClearAll();
  // Calls of `call` seen since it was armed (0 when it is not armed).
  static uint64_t Seen(std::string_view call);
  // Failures injected into `call` since the last ClearAll.
  static uint64_t Injected(std::string_view call);

  // Used by host calls: the status to fail with, or ZEL_OK.
  static ZelStatus Check(const char* call) {
    if (!armed_.load(std::memory_order_relaxed)) return ZEL_OK;
    return CheckSlow(call);
  }

 private:
  static ZelStatus CheckSlow(const char* call);
  static std::atomic<bool> armed_;
};

// Host-side checks that a real kernel would make fatal: prints the message
// and aborts.
[[noreturn]] void Fatal(const char* fmt, ...) __attribute__((format(printf, 1, 2)));

}  // namespace host
