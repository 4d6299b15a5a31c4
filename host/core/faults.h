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
#include <vector>

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

  // A failure point: a host call that can fail, from one call site (the
  // return address of the host call, or for heap allocations the caller of
  // the module's allocator).
  struct Point {
    std::string call;
    uintptr_t site = 0;
    auto operator<=>(const Point&) const = default;
    // "zel_SocketSendTo at exe+0x1a2b3": the offset suits addr2line.
    std::string Describe() const;
  };
  // While recording, every point a host call checks is remembered, armed or
  // not. Start clears what was recorded before.
  static void StartRecording();
  static void StopRecording();
  // Points checked since StartRecording, each once, in order of first reach.
  static std::vector<Point> Reached();
  // The `nth` time `point` is checked from now on fails with `status` (a
  // point fails once; arm a call by name for repeated failures). Points and
  // calls armed together both apply.
  static void FailAt(const Point& point, ZelStatus status, uint64_t nth = 1);
  // Points that failed through FailAt since the last ClearAll.
  static std::vector<Point> InjectedPoints();

  // Used by host calls: the status to fail with, or ZEL_OK. `site` defaults
  // to the return address of the host call that checks; a host call that
  // checks through a helper passes its own.
  static ZelStatus Check(const char* call, const void* site = __builtin_return_address(0)) {
    if (!armed_.load(std::memory_order_relaxed)) return ZEL_OK;
    return CheckSlow(call, reinterpret_cast<uintptr_t>(site));
  }

 private:
  static ZelStatus CheckSlow(const char* call, uintptr_t site);
  static void UpdateArmedLocked();
  static std::atomic<bool> armed_;
};

// Host-side checks that a real kernel would make fatal: prints the message
// and aborts.
[[noreturn]] void Fatal(const char* fmt, ...) __attribute__((format(printf, 1, 2)));

}  // namespace host
