#include "service/ctl/render.h"

#include <fmt/format.h>

namespace ctl {
namespace {

std::string Str(const nlohmann::json& j) { return j.is_string() ? j.get<std::string>() : j.dump(); }

// The fields of a rule summary worth a column when not a wildcard.
constexpr const char* kMatchFields[] = {"dMac", "sMac",    "ethType", "vlan1QTag", "ipSa",
                                        "ipDa", "ipProto", "sPort",   "dPort"};

// "SLCGenericActionDrop (drop packets)" -> "Drop".
std::string Short(const nlohmann::json& j, const std::string& prefix) {
  std::string s = Str(j);
  if (s.rfind(prefix, 0) == 0) s = s.substr(prefix.size());
  return s.substr(0, s.find(' '));
}

// Only printable text; the module leaves fields of unused actions unset.
bool Printable(const std::string& s) {
  if (s.empty()) return false;
  for (unsigned char ch : s) {
    if (ch < 0x20 || ch > 0x7e) return false;
  }
  return true;
}

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
      const auto rules = f.value("rules", nlohmann::json::array());
      if (!rules.empty()) {
        out += fmt::format("    {:>5} {:<12} {:<6} {:>12} {:>14}  match\n", "rule", "action", "dir",
                           "packets", "bytes");
      }
      for (const auto& r : rules) {
        std::string match;
        for (const char* field : kMatchFields) {
          if (!r.contains(field)) continue;
          const std::string v = Str(r[field]);
          if (v.empty() || v == "*" || v == "any") continue;
          match += fmt::format("{}={} ", field, v);
        }
        for (const char* extra : {"greIP", "rewriteMac", "dscpTag", "ethDot1PTag"}) {
          if (r.contains(extra) && Printable(Str(r[extra])) && Str(r[extra]) != "*") {
            match += fmt::format("{}={} ", extra, Str(r[extra]));
          }
        }
        out += fmt::format("    {:>5} {:<12} {:<6} {:>12} {:>14}  {}\n",
                           Str(r.value("rule", nlohmann::json(""))),
                           Short(r.value("action", nlohmann::json("")), "SLCGenericAction"),
                           Short(r.value("direction", nlohmann::json("")), "SLCGenericDirection"),
                           Str(r.value("pktCount", nlohmann::json(""))),
                           Str(r.value("byteCount", nlohmann::json(""))), match);
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
