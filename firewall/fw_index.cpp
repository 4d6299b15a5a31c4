// Building and maintaining the scan index of the general rules (layout and
// meaning in fw_index.h). Runs with configLock held exclusively, by the
// filter's sole owner while it is destroyed, on rules no packet sees yet (a
// replacing ruleset staged before the hold), or, for a build only, with
// configLock held shared (an addition staged beside the rules in force).

#include "firewall/fw_index.h"

namespace {

constexpr uint32_t kSlotAlign = 64;
static_assert(alignof(FWScanSlot) <= kSlotAlign);
static_assert(sizeof(FWScanIndex) <= kSlotAlign, "the header fits before the first slot");
// Per rule: one slot and one entry pointer.
constexpr uint64_t kBytesPerRule =
    sizeof(FWScanSlot) + sizeof(FWRuleEntry*) + sizeof(FWPortRanges);
// Header, alignment slack, then the slots, the entry pointers and the port
// ranges.
constexpr uint64_t kFixedBytes = sizeof(FWScanIndex) + kSlotAlign;

// The leading bits that every value of [lo, hi] shares (numeric order);
// all ones when lo == hi.
inline uint32_t CommonPrefix32(uint32_t lo, uint32_t hi) {
  const uint32_t diff = lo ^ hi;
  if (diff == 0) return 0xffffffffu;
  const int varying = 32 - __builtin_clz(diff);
  return varying == 32 ? 0 : ~0u << varying;
}

// The rule's side of the masked-equality words; see fw_index.h.
struct SlotBuilder {
  uint64_t value[4] = {};
  uint64_t mask[4] = {};
  bool exact = true;
  bool portRanges = false;  // a port range that is not a prefix, in ranges
  FWPortRanges ranges = {0, 0xffff, 0, 0xffff};

  void Require(uint32_t word, uint64_t fieldMask, uint64_t fieldValue) {
    mask[word] |= fieldMask;
    value[word] |= fieldValue & fieldMask;
  }

  // An IPv4 address, numeric, at `shift` of word 1: equal, or within the
  // common prefix of an inclusive range [lo, hi]. An empty range (lo > hi)
  // is left to the full test.
  void V4Address(const uint8_t* lo, const uint8_t* hi, bool range, uint32_t shift) {
    if (!range) {
      Require(1, 0xffffffffull << shift, static_cast<uint64_t>(FWNet32(lo)) << shift);
      return;
    }
    const uint32_t l = FWNet32(lo), h = FWNet32(hi);
    if (l > h) {
      exact = false;
      return;
    }
    const uint32_t prefix = CommonPrefix32(l, h);
    // A range that is exactly a prefix is exactly its masked equality.
    if ((l & ~prefix) != 0 || (h | prefix) != 0xffffffffu) exact = false;
    Require(1, static_cast<uint64_t>(prefix) << shift, static_cast<uint64_t>(l & prefix) << shift);
  }

