#include "tools/lib/filter_view.h"

#include <algorithm>
#include <cstring>

#include "control/control.h"
#include "host/control/control_host.h"
#include "host/core/host_core.h"
#include "module/module.h"
#include "tools/lib/ruleset_builder.h"

namespace filterview {

namespace {

using frames::Bytes;

struct TreeView {
  std::vector<SLCGeneric_RuleSummary> rules;
  SLCGeneric_RuleSetSummary summary{};
  bool haveSummary = false;
};

TreeView ReadTree(const std::string& agent, const std::string& instance,
                  size_t maxRules = SIZE_MAX, size_t* omitted = nullptr) {
  TreeView v;
  const host::StatusTree::Path base = {"agents", agent, "filters", instance};
  std::vector<uint8_t> bytes;
  auto path = [&](std::initializer_list<host::QryValue> rest) {
    host::StatusTree::Path p = base;
    p.insert(p.end(), rest);
    return p;
  };
  if (host::StatusTree::Get(path({"ruleSetSummary"}), &bytes) == ZEL_OK &&
      bytes.size() >= sizeof(v.summary)) {
    std::memcpy(&v.summary, bytes.data(), sizeof(v.summary));
    v.haveSummary = true;
  }
  std::vector<host::QryValue> positions;
  if (host::StatusTree::List(path({"rules"}), &positions) != ZEL_OK) return v;
  if (omitted != nullptr) *omitted = positions.size() > maxRules ? positions.size() - maxRules : 0;
  if (positions.size() > maxRules) positions.resize(maxRules);
  for (const host::QryValue& pos : positions) {
    if (!std::holds_alternative<int64_t>(pos)) continue;
    SLCGeneric_RuleSummary r;
    std::memset(&r, 0, sizeof(r));
    if (host::StatusTree::Get(path({"rules", pos, "ruleSummary"}), &bytes) == ZEL_OK &&
        bytes.size() >= sizeof(r)) {
      std::memcpy(&r, bytes.data(), sizeof(r));
    }
    v.rules.push_back(r);
  }
  return v;
}

// The ruleset in force through the agent's character device (get request),
// records in the module's positions; empty when the device refuses.
std::vector<FWRule> ReadRulesByDevice(const std::string& agent, const std::string& filterName,
                                      uint32_t numRules) {
  const size_t need = FW_RULESET_HEADER_SIZE + static_cast<size_t>(numRules) * FW_RULE_SIZE_V8;
  Bytes request(std::max(need, sizeof(FWCharDevRequest)), 0);
  const uint32_t type = FWCharDevReqGetRuleset;
  std::memcpy(request.data(), &type, 4);
  std::memcpy(request.data() + offsetof(FWCharDevRequest, filterName), filterName.data(),
              std::min(filterName.size(), sizeof(FWCharDevRequest::filterName) - 1));
  const uint64_t addr = host::UserMemory::Map(request);
  int32_t result = 0;
  const ZelStatus s = host::CharDevs::Ioctl(agent, 0, addr, &result);
  Bytes reply = host::UserMemory::Read(addr, need);
  host::UserMemory::Unmap(addr);
  if (s != ZEL_OK || reply.size() < FW_RULESET_HEADER_SIZE) return {};
  uint64_t size = 0;
  uint32_t written = 0;
  std::memcpy(&written, reply.data() + offsetof(FWRulesetHeader, numRules), 4);
  if (FWGetRuleSize(reply[0], &size) != ZEL_OK || written > numRules) return {};
  reply.resize(FW_RULESET_HEADER_SIZE + written * size);
  std::vector<uint8_t> trimmed(reply.begin(), reply.end());
  try {
    return rules::DecodeRuleset(trimmed).rules;
  } catch (const rules::RuleError&) {
    return {};
  }
}

// Equal records apart from their counters.
bool SameRuleIgnoringCounters(const FWRule& a, const FWRule& b) {
  constexpr size_t kCounters = offsetof(FWRule, pktCount);
  constexpr size_t kAfter = offsetof(FWRule, byteCount) + sizeof(uint64_t);
  const auto* pa = reinterpret_cast<const uint8_t*>(&a);
  const auto* pb = reinterpret_cast<const uint8_t*>(&b);
  return std::memcmp(pa, pb, kCounters) == 0 &&
         std::memcmp(pa + kAfter, pb + kAfter, sizeof(FWRule) - kAfter) == 0;
}

uint64_t FieldNumber(const char* field, size_t size) {
  const std::string text(field, strnlen(field, size));
  return std::strtoull(text.c_str(), nullptr, 10);
}

}  // namespace

std::vector<std::string> FilterInstances(const std::string& agent) {
  std::vector<std::string> out;
  std::vector<host::QryValue> filters;
  if (host::StatusTree::List({"agents", agent, "filters"}, &filters) != ZEL_OK) return out;
  for (const host::QryValue& f : filters) {
    if (std::holds_alternative<std::string>(f)) out.push_back(std::get<std::string>(f));
  }
  return out;
}

std::string FilterNameOf(const std::string& instance) {
  const size_t dash = instance.rfind('-');
  return dash == std::string::npos ? instance : instance.substr(0, dash);
}

std::vector<SLCGeneric_RuleSummary> RuleSummaries(const std::string& agent,
                                                  const std::string& instance) {
  return ReadTree(agent, instance).rules;
}

render::CounterListing ReadCounters(const std::string& agent, const std::string& instance,
                                    std::span<const uint8_t> givenBytes, size_t maxRules,
                                    size_t* omitted) {
  render::CounterListing c;
  const TreeView tree = ReadTree(agent, instance, maxRules, omitted);
  if (tree.haveSummary) std::memcpy(&c.defaultAction, &tree.summary.defaultAction, 4);
  if (givenBytes.empty() && tree.rules.empty()) return c;
  c.haveRuleset = true;
  const std::vector<FWRule> installed =
      ReadRulesByDevice(agent, FilterNameOf(instance), static_cast<uint32_t>(tree.rules.size()));
  std::vector<FWRule> given;
  try {
    if (!givenBytes.empty()) given = rules::DecodeRuleset(givenBytes).rules;
  } catch (const rules::RuleError&) {
  }
  std::vector<bool> used(given.size(), false);
  for (size_t pos = 0; pos < tree.rules.size(); pos++) {
    const SLCGeneric_RuleSummary& s = tree.rules[pos];
    render::RuleCounters r;
    r.position = static_cast<uint32_t>(pos);
    std::memcpy(&r.action, &s.action, 4);
    r.text = render::RuleSummaryLine(s);
    r.packets = FieldNumber(s.pktCount, sizeof(s.pktCount));
    r.bytes = FieldNumber(s.byteCount, sizeof(s.byteCount));
    if (pos < installed.size()) {
      r.exact = rules::IsExactRule(installed[pos]);
      for (size_t i = 0; i < given.size(); i++) {
        if (!used[i] && SameRuleIgnoringCounters(given[i], installed[pos])) {
          used[i] = true;
          r.rulesetIndex = i + 1;
          break;
        }
      }
    }
    c.rules.push_back(r);
  }
  std::stable_sort(c.rules.begin(), c.rules.end(), [](const auto& a, const auto& b) {
    const size_t ia = a.rulesetIndex == 0 ? SIZE_MAX : a.rulesetIndex;
    const size_t ib = b.rulesetIndex == 0 ? SIZE_MAX : b.rulesetIndex;
    return ia < ib;
  });
  return c;
}


}  // namespace filterview
