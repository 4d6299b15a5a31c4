// Memory for what a kernel would take from its slab caches: module heap
// blocks and packet blocks.
//
// Blocks are carved in order from 2 MiB chunks backed by large pages where
// the system grants them (a kernel's own memory is mapped that way), so
// that a module walking a million rule entries does not miss the address
// translation cache on each one, and objects made one after another sit
// one after another. A freed block waits on the free list of its size for
// the next block of that size; chunks are kept for the process's life.
// Blocks above kMaxSlabBlock are allocated on their own (in large pages
// from 2 MiB up) and returned when freed.
//
// Under the address sanitizer every block is a plain allocation instead,
// so that an overrun is caught at the block's end.
#pragma once

#include <cstddef>

namespace host {

inline constexpr size_t kSlabAlign = 64;
inline constexpr size_t kMaxSlabBlock = 64 * 1024;

// A block of at least `bytes` bytes (0 is taken as 1), aligned to
// kSlabAlign; null when the system has no memory left. `bytes` must be
// passed again to SlabFree.
void* SlabAlloc(size_t bytes);
void SlabFree(void* block, size_t bytes);

}  // namespace host
