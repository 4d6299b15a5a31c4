// Rule tuples, the exact-rule hash table and its entries.
//
// The tuple is the exact-match key of a rule or a packet (layout in
// fw_types.h). It is built so that, for an IPv6 rule, tuple bytes 0-54 are
// byte for byte the record's bytes 8-62 (dMac .. dPort are contiguous in the
// record), and for an IPv4 rule the tuple is three runs of the record:
// bytes 8-29 (MACs, ethertype, tag, 4 bytes of ipSa), 42-45 (ipDa) and
// 58-62 (protocol and ports). FWRuleCompare uses this to compare a stored
// rule with a packet's tuple in a handful of fixed-size word loads, without
// building the rule's tuple: it is on the per-packet path.
//
// Ownership: an entry owns its GRE socket and its resource-pool tag. While
// rules are added to a filter, the new table briefly holds copies of the
// former entries; exactly one of the two records is ever released with
// FWRuleEntryFree, the other only has its memory freed (FWIterFreeCopy).
//
// All functions run with the filter's configLock held (exclusively unless a
// function says otherwise); nothing here takes a lock.

#include "firewall/fw_rules.h"

namespace {

constexpr uint32_t kRuleL2 = offsetof(FWRule, dMac);          // record run: dMac .. ipSa
static_assert(offsetof(FWRule, sMac) - kRuleL2 == FW_TUPLE_SMAC);
static_assert(offsetof(FWRule, ethType) - kRuleL2 == FW_TUPLE_ETHTYPE);
static_assert(offsetof(FWRule, vlan1QTag) - kRuleL2 == FW_TUPLE_VLAN);
static_assert(offsetof(FWRule, ipSa) - kRuleL2 == FW_TUPLE_IPSA);
// IPv6: the whole tuple is one run of the record.
static_assert(offsetof(FWRule, ipDa) - kRuleL2 == FW_TUPLE_V6_IPDA);
static_assert(offsetof(FWRule, ipProto) - kRuleL2 == FW_TUPLE_V6_PROTO);
static_assert(offsetof(FWRule, sPort) - kRuleL2 == FW_TUPLE_V6_SPORT);
static_assert(offsetof(FWRule, dPort) - kRuleL2 == FW_TUPLE_V6_DPORT);
static_assert(offsetof(FWRule, dPort) + 2 - kRuleL2 == FW_TUPLE_V6_HASHED);
// IPv4: ipSa's first 4 bytes close the first run; proto and ports the third.
constexpr uint32_t kV4Run1Len = FW_TUPLE_IPSA + 4;            // 22
static_assert(kV4Run1Len == FW_TUPLE_V4_IPDA);
static_assert(FW_TUPLE_V4_PROTO + 5 == FW_TUPLE_V4_HASHED);

inline const uint8_t* RuleBytes(const FWRule* rule) {
  return reinterpret_cast<const uint8_t*>(rule);
}

}  // namespace

void FWFillTupleFromRule(const FWRule* rule, FWRuleTuple* tuple) {
  const uint8_t* r = RuleBytes(rule);
  uint8_t* t = tuple->bytes;
  if (rule->ruleFlags & FW_FLAG_IPV4) {
    __builtin_memcpy(t, r + kRuleL2, kV4Run1Len);
    __builtin_memcpy(t + FW_TUPLE_V4_IPDA, rule->ipDa, 4);
    __builtin_memcpy(t + FW_TUPLE_V4_PROTO, r + offsetof(FWRule, ipProto), 5);
    tuple->isIPv4 = 1;
  } else {
    __builtin_memcpy(t, r + kRuleL2, FW_TUPLE_V6_HASHED);
    tuple->isIPv4 = 0;
  }
}

uint64_t FWCreateTupleFromRule(const FWRule* rule, FWRuleTuple* tuple) {
  FWFillTupleFromRule(rule, tuple);
  return FWTupleHash(tuple);
}

FWRuleEntry* FWHashFindEntry(const Hash_Table* table, const FWRuleTuple* tuple, uint64_t hash) {
  const uint32_t h = static_cast<uint32_t>(hash);
  return FWBucketFindEntry(&table->buckets[h & (table->numBuckets - 1)], tuple, h);
}

