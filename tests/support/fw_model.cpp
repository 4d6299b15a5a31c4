#include "tests/support/fw_model.h"

#include <algorithm>
#include <array>
#include <cstring>

namespace testsupport {

namespace {

template <size_t N>
std::array<uint8_t, N> Bytes(const uint8_t* p) {
  std::array<uint8_t, N> a{};
  std::copy(p, p + N, a.begin());
  return a;
}

bool Bit(uint32_t word, uint32_t mask) { return (word & mask) != 0; }

uint16_t Port(const uint8_t p[2]) { return static_cast<uint16_t>(p[0] * 256 + p[1]); }

// Big-endian byte arrays compare lexicographically exactly as the numbers
// they spell.
template <size_t N>
bool Outside(const std::array<uint8_t, N>& v, const std::array<uint8_t, N>& lo,
             const std::array<uint8_t, N>& hi, bool upperInclusive) {
  if (v < lo) return true;
  return upperInclusive ? v > hi : v >= hi;
}

// d for one address field of the given family.
bool AddressDiffers(const uint8_t* pkt, const uint8_t* lo, const uint8_t* hi, bool range,
                    bool v4) {
  if (v4) {
    auto v = Bytes<4>(pkt);
    if (!range) return v != Bytes<4>(lo);
    return Outside(v, Bytes<4>(lo), Bytes<4>(hi), /*upperInclusive=*/true);
  }
  auto v = Bytes<16>(pkt);
  if (!range) return v != Bytes<16>(lo);
  return Outside(v, Bytes<16>(lo), Bytes<16>(hi), /*upperInclusive=*/false);
}

bool PortDiffers(const uint8_t pkt[2], const uint8_t lo[2], const uint8_t hi[2], bool range) {
  if (!range) return Port(pkt) != Port(lo);
  return Port(pkt) < Port(lo) || Port(pkt) > Port(hi);
}

bool MacDiffers(const uint8_t* pkt, const uint8_t* rule, const uint8_t* mask, bool masked) {
  for (int i = 0; i < 6; i++) {
    uint8_t a = pkt[i], b = rule[i];
    if (masked) {
      a &= mask[i];
      b &= mask[i];
    }
    if (a != b) return true;
  }
  return false;
}

}  // namespace

FWPktSummary ModelPacket::Summary() const {
  FWPktSummary s{};
  s.presence = presence;
  s.dMac = dMac;
  s.sMac = sMac;
  std::memcpy(s.ethType, ethType, 2);
  std::memcpy(s.vlan1QTag, vlan1QTag, 4);
  s.ipSa = ipSa;
  s.ipDa = ipDa;
  s.ipProto = ipProto;
  std::memcpy(s.sPort, sPort, 2);
  std::memcpy(s.dPort, dPort, 2);
  return s;
}

uint64_t ModelPacket::Tuple(FWRuleTuple* tuple) const {
  std::memset(tuple, 0, sizeof(*tuple));
  const bool v4 = Bit(presence, FW_PKT_IPV4);
  const size_t alen = v4 ? 4 : 16;
  uint8_t* p = tuple->bytes;
  auto put = [&](const uint8_t* src, size_t n) {
    std::memcpy(p, src, n);
    p += n;
  };
  put(dMac, 6);
  put(sMac, 6);
  put(ethType, 2);
  put(vlan1QTag, 4);
  put(ipSa, alen);
  put(ipDa, alen);
  put(&ipProto, 1);
  put(sPort, 2);
  put(dPort, 2);
  tuple->isIPv4 = v4 ? 1 : 0;
  return HashFunc_HashBytes(tuple->bytes, static_cast<uint32_t>(p - tuple->bytes));
}

void FwModel::Clear() {
  exact_.clear();
  general_.clear();
}

bool FwModel::SameKey(const FWRule& a, const FWRule& b) {
  const bool v4 = Bit(a.ruleFlags, FW_FLAG_IPV4);
  if (v4 != Bit(b.ruleFlags, FW_FLAG_IPV4)) return false;
  const size_t alen = v4 ? 4 : 16;
  return std::memcmp(a.dMac, b.dMac, 6) == 0 && std::memcmp(a.sMac, b.sMac, 6) == 0 &&
         std::memcmp(a.ethType, b.ethType, 2) == 0 &&
         std::memcmp(a.vlan1QTag, b.vlan1QTag, 4) == 0 &&
         std::memcmp(a.ipSa, b.ipSa, alen) == 0 && std::memcmp(a.ipDa, b.ipDa, alen) == 0 &&
         a.ipProto == b.ipProto && Port(a.sPort) == Port(b.sPort) &&
         Port(a.dPort) == Port(b.dPort);
}

void FwModel::InsertExact(const FWRule& rule) {
  for (FWRule& existing : exact_) {
    if (!SameKey(existing, rule)) continue;
    if (rule.bidirectional != 0) existing.bidirectional = rule.bidirectional;
    existing.direction = static_cast<uint8_t>(existing.direction | rule.direction);
    return;
  }
  exact_.push_back(rule);
}

void FwModel::Apply(std::span<const uint8_t> ruleset, bool replace) {
  FWRulesetHeader h;
  std::memcpy(&h, ruleset.data(), sizeof(h));
  size_t size;
  if (h.version == 7) {
    size = 259;
  } else if (h.version == 8) {
    size = 281;
  } else {
    return;
  }
  if (replace) Clear();
  for (uint32_t i = 0; i < h.numRules; i++) {
    FWRule r;
    std::memset(&r, 0, sizeof(r));
    std::memcpy(&r, ruleset.data() + 15 + i * size, size);
    if (h.version == 7) r.ruleFlags |= FW_WC_RPTAG;
    if (r.ruleFlags & FW_GENERAL_RULE_MASK) {
      general_.push_back(r);
      continue;
    }
    InsertExact(r);
    if (r.bidirectional == 1) {
      FWRule m = r;
      std::memcpy(m.dMac, r.sMac, 6);
      std::memcpy(m.sMac, r.dMac, 6);
      const size_t alen = Bit(r.ruleFlags, FW_FLAG_IPV4) ? 4 : 16;
      std::memcpy(m.ipSa, r.ipDa, alen);
      std::memcpy(m.ipDa, r.ipSa, alen);
      std::memcpy(m.sPort, r.dPort, 2);
      std::memcpy(m.dPort, r.sPort, 2);
      m.bidirectional = 2;
      if (r.direction == 1) m.direction = 2;
      if (r.direction == 2) m.direction = 1;
      InsertExact(m);
    }
  }
}

bool FwModel::GeneralMatches(const FWRule& r, const FWPktSummary& pkt, uint32_t direction,
                             uint16_t poolTag) {
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  // Every compared field (bits 0-9) must be present in the packet.
  for (uint32_t bit = 0; bit < 10; bit++) {
    if (!Bit(f, 1u << bit) && !Bit(pkt.presence, 1u << bit)) return false;
  }
  if (!(r.direction == 3 || r.direction == direction)) return false;

  // A field passes when "differs" equals its negation bit.
  auto pass = [&](bool differs, uint32_t negBit) { return differs == Bit(n, negBit); };

  if (!Bit(f, FW_WC_DMAC) &&
      !pass(MacDiffers(pkt.dMac, r.dMac, r.dMacMask, Bit(f, FW_MASK_DMAC)), FW_NEG_DMAC)) {
    return false;
  }
  if (!Bit(f, FW_WC_SMAC) &&
      !pass(MacDiffers(pkt.sMac, r.sMac, r.sMacMask, Bit(f, FW_MASK_SMAC)), FW_NEG_SMAC)) {
    return false;
  }
  if (!Bit(f, FW_WC_ETHTYPE) &&
      !pass(Bytes<2>(pkt.ethType) != Bytes<2>(r.ethType), FW_NEG_ETHTYPE)) {
    return false;
  }
  if (!Bit(f, FW_WC_VLAN) &&
      !pass(Bytes<4>(pkt.vlan1QTag) != Bytes<4>(r.vlan1QTag), FW_NEG_VLAN)) {
    return false;
  }

  const bool pktV4 = Bit(pkt.presence, FW_PKT_IPV4);
  const bool pktV6 = !pktV4 && Bit(pkt.presence, FW_PKT_IPV6);
  const bool bothWild = Bit(f, FW_WC_IPSA) && Bit(f, FW_WC_IPDA);
  if ((pktV4 || pktV6) && !bothWild) {
    if (Bit(f, FW_FLAG_IPV4) != pktV4) return false;
    if (!Bit(f, FW_WC_IPSA) &&
        !pass(AddressDiffers(pkt.ipSa, r.ipSa, r.ipSaHigh, Bit(f, FW_RANGE_IPSA), pktV4),
              FW_NEG_IPSA)) {
      return false;
    }
    if (!Bit(f, FW_WC_IPDA) &&
        !pass(AddressDiffers(pkt.ipDa, r.ipDa, r.ipDaHigh, Bit(f, FW_RANGE_IPDA), pktV4),
              FW_NEG_IPDA)) {
      return false;
    }
  }
  if (!Bit(f, FW_WC_IPPROTO) && !pass(pkt.ipProto != r.ipProto, FW_NEG_IPPROTO)) return false;
  if (!Bit(f, FW_WC_RPTAG) && poolTag != r.rpTag) return false;

  if (!Bit(pkt.presence, FW_WC_SPORT) && !Bit(pkt.presence, FW_WC_DPORT)) return true;
  if (!Bit(f, FW_WC_SPORT) &&
      !pass(PortDiffers(pkt.sPort, r.sPort, r.sPortHigh, Bit(f, FW_RANGE_SPORT)), FW_NEG_SPORT)) {
    return false;
  }
  if (!Bit(f, FW_WC_DPORT) &&
      !pass(PortDiffers(pkt.dPort, r.dPort, r.dPortHigh, Bit(f, FW_RANGE_DPORT)), FW_NEG_DPORT)) {
    return false;
  }
  return true;
}

std::optional<FWRule> FwModel::Match(const FWPktSummary& pkt, uint32_t direction,
                                     uint16_t poolTag) const {
  if (Bit(pkt.presence, FW_WC_SPORT) || Bit(pkt.presence, FW_WC_DPORT)) {
    // The packet's key, as a rule, to compare with SameKey.
    FWRule key;
    std::memset(&key, 0, sizeof(key));
    const bool v4 = Bit(pkt.presence, FW_PKT_IPV4);
    key.ruleFlags = v4 ? FW_FLAG_IPV4 : 0;
    std::memcpy(key.dMac, pkt.dMac, 6);
    std::memcpy(key.sMac, pkt.sMac, 6);
    std::memcpy(key.ethType, pkt.ethType, 2);
    std::memcpy(key.vlan1QTag, pkt.vlan1QTag, 4);
    std::memcpy(key.ipSa, pkt.ipSa, v4 ? 4 : 16);
    std::memcpy(key.ipDa, pkt.ipDa, v4 ? 4 : 16);
    key.ipProto = pkt.ipProto;
    std::memcpy(key.sPort, pkt.sPort, 2);
    std::memcpy(key.dPort, pkt.dPort, 2);
    for (const FWRule& r : exact_) {
      if (!SameKey(r, key)) continue;
      const bool dirOk = r.direction == 3 || r.direction == direction;
      const bool tagOk = Bit(r.ruleFlags, FW_WC_RPTAG) || r.rpTag == poolTag;
      if (dirOk && tagOk) return r;
      break;  // keys are unique: fall through to the general rules
    }
  }
  for (const FWRule& r : general_) {
    if (GeneralMatches(r, pkt, direction, poolTag)) return r;
  }
  return std::nullopt;
}

}  // namespace testsupport
