// Verdicts of two rulesets on the same packets, by the module's own trace.

#include "tools/lib/verdict_diff.h"

#include <cstring>

#include "firewall/fw_trace.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/module.h"
#include "tools/lib/rule_analysis.h"

namespace rules {

namespace {

constexpr const char kAgentText[] = "sluice-rules-diff:default-action=ACTION_ACCEPT";
constexpr const char kAgent[] = "sluice-rules-diff";

// The text line of the rule the filter decided with. Exact rules are found
// by tuple (a merged duplicate or mirrored half belongs to the first rule
// that installed the tuple); general rules by their place in the list.
size_t LineOf(const RulesetText& text, const FWTrace& t) {
  if (t.decision == FWTraceExactRule) {
    for (const TextRule& r : text.rules) {
      if (!IsExactRule(r.rule)) continue;
      if (SameTuple(r.rule, t.rule)) return r.line;
      if (r.rule.bidirectional == 1 && SameTuple(MirrorOf(r.rule), t.rule)) return r.line;
    }
    return 0;
  }
  if (t.decision == FWTraceGeneralRule) {
    uint32_t n = 0;
    for (const TextRule& r : text.rules) {
      if (IsExactRule(r.rule)) continue;
      if (n++ == t.generalIndex) return r.line;
    }
  }
  return 0;
}

// The action parameters of a deciding rule, as the rule text writes them.
std::string ParamsOf(const FWTrace& t) {
  if (t.decision != FWTraceExactRule && t.decision != FWTraceGeneralRule) return {};
  FWRule only;
  std::memset(&only, 0, sizeof(only));
  only.action = t.rule.action;
  only.direction = SLCGenericDirectionBidirectional;
  only.ruleFlags = FW_WC_ALL | FW_FLAG_IPV4;
  std::memcpy(only.rewriteMac, t.rule.rewriteMac, sizeof(only.rewriteMac));
  std::memcpy(only.greIP, t.rule.greIP, sizeof(only.greIP));
  only.snapLen = t.rule.snapLen;
  std::memcpy(only.resourcePool, t.rule.resourcePool, sizeof(only.resourcePool));
  only.dscpTag = t.rule.dscpTag;
  only.ethDot1PTag = t.rule.ethDot1PTag;
  std::string text = FormatRule(only);
  const size_t space = text.find(' ', text.find("action="));
  return space == std::string::npos ? std::string() : text.substr(space + 1);
}

}  // namespace

std::string PacketVerdict::Describe() const {
  std::string what = ActionName(action) + (params.empty() ? "" : " " + params);
  switch (decision) {
    case FWTraceExactRule:
      return what + " (exact rule, line " + std::to_string(line) + ")";
    case FWTraceGeneralRule:
      return what + " (general rule, line " + std::to_string(line) + ")";
    case FWTraceNoRule:
      return what + " (no rule matched)";
    case FWTraceFeature:
      return what + " (feature)";
    case FWTraceFragOverride:
      return what + " (fragment override)";
    default:
      return what + " (no ruleset)";
  }
}

bool DiffVerdicts(const RulesetText& oldText, const RulesetText& newText,
                  const std::vector<frames::CaptureRecord>& records,
                  std::vector<VerdictChange>* changes, std::string* error) {
  changes->clear();
  std::vector<uint8_t> bytes[2];
  try {
    bytes[0] = RulesetBytes(oldText);
    bytes[1] = RulesetBytes(newText);
  } catch (const RuleError& e) {
    *error = e.what();
    return false;
  }
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  if (host::Loader::Load(&slcGenericModuleImage) != 0) {
    *error = "the module did not start";
    host::Reset();
    return false;
  }
  bool ok = true;
  host::FilterId filters[2] = {0, 0};
  if (host::ClientPorts::Write(kSLCGenericCreateAgentPropName, kAgentText) != ZEL_OK) {
    *error = "the agent was not created";
    ok = false;
  }
  for (int i = 0; ok && i < 2; i++) {
    host::FilterConfig config;
    config.name = i == 0 ? "old.eth0" : "new.eth0";
    config.vmUUID = i == 0 ? "diff-old" : "diff-new";
    if (host::Sluice::CreateFilter(kAgent, config, &filters[i]) != ZEL_OK) {
      *error = "filter not created";
      ok = false;
    } else if (host::Sluice::PropertyWrite(std::string(kAgent) + ".ruleset", filters[i], bytes[i]) !=
               ZEL_OK) {
      *error = std::string("the module refused the ") + (i == 0 ? "old" : "new") + " ruleset";
      ok = false;
    }
  }
  for (size_t n = 0; ok && n < records.size(); n++) {
    const uint32_t dir = records[n].direction == 2 ? 2 : 1;
    PacketVerdict v[2];
    for (int i = 0; ok && i < 2; i++) {
      ZelPkt* pkt = host::Packets::Make(records[n].frame);
      FWTrace t{};
      auto* filter = static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(filters[i]));
      if (FWTracePacket(filter, pkt, dir, &t) != ZEL_OK) {
        *error = "the module could not trace packet " + std::to_string(n + 1);
        ok = false;
      }
      zel_PktRelease(pkt);
      v[i].decision = t.decision;
      v[i].action = t.action;
      v[i].line = LineOf(i == 0 ? oldText : newText, t);
      v[i].params = ParamsOf(t);
    }
    if (ok && (v[0].action != v[1].action || v[0].params != v[1].params)) {
      changes->push_back({n + 1, dir, v[0], v[1]});
    }
  }
  for (host::FilterId f : filters) {
    if (f != 0) (void)host::Sluice::DestroyFilter(f);
  }
  host::Loader::Unload();
  host::Reset();
  return ok;
}

}  // namespace rules
