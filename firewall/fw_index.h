// The scan index of the general rules: a contiguous array, in ruleset order,
// of one 64-byte slot per entry of ruleList, built whenever ruleList changes
// (under configLock held exclusively, or before taking it for the staged
// list of a replacing ruleset) and read by the general scan (shared).
//
// A slot is a pre-filter. The scan packs the packet's fields once into four
// key words K[0..3]; a rule can match only when, for every word,
// (K[w] ^ value[w]) & mask[w] == 0. The slot encodes, as masked equality,
// every test of the rule that can be expressed that way:
//   - presence (every field the rule compares), direction, address family;
//   - MACs (with their masks), ethertype, protocol, IPv4 addresses and
//     ports compared for equality, and IPv4 or port ranges that are
//     exactly a prefix (both in numeric order, as the classifier's trees
//     read them from the same words);
//   - a necessary condition for the rest: the common leading bits of any
//     other IPv4 or port range, a 16-bit fold of the 802.1Q tag, 32-bit folds of
//     IPv6 addresses.
// Negated fields, IPv6 ranges and the resource-pool tag are left out (mask
// 0). A slot that passes goes through the full step-by-step test of the
// rule, unless its value word 0 carries FW_KEY0_EXACT: then every test of
// the rule is exactly the masked equality and passing it is matching; or
// FW_KEY0_PORT_RANGES: then the rule's only other tests are port ranges
// (not negated, not empty), and matching is passing the slot with the
// packet's ports inside the slot's FWPortRanges.
//
// Invariant (configLock): while the filter has general rules, scanIndex
// lists exactly the entries of ruleList, back to front (ruleset order), and
// slots of entries removed since it was built (entries[i] null, slot never
// passing); with none it is null or empty. A large index carries the
// compiled classifier (fw_classifier.h) of its slots.
#pragma once

#include "firewall/fw_classifier.h"
#include "firewall/fw_rules.h"

struct FWScanSlot {
  uint64_t value[4];  // rule side, already masked (plus FW_KEY0_EXACT)
  uint64_t mask[4];
};
static_assert(sizeof(FWScanSlot) == 64, "one cache line per rule");

// A slot of an index none of whose slots compares key words 2 and 3: words
// 0 and 1 only, two slots to a cache line, so that the slots a lookup
// reads are half as likely to have left the caches.
struct FWScanHalfSlot {
  uint64_t value[2];
  uint64_t mask[2];
};
static_assert(sizeof(FWScanHalfSlot) == 32);

// The numeric port ranges of a slot whose value word 0 carries
// FW_KEY0_PORT_RANGES (inclusive; 0-65535 for a port the slot compares
// exactly or not at all).
struct FWPortRanges {
  uint16_t sLo, sHi, dLo, dHi;
};

struct FWScanIndex {
  uint32_t count;          // slots in use, ruleset order
  uint32_t capacity;
  FWScanSlot* slots;       // inside this block, 64-byte aligned; null when !l2Words
  FWScanHalfSlot* halfSlots;  // the same storage, when !l2Words; else null
  FWRuleEntry** entries;   // inside this block; entries[i] belongs to slots[i]
  FWPortRanges* ranges;    // inside this block; ranges[i] belongs to slots[i]
  FWClassifier* classifier;  // separate block, or null: scan every slot
  bool l2Words;            // some slot masks key word 2 or 3; else the scan skips both,
                           // and the slots are half slots
};

