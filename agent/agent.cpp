// Agents: creation from create texts, the create-agent property, teardown,
// and the framework callback table every agent registers.

#include "agent/agent.h"

#include "control/control.h"
#include "firewall/firewall.h"
#include "migration/migration.h"

const ZelSluiceFastPathOps slcGenericOps = {
    SLCGenericRegisterSlowPath,       SLCGenericUnregisterSlowPath,
    SLCGenericCreateFilter,           SLCGenericDestroyFilter,
    SLCGenericPrefetchSavedState,     SLCGenericGetSavedStateLen,
    SLCGenericSaveState,              SLCGenericRestoreState,
    SLCGenericProcessPackets,         SLCGenericProcessSlowPathPackets,
    SLCGenericProcessFilterIoctl,     SLCGenericProcessSlowPathIoctl,
    SLCGenericConfigurationChanged,
};

bool SLCGenericMagicIs(const void* record, const char (&magic)[8]) {
  return record != nullptr && __builtin_memcmp(record, magic, sizeof(magic)) == 0;
}

void SLCGenericMagicKill(void* record) {
  auto* bytes = static_cast<uint8_t*>(record);
  for (size_t i = 0; i < 8; i++) {
    bytes[i] = static_cast<uint8_t>(~bytes[i]);
  }
}

void SLCGenericAgentListAppend(SLCGenericAgent* agent) {
  // Readers walk agentList without a lock, following next pointers from the
  // head; writers (the create-agent property and the status tree) may run at
  // the same time. The agent is complete before the compare-and-swap that
  // makes it reachable. A writer that finds the tail moved (another append
  // won between reading prev and the swap) waits for that append to publish
  // the new tail, which it does right after its own swap.
  agent->link.next = &agentList;
  for (;;) {
    ListLinks* last = __atomic_load_n(&agentList.prev, __ATOMIC_ACQUIRE);
    agent->link.prev = last;
    ListLinks* expected = &agentList;
    if (__atomic_compare_exchange_n(&last->next, &expected, &agent->link, false,
                                    __ATOMIC_RELEASE, __ATOMIC_RELAXED)) {
      __atomic_store_n(&agentList.prev, &agent->link, __ATOMIC_RELEASE);
      return;
    }
    __builtin_ia32_pause();
  }
}

namespace {

// Agents whose creation failed after they were registered and whose
// registration could not be undone (see SLCGenericInitFastPathAgent).
ListLinks retiredAgents = {&retiredAgents, &retiredAgents};

// Copies at most size - 1 bytes of `src` and a NUL.
void CopyText(char* dst, size_t size, const char* src) {
  size_t n = zel_Strnlen(src, size - 1);
  zel_Memcpy(dst, src, n);
  dst[n] = '\0';
}

// Destroys the agent's lock once nobody can use it: waits out anyone still
// inside it and cancels an attach pass still pending (a slow path may have
// registered as soon as the framework knew the agent), which would otherwise
// run on a freed agent.
void DestroyAgentLock(SLCGenericFastPath* fp) {
  ZelTimerHandle timer;
  {
    SLCGenericSpinGuard guard(fp->lock);
    timer = fp->attachTimer;
  }
  if (timer != 0) {
    zel_TimerCancel(slcGenericTimerQueue, timer, true);
  }
  zel_SpinlockDestroy(fp->lock);
  fp->lock = nullptr;
}

}  // namespace

ZelStatus SLCGenericInitFastPathAgent(char* createText) {
  auto* agent = static_cast<SLCGenericAgent*>(SLCGenericAlloc(sizeof(SLCGenericAgent)));
  if (agent == nullptr) {
    SLCG_LOG(SLCG_ATTENTION, "Failed to allocate memory for fast path agent");
    return ZEL_NO_MEMORY;
  }

  if (createText != nullptr) {
    char* colon = zel_Strchr(createText, ':');
    if (colon != nullptr) {
      *colon = '\0';
      CopyText(agent->config, sizeof(agent->config), colon + 1);
    }
    CopyText(agent->name, sizeof(agent->name), createText);
  }
  if (agent->name[0] == '\0') {
    SLCGenericFree(agent);
    return ZEL_OK;
  }

  SLCGenericFastPath* fp = &agent->fastPath;
  zel_Memcpy(fp->magic, kSLCGenericFastPathMagic, sizeof(fp->magic));
  fp->namePtr = agent->name;
  fp->configPtr = agent->config;
  fp->ops = &slcGenericFwFastPathOps;
  List_Init(&fp->filters);
  List_Init(&fp->slowPaths);

  ZelStatus status = zel_SpinlockCreate(slcGenericModuleID, slcGenericHeapID, "slcg.fastpath",
                                        ZEL_LOCK_PLAIN, slcGenericLockDomain, 2, &fp->lock);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to create lock (%#x): %s", status,
                 zel_StatusToString(status));
    SLCGenericMagicKill(fp);
    SLCGenericFree(agent);
    return status;
  }

  status = zel_SluiceRegisterFastPath(agent->name, ZEL_SLUICE_FASTPATH_VERSION,
                                      ZEL_SLUICE_FASTPATH_VERSION, slcGenericModuleID,
                                      &slcGenericOps, fp, &fp->fastPathHandle);
  if (status != ZEL_OK) {
    fp->fastPathHandle = nullptr;
    SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to register agent (%#x): %s", status,
                 zel_StatusToString(status));
    zel_SpinlockDestroy(fp->lock);
    SLCGenericMagicKill(fp);
    SLCGenericFree(agent);
    return status;
  }

  status = SLCGenericFWInitCharDev(fp);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to register agent (%#x): %s", status,
                 zel_StatusToString(status));
    // The framework destroys whatever filters it created meanwhile.
    const ZelStatus unreg = zel_SluiceUnregisterFastPath(fp->fastPathHandle);
    DestroyAgentLock(fp);
    SLCGenericMagicKill(fp);
    if (unreg != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to unregister agent (%#x): %s", unreg,
                   zel_StatusToString(unreg));
      // Still registered: the framework may call in with this record, so it
      // stays allocated (its callbacks refuse the killed magic) until
      // unload tries the unregistration again.
      List_InsertBefore(&agent->link, &retiredAgents);
      return status;
    }
    fp->fastPathHandle = nullptr;
    SLCGenericFree(agent);
    return status;
  }

  // A failure here is logged by the property code; the agent works without it.
  SLCGenericFWInitProperty(fp);

  SLCGenericAgentListAppend(agent);
  return ZEL_OK;
}

