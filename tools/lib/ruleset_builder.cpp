// Ruleset builder: text syntax <-> FWRule <-> wire rulesets. See the header
// for the syntax.

#include "tools/lib/ruleset_builder.h"

#include <arpa/inet.h>

#include <array>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <cstring>

namespace rules {

namespace {

constexpr std::array<const char*, 12> kActionNames = {
    "none", "drop", "accept", "punt", "copy", "l2rewrite",
    "gre", "log", "pooltag", "dscp", "dot1p", "dscp+dot1p"};
constexpr std::array<const char*, 4> kDirectionNames = {"invalid", "from", "to", "both"};

struct ProtoName {
  const char* name;
  uint8_t value;
};
constexpr std::array<ProtoName, 4> kProtoNames = {
    {{"tcp", 6}, {"udp", 17}, {"icmp", 1}, {"icmpv6", 58}}};

[[noreturn]] void Fail(std::string_view key, std::string_view value, std::string_view why) {
  std::string msg = "bad ";
  msg.append(key);
  if (!value.empty()) {
    msg.append(" '");
    msg.append(value);
    msg.append("'");
  }
  msg.append(": ");
  msg.append(why);
  throw RuleError(msg);
}

uint64_t ParseNumber(std::string_view key, std::string_view text, uint64_t max) {
  std::string_view digits = text;
  int base = 10;
  if (digits.size() > 2 && digits[0] == '0' && (digits[1] == 'x' || digits[1] == 'X')) {
    digits.remove_prefix(2);
    base = 16;
  }
  uint64_t v = 0;
  auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), v, base);
  if (digits.empty() || ec != std::errc() || end != digits.data() + digits.size()) {
    Fail(key, text, "not a number");
  }
  if (v > max) Fail(key, text, "out of range");
  return v;
}

void ParseMac(std::string_view key, std::string_view text, uint8_t out[6]) {
  if (text.size() != 17) Fail(key, text, "expected aa:bb:cc:dd:ee:ff");
  for (int i = 0; i < 6; i++) {
    if (i > 0 && text[i * 3 - 1] != ':') Fail(key, text, "expected aa:bb:cc:dd:ee:ff");
    uint8_t b = 0;
    auto [end, ec] = std::from_chars(text.data() + i * 3, text.data() + i * 3 + 2, b, 16);
    if (ec != std::errc() || end != text.data() + i * 3 + 2) {
      Fail(key, text, "expected aa:bb:cc:dd:ee:ff");
    }
    out[i] = b;
  }
}

std::string FormatMac(const uint8_t mac[6]) {
  char buf[18];
  std::snprintf(buf, sizeof(buf), "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2],
                mac[3], mac[4], mac[5]);
  return buf;
}

// An address; returns true for IPv4 (4 bytes written), false for IPv6 (16).
bool ParseAddr(std::string_view key, std::string_view text, uint8_t out[16]) {
  std::string s(text);
  if (s.find(':') != std::string::npos) {
    if (inet_pton(AF_INET6, s.c_str(), out) != 1) Fail(key, text, "not an IPv6 address");
    return false;
  }
  if (inet_pton(AF_INET, s.c_str(), out) != 1) Fail(key, text, "not an IPv4 address");
  return true;
}

std::string FormatAddr(const uint8_t* addr, bool v4) {
  char buf[INET6_ADDRSTRLEN];
  inet_ntop(v4 ? AF_INET : AF_INET6, addr, buf, sizeof(buf));
  return buf;
}

// Splits a leading '!' off `value`.
bool TakeNegation(std::string_view* value) {
  if (!value->empty() && value->front() == '!') {
    value->remove_prefix(1);
    return true;
  }
  return false;
}

// "a-b" into its two halves; false when there is no '-'.
bool SplitRange(std::string_view value, std::string_view* lo, std::string_view* hi) {
  const size_t dash = value.find('-');
  if (dash == std::string_view::npos) return false;
  *lo = value.substr(0, dash);
  *hi = value.substr(dash + 1);
  return true;
}

uint32_t ParseNamed(std::string_view key, std::string_view value, const char* const* names,
                    size_t count, uint64_t max) {
  for (size_t i = 0; i < count; i++) {
    if (value == names[i]) return static_cast<uint32_t>(i);
  }
  return static_cast<uint32_t>(ParseNumber(key, value, max));
}

std::vector<std::string_view> Tokens(std::string_view line) {
  const size_t hash = line.find('#');
  if (hash != std::string_view::npos) line = line.substr(0, hash);
  std::vector<std::string_view> out;
  size_t i = 0;
  while (i < line.size()) {
    while (i < line.size() && std::isspace(static_cast<unsigned char>(line[i]))) i++;
    size_t j = i;
    while (j < line.size() && !std::isspace(static_cast<unsigned char>(line[j]))) j++;
    if (j > i) out.push_back(line.substr(i, j - i));
    i = j;
  }
  return out;
}

