// The general-rule scan: the first rule of ruleList, in ruleset order, that
// matches a packet summary.
//
// This runs for every packet that no exact rule accepted, over every general
// rule up to the match, so the per-rule cost is what counts:
//   - the packet's fields are decoded once per scan into words (MACs
//     zero-extended to 8 bytes, addresses both as stored and in numeric
//     order), and packed into the four key words of the scan index (the
//     two L2 words only when some slot compares them);
//   - the scan walks the index (fw_index.h), a contiguous array of 64-byte
//     slots in ruleset order, and tests each slot with four masked
//     compares and one branch; a slot that rejects the packet is a rule
//     that the full test would reject, and rejects it before the full test
//     would read the packet's resource-pool tag;
//   - a slot that passes either is a match (its exact bit) or sends its
//     rule through the full test, which runs the steps in their order on
//     the installed record: presence, direction, MACs, ethertype, 802.1Q
//     tag, addresses by family, protocol, resource-pool tag, then ports
//     unless the packet has none; each field test yields d = 1 when the
//     packet differs from (or lies outside) the rule and requires d to
//     equal the field's negation bit.
// A packet whose direction is neither 1 nor 2, or that presents an address
// without being IPv4 or IPv6, is outside what the key words encode: its
// scan runs the full test on every rule.
//
// Runs with configLock held shared; changes nothing, allocates nothing.

#include "firewall/fw_index.h"

