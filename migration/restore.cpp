// Destination side of a migration: checking a saved-state buffer, handing
// the fast path part to the agent and sending the slow path part back to the
// filter's slow path.
//
// The buffer is hostile input. Every header check runs before the filter's
// lock is taken and changes nothing; sums of 64-bit header fields that would
// pass 2^64 fail their check. The slow path part is passed to the framework
// as a pointer into the caller's buffer; no copy is kept.
#include "migration/migration.h"

#include "migration/filter_request.h"
#include "module/locks.h"

namespace {

constexpr uint64_t kHeaderSize = sizeof(SLCGenericStateHeader);

// True when a + b exceeds `limit`, a sum that would pass 2^64 included.
// *sum gets a + b, or UINT64_MAX for such a sum (what the messages show).
bool SumExceeds(uint64_t a, uint64_t b, uint64_t limit, uint64_t* sum) {
  if (__builtin_add_overflow(a, b, sum)) {
    *sum = UINT64_MAX;
    return true;
  }
  return *sum > limit;
}

// The header checks, in order; ZEL_OK when both parts lie inside the
// buffer, in order and after the header.
ZelStatus CheckHeader(SLCGenericFilter* filter, const void* buf, uint64_t len,
                      SLCGenericStateHeader* header) {
  if (len < kHeaderSize) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Buffer too short for header (%zu bytes)",
                 static_cast<size_t>(len));
    return ZEL_FAILURE;
  }
  zel_Memcpy(header, buf, sizeof(*header));

  if (zel_Memcmp(header->magic, kSLCGenericSaveMagic, sizeof(header->magic)) != 0) {
    uint64_t magic;
    zel_Memcpy(&magic, header->magic, sizeof(magic));
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Bad state header magic (got 0x%lx)",
                 static_cast<unsigned long>(magic));
    return ZEL_FAILURE;
  }
  if (header->version != kSLCGenericStateVersion) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Bad state header verison (expected %u, got %lu)",
                 static_cast<unsigned>(kSLCGenericStateVersion),
                 static_cast<unsigned long>(header->version));
    return ZEL_FAILURE;
  }
  uint64_t slowEnd;
  if (SumExceeds(header->slowPathOffset, header->slowPathLength, len, &slowEnd)) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Buffer not large enough (expected %zu, got %zu)",
                 static_cast<size_t>(slowEnd), static_cast<size_t>(len));
    return ZEL_FAILURE;
  }
  uint64_t fastEnd;
  if (header->fastPathOffset < kHeaderSize ||
      SumExceeds(header->fastPathOffset, header->fastPathLength, header->slowPathOffset,
                 &fastEnd)) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Bad state header offsets (%zu %zu %zu %zu)",
                 static_cast<size_t>(header->fastPathOffset),
                 static_cast<size_t>(header->fastPathLength),
                 static_cast<size_t>(header->slowPathOffset),
                 static_cast<size_t>(header->slowPathLength));
    return ZEL_FAILURE;
  }
  return ZEL_OK;
}

}  // namespace

ZelStatus SLCGenericRestoreState(void* filterPriv, const void* buf, uint64_t len) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return ZEL_BAD_PARAM;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  if (buf == nullptr || len == 0) return ZEL_OK;

  SLCGenericStateHeader header;
  if (ZelStatus s = CheckHeader(filter, buf, len, &header); s != ZEL_OK) return s;
  const auto* in = static_cast<const uint8_t*>(buf);

  SLCGenericSpinGuard guard(filter->lock);
  if (filter->migrationState != SLCGenericStateIdle) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Ignoring state restore request; wrong state (%u)",
                 static_cast<unsigned>(filter->migrationState));
    return ZEL_FAILURE;
  }

  bool sendSlowPart = header.slowPathLength != 0;
  if (sendSlowPart && filter->slowPath == nullptr) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Have saved slow path state, but no slow path");
    // Failure policy 0 refuses a partial restore; any other drops the part.
    if (filter->failurePolicy == 0) return ZEL_FAILURE;
    sendSlowPart = false;
  }

  const SLCGenericAgentOps* ops = filter->fastPath->ops;
  if (header.fastPathLength != 0 && ops->restoreState != nullptr &&
      ops->restoreState(filter, in + header.fastPathOffset, header.fastPathLength) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to restore fast path agent state");
    return ZEL_FAILURE;
  }

  if (!sendSlowPart) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Finished restoring state");
    return ZEL_OK;
  }

  filter->migrationState = SLCGenericStateRestoring;
  void* cookie = filter->slowPath;
  const ZelStatus status = SLCGenericRequestUnlocked(filter, guard, [&] {
    return zel_SluiceRestoreSlowPathState(filter->handle, in + header.slowPathOffset,
                                          header.slowPathLength, SLCGenericRestoreSlowPathReply,
                                          cookie, SLCGenericSlowPathTimeoutMs());
  });
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Couldn't request slow path state restore (%#x): %s",
                 status, zel_StatusToString(status));
    filter->migrationState = SLCGenericStateIdle;
  }
  // 0: the request is under way and its reply finishes the restore.
  return status;
}

void SLCGenericRestoreSlowPathReply(void* filterPriv, void* /*cookie*/, uint32_t status) {
  if (!SLCGenericMagicIs(filterPriv, kSLCGenericFilterMagic)) {
    SLCG_LOG(SLCG_ATTENTION, "Bad magic for filter");
    return;
  }
  auto* filter = static_cast<SLCGenericFilter*>(filterPriv);
  SLCGenericSpinGuard guard(filter->lock);

  if (filter->migrationState != SLCGenericStateRestoring) {
    // A save reset the filter meanwhile: only the reference is ours to drop.
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Unexpected restore slow path state reply");
  } else {
    if (status == ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Finished restoring slow path state");
    } else {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to restore slow path state (%#x): %s",
                   status, zel_StatusToString(status));
    }
    filter->migrationState = SLCGenericStateIdle;
  }
  filter->refCount -= 1;  // the reply's reference
}