std::vector<std::string_view> Lines(std::string_view text) {
  std::vector<std::string_view> out;
  size_t start = 0;
  while (start <= text.size()) {
    size_t nl = text.find('\n', start);
    if (nl == std::string_view::npos) nl = text.size();
    out.push_back(text.substr(start, nl - start));
    start = nl + 1;
  }
  return out;
}

void SplitToken(std::string_view token, std::string_view* key, std::string_view* value) {
  const size_t eq = token.find('=');
  if (eq == std::string_view::npos) {
    *key = token;
    *value = {};
  } else {
    *key = token.substr(0, eq);
    *value = token.substr(eq + 1);
  }
}

template <typename T>
std::string Hex(T v) {
  char buf[24];
  std::snprintf(buf, sizeof(buf), "0x%llx", static_cast<unsigned long long>(v));
  return buf;
}

}  // namespace

// --- Names ------------------------------------------------------------------

std::string ActionName(uint32_t action) {
  if (action < kActionNames.size()) return kActionNames[action];
  return std::to_string(action);
}

std::string DirectionName(uint8_t direction) {
  if (direction < kDirectionNames.size()) return kDirectionNames[direction];
  return std::to_string(direction);
}

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
  if (family_ != kUnset && family_ != f) Fail(why, {}, "conflicts with the rule's address family");
  family_ = f;
}

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
    if (wildcard) return *this;
    if (value.empty()) Fail(key, value, "missing value");
    if (TakeNegation(&value)) r.negateFlags |= fb.neg;
    r.ruleFlags &= ~fb.wc;
    std::string_view lo, hi;
    if (key == "dmac" || key == "smac") {
      const bool d = key == "dmac";
      std::string_view mac = value, mask;
      const size_t slash = value.find('/');
      if (slash != std::string_view::npos) {
        mac = value.substr(0, slash);
        mask = value.substr(slash + 1);
        ParseMac(key, mask, d ? r.dMacMask : r.sMacMask);
        r.ruleFlags |= fb.extra;
      }
      ParseMac(key, mac, d ? r.dMac : r.sMac);
    } else if (key == "ethtype") {
      FWPutNet16(r.ethType, static_cast<uint16_t>(ParseNumber(key, value, 0xffff)));
    } else if (key == "vlan") {
      if (value == "none") {
        std::memset(r.vlan1QTag, 0, 4);
      } else if (value.substr(0, 4) == "raw:") {
        const uint32_t raw = static_cast<uint32_t>(
            ParseNumber(key, std::string("0x").append(value.substr(4)), 0xffffffffu));
        if (value.size() != 12) Fail(key, value, "expected raw:XXXXXXXX");
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
            ParseNumber(key, vid, 4095) | (prio.empty() ? 0 : ParseNumber(key, prio, 7) << 13));
        r.vlan1QTag[0] = 0x81;
        r.vlan1QTag[1] = 0x00;
        FWPutNet16(r.vlan1QTag + 2, tci);
      }
    } else if (key == "sa" || key == "da") {
      const bool s = key == "sa";
      uint8_t* low = s ? r.ipSa : r.ipDa;
      uint8_t* high = s ? r.ipSaHigh : r.ipDaHigh;
      std::memset(low, 0, 16);
      std::memset(high, 0, 16);
      bool v4;
      if (SplitRange(value, &lo, &hi)) {
        v4 = ParseAddr(key, lo, low);
        if (ParseAddr(key, hi, high) != v4) Fail(key, value, "range mixes address families");
        r.ruleFlags |= fb.extra;
      } else {
        v4 = ParseAddr(key, value, low);
      }
      SetFamily(v4 ? kV4 : kV6, key);
    } else if (key == "proto") {
      bool named = false;
      for (const ProtoName& p : kProtoNames) {
        if (value == p.name) {
          r.ipProto = p.value;
          named = true;
        }
      }
      if (!named) r.ipProto = static_cast<uint8_t>(ParseNumber(key, value, 255));
    } else {  // sport, dport
      const bool s = key == "sport";
      uint8_t* low = s ? r.sPort : r.dPort;
      uint8_t* high = s ? r.sPortHigh : r.dPortHigh;
      std::memset(high, 0, 2);
      if (SplitRange(value, &lo, &hi)) {
        FWPutNet16(low, static_cast<uint16_t>(ParseNumber(key, lo, 0xffff)));
        FWPutNet16(high, static_cast<uint16_t>(ParseNumber(key, hi, 0xffff)));
        r.ruleFlags |= fb.extra;
      } else {
        FWPutNet16(low, static_cast<uint16_t>(ParseNumber(key, value, 0xffff)));
      }
    }
    return *this;
  }

  if (key == "action") {
    r.action = ParseNamed(key, value, kActionNames.data(), kActionNames.size(), 0xffffffffu);
  } else if (key == "dir") {
    r.direction = static_cast<uint8_t>(
        ParseNamed(key, value, kDirectionNames.data(), kDirectionNames.size(), 255));
  } else if (key == "ipv4" || key == "ipv6") {
    if (!value.empty()) Fail(key, value, "takes no value");
    if (familyExplicit_) Fail(key, {}, "address family given twice");
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
    if (!ParseAddr(key, value, addr)) Fail(key, value, "GRE destination must be IPv4");
    std::memcpy(r.greIP, addr, 4);
  } else if (key == "snaplen") {
    r.snapLen = static_cast<uint32_t>(ParseNumber(key, value, 0xffffffffu));
  } else if (key == "pool") {
    if (value.size() >= sizeof(r.resourcePool)) Fail(key, value, "longer than 127 characters");
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
  } else {
    Fail("key", key, "unknown field");
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
  if (rawFlags_) r.ruleFlags = rawFlagsValue_;
  if (rawNeg_) r.negateFlags = rawNegValue_;
  return r;
}

