// Pieces of the rule text language shared by its reader, its formatter and
// the rule builder: the names, value parsers and printers, and the checks
// both directions need. Internal to tools/lib.
#pragma once

#include <array>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>

#include "firewall/fw_types.h"
#include "tools/lib/ruleset_builder.h"

namespace rules::syntax {

inline constexpr std::array<const char*, 12> kActionNames = {
    "none", "drop", "accept", "punt", "copy", "l2rewrite",
    "gre", "log", "pooltag", "dscp", "dot1p", "dscp+dot1p"};
inline constexpr std::array<const char*, 4> kDirectionNames = {"invalid", "from", "to", "both"};

struct ProtoName {
  const char* name;
  uint8_t value;
};
inline constexpr std::array<ProtoName, 4> kProtoNames = {
    {{"tcp", 6}, {"udp", 17}, {"icmp", 1}, {"icmpv6", 58}}};

struct FeatureName {
  const char* name;
  uint32_t bit;
};
inline constexpr std::array<FeatureName, 2> kFeatureNames = {
    {{"drop-bpdu", FW_FEATURE_DROP_BPDU}, {"drop-dhcp-server", FW_FEATURE_DROP_DHCP_SERVER}}};

inline constexpr std::array<const char*, 28> kRuleKeys = {
    "action", "dir",  "ipv4",    "ipv6",  "dmac",   "smac",     "ethtype", "vlan",  "sa",
    "da",     "proto", "sport",  "dport", "rptag",  "bidir",    "rewrite", "gre",   "snaplen",
    "pool",   "dot1p", "dscp",   "pkts",  "bytes",  "rawflags", "rawneg",  "exact", "raw", "wire"};

// Throws RuleError with `msg`.
[[noreturn]] void Fail(std::string msg);

// A value for an error message: quoted, non-printing bytes as '?', cut at
// 64 characters.
std::string Quote(std::string_view v);
// A decimal or 0x number up to `max`; RuleError names `key` otherwise.
uint64_t ParseNumber(std::string_view key, std::string_view text, uint64_t max);
void ParseMac(std::string_view key, std::string_view text, uint8_t out[6]);
std::string FormatMac(const uint8_t mac[6]);
// An address; returns true for IPv4 (4 bytes written), false for IPv6 (16).
bool ParseAddr(std::string_view key, std::string_view text, uint8_t out[16]);
std::string FormatAddr(const uint8_t* addr, bool v4);
// Big-endian address arithmetic on n bytes; false on wrap-around.
bool AddrIncrement(uint8_t* a, int n);
bool AddrDecrement(uint8_t* a, int n);
// An address of n bytes as a number.
unsigned __int128 AddrValue(const uint8_t* a, int n);
// Splits a leading '!' off `value`.
bool TakeNegation(std::string_view* value);

template <typename T>
std::string Hex(T v) {
  char buf[24];
  std::snprintf(buf, sizeof(buf), "0x%llx", static_cast<unsigned long long>(v));
  return buf;
}

// Edits between two words, a swap of neighbours counting as one.
size_t EditDistance(std::string_view a, std::string_view b);

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
  for (const auto& n : names) {
    if (!out.empty()) out += ' ';
    out += n;
  }
  return out;
}

// Whether `action` reads the parameter field `param` (gre, snaplen,
// rewrite, pool, dscp, dot1p).
bool ActionUses(uint32_t action, std::string_view param);
// Two records are the same on the wire of `version` (bit 9 aside for 7).
bool SameRecord(const FWRule& a, const FWRule& b, uint8_t version);
// The catch-all rule of a `default=` line.
FWRule DefaultRule(uint32_t action);
// The rule one line reads as in a ruleset of `version`, checks included,
// or nothing when the line has an error.
std::optional<FWRule> ReadRuleText(std::string_view line, uint8_t version);

}  // namespace rules::syntax
