// The firewall agent: per-filter context, installed rules, applying and
// exporting rulesets, lookup, the packet path and the filter ioctl protocol.
//
// Locking: FWFilterContext::configLock ("slcg.fw.config", reader/writer,
// rank 4) guards every field of the context and every installed rule entry.
// It is always the last lock taken. The packet path holds it shared for a
// whole list; rulesets are applied and rules cleared under it exclusively,
// so no packet sees a half-applied ruleset. Counters are plain 64-bit adds
// under the shared hold, so concurrent walks may lose an increment.
#pragma once

#include "agent/agent.h"
#include "firewall/fw_types.h"

// One installed rule, in the exact-rule table or the general-rule list.
struct FWRuleEntry {
  ListLinks link;              // first: the host table expects it at offset 0
  uint32_t hash;               // low 32 bits of the tuple hash (exact rules)
  // rule.direction, beside the hash (exact rules): a hit then reads only
  // the entry's first two cache lines (links, hash, action, match fields,
  // counters), where rule.direction sits in the third. Set with the hash
  // and wherever rule.direction changes.
  uint8_t direction;
  FWRule rule;                 // version-8 form, counters included
  ZelSocket greSocket;
  uint8_t greSocketOpen;       // 1 once greSocket is open
  uint16_t poolTag;            // resource-pool tag of action 8, else 0
};
static_assert(offsetof(FWRuleEntry, link) == 0);
static_assert(offsetof(FWRuleEntry, rule) + offsetof(FWRule, byteCount) + 8 <= 128,
              "an exact hit reads two cache lines");

// The general rules' scan index (fw_index.h).
struct FWScanIndex;

struct FWFilterContext {
  SLCGenericFilter* filter;
  ZelLock* configLock;         // rank 4, reader/writer; guards all below
  Hash_Table* ruleHash;        // exact rules; null = no ruleset in force
  ListLinks ruleList;          // general rules; front = newest, back = first in order
  uint32_t defaultAction;      // SLCGenericActionEnum, fixed for the filter's life
  uint32_t spAttachState;      // copy of the filter's, for the packet path
  uint32_t fragOverride;       // SLCGenericActionEnum, 0 = none
  uint32_t version;            // version of the ruleset in force
  uint32_t fwFeatures;
  uint32_t numRules;           // installed entries, exact and general
  uint32_t ioctl;              // 1 once a ruleset came by an ioctl road; never cleared
  FWScanIndex* scanIndex;      // the entries of ruleList in ruleset order, for the scan;
                               // rebuilt with ruleList, owned by the context
  uint32_t generation;         // raised by every change of the rules (table, list, index);
                               // an addition staged under the shared hold is swapped in
                               // only if it still reads the value it was built from
};

inline FWFilterContext* FWContext(SLCGenericFilter* filter) {
  return static_cast<FWFilterContext*>(filter->agentPriv);
}

// The firewall agent's operations table.
extern const SLCGenericAgentOps slcGenericFwFastPathOps;

// --- Filter context ---------------------------------------------------------

[[nodiscard]] ZelStatus FWCreateFilter(SLCGenericFilter* filter);
[[nodiscard]] ZelStatus FWDestroyFilter(SLCGenericFilter* filter);
void FWConfigurationChanged(SLCGenericFilter* filter);
void FWSpAttachStateChanged(SLCGenericFilter* filter);

// --- Ruleset format ---------------------------------------------------------

// 259 for version 7, 281 for version 8; ZEL_BAD_PARAM otherwise (size untouched).
[[nodiscard]] ZelStatus FWGetRuleSize(uint32_t version, uint64_t* size);
// Address of record `index`; null for an unsupported version.
uint8_t* FWGetRuleFromRuleset(uint32_t version, FWRuleset* ruleset, uint32_t index, uint64_t* size);
void FWUpdateWildcardsToCurrent(uint32_t version, FWRule* rule);
void FWRevertWildcardsToOriginal(uint32_t version, FWRule* rule);
inline uint8_t* FWRulesetRules(FWRuleset* ruleset) {
  return reinterpret_cast<uint8_t*>(ruleset) + FW_RULESET_HEADER_SIZE;
}

// --- Tuples and tables (configLock held) -------------------------------------

struct FWRulesetCopyState {
  Hash_Table* target;
  uint8_t failed;
};

uint64_t FWCreateTupleFromRule(const FWRule* rule, FWRuleTuple* tuple);
// Inserts into ctx->ruleHash (counted in ctx->numRules), or merges a repeat
// into the entry already there; `filter` only names the log lines. `ctx`
// may be a staging context that no packet sees yet.
[[nodiscard]] ZelStatus FWInsertRuleInHashTable(SLCGenericFilter* filter, FWFilterContext* ctx,
                                                const FWRule* rule, FWRuleEntry** entry);
void FWRuleEntryFree(FWRuleEntry* entry);
void FWDestroyHash(Hash_Table** table);
// A table for n rules (at least 256 buckets, four per rule).
Hash_Table* FWAllocRuleHash(uint32_t n);
bool FWIterFreeElement(void* entry, void* table);
bool FWIterFreeCopy(void* entry, void* table);
bool FWIterCopyElement(void* entry, void* copyState);
bool FWIterRulesetGet(void* entry, void* ruleset);

// --- Applying and exporting (configLock held) --------------------------------

// Installs `ruleset`, replacing or adding to the rules in force, all or
// nothing. The caller guarantees the header and all numRules records of its
// version are readable, and holds configLock exclusively.
[[nodiscard]] ZelStatus FWApplyRuleset(SLCGenericFilter* filter, FWRuleset* ruleset,
                                       uint32_t replace, uint32_t fromIoctl);
