// Fast path agents, filter records, slow path records and the dispatch of
// framework callbacks to an agent's operations table.
//
// Locking. Three ranks, always taken in this order:
//   2  SLCGenericFastPath::lock   ("slcg.fastpath") filters, slowPaths,
//                                 attachTimer, attachRescan, slow path counts
//   3  SLCGenericFilter::lock     ("slcg.filter")   fields marked (L)
//   4  FWFilterContext::configLock ("slcg.fw.config", firewall/firewall.h)
// The attach timer runs at rank 1. Both the agent's and the filter's locks
// are released around every framework request that may call back; the
// filter's refCount keeps the record alive meanwhile (destroy answers
// ZEL_BUSY while it is above 1).
//
// agentList (module/module.h) has no lock: agents are only appended (by
// start-up, the create-agent property and the status tree) and removed at
// shut-down. An agent is fully initialised before it is linked, and the link
// is published with a release store, so a concurrent walk sees either the
// old end of the list or a complete agent.
#pragma once

#include "module/locks.h"
#include "module/module.h"

struct SLCGenericFilter;
struct SLCGenericSlowPath;

// Slow path attachment state of a filter.
enum SLCGenericSpAttachState : uint32_t {
  SLCGenericSpDetaching = 1,
  SLCGenericSpDetached = 2,
  SLCGenericSpAttaching = 3,
  SLCGenericSpAttached = 4,
};

// Save/restore state of a filter.
enum SLCGenericMigrationState : uint32_t {
  SLCGenericStateIdle = 1,
  SLCGenericStateFetching = 2,
  SLCGenericStateReady = 3,
  SLCGenericStateRestoring = 4,
};

// The operations an agent implements; the generic layer calls them with the
// filter record (slot 8: the slow path record). An empty slot has a defined
// meaning at each call site.
struct SLCGenericAgentOps {
  ZelStatus (*createFilter)(SLCGenericFilter* filter);                         // 0
  ZelStatus (*destroyFilter)(SLCGenericFilter* filter);                        // 1
  uint32_t (*getSavedStateLen)(SLCGenericFilter* filter);                      // 2
  // Writes at most `room` bytes of the agent's part at `dst`.
  void (*saveState)(SLCGenericFilter* filter, void* dst, uint32_t room);       // 3
  // Restores from the agent's part of `len` bytes at `src`.
  ZelStatus (*restoreState)(SLCGenericFilter* filter, const void* src, uint64_t len);  // 4
  ZelStatus (*processPackets)(SLCGenericFilter* filter, ZelPktList* list, uint32_t direction);  // 5
  ZelStatus (*processSlowPathPackets)(SLCGenericFilter* filter, ZelPktList* list,
                                      uint32_t direction);                     // 6
  void (*filterIoctlRequest)(SLCGenericFilter* filter, uint32_t requestCode, void* payload,
                             uint64_t payloadLen);                             // 7
  void (*slowPathIoctl)(SLCGenericSlowPath* slowPath, uint32_t requestCode, void* payload,
                        uint64_t payloadLen);                                  // 8
  void (*configurationChanged)(SLCGenericFilter* filter);                      // 9
  // Called with the agent's and the filter's locks held.
  void (*spAttachStateChanged)(SLCGenericFilter* filter);                      // 10
};

inline constexpr char kSLCGenericFastPathMagic[8] = {'s', 'l', 'c', 'g', 'f', 'a', 's', 't'};
inline constexpr char kSLCGenericFilterMagic[8] = {'s', 'l', 'c', 'g', 'f', 'i', 'l', 't'};
inline constexpr char kSLCGenericSlowPathMagic[8] = {'s', 'l', 'c', 'g', 's', 'l', 'o', 'w'};

// The part of an agent the framework knows; its address is the agent's
// private pointer.
struct SLCGenericFastPath {
  char magic[8];                        // "slcgfast"; complemented when freed
  const char* namePtr;                  // the agent's name
  const char* configPtr;                // the agent's configuration text
  ZelSluiceFastPathHandle fastPathHandle;
  const SLCGenericAgentOps* ops;        // slcGenericFwFastPathOps
  ZelSluicePropHandle rulesetProp;      // "%s.ruleset", null when not registered
  ZelCharDevHandle charDev;             // null when not registered
  ZelLock* lock;                        // rank 2
  ListLinks filters;                    // (lock) SLCGenericFilter::link, oldest first
  ListLinks slowPaths;                  // (lock) SLCGenericSlowPath::link, oldest first
  ZelTimerHandle attachTimer;           // (lock) pending attach pass, 0 = none
  uint8_t attachRescan;                 // (lock) a slow path registered during the pass
};

struct SLCGenericAgent {
  ListLinks link;                       // in agentList
  char name[100];
  char config[128];
  SLCGenericFastPath fastPath;
};

inline constexpr uint32_t kSLCGenericVnicIndexNone = 0xFFFFFFFFu;

