// The rule language's shared pieces: names, value parsers and printers.

#include "tools/lib/rule_syntax.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstring>

namespace rules {
namespace syntax {

void Fail(std::string msg) { throw RuleError(std::move(msg)); }

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

}  // namespace syntax

using namespace syntax;

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
    if (features & f.bit) {
      if (!out.empty()) out += ',';
      out += f.name;
    }
    features &= ~f.bit;
  }
  if (features) {
    if (!out.empty()) out += ',';
    out += Hex(features);
  }
  return out.empty() ? "none" : out;
}

}  // namespace rules
