// What a ruleset means as a whole: which rules can match at all, which ones
// another rule hides, and what changed between two rulesets.
//
// The answers follow the module's lookup: exact rules are probed first (by
// their tuple alone, negation ignored) and win over every general rule;
// general rules are tested in ruleset order and the first match wins.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "firewall/fw_types.h"
#include "tools/lib/ruleset_builder.h"

namespace rules {

// True when every packet (and direction) that `inner` matches is matched by
// `outer` as well. Conservative: false whenever that is not certain.
bool Covers(const FWRule& outer, const FWRule& inner);

// The exact-table tuples of two rules are equal (the module merges them).
bool SameTuple(const FWRule& a, const FWRule& b);

// The second half that the module installs for a bidirectional exact rule.
FWRule MirrorOf(const FWRule& rule);

struct Finding {
  size_t line = 0;       // the rule the finding is about
  size_t otherLine = 0;  // the rule that explains it, or 0
  std::string message;
};

// Rules that can never match, rules that merge into another, general rules
// that take every packet of a later rule, rules that never match by
// direction, and flags without effect. Ordered by line. Past 5000 rules
// the pairwise search is skipped, which a first finding with line 0 says.
std::vector<Finding> Lint(const RulesetText& text);

struct RuleChange {
  enum Kind { kAdded, kRemoved, kChanged } kind;
  size_t oldLine = 0, newLine = 0;  // 0 when absent on that side
  std::string oldText, newText;
};

// Rules are paired by what they match (fields, direction, family); a pair
// whose action, action parameters or bidirectional flag differ is changed.
// Header differences come first as changes with line 0.
std::vector<RuleChange> DiffRules(const RulesetText& oldText, const RulesetText& newText);

}  // namespace rules