struct SLCGenericFilter {
  char magic[8];                        // "slcgfilt"; complemented when freed
  ZelLock* lock;                        // rank 3, guards fields marked (L)
  ListLinks link;                       // in fastPath->filters (agent lock)
  ZelSluiceFilterHandle handle;
  uint32_t refCount;                    // (L) 1 for the framework + requests in flight
  uint32_t spRetries;                   // (L)
  void* slowPathState;                  // (L) fetched for saving, owned here
  uint64_t slowPathStateLen;            // (L)
  SLCGenericSlowPath* slowPath;         // (L) attached or being attached
  SLCGenericFastPath* fastPath;
  SLCGenericSpAttachState spAttachState;      // (L)
  SLCGenericMigrationState migrationState;    // (L)
  void* agentPriv;                      // the agent's per-filter context
  char name[100];
  char vmUUID[128];
  uint32_t failurePolicy;
  uint32_t endPointType;
  uint32_t vnicIndex;
};

struct SLCGenericSlowPath {
  char magic[8];                        // "slcgslow"; complemented when freed
  ListLinks link;                       // in fastPath->slowPaths (agent lock)
  uint32_t id;
  uint32_t useCount;                    // (agent lock) 1 + filters attached or attaching
  uint32_t numFilters;                  // (agent lock) filters attached or attaching
  SLCGenericFastPath* fastPath;
};

// Magic helpers. A record's magic is compared before anything else of it is
// touched; freeing a record complements it first.
bool SLCGenericMagicIs(const void* record, const char (&magic)[8]);
void SLCGenericMagicKill(void* record);

// The framework callback table every agent registers.
extern const ZelSluiceFastPathOps slcGenericOps;

// --- Agents ---------------------------------------------------------------

// Create-agent property write handler.
[[nodiscard]] ZelStatus SLCGenericAgentPropWrite(void* ctx0, void* ctx1, void* ctx2, char* data,
                                                 int32_t len);
// Creates the agent of one create text unless one of that name exists.
[[nodiscard]] ZelStatus SLCGenericRegisterFastpath(char* createText);
// Creates, registers and lists an agent from one create text (may be null).
[[nodiscard]] ZelStatus SLCGenericInitFastPathAgent(char* createText);
// Tears down an agent already unlinked from agentList, and frees it.
void SLCGenericCleanupFastPathAgent(SLCGenericAgent* agent);
// Unload: unregisters and frees the agents a failed creation could not
// unregister.
void SLCGenericCleanupRetiredAgents();
// Links an agent at the end of agentList (publishing it to lock-free walks).
void SLCGenericAgentListAppend(SLCGenericAgent* agent);
// The next link of a lock-free walk of agentList.
inline ListLinks* SLCGenericAgentListNext(ListLinks* l) {
  return __atomic_load_n(&l->next, __ATOMIC_ACQUIRE);
}

inline SLCGenericAgent* SLCGenericAgentFromLink(ListLinks* l) {
  return LIST_CONTAINER(l, SLCGenericAgent, link);
}
inline SLCGenericFilter* SLCGenericFilterFromLink(ListLinks* l) {
  return LIST_CONTAINER(l, SLCGenericFilter, link);
}
inline SLCGenericSlowPath* SLCGenericSlowPathFromLink(ListLinks* l) {
  return LIST_CONTAINER(l, SLCGenericSlowPath, link);
}

// --- Filters --------------------------------------------------------------

[[nodiscard]] ZelStatus SLCGenericCreateFilter(void* fastPath, ZelSluiceFilterHandle handle,
                                               void** filterPriv, uint8_t flag);
[[nodiscard]] ZelStatus SLCGenericDestroyFilter(void* filter);
[[nodiscard]] ZelStatus SLCGenericProcessPackets(void* filter, ZelPktList* list, uint32_t direction);
[[nodiscard]] ZelStatus SLCGenericProcessSlowPathPackets(void* filter, ZelPktList* list,
                                                         uint32_t direction);
void SLCGenericProcessFilterIoctl(void* filter, uint32_t requestCode, void* payload,
                                  uint64_t payloadLen);
void SLCGenericProcessSlowPathIoctl(void* slowPath, uint32_t requestCode, void* payload,
                                    uint64_t payloadLen);
void SLCGenericConfigurationChanged(void* filter);
[[nodiscard]] ZelStatus SLCGenericReadConfiguration(SLCGenericFilter* filter);

// --- Slow paths -----------------------------------------------------------

[[nodiscard]] ZelStatus SLCGenericRegisterSlowPath(void* fastPath, uint32_t id, void** slowPathPriv);
[[nodiscard]] ZelStatus SLCGenericUnregisterSlowPath(void* slowPath);
// Both locks held (agent, then filter); filter in SLCGenericSpDetached.
void SLCGenericAttachSlowPath(SLCGenericFilter* filter);
// Both locks held; filter attached (or attaching after a refused request).
[[nodiscard]] ZelStatus SLCGenericDetachSlowPath(SLCGenericFilter* filter);
void SLCGenericSetSlowPathReply(void* filter, void* cookie, ZelStatus status);
void SLCGenericAttachSlowPathsToFilters(void* fastPath);
// Agent lock held.
void SLCGenericScheduleAttach(SLCGenericFastPath* fastPath);
// Sets the filter's attachment state and tells the agent (both locks held).
void SLCGenericSetSpAttachState(SLCGenericFilter* filter, SLCGenericSpAttachState state);
