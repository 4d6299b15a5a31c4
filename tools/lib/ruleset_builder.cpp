// Ruleset builder: text syntax <-> FWRule <-> wire rulesets, with the checks
// that keep a rule text from meaning something other than it says.

#include "tools/lib/ruleset_builder.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <optional>

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

struct FeatureName {
  const char* name;
  uint32_t bit;
};
constexpr std::array<FeatureName, 2> kFeatureNames = {
    {{"drop-bpdu", FW_FEATURE_DROP_BPDU}, {"drop-dhcp-server", FW_FEATURE_DROP_DHCP_SERVER}}};

constexpr std::array<const char*, 28> kRuleKeys = {
    "action", "dir",  "ipv4",    "ipv6",  "dmac",   "smac",     "ethtype", "vlan",  "sa",
    "da",     "proto", "sport",  "dport", "rptag",  "bidir",    "rewrite", "gre",   "snaplen",
    "pool",   "dot1p", "dscp",   "pkts",  "bytes",  "rawflags", "rawneg",  "exact", "raw", "wire"};

[[noreturn]] void Fail(std::string msg) { throw RuleError(std::move(msg)); }

std::string Quote(std::string_view v) {
  std::string out = "'";
  for (char c : v.substr(0, 64)) out += std::isprint(static_cast<unsigned char>(c)) ? c : '?';
  if (v.size() > 64) out += "...";
  return out + "'";
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
  if (digits.empty() || end != digits.data() + digits.size() ||
      (ec != std::errc() && ec != std::errc::result_out_of_range)) {
    Fail(std::string(key) + " " + Quote(text) + " is not a number");
  }
  if (ec == std::errc::result_out_of_range || v > max) {
    Fail(std::string(key) + " " + Quote(text) + " is out of range 0-" + std::to_string(max));
  }
  return v;
}

void ParseMac(std::string_view key, std::string_view text, uint8_t out[6]) {
  const std::string bad = std::string(key) + " " + Quote(text) + " is not a MAC address (aa:bb:cc:dd:ee:ff)";
  if (text.size() != 17) Fail(bad);
  for (int i = 0; i < 6; i++) {
    if (i > 0 && text[i * 3 - 1] != ':') Fail(bad);
    uint8_t b = 0;
    auto [end, ec] = std::from_chars(text.data() + i * 3, text.data() + i * 3 + 2, b, 16);
    if (ec != std::errc() || end != text.data() + i * 3 + 2) Fail(bad);
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
  std::string s(text.substr(0, 64));
  if (s.find(':') != std::string::npos) {
    if (text.size() > 64 || inet_pton(AF_INET6, s.c_str(), out) != 1) {
      Fail(std::string(key) + " " + Quote(text) + " is not an IPv6 address");
    }
    return false;
  }
  if (text.size() > 64 || inet_pton(AF_INET, s.c_str(), out) != 1) {
    Fail(std::string(key) + " " + Quote(text) + " is not an IPv4 address");
  }
  return true;
}

std::string FormatAddr(const uint8_t* addr, bool v4) {
  char buf[INET6_ADDRSTRLEN];
  inet_ntop(v4 ? AF_INET : AF_INET6, addr, buf, sizeof(buf));
  return buf;
}

// Big-endian address arithmetic on n bytes; false on wrap-around.
bool AddrIncrement(uint8_t* a, int n) {
  for (int i = n - 1; i >= 0; i--) {
    if (++a[i] != 0) return true;
  }
  return false;
}
bool AddrDecrement(uint8_t* a, int n) {
  for (int i = n - 1; i >= 0; i--) {
    if (a[i]-- != 0) return true;
  }
  return false;
}

bool TakeNegation(std::string_view* value) {
  if (!value->empty() && value->front() == '!') {
    value->remove_prefix(1);
    return true;
  }
  return false;
}

template <typename T>
std::string Hex(T v) {
  char buf[24];
  std::snprintf(buf, sizeof(buf), "0x%llx", static_cast<unsigned long long>(v));
  return buf;
}

// Edits between two words, a swap of neighbours counting as one.
size_t EditDistance(std::string_view a, std::string_view b) {
  if (a.size() > 32 || b.size() > 32) return 99;
  size_t d[33][33];
  for (size_t i = 0; i <= a.size(); i++) d[i][0] = i;
  for (size_t j = 0; j <= b.size(); j++) d[0][j] = j;
  auto low = [](char c) { return std::tolower(static_cast<unsigned char>(c)); };
  for (size_t i = 1; i <= a.size(); i++) {
    for (size_t j = 1; j <= b.size(); j++) {
      d[i][j] = std::min({d[i - 1][j] + 1, d[i][j - 1] + 1,
                          d[i - 1][j - 1] + (low(a[i - 1]) == low(b[j - 1]) ? 0 : 1)});
      if (i > 1 && j > 1 && low(a[i - 1]) == low(b[j - 2]) && low(a[i - 2]) == low(b[j - 1])) {
        d[i][j] = std::min(d[i][j], d[i - 2][j - 2] + 1);
      }
    }
  }
  return d[a.size()][b.size()];
}

// "; did you mean 'x'?" for the closest name within reach (one edit for
// short words, two for longer ones), or "".
template <typename Names>
std::string DidYouMean(std::string_view word, const Names& names) {
  std::string best;
  size_t bestDist = word.size() <= 4 ? 2 : 3;
  for (const auto& n : names) {
    const size_t d = EditDistance(word, n);
    if (d < bestDist && d < std::string_view(n).size()) {
      bestDist = d;
      best = n;
    }
  }
  return best.empty() ? "" : "; did you mean '" + best + "'?";
}

template <typename Names>
std::string NameList(const Names& names) {
  std::string out;
  for (const auto& n : names) out += (out.empty() ? "" : " ") + std::string(n);
  return out;
}

}  // namespace

