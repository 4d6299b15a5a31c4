// The userspace host's core services, as tests and tools drive them: the
// module loader, heaps, the log, locks and timers. The zel_ calls that the
// module makes are implemented behind these classes.
//
// All classes are process-wide (there is one host kernel per process); all
// methods are thread-safe unless stated otherwise.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/zel.h"

namespace host {

// ---------------------------------------------------------------------------
// Module loader

class Loader {
 public:
  // Loads `image`: applies parameter overrides (by name), makes the module
  // current and calls its init. Returns init's result (0 = running). Aborts
  // if a module is already loaded or an override names no parameter.
  static int Load(const ZelModuleImage* image, const std::map<std::string, int32_t>& params = {});
  // Calls the module's cleanup and forgets it. Heaps, logs, timer queues,
  // lock domains and client ports it left behind are reported as leaks.
  static void Unload();
  static bool Loaded();
  static const ZelModuleImage* Current();
  // The loaded module's identifier; when none is loaded, the identifier the
  // next load will give (which is also what zel_ModuleCurrentID answers to
  // module code run outside the loader). Every load gets a fresh one.
  static ZelModuleID CurrentID();
  // Pins the identifier of the next load (positive).
  static void PinNextID(ZelModuleID id);
  // Name under which the next modules are loaded, until Reset (default:
  // image->name).
  static void SetLoadName(std::string name);
  // The heap the module made its default (zel_ModuleSetHeapID), or null.
  static ZelHeapID DefaultHeap();
};

// Client-port properties registered through zel_PGXClientPortRegister.
class ClientPorts {
 public:
  static bool Registered(std::string_view name);
  // Calls the write handler (slot 0) of property `name` with `text`.
  // Aborts if no such property or no write handler.
  static ZelStatus Write(std::string_view name, std::string_view text);
};

// ---------------------------------------------------------------------------
// Heaps

struct HeapStats {
  std::string name;
  uint64_t blocks = 0;        // outstanding
  uint64_t bytes = 0;         // outstanding
  uint64_t peakBytes = 0;
  uint64_t allocations = 0;   // successful allocations so far
  uint64_t maximumSize = 0;
};

struct LeakReport {
  std::string what;           // "heap sluice-generic-fastpath: 3 blocks, 120 bytes", ...
};

class Heaps {
 public:
  static bool Exists(ZelHeapID heap);
  static HeapStats Stats(ZelHeapID heap);
  // The heap most recently created by a module (the module heap), or null.
  static ZelHeapID ModuleHeap();
  static uint64_t LiveHeaps();
  // Leaks reported so far (heaps destroyed with blocks, objects left at
  // unload). Cleared by Reset.
  static std::vector<LeakReport> Leaks();
};

// ---------------------------------------------------------------------------
// Log

enum class LogForm { Long, Short };

struct LogRecord {
  int32_t urgency = 0;
  LogForm form = LogForm::Long;
  std::string logName;        // long form: the log's name
  std::string function;       // long form: reporting function
  int32_t line = 0;           // long form: source line
  std::string object;         // filter or agent name, empty when none
  std::string text;           // the message text, rendered, without newline
  std::string rendered;       // the whole line as written, with newline
};

class Log {
 public:
  // Records since the last Clear or Reset (at most the latest 200000).
  static std::vector<LogRecord> Records();
  // Records whose text equals `text` (urgency -1 = any).
  static size_t Count(std::string_view text, int32_t urgency = -1);
  static bool Contains(std::string_view text, int32_t urgency = -1);
  // Records whose text contains `fragment`.
  static size_t CountContaining(std::string_view fragment);
  static void Clear();
  // Echo every record to stderr as it arrives.
  static void SetEcho(bool on);
  static bool LogExists(std::string_view name);
};

// ---------------------------------------------------------------------------
// Locks
//
// Rank rule: a context may take a lock only when its rank is strictly above
// the rank of every lock it holds (timer callbacks hold a pseudo-lock of
// their rank). Violations, unlocking a lock not held, destroying a held lock
// and destroying a domain with live locks abort with the names and ranks.

class Locks {
 public:
  // Locks held by the calling thread.
  static size_t HeldByThisThread();
  static uint64_t LiveLocks();
  static uint64_t LiveDomains();
  // Times any lock of this name was acquired (read, write or plain).
  static uint64_t Acquisitions(std::string_view name);
  // The longest exclusive hold of a reader/writer lock of this name (live
  // locks only), in nanoseconds, since the last reset: how long readers
  // were kept out. Benchmarks read it; the cost is two clock reads per
  // write hold.
  static uint64_t LongestWriteHoldNs(std::string_view name);
  static void ResetWriteHolds(std::string_view name);
};

// ---------------------------------------------------------------------------
// Timers

enum class TimerMode {
  Async,    // a host thread runs timers when due
  Manual,   // nothing runs until a test calls RunDue; time is virtual
};

class Timers {
 public:
  // Async is the mode after Reset. Pending timers keep their remaining time
  // across a change of mode.
  static void SetMode(TimerMode mode);
  static TimerMode Mode();
  // Manual mode: advances virtual time (aborts in Async mode).
  static void AdvanceMs(uint64_t ms);
  // Manual mode: runs every due timer on the calling thread, including ones
  // that become due while running; returns how many ran.
  static size_t RunDue();
  static size_t Pending();
  static uint64_t LiveQueues();
  // Async mode: waits until no one-shot timer is pending and no callback is
  // running (periodic timers never go idle and are not waited for). Returns
  // at once in Manual mode.
  static void WaitIdle();
};

// ---------------------------------------------------------------------------
// Whole host

// Each host subsystem registers how to reset itself and how to report what
// it still holds; Reset and Leftovers below run every registered subsystem.
struct Subsystem {
  const char* name;
  void (*reset)();
  void (*leftovers)(std::vector<std::string>* out);
};
// Called from a static initialiser of the subsystem's source file.
bool RegisterSubsystem(const Subsystem& subsystem);

// Returns the host to its initial state between tests: no module, no heaps,
// no logs, no locks, no timers, no faults, no packets, no framework state.
// Aborts if a module is still loaded.
void Reset();

// Everything a clean test leaves behind: empty when nothing leaked (heap
// blocks, heaps, logs, queues, domains, locks, packets, sockets, pool tags,
// framework objects). Each entry says what.
std::vector<std::string> Leftovers();

}  // namespace host
