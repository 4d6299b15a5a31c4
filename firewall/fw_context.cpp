// The firewall's per-filter context: creation with the agent's default
// action, destruction, configuration and attachment changes, and the
// firewall agent's operations table.

#include "firewall/firewall.h"

const SLCGenericAgentOps slcGenericFwFastPathOps = {
    FWCreateFilter,           // 0 createFilter
    FWDestroyFilter,          // 1 destroyFilter
    FWGetSavedStateLen,       // 2 getSavedStateLen
    FWSaveState,              // 3 saveState
    FWRestoreState,           // 4 restoreState
    FWProcessPackets,         // 5 processPackets
    FWProcessSlowPathPackets, // 6 processSlowPathPackets
    FWFilterIoctlRequest,     // 7 filterIoctlRequest
    nullptr,                  // 8 slowPathIoctl: the firewall has no slow path ioctls
    FWConfigurationChanged,   // 9 configurationChanged
    FWSpAttachStateChanged,   // 10 spAttachStateChanged
};

namespace {

constexpr char kDefaultActionKey[] = "default-action=";
constexpr size_t kDefaultActionKeyLen = sizeof(kDefaultActionKey) - 1;

struct DefaultActionKeyword {
  const char* word;
  size_t len;
  SLCGenericActionEnum action;
};

// Compared in this order, each over its own length only.
constexpr DefaultActionKeyword kDefaultActionKeywords[] = {
    {"ACTION_PUNT", sizeof("ACTION_PUNT") - 1, SLCGenericActionPunt},
    {"ACTION_DROP", sizeof("ACTION_DROP") - 1, SLCGenericActionDrop},
    {"ACTION_ACCEPT", sizeof("ACTION_ACCEPT") - 1, SLCGenericActionAccept},
};

uint32_t DefaultActionFromConfig(const SLCGenericFilter* filter) {
  const char* config = filter->fastPath->configPtr;
  if (config == nullptr || zel_Strncmp(config, kDefaultActionKey, kDefaultActionKeyLen) != 0) {
    return SLCGenericActionAccept;
  }
  const char* value = config + kDefaultActionKeyLen;
  for (const DefaultActionKeyword& k : kDefaultActionKeywords) {
    if (zel_Strncmp(value, k.word, k.len) == 0) {
      return k.action;
    }
  }
  SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Invalid default action specified: %s", value);
  return SLCGenericActionAccept;
}

}  // namespace

ZelStatus FWCreateFilter(SLCGenericFilter* filter) {
  auto* ctx = static_cast<FWFilterContext*>(SLCGenericAlloc(sizeof(FWFilterContext)));
  if (ctx == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate memory for agent context");
    (void)FWDestroyFilter(filter);
    return ZEL_NO_MEMORY;
  }
  filter->agentPriv = ctx;

  ctx->filter = filter;
  List_Init(&ctx->ruleList);
  ctx->ruleHash = nullptr;
  ctx->defaultAction = SLCGenericActionAccept;
  ctx->spAttachState = SLCGenericSpDetached;
  ctx->version = FW_RULESET_VERSION_8;
  ctx->fragOverride = SLCGenericActionNone;
  ctx->fwFeatures = 0;
  ctx->numRules = 0;
  ctx->ioctl = 0;
  ctx->scanIndex = nullptr;
  ctx->generation = 0;
  ctx->defaultAction = DefaultActionFromConfig(filter);

  ZelStatus status = zel_SpinlockCreate(slcGenericModuleID, slcGenericHeapID, "slcg.fw.config",
                                        ZEL_LOCK_RW, slcGenericLockDomain, 4, &ctx->configLock);
  if (status != ZEL_OK) {
    ctx->configLock = nullptr;
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Could not allocate configuration lock");
    (void)FWDestroyFilter(filter);
    return status;
  }
  return ZEL_OK;
}

ZelStatus FWDestroyFilter(SLCGenericFilter* filter) {
  FWFilterContext* ctx = FWContext(filter);
  filter->agentPriv = nullptr;
  if (ctx == nullptr) {
    return ZEL_OK;
  }
  // The filter is unlisted and the framework sends it nothing more, so no
  // lock is needed from here on.
  if (ctx->configLock != nullptr) {
    zel_SpinlockDestroy(ctx->configLock);
    ctx->configLock = nullptr;
  }
  FWClearRules(ctx);
  SLCGenericFree(ctx);
  return ZEL_OK;
}

void FWConfigurationChanged(SLCGenericFilter*) {
  // The default action is fixed when the filter is created; the generic
  // layer has already re-read the filter's own configuration fields.
}

void FWSpAttachStateChanged(SLCGenericFilter* filter) {
  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) {
    return;
  }
  SLCGenericWriteGuard guard(ctx->configLock);
  ctx->spAttachState = filter->spAttachState;
}