const char kRuleSyntaxHelp[] = R"(Rule text syntax
  One rule per line: whitespace-separated KEY=VALUE tokens; '#' starts a
  comment. A field not mentioned (or given as '*') is a wildcard; a value
  starting with '!' matches everything else (version 8, general rules only).
  Each key may appear once per rule.

  Header (optional, first line):
    ruleset version=7|8 features=drop-bpdu,drop-dhcp-server frag=ACTION
  Last line (optional): default=accept|drop|punt
    a catch-all rule after all others, for packets no rule matches

  action=NAME    none drop accept punt copy l2rewrite gre log pooltag dscp
                 dot1p dscp+dot1p (default accept)
  dir=NAME       from (from the switch), to (to the switch), both (default),
                 invalid (never matches)
  ipv4 | ipv6    the address family; also matches its ethertype (0x0800,
                 0x86dd) unless the rule says ethtype=any
  dmac=MAC[/MASK] smac=MAC[/MASK]   aa:bb:cc:dd:ee:ff; /MASK compares under
                 the mask (version 8)
  ethtype=N|any  ethertype, 0x0800 or 2048
  vlan=V         none (untagged, no priority), VID, VID/PRIO, raw:XXXXXXXX
  sa=ADDR da=ADDR   A, A-B (both ends included, either family), A/LEN
                 (CIDR), A-<B (IPv6, B excluded)
  proto=P        tcp udp icmp icmpv6 or 0-255
  sport=N[-M] dport=N[-M]   port or inclusive range, 0-65535
  rptag=N        resource-pool tag the packet must carry (version 8)
  bidir          exact rules only: also install the mirrored rule for
                 replies (bidir=2 marks a mirrored half)
  exact          require an exact rule; an error says why one cannot be
  Action parameters (refused with other actions):
    gre=A.B.C.D [snaplen=N]  action=gre: collector address, bytes copied
    rewrite=MAC               action=l2rewrite
    pool=NAME                 action=pooltag (at most 127 characters)
    dscp=0-63 dot1p=0-7       action=dscp, dot1p, dscp+dot1p (version 8)
  pkts=N bytes=N  counters the rule starts from
  raw            turn the value checks off (what decode prints for records
                 the checked language cannot say); rawflags=N rawneg=N set
                 ruleFlags and negateFlags exactly

  A rule is exact (hash table, probed before all general rules) when it
  gives dmac smac ethtype vlan sa da proto sport dport with no range or
  mask; exact rules only match TCP and UDP. Otherwise it is general
  (ordered list, first match wins). 'sluice-rules check' says which.
)";

// --- Names ------------------------------------------------------------------

std::string ActionName(uint32_t action) {
  if (action < kActionNames.size()) return kActionNames[action];
  return std::to_string(action);
}

std::string DirectionName(uint8_t direction) {
  if (direction < kDirectionNames.size()) return kDirectionNames[direction];
  return std::to_string(direction);
}

