// Private glue between the host core's source files (loader, heaps, log,
// locks, timers, client ports). Nothing outside host/core includes this.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/zel.h"

namespace host::core {

// Loader: the module whose code may be running (loaded or being loaded), or
// -1. Objects created while it is set are charged to it and reported as
// leaks if they outlive its unload.
ZelModuleID OwningModule();
void ResetLoader();

// Heaps (heap.cpp). The leak list is shared by every core subsystem.
void RecordLeak(std::string what);
void ResetHeaps();
void HeapLeftovers(std::vector<std::string>* out);
void ReportHeapsOf(ZelModuleID module);

// Log (log.cpp).
void ResetLogs();
void LogLeftovers(std::vector<std::string>* out);
void ReportLogsOf(ZelModuleID module);

// Locks (locks.cpp).
void ResetLocks();
void LockLeftovers(std::vector<std::string>* out);
void ReportLocksOf(ZelModuleID module);
// Timer callbacks run as if they held a lock of their rank: these put that
// pseudo-lock on the calling thread's held-lock stack and take it off again.
// PopPseudoLock aborts if the callback left a real lock held.
void PushPseudoLock(uint32_t rank, const char* what);
void PopPseudoLock(const char* what);
bool DomainExists(ZelLockDomainID domain);
// Real locks (not timer pseudo-locks) held by the calling thread.
size_t RealLocksHeld();

// Timers (timers.cpp). ResetTimers stops the timer thread and forgets every
// queue and timer; ReportTimersOf also cancels the pending timers of the
// module's leftover queues so no callback runs into unloaded code.
void ResetTimers();
void TimerLeftovers(std::vector<std::string>* out);
void ReportTimersOf(ZelModuleID module);

// Client ports (client_ports.cpp).
void ResetClientPorts();
void ClientPortLeftovers(std::vector<std::string>* out);
void ReportClientPortsOf(ZelModuleID module);

}  // namespace host::core