namespace {

// A 6-byte MAC of the frame as a zero-extended word; nothing past the 6
// bytes is read.
inline uint64_t PacketMac(const uint8_t* p) {
  return FWLoad32(p) | (static_cast<uint64_t>(FWLoad16(p + 4)) << 32);
}

// An address in both forms: as stored (equality) and as a big-endian
// number (ranges). IPv4 uses hi only.
struct FWAddr {
  uint64_t rawHi, rawLo;
  uint64_t numHi, numLo;
};

inline FWAddr PacketAddr(const uint8_t* p, bool v4) {
  FWAddr a{};
  if (v4) {
    a.rawHi = FWLoad32(p);
    a.numHi = __builtin_bswap32(FWLoad32(p));
  } else {
    a.rawHi = FWLoad64(p);
    a.rawLo = FWLoad64(p + 8);
    a.numHi = __builtin_bswap64(a.rawHi);
    a.numLo = __builtin_bswap64(a.rawLo);
  }
  return a;
}

// The packet's side of every test, decoded once per scan.
struct FWPacketWords {
  uint64_t dMac, sMac;
  uint32_t vlan;
  uint16_t ethType;   // as stored
  uint16_t sPortRaw, dPortRaw;
  uint16_t sPort, dPort;  // numeric
  uint8_t ipProto;
  FWAddr sa, da;
};

inline uint32_t NegBit(uint32_t negate, uint32_t bit) { return (negate & bit) != 0; }

inline uint32_t MacDiffers(uint64_t pkt, const uint8_t* rule, const uint8_t* mask, bool masked) {
  uint64_t b = FWRuleMac(rule);
  if (masked) {
    const uint64_t m = FWRuleMac(mask);
    pkt &= m;
    b &= m;
  }
  return pkt != b;
}

// IPv4 ranges include both bounds.
inline uint32_t V4AddrDiffers(const FWAddr& v, const uint8_t* lo, const uint8_t* hi, bool range) {
  if (!range) return v.rawHi != FWLoad32(lo);
  return v.numHi < __builtin_bswap32(FWLoad32(lo)) || v.numHi > __builtin_bswap32(FWLoad32(hi));
}

// v < the 128-bit big-endian number at p.
inline bool V6Less(const FWAddr& v, const uint8_t* p) {
  const uint64_t hi = __builtin_bswap64(FWLoad64(p));
  return v.numHi < hi || (v.numHi == hi && v.numLo < __builtin_bswap64(FWLoad64(p + 8)));
}

// IPv6 ranges exclude the upper bound.
inline uint32_t V6AddrDiffers(const FWAddr& v, const uint8_t* lo, const uint8_t* hi, bool range) {
  if (!range) return ((v.rawHi ^ FWLoad64(lo)) | (v.rawLo ^ FWLoad64(lo + 8))) != 0;
  return V6Less(v, lo) || !V6Less(v, hi);
}

// Ranges include both bounds.
inline uint32_t PortDiffers(uint16_t raw, uint16_t num, const uint8_t* lo, const uint8_t* hi,
                            bool range) {
  if (!range) return raw != FWLoad16(lo);
  return num < FWNet16(lo) || num > FWNet16(hi);
}

// One scan: the packet, its direction, the packet decoded for the full
// test (on its first use) and its resource-pool tag (read at most once).
struct FWScan {
  const FWPktSummary* summary;
  uint32_t presence;
  uint32_t direction;
  bool v4, v6, ports;
  bool decoded;
  bool haveTag;
  uint16_t tag;
  ZelPkt* pkt;
  FWPacketWords p;
};

// Only fields whose presence bit is set are read from the summary; a field
// the packet lacks is compared by no rule that passes step 1.
void FWDecode(FWScan* s) {
  const FWPktSummary* summary = s->summary;
  FWPacketWords& p = s->p;
  // Every field set once (no block clear: this runs for most packets that
  // reach a rule's full test).
  p.dMac = (s->presence & FW_WC_DMAC) ? PacketMac(summary->dMac) : 0;
  p.sMac = (s->presence & FW_WC_SMAC) ? PacketMac(summary->sMac) : 0;
  p.ethType = FWLoad16(summary->ethType);
  p.vlan = FWLoad32(summary->vlan1QTag);
  p.ipProto = summary->ipProto;
  const bool ip = s->v4 || s->v6;
  p.sa = ip && (s->presence & FW_WC_IPSA) ? PacketAddr(summary->ipSa, s->v4) : FWAddr{};
  p.da = ip && (s->presence & FW_WC_IPDA) ? PacketAddr(summary->ipDa, s->v4) : FWAddr{};
  p.sPortRaw = FWLoad16(summary->sPort);
  p.dPortRaw = FWLoad16(summary->dPort);
  p.sPort = FWNet16(summary->sPort);
  p.dPort = FWNet16(summary->dPort);
  s->decoded = true;
}

// The full test of one rule, steps 1-13 in order.
__attribute__((noinline)) bool FWRuleMatches(const FWRule& r, FWScan* s) {
  if (!s->decoded) FWDecode(s);
  const FWPacketWords& p = s->p;
  const uint32_t f = r.ruleFlags;

  // 1. Every field the rule does not wildcard must be present.
  const uint32_t need = ~f & FW_WC_ALL;
  if ((s->presence & need) != need) return false;
  // 2. Direction (0 never equals a packet's 1 or 2).
  if (r.direction != SLCGenericDirectionBidirectional && r.direction != s->direction) return false;

  const uint32_t n = r.negateFlags;
  // 3-6. L2 fields.
  if (!(f & FW_WC_DMAC) &&
      MacDiffers(p.dMac, r.dMac, r.dMacMask, f & FW_MASK_DMAC) != NegBit(n, FW_NEG_DMAC)) {
    return false;
  }
  if (!(f & FW_WC_SMAC) &&
      MacDiffers(p.sMac, r.sMac, r.sMacMask, f & FW_MASK_SMAC) != NegBit(n, FW_NEG_SMAC)) {
    return false;
  }
  if (!(f & FW_WC_ETHTYPE) &&
      static_cast<uint32_t>(p.ethType != FWLoad16(r.ethType)) != NegBit(n, FW_NEG_ETHTYPE)) {
    return false;
  }
  if (!(f & FW_WC_VLAN) &&
      static_cast<uint32_t>(p.vlan != FWLoad32(r.vlan1QTag)) != NegBit(n, FW_NEG_VLAN)) {
    return false;
  }

  // 7. Addresses, by the packet's family; a rule wildcarding both matches
  // either family whatever its bit 20.
  if ((s->v4 || s->v6) && (f & (FW_WC_IPSA | FW_WC_IPDA)) != (FW_WC_IPSA | FW_WC_IPDA)) {
    if (((f & FW_FLAG_IPV4) != 0) != s->v4) return false;
    if (s->v4) {
      if (!(f & FW_WC_IPSA) &&
          V4AddrDiffers(p.sa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) != NegBit(n, FW_NEG_IPSA)) {
        return false;
      }
      if (!(f & FW_WC_IPDA) &&
          V4AddrDiffers(p.da, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) != NegBit(n, FW_NEG_IPDA)) {
        return false;
      }
    } else {
      if (!(f & FW_WC_IPSA) &&
          V6AddrDiffers(p.sa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) != NegBit(n, FW_NEG_IPSA)) {
        return false;
      }
      if (!(f & FW_WC_IPDA) &&
          V6AddrDiffers(p.da, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) != NegBit(n, FW_NEG_IPDA)) {
        return false;
      }
    }
  }

  // 8. Protocol.
  if (!(f & FW_WC_IPPROTO) &&
      static_cast<uint32_t>(p.ipProto != r.ipProto) != NegBit(n, FW_NEG_IPPROTO)) {
    return false;
  }

  // 9. Resource-pool tag (no negation), read from the packet once per scan
  // and only when a rule that compares it gets this far.
  if (!(f & FW_WC_RPTAG)) {
    if (!s->haveTag) {
      (void)zel_PktResPoolTagGet(s->pkt, &s->tag);  // relied on to fill the tag
      s->haveTag = true;
    }
    if (s->tag != r.rpTag) return false;
  }

  // 10. Without ports the rule matches here.
  if (!s->ports) return true;

  // 11-12. Ports (negation bits: 8 source, 7 destination).
  if (!(f & FW_WC_SPORT) && PortDiffers(p.sPortRaw, p.sPort, r.sPort, r.sPortHigh,
                                        f & FW_RANGE_SPORT) != NegBit(n, FW_NEG_SPORT)) {
    return false;
  }
  if (!(f & FW_WC_DPORT) && PortDiffers(p.dPortRaw, p.dPort, r.dPort, r.dPortHigh,
                                        f & FW_RANGE_DPORT) != NegBit(n, FW_NEG_DPORT)) {
    return false;
  }
  return true;
}

// A scan's state for the full test, set up on its first use: most packets
// are decided by their slots alone.
inline void FWScanStart(FWScan* s, const FWPktSummary* summary, uint32_t direction, ZelPkt* pkt) {
  s->summary = summary;
  s->presence = summary->presence;
  s->direction = direction;
  s->v4 = (s->presence & FW_PKT_IPV4) != 0;
  s->v6 = !s->v4 && (s->presence & FW_PKT_IPV6) != 0;
  s->ports = (s->presence & FW_PKT_PORTS) != 0;
  s->decoded = false;
  s->haveTag = false;
  s->tag = 0;
  s->pkt = pkt;
}

// The packet's key words (fw_index.h) and the classifier's (fw_classifier.h),
// read from the summary. Direction 1 or 2 only.
struct FWPacketKey {
  uint64_t k0, k1, k2, k3;
  FWClsKey cls;
};

// Key word 0's family bits by the presence bits FW_PKT_IPV4 and
// FW_PKT_IPV6: a packet flagged as both counts as IPv4, as in FWScan.
constexpr uint8_t kFamilyBits[4] = {3, 1, 2, 1};
static_assert(FW_PKT_IPV6 == FW_PKT_IPV4 << 1);
static_assert(FW_KEY0_FAMILY_V4 == 1ull << FW_KEY0_FAMILY_SHIFT &&
              FW_KEY0_FAMILY_V6 == 2ull << FW_KEY0_FAMILY_SHIFT);
static_assert(FW_KEY0_FAMILY_SHIFT == FW_KEY0_PRESENCE_SHIFT + 10 && FW_WC_ALL == 0x3ffu);
// Protocol and ports come from one 8-byte load at ipProto: the three bytes
// past dPort are the summary's own padding, shifted out.
static_assert(offsetof(FWPktSummary, sPort) == offsetof(FWPktSummary, ipProto) + 1 &&
              offsetof(FWPktSummary, dPort) == offsetof(FWPktSummary, ipProto) + 3 &&
              offsetof(FWPktSummary, ipProto) + 8 <= sizeof(FWPktSummary));
static_assert(FW_KEY0_DPORT_SHIFT == 0 && FW_KEY0_SPORT_SHIFT == 16 && FW_KEY0_PROTO_SHIFT == 32);

// Words 2 and 3 (MACs, ethertype, 802.1Q tag) only with kL2: an index
// none of whose slots compares them leaves them 0.
template <bool kL2>
inline FWPacketKey PacketKey(const FWPktSummary* summary, uint32_t presence, uint32_t direction) {
  FWPacketKey k;
  const uint32_t ip = (presence / FW_PKT_IPV4) & 3;
  k.k0 = (__builtin_bswap64(FWLoad64(&summary->ipProto)) >> 24) |
         (static_cast<uint64_t>((presence & FW_WC_ALL) | (kFamilyBits[ip] << 10u))
          << FW_KEY0_PRESENCE_SHIFT) |
         (uint64_t{1} << (FW_KEY0_DIR_SHIFT + direction));
  k.k1 = 0;
  k.cls.w[0] = k.k0;
  if (ip & 1) {  // IPv4: the classifier reads the same word
    if (presence & FW_WC_IPSA) k.k1 = static_cast<uint64_t>(FWNet32(summary->ipSa)) << FW_KEY1_SA_SHIFT;
    if (presence & FW_WC_IPDA) k.k1 |= static_cast<uint64_t>(FWNet32(summary->ipDa)) << FW_KEY1_DA_SHIFT;
    k.cls.w[1] = k.k1;
  } else if (ip & 2) {  // IPv6: folded for the slots, leading 32 bits for the classifier
    k.cls.w[1] = 0;
    if (presence & FW_WC_IPSA) {
      const uint8_t* a = summary->ipSa;
      k.k1 = FWFold32(FWLoad64(a), FWLoad64(a + 8)) << FW_KEY1_SA_SHIFT;
      k.cls.w[1] = static_cast<uint64_t>(FWNet32(a)) << FW_KEY1_SA_SHIFT;
    }
    if (presence & FW_WC_IPDA) {
      const uint8_t* a = summary->ipDa;
      k.k1 |= FWFold32(FWLoad64(a), FWLoad64(a + 8)) << FW_KEY1_DA_SHIFT;
      k.cls.w[1] |= static_cast<uint64_t>(FWNet32(a)) << FW_KEY1_DA_SHIFT;
    }
  } else {
    k.cls.w[1] = 0;
  }
  k.k2 = k.k3 = 0;
  if (kL2) {
    k.k2 = static_cast<uint64_t>(FWLoad16(summary->ethType)) << FW_KEY_HIGH16_SHIFT;
    if (presence & FW_WC_DMAC) k.k2 |= PacketMac(summary->dMac);
    k.k3 = FWFold16(FWLoad32(summary->vlan1QTag)) << FW_KEY_HIGH16_SHIFT;
    if (presence & FW_WC_SMAC) k.k3 |= PacketMac(summary->sMac);
  }
  return k;
}

// The classifier's part of the keyed lookup, over its slot numbers of type
// Index.
template <typename Index, typename Miss, typename Accept, typename Slot>
__attribute__((always_inline)) inline FWRuleEntry* FWFindInLeaves(
    const FWClassifier* cls, const FWClsKey& key, const Index* leaves, const Index* residual,
    Miss& miss, Accept& accept, const Slot* slots, FWRuleEntry* const* entries) {
  // The leaf of every tree and the residual list, merged in ascending
  // slot order: the first slot that passes its test is the first match
  // of the whole scan, reached through the same full tests. A slot is
  // in one list only.
  if (cls->numTrees == 1 && cls->numResidual == 0) {  // one leaf: nothing to merge
    const FWClsNode* node = FWClassifierLeaf(cls, cls->roots[0], key);
    const Index* leaf = leaves + node->base;
    for (const Index* end = leaf + FWClsLeafCount(*node); leaf != end; leaf++) {
      if (miss(slots[*leaf]) == 0 && accept(*leaf)) return entries[*leaf];
    }
    return nullptr;
  }
  const Index* list[FW_CLS_TREES + 1];
  const Index* end[FW_CLS_TREES + 1];
  uint32_t lists = 0;
  for (uint32_t t = 0; t < cls->numTrees; t++) {
    const FWClsNode* node = FWClassifierLeaf(cls, cls->roots[t], key);
    const uint32_t n = FWClsLeafCount(*node);
    const Index* leaf = leaves + node->base;
    list[lists] = leaf;
    end[lists] = leaf + n;
    lists += n != 0;
  }
  if (cls->numResidual != 0) {
    list[lists] = residual;
    end[lists++] = residual + cls->numResidual;
  }
  // More than two lists: the smallest head first, until two are left.
  while (lists > 2) {
    uint32_t best = 0;
    for (uint32_t j = 1; j < lists; j++) {
      if (*list[j] < *list[best]) best = j;
    }
    const uint32_t i = *list[best]++;
    if (list[best] == end[best]) {  // exhausted: the last list takes its place
      lists--;
      list[best] = list[lists];
      end[best] = end[lists];
    }
    if (miss(slots[i]) == 0 && accept(i)) return entries[i];
  }
  if (lists == 0) return nullptr;
  const Index* a = list[0];
  const Index* aEnd = end[0];
  if (lists == 2) {
    const Index* b = list[1];
    const Index* bEnd = end[1];
    for (;;) {
      const uint32_t i = *a < *b ? *a++ : *b++;
      if (miss(slots[i]) == 0 && accept(i)) return entries[i];
      if (a == aEnd) {
        a = b;
        aEnd = bEnd;
        break;
      }
      if (b == bEnd) break;
    }
  }
  for (; a != aEnd; a++) {
    if (miss(slots[*a]) == 0 && accept(*a)) return entries[*a];
  }
  return nullptr;
}

template <bool kL2>
struct FWSlotOf {
  using Type = FWScanSlot;
};
template <>
struct FWSlotOf<false> {
  using Type = FWScanHalfSlot;
};

// The keyed lookup: slots tested by their masked words (and the full test
// when a slot says so), through the classifier when there is one.
template <bool kL2>
FWRuleEntry* FWFindKeyed(const FWScanIndex* index, const FWPktSummary* summary,
                         uint32_t presence, uint32_t direction, ZelPkt* pkt) {
  const uint32_t count = index->count;
  FWRuleEntry* const* entries = index->entries;
  const FWPacketKey k = PacketKey<kL2>(summary, presence, direction);
  using Slot = typename FWSlotOf<kL2>::Type;
  const Slot* const slots = kL2 ? reinterpret_cast<const Slot*>(index->slots)
                                : reinterpret_cast<const Slot*>(index->halfSlots);
  FWScan s;
  bool started = false;
  auto miss = [&k](const Slot& slot) {
    uint64_t m = ((k.k0 ^ slot.value[0]) & slot.mask[0]) | ((k.k1 ^ slot.value[1]) & slot.mask[1]);
    if constexpr (kL2) {
      m |= ((k.k2 ^ slot.value[2]) & slot.mask[2]) | ((k.k3 ^ slot.value[3]) & slot.mask[3]);
    }
    return m;
  };
  auto accept = [&](uint32_t i) __attribute__((always_inline)) {
    const uint64_t v0 = slots[i].value[0];
    if (v0 & FW_KEY0_EXACT) return true;
    if (v0 & FW_KEY0_PORT_RANGES) {
      const FWPortRanges& r = index->ranges[i];
      const uint32_t sp = static_cast<uint16_t>(k.k0 >> FW_KEY0_SPORT_SHIFT);
      const uint32_t dp = static_cast<uint16_t>(k.k0 >> FW_KEY0_DPORT_SHIFT);
      return sp - r.sLo <= static_cast<uint32_t>(r.sHi - r.sLo) &&
             dp - r.dLo <= static_cast<uint32_t>(r.dHi - r.dLo);
    }
    if (!started) {
      FWScanStart(&s, summary, direction, pkt);
      started = true;
    }
    return FWRuleMatches(entries[i]->rule, &s);
  };

  if (const FWClassifier* cls = index->classifier; cls != nullptr) {
    return cls->leaves16 != nullptr
               ? FWFindInLeaves(cls, k.cls, cls->leaves16, cls->residual16, miss, accept, slots,
                                entries)
               : FWFindInLeaves(cls, k.cls, cls->leaves, cls->residual, miss, accept, slots,
                                entries);
  }

  // Two slots per iteration and one branch for both while neither passes;
  // a passing pair is resolved in order, so the first match still wins.
  uint32_t i = 0;
  for (; i + 1 < count; i += 2) {
    const uint64_t m0 = miss(slots[i]);
    const uint64_t m1 = miss(slots[i + 1]);
    if (__builtin_expect((m0 != 0) & (m1 != 0), 1)) continue;
    if (m0 == 0 && accept(i)) return entries[i];
    if (m1 == 0 && accept(i + 1)) return entries[i + 1];
  }
  if (i < count && miss(slots[i]) == 0 && accept(i)) return entries[i];
  return nullptr;
}

}  // namespace

