// Core host kernel services: modules, heaps, logs, locks, timers, strings
// and the distributed switch's client-port properties.
//
// Every call that returns a ZelStatus may fail with a host status; callers
// check it. Calls marked "never fails" return a plain value.
#pragma once

#include <cstdarg>

#include "platform/zel_status.h"

// ---------------------------------------------------------------------------
// Modules

// Identifier of the module whose code is running (the one being loaded).
ZelModuleID zel_ModuleCurrentID();
// Copies the name under which the host loaded the module, NUL-terminated and
// cut to `len` - 1 characters.
[[nodiscard]] ZelStatus zel_ModuleGetName(ZelModuleID id, char* buf, size_t len);
// Makes `heap` the default heap of module `id`.
[[nodiscard]] ZelStatus zel_ModuleSetHeapID(ZelModuleID id, ZelHeapID heap);

// Load-time parameter declaration. The loader may overwrite *value before it
// calls the module's init function.
struct ZelModuleParam {
  const char* name;
  const char* type;         // "int"
  const char* description;
  int32_t* value;
};

// Module information record: a key and its text ("version", "build_type",
// "depends").
struct ZelModuleInfo {
  const char* key;
  const char* value;
};

struct QRY_ModuleTables;

// What the host's loader finds in a module image.
struct ZelModuleImage {
  const char* name;                       // name the module is loaded under
  int (*init)();                          // 0 = running, non-zero = start-up failed
  void (*cleanup)();
  const ZelModuleParam* params;
  uint32_t numParams;
  const ZelModuleInfo* info;
  uint32_t numInfo;
  const QRY_ModuleTables* qry;            // status tree tables, or null
};

// ---------------------------------------------------------------------------
// Heaps

struct ZelHeapCreateProps {
  uint32_t type;           // 0 = ordinary heap
  const char* name;
  ZelModuleID module;
  uint64_t initialSize;
  uint64_t maximumSize;
  uint64_t flags;          // 0
};

[[nodiscard]] ZelStatus zel_HeapCreate(const ZelHeapCreateProps* props, ZelHeapID* heap);
// Destroys a heap. A heap that still holds blocks is reported as a leak.
void zel_HeapDestroy(ZelHeapID heap);
// Allocates `size` bytes; `ra` is the caller's return address, recorded for
// attribution. Returns null when the heap refuses. The contents are undefined.
void* zel_HeapAllocWithRA(ZelHeapID heap, uint32_t size, void* ra);
void zel_HeapFree(ZelHeapID heap, void* block);

// ---------------------------------------------------------------------------
// Logs

[[nodiscard]] ZelStatus zel_LogRegister(const char* name, ZelModuleID module, ZelHeapID heap,
                                        int32_t defaultLevel, uint64_t flags, ZelLogHandle* log);
void zel_LogUnregister(ZelLogHandle log);
const char* zel_LogGetName(ZelLogHandle log);
int32_t zel_LogGetCurrentLogLevel(ZelLogHandle log);
// Writes a message of urgency `urgency` at level `level` to `log`.
void zel_LogLevel(int32_t urgency, ZelLogHandle log, int32_t level, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));
// Writes a message to the host's own log, for use before a log exists.
void zel_LogNoLevel(int32_t urgency, const char* fmt, ...) __attribute__((format(printf, 2, 3)));

// ---------------------------------------------------------------------------
// Lock domains and spin locks
//
// Every lock has a rank. A context may take a lock only when its rank is
// above that of every lock it already holds; timer callbacks run as if they
// held a lock of the rank they were scheduled with.

enum ZelLockType : uint32_t {
  ZEL_LOCK_PLAIN = 0,   // spin lock
  ZEL_LOCK_RW = 1,      // reader/writer spin lock
};

[[nodiscard]] ZelStatus zel_LockDomainCreate(ZelModuleID module, ZelHeapID heap, const char* name,
                                             ZelLockDomainID* domain);
void zel_LockDomainDestroy(ZelLockDomainID domain);

[[nodiscard]] ZelStatus zel_SpinlockCreate(ZelModuleID module, ZelHeapID heap, const char* name,
                                           ZelLockType type, ZelLockDomainID domain, uint32_t rank,
                                           ZelLock** lock);
void zel_SpinlockDestroy(ZelLock* lock);
void zel_SpinlockLock(ZelLock* lock);
void zel_SpinlockUnlock(ZelLock* lock);
void zel_SpinlockReadLock(ZelLock* lock);
void zel_SpinlockReadUnlock(ZelLock* lock);
void zel_SpinlockWriteLock(ZelLock* lock);
void zel_SpinlockWriteUnlock(ZelLock* lock);

// ---------------------------------------------------------------------------
// Timer queues

using ZelTimerCallback = void (*)(void* cookie);

[[nodiscard]] ZelStatus zel_TimerQueueCreate(const char* name, ZelModuleID owner, ZelHeapID heap,
                                             uint64_t flags, ZelTimerQueueHandle* queue);
// Destroys a queue; timers still pending on it are cancelled.
void zel_TimerQueueDestroy(ZelTimerQueueHandle queue);
// Schedules `cb(cookie)` after `timeoutMs` (0 = as soon as possible), then
// every `periodMs` (-1 = once). The callback runs in `domain` holding a
// pseudo-lock of rank `rank`.
[[nodiscard]] ZelStatus zel_TimerSchedule(ZelTimerQueueHandle queue, ZelTimerCallback cb,
                                          void* cookie, int64_t timeoutMs, int64_t periodMs,
                                          uint32_t attributes, ZelLockDomainID domain,
                                          uint32_t rank, ZelTimerHandle* timer);
// Cancels a timer. When `wait` is true and the callback is running on
// another context, waits until it has returned. A stale handle is ignored.
void zel_TimerCancel(ZelTimerQueueHandle queue, ZelTimerHandle timer, bool wait);

// ---------------------------------------------------------------------------
// Memory and strings (thin, never fail)

void* zel_Memcpy(void* dst, const void* src, size_t len);
void* zel_Memset(void* dst, int value, size_t len);
int zel_Memcmp(const void* a, const void* b, size_t len);
char* zel_Strncpy(char* dst, const char* src, size_t len);
size_t zel_Strnlen(const char* s, size_t max);
int zel_Strncmp(const char* a, const char* b, size_t len);
char* zel_Strchr(const char* s, int c);
// vsnprintf-like; returns the length the full text would have.
int zel_Sprintf(char* buf, size_t len, const char* fmt, ...) __attribute__((format(printf, 3, 4)));
// Formats into `buf` of `len` bytes, cutting the text to fit; returns the
// number of characters written (without the NUL).
int zel_StringFormat(char* buf, size_t len, const char* fmt, ...)
    __attribute__((format(printf, 3, 4)));

// ---------------------------------------------------------------------------
// Distributed switch client-port properties

// Handlers of a client-port property. The three leading arguments of write
// are host context the handler does not need.
struct ZelPGXPropOps {
  ZelStatus (*write)(void* ctx0, void* ctx1, void* ctx2, char* data, int32_t len);
  ZelStatus (*read)(void* ctx0, void* ctx1, void* ctx2, char* buf, int32_t* len);
  ZelStatus (*poll)(void* ctx0, void* ctx1, void* ctx2, int32_t* len);
  void (*cleanup)();
};

[[nodiscard]] ZelStatus zel_PGXClientPortRegister(ZelClientPortHandle* handle, uint32_t flags,
                                                  const char* name, const ZelPGXPropOps* ops);
void zel_PGXClientPortUnregister(ZelClientPortHandle handle);
