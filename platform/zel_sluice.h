// The Sluice network filter framework: what a fast path agent registers,
// the callbacks the framework makes, and the calls the agent makes back.
//
// Contract, as the module relies on it:
//  - After zel_SluiceRegisterFastPath succeeds, callbacks may arrive on any
//    host context; the private pointer given at registration comes back as
//    the first argument of the agent-level callbacks (register slow path,
//    create filter). Per-filter callbacks get the filter's private pointer,
//    slow path callbacks the slow path's.
//  - zel_SluiceUnregisterFastPath returns only after every filter of the
//    agent has been destroyed (destroy is called again while it answers
//    ZEL_BUSY) and every slow path unregistered; no callback follows.
//  - An asynchronous request that returns ZEL_OK gets exactly one reply, which
//    may arrive on any context, also before the request call has returned. A
//    refused request gets none.
//  - zel_SluiceClearSlowPath is synchronous; ZEL_BUSY, ZEL_WOULD_BLOCK and
//    ZEL_NO_MEMORY from it are transient.
//  - FaultPackets and IssuePackets take over every packet of the list.
#pragma once

#include "platform/zel_pkt.h"

struct ZelSluiceFastPath;
struct ZelSluiceFilter;
struct ZelSluiceProperty;

using ZelSluiceFastPathHandle = ZelSluiceFastPath*;
using ZelSluiceFilterHandle = ZelSluiceFilter*;
using ZelSluicePropHandle = ZelSluiceProperty*;

inline constexpr uint32_t ZEL_SLUICE_FASTPATH_VERSION = 0x01010000;

// Packet directions.
inline constexpr uint32_t ZEL_SLUICE_DIR_FROM_SWITCH = 1;
inline constexpr uint32_t ZEL_SLUICE_DIR_TO_SWITCH = 2;

// The 13 callbacks a fast path agent registers, in slot order.
struct ZelSluiceFastPathOps {
  ZelStatus (*registerSlowPath)(void* agentPriv, uint32_t slowPathId, void** slowPathPriv);
  ZelStatus (*unregisterSlowPath)(void* slowPathPriv);
  ZelStatus (*createFilter)(void* agentPriv, ZelSluiceFilterHandle handle, void** filterPriv,
                            uint8_t flag);
  ZelStatus (*destroyFilter)(void* filterPriv);
  void (*prefetchSavedState)(void* filterPriv);
  ZelStatus (*getSavedStateLen)(void* filterPriv, uint64_t* len);
  ZelStatus (*saveState)(void* filterPriv, void* buf, uint64_t* len);
  ZelStatus (*restoreState)(void* filterPriv, const void* buf, uint64_t len);
  ZelStatus (*processPackets)(void* filterPriv, ZelPktList* list, uint32_t direction);
  ZelStatus (*processSlowPathPackets)(void* filterPriv, ZelPktList* list, uint32_t direction);
  void (*processFilterIoctl)(void* filterPriv, uint32_t requestCode, void* payload,
                             uint64_t payloadLen);
  void (*processSlowPathIoctl)(void* slowPathPriv, uint32_t requestCode, void* payload,
                               uint64_t payloadLen);
  void (*configurationChanged)(void* filterPriv);
};

[[nodiscard]] ZelStatus zel_SluiceRegisterFastPath(const char* name, uint32_t version,
                                                   uint32_t opsVersion, ZelModuleID module,
                                                   const ZelSluiceFastPathOps* ops, void* priv,
                                                   ZelSluiceFastPathHandle* handle);
[[nodiscard]] ZelStatus zel_SluiceUnregisterFastPath(ZelSluiceFastPathHandle handle);