ZelStatus SLCGenericRegisterFastpath(char* createText) {
  char* colon = zel_Strchr(createText, ':');
  if (colon != nullptr) {
    *colon = '\0';
  }
  for (ListLinks* l = SLCGenericAgentListNext(&agentList); l != &agentList;
       l = SLCGenericAgentListNext(l)) {
    SLCGenericAgent* agent = SLCGenericAgentFromLink(l);
    if (zel_Strncmp(agent->name, createText, sizeof(agent->name)) == 0) {
      SLCG_LOG(SLCG_PROGRESS, "Agent %s already exists. Not recreating", createText);
      return ZEL_OK;
    }
  }
  if (colon != nullptr) {
    *colon = ':';
  }
  SLCG_LOG(SLCG_PROGRESS, "Registering new fastpath '%s'", createText);
  return SLCGenericInitFastPathAgent(createText);
}

ZelStatus SLCGenericAgentPropWrite(void*, void*, void*, char* data, int32_t len) {
  if (len < 0 || (len > 0 && data == nullptr)) {
    return ZEL_BAD_PARAM;
  }
  const uint32_t count = static_cast<uint32_t>(len);
  auto* text = static_cast<char*>(SLCGenericAlloc(count + 1));
  if (text == nullptr) {
    SLCG_LOG(SLCG_ATTENTION, "Failed to allocate memory for agent names");
    return ZEL_FAILURE;
  }
  if (count > 0) {
    zel_Memcpy(text, data, count);
  }
  text[count] = '\0';

  // Pieces end at single spaces; only a non-empty last piece is passed at
  // the end, so a trailing space adds nothing while doubled spaces pass empty
  // pieces, which create nothing.
  ZelStatus status = ZEL_OK;
  char* piece = text;
  for (char* p = text;; p++) {
    if (*p == ' ') {
      *p = '\0';
      status = SLCGenericRegisterFastpath(piece);
      if (status != ZEL_OK) {
        break;
      }
      piece = p + 1;
    } else if (*p == '\0') {
      if (*piece != '\0') {
        status = SLCGenericRegisterFastpath(piece);
      }
      break;
    }
  }
  SLCGenericFree(text);
  return status;
}

void SLCGenericCleanupRetiredAgents() {
  while (!List_IsEmpty(&retiredAgents)) {
    SLCGenericAgent* agent = SLCGenericAgentFromLink(retiredAgents.next);
    List_Remove(&agent->link);
    if (ZelStatus unreg = zel_SluiceUnregisterFastPath(agent->fastPath.fastPathHandle);
        unreg != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to unregister agent (%#x): %s", unreg,
                   zel_StatusToString(unreg));
    }
    SLCGenericFree(agent);
  }
}

void SLCGenericCleanupFastPathAgent(SLCGenericAgent* agent) {
  SLCGenericFastPath* fp = &agent->fastPath;

  SLCGenericFWCleanupProperty(fp);

  if (fp->fastPathHandle != nullptr) {
    // Returns once the framework has destroyed our filters and unregistered
    // our slow paths through our own callbacks.
    if (ZelStatus unreg = zel_SluiceUnregisterFastPath(fp->fastPathHandle); unreg != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, agent->name, "Failed to unregister agent (%#x): %s", unreg,
                   zel_StatusToString(unreg));
    }
    fp->fastPathHandle = nullptr;
  }

  if (fp->lock != nullptr) {
    DestroyAgentLock(fp);
  }

  SLCGenericFWCleanupCharDev(fp);

  SLCGenericMagicKill(fp);
  SLCGenericFree(agent);
}