  // A port, numeric, at `shift` of word 0; a range as for IPv4, which
  // when it is not a prefix also goes to `ranges` (`*lo`, `*hi`).
  void Port(const uint8_t* lo, const uint8_t* hi, bool range, uint32_t shift, uint16_t* rangeLo,
            uint16_t* rangeHi) {
    if (!range) {
      Require(0, 0xffffull << shift, static_cast<uint64_t>(FWNet16(lo)) << shift);
      return;
    }
    const uint32_t l = FWNet16(lo), h = FWNet16(hi);
    if (l > h) {
      exact = false;
      return;
    }
    const uint32_t prefix = CommonPrefix32(l << 16, h << 16) >> 16;
    if ((l & ~prefix) != 0 || (h | prefix) != 0xffffu) {
      portRanges = true;
      *rangeLo = static_cast<uint16_t>(l);
      *rangeHi = static_cast<uint16_t>(h);
    }
    Require(0, static_cast<uint64_t>(prefix) << shift, static_cast<uint64_t>(l & prefix) << shift);
  }
};

void SlotFromRule(const FWRule& r, FWScanSlot* slot, FWPortRanges* ranges) {
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  const uint32_t need = ~f & FW_WC_ALL;
  SlotBuilder b;

  // Step 1: every compared field present.
  b.Require(0, static_cast<uint64_t>(need) << FW_KEY0_PRESENCE_SHIFT,
            static_cast<uint64_t>(need) << FW_KEY0_PRESENCE_SHIFT);
  // Step 2: direction 3 accepts both; any value but 1, 2, 3 matches no
  // packet of direction 1 or 2 (other packet directions bypass the index).
  switch (r.direction) {
    case SLCGenericDirectionFromSwitch: b.Require(0, FW_KEY0_DIR_FROM, FW_KEY0_DIR_FROM); break;
    case SLCGenericDirectionToSwitch: b.Require(0, FW_KEY0_DIR_TO, FW_KEY0_DIR_TO); break;
    case SLCGenericDirectionBidirectional: break;
    default: b.Require(0, FW_KEY0_NEVER, FW_KEY0_NEVER); break;
  }

  // A negated field is tested by the full test only.
  auto compared = [&](uint32_t wildcard, uint32_t negate) {
    if (f & wildcard) return false;
    if (n & negate) {
      b.exact = false;
      return false;
    }
    return true;
  };

  // Steps 3-6.
  if (compared(FW_WC_DMAC, FW_NEG_DMAC)) {
    b.Require(2, (f & FW_MASK_DMAC) ? FWRuleMac(r.dMacMask) : FW_MAC48, FWRuleMac(r.dMac));
  }
  if (compared(FW_WC_SMAC, FW_NEG_SMAC)) {
    b.Require(3, (f & FW_MASK_SMAC) ? FWRuleMac(r.sMacMask) : FW_MAC48, FWRuleMac(r.sMac));
  }
  if (compared(FW_WC_ETHTYPE, FW_NEG_ETHTYPE)) {
    b.Require(2, 0xffffull << FW_KEY_HIGH16_SHIFT,
              static_cast<uint64_t>(FWLoad16(r.ethType)) << FW_KEY_HIGH16_SHIFT);
  }
  if (compared(FW_WC_VLAN, FW_NEG_VLAN)) {
    b.exact = false;
    b.Require(3, 0xffffull << FW_KEY_HIGH16_SHIFT,
              FWFold16(FWLoad32(r.vlan1QTag)) << FW_KEY_HIGH16_SHIFT);
  }

  // Step 7: a rule comparing an address requires its family.
  if ((f & (FW_WC_IPSA | FW_WC_IPDA)) != (FW_WC_IPSA | FW_WC_IPDA)) {
    const bool v4 = (f & FW_FLAG_IPV4) != 0;
    const uint64_t family = v4 ? FW_KEY0_FAMILY_V4 : FW_KEY0_FAMILY_V6;
    b.Require(0, family, family);
    struct Addr {
      uint32_t wildcard, negate, range;
      const uint8_t *lo, *hi;
      uint32_t shift;
    };
    const Addr addrs[2] = {
        {FW_WC_IPSA, FW_NEG_IPSA, FW_RANGE_IPSA, r.ipSa, r.ipSaHigh, FW_KEY1_SA_SHIFT},
        {FW_WC_IPDA, FW_NEG_IPDA, FW_RANGE_IPDA, r.ipDa, r.ipDaHigh, FW_KEY1_DA_SHIFT}};
    for (const Addr& a : addrs) {
      if (!compared(a.wildcard, a.negate)) continue;
      if (v4) {
        b.V4Address(a.lo, a.hi, (f & a.range) != 0, a.shift);
      } else if (!(f & a.range)) {
        b.exact = false;
        b.Require(1, 0xffffffffull << a.shift,
                  FWFold32(FWLoad64(a.lo), FWLoad64(a.lo + 8)) << a.shift);
      } else {
        b.exact = false;  // IPv6 ranges: full test only
      }
    }
  }

  // Step 8.
  if (compared(FW_WC_IPPROTO, FW_NEG_IPPROTO)) {
    b.Require(0, 0xffull << FW_KEY0_PROTO_SHIFT,
              static_cast<uint64_t>(r.ipProto) << FW_KEY0_PROTO_SHIFT);
  }

  // Step 9 is the full test's: it reads the packet's tag, and must do so
  // exactly when steps 1-8 pass. So a rule comparing the tag keeps its
  // ports (steps 11-12) out of the slot too: a slot may reject it only for
  // a reason the full test finds before reading the tag.
  const bool comparesTag = (f & FW_WC_RPTAG) == 0;
  if (comparesTag) b.exact = false;

  // Steps 11-12. A rule comparing a port requires its presence bit, so a
  // packet without ports (step 10) never reaches these words.
  if (compared(FW_WC_SPORT, FW_NEG_SPORT) && !comparesTag) {
    b.Port(r.sPort, r.sPortHigh, (f & FW_RANGE_SPORT) != 0, FW_KEY0_SPORT_SHIFT,
           &b.ranges.sLo, &b.ranges.sHi);
  }
  if (compared(FW_WC_DPORT, FW_NEG_DPORT) && !comparesTag) {
    b.Port(r.dPort, r.dPortHigh, (f & FW_RANGE_DPORT) != 0, FW_KEY0_DPORT_SHIFT,
           &b.ranges.dLo, &b.ranges.dHi);
  }

  for (uint32_t w = 0; w < 4; w++) {
    slot->value[w] = b.value[w];
    slot->mask[w] = b.mask[w];
  }
  *ranges = b.ranges;
  if (b.exact) slot->value[0] |= b.portRanges ? FW_KEY0_PORT_RANGES : FW_KEY0_EXACT;
}

}  // namespace

