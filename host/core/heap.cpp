// Host heaps: accounting, a size limit, garbage-filled blocks and checked
// frees.
//
// Each heap has its own mutex and a map of its live blocks (block -> size
// and caller), so a free can be checked against the heap it names and a
// destroyed heap can release what it still holds. Heap records are kept
// (marked dead) until Reset so that a call on a destroyed heap is caught by
// its magic rather than by reading freed memory, and so that tests can read
// the final statistics of a heap the module has destroyed.

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <unordered_map>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/core/slab.h"

struct ZelHeap {
  static constexpr uint64_t kLive = 0x6c6976652d686570;
  static constexpr uint64_t kDead = 0x646561642d686570;

  struct Block {
    uint32_t size;
    void* ra;
  };

  // Written under mu; read without it by the handle checks.
  std::atomic<uint64_t> magic{kLive};
  std::string name;
  ZelModuleID owner = -1;
  std::mutex mu;
  std::unordered_map<void*, Block> blocks;   // guarded by mu
  host::HeapStats stats;                      // guarded by mu
};

namespace host {

namespace {

// Bytes a fresh block is filled with: the module must zero what it needs.
constexpr uint8_t kGarbage = 0xa5;

struct HeapRegistry {
  std::mutex mu;
  std::vector<std::unique_ptr<ZelHeap>> all;   // live and dead, creation order
  ZelHeapID lastCreated = nullptr;
  std::vector<LeakReport> leaks;
};

HeapRegistry& R() {
  static HeapRegistry* r = new HeapRegistry;
  return *r;
}

ZelHeap* Checked(ZelHeapID heap, const char* call) {
  if (heap == nullptr) Fatal("%s: null heap", call);
  uint64_t magic = heap->magic.load(std::memory_order_relaxed);
  if (magic == ZelHeap::kDead) Fatal("%s: heap %s was destroyed", call, heap->name.c_str());
  if (magic != ZelHeap::kLive) Fatal("%s: %p is not a heap", call, static_cast<void*>(heap));
  return heap;
}

// Frees every block of `heap` (caller holds heap->mu); returns the report
// text, or empty when the heap held nothing.
std::string ReleaseBlocksLocked(ZelHeap* heap) {
  if (heap->blocks.empty()) return {};
  std::string what = "heap " + heap->name + ": " + std::to_string(heap->stats.blocks) + " blocks, " +
                     std::to_string(heap->stats.bytes) + " bytes";
  for (auto& [block, info] : heap->blocks) SlabFree(block, info.size);
  heap->blocks.clear();
  heap->stats.blocks = 0;
  heap->stats.bytes = 0;
  return what;
}

}  // namespace

namespace core {

void RecordLeak(std::string what) {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  r.leaks.push_back(LeakReport{std::move(what)});
}

void ResetHeaps() {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (auto& heap : r.all) {
    std::lock_guard<std::mutex> hg(heap->mu);
    ReleaseBlocksLocked(heap.get());
  }
  r.all.clear();
  r.lastCreated = nullptr;
  r.leaks.clear();
}

void HeapLeftovers(std::vector<std::string>* out) {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (auto& heap : r.all) {
    if (heap->magic != ZelHeap::kLive) continue;
    std::lock_guard<std::mutex> hg(heap->mu);
    out->push_back("heap " + heap->name + ": still exists (" + std::to_string(heap->stats.blocks) +
                   " blocks, " + std::to_string(heap->stats.bytes) + " bytes)");
  }
  for (const LeakReport& leak : r.leaks) out->push_back(leak.what);
}

void ReportHeapsOf(ZelModuleID module) {
  if (module < 0) return;
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (auto& heap : r.all) {
    if (heap->magic != ZelHeap::kLive || heap->owner != module) continue;
    std::lock_guard<std::mutex> hg(heap->mu);
    r.leaks.push_back(LeakReport{"heap " + heap->name + ": not destroyed at unload (" +
                                 std::to_string(heap->stats.blocks) + " blocks, " +
                                 std::to_string(heap->stats.bytes) + " bytes)"});
  }
}

}  // namespace core

bool Heaps::Exists(ZelHeapID heap) {
  if (heap == nullptr) return false;
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (auto& h : r.all) {
    if (h.get() == heap) return h->magic == ZelHeap::kLive;
  }
  return false;
}

HeapStats Heaps::Stats(ZelHeapID heap) {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  for (auto& h : r.all) {
    if (h.get() == heap) {
      std::lock_guard<std::mutex> hg(h->mu);
      return h->stats;
    }
  }
  Fatal("Heaps::Stats: %p is not a heap", static_cast<void*>(heap));
}

ZelHeapID Heaps::ModuleHeap() {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return r.lastCreated;
}

uint64_t Heaps::LiveHeaps() {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return std::count_if(r.all.begin(), r.all.end(),
                       [](const auto& h) { return h->magic == ZelHeap::kLive; });
}

std::vector<LeakReport> Heaps::Leaks() {
  HeapRegistry& r = R();
  std::lock_guard<std::mutex> g(r.mu);
  return r.leaks;
}

}  // namespace host

