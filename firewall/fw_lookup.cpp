// The general-rule scan: the first rule of ruleList, in ruleset order, that
// matches a packet summary.
//
// This runs for every packet that no exact rule accepted, once per general
// rule, so each test is a few word operations. The first test is the
// presence mask: a rule that compares a field the packet lacks is rejected
// before any field is read, which also makes every later read of a summary
// pointer safe. Each field test yields d = 1 when the packet differs from
// (or lies outside) the rule and requires d to equal the field's negation
// bit.
//
// Runs with configLock held shared; changes nothing, allocates nothing.

#include "firewall/fw_rules.h"

namespace {

inline uint64_t Load64(const uint8_t* p) {
  uint64_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}
inline uint32_t Load32(const uint8_t* p) {
  uint32_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}

constexpr uint64_t kMac48 = 0x0000ffffffffffffull;

// A 6-byte MAC as a zero-extended word. Frame side: two loads so that
// nothing past the 6 bytes is read.
inline uint64_t PacketMac(const uint8_t* p) {
  uint32_t lo;
  uint16_t hi;
  __builtin_memcpy(&lo, p, sizeof(lo));
  __builtin_memcpy(&hi, p + 4, sizeof(hi));
  return lo | (static_cast<uint64_t>(hi) << 32);
}
// Rule side: every MAC and mask field of the record is followed by at least
// two more bytes of the record, so one 8-byte load is safe.
inline uint64_t RuleMac(const uint8_t* p) { return Load64(p) & kMac48; }
static_assert(offsetof(FWRule, dMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, dMacMask) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMacMask) + 8 <= sizeof(FWRule));

// d for one MAC field.
inline uint32_t MacDiffers(const uint8_t* pkt, const uint8_t* rule, const uint8_t* mask,
                           bool masked) {
  uint64_t a = PacketMac(pkt);
  uint64_t b = RuleMac(rule);
  if (masked) {
    const uint64_t m = RuleMac(mask);
    a &= m;
    b &= m;
  }
  return a != b;
}

inline uint32_t NegBit(uint32_t negate, uint32_t bit) { return (negate & bit) != 0; }

// d for one address. IPv4 ranges include both bounds; IPv6 ranges exclude
// the upper bound.
inline uint32_t V4AddrDiffers(const uint8_t* v, const uint8_t* lo, const uint8_t* hi,
                              bool range) {
  if (!range) return Load32(v) != Load32(lo);
  const uint32_t x = __builtin_bswap32(Load32(v));
  return x < __builtin_bswap32(Load32(lo)) || x > __builtin_bswap32(Load32(hi));
}

// Big-endian 128-bit compare: -1, 0 or 1.
inline int V6Cmp(const uint8_t* a, const uint8_t* b) {
  const uint64_t ah = __builtin_bswap64(Load64(a)), bh = __builtin_bswap64(Load64(b));
  if (ah != bh) return ah < bh ? -1 : 1;
  const uint64_t al = __builtin_bswap64(Load64(a + 8)), bl = __builtin_bswap64(Load64(b + 8));
  if (al != bl) return al < bl ? -1 : 1;
  return 0;
}

inline uint32_t V6AddrDiffers(const uint8_t* v, const uint8_t* lo, const uint8_t* hi,
                              bool range) {
  if (!range) {
    return ((Load64(v) ^ Load64(lo)) | (Load64(v + 8) ^ Load64(lo + 8))) != 0;
  }
  return V6Cmp(v, lo) < 0 || V6Cmp(v, hi) >= 0;
}

// d for one port (network order); ranges include both bounds.
inline uint32_t PortDiffers(const uint8_t* v, const uint8_t* lo, const uint8_t* hi, bool range) {
  if (!range) return (v[0] != lo[0]) | (v[1] != lo[1]);
  const uint16_t x = FWNet16(v);
  return x < FWNet16(lo) || x > FWNet16(hi);
}

}  // namespace

