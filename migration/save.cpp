// Source side of a migration: prefetching the slow path's state, reporting
// the saved-state length and writing the saved-state buffer.
//
// Every callback and the retrieve reply serialise on the filter's lock. The
// prefetch releases it around the framework request (see
// SLCGenericRequestUnlocked); migrationState is set to fetching first, so the
// reply finds the state it expects whenever it runs. The agent's
// getSavedStateLen/saveState operations run under the filter's lock and take
// the agent's own lock (rank 4) inside.
#include "migration/migration.h"

#include "migration/filter_request.h"
#include "module/locks.h"

namespace {

constexpr uint64_t kHeaderSize = sizeof(SLCGenericStateHeader);

// F: the agent's part, 0 for an agent that saves nothing. Filter lock held.
uint32_t AgentSavedStateLen(SLCGenericFilter* filter) {
  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  return ops->getSavedStateLen != nullptr ? ops->getSavedStateLen(filter) : 0;
}

}  // namespace

void SLCGenericDiscardSavedState(SLCGenericFilter* filter) {
  if (filter->slowPathState != nullptr) SLCGenericFree(filter->slowPathState);
  filter->slowPathState = nullptr;
  filter->slowPathStateLen = 0;
  filter->migrationState = SLCGenericStateIdle;
}

void SLCGenericPrefetchSavedState(void* filterPriv) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericSpinGuard guard(filter->lock);

  if (filter->migrationState != SLCGenericStateIdle) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Ignoring state prefetch request; wrong state (%u)",
                 static_cast<unsigned>(filter->migrationState));
    return;
  }
  if (filter->spAttachState != SLCGenericSpAttached) {
    // Nothing to fetch: the saved state will have no slow path part.
    filter->migrationState = SLCGenericStateReady;
    return;
  }

  filter->migrationState = SLCGenericStateFetching;
  void* cookie = filter->slowPath;
  const ZelStatus status = SLCGenericRequestUnlocked(filter, guard, [&] {
    return zel_SluiceRetrieveSlowPathState(filter->handle, SLCGenericRetrieveSlowPathReply, cookie,
                                           SLCGenericSlowPathTimeoutMs());
  });
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Requesting slow path state failed (%#x): %s",
                 status, zel_StatusToString(status));
    filter->migrationState = SLCGenericStateIdle;
  }
}

void SLCGenericRetrieveSlowPathReply(void* filterPriv, void* /*cookie*/, const void* data,
                                     uint64_t len, uint32_t status) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericSpinGuard guard(filter->lock);

  if (filter->migrationState != SLCGenericStateFetching) {
    // Detached meanwhile, or the fetch was discarded: keep nothing.
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Ignoring slow path state reply; wrong state (%u)",
                 static_cast<unsigned>(filter->migrationState));
  } else if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Failed to retrieve slow path state (%#x): %s",
                 status, zel_StatusToString(status));
    filter->migrationState = SLCGenericStateIdle;
  } else if (len == 0) {
    filter->migrationState = SLCGenericStateReady;
  } else {
    // The heap serves 32-bit sizes; a longer reply (or one without data) is
    // refused like a failed allocation, so no more than was allocated is
    // ever copied.
    void* copy = (data != nullptr && len <= UINT32_MAX)
                     ? SLCGenericAlloc(static_cast<uint32_t>(len))
                     : nullptr;
    if (copy == nullptr) {
      SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Failed to alloc %zu bytes for state buffer",
                   static_cast<size_t>(len));
      filter->migrationState = SLCGenericStateIdle;
    } else {
      zel_Memcpy(copy, data, static_cast<size_t>(len));
      if (filter->slowPathState != nullptr) SLCGenericFree(filter->slowPathState);
      filter->slowPathState = copy;
      filter->slowPathStateLen = len;
      filter->migrationState = SLCGenericStateReady;
    }
  }
  filter->refCount -= 1;  // the reply's reference, whatever happened above
}

ZelStatus SLCGenericGetSavedStateLen(void* filterPriv, uint64_t* len) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_BAD_PARAM;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericSpinGuard guard(filter->lock);

  if (len == nullptr) {
    SLCGenericDiscardSavedState(filter);
    return ZEL_OK;
  }
  switch (filter->migrationState) {
    case SLCGenericStateFetching:
      SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Slow path agent state is not yet available");
      return ZEL_NOT_READY;
    case SLCGenericStateReady:
      // F < 2^32 and the slow path state < 2^32 (heap limit): no overflow.
      *len = kHeaderSize + AgentSavedStateLen(filter) + filter->slowPathStateLen;
      return ZEL_OK;
    default:
      return ZEL_FAILURE;
  }
}

ZelStatus SLCGenericSaveState(void* filterPriv, void* buf, uint64_t* len) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_BAD_PARAM;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericSpinGuard guard(filter->lock);

  ZelStatus result = ZEL_OK;
  if (buf != nullptr && len != nullptr) {
    if (filter->migrationState != SLCGenericStateReady) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Unexpected request to save state");
      result = ZEL_INVALID_STATE;
    } else {
      // F again: rules may have changed since the length request.
      const uint32_t fastLen = AgentSavedStateLen(filter);
      const uint64_t slowLen = filter->slowPathStateLen;
      const uint64_t total = kHeaderSize + fastLen + slowLen;
      if (total > *len) {
        SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                     "Buffer too short for saved state (requested %zu, got %zu)",
                     static_cast<size_t>(total), static_cast<size_t>(*len));
        result = ZEL_BUF_TOO_SMALL;
      } else {
        auto* out = static_cast<uint8_t*>(buf);
        zel_Memset(out, 0, static_cast<size_t>(total));

        SLCGenericStateHeader header;
        zel_Memcpy(header.magic, kSLCGenericSaveMagic, sizeof(header.magic));
        // Host order is little-endian (platform/zel_status.h), the stored order.
        header.version = kSLCGenericStateVersion;
        header.fastPathOffset = kHeaderSize;
        header.fastPathLength = fastLen;
        header.slowPathOffset = kHeaderSize + fastLen;
        header.slowPathLength = slowLen;
        zel_Memcpy(out, &header, sizeof(header));

        const SLCGenericAgentOps* ops = filter->fastPath->ops;
        // The agent writes at most fastLen bytes even if its rules grew
        // since fastLen was computed.
        if (fastLen != 0 && ops->saveState != nullptr) {
          ops->saveState(filter, out + kHeaderSize, fastLen);
        }
        if (filter->slowPathState != nullptr) {
          zel_Memcpy(out + header.slowPathOffset, filter->slowPathState,
                     static_cast<size_t>(slowLen));
        }
        *len = total;
      }
    }
  }
  // One-shot: whatever the outcome, the fetched state is gone and a new
  // save needs a new prefetch.
  SLCGenericDiscardSavedState(filter);
  return result;
}
