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

// The tuple's hash: the host's byte hash of its hashed bytes.
inline uint64_t FWTupleHash(const FWRuleTuple* tuple) {
  return HashFunc_HashBytes(tuple->bytes, FWTupleHashedLen(tuple));
}

inline FWRuleEntry* FWEntryFromLink(ListLinks* link) {
  return LIST_CONTAINER(link, FWRuleEntry, link);
}

// 0 when the entry's rule equals the tuple, 1 otherwise. The tuple lines up
// with the record from dMac on (fw_hash.cpp checks the layout): an IPv6
// rule's tuple is record bytes 8-62 in one run, an IPv4 rule's three runs
// (8-29, ipDa, protocol and ports), so the stored rule is compared in a
// handful of word loads without building its tuple. On the packet path.
inline int FWRuleCompare(const FWRuleEntry* entry, const FWRuleTuple* tuple) {
  const uint8_t* rule = reinterpret_cast<const uint8_t*>(&entry->rule);
  const uint8_t* r = rule + offsetof(FWRule, dMac);  // lines up with tuple byte 0
  const uint8_t* t = tuple->bytes;
  const bool ruleV4 = (entry->rule.ruleFlags & FW_FLAG_IPV4) != 0;
  if (ruleV4 != (tuple->isIPv4 != 0)) return 1;
  uint64_t diff;
  if (ruleV4) {
    // Tuple 0-21 against record 8-29: words at 0, 8 and (overlapping) 14.
    diff = (FWLoad64(r) ^ FWLoad64(t)) | (FWLoad64(r + 8) ^ FWLoad64(t + 8)) |
           (FWLoad64(r + 14) ^ FWLoad64(t + 14));
    // ipDa, then protocol and ports (record 58-62 against tuple 26-30, as
    // two overlapping 4-byte words).
    const uint8_t* rp = rule + offsetof(FWRule, ipProto);
    diff |= FWLoad32(entry->rule.ipDa) ^ FWLoad32(t + FW_TUPLE_V4_IPDA);
    diff |= (FWLoad32(rp) ^ FWLoad32(t + FW_TUPLE_V4_PROTO)) |
            (FWLoad32(rp + 1) ^ FWLoad32(t + FW_TUPLE_V4_PROTO + 1));
  } else {
    // Tuple 0-54 against record 8-62: words at 0..40 and (overlapping) 47.
    diff = (FWLoad64(r) ^ FWLoad64(t)) | (FWLoad64(r + 8) ^ FWLoad64(t + 8)) |
           (FWLoad64(r + 16) ^ FWLoad64(t + 16)) | (FWLoad64(r + 24) ^ FWLoad64(t + 24)) |
           (FWLoad64(r + 32) ^ FWLoad64(t + 32)) | (FWLoad64(r + 40) ^ FWLoad64(t + 40)) |
           (FWLoad64(r + 47) ^ FWLoad64(t + 47));
  }
  return diff != 0 ? 1 : 0;
}

// The entry of bucket `head` whose rule equals `tuple` (`h`: the low 32
// bits of its hash), or null. Walks oldest first; tuples are unique within
// a table, so the first equal entry is the only one.
inline FWRuleEntry* FWBucketFindEntry(const ListLinks* head, const FWRuleTuple* tuple,
                                      uint32_t h) {
  for (ListLinks* l = head->prev; l != head; l = l->prev) {
    FWRuleEntry* entry = FWEntryFromLink(l);
    // The stored hash rejects almost every non-equal entry with one compare.
    if (entry->hash == h && FWRuleCompare(entry, tuple) == 0) return entry;
  }
  return nullptr;
}

// FWBucketFindEntry in the bucket of `hash`.
FWRuleEntry* FWHashFindEntry(const Hash_Table* table, const FWRuleTuple* tuple, uint64_t hash);

// `entry` (null passes through) when it accepts the packet's direction and
// resource-pool tag, else null. The tag is read only for a rule comparing
// it.
inline FWRuleEntry* FWExactAccepts(FWRuleEntry* entry, uint32_t direction, ZelPkt* pkt) {
  if (entry == nullptr) return nullptr;
  const FWRule& rule = entry->rule;
  if (entry->direction != SLCGenericDirectionBidirectional && entry->direction != direction) {
    return nullptr;
  }
  if (!(rule.ruleFlags & FW_WC_RPTAG)) {
    uint16_t tag = 0;
    (void)zel_PktResPoolTagGet(pkt, &tag);  // relied on to fill the tag
    if (tag != rule.rpTag) return nullptr;
  }
  return entry;
}

// Links `entry` at the front of the bucket its stored hash selects.
inline void FWHashLinkEntry(Hash_Table* table, FWRuleEntry* entry) {
  List_InsertAfter(&entry->link, &table->buckets[entry->hash & (table->numBuckets - 1)]);
}
