// Saving a filter's state on the source host of a migration and restoring
// it on the destination.
//
// Saved-state buffer: a 48-byte header of little-endian u64 fields, the
// agent's (fast path) part, then the slow path's part.
#pragma once

#include "agent/agent.h"

#pragma pack(push, 1)
struct SLCGenericStateHeader {
  char magic[8];              // "slcgsave"
  uint64_t version;           // 1
  uint64_t fastPathOffset;
  uint64_t fastPathLength;
  uint64_t slowPathOffset;
  uint64_t slowPathLength;
};
#pragma pack(pop)
static_assert(sizeof(SLCGenericStateHeader) == 48);
static_assert(offsetof(SLCGenericStateHeader, fastPathOffset) == 16);
static_assert(offsetof(SLCGenericStateHeader, slowPathLength) == 40);

inline constexpr char kSLCGenericSaveMagic[8] = {'s', 'l', 'c', 'g', 's', 'a', 'v', 'e'};
inline constexpr uint64_t kSLCGenericStateVersion = 1;

void SLCGenericPrefetchSavedState(void* filter);
[[nodiscard]] ZelStatus SLCGenericGetSavedStateLen(void* filter, uint64_t* len);
[[nodiscard]] ZelStatus SLCGenericSaveState(void* filter, void* buf, uint64_t* len);
void SLCGenericRetrieveSlowPathReply(void* filter, void* cookie, const void* data, uint64_t len,
                                     uint32_t status);
[[nodiscard]] ZelStatus SLCGenericRestoreState(void* filter, const void* buf, uint64_t len);
void SLCGenericRestoreSlowPathReply(void* filter, void* cookie, uint32_t status);