// Filter configuration queries.
[[nodiscard]] ZelStatus zel_SluiceGetName(ZelSluiceFilterHandle filter, char* buf, uint32_t size);
// ZEL_NOT_INITIALIZED when the filter's VM has no UUID.
[[nodiscard]] ZelStatus zel_SluiceGetVMUUID(ZelSluiceFilterHandle filter, char* buf, uint32_t size);
[[nodiscard]] ZelStatus zel_SluiceGetFailurePolicy(ZelSluiceFilterHandle filter, uint32_t* policy);
[[nodiscard]] ZelStatus zel_SluiceGetEndPointType(ZelSluiceFilterHandle filter, uint32_t* type);
[[nodiscard]] ZelStatus zel_SluiceGetVnicIndex(ZelSluiceFilterHandle filter, uint32_t* index);
// Numbered configuration parameters 1 to 4, up to 256 bytes of text.
[[nodiscard]] ZelStatus zel_SluiceGetConfigParameter(ZelSluiceFilterHandle filter, uint32_t number,
                                                     char* buf, uint32_t size);

// Slow path link.
using ZelSluiceSetSlowPathReply = void (*)(void* filterPriv, void* cookie, ZelStatus status);
using ZelSluiceRetrieveStateReply = void (*)(void* filterPriv, void* cookie, const void* data,
                                             uint64_t len, uint32_t status);
using ZelSluiceRestoreStateReply = void (*)(void* filterPriv, void* cookie, uint32_t status);

[[nodiscard]] ZelStatus zel_SluiceSetSlowPath(ZelSluiceFilterHandle filter, uint32_t slowPathId,
                                              ZelSluiceSetSlowPathReply reply, void* cookie,
                                              uint32_t timeoutMs);
[[nodiscard]] ZelStatus zel_SluiceClearSlowPath(ZelSluiceFilterHandle filter);
[[nodiscard]] ZelStatus zel_SluiceRetrieveSlowPathState(ZelSluiceFilterHandle filter,
                                                        ZelSluiceRetrieveStateReply reply,
                                                        void* cookie, uint32_t timeoutMs);
[[nodiscard]] ZelStatus zel_SluiceRestoreSlowPathState(ZelSluiceFilterHandle filter,
                                                       const void* buf, uint64_t len,
                                                       ZelSluiceRestoreStateReply reply,
                                                       void* cookie, uint32_t timeoutMs);

// Packets.
[[nodiscard]] ZelStatus zel_SluiceFaultPackets(ZelSluiceFilterHandle filter, ZelPktList* list,
                                               uint32_t direction, uint32_t flags);
[[nodiscard]] ZelStatus zel_SluiceIssuePackets(ZelSluiceFilterHandle filter, ZelPktList* list,
                                               uint32_t direction);

// Filter ioctl channel.
using ZelSluiceIoctlReply = void (*)(void* filterPriv, void* cbData, const void* payload,
                                     uint32_t len, ZelStatus status);

[[nodiscard]] ZelStatus zel_SluiceSendFilterIoctlReply(ZelSluiceFilterHandle filter,
                                                       uint32_t requestCode, const void* msg,
                                                       uint32_t len);
[[nodiscard]] ZelStatus zel_SluiceSendFilterIoctlRequest(ZelSluiceFilterHandle filter,
                                                         const void* payload, uint32_t len,
                                                         ZelSluiceIoctlReply reply, void* cbData,
                                                         uint32_t cookie);

// Agent properties: the framework routes each operation to one filter and
// passes that filter's private pointer first. The second argument is the
// framework's own and is not used by handlers.
struct ZelSluicePropOps {
  ZelStatus (*write)(void* filterPriv, void* ctx, const void* data, uint32_t len);
  ZelStatus (*read)(void* filterPriv, void* ctx, void* buf);
  bool (*poll)(void* filterPriv, void* ctx, uint32_t* size);
  void (*cleanup)();
};

[[nodiscard]] ZelStatus zel_SluicePropertyRegister(ZelSluicePropHandle* handle, const char* name,
                                                   const ZelSluicePropOps* ops);
[[nodiscard]] ZelStatus zel_SluicePropertyUnregister(ZelSluicePropHandle handle);
