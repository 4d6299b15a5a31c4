// Ruleset builder: firewall rules and rulesets from readable text, and back.
//
// Userspace only (tools, tests, benchmarks). Rules are held as FWRule in
// the 281-byte version-8 form; a RulesetBuilder writes version-7 or
// version-8 wire rulesets, DecodeRuleset/FormatRuleset read them back.
//
// The rule text language is documented in the README ("Rule syntax") and
// by `sluice-rules --help`; kRuleSyntaxHelp below is that reference.
//
// Two layers:
//  - RuleBuilder sets fields one at a time and checks only that each value
//    fits its wire field. Tests use it to build records the text language
//    refuses on purpose.
//  - ReadRulesetText reads a whole ruleset text, checks every rule against
//    what the module will do with it (ranges, action parameters, version,
//    exact or general) and reports every error with line and column.
//    ParseRuleset, TryParseRuleset, ParseRule and TryParseRule go through it.
//
// rule_text.cpp reads texts, ruleset_builder.cpp builds, formats and
// decodes, rule_syntax.{h,cpp} holds what both share.
//
// FormatRule/FormatRuleset print the checked language whenever the record
// can be said in it, and otherwise the rule marked `raw`, where the value
// checks are off; either way the text compiles back to the same bytes.
#pragma once

#include <cstddef>
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

// Reference of the rule text syntax (README table in plain text).
extern const char kRuleSyntaxHelp[];

// Builds one rule from readable field values; every setter takes the value
// part of the text syntax ("10.0.0.1-10.0.0.9", "!80", "02:..:ff/ff:..").
class RuleBuilder {
 public:
  RuleBuilder();

  RuleBuilder& Action(std::string_view v) { return Set("action", v); }
  RuleBuilder& Action(uint32_t action);
  RuleBuilder& Dir(std::string_view v) { return Set("dir", v); }
  RuleBuilder& Dir(uint8_t direction);
  // The address family; also matches the family's ethertype unless the rule
  // sets ethtype itself (ethtype=any keeps it a wildcard).
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
  // Throws RuleError when the value does not fit the field.
  RuleBuilder& Set(std::string_view key, std::string_view value);

  // The finished rule (version-8 form). May be called more than once.
  FWRule Build() const;

 private:
  enum Family : uint8_t { kUnset, kV4, kV6 };
  void SetFamily(Family f, std::string_view why);

  FWRule rule_;
  Family family_ = kUnset;
  bool familyExplicit_ = false;
  bool ethTypeGiven_ = false;
  bool rawFlags_ = false;
  bool rawNeg_ = false;
  uint32_t rawFlagsValue_ = 0;
  uint32_t rawNegValue_ = 0;
  std::vector<uint8_t> wire_;  // a whole record given as wire=HEX
};

// One error found in a ruleset text. Lines and columns count from 1;
// columns are bytes. `width` is how many bytes the caret underlines.
struct Diagnostic {
  size_t line = 0;
  size_t column = 0;
  size_t width = 1;
  std::string message;
  std::string note;    // valid names and the like; may be empty
  std::string source;      // the line, or a window of a long line
  size_t sourceColumn = 1;  // column of the line where `source` starts
};

// "FILE:LINE:COL: error: MESSAGE", the line, a caret line and the note, for
// each diagnostic. `file` may be empty.
std::string RenderDiagnostics(std::string_view file, const std::vector<Diagnostic>& diags);

// One rule read from text.
struct TextRule {
  FWRule rule;
  size_t line = 0;          // 1-based line in the text
  bool exactAsked = false;  // the rule said `exact`
  bool isDefault = false;   // from the `default=` line
};

struct RulesetText {
  uint8_t version = FW_RULESET_VERSION_8;
  uint32_t features = 0;
  uint32_t fragOverride = 0;
  std::vector<TextRule> rules;
  std::vector<Diagnostic> diagnostics;  // empty when the text is good
  bool Ok() const { return diagnostics.empty(); }
};

// Limits on ruleset texts: longer lines, more rules or more errors end the
// reading with an error instead of growing without bound.
inline constexpr size_t kMaxLineLength = 4096;
inline constexpr size_t kMaxRules = 1u << 18;
inline constexpr size_t kMaxDiagnostics = 50;

// Reads a ruleset text: an optional header line
//   ruleset version=7|8 features=NAMES frag=ACTION
// rule lines, and an optional last line default=accept|drop|punt.
RulesetText ReadRulesetText(std::string_view text);
// The wire ruleset of a text read without errors.
std::vector<uint8_t> RulesetBytes(const RulesetText& text);

// One line of the text syntax (comments allowed) to a rule, with the checks
// of a version-8 ruleset.
FWRule ParseRule(std::string_view line);
bool TryParseRule(std::string_view line, FWRule* rule, std::string* error);

// A rule in the text syntax, canonical order, wildcards omitted. For
// version 7 the version-8 fields are not shown and bit 9 is ignored.
std::string FormatRule(const FWRule& rule, uint8_t version = FW_RULESET_VERSION_8);

// True when the rule goes to the exact-rule table.
inline bool IsExactRule(const FWRule& rule) {
  return (rule.ruleFlags & FW_GENERAL_RULE_MASK) == 0;
}
// Why a rule is general: one phrase per field that is wildcarded, a range
// or masked ("sport wildcard", "sa range"). Empty for an exact rule.
std::vector<std::string> GeneralReasons(const FWRule& rule);

// Action and direction names as the text syntax uses them.
std::string ActionName(uint32_t action);
std::string DirectionName(uint8_t direction);
// "drop-bpdu,drop-dhcp-server", "none", unknown bits in hex.
std::string FeatureNames(uint32_t features);

class RulesetBuilder {
 public:
  explicit RulesetBuilder(uint8_t version = FW_RULESET_VERSION_8);

  RulesetBuilder& Version(uint8_t version);
  RulesetBuilder& Features(uint32_t features);
  RulesetBuilder& FragOverride(uint32_t action);
  RulesetBuilder& Add(const FWRule& rule);
  RulesetBuilder& Add(std::string_view line);    // one rule line
  // A whole ruleset text (header and default line allowed); throws
  // RuleError with the rendered diagnostics when it has errors.
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
// The whole ruleset as text: a header line, then one rule line each, the
// last rule as a default= line when it is a plain catch-all.
std::string FormatRuleset(std::span<const uint8_t> bytes);
// Ruleset text to wire bytes; the error (and RuleError's message) is the
// rendered diagnostics of every error in the text.
std::vector<uint8_t> ParseRuleset(std::string_view text);
bool TryParseRuleset(std::string_view text, std::vector<uint8_t>* bytes, std::string* error);

}  // namespace rules
