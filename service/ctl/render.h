// sluice-ctl's text output for the status tree and the host's counters;
// each filter's rules and counters are listed by the shared renderer
// (tools/lib/render.h), as sluice-run lists them.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

namespace ctl {

// {"agents": [{name, filters: [{name, ruleSetSummary, counters, rulesOmitted}]}]}
std::string RenderStatus(const nlohmann::json& tree);
// The host's stats reply: heap, packets, timers, ports with traffic.
std::string RenderStats(const nlohmann::json& stats);

}  // namespace ctl