// Key word 0: ports (numeric) and protocol, presence bits 0-9, the family
// and direction bits, and two bits that only rules use. Ports and protocol
// sit where a big-endian load of the summary's ipProto, sPort and dPort
// puts them, so the packet's side is one load, one swap and one shift.
inline constexpr uint32_t FW_KEY0_DPORT_SHIFT = 0;   // 16 bits, numeric
inline constexpr uint32_t FW_KEY0_SPORT_SHIFT = 16;  // 16 bits, numeric
inline constexpr uint32_t FW_KEY0_PROTO_SHIFT = 32;  // 8 bits
inline constexpr uint32_t FW_KEY0_PRESENCE_SHIFT = 40;  // presence bits 0-9
inline constexpr uint32_t FW_KEY0_FAMILY_SHIFT = 50;
inline constexpr uint64_t FW_KEY0_FAMILY_V4 = 1ull << 50;  // IPv4 packet, or not IP
inline constexpr uint64_t FW_KEY0_FAMILY_V6 = 1ull << 51;  // IPv6 packet, or not IP
inline constexpr uint32_t FW_KEY0_DIR_SHIFT = 51;          // direction d sets bit 51 + d
inline constexpr uint64_t FW_KEY0_DIR_FROM = 1ull << 52;   // direction 1
inline constexpr uint64_t FW_KEY0_DIR_TO = 1ull << 53;     // direction 2
static_assert(FW_KEY0_DIR_FROM == 1ull << (FW_KEY0_DIR_SHIFT + SLCGenericDirectionFromSwitch));
static_assert(FW_KEY0_DIR_TO == 1ull << (FW_KEY0_DIR_SHIFT + SLCGenericDirectionToSwitch));
inline constexpr uint64_t FW_KEY0_PORT_RANGES = 1ull << 61;  // value only: exact once ranges hold
inline constexpr uint64_t FW_KEY0_NEVER = 1ull << 62;      // never set in a packet key
inline constexpr uint64_t FW_KEY0_EXACT = 1ull << 63;      // value only, outside every mask
// Key word 1: destination address in bits 0-31, source in 32-63; IPv4
// numeric, IPv6 folded as stored (FWFold32).
inline constexpr uint32_t FW_KEY1_DA_SHIFT = 0;
inline constexpr uint32_t FW_KEY1_SA_SHIFT = 32;
// Key word 2: dMac (zero-extended, as stored) in bits 0-47, ethertype as
// stored in 48-63.
// Key word 3: sMac in bits 0-47, the 802.1Q tag folded (FWFold16) in 48-63.
inline constexpr uint32_t FW_KEY_HIGH16_SHIFT = 48;
inline constexpr uint64_t FW_MAC48 = 0x0000ffffffffffffull;

// A MAC or MAC mask of a rule record as a zero-extended word. Every such
// field is followed by at least two more bytes of the record, so the 8-byte
// load stays inside it.
inline uint64_t FWRuleMac(const uint8_t* p) { return FWLoad64(p) & FW_MAC48; }
static_assert(offsetof(FWRule, dMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, dMacMask) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMacMask) + 8 <= sizeof(FWRule));

// Equal inputs give equal folds, so comparing folds is a necessary
// condition for equality.
inline uint64_t FWFold16(uint32_t v) { return (v ^ (v >> 16)) & 0xffffu; }
inline uint64_t FWFold32(uint64_t rawHi, uint64_t rawLo) {
  const uint64_t x = rawHi ^ rawLo;
  return (x ^ (x >> 32)) & 0xffffffffu;
}

// Builds the index of `ruleList` (entries linked at the front, so walked
// from the back), with its classifier; the entries of `added`, when given,
// follow in ruleset order (the general rules of an addition, before they
// are linked in front of ruleList). Reads only the entries' match fields,
// so the shared hold suffices for lists in force. An empty list yields null
// and ZEL_OK. ZEL_NO_MEMORY when an allocation fails; nothing is then
// allocated.
[[nodiscard]] ZelStatus FWScanIndexBuild(const ListLinks* ruleList, FWScanIndex** index,
                                         const ListLinks* added = nullptr);
void FWScanIndexFree(FWScanIndex** index);
// Drops the slot of `entry`, if any, keeping the others in order; allocates
// nothing. Called before the entry is unlinked and freed. With a
// classifier, whose leaves name slots by number, the slot stays as a
// tombstone instead: it never passes and its entry is null.
void FWScanIndexForget(FWScanIndex* index, const FWRuleEntry* entry);
