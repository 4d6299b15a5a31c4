// The module's frame: start and stop, load-time parameters, the module-wide
// host resources (heap, log, timer queue, lock domain) and logging.
//
// The globals below are written only by start-up and shut-down, which the
// host's loader runs while no other entry point can run; everything else
// reads them without a lock. agentList is the exception: see agent/agent.h.
#pragma once

#include "platform/zel.h"

// Every live agent record (SLCGenericAgent::link), oldest first.
extern ListLinks agentList;
extern ZelModuleID slcGenericModuleID;                 // -1 when not started
extern ZelHeapID slcGenericHeapID;                     // null = none
extern ZelLogHandle slcGenericLogHandle;               // null = none
extern ZelTimerQueueHandle slcGenericTimerQueue;       // null = none
extern ZelLockDomainID slcGenericLockDomain;           // -1 = none
extern ZelClientPortHandle slcGenericPortClient;       // null = none
extern const ZelPGXPropOps slcGenericCreateAgentOps;

// Load-time parameters (the host may override them before init_module).
extern int32_t SLCGENERIC_SLOWPATH_TIMEOUT;   // ms, every request to a slow path
extern int32_t SLCGENERIC_HEAP_MAX_SIZE;      // bytes
extern int32_t SLCGENERIC_HEAP_MIN_SIZE;      // bytes

inline constexpr const char kSLCGenericModuleName[] = "sluice-generic-fastpath";
inline constexpr const char kSLCGenericCreateAgentPropName[] = "com.quelmar.common.sluice-generic";
inline constexpr const char kSLCGenericDefaultAgentName[] = "sluice-generic-quelmar";

// Log urgencies.
inline constexpr int32_t SLCG_PROGRESS = 1;
inline constexpr int32_t SLCG_ATTENTION = 2;

// The module as the host's loader sees it.
extern const ZelModuleImage slcGenericModuleImage;

// 0 when the module is running, 1 when start-up failed.
int init_module();
void cleanup_module();

// Creates the module-wide resources in order; on failure undoes them and
// returns the failed call's status.
[[nodiscard]] ZelStatus SLCGenericInit(const char* moduleName, const char* createAgentPropName);
// Tears down agents (oldest first), then the resources in reverse order of
// creation. Safe after a partial start.
void SLCGenericCleanup();

// A zero-filled block of `size` bytes from the module heap, or null.
// Logs nothing.
void* SLCGenericAlloc(uint32_t size);
void SLCGenericFree(void* block);

// Logging. Long form whenever the module log exists; without it, urgency-2
// messages go out in the host's short form and urgency-1 messages are lost.
// SLCG_LOG names no object; SLCG_LOG_OBJ names a filter or an agent.
#define SLCG_LOG(urgency, fmt, ...)                                                          \
  do {                                                                                       \
    if (slcGenericLogHandle != nullptr) {                                                    \
      zel_LogLevel((urgency), slcGenericLogHandle,                                           \
                   zel_LogGetCurrentLogLevel(slcGenericLogHandle), "%s: %s:%d: " fmt "\n",   \
                   zel_LogGetName(slcGenericLogHandle), __func__,                            \
                   __LINE__ __VA_OPT__(, ) __VA_ARGS__);                                     \
    } else if ((urgency) == SLCG_ATTENTION) {                                                \
      zel_LogNoLevel(SLCG_ATTENTION, fmt "\n" __VA_OPT__(, ) __VA_ARGS__);                   \
    }                                                                                        \
  } while (0)

#define SLCG_LOG_OBJ(urgency, object, fmt, ...)                                              \
  do {                                                                                       \
    if (slcGenericLogHandle != nullptr) {                                                    \
      zel_LogLevel((urgency), slcGenericLogHandle,                                           \
                   zel_LogGetCurrentLogLevel(slcGenericLogHandle),                           \
                   "%s: %s:%d: %s: " fmt "\n", zel_LogGetName(slcGenericLogHandle),          \
                   __func__, __LINE__, (object) __VA_OPT__(, ) __VA_ARGS__);                 \
    } else if ((urgency) == SLCG_ATTENTION) {                                                \
      zel_LogNoLevel(SLCG_ATTENTION, "%s: " fmt "\n", (object) __VA_OPT__(, ) __VA_ARGS__);  \
    }                                                                                        \
  } while (0)
