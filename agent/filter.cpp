// Filter records: creation, configuration, destruction, and the dispatch of
// per-filter framework callbacks to the agent's operations table.

#include "agent/agent.h"

namespace {

// Copies text from the framework and makes sure it ends inside the field.
void Terminate(char* field, size_t size) { field[size - 1] = '\0'; }

}  // namespace

ZelStatus SLCGenericReadConfiguration(SLCGenericFilter* filter) {
  ZelStatus status = zel_SluiceGetName(filter->handle, filter->name, sizeof(filter->name));
  if (status != ZEL_OK) {
    SLCG_LOG(SLCG_ATTENTION, "Could not get filter name (%#x): %s", status,
             zel_StatusToString(status));
    return status;
  }
  Terminate(filter->name, sizeof(filter->name));

  status = zel_SluiceGetFailurePolicy(filter->handle, &filter->failurePolicy);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Could not get filter failure policy (%#x): %s",
                 status, zel_StatusToString(status));
    return status;
  }

  status = zel_SluiceGetEndPointType(filter->handle, &filter->endPointType);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Could not get filter endpoint type (%#x): %s",
                 status, zel_StatusToString(status));
    return status;
  }

  filter->vmUUID[0] = '\0';
  filter->vnicIndex = kSLCGenericVnicIndexNone;
  if (filter->endPointType != 0) {
    return ZEL_OK;
  }

  status = zel_SluiceGetVMUUID(filter->handle, filter->vmUUID, sizeof(filter->vmUUID));
  if (status != ZEL_OK && status != ZEL_NOT_INITIALIZED) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Could not get filter vm uuid (%#x): %s", status,
                 zel_StatusToString(status));
    return status;
  }
  Terminate(filter->vmUUID, sizeof(filter->vmUUID));

  status = zel_SluiceGetVnicIndex(filter->handle, &filter->vnicIndex);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Could not get filter vnic index (%#x): %s",
                 status, zel_StatusToString(status));
    return status;
  }
  return ZEL_OK;
}

ZelStatus SLCGenericCreateFilter(void* fastPathPriv, ZelSluiceFilterHandle handle,
                                 void** filterPriv, uint8_t /*flag*/) {
  if (!SLCGenericMagicIs(fastPathPriv, kSLCGenericFastPathMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for fastPath");
    return ZEL_BAD_PARAM;
  }
  auto* fp = static_cast<SLCGenericFastPath*>(fastPathPriv);

  auto* filter = static_cast<SLCGenericFilter*>(SLCGenericAlloc(sizeof(SLCGenericFilter)));
  if (filter == nullptr) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, fp->namePtr, "Failed to allocate memory for filter");
    return ZEL_NO_MEMORY;
  }
  zel_Memcpy(filter->magic, kSLCGenericFilterMagic, sizeof(filter->magic));
  filter->handle = handle;
  filter->refCount = 1;
  filter->fastPath = fp;
  filter->spAttachState = SLCGenericSpDetached;
  filter->migrationState = SLCGenericStateIdle;
  filter->vnicIndex = kSLCGenericVnicIndexNone;

  ZelStatus status = SLCGenericReadConfiguration(filter);
  if (status != ZEL_OK) {
    SLCGenericMagicKill(filter);
    SLCGenericFree(filter);
    return status;
  }

  status = zel_SpinlockCreate(slcGenericModuleID, slcGenericHeapID, "slcg.filter", ZEL_LOCK_PLAIN,
                              slcGenericLockDomain, 3, &filter->lock);
  if (status != ZEL_OK) {
    SLCGenericMagicKill(filter);
    SLCGenericFree(filter);
    return status;
  }

  if (fp->ops->createFilter != nullptr) {
    status = fp->ops->createFilter(filter);
    if (status != ZEL_OK) {
      zel_SpinlockDestroy(filter->lock);
      SLCGenericMagicKill(filter);
      SLCGenericFree(filter);
      return status;
    }
  }

  *filterPriv = filter;

  SLCGenericSpinGuard agentGuard(fp->lock);
  List_InsertBefore(&filter->link, &fp->filters);
  SLCGenericSpinGuard filterGuard(filter->lock);
  SLCGenericAttachSlowPath(filter);
  return ZEL_OK;
}

ZelStatus SLCGenericDestroyFilter(void* filterPriv) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_OK;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericFastPath* fp = filter->fastPath;

  {
    SLCGenericSpinGuard agentGuard(fp->lock);
    SLCGenericSpinGuard filterGuard(filter->lock);
    if (filter->spAttachState == SLCGenericSpAttached) {
      // A clear that failed transiently leaves the filter attached and
      // counted by its slow path; freeing it now would leave that count
      // raised for good and the slow path could never go. The framework
      // calls destroy again, which retries the clear.
      if (SLCGenericDetachSlowPath(filter) != ZEL_OK) {
        return ZEL_BUSY;
      }
    }
    if (filter->refCount > 1) {
      return ZEL_BUSY;
    }
    if (List_IsLinked(&filter->link)) {
      List_Remove(&filter->link);
    }
  }

  if (fp->ops->destroyFilter != nullptr) {
    ZelStatus status = fp->ops->destroyFilter(filter);
    if (status != ZEL_OK) {
      return status;
    }
  }

  zel_SpinlockDestroy(filter->lock);
  filter->lock = nullptr;
  if (filter->slowPathState != nullptr) {
    SLCGenericFree(filter->slowPathState);
    filter->slowPathState = nullptr;
    filter->slowPathStateLen = 0;
  }
  SLCGenericMagicKill(filter);
  SLCGenericFree(filter);
  return ZEL_OK;
}

ZelStatus SLCGenericProcessPackets(void* filterPriv, ZelPktList* list, uint32_t direction) {
  if (__builtin_expect(!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic), 0)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_BAD_PARAM;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (ops->processPackets == nullptr) {
    return ZEL_OK;
  }
  return ops->processPackets(filter, list, direction);
}

ZelStatus SLCGenericProcessSlowPathPackets(void* filterPriv, ZelPktList* list, uint32_t direction) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_BAD_PARAM;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (ops->processSlowPathPackets == nullptr) {
    return ZEL_FAILURE;
  }
  return ops->processSlowPathPackets(filter, list, direction);
}

void SLCGenericProcessFilterIoctl(void* filterPriv, uint32_t requestCode, void* payload,
                                  uint64_t payloadLen) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (ops->filterIoctlRequest != nullptr) {
    ops->filterIoctlRequest(filter, requestCode, payload, payloadLen);
  }
}

void SLCGenericProcessSlowPathIoctl(void* slowPathPriv, uint32_t requestCode, void* payload,
                                    uint64_t payloadLen) {
  if (!SLCGenericMagicIs(slowPathPriv, kSLCGenericSlowPathMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for slowPath");
    return;
  }
  auto* slowPath = static_cast<SLCGenericSlowPath*>(slowPathPriv);
  const SLCGenericAgentOps* ops = slowPath->fastPath->ops;
  if (ops->slowPathIoctl != nullptr) {
    ops->slowPathIoctl(slowPath, requestCode, payload, payloadLen);
  }
}

void SLCGenericConfigurationChanged(void* filterPriv) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  // A failure is logged by the read; the agent is told either way.
  (void)SLCGenericReadConfiguration(filter);
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (ops->configurationChanged != nullptr) {
    ops->configurationChanged(filter);
  }
}
