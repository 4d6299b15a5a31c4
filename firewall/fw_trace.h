// How the packet path decides one packet, told without deciding it.
//
// FWTracePacket runs the walk's own steps on one packet against the rules in
// force: the parse, the feature checks, the fragment override, the exact
// probe (FWFindExactRule) and the general scan (FWFindRuleForPacket), and
// reports which of them decided and with what. It is read-only: it holds
// configLock shared for the call, changes no counter, opens no socket,
// touches neither the packet nor any list, and allocates nothing. Tools call
// it on a packet just before handing the packet to FWProcessPackets, so the
// two see the same rules as long as nothing applies a ruleset in between.
//
// Thread-safe with the packet path and with every control channel.
#pragma once

#include "firewall/firewall.h"

enum FWTraceDecision : uint32_t {
  FWTraceNoRuleset = 0,      // no ruleset in force: the filter's default action
  FWTraceFeature = 1,        // a feature check dropped it (feature says which)
  FWTraceFragOverride = 2,   // a fragment, decided by the ruleset's override
  FWTraceExactRule = 3,      // the exact table held its tuple
  FWTraceGeneralRule = 4,    // the general scan matched a rule
  FWTraceNoRule = 5,         // no rule matched: passes uncounted
};

struct FWTrace {
  uint32_t decision;         // FWTraceDecision
  // The action carried out: the rule's, the override's as the walk maps it,
  // Drop for a feature, the default action without a ruleset, Accept for no
  // rule.
  uint32_t action;
  uint32_t feature;          // FW_FEATURE_* bit that dropped it, else 0
  uint32_t fragOverride;     // the ruleset's override as written, 0 = none
  uint32_t presence;         // FWPktSummary::presence of the walk's parse
  uint8_t exactProbed;       // 1: the packet had ports, so the exact table was probed
  uint8_t exactHit;          // 1: the probe found the deciding rule
  uint8_t generalScanned;    // 1: the general rules were scanned
  uint8_t reserved;
  // For a rule decision: the rule's position among the rules the filter
  // serialises (exact rules in table order, then general rules in ruleset
  // order), which is the position the status tree and the ruleset readers
  // use; and, for a general rule, its place among the general rules.
  uint32_t position;
  uint32_t generalIndex;
  uint32_t numRules;         // installed rules, exact and general
  uint32_t spAttachState;    // the filter's slow-path state as the walk reads it
  uint32_t failurePolicy;
  uint16_t poolTag;          // the tag a pool-tag rule sets
  FWRule rule;               // the deciding rule as installed, counters before this packet
};

// Fills `out` with how FWProcessPackets would decide `pkt` arriving in
// `direction` (1 from the switch, 2 toward it). ZEL_BAD_PARAM for a null
// argument or a filter without a firewall context; `out` is then untouched.
[[nodiscard]] ZelStatus FWTracePacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                                      FWTrace* out);
