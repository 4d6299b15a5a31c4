// Helpers shared by the rule-table code of the firewall (tables, apply,
// lookup, single-rule removal). Everything here runs with the filter's
// configLock held: exclusively when a table changes, shared for lookups.
#pragma once

#include "firewall/firewall.h"

// Unaligned fixed-size loads of record and frame bytes; the compiler turns
// each into a single move.
inline uint64_t FWLoad64(const uint8_t* p) {
  uint64_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}
inline uint32_t FWLoad32(const uint8_t* p) {
  uint32_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}
inline uint16_t FWLoad16(const uint8_t* p) {
  uint16_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}

// Fills `tuple` from `rule` (family from ruleFlags bit 20) without hashing.
// For an IPv4 rule bytes 31-54 of the tuple are left as they were.
void FWFillTupleFromRule(const FWRule* rule, FWRuleTuple* tuple);

// Number of bytes of a tuple that are hashed: 31 (IPv4) or 55 (IPv6).
inline uint32_t FWTupleHashedLen(const FWRuleTuple* tuple) {
  return tuple->isIPv4 ? FW_TUPLE_V4_HASHED : FW_TUPLE_V6_HASHED;
}

// The entry of `table` whose rule equals `tuple`, or null. Walks bucket
// (hash & (B - 1)) oldest first; tuples are unique within a table, so the
// first equal entry is the only one.
FWRuleEntry* FWHashFindEntry(const Hash_Table* table, const FWRuleTuple* tuple, uint64_t hash);

// Links `entry` at the front of the bucket its stored hash selects.
inline void FWHashLinkEntry(Hash_Table* table, FWRuleEntry* entry) {
  List_InsertAfter(&entry->link, &table->buckets[entry->hash & (table->numBuckets - 1)]);
}

inline FWRuleEntry* FWEntryFromLink(ListLinks* link) {
  return LIST_CONTAINER(link, FWRuleEntry, link);
}
