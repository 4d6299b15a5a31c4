// sluice-ctl's text output for the status tree and the host's counters.
// Kept apart from the command so it can be swapped for a shared renderer.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

namespace ctl {

// {"agents": [{name, filters: [{name, ruleSetSummary, rules: [...]}]}]}
std::string RenderStatus(const nlohmann::json& tree);
// The host's stats reply: heap, packets, timers, ports with traffic.
std::string RenderStats(const nlohmann::json& stats);

}  // namespace ctl
