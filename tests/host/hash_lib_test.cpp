// The host's hash table and list library: heap accounting, iteration that
// frees as it goes, early stop, the byte hash's spread, and List_Append.
#include <gtest/gtest.h>

#include <bit>
#include <cmath>
#include <cstring>
#include <set>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"
#include "platform/zel.h"

namespace {


struct Elem {
  ListLinks links;  // first, as the table expects
  int id;
};

class HashLibTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    ZelHeapCreateProps props{0, "hashtest", 0, 4096, 1 << 20, 0};
    ASSERT_EQ(zel_HeapCreate(&props, &heap_), ZEL_OK);
  }
  void TearDown() override {
    EXPECT_EQ(host::Heaps::Stats(heap_).blocks, 0u);
    zel_HeapDestroy(heap_);
    HostTest::TearDown();
  }

  // Links `n` elements with ids 0..n-1 into buckets by id.
  std::vector<Elem*> Fill(Hash_Table* t, int n) {
    std::vector<Elem*> elems;
    for (int i = 0; i < n; i++) {
      Elem* e = new Elem{{nullptr, nullptr}, i};
      List_InsertAfter(&e->links, &t->buckets[uint32_t(i * 7) & (t->numBuckets - 1)]);
      elems.push_back(e);
    }
    return elems;
  }

  ZelHeapID heap_ = nullptr;
};

TEST_F(HashLibTest, TableAndBucketsComeFromTheCallersHeap) {
  Hash_Table* t = Hash_Alloc(heap_, 1024, 255);
  ASSERT_NE(t, nullptr);
  EXPECT_EQ(t->numBuckets, 1024u);
  EXPECT_EQ(t->sizeHint, 255u);
  EXPECT_EQ(host::Heaps::Stats(heap_).blocks, 2u);
  EXPECT_GE(host::Heaps::Stats(heap_).bytes, 1024 * sizeof(ListLinks));
  for (uint32_t i = 0; i < t->numBuckets; i++) ASSERT_TRUE(List_IsEmpty(&t->buckets[i]));
  Hash_Free(t);
  EXPECT_EQ(host::Heaps::Stats(heap_).blocks, 0u);

  host::Faults::Fail("Hash_Alloc", ZEL_NO_MEMORY);
  EXPECT_EQ(Hash_Alloc(heap_, 256, 0), nullptr);
  // The heap refuses the bucket array: the table block allocated first is
  // given back (TearDown checks the heap is empty).
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 2);
  EXPECT_EQ(Hash_Alloc(heap_, 256, 0), nullptr);
  EXPECT_EQ(host::Faults::Injected("zel_HeapAllocWithRA"), 1u);
  EXPECT_EQ(Hash_Alloc(heap_, 1 << 20, 0), nullptr);  // beyond the heap's limit
}

TEST_F(HashLibTest, IterateVisitsEachOnceWhileTheCallbackFreesIt) {
  Hash_Table* t = Hash_Alloc(heap_, 256, 0);
  ASSERT_NE(t, nullptr);
  Fill(t, 1000);
  std::multiset<int> seen;
  struct Ctx { std::multiset<int>* seen; } ctx{&seen};
  Hash_Iterate(
      t,
      [](void* elem, void* arg) {
        Elem* e = static_cast<Elem*>(elem);
        static_cast<Ctx*>(arg)->seen->insert(e->id);
        List_Remove(&e->links);
        delete e;
        return true;
      },
      &ctx);
  EXPECT_EQ(seen.size(), 1000u);
  EXPECT_EQ(std::set<int>(seen.begin(), seen.end()).size(), 1000u);
  Hash_Free(t);  // aborts if anything was left behind
}

TEST_F(HashLibTest, IterateWithCheckStopsAfterFalse) {
  Hash_Table* t = Hash_Alloc(heap_, 256, 0);
  ASSERT_NE(t, nullptr);
  std::vector<Elem*> elems = Fill(t, 50);
  int calls = 0;
  EXPECT_FALSE(Hash_IterateWithCheck(
      t, [](void*, void* arg) { return ++*static_cast<int*>(arg) < 10; }, &calls));
  EXPECT_EQ(calls, 10);
  calls = 0;
  EXPECT_TRUE(Hash_IterateWithCheck(
      t, [](void*, void* arg) { return ++*static_cast<int*>(arg) > 0; }, &calls));
  EXPECT_EQ(calls, 50);

  EXPECT_DEATH(Hash_Free(t), "still holds elements");
  for (Elem* e : elems) {
    List_Remove(&e->links);
    delete e;
  }
  Hash_Free(t);
}

