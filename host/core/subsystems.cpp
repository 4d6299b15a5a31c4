// Reset and Leftovers across every host subsystem. The core's own parts
// are run directly, in an order that matters: timers stop first so no
// callback runs while the rest is torn down, the other subsystems next
// (they may still refer to core objects), the core's objects last.

#include <mutex>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

namespace host {

namespace {

struct SubsystemList {
  std::mutex mu;
  std::vector<Subsystem> list;
};

// Built on first use: registrations come from other files' static
// initialisers, in no particular order.
SubsystemList& Subsystems() {
  static SubsystemList* s = new SubsystemList;
  return *s;
}

std::vector<Subsystem> Snapshot() {
  SubsystemList& s = Subsystems();
  std::lock_guard<std::mutex> g(s.mu);
  return s.list;
}

}  // namespace

bool RegisterSubsystem(const Subsystem& subsystem) {
  SubsystemList& s = Subsystems();
  std::lock_guard<std::mutex> g(s.mu);
  s.list.push_back(subsystem);
  return true;
}

void Reset() {
  if (const ZelModuleImage* image = Loader::Current()) {
    Fatal("host::Reset: module %s is still loaded", image->name);
  }
  core::ResetTimers();
  for (const Subsystem& sub : Snapshot()) {
    if (sub.reset != nullptr) sub.reset();
  }
  core::ResetClientPorts();
  core::ResetLocks();
  core::ResetLogs();
  core::ResetHeaps();
  core::ResetLoader();
  Faults::ClearAll();
}

std::vector<std::string> Leftovers() {
  std::vector<std::string> out;
  if (const ZelModuleImage* image = Loader::Current()) {
    out.push_back(std::string("module ") + image->name + ": still loaded");
  }
  core::TimerLeftovers(&out);
  core::ClientPortLeftovers(&out);
  core::LockLeftovers(&out);
  core::LogLeftovers(&out);
  core::HeapLeftovers(&out);
  for (const Subsystem& sub : Snapshot()) {
    if (sub.leftovers != nullptr) sub.leftovers(&out);
  }
  return out;
}

}  // namespace host
