// What two rulesets do differently to the same packets, decided by the
// module itself: the module is loaded into the userspace host, each ruleset
// goes onto its own filter, and every packet is traced (read-only) through
// both filters.
//
// Needs the module and host libraries at link time (sluice-rules and the
// tests link them; other users of the tool library never pull this in).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace rules {

// How one filter decided one packet.
struct PacketVerdict {
  uint32_t decision = 0;  // FWTraceDecision
  uint32_t action = 0;    // the action carried out
  size_t line = 0;        // the deciding rule's line in the text, 0 if none
  std::string params;     // the deciding rule's action parameters ("gre=..."), if any
  std::string Describe() const;
};

struct VerdictChange {
  size_t packet = 0;  // 1-based index in the capture
  uint32_t direction = 0;
  PacketVerdict before, after;
};

// Traces every record through a filter holding `oldText` and one holding
// `newText`; lists the packets whose action, or the parameters of the
// action (GRE destination, rewrite address, pool, marks), differ. Records without a
// direction count as coming from the switch. False with a reason when the
// module refuses to start or a ruleset is refused.
bool DiffVerdicts(const RulesetText& oldText, const RulesetText& newText,
                  const std::vector<frames::CaptureRecord>& records,
                  std::vector<VerdictChange>* changes, std::string* error);

}  // namespace rules
