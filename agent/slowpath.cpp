// Slow paths: registration, the attach pass, attachment to the least-loaded
// slow path with retries, detachment, and unregistration.
//
// Every framework request that may call back (set and clear slow path) is
// made with the agent's and the filter's locks released; the filter's
// refCount keeps the record alive meanwhile, and the state fields tell a
// reply what it finds.

#include "agent/agent.h"

namespace {

// Releases the filter's lock and then the agent's for the life of the scope
// and takes them again, in lock order, when it ends. The caller holds both.
class [[nodiscard]] LocksDropped {
 public:
  explicit LocksDropped(SLCGenericFilter* filter) : filter_(filter) {
    zel_SpinlockUnlock(filter_->lock);
    zel_SpinlockUnlock(filter_->fastPath->lock);
  }
  ~LocksDropped() {
    zel_SpinlockLock(filter_->fastPath->lock);
    zel_SpinlockLock(filter_->lock);
  }
  LocksDropped(const LocksDropped&) = delete;
  LocksDropped& operator=(const LocksDropped&) = delete;

 private:
  SLCGenericFilter* filter_;
};

bool IsTransientClearFailure(ZelStatus status) {
  return status == ZEL_BUSY || status == ZEL_WOULD_BLOCK || status == ZEL_NO_MEMORY;
}

// Both locks held. Makes the request; a refusal undoes the attachment.
// The caller has taken one reference for the reply; this takes and drops one
// for the call itself.
void RequestSetSlowPath(SLCGenericFilter* filter, SLCGenericSlowPath* slowPath) {
  filter->refCount++;
  ZelStatus status;
  {
    LocksDropped dropped(filter);
    status = zel_SluiceSetSlowPath(filter->handle, slowPath->id, SLCGenericSetSlowPathReply,
                                   slowPath, static_cast<uint32_t>(SLCGENERIC_SLOWPATH_TIMEOUT));
  }
  filter->refCount--;
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Request to set slow path failed (%#x): %s", status,
                 zel_StatusToString(status));
    // In state attaching this only undoes the choice; it cannot fail.
    (void)SLCGenericDetachSlowPath(filter);
    filter->refCount--;  // no reply will come
  }
}

}  // namespace

void SLCGenericSetSpAttachState(SLCGenericFilter* filter, SLCGenericSpAttachState state) {
  filter->spAttachState = state;
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (ops->spAttachStateChanged != nullptr) {
    ops->spAttachStateChanged(filter);
  }
}

ZelStatus SLCGenericRegisterSlowPath(void* fastPathPriv, uint32_t id, void** slowPathPriv) {
  if (!SLCGenericMagicIs(fastPathPriv, kSLCGenericFastPathMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for fastPath");
    return ZEL_BAD_PARAM;
  }
  auto* fp = static_cast<SLCGenericFastPath*>(fastPathPriv);

  auto* slowPath = static_cast<SLCGenericSlowPath*>(SLCGenericAlloc(sizeof(SLCGenericSlowPath)));
  if (slowPath == nullptr) {
    return ZEL_NO_MEMORY;
  }
  zel_Memcpy(slowPath->magic, kSLCGenericSlowPathMagic, sizeof(slowPath->magic));
  slowPath->id = id;
  slowPath->useCount = 1;
  slowPath->numFilters = 0;
  slowPath->fastPath = fp;

  SLCGenericSpinGuard agentGuard(fp->lock);
  List_InsertBefore(&slowPath->link, &fp->slowPaths);
  *slowPathPriv = slowPath;
  // Filters are attached by the timer pass, never inside this call.
  if (fp->attachTimer != 0) {
    fp->attachRescan = 1;
  } else {
    SLCGenericScheduleAttach(fp);
  }
  return ZEL_OK;
}

void SLCGenericScheduleAttach(SLCGenericFastPath* fp) {
  ZelStatus status =
      zel_TimerSchedule(slcGenericTimerQueue, SLCGenericAttachSlowPathsToFilters, fp, 0, -1, 0,
                        slcGenericLockDomain, 1, &fp->attachTimer);
  if (status != ZEL_OK) {
    fp->attachTimer = 0;
    SLCG_LOG_OBJ(SLCG_ATTENTION, fp->namePtr, "Could not schedule callback (%#x): %s", status,
                 zel_StatusToString(status));
  }
}

void SLCGenericAttachSlowPathsToFilters(void* fastPathPriv) {
  if (!SLCGenericMagicIs(fastPathPriv, kSLCGenericFastPathMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for fastPath");
    return;
  }
  auto* fp = static_cast<SLCGenericFastPath*>(fastPathPriv);

  SLCGenericSpinGuard agentGuard(fp->lock);
  do {
    fp->attachRescan = 0;
    if (List_IsEmpty(&fp->slowPaths)) {
      break;
    }
    // Attaching drops the agent's lock; the filter being attached holds
    // references, so it stays listed and its next link is read afresh.
    for (ListLinks* l = fp->filters.next; l != &fp->filters; l = l->next) {
      SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
      SLCGenericSpinGuard filterGuard(filter->lock);
      if (filter->spAttachState == SLCGenericSpDetached) {
        SLCGenericAttachSlowPath(filter);
      }
    }
  } while (fp->attachRescan != 0);
  fp->attachTimer = 0;
}

void SLCGenericAttachSlowPath(SLCGenericFilter* filter) {
  SLCGenericFastPath* fp = filter->fastPath;

  // Least loaded; ties go to the oldest registration.
  SLCGenericSlowPath* choice = nullptr;
  for (ListLinks* l = fp->slowPaths.next; l != &fp->slowPaths; l = l->next) {
    SLCGenericSlowPath* sp = SLCGenericSlowPathFromLink(l);
    if (choice == nullptr || sp->numFilters < choice->numFilters) {
      choice = sp;
    }
  }
  if (choice == nullptr) {
    return;
  }

  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Attaching to slow path #%u", choice->id);
  filter->slowPath = choice;
  filter->spRetries = 0;
  SLCGenericSetSpAttachState(filter, SLCGenericSpAttaching);
  choice->numFilters++;
  choice->useCount++;
  filter->refCount++;  // for the reply
  RequestSetSlowPath(filter, choice);
}

void SLCGenericSetSlowPathReply(void* filterPriv, void* cookie, ZelStatus status) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  auto* slowPath = static_cast<SLCGenericSlowPath*>(cookie);

  SLCGenericSpinGuard agentGuard(filter->fastPath->lock);
  SLCGenericSpinGuard filterGuard(filter->lock);
  if (status == ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Successfully set slow path #%u", slowPath->id);
    SLCGenericSetSpAttachState(filter, SLCGenericSpAttached);
    filter->refCount--;
    return;
  }

  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Couldn't set slow path (%#x): %s", status,
               zel_StatusToString(status));
  filter->spRetries++;
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Retry (#%d) to attach slow path #%u",
               static_cast<int>(filter->spRetries), slowPath->id);
  // The reference held for this reply passes to the new request's reply.
  RequestSetSlowPath(filter, slowPath);
}

