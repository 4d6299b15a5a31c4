#include "tools/lib/render.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstring>

#include "control/control.h"
#include "tools/lib/rule_syntax.h"
#include "tools/lib/ruleset_builder.h"

namespace render {

namespace {

uint16_t Be16(std::span<const uint8_t> f, size_t at) {
  return static_cast<uint16_t>(f[at] << 8 | f[at + 1]);
}

std::string MacText(std::span<const uint8_t> f, size_t at) {
  return fmt::format("{:02x}:{:02x}:{:02x}:{:02x}:{:02x}:{:02x}", f[at], f[at + 1], f[at + 2],
                     f[at + 3], f[at + 4], f[at + 5]);
}

std::string Ip4Text(std::span<const uint8_t> f, size_t at) {
  return fmt::format("{}.{}.{}.{}", f[at], f[at + 1], f[at + 2], f[at + 3]);
}

// RFC 5952 text: lower case, leading zeros dropped, the longest run of two
// or more zero groups as "::".
std::string Ip6Text(std::span<const uint8_t> f, size_t at) {
  uint16_t g[8];
  for (int i = 0; i < 8; i++) g[i] = Be16(f, at + 2 * i);
  int bestAt = -1, bestLen = 0;
  for (int i = 0; i < 8;) {
    int j = i;
    while (j < 8 && g[j] == 0) j++;
    if (j - i > bestLen && j - i >= 2) bestAt = i, bestLen = j - i;
    i = j == i ? i + 1 : j;
  }
  std::string s;
  for (int i = 0; i < 8; i++) {
    if (i == bestAt) {
      s += "::";
      i += bestLen - 1;
      continue;
    }
    if (!s.empty() && s.back() != ':') s += ':';
    s += fmt::format("{:x}", g[i]);
  }
  return s;
}

std::string ProtoName(uint8_t proto) {
  switch (proto) {
    case 1: return "icmp";
    case 6: return "tcp";
    case 17: return "udp";
    case 47: return "gre";
    case 58: return "icmpv6";
    default: return fmt::format("proto {}", proto);
  }
}

void DissectL4(std::span<const uint8_t> f, size_t l4, Dissection* d) {
  if (!d->proto || d->fragment == "later") return;
  if (*d->proto != 6 && *d->proto != 17) return;
  if (f.size() < l4 + 4) {
    d->truncated = true;
    return;
  }
  d->sport = Be16(f, l4);
  d->dport = Be16(f, l4 + 2);
}

void DissectIpv6(std::span<const uint8_t> f, size_t l3, Dissection* d) {
  d->l3 = "ipv6";
  if (f.size() < l3 + 40) {
    d->truncated = true;
    return;
  }
  d->dscp = static_cast<uint8_t>(((f[l3] & 0x0f) << 2) | (f[l3 + 1] >> 6));
  d->ipSrc = Ip6Text(f, l3 + 8);
  d->ipDst = Ip6Text(f, l3 + 24);
  uint8_t nh = f[l3 + 6];
  size_t off = l3 + 40;
  // Extension headers, bounded by the frame and by a fixed count.
  for (int hops = 0; hops < 16; hops++) {
    if (nh != 0 && nh != 43 && nh != 60 && nh != 51 && nh != 44) break;
    if (f.size() < off + 8) {
      d->truncated = true;
      d->proto = nh;
      return;
    }
    const uint8_t next = f[off];
    if (nh == 44) {
      const uint16_t field = Be16(f, off + 2);
      if ((field >> 3) != 0) {
        d->fragment = "later";
      } else if (field & 1) {
        d->fragment = "first";
      }
      off += 8;
    } else if (nh == 51) {
      off += 8 + 4 * static_cast<size_t>(f[off + 1]);
    } else {
      off += 8 + 8 * static_cast<size_t>(f[off + 1]);
    }
    nh = next;
  }
  d->proto = nh;
  DissectL4(f, off, d);
}

std::string Hex16(uint16_t v) { return fmt::format("0x{:04x}", v); }

}  // namespace

Dissection Dissect(std::span<const uint8_t> f) {
  Dissection d;
  d.length = f.size();
  if (f.size() < 14) {
    d.runt = true;
    return d;
  }
  d.dst = MacText(f, 0);
  d.src = MacText(f, 6);
  size_t off = 12;
  uint16_t type = Be16(f, off);
  if (type == 0x8100) {
    if (f.size() < 18) {
      d.truncated = true;
      d.etherType = type;
      return d;
    }
    d.vlanId = Be16(f, 14) & 0x0fff;
    d.pcp = static_cast<uint8_t>(f[14] >> 5);
    off = 16;
    type = Be16(f, off);
  }
  size_t l3 = off + 2;
  if (type <= 1500) {
    d.llc = true;
    d.llcLength = type;
    // LLC/SNAP (AA AA 03 + OUI + type) carries an EtherType; other LLC
    // frames have none.
    if (f.size() >= l3 + 8 && f[l3] == 0xaa && f[l3 + 1] == 0xaa && f[l3 + 2] == 0x03) {
      type = Be16(f, l3 + 6);
      l3 += 8;
    } else {
      d.etherType = 0;
      return d;
    }
  }
  d.etherType = type;
  if (type == 0x0800) {
    d.l3 = "ipv4";
    if (f.size() < l3 + 20) {
      d.truncated = true;
      return d;
    }
    d.dscp = static_cast<uint8_t>(f[l3 + 1] >> 2);
    d.ipSrc = Ip4Text(f, l3 + 12);
    d.ipDst = Ip4Text(f, l3 + 16);
    d.proto = f[l3 + 9];
    const uint16_t frag = Be16(f, l3 + 6);
    if (frag & 0x1fff) {
      d.fragment = "later";
    } else if (frag & 0x2000) {
      d.fragment = "first";
    }
    DissectL4(f, l3 + 4 * static_cast<size_t>(f[l3] & 0x0f), &d);
  } else if (type == 0x86dd) {
    DissectIpv6(f, l3, &d);
  } else if (type == 0x0806) {
    d.l3 = "arp";
    if (f.size() >= l3 + 28) {
      d.ipSrc = Ip4Text(f, l3 + 14);
      d.ipDst = Ip4Text(f, l3 + 24);
    } else {
      d.truncated = true;
    }
  }
  return d;
}

std::string DissectionText(const Dissection& d) {
  if (d.runt) return fmt::format("runt frame of {} bytes", d.length);
  std::string s = fmt::format("{} > {}", d.src, d.dst);
  if (d.vlanId) s += fmt::format(" vlan {} pri {}", *d.vlanId, *d.pcp);
  if (d.llc) {
    s += fmt::format(" 802.3 length {}", *d.llcLength);
    if (d.etherType == 0) return s + fmt::format(" LLC, {} bytes", d.length);
    s += " snap";
  }
  if (d.l3 == "ipv4" || d.l3 == "ipv6") {
    s += d.l3 == "ipv4" ? " IPv4" : " IPv6";
    if (!d.ipSrc.empty()) {
      auto ep = [](const std::string& ip, std::optional<uint16_t> port, bool v6) {
        if (!port) return ip;
        return v6 ? fmt::format("[{}]:{}", ip, *port) : fmt::format("{}:{}", ip, *port);
      };
      const bool v6 = d.l3 == "ipv6";
      s += fmt::format(" {} > {}", ep(d.ipSrc, d.sport, v6), ep(d.ipDst, d.dport, v6));
    }
    if (d.proto) s += " " + ProtoName(*d.proto);
    if (d.dscp && *d.dscp != 0) s += fmt::format(" dscp {}", *d.dscp);
    if (d.fragment == "first") s += " first fragment";
    if (d.fragment == "later") s += " non-first fragment (no ports)";
  } else if (d.l3 == "arp") {
    s += " ARP";
    if (!d.ipSrc.empty()) s += fmt::format(" {} > {}", d.ipSrc, d.ipDst);
  } else {
    s += " ethertype " + Hex16(d.etherType);
  }
  if (d.truncated) s += " [truncated]";
  return s + fmt::format(", {} bytes", d.length);
}

nlohmann::json DissectionJson(const Dissection& d) {
  nlohmann::json j;
  j["length"] = d.length;
  if (d.runt) {
    j["runt"] = true;
    return j;
  }
  j["dst"] = d.dst;
  j["src"] = d.src;
  if (d.vlanId) j["vlan"] = {{"id", *d.vlanId}, {"pcp", *d.pcp}};
  if (d.llc) j["llcLength"] = *d.llcLength;
  j["ethertype"] = d.etherType;
  if (!d.l3.empty()) j["l3"] = d.l3;
  if (!d.ipSrc.empty()) {
    j["ipSrc"] = d.ipSrc;
    j["ipDst"] = d.ipDst;
  }
  if (d.proto) j["proto"] = *d.proto;
  if (d.dscp) j["dscp"] = *d.dscp;
  if (d.sport) {
    j["sport"] = *d.sport;
    j["dport"] = *d.dport;
  }
  if (!d.fragment.empty()) j["fragment"] = d.fragment;
  if (d.truncated) j["truncated"] = true;
  return j;
}

std::string DirectionName(uint32_t direction) {
  switch (direction) {
    case 1: return "from-switch";
    case 2: return "to-switch";
    default: return std::to_string(direction);
  }
}

std::string ActionName(uint32_t action) { return rules::ActionName(action); }

std::string DecisionName(uint32_t decision) {
  switch (decision) {
    case FWTraceNoRuleset: return "no-ruleset";
    case FWTraceFeature: return "feature";
    case FWTraceFragOverride: return "fragment-override";
    case FWTraceExactRule: return "exact";
    case FWTraceGeneralRule: return "general";
    case FWTraceNoRule: return "no-rule";
    default: return std::to_string(decision);
  }
}

std::string RuleSummaryLine(const SLCGeneric_RuleSummary& r) {
  // Fields are fixed-size text; none is trusted to hold its terminator, and
  // the module leaves the fields of other actions unwritten, so a field
  // that is not printable text is taken as absent.
  auto text = [](const char* field, size_t size) {
    std::string s(field, strnlen(field, size));
    for (char ch : s) {
      if (ch < 0x20 || ch > 0x7e) return std::string();
    }
    return s;
  };
  struct Field {
    const char* name;
    const char* value;
    size_t size;
  };
#define SLCG_FIELD(name) {#name, r.name, sizeof(r.name)}
  const Field fields[] = {
      SLCG_FIELD(dMac),    SLCG_FIELD(sMac),  SLCG_FIELD(ethType),      SLCG_FIELD(vlan1QTag),
      SLCG_FIELD(ipSa),    SLCG_FIELD(ipDa),  SLCG_FIELD(ipProto),      SLCG_FIELD(sPort),
      SLCG_FIELD(dPort),   SLCG_FIELD(rpTag), SLCG_FIELD(greIP),        SLCG_FIELD(rewriteMac),
      SLCG_FIELD(resourcePool), SLCG_FIELD(ethDot1PTag), SLCG_FIELD(dscpTag),
  };
#undef SLCG_FIELD
  std::string s;
  for (const Field& f : fields) {
    std::string v = text(f.value, f.size);
    while (!v.empty() && v.front() == ' ') v.erase(v.begin());
    if (v.empty() || v == "*") continue;
    s += fmt::format("{}={} ", f.name, v);
  }
  const std::string ranges = text(r.rangesEnabled, sizeof(r.rangesEnabled));
  if (!ranges.empty() && ranges != "None") s += fmt::format("ranges={} ", ranges);
  if (text(r.bidirectional, sizeof(r.bidirectional)) == "True") s += "bidirectional ";
  uint32_t direction, action;
  std::memcpy(&direction, &r.direction, 4);
  std::memcpy(&action, &r.action, 4);
  const char* dir = direction == 1 ? "from-switch" : direction == 2 ? "to-switch"
                    : direction == 3                ? "both"
                                                    : "invalid";
  return s + fmt::format("direction={} action={}", dir, ActionName(action));
}

std::string FateName(Fate fate) {
  switch (fate) {
    case Fate::ToVm: return "to-vm";
    case Fate::ToSwitch: return "to-switch";
    case Fate::TurnedBack: return "turned-back";
    case Fate::SlowPath: return "slow-path";
    case Fate::Dropped: return "dropped";
  }
  return "?";
}

namespace {

std::string FateText(Fate fate) {
  switch (fate) {
    case Fate::ToVm: return "passed toward the VM";
    case Fate::ToSwitch: return "passed toward the switch";
    case Fate::TurnedBack: return "turned back toward the switch";
    case Fate::SlowPath: return "handed to the slow path";
    case Fate::Dropped: return "dropped";
  }
  return "?";
}

std::string FeatureName(uint32_t feature) {
  if (feature == FW_FEATURE_DROP_BPDU) return "bridge-protocol destination (feature bit 0)";
  if (feature == FW_FEATURE_DROP_DHCP_SERVER) return "DHCP server reply toward the switch (feature bit 1)";
  return fmt::format("feature {:#x}", feature);
}

// How the verdict was reached, in words.
std::string HowText(const PacketReport& p) {
  const FWTrace& t = p.trace;
  switch (t.decision) {
    case FWTraceNoRuleset:
      return fmt::format("no ruleset in force: default action {}", ActionName(t.action));
    case FWTraceFeature:
      return "feature check: " + FeatureName(t.feature);
    case FWTraceFragOverride:
      return fmt::format("fragment override {} (action {})", ActionName(t.fragOverride),
                         ActionName(t.action));
    case FWTraceExactRule:
      return fmt::format("exact table: hit, rule at position {}: {}", t.position, p.ruleText);
    case FWTraceGeneralRule:
      return fmt::format("{}general rule {} (position {}): {}",
                         t.exactProbed ? "exact table: miss; " : "", t.generalIndex + 1,
                         t.position, p.ruleText);
    case FWTraceNoRule:
      return fmt::format("{}no rule: passes", t.exactProbed ? "exact table: miss; " : "");
    default:
      return "unknown decision";
  }
}

std::string EffectText(const PacketReport& p) {
  std::string s;
  for (Fate f : p.fates) s += (s.empty() ? "" : ", ") + FateText(f);
  // A punt that did not reach the slow path: say why.
  const bool punted = std::find(p.fates.begin(), p.fates.end(), Fate::SlowPath) != p.fates.end();
  if (p.traced && p.trace.action == SLCGenericActionPunt && !punted) {
    s += p.fates.size() == 1 && p.fates[0] == Fate::Dropped
             ? " (no slow path attached; the failure policy drops)"
             : " (no slow path attached; the failure policy passes)";
  }
  if (!p.changes.empty()) {
    s += fmt::format("; {} byte{} changed:", p.changes.size(), p.changes.size() == 1 ? "" : "s");
    for (const ByteChange& c : p.changes) {
      s += fmt::format(" [{}] {:02x}->{:02x}", c.offset, c.before, c.after);
    }
  }
  if (p.priority) s += fmt::format("; 802.1p priority {}", *p.priority);
  if (p.poolTag) s += fmt::format("; pool tag {}", *p.poolTag);
  for (const GreCopy& g : p.gre) {
    s += fmt::format("; GRE copy to {}: {} bytes ({} of the frame)", g.destination, g.bytes,
                     g.innerBytes);
  }
  if (!p.status.empty()) s += "; status " + p.status;
  return s;
}

}  // namespace

std::string PacketText(const PacketReport& p, bool detail) {
  const std::string dir = p.direction == 1 ? "from" : p.direction == 2 ? "to" : "?";
  std::string verdict = p.traced ? DecisionName(p.trace.decision) + " " + ActionName(p.trace.action)
                                 : "untraced";
  std::string s = fmt::format("{:<4} {:<4} {:<60} {}\n", p.index, dir,
                              DissectionText(Dissect(p.frame)), verdict);
  if (!detail) return s;
  if (p.origLen > p.frame.size()) {
    s += fmt::format("     captured {} of {} bytes\n", p.frame.size(), p.origLen);
  }
  if (p.traced) s += "     how: " + HowText(p) + "\n";
  s += "     did: " + EffectText(p) + "\n";
  return s;
}

nlohmann::json PacketJson(const PacketReport& p) {
  nlohmann::json j;
  j["index"] = p.index;
  j["direction"] = DirectionName(p.direction);
  j["time"] = {{"sec", p.tsSec}, {"nsec", p.tsNsec}};
  j["length"] = p.frame.size();
  j["origLength"] = p.origLen != 0 ? p.origLen : p.frame.size();
  j["frame"] = DissectionJson(Dissect(p.frame));
  if (p.traced) {
    const FWTrace& t = p.trace;
    nlohmann::json tr;
    tr["decision"] = DecisionName(t.decision);
    tr["action"] = ActionName(t.action);
    tr["exactProbed"] = t.exactProbed != 0;
    tr["exactHit"] = t.exactHit != 0;
    if (t.decision == FWTraceFeature) tr["feature"] = t.feature;
    if (t.decision == FWTraceFragOverride) tr["fragOverride"] = ActionName(t.fragOverride);
    if (t.decision == FWTraceExactRule || t.decision == FWTraceGeneralRule) {
      tr["rule"] = {{"position", t.position}, {"summary", p.ruleText}};
      if (t.decision == FWTraceGeneralRule) tr["rule"]["generalIndex"] = t.generalIndex;
    }
    j["trace"] = tr;
  }
  nlohmann::json fates = nlohmann::json::array();
  for (Fate f : p.fates) fates.push_back(FateName(f));
  j["fates"] = fates;
  nlohmann::json changes = nlohmann::json::array();
  for (const ByteChange& c : p.changes) {
    changes.push_back({{"offset", c.offset}, {"before", c.before}, {"after", c.after}});
  }
  j["changes"] = changes;
  if (p.priority) j["priority"] = *p.priority;
  if (p.poolTag) j["poolTag"] = *p.poolTag;
  nlohmann::json gre = nlohmann::json::array();
  for (const GreCopy& g : p.gre) {
    gre.push_back({{"destination", g.destination}, {"bytes", g.bytes}, {"innerBytes", g.innerBytes}});
  }
  j["gre"] = gre;
  if (!p.status.empty()) j["status"] = p.status;
  return j;
}

std::string CountersText(const CounterListing& c) {
  std::string s;
  if (!c.haveRuleset) {
    if (!c.tallied) return fmt::format("no ruleset in force; default action {}\n",
                                       ActionName(c.defaultAction));
    s += fmt::format("no ruleset in force; default action {}: {} packets, {} bytes\n",
                     ActionName(c.defaultAction), c.defaultPackets, c.defaultBytes);
    return s;
  }
  s += fmt::format("{:<5} {:<4} {:<8} {:>10} {:>12}  {}\n", "rule", "pos", "table", "packets",
                   "bytes", "summary");
  for (const RuleCounters& r : c.rules) {
    s += fmt::format("{:<5} {:<4} {:<8} {:>10} {:>12}  {}\n",
                     r.rulesetIndex != 0 ? std::to_string(r.rulesetIndex) : "-", r.position,
                     r.exact ? "exact" : "general", r.packets, r.bytes, r.text);
  }
  if (!c.tallied) return s;
  s += fmt::format("{:<19} {:>10} {:>12}  no rule matched: passed\n", "no match", c.noMatchPackets,
                   c.noMatchBytes);
  if (c.defaultPackets != 0) {
    s += fmt::format("{:<19} {:>10} {:>12}  default action {} (before a ruleset)\n", "default",
                     c.defaultPackets, c.defaultBytes, ActionName(c.defaultAction));
  }
  return s;
}

nlohmann::json CountersJson(const CounterListing& c) {
  nlohmann::json j;
  j["haveRuleset"] = c.haveRuleset;
  j["defaultAction"] = {{"action", ActionName(c.defaultAction)}};
  if (c.tallied) {
    j["defaultAction"]["packets"] = c.defaultPackets;
    j["defaultAction"]["bytes"] = c.defaultBytes;
    j["noMatch"] = {{"packets", c.noMatchPackets}, {"bytes", c.noMatchBytes}};
  }
  nlohmann::json rules = nlohmann::json::array();
  for (const RuleCounters& r : c.rules) {
    nlohmann::json e = {{"position", r.position},
                        {"table", r.exact ? "exact" : "general"},
                        {"action", ActionName(r.action)},
                        {"summary", r.text},
                        {"packets", r.packets},
                        {"bytes", r.bytes}};
    if (r.rulesetIndex != 0) e["rulesetIndex"] = r.rulesetIndex;
    rules.push_back(e);
  }
  j["rules"] = rules;
  return j;
}

namespace {

// The action number of a text-syntax name; 0 (none) for a name not known.
uint32_t ActionNumber(const std::string& name) {
  for (size_t i = 0; i < rules::syntax::kActionNames.size(); i++) {
    if (name == rules::syntax::kActionNames[i]) return static_cast<uint32_t>(i);
  }
  return 0;
}

}  // namespace

CounterListing CountersFromJson(const nlohmann::json& j) {
  CounterListing c;
  if (!j.is_object()) return c;
  auto u64 = [](const nlohmann::json& o, const char* key) -> uint64_t {
    return o.is_object() && o.contains(key) && o[key].is_number_unsigned() ? o[key].get<uint64_t>()
                                                                            : 0;
  };
  auto text = [](const nlohmann::json& o, const char* key) -> std::string {
    return o.is_object() && o.contains(key) && o[key].is_string() ? o[key].get<std::string>() : "";
  };
  c.haveRuleset = j.value("haveRuleset", false);
  const nlohmann::json def = j.value("defaultAction", nlohmann::json::object());
  c.defaultAction = ActionNumber(text(def, "action"));
  if (j.contains("noMatch")) {
    c.tallied = true;
    c.noMatchPackets = u64(j["noMatch"], "packets");
    c.noMatchBytes = u64(j["noMatch"], "bytes");
    c.defaultPackets = u64(def, "packets");
    c.defaultBytes = u64(def, "bytes");
  }
  for (const nlohmann::json& e : j.value("rules", nlohmann::json::array())) {
    RuleCounters r;
    r.position = static_cast<uint32_t>(u64(e, "position"));
    r.rulesetIndex = u64(e, "rulesetIndex");
    r.exact = text(e, "table") == "exact";
    r.action = ActionNumber(text(e, "action"));
    r.text = text(e, "summary");
    r.packets = u64(e, "packets");
    r.bytes = u64(e, "bytes");
    c.rules.push_back(std::move(r));
  }
  return c;
}

std::string LogText(std::span<const LogLine> lines) {
  std::string s;
  for (const LogLine& l : lines) {
    s += fmt::format("  [{}] {}{}\n", l.urgency, l.object.empty() ? "" : l.object + ": ", l.text);
  }
  return s;
}

nlohmann::json LogJson(std::span<const LogLine> lines) {
  nlohmann::json j = nlohmann::json::array();
  for (const LogLine& l : lines) {
    j.push_back({{"urgency", l.urgency}, {"object", l.object}, {"text", l.text}});
  }
  return j;
}

}  // namespace render
