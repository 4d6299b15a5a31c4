// Ruleset builder: firewall rules and rulesets from readable text, and back.
//
// Userspace only (tools, tests, benchmarks). Rules are held as FWRule in
// the 281-byte version-8 form; a RulesetBuilder writes version-7 or
// version-8 wire rulesets, DecodeRuleset/FormatRuleset read them back.
//
// Text syntax
// -----------
// One rule per line, whitespace-separated tokens; '#' starts a comment,
// blank lines are skipped. A field that is not mentioned, or is given as
// '*', is a wildcard. A value may start with '!' to negate the field.
//
//   action=NAME|N   none drop accept punt copy l2rewrite gre log pooltag dscp
//                   dot1p dscp+dot1p (default: accept)
//   dir=D           from (1), to (2), both (3), invalid (0) or a number
//                   (default: both)
//   ipv4 | ipv6     address family (default: taken from sa/da, else ipv4)
//   dmac=[!]MAC[/MASK]   destination MAC aa:bb:cc:dd:ee:ff; /MASK compares
//   smac=[!]MAC[/MASK]   under the mask (ruleFlags bit 21 / 22)
//   ethtype=[!]N    ethertype, 0x0800 or 2048
//   vlan=[!]V       none (00 00 00 00), VID or VID/PRIO (81 00 + TCI),
//                   raw:XXXXXXXX (4 bytes in hex)
//   sa=[!]A[-B]     source address or inclusive range (IPv4 10.0.0.1,
//   da=[!]A[-B]     IPv6 2001:db8::1; IPv6 range ends are exclusive in lookup)
//   proto=[!]P      IP protocol: number, tcp, udp, icmp, icmpv6
//   sport=[!]N[-M]  source port or inclusive range
//   dport=[!]N[-M]  destination port or inclusive range
//   rptag=N         resource-pool tag to match (version 8); omitted = any
//   bidir[=N]       bidirectional flag; bare 'bidir' means 1 (install mirror)
//   rewrite=MAC     L2 rewrite address
//   gre=A.B.C.D     GRE destination
//   snaplen=N       GRE snap length
//   pool=NAME       resource-pool name (no whitespace, at most 127 chars)
//   dot1p=N dscp=N  marking values (version 8)
//   pkts=N bytes=N  counters carried in the record
//   rawflags=N      ruleFlags exactly (overrides what the fields produced)
//   rawneg=N        negateFlags exactly
//
// Example:
//   action=drop dir=to ipv4 proto=6 sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80
//
// A rule is exact (hash table) when it wildcards none of dmac, smac,
// ethtype, vlan, sa, da, proto, sport, dport and has no range or mask;
// otherwise it is general (ordered list).
//
// A ruleset text may hold one header line before its rules:
//   ruleset version=7|8 features=N frag=ACTION
// (defaults: version 8, features 0, frag none).
//
// Version 7 records have no rptag, dot1p, dscp, masks or negation: building
// a version-7 ruleset from a rule that sets any of those bytes fails. The
// rpTag wildcard bit (ruleFlags bit 9) is written clear in version-7 records,
// as the module writes them.
//
// Errors: parsing and building throw RuleError with a message naming the
// offending token; the Try* functions return false with the message instead.
#pragma once

#include <cstdint>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "firewall/fw_types.h"

namespace rules {

class RuleError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Builds one rule from readable field values; every setter takes the value
// part of the text syntax above ("10.0.0.1-10.0.0.9", "!80", "02:..:ff/ff:..").
class RuleBuilder {
 public:
  RuleBuilder();

