// The general-rule scan: the first rule of ruleList, in ruleset order, that
// matches a packet summary.
//
// This runs for every packet that no exact rule accepted, once per general
// rule, so each test is a few word operations:
//   - the packet's fields are decoded once per scan into words (MACs
//     zero-extended to 8 bytes, addresses both as stored and in numeric
//     order), so a rule test only loads the rule's side;
//   - the first test is the presence mask, which rejects a rule that
//     compares a field the packet lacks before any field is read; a field
//     that the packet lacks is therefore never compared, and its decoded
//     word (left 0) never matters;
//   - each field test yields d = 1 when the packet differs from (or lies
//     outside) the rule and requires d to equal the field's negation bit.
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
inline uint16_t Load16(const uint8_t* p) {
  uint16_t v;
  __builtin_memcpy(&v, p, sizeof(v));
  return v;
}

constexpr uint64_t kMac48 = 0x0000ffffffffffffull;

// A 6-byte MAC of the frame as a zero-extended word; nothing past the 6
// bytes is read.
inline uint64_t PacketMac(const uint8_t* p) {
  return Load32(p) | (static_cast<uint64_t>(Load16(p + 4)) << 32);
}
// Rule side: every MAC and mask field of the record is followed by at least
// two more bytes of the record, so one 8-byte load is safe.
inline uint64_t RuleMac(const uint8_t* p) { return Load64(p) & kMac48; }
static_assert(offsetof(FWRule, dMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMac) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, dMacMask) + 8 <= sizeof(FWRule));
static_assert(offsetof(FWRule, sMacMask) + 8 <= sizeof(FWRule));

// An address in both forms: as stored (equality) and as a big-endian
// number (ranges). IPv4 uses hi only.
struct FWAddr {
  uint64_t rawHi, rawLo;
  uint64_t numHi, numLo;
};

inline FWAddr PacketAddr(const uint8_t* p, bool v4) {
  FWAddr a{};
  if (v4) {
    a.rawHi = Load32(p);
    a.numHi = __builtin_bswap32(Load32(p));
  } else {
    a.rawHi = Load64(p);
    a.rawLo = Load64(p + 8);
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
  uint64_t b = RuleMac(rule);
  if (masked) {
    const uint64_t m = RuleMac(mask);
    pkt &= m;
    b &= m;
  }
  return pkt != b;
}

// IPv4 ranges include both bounds.
inline uint32_t V4AddrDiffers(const FWAddr& v, const uint8_t* lo, const uint8_t* hi, bool range) {
  if (!range) return v.rawHi != Load32(lo);
  return v.numHi < __builtin_bswap32(Load32(lo)) || v.numHi > __builtin_bswap32(Load32(hi));
}

// v < the 128-bit big-endian number at p.
inline bool V6Less(const FWAddr& v, const uint8_t* p) {
  const uint64_t hi = __builtin_bswap64(Load64(p));
  return v.numHi < hi || (v.numHi == hi && v.numLo < __builtin_bswap64(Load64(p + 8)));
}

// IPv6 ranges exclude the upper bound.
inline uint32_t V6AddrDiffers(const FWAddr& v, const uint8_t* lo, const uint8_t* hi, bool range) {
  if (!range) return ((v.rawHi ^ Load64(lo)) | (v.rawLo ^ Load64(lo + 8))) != 0;
  return V6Less(v, lo) || !V6Less(v, hi);
}

// Ranges include both bounds.
inline uint32_t PortDiffers(uint16_t raw, uint16_t num, const uint8_t* lo, const uint8_t* hi,
                            bool range) {
  if (!range) return raw != Load16(lo);
  return num < FWNet16(lo) || num > FWNet16(hi);
}

}  // namespace

