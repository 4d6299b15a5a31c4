// The host's hash table library and byte hash.
//
// A table is only an array of circular list heads: callers link elements
// into buckets and walk buckets themselves. The library allocates, frees and
// iterates. The table and its bucket array come from the caller's heap so
// that the owner's heap accounting sees them.
#include <cstring>

#include "host/core/faults.h"
#include "platform/zel_hash.h"

namespace {

void* HeapAlloc(ZelHeapID heap, uint64_t size, void* ra) {
  if (size > UINT32_MAX) return nullptr;
  return zel_HeapAllocWithRA(heap, static_cast<uint32_t>(size), ra);
}

// Visits every element of `table` once, buckets in order and each bucket
// from the back (oldest first, since elements are linked in at the front).
// The next element is read before the callback runs, so the callback may
// unlink and free the element it is given, but no other element.
template <bool kStopOnFalse>
bool Iterate(Hash_Table* table, Hash_IterFn fn, void* arg) {
  if (table == nullptr || fn == nullptr) host::Fatal("Hash_Iterate: null table or callback");
  for (uint32_t i = 0; i < table->numBuckets; i++) {
    ListLinks* head = &table->buckets[i];
    for (ListLinks* e = head->prev; e != head;) {
      ListLinks* prev = e->prev;
      bool more = fn(e, arg);
      if (kStopOnFalse && !more) return false;
      e = prev;
    }
  }
  return true;
}

}  // namespace

Hash_Table* Hash_Alloc(ZelHeapID heap, uint32_t numBuckets, uint32_t sizeHint) {
  if (numBuckets == 0 || (numBuckets & (numBuckets - 1)) != 0) {
    host::Fatal("Hash_Alloc: %u buckets is not a power of two", numBuckets);
  }
  if (host::Faults::Check("Hash_Alloc") != ZEL_OK) return nullptr;
  void* ra = __builtin_return_address(0);
  auto* table = static_cast<Hash_Table*>(HeapAlloc(heap, sizeof(Hash_Table), ra));
  if (table == nullptr) return nullptr;
  auto* buckets =
      static_cast<ListLinks*>(HeapAlloc(heap, uint64_t{numBuckets} * sizeof(ListLinks), ra));
  if (buckets == nullptr) {
    zel_HeapFree(heap, table);
    return nullptr;
  }
  for (uint32_t i = 0; i < numBuckets; i++) List_Init(&buckets[i]);
  table->numBuckets = numBuckets;
  table->sizeHint = sizeHint;
  table->heap = heap;
  table->buckets = buckets;
  return table;
}

void Hash_Free(Hash_Table* table) {
  if (table == nullptr) host::Fatal("Hash_Free: null table");
  for (uint32_t i = 0; i < table->numBuckets; i++) {
    const ListLinks* head = &table->buckets[i];
    if (head->next != head || head->prev != head) {
      host::Fatal("Hash_Free: bucket %u of table %p still holds elements", i, (void*)table);
    }
  }
  ZelHeapID heap = table->heap;
  zel_HeapFree(heap, table->buckets);
  zel_HeapFree(heap, table);
}

void Hash_Iterate(Hash_Table* table, Hash_IterFn fn, void* arg) { Iterate<false>(table, fn, arg); }

bool Hash_IterateWithCheck(Hash_Table* table, Hash_IterFn fn, void* arg) {
  return Iterate<true>(table, fn, arg);
}

// ---------------------------------------------------------------------------
// Byte hash
//
// Each step multiplies two 64-bit words into 128 bits and folds the halves
// together (xor), which spreads every input bit over the whole result. Input
// is consumed 16 bytes per step; the last 1-16 bytes are read as two
// overlapping 8-byte words ending at the last byte, so no byte-by-byte tail
// loop runs for the 31- and 55-byte tuples of the packet path (2 and 4
// multiplies, plus the final one). The seed is fixed: the result depends
// only on the bytes.

namespace {

constexpr uint64_t kSeed = 0x2d358dccaa6c78a5ULL;
constexpr uint64_t kK0 = 0x8bb84b93962eacc9ULL;
constexpr uint64_t kK1 = 0x4b33a62ed433d4a3ULL;

inline uint64_t Fold(uint64_t a, uint64_t b) {
  __uint128_t r = static_cast<__uint128_t>(a) * b;
  return static_cast<uint64_t>(r) ^ static_cast<uint64_t>(r >> 64);
}

inline uint64_t Load64(const uint8_t* p) {
  uint64_t v;
  std::memcpy(&v, p, sizeof v);
  return v;
}

inline uint64_t Load32(const uint8_t* p) {
  uint32_t v;
  std::memcpy(&v, p, sizeof v);
  return v;
}

}  // namespace

uint64_t HashFunc_HashBytes(const void* bytes, uint32_t len) {
  const uint8_t* p = static_cast<const uint8_t*>(bytes);
  uint64_t seed = kSeed;
  uint64_t a;
  uint64_t b;
  if (len > 16) {
    uint32_t left = len;
    while (left > 16) {
      seed = Fold(Load64(p) ^ kK0, Load64(p + 8) ^ seed);
      p += 16;
      left -= 16;
    }
    // The last 16 bytes of the input, overlapping what was already mixed.
    a = Load64(p + left - 16);
    b = Load64(p + left - 8);
  } else if (len >= 8) {
    a = Load64(p);
    b = Load64(p + len - 8);
  } else if (len >= 4) {
    a = Load32(p);
    b = Load32(p + len - 4);
  } else if (len > 0) {
    a = (uint64_t{p[0]} << 16) | (uint64_t{p[len >> 1]} << 8) | p[len - 1];
    b = 0;
  } else {
    a = 0;
    b = 0;
  }
  return Fold(kK1 ^ len, Fold(a ^ kK1, b ^ seed));
}
