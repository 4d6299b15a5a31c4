// Host status codes and the basic handle types shared by every host service.
//
// A host status is an unsigned 32-bit result; 0 means success. The named
// constants below are the statuses the module produces or interprets; the
// host may return others, which the module passes on unchanged.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>

static_assert(std::endian::native == std::endian::little,
              "module integers are stored little-endian; this host must be little-endian");

using ZelStatus = uint32_t;

inline constexpr ZelStatus ZEL_OK = 0;
inline constexpr ZelStatus ZEL_FAILURE = 0xbad0001;           // general failure
inline constexpr ZelStatus ZEL_NOT_FOUND = 0xbad0003;         // no such agent, filter or rule
inline constexpr ZelStatus ZEL_BUSY = 0xbad0004;              // in use, call again later
inline constexpr ZelStatus ZEL_WOULD_BLOCK = 0xbad0006;       // transient framework condition
inline constexpr ZelStatus ZEL_BAD_PARAM = 0xbad0007;         // bad argument or record magic
inline constexpr ZelStatus ZEL_NO_MEMORY = 0xbad0014;         // out of memory
inline constexpr ZelStatus ZEL_NOT_SUPPORTED = 0xbad002c;     // unsupported version
inline constexpr ZelStatus ZEL_NOT_INITIALIZED = 0xbad0031;   // value not set (VM UUID query)
inline constexpr ZelStatus ZEL_INVALID_STATE = 0xbad0039;     // wrong state or no context
inline constexpr ZelStatus ZEL_BAD_PARAM_TYPE = 0xbad0084;    // status-tree argument of wrong type
inline constexpr ZelStatus ZEL_NOT_READY = 0xbad0088;         // value not available yet
inline constexpr ZelStatus ZEL_BUF_TOO_SMALL = 0xbad00db;     // buffer too short

// Identifier of a loaded module; -1 when none.
using ZelModuleID = int32_t;

// Lock domain identifier; -1 when none.
using ZelLockDomainID = int64_t;
inline constexpr ZelLockDomainID ZEL_INVALID_LOCK_DOMAIN = -1;

// Opaque host objects. A null handle means "none".
struct ZelHeap;
struct ZelLog;
struct ZelTimerQueue;
struct ZelLock;
struct ZelClientPort;

using ZelHeapID = ZelHeap*;
using ZelLogHandle = ZelLog*;
using ZelTimerQueueHandle = ZelTimerQueue*;
using ZelClientPortHandle = ZelClientPort*;

// Timers are named by a number so that a stale handle is harmless; 0 = none.
using ZelTimerHandle = uint64_t;

// Returns the host's text for a status ("Success", "Out of memory", ...).
const char* zel_StatusToString(ZelStatus status);