// FWApplyRuleset with replace = 1 for a caller holding no lock: the new
// rules (entries, table, index, classifier) are built before configLock is
// taken exclusively, the hold only swaps them in, and the former rules are
// released after it. Same outcome, status and logs as FWApplyRuleset.
[[nodiscard]] ZelStatus FWReplaceRuleset(SLCGenericFilter* filter, FWRuleset* ruleset,
                                         uint32_t fromIoctl);
// FWApplyRuleset with replace = 0 for a caller holding no lock: the new
// table (with copies of the former exact entries), the new general entries
// and the scan index of all general rules are built while configLock is
// held shared, so packets keep flowing; the exclusive hold takes over the
// counters and GRE sockets the packet path changed meanwhile and swaps.
// Rules changed by another writer between the two holds are noticed
// (FWFilterContext::generation): the addition is staged again, and built
// under the exclusive hold if they changed again. Same outcome and status
// as FWApplyRuleset, and the same logs but for one line per stale staging.
[[nodiscard]] ZelStatus FWAddRuleset(SLCGenericFilter* filter, FWRuleset* ruleset,
                                     uint32_t fromIoctl);
// Called by FWAddRuleset between releasing the shared hold and taking the
// exclusive one, with no lock held; null outside tests, which use it to
// change the rules there.
extern void (*g_fwAddBetweenHolds)(SLCGenericFilter* filter);
// Writes the rules in force; the buffer holds 15 + 281 * numRules bytes.
void FWPopulateRuleset(FWFilterContext* ctx, FWRuleset* ruleset);
void FWClearRules(FWFilterContext* ctx);
// Clears the rules of `ctx` as FWClearRules does, but moves them to
// `former` (whose other fields it leaves alone) instead of releasing them:
// called with configLock held exclusively, so that FWClearRules(former)
// can release them after the hold, when no packet sees them. Allocates
// nothing.
void FWTakeRules(FWFilterContext* ctx, FWFilterContext* former);

// --- Lookup (configLock held shared) ----------------------------------------

// The parse result of one packet. Only presence and vlan1QTag are reset per
// packet; a field means something only while its presence bit is set.
struct FWPktSummary {
  uint32_t presence;
  const uint8_t* dMac;
  const uint8_t* sMac;
  uint8_t ethType[2];
  uint8_t vlan1QTag[4];
  const uint8_t* ipSa;
  const uint8_t* ipDa;
  uint8_t ipProto;
  uint8_t sPort[2];
  uint8_t dPort[2];
};

inline constexpr uint32_t FW_PKT_L2 = 0xfu;              // bits 0-3
inline constexpr uint32_t FW_PKT_L3 = 0x70u;             // bits 4-6
inline constexpr uint32_t FW_PKT_PORTS = 0x180u;         // bits 7-8
inline constexpr uint32_t FW_PKT_RPTAG = 0x200u;         // bit 9
inline constexpr uint32_t FW_PKT_IPV4 = 1u << 20;
inline constexpr uint32_t FW_PKT_IPV6 = 1u << 21;
inline constexpr uint32_t FW_PKT_FIRST_FRAG = 1u << 22;
inline constexpr uint32_t FW_PKT_LATER_FRAG = 1u << 23;
inline constexpr uint32_t FW_PKT_TCP = 1u << 24;
inline constexpr uint32_t FW_PKT_UDP = 1u << 25;

// Exact probe: the entry whose tuple equals the packet's and which accepts
// the packet's direction and resource-pool tag, or null.
FWRuleEntry* FWFindExactRule(FWFilterContext* ctx, const FWRuleTuple* tuple, uint64_t hash,
                             uint32_t direction, ZelPkt* pkt);
// General scan in ruleset order; the first matching entry, or null.
FWRuleEntry* FWFindRuleForPacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                                 const FWPktSummary* summary);

// --- Packet path ---------------------------------------------------------------

[[nodiscard]] ZelStatus FWProcessPackets(SLCGenericFilter* filter, ZelPktList* list,
                                         uint32_t direction);
[[nodiscard]] ZelStatus FWProcessSlowPathPackets(SLCGenericFilter* filter, ZelPktList* list,
                                                 uint32_t direction);
uint32_t FWProcessFeatures(FWFilterContext* ctx, ZelPkt* pkt, const FWPktSummary* summary,
                           uint32_t direction);
// Frame bytes [start, end) when they lie within one scatter-gather element.
const uint8_t* SLCGenericFindSGEntry(ZelPkt* pkt, uint32_t start, uint32_t end);
// The no-ruleset path: called with configLock held shared and ruleHash null;
// releases the lock.
[[nodiscard]] ZelStatus FWProcessDefaultAction(FWFilterContext* ctx, ZelPktList* list,
                                               uint32_t direction);

// --- Filter ioctl protocol ------------------------------------------------------

void FWFilterIoctlRequest(SLCGenericFilter* filter, uint32_t requestCode, void* payload,
                          uint64_t payloadLen);
// Applies `ruleset` with fromIoctl = 1; takes configLock itself (a
// replacement through FWReplaceRuleset, an addition through FWAddRuleset).
[[nodiscard]] ZelStatus FWSetIoctlRuleset(SLCGenericFilter* filter, FWRuleset* ruleset,
                                          uint32_t replace);

// --- Saved state ----------------------------------------------------------------

uint32_t FWGetSavedStateLen(SLCGenericFilter* filter);
void FWSaveState(SLCGenericFilter* filter, void* dst, uint32_t room);
[[nodiscard]] ZelStatus FWRestoreState(SLCGenericFilter* filter, const void* src, uint64_t len);
