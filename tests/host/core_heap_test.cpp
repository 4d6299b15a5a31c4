// Host heaps: accounting, the size limit, leak reports, checked frees and
// fault injection.

#include <gtest/gtest.h>

#include <cstring>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "platform/zel.h"

namespace {

class HeapTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::Reset();
  }
  void TearDown() override {
    EXPECT_TRUE(host::Leftovers().empty());
    host::Reset();
  }

  ZelHeapID Create(const char* name, uint64_t max = 0) {
    ZelHeapCreateProps props{0, name, 1, 4096, max, 0};
    ZelHeapID heap = nullptr;
    EXPECT_EQ(zel_HeapCreate(&props, &heap), ZEL_OK);
    return heap;
  }
  static void* Alloc(ZelHeapID heap, uint32_t size) { return zel_HeapAllocWithRA(heap, size, nullptr); }
};

TEST_F(HeapTest, AccountsBlocksBytesAndPeak) {
  ZelHeapID heap = Create("acct");
  EXPECT_EQ(host::Heaps::ModuleHeap(), heap);
  void* a = Alloc(heap, 100);
  void* b = Alloc(heap, 20);
  ASSERT_TRUE(a && b);
  // Fresh blocks are not zeroed: the module must clear what it uses.
  EXPECT_NE(static_cast<uint8_t*>(a)[0], 0);
  EXPECT_NE(static_cast<uint8_t*>(a)[99], 0);
  zel_HeapFree(heap, a);
  void* c = Alloc(heap, 30);

  host::HeapStats st = host::Heaps::Stats(heap);
  EXPECT_EQ(st.name, "acct");
  EXPECT_EQ(st.blocks, 2u);
  EXPECT_EQ(st.bytes, 50u);
  EXPECT_EQ(st.peakBytes, 120u);
  EXPECT_EQ(st.allocations, 3u);
  zel_HeapFree(heap, b);
  zel_HeapFree(heap, c);
  zel_HeapDestroy(heap);
  // Final statistics stay readable after destruction.
  EXPECT_EQ(host::Heaps::Stats(heap).bytes, 0u);
  EXPECT_FALSE(host::Heaps::Exists(heap));
  EXPECT_EQ(host::Heaps::ModuleHeap(), nullptr);
  EXPECT_TRUE(host::Heaps::Leaks().empty());
}

TEST_F(HeapTest, RefusesBeyondMaximumSize) {
  ZelHeapID heap = Create("small", 100);
  void* a = Alloc(heap, 60);
  ASSERT_NE(a, nullptr);
  EXPECT_EQ(Alloc(heap, 41), nullptr);
  void* b = Alloc(heap, 40);
  ASSERT_NE(b, nullptr);
  EXPECT_EQ(host::Heaps::Stats(heap).allocations, 2u);
  EXPECT_EQ(host::Heaps::Stats(heap).bytes, 100u);
  zel_HeapFree(heap, a);
  zel_HeapFree(heap, b);
  zel_HeapDestroy(heap);
}

TEST_F(HeapTest, DestroyingAHeapWithBlocksReportsALeak) {
  ZelHeapID heap = Create("leaky");
  Alloc(heap, 100);
  Alloc(heap, 20);
  zel_HeapDestroy(heap);
  ASSERT_EQ(host::Heaps::Leaks().size(), 1u);
  EXPECT_EQ(host::Heaps::Leaks()[0].what, "heap leaky: 2 blocks, 120 bytes");
  std::vector<std::string> left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(left[0], "heap leaky: 2 blocks, 120 bytes");

  // A heap nobody destroyed is a leftover too.
  host::Reset();
  ZelHeapID kept = Create("kept");
  Alloc(kept, 8);
  left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(left[0], "heap kept: still exists (1 blocks, 8 bytes)");
  host::Reset();
}

TEST_F(HeapTest, FreeChecksTheBlockBelongsToTheHeap) {
  ZelHeapID one = Create("one");
  ZelHeapID two = Create("two");
  void* block = Alloc(one, 16);
  EXPECT_DEATH(zel_HeapFree(two, block), "not a live block of heap two");
  EXPECT_DEATH(
      {
        zel_HeapFree(one, block);
        zel_HeapFree(one, block);
      },
      "not a live block of heap one");
  zel_HeapFree(one, block);
  zel_HeapDestroy(one);
  EXPECT_DEATH(Alloc(one, 1), "heap one was destroyed");
  zel_HeapDestroy(two);
}

TEST_F(HeapTest, FaultInjectionFailsTheNthCallOrEveryCallFromIt) {
  ZelHeapID heap = Create("faulty");
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 3);
  std::vector<void*> got;
  for (int i = 0; i < 4; i++) got.push_back(Alloc(heap, 8));
  EXPECT_TRUE(got[0] && got[1] && !got[2] && got[3]);
  EXPECT_EQ(host::Faults::Injected("zel_HeapAllocWithRA"), 1u);

  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 2, /*sticky=*/true);
  void* first = Alloc(heap, 8);
  EXPECT_NE(first, nullptr);
  for (int i = 0; i < 3; i++) EXPECT_EQ(Alloc(heap, 8), nullptr);
  host::Faults::Clear("zel_HeapAllocWithRA");
  void* again = Alloc(heap, 8);
  EXPECT_NE(again, nullptr);
  EXPECT_EQ(host::Heaps::Stats(heap).blocks, 5u);   // refusals left no trace

  host::Faults::Fail("zel_HeapCreate", ZEL_NO_MEMORY);
  ZelHeapCreateProps props{0, "never", 1, 0, 0, 0};
  ZelHeapID none = nullptr;
  EXPECT_EQ(zel_HeapCreate(&props, &none), ZEL_NO_MEMORY);
  EXPECT_EQ(host::Heaps::LiveHeaps(), 1u);

  for (void* p : got) zel_HeapFree(heap, p);
  zel_HeapFree(heap, first);
  zel_HeapFree(heap, again);
  zel_HeapDestroy(heap);
}

}  // namespace