  RuleBuilder& Action(std::string_view v) { return Set("action", v); }
  RuleBuilder& Action(uint32_t action);
  RuleBuilder& Dir(std::string_view v) { return Set("dir", v); }
  RuleBuilder& Dir(uint8_t direction);
  RuleBuilder& Ipv4() { return Set("ipv4", {}); }
  RuleBuilder& Ipv6() { return Set("ipv6", {}); }
  RuleBuilder& DMac(std::string_view v) { return Set("dmac", v); }
  RuleBuilder& SMac(std::string_view v) { return Set("smac", v); }
  RuleBuilder& EthType(std::string_view v) { return Set("ethtype", v); }
  RuleBuilder& EthType(uint16_t type);
  RuleBuilder& Vlan(std::string_view v) { return Set("vlan", v); }
  RuleBuilder& Src(std::string_view v) { return Set("sa", v); }
  RuleBuilder& Dst(std::string_view v) { return Set("da", v); }
  RuleBuilder& Proto(std::string_view v) { return Set("proto", v); }
  RuleBuilder& Proto(uint8_t proto);
  RuleBuilder& SPort(std::string_view v) { return Set("sport", v); }
  RuleBuilder& SPort(uint16_t port);
  RuleBuilder& DPort(std::string_view v) { return Set("dport", v); }
  RuleBuilder& DPort(uint16_t port);
  RuleBuilder& RpTag(uint16_t tag);
  RuleBuilder& Bidirectional(uint8_t value = 1);
  RuleBuilder& RewriteMac(std::string_view v) { return Set("rewrite", v); }
  RuleBuilder& GreIp(std::string_view v) { return Set("gre", v); }
  RuleBuilder& SnapLen(uint32_t len);
  RuleBuilder& Pool(std::string_view name) { return Set("pool", name); }
  RuleBuilder& Dot1p(uint16_t value);
  RuleBuilder& Dscp(uint16_t value);
  RuleBuilder& Counters(uint64_t pkts, uint64_t bytes);
  RuleBuilder& RawFlags(uint32_t flags);
  RuleBuilder& RawNegate(uint32_t negate);

  // One field of the text syntax; `key` without '=' takes an empty value.
  RuleBuilder& Set(std::string_view key, std::string_view value);

  // The finished rule (version-8 form). May be called more than once.
  FWRule Build() const;

 private:
  enum Family : uint8_t { kUnset, kV4, kV6 };
  void SetFamily(Family f, std::string_view why);

  FWRule rule_;
  Family family_ = kUnset;
  bool familyExplicit_ = false;
  bool rawFlags_ = false;
  bool rawNeg_ = false;
  uint32_t rawFlagsValue_ = 0;
  uint32_t rawNegValue_ = 0;
};

// One line of the text syntax (comments allowed) to a rule.
FWRule ParseRule(std::string_view line);
bool TryParseRule(std::string_view line, FWRule* rule, std::string* error);

// A rule in the text syntax, canonical order, wildcards omitted. For
// version 7 the version-8 fields are not shown and bit 9 is ignored.
std::string FormatRule(const FWRule& rule, uint8_t version = FW_RULESET_VERSION_8);

// True when the rule goes to the exact-rule table.
inline bool IsExactRule(const FWRule& rule) {
  return (rule.ruleFlags & FW_GENERAL_RULE_MASK) == 0;
}

// Action and direction names as the text syntax uses them.
std::string ActionName(uint32_t action);
std::string DirectionName(uint8_t direction);

class RulesetBuilder {
 public:
  explicit RulesetBuilder(uint8_t version = FW_RULESET_VERSION_8);

  RulesetBuilder& Version(uint8_t version);
  RulesetBuilder& Features(uint32_t features);
  RulesetBuilder& FragOverride(uint32_t action);
  RulesetBuilder& Add(const FWRule& rule);
  RulesetBuilder& Add(std::string_view line);    // one rule line
  // Several lines of rules (and an optional header line).
  RulesetBuilder& AddText(std::string_view text);

  const std::vector<FWRule>& Rules() const { return rules_; }
  // The wire ruleset: header plus records of the builder's version. Version 7
  // refuses rules whose version-8 bytes are not zero.
  std::vector<uint8_t> Bytes() const;

 private:
  uint8_t version_;
  uint32_t features_ = 0;
  uint32_t fragOverride_ = 0;
  std::vector<FWRule> rules_;
};

// A wire ruleset read back. Records are zero-extended to 281 bytes and left
// as they were on the wire (bit 9 is not touched).
struct DecodedRuleset {
  uint8_t version = 0;
  uint8_t highestSupportedVersion = 0;
  uint8_t lowestSupportedVersion = 0;
  uint32_t fwFeatures = 0;
  uint32_t fragOverride = 0;
  std::vector<FWRule> rules;
};

// Throws RuleError unless version is 7 or 8 and the length is exactly
// 15 + numRules * size(version).
DecodedRuleset DecodeRuleset(std::span<const uint8_t> bytes);
// The whole ruleset as text: a header line, then one rule line each.
std::string FormatRuleset(std::span<const uint8_t> bytes);
// Ruleset text (header line optional) to wire bytes.
std::vector<uint8_t> ParseRuleset(std::string_view text);
bool TryParseRuleset(std::string_view text, std::vector<uint8_t>* bytes, std::string* error);

}  // namespace rules