FWRule ParseRule(std::string_view line) {
  RuleBuilder b;
  for (std::string_view token : Tokens(line)) {
    std::string_view key, value;
    SplitToken(token, &key, &value);
    b.Set(key, value);
  }
  return b.Build();
}

bool TryParseRule(std::string_view line, FWRule* rule, std::string* error) {
  try {
    *rule = ParseRule(line);
    return true;
  } catch (const RuleError& e) {
    if (error) *error = e.what();
    return false;
  }
}

// --- Formatting -------------------------------------------------------------------

namespace {

std::string FormatRuleFields(const FWRule& r, uint8_t version) {
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  const bool v4 = (f & FW_FLAG_IPV4) != 0;
  std::string out = "action=" + ActionName(r.action) + " dir=" + DirectionName(r.direction) +
                    (v4 ? " ipv4" : " ipv6");
  auto neg = [&](uint32_t bit) { return (n & bit) ? "!" : ""; };

  if (!(f & FW_WC_DMAC)) {
    out += std::string(" dmac=") + neg(FW_NEG_DMAC) + FormatMac(r.dMac);
    if (f & FW_MASK_DMAC) out += "/" + FormatMac(r.dMacMask);
  }
  if (!(f & FW_WC_SMAC)) {
    out += std::string(" smac=") + neg(FW_NEG_SMAC) + FormatMac(r.sMac);
    if (f & FW_MASK_SMAC) out += "/" + FormatMac(r.sMacMask);
  }
  if (!(f & FW_WC_ETHTYPE)) {
    char buf[8];
    std::snprintf(buf, sizeof(buf), "0x%04x", FWNet16(r.ethType));
    out += std::string(" ethtype=") + neg(FW_NEG_ETHTYPE) + buf;
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
    out += std::string(" sa=") + neg(FW_NEG_IPSA) + FormatAddr(r.ipSa, v4);
    if (f & FW_RANGE_IPSA) out += "-" + FormatAddr(r.ipSaHigh, v4);
  }
  if (!(f & FW_WC_IPDA)) {
    out += std::string(" da=") + neg(FW_NEG_IPDA) + FormatAddr(r.ipDa, v4);
    if (f & FW_RANGE_IPDA) out += "-" + FormatAddr(r.ipDaHigh, v4);
  }
  if (!(f & FW_WC_IPPROTO)) {
    out += std::string(" proto=") + neg(FW_NEG_IPPROTO) + std::to_string(r.ipProto);
  }
  if (!(f & FW_WC_SPORT)) {
    out += std::string(" sport=") + neg(FW_NEG_SPORT) + std::to_string(FWNet16(r.sPort));
    if (f & FW_RANGE_SPORT) out += "-" + std::to_string(FWNet16(r.sPortHigh));
  }
  if (!(f & FW_WC_DPORT)) {
    out += std::string(" dport=") + neg(FW_NEG_DPORT) + std::to_string(FWNet16(r.dPort));
    if (f & FW_RANGE_DPORT) out += "-" + std::to_string(FWNet16(r.dPortHigh));
  }
  if (version >= FW_RULESET_VERSION_8 && !(f & FW_WC_RPTAG)) {
    out += " rptag=" + std::to_string(r.rpTag);
  }
  if (r.bidirectional) out += " bidir=" + std::to_string(r.bidirectional);
  static constexpr uint8_t kZeroMac[6] = {};
  if (std::memcmp(r.rewriteMac, kZeroMac, 6) != 0) out += " rewrite=" + FormatMac(r.rewriteMac);
  if (FWNet32(r.greIP) != 0) out += " gre=" + FormatAddr(r.greIP, true);
  if (r.snapLen) out += " snaplen=" + std::to_string(r.snapLen);
  const size_t poolLen = strnlen(r.resourcePool, sizeof(r.resourcePool));
  if (poolLen > 0) out += " pool=" + std::string(r.resourcePool, poolLen);
  if (version >= FW_RULESET_VERSION_8) {
    if (r.ethDot1PTag) out += " dot1p=" + std::to_string(r.ethDot1PTag);
    if (r.dscpTag) out += " dscp=" + std::to_string(r.dscpTag);
  }
  if (r.pktCount) out += " pkts=" + std::to_string(r.pktCount);
  if (r.byteCount) out += " bytes=" + std::to_string(r.byteCount);
  return out;
}

}  // namespace