TEST_F(HashLibTest, ByteHashDependsOnlyOnTheBytes) {
  uint8_t a[64 + 8];
  for (size_t i = 0; i < sizeof a; i++) a[i] = uint8_t(i * 37 + 1);
  uint8_t b[64 + 8];
  for (uint32_t len : {0u, 1u, 3u, 4u, 7u, 8u, 15u, 16u, 17u, 31u, 55u, 64u}) {
    for (size_t shift = 1; shift < 8; shift++) {
      std::memcpy(b + shift, a, len);
      ASSERT_EQ(HashFunc_HashBytes(a, len), HashFunc_HashBytes(b + shift, len)) << len;
    }
    // Every byte counts (the tail included).
    for (uint32_t i = 0; i < len; i++) {
      uint8_t c[64];
      std::memcpy(c, a, len);
      c[i] ^= 0x80;
      ASSERT_NE(HashFunc_HashBytes(a, len), HashFunc_HashBytes(c, len)) << len << " byte " << i;
    }
  }
  EXPECT_NE(HashFunc_HashBytes(a, 30), HashFunc_HashBytes(a, 31));
}

// Tuples that differ in one port or address byte, as a port scan or an
// address range produces, must still spread evenly over the low bits.
TEST_F(HashLibTest, SequentialTuplesSpreadOverBuckets) {
  constexpr uint32_t kBuckets = 1024;
  constexpr uint32_t kKeys = 64 * kBuckets;
  for (uint32_t len : {31u, 55u}) {
    for (uint32_t field : {27u, 18u}) {  // source port; first address byte
      SCOPED_TRACE(testing::Message() << "len " << len << " field " << field);
      std::vector<uint32_t> load(kBuckets);
      uint8_t tuple[56] = {0x00, 0x50, 0x56, 0x01, 0x02, 0x03, 0x00, 0x50, 0x56, 0x04, 0x05, 0x06,
                           0x08, 0x00};
      for (uint32_t k = 0; k < kKeys; k++) {
        tuple[field] = uint8_t(k >> 8);
        tuple[field + 1] = uint8_t(k);
        tuple[field + 2] = uint8_t(k >> 16);
        load[uint32_t(HashFunc_HashBytes(tuple, len)) & (kBuckets - 1)]++;
      }
      double expected = double(kKeys) / kBuckets;
      double chi2 = 0;
      uint32_t maxLoad = 0;
      for (uint32_t l : load) {
        chi2 += (l - expected) * (l - expected) / expected;
        maxLoad = std::max(maxLoad, l);
      }
      // chi2 has mean 1023 and standard deviation ~45 for a uniform hash.
      EXPECT_LT(chi2, 1023 + 6 * 45);
      EXPECT_LT(maxLoad, 2 * expected);
    }
  }
}

TEST_F(HashLibTest, SingleBitChangesFlipAboutHalfTheLowBits) {
  uint8_t tuple[55];
  for (size_t i = 0; i < sizeof tuple; i++) tuple[i] = uint8_t(i * 13 + 5);
  for (uint32_t len : {31u, 55u}) {
    uint32_t base = uint32_t(HashFunc_HashBytes(tuple, len));
    double total = 0;
    for (uint32_t bit = 0; bit < len * 8; bit++) {
      tuple[bit / 8] ^= uint8_t(1 << (bit % 8));
      total += std::popcount(base ^ uint32_t(HashFunc_HashBytes(tuple, len)));
      tuple[bit / 8] ^= uint8_t(1 << (bit % 8));
    }
    double mean = total / (len * 8);
    EXPECT_GT(mean, 14.5) << len;
    EXPECT_LT(mean, 17.5) << len;
  }
}

std::vector<int> Walk(ListLinks* head, bool backwards) {
  std::vector<int> ids;
  for (ListLinks* l = backwards ? head->prev : head->next; l != head;
       l = backwards ? l->prev : l->next) {
    ids.push_back(LIST_CONTAINER(l, Elem, links)->id);
  }
  return ids;
}

TEST_F(HashLibTest, ListAppendMovesTheSourceToTheEndInOrder) {
  Elem e[5] = {{{}, 1}, {{}, 2}, {{}, 3}, {{}, 4}, {{}, 5}};
  ListLinks dst;
  ListLinks src;
  List_Init(&dst);
  List_Init(&src);
  List_Append(&dst, &src);  // both empty
  EXPECT_TRUE(List_IsEmpty(&dst));
  for (int i = 0; i < 3; i++) List_InsertBefore(&e[i].links, &src);
  List_Append(&dst, &src);  // into an empty list
  for (int i = 3; i < 5; i++) List_InsertBefore(&e[i].links, &src);
  List_Append(&dst, &src);
  EXPECT_EQ(Walk(&dst, false), (std::vector<int>{1, 2, 3, 4, 5}));
  EXPECT_EQ(Walk(&dst, true), (std::vector<int>{5, 4, 3, 2, 1}));
  EXPECT_TRUE(List_IsEmpty(&src));
  EXPECT_EQ(src.prev, &src);
  Elem extra{{}, 6};
  List_InsertBefore(&extra.links, &src);  // the emptied source is usable again
  EXPECT_EQ(Walk(&src, false), (std::vector<int>{6}));
  EXPECT_EQ(Walk(&dst, false), (std::vector<int>{1, 2, 3, 4, 5}));
}

}  // namespace
