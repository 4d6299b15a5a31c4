#include "host/core/slab.h"

#include <cstdlib>
#include <mutex>
#include <new>

#include <sys/mman.h>

#if defined(__SANITIZE_ADDRESS__)
#define SLC_HOST_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define SLC_HOST_ASAN 1
#endif
#endif

namespace host {
namespace {

size_t BlockSize(size_t bytes) {
  return ((bytes == 0 ? 1 : bytes) + kSlabAlign - 1) / kSlabAlign * kSlabAlign;
}

}  // namespace

#ifdef SLC_HOST_ASAN

void* SlabAlloc(size_t bytes) {
  return ::operator new(BlockSize(bytes), std::align_val_t{kSlabAlign}, std::nothrow);
}

void SlabFree(void* block, size_t bytes) {
  (void)bytes;
  if (block != nullptr) ::operator delete(block, std::align_val_t{kSlabAlign});
}

#else

namespace {

constexpr size_t kChunk = size_t{2} << 20;
constexpr size_t kClasses = kMaxSlabBlock / kSlabAlign;

// A block of `bytes` (a multiple of kChunk), aligned to kChunk so that it
// can be mapped with large pages.
void* NewChunk(size_t bytes) {
  void* p = std::aligned_alloc(kChunk, bytes);
  if (p != nullptr) (void)madvise(p, bytes, MADV_HUGEPAGE);  // a hint: small pages work too
  return p;
}

struct FreeBlock {
  FreeBlock* next;
};

struct Slab {
  std::mutex mu;
  FreeBlock* free[kClasses + 1] = {};  // by size in kSlabAlign units
  char* bump = nullptr;
  size_t left = 0;
};

// Never destroyed: blocks may be freed by other subsystems' static
// destructors.
Slab& S() {
  static Slab* slab = new Slab;
  return *slab;
}

}  // namespace

void* SlabAlloc(size_t bytes) {
  const size_t size = BlockSize(bytes);
  if (size >= kChunk) return NewChunk((size + kChunk - 1) / kChunk * kChunk);
  if (size > kMaxSlabBlock) return std::aligned_alloc(kSlabAlign, size);
  Slab& s = S();
  const size_t units = size / kSlabAlign;
  std::lock_guard<std::mutex> g(s.mu);
  if (FreeBlock* b = s.free[units]) {
    s.free[units] = b->next;
    return b;
  }
  if (s.left < size) {
    // The rest of the old chunk (less than this block) stays unused.
    s.bump = static_cast<char*>(NewChunk(kChunk));
    if (s.bump == nullptr) {
      s.left = 0;
      return nullptr;
    }
    s.left = kChunk;
  }
  void* b = s.bump;
  s.bump += size;
  s.left -= size;
  return b;
}

void SlabFree(void* block, size_t bytes) {
  if (block == nullptr) return;
  const size_t size = BlockSize(bytes);
  if (size > kMaxSlabBlock) {
    std::free(block);
    return;
  }
  Slab& s = S();
  auto* b = static_cast<FreeBlock*>(block);
  std::lock_guard<std::mutex> g(s.mu);
  b->next = s.free[size / kSlabAlign];
  s.free[size / kSlabAlign] = b;
}

#endif

}  // namespace host