std::string FeatureNames(uint32_t features) {
  std::string out;
  for (const FeatureName& f : kFeatureNames) {
    if (features & f.bit) out += (out.empty() ? "" : ",") + std::string(f.name);
    features &= ~f.bit;
  }
  if (features) out += (out.empty() ? "" : ",") + Hex(features);
  return out.empty() ? "none" : out;
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
    std::memcpy(r.resourcePool, value.data(), value.size());
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

// --- Reading texts ----------------------------------------------------------------

namespace {

struct Token {
  std::string_view text, key, value;
  size_t col = 0;       // of the key
  size_t valueCol = 0;  // of the value (after '='), or of the key when bare
  bool hasValue = false;
};

std::vector<Token> Tokenize(std::string_view line) {
  std::vector<Token> out;
  size_t i = 0;
  while (i < line.size() && line[i] != '#') {
    if (std::isspace(static_cast<unsigned char>(line[i]))) {
      i++;
      continue;
    }
    size_t j = i;
    while (j < line.size() && !std::isspace(static_cast<unsigned char>(line[j])) && line[j] != '#') j++;
    Token t;
    t.text = line.substr(i, j - i);
    t.col = i + 1;
    const size_t eq = t.text.find('=');
    if (eq == std::string_view::npos) {
      t.key = t.text;
      t.valueCol = t.col;
    } else {
      t.key = t.text.substr(0, eq);
      t.value = t.text.substr(eq + 1);
      t.valueCol = t.col + eq + 1;
      t.hasValue = true;
    }
    out.push_back(t);
    i = j;
  }
  return out;
}

class Reporter {
 public:
  Reporter(std::vector<Diagnostic>* diags, std::string_view line, size_t lineNo)
      : diags_(diags), line_(line), lineNo_(lineNo) {}

  void Error(size_t col, size_t width, std::string message, std::string note = {}) {
    errors_++;
    if (diags_->size() >= kMaxDiagnostics) return;
    Diagnostic d;
    d.line = lineNo_;
    d.column = col;
    d.width = std::max<size_t>(1, std::min<size_t>(width, 80));
    d.message = std::move(message);
    d.note = std::move(note);
    constexpr size_t kWindow = 160;
    d.sourceColumn = std::min(col > kWindow / 2 ? col - kWindow / 2 : 1, line_.size() + 1);
    for (char c : line_.substr(d.sourceColumn - 1, kWindow)) {
      d.source += (std::isprint(static_cast<unsigned char>(c)) || c == '\t') ? c : '?';
    }
    diags_->push_back(std::move(d));
  }
  void At(const Token& t, std::string message, std::string note = {}) {
    Error(t.col, t.text.size(), std::move(message), std::move(note));
  }
  void AtValue(const Token& t, std::string message, std::string note = {}) {
    Error(t.valueCol, t.hasValue ? std::max<size_t>(1, t.value.size()) : t.key.size(),
          std::move(message), std::move(note));
  }
  size_t errors() const { return errors_; }

 private:
  std::vector<Diagnostic>* diags_;
  std::string_view line_;
  size_t lineNo_;
  size_t errors_ = 0;
};

bool ActionUses(uint32_t action, std::string_view param) {
  if (param == "gre" || param == "snaplen") return action == SLCGenericActionGRE;
  if (param == "rewrite") return action == SLGenericActionL2Rewrite;
  if (param == "pool") return action == SLCGenericActionResourcePoolTag;
  if (param == "dscp") {
    return action == SLCGenericActionDSCPMark || action == SLCGenericActionDSCPMarkAndEthDot1PMark;
  }
  if (param == "dot1p") {
    return action == SLCGenericActionEthDot1PMark ||
           action == SLCGenericActionDSCPMarkAndEthDot1PMark;
  }
  return false;
}

constexpr std::array<const char*, 6> kParams = {"gre", "snaplen", "rewrite", "pool", "dscp", "dot1p"};
constexpr std::array<const char*, 2> kParamUsers[] = {
    {"gre", "gre"},         {"snaplen", "gre"},   {"rewrite", "l2rewrite"},
    {"pool", "pooltag"},    {"dscp", "dscp or dscp+dot1p"}, {"dot1p", "dot1p or dscp+dot1p"}};

bool RequiredParam(uint32_t action, std::string_view param) {
  return ActionUses(action, param) && param != "snaplen";
}

std::string ParamHint(std::string_view param) {
  if (param == "gre") return "gre=A.B.C.D, the IPv4 destination of the GRE copies";
  if (param == "rewrite") return "rewrite=MAC, the address written into the frames";
  if (param == "pool") return "pool=NAME, the resource pool (at most 127 characters)";
  if (param == "dscp") return "dscp=0-63, the DSCP value to write";
  return "dot1p=0-7, the 802.1p priority to write";
}

unsigned __int128 AddrValue(const uint8_t* a, int n) {
  unsigned __int128 v = 0;
  for (int i = 0; i < n; i++) v = (v << 8) | a[i];
  return v;
}

bool SameRecord(const FWRule& a, const FWRule& b, uint8_t version) {
  FWRule x = a, y = b;
  size_t size = FW_RULE_SIZE_V8;
  if (version == FW_RULESET_VERSION_7) {
    x.ruleFlags &= ~FW_WC_RPTAG;
    y.ruleFlags &= ~FW_WC_RPTAG;
    size = FW_RULE_SIZE_V7;
  }
  return std::memcmp(&x, &y, size) == 0;
}

// One rule line, checked. Reports errors and returns nothing when any.
std::optional<TextRule> ReadRuleLine(const std::vector<Token>& tokens, uint8_t version,
                                     Reporter& rep) {
  const size_t before = rep.errors();
  const Token* seen[std::size(kRuleKeys)] = {};
  auto keyIndex = [](std::string_view k) -> int {
    for (size_t i = 0; i < kRuleKeys.size(); i++) {
      if (k == kRuleKeys[i]) return static_cast<int>(i);
    }
    return -1;
  };
  auto find = [&](std::string_view k) -> const Token* { return seen[keyIndex(k)]; };
  bool raw = false;
  for (const Token& t : tokens) raw = raw || t.text == "raw";
  const bool v7 = version == FW_RULESET_VERSION_7;

  RuleBuilder b;
  for (const Token& t : tokens) {
    const int k = keyIndex(t.key);
    if (k < 0) {
      rep.At(t, "unknown field " + Quote(t.key) + DidYouMean(t.key, kRuleKeys),
             "fields: " + NameList(kRuleKeys));
      continue;
    }
    if (seen[k]) {
      rep.At(t, "field '" + std::string(t.key) + "' given twice (first at column " +
                    std::to_string(seen[k]->col) + ")");
      continue;
    }
    seen[k] = &t;
    const std::string_view key = t.key, value = t.value;
    if ((key == "ipv4" || key == "ipv6" || key == "exact" || key == "raw") && t.hasValue) {
      rep.AtValue(t, std::string(key) + " takes no value");
      continue;
    }
    if (key != "ipv4" && key != "ipv6" && key != "exact" && key != "raw" && key != "bidir" &&
        (!t.hasValue || value.empty()) && !(raw && key == "pool" && t.hasValue)) {
      rep.At(t, std::string(key) + " needs a value (" + std::string(key) + "=...)");
      continue;
    }
    // Version-7 records have no bytes for these; `raw` leaves the refusal
    // to the builder, which accepts them only when they write zero bytes.
    if (key == "wire" && !raw) {
      rep.At(t, "wire= (a whole record in hex) is only read in a raw rule");
      continue;
    }
    if (v7 && !raw && (key == "rptag" || key == "dscp" || key == "dot1p")) {
      rep.At(t, std::string(key) + " is a version-8 field; this ruleset is version 7");
      continue;
    }
    if (v7 && !raw && !value.empty() && value[0] == '!') {
      rep.AtValue(t, "negation ('!') needs a version-8 ruleset; this one is version 7");
      continue;
    }
    if (v7 && !raw && (key == "dmac" || key == "smac") && value.find('/') != std::string_view::npos) {
      rep.AtValue(t, "MAC masks need a version-8 ruleset; this one is version 7");
      continue;
    }
    if (!raw) {
      auto byName = [&](const auto& names, const char* what, const char* plural) {
        for (const auto& n : names) {
          if (value == n) return true;
        }
        rep.AtValue(t, std::string("unknown ") + what + " " + Quote(value) + DidYouMean(value, names),
                    std::string(plural) + ": " + NameList(names));
        return false;
      };
      if (key == "action" && !byName(kActionNames, "action", "actions")) continue;
      if (key == "dir" && !byName(kDirectionNames, "direction", "directions")) continue;
      if (key == "proto" && !value.empty() && !std::isdigit(static_cast<unsigned char>(value[0])) &&
          value[0] != '!' && value != "*" &&
          !byName(std::array{"tcp", "udp", "icmp", "icmpv6"}, "protocol",
                  "protocols (or a number 0-255)")) {
        continue;
      }
      if (key == "bidir" && t.hasValue && value != "1" && value != "2") {
        rep.AtValue(t, "bidir is written bare (install the mirrored rule) or bidir=2 (a mirrored half)");
        continue;
      }
    }
    try {
      b.Set(key, value);
    } catch (const RuleError& e) {
      rep.AtValue(t, e.what());
      continue;
    }
    if (!raw) {
      const FWRule r = b.Build();
      if (key == "dscp" && r.dscpTag > 63) rep.AtValue(t, "dscp " + Quote(value) + " is out of range 0-63");
      if (key == "dot1p" && r.ethDot1PTag > 7) rep.AtValue(t, "dot1p " + Quote(value) + " is out of range 0-7");
    }
  }
  if (rep.errors() != before) return std::nullopt;

  TextRule out;
  out.rule = b.Build();
  out.exactAsked = find("exact") != nullptr;
  const FWRule& r = out.rule;
  const uint32_t f = r.ruleFlags;
  const Token* actionTok = find("action");
  auto atAction = [&](std::string msg) {
    if (actionTok) {
      rep.At(*actionTok, std::move(msg));
    } else {
      rep.Error(1, 1, std::move(msg));
    }
  };

  if (!raw) {
    for (const char* p : kParams) {
      const Token* t = find(p);
      if (t && !ActionUses(r.action, p)) {
        std::string users;
        for (const auto& u : kParamUsers) {
          if (std::string_view(u[0]) == p) users = u[1];
        }
        rep.At(*t, std::string(p) + " has no effect with action=" + ActionName(r.action) +
                       "; only action=" + users + " uses it");
      } else if (!t && RequiredParam(r.action, p)) {
        atAction("action=" + ActionName(r.action) + " needs " + ParamHint(p));
      }
    }
    if (r.action == SLCGenericActionGRE && find("gre") && FWNet32(r.greIP) == 0) {
      rep.AtValue(*find("gre"), "gre 0.0.0.0 is not a destination");
    }
    static constexpr uint8_t kZeroMac[6] = {};
    if (find("rewrite") && std::memcmp(r.rewriteMac, kZeroMac, 6) == 0) {
      rep.AtValue(*find("rewrite"), "rewrite 00:00:00:00:00:00 is not an address to write");
    }
    // Ranges whose low end is above the high end match nothing.
    auto portRange = [&](const char* key, uint32_t bit, const uint8_t* lo, const uint8_t* hi) {
      if ((f & bit) && FWNet16(lo) > FWNet16(hi)) {
        rep.AtValue(*find(key), std::string(key) + " range " + std::to_string(FWNet16(lo)) + "-" +
                                    std::to_string(FWNet16(hi)) + " is empty: the low end is above the high end");
      }
    };
    if (find("sport")) portRange("sport", FW_RANGE_SPORT, r.sPort, r.sPortHigh);
    if (find("dport")) portRange("dport", FW_RANGE_DPORT, r.dPort, r.dPortHigh);
    auto addrRange = [&](const char* key, uint32_t bit, const uint8_t* lo, const uint8_t* hi) {
      if (!(f & bit) || !find(key)) return;
      const bool v4 = (f & FW_FLAG_IPV4) != 0;
      const unsigned __int128 l = AddrValue(lo, v4 ? 4 : 16), h = AddrValue(hi, v4 ? 4 : 16);
      if (v4 ? l > h : l >= h) {
        rep.AtValue(*find(key), std::string(key) + " range is empty: the low end is above the high end");
      }
    };
    addrRange("sa", FW_RANGE_IPSA, r.ipSa, r.ipSaHigh);
    addrRange("da", FW_RANGE_IPDA, r.ipDa, r.ipDaHigh);
    const Token* fam = find("ipv4") ? find("ipv4") : find("ipv6");
    const Token* eth = find("ethtype");
    if (fam && eth && eth->value != "any" && eth->value != "*") {
      const uint16_t want = fam->key == "ipv4" ? 0x0800 : 0x86dd;
      if ((r.negateFlags & FW_NEG_ETHTYPE) || FWNet16(r.ethType) != want) {
        char buf[8];
        std::snprintf(buf, sizeof(buf), "0x%04x", want);
        rep.At(*eth, std::string(fam->key) + " already matches ethertype " + buf + "; ethtype=" +
                         std::string(eth->value) + " contradicts it",
               "write ethtype=any to match the address family alone");
      }
    }
    if (IsExactRule(r) && r.negateFlags != 0) {
      const Token* neg = nullptr;
      for (const Token& t : tokens) {
        if (!neg && !t.value.empty() && t.value[0] == '!') neg = &t;
      }
      const std::string msg =
          "negation has no effect on an exact rule: with every field given and no range or mask, "
          "the module matches the values alone";
      if (neg) {
        rep.AtValue(*neg, msg);
      } else {
        rep.Error(1, 1, msg);
      }
    }
  }
  if (const Token* ex = find("exact")) {
    const std::vector<std::string> why = GeneralReasons(r);
    if (!why.empty()) {
      std::string list;
      for (const std::string& w : why) list += (list.empty() ? "" : ", ") + w;
      rep.At(*ex, "the rule cannot be exact: " + list,
             "an exact rule gives dmac smac ethtype vlan sa da proto sport dport, without ranges or masks");
    } else if (r.ipProto != 6 && r.ipProto != 17) {
      rep.At(*ex, "an exact rule only matches TCP and UDP packets; proto=" +
                      std::to_string(r.ipProto) + " would never match");
    }
  }
  if (rep.errors() != before) return std::nullopt;
  return out;
}

FWRule DefaultRule(uint32_t action) {
  RuleBuilder b;
  b.Action(action);
  return b.Build();
}

}  // namespace

std::vector<std::string> GeneralReasons(const FWRule& r) {
  std::vector<std::string> out;
  const uint32_t f = r.ruleFlags;
  static constexpr std::pair<uint32_t, const char*> kBits[] = {
      {FW_WC_DMAC, "dmac wildcard"},   {FW_WC_SMAC, "smac wildcard"},
      {FW_WC_ETHTYPE, "ethtype wildcard"}, {FW_WC_VLAN, "vlan wildcard"},
      {FW_WC_IPSA, "sa wildcard"},     {FW_WC_IPDA, "da wildcard"},
      {FW_WC_IPPROTO, "proto wildcard"}, {FW_WC_SPORT, "sport wildcard"},
      {FW_WC_DPORT, "dport wildcard"}, {FW_RANGE_IPSA, "sa range"},
      {FW_RANGE_IPDA, "da range"},     {FW_RANGE_SPORT, "sport range"},
      {FW_RANGE_DPORT, "dport range"}, {FW_MASK_DMAC, "dmac mask"},
      {FW_MASK_SMAC, "smac mask"}};
  for (const auto& [bit, name] : kBits) {
    if (f & bit) out.push_back(name);
  }
  return out;
}

std::string RenderDiagnostics(std::string_view file, const std::vector<Diagnostic>& diags) {
  std::string out;
  for (const Diagnostic& d : diags) {
    if (!file.empty()) out += std::string(file) + ":";
    out += std::to_string(d.line) + ":" + std::to_string(d.column) + ": error: " + d.message + "\n";
    if (d.line == 0) continue;
    const std::string num = std::to_string(d.line);
    out += " " + num + " | " + d.source + "\n";
    out += " " + std::string(num.size(), ' ') + " | ";
    const size_t pad = d.column - d.sourceColumn;
    for (size_t i = 0; i < pad && i < d.source.size(); i++) out += d.source[i] == '\t' ? '\t' : ' ';
    out += "^" + std::string(d.width - 1, '~') + "\n";
    if (!d.note.empty()) out += " " + std::string(num.size(), ' ') + " = " + d.note + "\n";
  }
  return out;
}

RulesetText ReadRulesetText(std::string_view text) {
  RulesetText out;
  bool sawRule = false, sawHeader = false;
  size_t defaultLine = 0;
  size_t lineNo = 0;
  size_t pos = 0;
  while (pos < text.size() && out.diagnostics.size() < kMaxDiagnostics) {
    size_t nl = text.find('\n', pos);
    if (nl == std::string_view::npos) nl = text.size();
    std::string_view line = text.substr(pos, nl - pos);
    pos = nl + 1;
    lineNo++;
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    Reporter rep(&out.diagnostics, line, lineNo);
    if (line.size() > kMaxLineLength) {
      rep.Error(kMaxLineLength + 1, 1,
                "line is longer than " + std::to_string(kMaxLineLength) + " bytes");
      continue;
    }
    const std::vector<Token> tokens = Tokenize(line);
    if (tokens.empty()) continue;
    if (defaultLine) {
      rep.At(tokens[0], "nothing may follow the default line (line " + std::to_string(defaultLine) +
                            "): it is the last rule");
      continue;
    }
    if (tokens[0].text == "ruleset") {
      if (sawRule || sawHeader) {
        rep.At(tokens[0], sawHeader ? "a second ruleset header line"
                                    : "the ruleset header line must come before the rules");
        continue;
      }
      sawHeader = true;
      bool raw = false;
      for (const Token& t : tokens) raw = raw || t.text == "raw";
      std::string_view seenKeys[4];
      for (size_t i = 1; i < tokens.size(); i++) {
        const Token& t = tokens[i];
        static constexpr std::array<const char*, 4> kHeaderKeys = {"version", "features", "frag", "raw"};
        if (std::find(kHeaderKeys.begin(), kHeaderKeys.end(), t.key) == kHeaderKeys.end()) {
          rep.At(t, "unknown header field " + Quote(t.key) + DidYouMean(t.key, kHeaderKeys),
                 "header fields: version features frag");
          continue;
        }
        const size_t k = static_cast<size_t>(std::find(kHeaderKeys.begin(), kHeaderKeys.end(), t.key) - kHeaderKeys.begin());
        if (!seenKeys[k].empty()) {
          rep.At(t, "field '" + std::string(t.key) + "' given twice");
          continue;
        }
        seenKeys[k] = t.key;
        if (t.key == "raw") continue;
        if (!t.hasValue || t.value.empty()) {
          rep.At(t, std::string(t.key) + " needs a value");
          continue;
        }
        try {
          if (t.key == "version") {
            if (t.value != "7" && t.value != "8") {
              rep.AtValue(t, "version " + Quote(t.value) + " is not 7 or 8");
            } else {
              out.version = static_cast<uint8_t>(t.value[0] - '0');
            }
          } else if (t.key == "features") {
            uint32_t bits = 0;
            std::string_view rest = t.value;
            bool ok = true;
            while (ok && !rest.empty()) {
              const size_t comma = rest.find(',');
              const std::string_view name = rest.substr(0, comma);
              rest = comma == std::string_view::npos ? std::string_view{} : rest.substr(comma + 1);
              bool found = name == "none";
              for (const FeatureName& fn : kFeatureNames) {
                if (name == fn.name) {
                  bits |= fn.bit;
                  found = true;
                }
              }
              if (!found && !name.empty() && std::isdigit(static_cast<unsigned char>(name[0]))) {
                // Numbers are read for the known bits; others need `raw`
                // because the module ignores them.
                const uint32_t n = static_cast<uint32_t>(ParseNumber("features", name, 0xffffffffu));
                const uint32_t known = FW_FEATURE_DROP_BPDU | FW_FEATURE_DROP_DHCP_SERVER;
                if ((n & ~known) && !raw) {
                  rep.AtValue(t, "features " + Quote(name) + " sets bits the module ignores (" +
                                     Hex(n & ~known) + ")",
                              "features: drop-bpdu (0x1) drop-dhcp-server (0x2); 'raw' in the header allows others");
                  ok = false;
                  break;
                }
                bits |= n;
                found = true;
              }
              if (!found) {
                std::array<const char*, 3> names = {"none", "drop-bpdu", "drop-dhcp-server"};
                rep.AtValue(t, "unknown feature " + Quote(name) + DidYouMean(name, names),
                            "features: drop-bpdu drop-dhcp-server, comma-separated, or none");
                ok = false;
              }
            }
            if (ok) out.features = bits;
          } else {  // frag
            bool found = false;
            for (size_t a = 0; a < kActionNames.size(); a++) {
              if (t.value == kActionNames[a]) {
                out.fragOverride = static_cast<uint32_t>(a);
                found = true;
              }
            }
            if (!found && raw && std::isdigit(static_cast<unsigned char>(t.value[0]))) {
              out.fragOverride = static_cast<uint32_t>(ParseNumber("frag", t.value, 0xffffffffu));
              found = true;
            }
            if (!found) {
              rep.AtValue(t, "unknown fragment action " + Quote(t.value) + DidYouMean(t.value, kActionNames),
                          "actions: " + NameList(kActionNames) + " (none: fragments are looked up like other packets)");
            }
          }
        } catch (const RuleError& e) {
          rep.AtValue(t, e.what());
        }
      }
      continue;
    }
    if (tokens[0].key == "default") {
      defaultLine = lineNo;
      static constexpr std::array<const char*, 3> kDefaults = {"accept", "drop", "punt"};
      uint32_t action = 0;
      for (size_t a = 0; a < kActionNames.size(); a++) {
        if (tokens[0].value == kActionNames[a]) action = static_cast<uint32_t>(a);
      }
      if (std::find(kDefaults.begin(), kDefaults.end(), tokens[0].value) == kDefaults.end()) {
        rep.AtValue(tokens[0], "unknown default action " + Quote(tokens[0].value) +
                                   DidYouMean(tokens[0].value, kDefaults),
                    "default=accept, default=drop or default=punt");
      } else if (tokens.size() > 1) {
        rep.At(tokens[1], "the default line takes nothing else");
      } else if (out.rules.size() >= kMaxRules) {
        rep.At(tokens[0], "more than " + std::to_string(kMaxRules) + " rules");
      } else {
        TextRule tr;
        tr.rule = DefaultRule(action);
        tr.line = lineNo;
        tr.isDefault = true;
        out.rules.push_back(tr);
      }
      continue;
    }
    sawRule = true;
    if (out.rules.size() >= kMaxRules) {
      rep.At(tokens[0], "more than " + std::to_string(kMaxRules) + " rules");
      break;
    }
    std::optional<TextRule> tr = ReadRuleLine(tokens, out.version, rep);
    if (tr && out.version == FW_RULESET_VERSION_7) {
      // Reached only by raw rules: the checked ones refuse these fields.
      const uint8_t* bytes = reinterpret_cast<const uint8_t*>(&tr->rule);
      for (uint32_t b = FW_RULE_SIZE_V7; b < FW_RULE_SIZE_V8; b++) {
        if (bytes[b] != 0) {
          rep.At(tokens[0], "the rule sets version-8 bytes (rptag, marks, masks or negation) in a "
                            "version-7 ruleset");
          tr.reset();
          break;
        }
      }
    }
    if (tr) {
      tr->line = lineNo;
      out.rules.push_back(*tr);
    }
  }
  if (out.diagnostics.size() >= kMaxDiagnostics) {
    Diagnostic d;
    d.line = 0;
    d.message = "too many errors; stopped at line " + std::to_string(lineNo);
    out.diagnostics.push_back(d);
  }
  if (!out.diagnostics.empty()) out.rules.clear();
  return out;
}

std::vector<uint8_t> RulesetBytes(const RulesetText& text) {
  RulesetBuilder b(text.version);
  b.Features(text.features).FragOverride(text.fragOverride);
  for (const TextRule& r : text.rules) b.Add(r.rule);
  return b.Bytes();
}

FWRule ParseRule(std::string_view line) {
  std::vector<Diagnostic> diags;
  if (line.find('\n') != std::string_view::npos) line = line.substr(0, line.find('\n'));
  Reporter rep(&diags, line, 1);
  const std::vector<Token> tokens = Tokenize(line);
  if (tokens.empty()) return RuleBuilder().Build();
  std::optional<TextRule> r = ReadRuleLine(tokens, FW_RULESET_VERSION_8, rep);
  if (!r) throw RuleError(RenderDiagnostics("", diags));
  return r->rule;
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

// The rule a line reads as in a ruleset of `version`, or nothing.
std::optional<FWRule> ReadBack(const std::string& line, uint8_t version) {
  std::vector<Diagnostic> diags;
  Reporter rep(&diags, line, 1);
  std::optional<TextRule> r = ReadRuleLine(Tokenize(line), version, rep);
  if (!r) return std::nullopt;
  return r->rule;
}

}  // namespace

std::string FormatRule(const FWRule& rule, uint8_t version) {
  // The checked language first; a record it cannot say (or says
  // differently) is written raw with what the fields do not express (unknown
  // flag bits, negation or mask bits on wildcarded fields) added as raw
  // flags, so the text always reads back to the same record.
  const std::string plain = FormatRuleFields(rule, version, false);
  if (PoolIsText(rule)) {
    std::optional<FWRule> back = ReadBack(plain, version);
    if (back && SameRecord(*back, rule, version)) return plain;
  }
  std::string out = FormatRuleFields(rule, version, true);
  std::optional<FWRule> back = ReadBack(out, version);
  const uint32_t ignore = version < FW_RULESET_VERSION_8 ? FW_WC_RPTAG : 0;
  if (back && (back->ruleFlags & ~ignore) != (rule.ruleFlags & ~ignore)) {
    out += " rawflags=" + Hex(rule.ruleFlags);
  }
  if (back && back->negateFlags != rule.negateFlags) out += " rawneg=" + Hex(rule.negateFlags);
  // Bytes no field shows (values under a wildcard, the unused tail of an
  // IPv4 address, a bound without its range bit) come from senders that
  // did not start from text; the whole record then follows in hex.
  back = ReadBack(out, version);
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