FWRuleEntry* FWFindRuleForPacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                                 const FWPktSummary* s) {
  FWFilterContext* ctx = FWContext(filter);
  ListLinks* head = &ctx->ruleList;
  if (head->prev == head) return nullptr;

  const uint32_t presence = s->presence;
  const bool pktV4 = (presence & FW_PKT_IPV4) != 0;
  const bool pktV6 = !pktV4 && (presence & FW_PKT_IPV6) != 0;
  const bool pktPorts = (presence & FW_PKT_PORTS) != 0;

  // Only fields whose presence bit is set are read from the summary.
  FWPacketWords p{};
  if (presence & FW_WC_DMAC) p.dMac = PacketMac(s->dMac);
  if (presence & FW_WC_SMAC) p.sMac = PacketMac(s->sMac);
  p.ethType = Load16(s->ethType);
  p.vlan = Load32(s->vlan1QTag);
  p.ipProto = s->ipProto;
  if (pktV4 || pktV6) {
    if (presence & FW_WC_IPSA) p.sa = PacketAddr(s->ipSa, pktV4);
    if (presence & FW_WC_IPDA) p.da = PacketAddr(s->ipDa, pktV4);
  }
  p.sPortRaw = Load16(s->sPort);
  p.dPortRaw = Load16(s->dPort);
  p.sPort = FWNet16(s->sPort);
  p.dPort = FWNet16(s->dPort);

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
        MacDiffers(p.dMac, r.dMac, r.dMacMask, f & FW_MASK_DMAC) != NegBit(n, FW_NEG_DMAC)) {
      continue;
    }
    if (!(f & FW_WC_SMAC) &&
        MacDiffers(p.sMac, r.sMac, r.sMacMask, f & FW_MASK_SMAC) != NegBit(n, FW_NEG_SMAC)) {
      continue;
    }
    if (!(f & FW_WC_ETHTYPE) &&
        static_cast<uint32_t>(p.ethType != Load16(r.ethType)) != NegBit(n, FW_NEG_ETHTYPE)) {
      continue;
    }
    if (!(f & FW_WC_VLAN) &&
        static_cast<uint32_t>(p.vlan != Load32(r.vlan1QTag)) != NegBit(n, FW_NEG_VLAN)) {
      continue;
    }

    // 7. Addresses, by the packet's family; a rule wildcarding both
    // matches either family whatever its bit 20.
    if ((pktV4 || pktV6) && (f & (FW_WC_IPSA | FW_WC_IPDA)) != (FW_WC_IPSA | FW_WC_IPDA)) {
      if (((f & FW_FLAG_IPV4) != 0) != pktV4) continue;
      if (pktV4) {
        if (!(f & FW_WC_IPSA) &&
            V4AddrDiffers(p.sa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) != NegBit(n, FW_NEG_IPSA)) {
          continue;
        }
        if (!(f & FW_WC_IPDA) &&
            V4AddrDiffers(p.da, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) != NegBit(n, FW_NEG_IPDA)) {
          continue;
        }
      } else {
        if (!(f & FW_WC_IPSA) &&
            V6AddrDiffers(p.sa, r.ipSa, r.ipSaHigh, f & FW_RANGE_IPSA) != NegBit(n, FW_NEG_IPSA)) {
          continue;
        }
        if (!(f & FW_WC_IPDA) &&
            V6AddrDiffers(p.da, r.ipDa, r.ipDaHigh, f & FW_RANGE_IPDA) != NegBit(n, FW_NEG_IPDA)) {
          continue;
        }
      }
    }

    // 8. Protocol.
    if (!(f & FW_WC_IPPROTO) &&
        static_cast<uint32_t>(p.ipProto != r.ipProto) != NegBit(n, FW_NEG_IPPROTO)) {
      continue;
    }

    // 9. Resource-pool tag (no negation), read from the packet once per
    // scan and only when a rule compares it.
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
    if (!(f & FW_WC_SPORT) && PortDiffers(p.sPortRaw, p.sPort, r.sPort, r.sPortHigh,
                                          f & FW_RANGE_SPORT) != NegBit(n, FW_NEG_SPORT)) {
      continue;
    }
    if (!(f & FW_WC_DPORT) && PortDiffers(p.dPortRaw, p.dPort, r.dPort, r.dPortHigh,
                                          f & FW_RANGE_DPORT) != NegBit(n, FW_NEG_DPORT)) {
      continue;
    }
    return entry;
  }
  return nullptr;
}
