#include "service/ctl/render.h"

#include <fmt/format.h>

#include "tools/lib/render.h"

namespace ctl {
namespace {

std::string Str(const nlohmann::json& j) { return j.is_string() ? j.get<std::string>() : j.dump(); }

}  // namespace

std::string RenderStatus(const nlohmann::json& tree) {
  std::string out;
  for (const auto& agent : tree.value("agents", nlohmann::json::array())) {
    out += fmt::format("agent {}\n", Str(agent.value("name", nlohmann::json(""))));
    for (const auto& f : agent.value("filters", nlohmann::json::array())) {
      out += fmt::format("  filter {}\n", Str(f.value("name", nlohmann::json(""))));
      if (f.contains("ruleSetSummary")) {
        for (const auto& [k, v] : f["ruleSetSummary"].items()) {
          out += fmt::format("    {}: {}\n", k, Str(v));
        }
      }
      if (f.contains("counters")) {
        std::string listing = render::CountersText(render::CountersFromJson(f["counters"]));
        for (size_t at = 0; at < listing.size();) {
          const size_t end = listing.find('\n', at);
          out += "    " + listing.substr(at, end == std::string::npos ? end : end + 1 - at);
          if (end == std::string::npos) break;
          at = end + 1;
        }
      }
      if (f.contains("rulesOmitted")) {
        out += fmt::format("    ... {} more rules (--max-rules)\n", Str(f["rulesOmitted"]));
      }
    }
  }
  return out;
}

std::string RenderStats(const nlohmann::json& s) {
  std::string out = fmt::format(
      "module heap: {} bytes in {} blocks\npackets alive: {}\ntimers pending: {}\n"
      "GRE copies sent: {} (errors {})\n",
      Str(s.value("heapBytes", nlohmann::json(0))), Str(s.value("heapBlocks", nlohmann::json(0))),
      Str(s.value("livePackets", nlohmann::json(0))),
      Str(s.value("pendingTimers", nlohmann::json(0))), Str(s.value("greSent", nlohmann::json(0))),
      Str(s.value("greErrors", nlohmann::json(0))));
  for (const auto& p : s.value("ports", nlohmann::json::array())) {
    auto field = [&](const char* k) { return Str(p.value(k, nlohmann::json(""))); };
    out += fmt::format("port {} (agent {}, vm {}, switch {})\n", field("name"), field("agent"),
                       field("vm"), field("switch"));
    const nlohmann::json traffic = p.value("traffic", nlohmann::json::object());
    for (const auto& [k, v] : traffic.items()) {
      out += fmt::format("  {}: {}\n", k, Str(v));
    }
  }
  for (const auto& sp : s.value("slowPaths", nlohmann::json::array())) {
    auto field = [&](const char* k) { return Str(sp.value(k, nlohmann::json(""))); };
    std::string filters;
    for (const auto& f : sp.value("filters", nlohmann::json::array())) {
      filters += (filters.empty() ? "" : ", ") + Str(f);
    }
    out += fmt::format(
        "slow path #{} {} (agent {}): filters [{}], punted {} (dropped {}), sent back {}, "
        "ioctls {}\n",
        field("id"), field("name"), field("agent"), filters, field("punted"),
        field("puntDropped"), field("reissued"), field("ioctls"));
  }
  return out;
}

}  // namespace ctl
