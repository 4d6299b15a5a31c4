// A loaded filter's rules and counters, read back through the module's own
// channels in the process that hosts it (sluice-run, sluice-host): the
// status tree's rule summaries give each rule's position, text and
// counters; the agent's character device (get request) gives each rule's
// record, which says whether it sits in the exact table and where it
// stands in the ruleset that was given. Nothing here reaches into module
// memory.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <vector>

#include "control/control.h"
#include "tools/lib/render.h"

namespace filterview {

// The filters of `agent` as the status tree names them ("NAME-POSITION"),
// in the agent's order; empty when the agent is unknown.
std::vector<std::string> FilterInstances(const std::string& agent);
// The filter name inside an instance name (the part before "-POSITION").
std::string FilterNameOf(const std::string& instance);

// The status tree's summaries of one filter's rules, position by position.
std::vector<SLCGeneric_RuleSummary> RuleSummaries(const std::string& agent,
                                                  const std::string& instance);

// Every rule of the filter with its counters, in the order of `given` (the
// wire ruleset that was installed; rules not found in it, such as mirrors,
// follow in module order). With `given` empty, module order. The listing's
// tallies (no match, default action) are left at zero and untallied: the
// module keeps no counters for them. At most `maxRules` rules are read (the
// first ones in module order); `*omitted`, when given, gets the number left.
render::CounterListing ReadCounters(const std::string& agent, const std::string& instance,
                                    std::span<const uint8_t> given,
                                    size_t maxRules = SIZE_MAX, size_t* omitted = nullptr);

}  // namespace filterview