FWRuleEntry* FWFindRuleForPacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                                 const FWPktSummary* s) {
  FWFilterContext* ctx = FWContext(filter);
  ListLinks* head = &ctx->ruleList;
  const uint32_t presence = s->presence;
  const bool pktV4 = (presence & FW_PKT_IPV4) != 0;
  const bool pktV6 = !pktV4 && (presence & FW_PKT_IPV6) != 0;
  const bool pktPorts = (presence & FW_PKT_PORTS) != 0;
  uint16_t pktTag = 0;
  bool haveTag = false;

  for (ListLinks* l = head->prev; l != head; l = l->prev) {
    FWRuleEntry* entry = FWEntryFromLink(l);
    const FWRule& r = entry->rule;
    const uint32_t f = r.ruleFlags;

    // 1. Every field the rule does not wildcard must be present.
    const uint32_t need = ~f & FW_WC_ALL;
    if ((presence & need) != need) continue;
    // 2. Direction (0 never equals a packet's 1 or 2).
    if (r.direction != SLCGenericDirectionBidirectional && r.direction != direction) continue;

    const uint32_t n = r.negateFlags;
    // 3-6. L2 fields.
    if (!(f & FW_WC_DMAC) &&
        MacDiffers(s->dMac, r.dMac, r.dMacMask, f & FW_MASK_DMAC) != NegBit(n, FW_NEG_DMAC)) {
      continue;
    }
    if (!(f & FW_WC_SMAC) &&
        MacDiffers(s->sMac, r.sMac, r.sMacMask, f & FW_MASK_SMAC) != NegBit(n, FW_NEG_SMAC)) {
      continue;
    }
    if (!(f & FW_WC_ETHTYPE) &&
        static_cast<uint32_t>((s->ethType[0] != r.ethType[0]) | (s->ethType[1] != r.ethType[1])) !=
            NegBit(n, FW_NEG_ETHTYPE)) {
      continue;
    }
    if (!(f & FW_WC_VLAN) &&
        static_cast<uint32_t>(Load32(s->vlan1QTag) != Load32(r.vlan1QTag)) !=
            NegBit(n, FW_NEG_VLAN)) {
      continue;
    }

    // 7. Addresses, by the packet's family; a rule wildcarding both
    // matches either family whatever its bit 20.
    if ((pktV4 || pktV6) && (f & (FW_WC_IPSA | FW_WC_IPDA)) != (FW_WC_IPSA | FW_WC_IPDA)) {
      if (((f & FW_FLAG_IPV4) != 0) != pktV4) continue;
      if (pktV4) {
        if (!(f & FW_WC_IPSA) &&
            V4AddrDiffers(s->ipSa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) !=
                NegBit(n, FW_NEG_IPSA)) {
          continue;
        }
        if (!(f & FW_WC_IPDA) &&
            V4AddrDiffers(s->ipDa, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) !=
                NegBit(n, FW_NEG_IPDA)) {
          continue;
        }
      } else {
        if (!(f & FW_WC_IPSA) &&
            V6AddrDiffers(s->ipSa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) !=
                NegBit(n, FW_NEG_IPSA)) {
          continue;
        }
        if (!(f & FW_WC_IPDA) &&
            V6AddrDiffers(s->ipDa, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) !=
                NegBit(n, FW_NEG_IPDA)) {
          continue;
        }
      }
    }

    // 8. Protocol.
    if (!(f & FW_WC_IPPROTO) &&
        static_cast<uint32_t>(s->ipProto != r.ipProto) != NegBit(n, FW_NEG_IPPROTO)) {
      continue;
    }

    // 9. Resource-pool tag, read from the packet once per scan and only
    // when a rule compares it.
    if (!(f & FW_WC_RPTAG)) {
      if (!haveTag) {
        (void)zel_PktResPoolTagGet(pkt, &pktTag);  // relied on to fill the tag
        haveTag = true;
      }
      if (pktTag != r.rpTag) continue;
    }

    // 10. Without ports the rule matches here.
    if (!pktPorts) return entry;

    // 11-12. Ports (negation bits: 8 source, 7 destination).
    if (!(f & FW_WC_SPORT) &&
        PortDiffers(s->sPort, r.sPort, r.sPortHigh, f & FW_RANGE_SPORT) !=
            NegBit(n, FW_NEG_SPORT)) {
      continue;
    }
    if (!(f & FW_WC_DPORT) &&
        PortDiffers(s->dPort, r.dPort, r.dPortHigh, f & FW_RANGE_DPORT) !=
            NegBit(n, FW_NEG_DPORT)) {
      continue;
    }
    return entry;
  }
  return nullptr;
}