FWRuleEntry* FWFindRuleForPacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                                 const FWPktSummary* summary) {
  const FWScanIndex* index = FWContext(filter)->scanIndex;
  if (index == nullptr || index->count == 0) return nullptr;
  const uint32_t presence = summary->presence;

  // The key words encode directions 1 and 2 only, and addresses only of
  // IPv4 and IPv6 packets; any other packet gets the full test of every
  // rule.
  const bool keyed = (direction == SLCGenericDirectionFromSwitch ||
                      direction == SLCGenericDirectionToSwitch) &&
                     ((presence & (FW_PKT_IPV4 | FW_PKT_IPV6)) != 0 ||
                      (presence & (FW_WC_IPSA | FW_WC_IPDA)) == 0);
  if (__builtin_expect(!keyed, 0)) {
    FWScan s;
    FWScanStart(&s, summary, direction, pkt);
    FWRuleEntry* const* entries = index->entries;
    for (uint32_t i = 0; i < index->count; i++) {
      if (entries[i] != nullptr && FWRuleMatches(entries[i]->rule, &s)) return entries[i];
    }
    return nullptr;
  }
  return index->l2Words ? FWFindKeyed<true>(index, summary, presence, direction, pkt)
                        : FWFindKeyed<false>(index, summary, presence, direction, pkt);
}
