// Ruleset builder: rules from field values, rules and rulesets to text,
// wire rulesets built and read back.

#include "tools/lib/ruleset_builder.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <optional>

#include "tools/lib/rule_syntax.h"

namespace rules {

using namespace syntax;

// --- RuleBuilder ---------------------------------------------------------------

RuleBuilder::RuleBuilder() {
  std::memset(&rule_, 0, sizeof(rule_));
  rule_.action = SLCGenericActionAccept;
  rule_.direction = SLCGenericDirectionBidirectional;
  rule_.ruleFlags = FW_WC_ALL;
}

RuleBuilder& RuleBuilder::Action(uint32_t action) {
  rule_.action = action;
  return *this;
}
RuleBuilder& RuleBuilder::Dir(uint8_t direction) {
  rule_.direction = direction;
  return *this;
}
RuleBuilder& RuleBuilder::EthType(uint16_t type) { return Set("ethtype", std::to_string(type)); }
RuleBuilder& RuleBuilder::Proto(uint8_t proto) { return Set("proto", std::to_string(proto)); }
RuleBuilder& RuleBuilder::SPort(uint16_t port) { return Set("sport", std::to_string(port)); }
RuleBuilder& RuleBuilder::DPort(uint16_t port) { return Set("dport", std::to_string(port)); }
RuleBuilder& RuleBuilder::RpTag(uint16_t tag) { return Set("rptag", std::to_string(tag)); }
RuleBuilder& RuleBuilder::Bidirectional(uint8_t value) {
  rule_.bidirectional = value;
  return *this;
}
RuleBuilder& RuleBuilder::SnapLen(uint32_t len) {
  rule_.snapLen = len;
  return *this;
}
RuleBuilder& RuleBuilder::Dot1p(uint16_t value) {
  rule_.ethDot1PTag = value;
  return *this;
}
RuleBuilder& RuleBuilder::Dscp(uint16_t value) {
  rule_.dscpTag = value;
  return *this;
}
RuleBuilder& RuleBuilder::Counters(uint64_t pkts, uint64_t bytes) {
  rule_.pktCount = pkts;
  rule_.byteCount = bytes;
  return *this;
}
RuleBuilder& RuleBuilder::RawFlags(uint32_t flags) {
  rawFlags_ = true;
  rawFlagsValue_ = flags;
  return *this;
}
RuleBuilder& RuleBuilder::RawNegate(uint32_t negate) {
  rawNeg_ = true;
  rawNegValue_ = negate;
  return *this;
}

void RuleBuilder::SetFamily(Family f, std::string_view why) {
  if (family_ != kUnset && family_ != f) {
    Fail(std::string(why) + " is " + (f == kV4 ? "IPv4" : "IPv6") +
         " but the rule is already " + (f == kV4 ? "IPv6" : "IPv4"));
  }
  family_ = f;
}

namespace {

// One address field value: A, A/LEN, A-B (inclusive), A-<B (IPv6, B
// excluded as on the wire). Writes low and the wire's high bound.
bool ParseAddressValue(std::string_view key, std::string_view value, uint8_t low[16],
                       uint8_t high[16], bool* range) {
  std::memset(low, 0, 16);
  std::memset(high, 0, 16);
  *range = false;
  const size_t dash = value.find('-');
  const size_t slash = value.find('/');
  if (dash != std::string_view::npos) {
    std::string_view lo = value.substr(0, dash), hi = value.substr(dash + 1);
    const bool exclusive = !hi.empty() && hi.front() == '<';
    if (exclusive) hi.remove_prefix(1);
    const bool v4 = ParseAddr(key, lo, low);
    if (ParseAddr(key, hi, high) != v4) {
      Fail(std::string(key) + " range " + Quote(value) + " mixes IPv4 and IPv6");
    }
    *range = true;
    if (v4) {
      if (exclusive) Fail(std::string(key) + " '-<' (end excluded) is for IPv6 ranges only");
      return true;
    }
    // IPv6 lookups exclude the upper bound; the text's end is included.
    if (!exclusive && !AddrIncrement(high, 16)) {
      Fail(std::string(key) + " range " + Quote(value) +
           " ends at the last IPv6 address, which a range cannot include; end it at "
           "ffff:ffff:ffff:ffff:ffff:ffff:ffff:fffe or write A-<ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff");
    }
    return false;
  }
  if (slash != std::string_view::npos) {
    const bool v4 = ParseAddr(key, value.substr(0, slash), low);
    const int bits = v4 ? 32 : 128;
    const uint64_t len = ParseNumber(std::string(key) + " prefix length", value.substr(slash + 1),
                                     static_cast<uint64_t>(bits));
    const int n = v4 ? 4 : 16;
    std::memcpy(high, low, n);
    for (int b = static_cast<int>(len); b < bits; b++) {
      const uint8_t bit = static_cast<uint8_t>(0x80u >> (b % 8));
      if (low[b / 8] & bit) {
        uint8_t net[16] = {};
        std::memcpy(net, low, n);
        for (int c = static_cast<int>(len); c < bits; c++) net[c / 8] &= ~(0x80u >> (c % 8));
        Fail(std::string(key) + " " + Quote(value) + " has host bits set; did you mean " +
             FormatAddr(net, v4) + "/" + std::to_string(len) + "?");
      }
      high[b / 8] |= bit;
    }
    *range = true;
    if (!v4 && !AddrIncrement(high, 16)) {
      Fail(std::string(key) + " " + Quote(value) +
           " reaches the last IPv6 address, which a range cannot include; leave the field out "
           "or write A-<ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff");
    }
    return v4;
  }
  return ParseAddr(key, value, low);
}

}  // namespace

RuleBuilder& RuleBuilder::Set(std::string_view key, std::string_view value) {
  FWRule& r = rule_;
  const bool wildcard = value == "*";

  // Fields with wildcard, negation (and range or mask) bits.
  struct FieldBits {
    const char* key;
    uint32_t wc, neg, extra;
  };
  static constexpr FieldBits kFields[] = {
      {"dmac", FW_WC_DMAC, FW_NEG_DMAC, FW_MASK_DMAC},
      {"smac", FW_WC_SMAC, FW_NEG_SMAC, FW_MASK_SMAC},
      {"ethtype", FW_WC_ETHTYPE, FW_NEG_ETHTYPE, 0},
      {"vlan", FW_WC_VLAN, FW_NEG_VLAN, 0},
      {"sa", FW_WC_IPSA, FW_NEG_IPSA, FW_RANGE_IPSA},
      {"da", FW_WC_IPDA, FW_NEG_IPDA, FW_RANGE_IPDA},
      {"proto", FW_WC_IPPROTO, FW_NEG_IPPROTO, 0},
      {"sport", FW_WC_SPORT, FW_NEG_SPORT, FW_RANGE_SPORT},
      {"dport", FW_WC_DPORT, FW_NEG_DPORT, FW_RANGE_DPORT},
  };
  for (const FieldBits& fb : kFields) {
    if (key != fb.key) continue;
    // Start from a wildcard, then narrow.
    r.ruleFlags = (r.ruleFlags | fb.wc) & ~fb.extra;
    r.negateFlags &= ~fb.neg;
    if (key == "ethtype") ethTypeGiven_ = true;
    if (wildcard || (key == "ethtype" && value == "any")) return *this;
    if (value.empty()) Fail(std::string(key) + " needs a value");
    if (TakeNegation(&value)) r.negateFlags |= fb.neg;
    r.ruleFlags &= ~fb.wc;
    if (key == "dmac" || key == "smac") {
      const bool d = key == "dmac";
      std::string_view mac = value, mask;
      const size_t slash = value.find('/');
      if (slash != std::string_view::npos) {
        mac = value.substr(0, slash);
        mask = value.substr(slash + 1);
        ParseMac(std::string(key) + " mask", mask, d ? r.dMacMask : r.sMacMask);
        r.ruleFlags |= fb.extra;
      }
      ParseMac(key, mac, d ? r.dMac : r.sMac);
    } else if (key == "ethtype") {
      FWPutNet16(r.ethType, static_cast<uint16_t>(ParseNumber(key, value, 0xffff)));
    } else if (key == "vlan") {
      if (value == "none") {
        std::memset(r.vlan1QTag, 0, 4);
      } else if (value.substr(0, 4) == "raw:") {
        if (value.size() != 12) Fail("vlan " + Quote(value) + " is not raw:XXXXXXXX (8 hex digits)");
        const uint32_t raw = static_cast<uint32_t>(
            ParseNumber(key, std::string("0x").append(value.substr(4)), 0xffffffffu));
        r.vlan1QTag[0] = static_cast<uint8_t>(raw >> 24);
        r.vlan1QTag[1] = static_cast<uint8_t>(raw >> 16);
        r.vlan1QTag[2] = static_cast<uint8_t>(raw >> 8);
        r.vlan1QTag[3] = static_cast<uint8_t>(raw);
      } else {
        std::string_view vid = value, prio;
        const size_t slash = value.find('/');
        if (slash != std::string_view::npos) {
          vid = value.substr(0, slash);
          prio = value.substr(slash + 1);
        }
        const uint16_t tci = static_cast<uint16_t>(
            ParseNumber("vlan id", vid, 4095) |
            (prio.empty() ? 0 : ParseNumber("vlan priority", prio, 7) << 13));
        r.vlan1QTag[0] = 0x81;
        r.vlan1QTag[1] = 0x00;
        FWPutNet16(r.vlan1QTag + 2, tci);
      }
    } else if (key == "sa" || key == "da") {
      const bool s = key == "sa";
      bool range = false;
      const bool v4 = ParseAddressValue(key, value, s ? r.ipSa : r.ipDa,
                                        s ? r.ipSaHigh : r.ipDaHigh, &range);
      if (range) r.ruleFlags |= fb.extra;
      SetFamily(v4 ? kV4 : kV6, key);
    } else if (key == "proto") {
      bool named = false;
      for (const ProtoName& p : kProtoNames) {
        if (value == p.name) {
          r.ipProto = p.value;
          named = true;
        }
      }
      if (!named) {
        if (value.empty() || !std::isdigit(static_cast<unsigned char>(value[0]))) {
          Fail("unknown protocol " + Quote(value) + DidYouMean(value, std::array{"tcp", "udp", "icmp", "icmpv6"}));
        }
        r.ipProto = static_cast<uint8_t>(ParseNumber(key, value, 255));
      }
    } else {  // sport, dport
      const bool s = key == "sport";
      uint8_t* low = s ? r.sPort : r.dPort;
      uint8_t* high = s ? r.sPortHigh : r.dPortHigh;
      std::memset(high, 0, 2);
      const size_t dash = value.find('-');
      if (dash != std::string_view::npos) {
        FWPutNet16(low, static_cast<uint16_t>(ParseNumber(key, value.substr(0, dash), 0xffff)));
        FWPutNet16(high, static_cast<uint16_t>(ParseNumber(key, value.substr(dash + 1), 0xffff)));
        r.ruleFlags |= fb.extra;
      } else {
        FWPutNet16(low, static_cast<uint16_t>(ParseNumber(key, value, 0xffff)));
      }
    }
    return *this;
  }

  auto named = [&](const auto& names, const char* what, uint64_t max) -> uint32_t {
    for (size_t i = 0; i < names.size(); i++) {
      if (value == names[i]) return static_cast<uint32_t>(i);
    }
    if (value.empty() || !std::isdigit(static_cast<unsigned char>(value[0]))) {
      Fail(std::string("unknown ") + what + " " + Quote(value) + DidYouMean(value, names));
    }
    return static_cast<uint32_t>(ParseNumber(key, value, max));
  };
  if (key == "action") {
    r.action = named(kActionNames, "action", 0xffffffffu);
  } else if (key == "dir") {
    r.direction = static_cast<uint8_t>(named(kDirectionNames, "direction", 255));
  } else if (key == "ipv4" || key == "ipv6") {
    if (!value.empty()) Fail(std::string(key) + " takes no value");
    if (familyExplicit_) Fail("address family given twice");
    SetFamily(key == "ipv4" ? kV4 : kV6, key);
    familyExplicit_ = true;
  } else if (key == "rptag") {
    if (wildcard) {
      r.ruleFlags |= FW_WC_RPTAG;
      r.rpTag = 0;
    } else {
      r.rpTag = static_cast<uint16_t>(ParseNumber(key, value, 0xffff));
      r.ruleFlags &= ~FW_WC_RPTAG;
    }
  } else if (key == "bidir") {
    r.bidirectional = value.empty() ? 1 : static_cast<uint8_t>(ParseNumber(key, value, 255));
  } else if (key == "rewrite") {
    ParseMac(key, value, r.rewriteMac);
  } else if (key == "gre") {
    uint8_t addr[16] = {};
    if (!ParseAddr(key, value, addr)) Fail("gre " + Quote(value) + ": the GRE destination must be IPv4");
    std::memcpy(r.greIP, addr, 4);
  } else if (key == "snaplen") {
    r.snapLen = static_cast<uint32_t>(ParseNumber(key, value, 0xffffffffu));
  } else if (key == "pool") {
    if (value.size() >= sizeof(r.resourcePool)) {
      Fail("pool name is " + std::to_string(value.size()) + " characters long; at most 127 fit");
    }
    std::memset(r.resourcePool, 0, sizeof(r.resourcePool));
    value.copy(r.resourcePool, value.size());  // `pool=` alone: no bytes, maybe no data
  } else if (key == "dot1p") {
    r.ethDot1PTag = static_cast<uint16_t>(ParseNumber(key, value, 0xffff));
  } else if (key == "dscp") {
    r.dscpTag = static_cast<uint16_t>(ParseNumber(key, value, 0xffff));
  } else if (key == "pkts") {
    r.pktCount = ParseNumber(key, value, UINT64_MAX);
  } else if (key == "bytes") {
    r.byteCount = ParseNumber(key, value, UINT64_MAX);
  } else if (key == "rawflags") {
    RawFlags(static_cast<uint32_t>(ParseNumber(key, value, 0xffffffffu)));
  } else if (key == "rawneg") {
    RawNegate(static_cast<uint32_t>(ParseNumber(key, value, 0xffffffffu)));
  } else if (key == "wire") {
    if (value.size() != 2 * FW_RULE_SIZE_V7 && value.size() != 2 * FW_RULE_SIZE_V8) {
      Fail("wire takes the whole record: " + std::to_string(2 * FW_RULE_SIZE_V7) + " or " +
           std::to_string(2 * FW_RULE_SIZE_V8) + " hex digits, not " + std::to_string(value.size()));
    }
    wire_.assign(value.size() / 2, 0);
    for (size_t i = 0; i < wire_.size(); i++) {
      auto [end, ec] = std::from_chars(value.data() + 2 * i, value.data() + 2 * i + 2, wire_[i], 16);
      if (ec != std::errc() || end != value.data() + 2 * i + 2) {
        Fail("wire: '" + std::string(value.substr(2 * i, 2)) + "' at digit " + std::to_string(2 * i + 1) +
             " is not hex");
      }
    }
  } else if (key == "exact" || key == "raw") {
    // Markers for the text checks; they change no byte.
  } else {
    Fail("unknown field " + Quote(key) + DidYouMean(key, kRuleKeys));
  }
  return *this;
}

FWRule RuleBuilder::Build() const {
  FWRule r = rule_;
  if (family_ == kV6) {
    r.ruleFlags &= ~FW_FLAG_IPV4;
  } else {
    r.ruleFlags |= FW_FLAG_IPV4;
  }
  if (familyExplicit_ && !ethTypeGiven_) {
    r.ruleFlags &= ~FW_WC_ETHTYPE;
    r.negateFlags &= ~FW_NEG_ETHTYPE;
    FWPutNet16(r.ethType, family_ == kV6 ? 0x86dd : 0x0800);
  }
  if (rawFlags_) r.ruleFlags = rawFlagsValue_;
  if (rawNeg_) r.negateFlags = rawNegValue_;
  if (!wire_.empty()) {
    std::memset(&r, 0, sizeof(r));
    std::memcpy(&r, wire_.data(), std::min(wire_.size(), sizeof(r)));
  }
  return r;
}

// --- Formatting -------------------------------------------------------------------

namespace {

// "A/LEN" when lo..hi (inclusive) is exactly one prefix, else "".
std::string AsPrefix(unsigned __int128 lo, unsigned __int128 hi, int bits, bool v4) {
  const unsigned __int128 host = lo ^ hi;
  if ((host & (host + 1)) != 0 || (lo & host) != 0 || lo > hi) return {};
  int len = bits;
  for (unsigned __int128 h = host; h; h >>= 1) len--;
  uint8_t a[16] = {};
  const int n = v4 ? 4 : 16;
  for (int i = n - 1; i >= 0; i--, lo >>= 8) a[i] = static_cast<uint8_t>(lo);
  return FormatAddr(a, v4) + "/" + std::to_string(len);
}

std::string FormatAddressField(const uint8_t* lo, const uint8_t* hi, bool range, bool v4) {
  if (!range) return FormatAddr(lo, v4);
  const int n = v4 ? 4 : 16;
  uint8_t end[16] = {};
  std::memcpy(end, hi, n);
  if (!v4 && !AddrDecrement(end, 16)) return FormatAddr(lo, v4) + "-<" + FormatAddr(hi, v4);
  const std::string prefix = AsPrefix(AddrValue(lo, n), AddrValue(end, n), n * 8, v4);
  if (!prefix.empty()) return prefix;
  return FormatAddr(lo, v4) + "-" + FormatAddr(end, v4);
}

bool PoolIsText(const FWRule& r) {
  const size_t len = strnlen(r.resourcePool, sizeof(r.resourcePool));
  if (len == sizeof(r.resourcePool)) return false;
  for (size_t i = 0; i < sizeof(r.resourcePool); i++) {
    const char c = r.resourcePool[i];
    if (i >= len ? c != 0 : (!std::isgraph(static_cast<unsigned char>(c)) || c == '#')) return false;
  }
  return true;
}

std::string FormatRuleFields(const FWRule& r, uint8_t version, bool raw) {
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  const bool v4 = (f & FW_FLAG_IPV4) != 0;
  const bool v8 = version >= FW_RULESET_VERSION_8;
  std::string out = raw ? "raw " : "";
  out += "action=" + ActionName(r.action);
  if (r.direction != SLCGenericDirectionBidirectional) out += " dir=" + DirectionName(r.direction);
  auto neg = [&](uint32_t bit) { return (n & bit) ? "!" : ""; };

  const bool hasAddr = !(f & FW_WC_IPSA) || !(f & FW_WC_IPDA);
  const bool ethWild = (f & FW_WC_ETHTYPE) != 0;
  const uint16_t famType = v4 ? 0x0800 : 0x86dd;
  const bool ethIsFamily = !ethWild && !(n & FW_NEG_ETHTYPE) && FWNet16(r.ethType) == famType;
  std::string eth;
  if (!ethWild) {
    char buf[8];
    std::snprintf(buf, sizeof(buf), "0x%04x", FWNet16(r.ethType));
    eth = std::string(" ethtype=") + neg(FW_NEG_ETHTYPE) + buf;
  }
  if (ethIsFamily) {
    out += v4 ? " ipv4" : " ipv6";
  } else if (!v4 && !hasAddr) {
    out += " ipv6" + (ethWild ? std::string(" ethtype=any") : eth);
  } else {
    out += eth;
  }
  if (!(f & FW_WC_DMAC)) {
    out += std::string(" dmac=") + neg(FW_NEG_DMAC) + FormatMac(r.dMac);
    if (f & FW_MASK_DMAC) out += "/" + FormatMac(r.dMacMask);
  }
  if (!(f & FW_WC_SMAC)) {
    out += std::string(" smac=") + neg(FW_NEG_SMAC) + FormatMac(r.sMac);
    if (f & FW_MASK_SMAC) out += "/" + FormatMac(r.sMacMask);
  }
  if (!(f & FW_WC_VLAN)) {
    out += std::string(" vlan=") + neg(FW_NEG_VLAN);
    const uint16_t tci = FWNet16(r.vlan1QTag + 2);
    if (FWNet32(r.vlan1QTag) == 0) {
      out += "none";
    } else if (r.vlan1QTag[0] == 0x81 && r.vlan1QTag[1] == 0 && !(tci & 0x1000)) {
      out += std::to_string(tci & 0xfff);
      if (tci >> 13) out += "/" + std::to_string(tci >> 13);
    } else {
      char buf[16];
      std::snprintf(buf, sizeof(buf), "raw:%08x", FWNet32(r.vlan1QTag));
      out += buf;
    }
  }
  if (!(f & FW_WC_IPSA)) {
    out += std::string(" sa=") + neg(FW_NEG_IPSA) +
           FormatAddressField(r.ipSa, r.ipSaHigh, (f & FW_RANGE_IPSA) != 0, v4);
  }
  if (!(f & FW_WC_IPDA)) {
    out += std::string(" da=") + neg(FW_NEG_IPDA) +
           FormatAddressField(r.ipDa, r.ipDaHigh, (f & FW_RANGE_IPDA) != 0, v4);
  }
  if (!(f & FW_WC_IPPROTO)) {
    std::string proto = std::to_string(r.ipProto);
    for (const ProtoName& p : kProtoNames) {
      if (p.value == r.ipProto) proto = p.name;
    }
    out += std::string(" proto=") + neg(FW_NEG_IPPROTO) + proto;
  }
  if (!(f & FW_WC_SPORT)) {
    out += std::string(" sport=") + neg(FW_NEG_SPORT) + std::to_string(FWNet16(r.sPort));
    if (f & FW_RANGE_SPORT) out += "-" + std::to_string(FWNet16(r.sPortHigh));
  }
  if (!(f & FW_WC_DPORT)) {
    out += std::string(" dport=") + neg(FW_NEG_DPORT) + std::to_string(FWNet16(r.dPort));
    if (f & FW_RANGE_DPORT) out += "-" + std::to_string(FWNet16(r.dPortHigh));
  }
  if (v8 && !(f & FW_WC_RPTAG)) out += " rptag=" + std::to_string(r.rpTag);
  if (r.bidirectional == 1) out += " bidir";
  if (r.bidirectional > 1) out += " bidir=" + std::to_string(r.bidirectional);
  static constexpr uint8_t kZeroMac[6] = {};
  const uint32_t a = r.action;
  if (ActionUses(a, "rewrite") || std::memcmp(r.rewriteMac, kZeroMac, 6) != 0) {
    out += " rewrite=" + FormatMac(r.rewriteMac);
  }
  if (ActionUses(a, "gre") || FWNet32(r.greIP) != 0) out += " gre=" + FormatAddr(r.greIP, true);
  if (r.snapLen) out += " snaplen=" + std::to_string(r.snapLen);
  const size_t poolLen = strnlen(r.resourcePool, sizeof(r.resourcePool));
  if ((ActionUses(a, "pool") || poolLen > 0) && PoolIsText(r)) {
    out += " pool=" + std::string(r.resourcePool, poolLen);
  }
  if (v8) {
    if (ActionUses(a, "dot1p") || r.ethDot1PTag) out += " dot1p=" + std::to_string(r.ethDot1PTag);
    if (ActionUses(a, "dscp") || r.dscpTag) out += " dscp=" + std::to_string(r.dscpTag);
  }
  if (r.pktCount) out += " pkts=" + std::to_string(r.pktCount);
  if (r.byteCount) out += " bytes=" + std::to_string(r.byteCount);
  return out;
}

}  // namespace

std::string FormatRule(const FWRule& rule, uint8_t version) {
  // The checked language first; a record it cannot say (or says
  // differently) is written raw with what the fields do not express (unknown
  // flag bits, negation or mask bits on wildcarded fields) added as raw
  // flags, so the text always reads back to the same record.
  const std::string plain = FormatRuleFields(rule, version, false);
  if (PoolIsText(rule)) {
    std::optional<FWRule> back = ReadRuleText(plain, version);
    if (back && SameRecord(*back, rule, version)) return plain;
  }
  std::string out = FormatRuleFields(rule, version, true);
  std::optional<FWRule> back = ReadRuleText(out, version);
  const uint32_t ignore = version < FW_RULESET_VERSION_8 ? FW_WC_RPTAG : 0;
  if (back && (back->ruleFlags & ~ignore) != (rule.ruleFlags & ~ignore)) {
    out += " rawflags=" + Hex(rule.ruleFlags);
  }
  if (back && back->negateFlags != rule.negateFlags) out += " rawneg=" + Hex(rule.negateFlags);
  // Bytes no field shows (values under a wildcard, the unused tail of an
  // IPv4 address, a bound without its range bit) come from senders that
  // did not start from text; the whole record then follows in hex.
  back = ReadRuleText(out, version);
  if (!back || !SameRecord(*back, rule, version)) {
    const size_t size = version == FW_RULESET_VERSION_7 ? FW_RULE_SIZE_V7 : FW_RULE_SIZE_V8;
    FWRule w = rule;
    if (version == FW_RULESET_VERSION_7) w.ruleFlags &= ~FW_WC_RPTAG;
    const uint8_t* p = reinterpret_cast<const uint8_t*>(&w);
    out += " wire=";
    for (size_t i = 0; i < size; i++) {
      char buf[3];
      std::snprintf(buf, sizeof(buf), "%02x", p[i]);
      out += buf;
    }
  }
  return out;
}

// --- Rulesets -------------------------------------------------------------------

RulesetBuilder::RulesetBuilder(uint8_t version) : version_(version) {}

RulesetBuilder& RulesetBuilder::Version(uint8_t version) {
  version_ = version;
  return *this;
}
RulesetBuilder& RulesetBuilder::Features(uint32_t features) {
  features_ = features;
  return *this;
}
RulesetBuilder& RulesetBuilder::FragOverride(uint32_t action) {
  fragOverride_ = action;
  return *this;
}
RulesetBuilder& RulesetBuilder::Add(const FWRule& rule) {
  rules_.push_back(rule);
  return *this;
}
RulesetBuilder& RulesetBuilder::Add(std::string_view line) { return Add(ParseRule(line)); }

RulesetBuilder& RulesetBuilder::AddText(std::string_view text) {
  RulesetText t = ReadRulesetText(text);
  if (!t.Ok()) throw RuleError(RenderDiagnostics("", t.diagnostics));
  version_ = t.version;
  features_ = t.features;
  fragOverride_ = t.fragOverride;
  for (const TextRule& r : t.rules) rules_.push_back(r.rule);
  return *this;
}

std::vector<uint8_t> RulesetBuilder::Bytes() const {
  uint32_t size;
  if (version_ == FW_RULESET_VERSION_7) {
    size = FW_RULE_SIZE_V7;
  } else if (version_ == FW_RULESET_VERSION_8) {
    size = FW_RULE_SIZE_V8;
  } else {
    Fail("ruleset version " + std::to_string(version_) + " is not 7 or 8");
  }
  std::vector<uint8_t> out(FW_RULESET_HEADER_SIZE + rules_.size() * size);
  FWRulesetHeader h{};
  h.version = version_;
  h.highestSupportedVersion = FW_RULESET_VERSION_8;
  h.lowestSupportedVersion = FW_RULESET_VERSION_7;
  h.numRules = static_cast<uint32_t>(rules_.size());
  h.fwFeatures = features_;
  h.fragOverride = fragOverride_;
  std::memcpy(out.data(), &h, sizeof(h));
  uint8_t* p = out.data() + FW_RULESET_HEADER_SIZE;
  for (size_t i = 0; i < rules_.size(); i++, p += size) {
    FWRule r = rules_[i];
    if (version_ == FW_RULESET_VERSION_7) {
      const uint8_t* bytes = reinterpret_cast<const uint8_t*>(&r);
      for (uint32_t b = FW_RULE_SIZE_V7; b < FW_RULE_SIZE_V8; b++) {
        if (bytes[b] != 0) {
          Fail("rule " + std::to_string(i + 1) + " uses version-8 fields in a version-7 ruleset");
        }
      }
      r.ruleFlags &= ~FW_WC_RPTAG;
    }
    std::memcpy(p, &r, size);
  }
  return out;
}

DecodedRuleset DecodeRuleset(std::span<const uint8_t> bytes) {
  if (bytes.size() < FW_RULESET_HEADER_SIZE) {
    Fail("ruleset of " + std::to_string(bytes.size()) + " bytes is shorter than its 15-byte header");
  }
  FWRulesetHeader h;
  std::memcpy(&h, bytes.data(), sizeof(h));
  uint32_t size;
  if (h.version == FW_RULESET_VERSION_7) {
    size = FW_RULE_SIZE_V7;
  } else if (h.version == FW_RULESET_VERSION_8) {
    size = FW_RULE_SIZE_V8;
  } else {
    Fail("ruleset version " + std::to_string(h.version) + " is not 7 or 8");
  }
  if (bytes.size() != FW_RULESET_HEADER_SIZE + static_cast<uint64_t>(h.numRules) * size) {
    Fail("ruleset length " + std::to_string(bytes.size()) + " does not match its " +
         std::to_string(h.numRules) + " rules of " + std::to_string(size) + " bytes");
  }
  DecodedRuleset out;
  out.version = h.version;
  out.highestSupportedVersion = h.highestSupportedVersion;
  out.lowestSupportedVersion = h.lowestSupportedVersion;
  out.fwFeatures = h.fwFeatures;
  out.fragOverride = h.fragOverride;
  out.rules.resize(h.numRules);
  for (uint32_t i = 0; i < h.numRules; i++) {
    std::memset(&out.rules[i], 0, sizeof(FWRule));
    std::memcpy(&out.rules[i], bytes.data() + FW_RULESET_HEADER_SIZE + uint64_t{i} * size, size);
  }
  return out;
}

std::string FormatRuleset(std::span<const uint8_t> bytes) {
  DecodedRuleset d = DecodeRuleset(bytes);
  std::string out = "ruleset version=" + std::to_string(d.version);
  const bool rawHeader = (d.fwFeatures & ~(FW_FEATURE_DROP_BPDU | FW_FEATURE_DROP_DHCP_SERVER)) ||
                         d.fragOverride >= kActionNames.size();
  if (d.fwFeatures) out += " features=" + FeatureNames(d.fwFeatures);
  if (d.fragOverride) out += " frag=" + ActionName(d.fragOverride);
  if (rawHeader) out += " raw";
  out += "\n";
  for (size_t i = 0; i < d.rules.size(); i++) {
    const FWRule& r = d.rules[i];
    if (i + 1 == d.rules.size()) {
      const uint32_t a = r.action;
      if ((a == SLCGenericActionAccept || a == SLCGenericActionDrop || a == SLCGenericActionPunt) &&
          SameRecord(r, DefaultRule(a), d.version)) {
        out += "default=" + ActionName(a) + "\n";
        break;
      }
    }
    out += FormatRule(r, d.version) + "\n";
  }
  return out;
}

std::vector<uint8_t> ParseRuleset(std::string_view text) {
  return RulesetBuilder().AddText(text).Bytes();
}

bool TryParseRuleset(std::string_view text, std::vector<uint8_t>* bytes, std::string* error) {
  try {
    *bytes = ParseRuleset(text);
    return true;
  } catch (const RuleError& e) {
    if (error) *error = e.what();
    return false;
  }
}

}  // namespace rules