ZelStatus SLCGenericDetachSlowPath(SLCGenericFilter* filter) {
  SLCGenericSlowPath* slowPath = filter->slowPath;
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Detaching from slow path #%u", slowPath->id);

  if (filter->spAttachState != SLCGenericSpAttaching) {
    if (filter->migrationState == SLCGenericStateFetching) {
      // The slow path's state will not come; save without it.
      filter->migrationState = SLCGenericStateReady;
    }
    SLCGenericSetSpAttachState(filter, SLCGenericSpDetaching);
    filter->refCount++;
    ZelStatus status;
    {
      LocksDropped dropped(filter);
      status = zel_SluiceClearSlowPath(filter->handle);
    }
    filter->refCount--;
    if (IsTransientClearFailure(status)) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                   "Transient failure in clearing slow path (%#x): %s", status,
                   zel_StatusToString(status));
      SLCGenericSetSpAttachState(filter, SLCGenericSpAttached);
      return ZEL_BUSY;
    }
    if (status != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Request to clear slow path failed (%#x): %s",
                   status, zel_StatusToString(status));
    }
  }

  slowPath->numFilters--;
  slowPath->useCount--;
  filter->slowPath = nullptr;
  SLCGenericSetSpAttachState(filter, SLCGenericSpDetached);
  return ZEL_OK;
}

ZelStatus SLCGenericUnregisterSlowPath(void* slowPathPriv) {
  if (!SLCGenericMagicIs(slowPathPriv, kSLCGenericSlowPathMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for slowPath");
    return ZEL_OK;
  }
  auto* slowPath = static_cast<SLCGenericSlowPath*>(slowPathPriv);
  SLCGenericFastPath* fp = slowPath->fastPath;

  SLCGenericSpinGuard agentGuard(fp->lock);
  // Unlisted first, so that no filter chooses it again.
  if (List_IsLinked(&slowPath->link)) {
    List_Remove(&slowPath->link);
  }
  for (ListLinks* l = fp->filters.next; l != &fp->filters; l = l->next) {
    SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
    SLCGenericSpinGuard filterGuard(filter->lock);
    if (filter->spAttachState == SLCGenericSpAttached && filter->slowPath == slowPath) {
      if (SLCGenericDetachSlowPath(filter) == ZEL_OK) {
        SLCGenericAttachSlowPath(filter);
      }
    }
  }
  if (slowPath->useCount > 1) {
    SLCG_LOG(SLCG_PROGRESS, "Could not unregister slow path, use count = %u", slowPath->useCount);
    return ZEL_BUSY;
  }
  agentGuard.Unlock();
  SLCGenericMagicKill(slowPath);
  SLCGenericFree(slowPath);
  return ZEL_OK;
}