ZelStatus FWScanIndexBuild(const ListLinks* ruleList, FWScanIndex** index,
                           const ListLinks* added) {
  *index = nullptr;
  const ListLinks* const lists[2] = {ruleList, added};
  uint64_t count = 0;
  for (const ListLinks* list : lists) {
    if (list == nullptr) continue;
    for (const ListLinks* l = list->prev; l != list; l = l->prev) count++;
  }
  if (count == 0) return ZEL_OK;

  const uint64_t bytes = kFixedBytes + count * kBytesPerRule;
  if (bytes > UINT32_MAX) return ZEL_NO_MEMORY;  // more than the heap can give
  auto* block = static_cast<uint8_t*>(SLCGenericAlloc(static_cast<uint32_t>(bytes)));
  if (block == nullptr) return ZEL_NO_MEMORY;

  auto* idx = reinterpret_cast<FWScanIndex*>(block);
  const uintptr_t first = reinterpret_cast<uintptr_t>(block + sizeof(FWScanIndex));
  idx->slots = reinterpret_cast<FWScanSlot*>((first + kSlotAlign - 1) & ~uintptr_t{kSlotAlign - 1});
  idx->entries = reinterpret_cast<FWRuleEntry**>(idx->slots + count);
  idx->ranges = reinterpret_cast<FWPortRanges*>(idx->entries + count);
  idx->capacity = static_cast<uint32_t>(count);

  uint32_t i = 0;
  idx->l2Words = false;
  for (const ListLinks* list : lists) {
    if (list == nullptr) continue;
    for (ListLinks* l = list->prev; l != list; l = l->prev, i++) {
      FWRuleEntry* entry = FWEntryFromLink(l);
      SlotFromRule(entry->rule, &idx->slots[i], &idx->ranges[i]);
      idx->entries[i] = entry;
      idx->l2Words |= (idx->slots[i].mask[2] | idx->slots[i].mask[3]) != 0;
    }
  }
  idx->count = i;
  idx->halfSlots = nullptr;
  if (!idx->l2Words) {
    // Words 0 and 1 of each slot, moved to the front of the storage; slot
    // i's half lands at or below where slot i starts, so in order nothing
    // is overwritten before it is read.
    auto* half = reinterpret_cast<FWScanHalfSlot*>(idx->slots);
    for (uint32_t k = 0; k < idx->count; k++) {
      const FWScanSlot slot = idx->slots[k];
      half[k] = FWScanHalfSlot{{slot.value[0], slot.value[1]}, {slot.mask[0], slot.mask[1]}};
    }
    idx->halfSlots = half;
    idx->slots = nullptr;
  }
  idx->classifier = nullptr;
  if (FWClassifierBuild(idx->entries, idx->count, &idx->classifier) != ZEL_OK) {
    SLCGenericFree(block);
    return ZEL_NO_MEMORY;
  }
  *index = idx;
  return ZEL_OK;
}

void FWScanIndexFree(FWScanIndex** index) {
  if (*index != nullptr) {
    FWClassifierFree(&(*index)->classifier);
    SLCGenericFree(*index);
    *index = nullptr;
  }
}

void FWScanIndexForget(FWScanIndex* index, const FWRuleEntry* entry) {
  // Only general entries (as FWApplyRuleset sorts them) have slots.
  if (index == nullptr || (entry->rule.ruleFlags & FW_GENERAL_RULE_MASK) == 0) return;
  for (uint32_t i = 0; i < index->count; i++) {
    if (index->entries[i] != entry) continue;
    if (index->classifier != nullptr) {
      if (index->halfSlots != nullptr) {
        index->halfSlots[i] = FWScanHalfSlot{{FW_KEY0_NEVER, 0}, {FW_KEY0_NEVER, 0}};
      } else {
        index->slots[i] = FWScanSlot{{FW_KEY0_NEVER, 0, 0, 0}, {FW_KEY0_NEVER, 0, 0, 0}};
      }
      index->entries[i] = nullptr;
      return;
    }
    // Compact in place, front to back, keeping ruleset order.
    for (uint32_t j = i + 1; j < index->count; j++) {
      if (index->halfSlots != nullptr) {
        index->halfSlots[j - 1] = index->halfSlots[j];
      } else {
        index->slots[j - 1] = index->slots[j];
      }
      index->entries[j - 1] = index->entries[j];
      index->ranges[j - 1] = index->ranges[j];
    }
    index->count--;
    return;
  }
}