ZelStatus FWInsertRuleInHashTable(SLCGenericFilter* filter, FWFilterContext* ctx,
                                  const FWRule* rule, FWRuleEntry** entryOut) {
  FWRuleTuple tuple;
  const uint64_t hash = FWCreateTupleFromRule(rule, &tuple);

  if (FWRuleEntry* existing = FWHashFindEntry(ctx->ruleHash, &tuple, hash)) {
    *entryOut = existing;
    // A repeat never changes the installed rule's action, counters or tag;
    // it only widens the direction and records that a mirror exists.
    if (rule->bidirectional != 0) existing->rule.bidirectional = rule->bidirectional;
    if (existing->rule.direction == rule->direction) {
      if (rule->bidirectional == 0) {
        SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Firewall rule already present, ignoring");
      }
    } else {
      existing->rule.direction = static_cast<uint8_t>(existing->rule.direction | rule->direction);
      existing->direction = existing->rule.direction;
    }
    return ZEL_OK;
  }

  auto* entry = static_cast<FWRuleEntry*>(SLCGenericAlloc(sizeof(FWRuleEntry)));
  if (entry == nullptr) {
    *entryOut = nullptr;
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Failed to allocate firewall rule hash entry");
    return ZEL_FAILURE;
  }
  entry->hash = static_cast<uint32_t>(hash);
  entry->direction = rule->direction;
  zel_Memcpy(&entry->rule, rule, sizeof(FWRule));
  FWHashLinkEntry(ctx->ruleHash, entry);
  ctx->numRules++;
  *entryOut = entry;
  return ZEL_OK;
}

void FWRuleEntryFree(FWRuleEntry* entry) {
  if (entry->greSocketOpen) {
    zel_SocketClose(entry->greSocket);
    entry->greSocketOpen = 0;
  }
  if (entry->rule.action == SLCGenericActionResourcePoolTag) {
    zel_PortsetPutResPoolTag(entry->poolTag);
  }
  SLCGenericFree(entry);
}

Hash_Table* FWAllocRuleHash(uint32_t n) {
  // Sized in 32-bit arithmetic: x + 1 is n rounded up to a power of two, and
  // the table gets four buckets per rule but never fewer than 256. Sizes
  // that wrap (n above 2^29) fall back to 256 like n = 0.
  uint32_t x = n - 1;
  x |= x >> 1;
  x |= x >> 2;
  x |= x >> 4;
  x |= x >> 8;
  x |= x >> 16;
  uint32_t buckets = 4 * x + 4;
  if (buckets < 256) buckets = 256;
  return Hash_Alloc(slcGenericHeapID, buckets, x);
}

void FWDestroyHash(Hash_Table** table) {
  if (*table == nullptr) return;
  Hash_Iterate(*table, FWIterFreeElement, *table);
  Hash_Free(*table);
  *table = nullptr;
}

bool FWIterFreeElement(void* elem, void* /*table*/) {
  auto* entry = static_cast<FWRuleEntry*>(elem);
  List_Remove(&entry->link);
  FWRuleEntryFree(entry);
  return true;
}

bool FWIterFreeCopy(void* elem, void* /*table*/) {
  auto* entry = static_cast<FWRuleEntry*>(elem);
  List_Remove(&entry->link);
  SLCGenericFree(entry);
  return true;
}

bool FWIterCopyElement(void* elem, void* arg) {
  auto* state = static_cast<FWRulesetCopyState*>(arg);
  auto* copy = static_cast<FWRuleEntry*>(SLCGenericAlloc(sizeof(FWRuleEntry)));
  if (copy == nullptr) {
    state->failed = 1;
    return false;
  }
  zel_Memcpy(copy, elem, sizeof(FWRuleEntry));
  FWHashLinkEntry(state->target, copy);
  return true;
}

bool FWIterRulesetGet(void* elem, void* arg) {
  auto* entry = static_cast<FWRuleEntry*>(elem);
  auto* ruleset = static_cast<FWRuleset*>(arg);
  uint64_t size = 0;
  uint8_t* dst = FWGetRuleFromRuleset(ruleset->version, ruleset, ruleset->numRules, &size);
  if (dst == nullptr) return true;  // not a version the module writes
  zel_Memcpy(dst, &entry->rule, size);
  // The record's flags are patched in place; dst is unaligned wire memory.
  FWRule* out = reinterpret_cast<FWRule*>(dst);
  FWRevertWildcardsToOriginal(ruleset->version, out);
  ruleset->numRules++;
  return true;
}

// Shared hold of configLock. The caller has checked that the packet carries
// ports (presence bit 7 or 8).
FWRuleEntry* FWFindExactRule(FWFilterContext* ctx, const FWRuleTuple* tuple, uint64_t hash,
                             uint32_t direction, ZelPkt* pkt) {
  const Hash_Table* table = ctx->ruleHash;
  if (table == nullptr) return nullptr;
  const uint32_t h = static_cast<uint32_t>(hash);
  return FWExactAccepts(FWBucketFindEntry(&table->buckets[h & (table->numBuckets - 1)], tuple, h),
                        direction, pkt);
}