std::string FormatRule(const FWRule& rule, uint8_t version) {
  std::string out = FormatRuleFields(rule, version);
  // Flags the readable fields do not express (unknown bits, negation or
  // mask bits on wildcarded fields) are added raw so the text reads back
  // to the same record. Bit 9 does not exist on the version-7 wire.
  FWRule back = ParseRule(out);
  const uint32_t ignore = version < FW_RULESET_VERSION_8 ? FW_WC_RPTAG : 0;
  if ((back.ruleFlags & ~ignore) != (rule.ruleFlags & ~ignore)) {
    out += " rawflags=" + Hex(rule.ruleFlags);
  }
  if (back.negateFlags != rule.negateFlags) out += " rawneg=" + Hex(rule.negateFlags);
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
  bool sawRule = false;
  for (std::string_view line : Lines(text)) {
    std::vector<std::string_view> tokens = Tokens(line);
    if (tokens.empty()) continue;
    if (tokens[0] != "ruleset") {
      Add(line);
      sawRule = true;
      continue;
    }
    if (sawRule) Fail("ruleset", {}, "header line must come before the rules");
    for (size_t i = 1; i < tokens.size(); i++) {
      std::string_view key, value;
      SplitToken(tokens[i], &key, &value);
      if (key == "version") {
        version_ = static_cast<uint8_t>(ParseNumber(key, value, 255));
      } else if (key == "features") {
        features_ = static_cast<uint32_t>(ParseNumber(key, value, 0xffffffffu));
      } else if (key == "frag") {
        fragOverride_ =
            ParseNamed(key, value, kActionNames.data(), kActionNames.size(), 0xffffffffu);
      } else {
        Fail("ruleset key", key, "unknown");
      }
    }
  }
  return *this;
}

std::vector<uint8_t> RulesetBuilder::Bytes() const {
  uint32_t size;
  if (version_ == FW_RULESET_VERSION_7) {
    size = FW_RULE_SIZE_V7;
  } else if (version_ == FW_RULESET_VERSION_8) {
    size = FW_RULE_SIZE_V8;
  } else {
    Fail("version", std::to_string(version_), "only 7 and 8 can be built");
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
          Fail("rule", std::to_string(i), "uses version-8 fields in a version-7 ruleset");
        }
      }
      r.ruleFlags &= ~FW_WC_RPTAG;
    }
    std::memcpy(p, &r, size);
  }
  return out;
}

DecodedRuleset DecodeRuleset(std::span<const uint8_t> bytes) {
  if (bytes.size() < FW_RULESET_HEADER_SIZE) Fail("ruleset", {}, "shorter than its header");
  FWRulesetHeader h;
  std::memcpy(&h, bytes.data(), sizeof(h));
  uint32_t size;
  if (h.version == FW_RULESET_VERSION_7) {
    size = FW_RULE_SIZE_V7;
  } else if (h.version == FW_RULESET_VERSION_8) {
    size = FW_RULE_SIZE_V8;
  } else {
    Fail("ruleset version", std::to_string(h.version), "not 7 or 8");
  }
  if (bytes.size() != FW_RULESET_HEADER_SIZE + static_cast<uint64_t>(h.numRules) * size) {
    Fail("ruleset length", std::to_string(bytes.size()), "does not match numRules");
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
  std::string out = "ruleset version=" + std::to_string(d.version) +
                    " features=" + Hex(d.fwFeatures) + " frag=" + ActionName(d.fragOverride) +
                    "\n";
  for (const FWRule& r : d.rules) out += FormatRule(r, d.version) + "\n";
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
