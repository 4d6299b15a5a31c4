// The host's hash table and byte hash.
//
// A table is an array of buckets, each a circular doubly linked list head
// (ListLinks). Callers place elements into buckets and walk buckets
// themselves; an element's first two words are its ListLinks. The number of
// buckets is a power of two, so bucket i of hash h is h & (numBuckets - 1).
#pragma once

#include "platform/zel_kernel.h"
#include "platform/zel_list.h"

struct Hash_Table {
  uint32_t numBuckets;
  uint32_t sizeHint;     // the third argument of Hash_Alloc, kept for the host
  ZelHeapID heap;
  ListLinks* buckets;
};

// A table of `numBuckets` empty buckets on `heap`, or null when memory is
// short. `numBuckets` must be a power of two.
Hash_Table* Hash_Alloc(ZelHeapID heap, uint32_t numBuckets, uint32_t sizeHint);
// Frees the table; its elements must have been removed before.
void Hash_Free(Hash_Table* table);

// Called once per element; the callback may unlink and free the element it
// is given. The result matters only to Hash_IterateWithCheck.
using Hash_IterFn = bool (*)(void* elem, void* arg);

void Hash_Iterate(Hash_Table* table, Hash_IterFn fn, void* arg);
// As Hash_Iterate, stopping after a callback returns false; returns false
// when it stopped early.
bool Hash_IterateWithCheck(Hash_Table* table, Hash_IterFn fn, void* arg);

// A well-distributed hash of `len` bytes that depends only on those bytes.
uint64_t HashFunc_HashBytes(const void* bytes, uint32_t len);