ZelStatus zel_HeapCreate(const ZelHeapCreateProps* props, ZelHeapID* heap) {
  if (ZelStatus st = host::Faults::Check("zel_HeapCreate")) return st;
  if (props == nullptr || props->name == nullptr || heap == nullptr) return ZEL_BAD_PARAM;
  if (props->type != 0) return ZEL_NOT_SUPPORTED;
  auto h = std::make_unique<ZelHeap>();
  h->name = props->name;
  h->owner = host::core::OwningModule();
  h->stats.name = props->name;
  h->stats.maximumSize = props->maximumSize;
  host::HeapRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  *heap = h.get();
  r.lastCreated = h.get();
  r.all.push_back(std::move(h));
  return ZEL_OK;
}

void zel_HeapDestroy(ZelHeapID heap) {
  ZelHeap* h = host::Checked(heap, "zel_HeapDestroy");
  std::string leak;
  {
    std::lock_guard<std::mutex> hg(h->mu);
    leak = host::ReleaseBlocksLocked(h);
    h->magic.store(ZelHeap::kDead, std::memory_order_relaxed);
  }
  host::HeapRegistry& r = host::R();
  std::lock_guard<std::mutex> g(r.mu);
  if (r.lastCreated == h) r.lastCreated = nullptr;
  if (!leak.empty()) r.leaks.push_back(host::LeakReport{std::move(leak)});
}

void* zel_HeapAllocWithRA(ZelHeapID heap, uint32_t size, void* ra) {
  ZelHeap* h = host::Checked(heap, "zel_HeapAllocWithRA");
  if (host::Faults::Check("zel_HeapAllocWithRA", ra) != ZEL_OK) return nullptr;
  std::lock_guard<std::mutex> hg(h->mu);
  host::Checked(h, "zel_HeapAllocWithRA");   // destroyed while we waited?
  host::HeapStats& st = h->stats;
  if (st.maximumSize != 0 && st.bytes + size > st.maximumSize) return nullptr;
  void* block = host::SlabAlloc(size);
  if (block == nullptr) return nullptr;
  std::memset(block, host::kGarbage, size);
  h->blocks.emplace(block, ZelHeap::Block{size, ra});
  st.blocks++;
  st.bytes += size;
  st.allocations++;
  st.peakBytes = std::max(st.peakBytes, st.bytes);
  return block;
}

void zel_HeapFree(ZelHeapID heap, void* block) {
  ZelHeap* h = host::Checked(heap, "zel_HeapFree");
  if (block == nullptr) return;
  std::lock_guard<std::mutex> hg(h->mu);
  host::Checked(h, "zel_HeapFree");
  auto it = h->blocks.find(block);
  if (it == h->blocks.end()) {
    host::Fatal("zel_HeapFree: %p is not a live block of heap %s (double free or another heap's block)",
                block, h->name.c_str());
  }
  h->stats.blocks--;
  h->stats.bytes -= it->second.size;
  const uint32_t size = it->second.size;
  h->blocks.erase(it);
  host::SlabFree(block, size);
}
