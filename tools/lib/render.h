// The one renderer for what the tools show: frames dissected on one line,
// packet traces (how the filter decided and what it did), rules with their
// counters, and the module log. Each has a text form ({fmt}) and a JSON form
// (nlohmann-json) built from the same plain structures, so the two never
// disagree. The JSON field names are a stable interface (schema version
// kJsonSchema); README.md documents them.
//
// The structures are filled by whoever ran the packets (sluice-run, the
// long-running host's client); this file only renders. Nothing here decides
// a verdict: the trace comes from the module (firewall/fw_trace.h) and the
// rule text from the module's status tree.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "firewall/fw_trace.h"
#include "tools/lib/frames.h"

struct SLCGeneric_RuleSummary;

namespace render {

inline constexpr int kJsonSchema = 1;

// --- Frames -------------------------------------------------------------------

// What one Ethernet frame holds, as far as its bytes go.
struct Dissection {
  size_t length = 0;
  bool runt = false;                 // shorter than an Ethernet header
  std::string dst, src;              // MACs
  std::optional<uint16_t> vlanId;    // 802.1Q tag in the frame
  std::optional<uint8_t> pcp;
  bool llc = false;                  // 802.3 length framing
  std::optional<uint16_t> llcLength;
  uint16_t etherType = 0;            // after any tag and LLC/SNAP header
  std::string l3;                    // "ipv4", "ipv6", "arp" or "" (other)
  std::string ipSrc, ipDst;
  std::optional<uint8_t> proto;
  std::optional<uint8_t> dscp;
  std::optional<uint16_t> sport, dport;
  std::string fragment;              // "", "first" or "later"
  bool truncated = false;            // a header it announces is cut short
};

Dissection Dissect(std::span<const uint8_t> frame);
std::string DissectionText(const Dissection& d);
nlohmann::json DissectionJson(const Dissection& d);

// --- Names --------------------------------------------------------------------

// "from-switch" / "to-switch" (other values as numbers).
std::string DirectionName(uint32_t direction);
// The text-syntax action name ("drop", "dscp+dot1p", ...).
std::string ActionName(uint32_t action);
// "exact", "general", "feature", "fragment-override", "no-rule", "no-ruleset".
std::string DecisionName(uint32_t decision);
// The status tree's summary of one rule on one line: the fields that are
// not wildcards, as the tree renders them, then direction and action.
// Counters are left out (they are listed beside the rule).
std::string RuleSummaryLine(const SLCGeneric_RuleSummary& summary);

// --- Packet traces -------------------------------------------------------------

struct ByteChange {
  size_t offset;
  uint8_t before, after;
};

struct GreCopy {
  std::string destination;   // dotted IPv4
  size_t bytes = 0;          // GRE header and inner frame, as sent
  size_t innerBytes = 0;     // of which inner frame
};

// Where a packet (or a copy of it) went.
enum class Fate { ToVm, ToSwitch, TurnedBack, SlowPath, Dropped };
std::string FateName(Fate fate);

struct PacketReport {
  size_t index = 0;             // 1-based record number
  uint32_t direction = 0;
  int64_t tsSec = 0;
  uint32_t tsNsec = 0;
  frames::Bytes frame;
  uint32_t origLen = 0;
  bool traced = false;          // `trace` holds the module's answer
  FWTrace trace{};
  std::string ruleText;         // RuleSummaryLine of the deciding rule
  std::vector<Fate> fates;
  std::vector<ByteChange> changes;        // in the frame that left, against the input
  std::optional<uint8_t> priority;        // 802.1p priority set on the packet
  std::optional<uint16_t> poolTag;        // resource-pool tag set on the packet
  std::vector<GreCopy> gre;
  std::string status;           // the packet path's status when not OK
};

// One line per packet; with `detail`, the trace below it: how the verdict
// was reached, the rule, the action and its effect.
std::string PacketText(const PacketReport& p, bool detail);
nlohmann::json PacketJson(const PacketReport& p);

// --- Rules and counters --------------------------------------------------------

struct RuleCounters {
  size_t rulesetIndex = 0;      // 1-based line of the ruleset given; 0 = not found there
  uint32_t position = 0;        // the module's position (status tree, readers)
  bool exact = false;
  uint32_t action = 0;
  std::string text;             // RuleSummaryLine
  uint64_t packets = 0, bytes = 0;
};

struct CounterListing {
  bool haveRuleset = false;
  uint32_t defaultAction = 0;
  std::vector<RuleCounters> rules;   // in ruleset order
  // Tallied from the traces of a run (`tallied`): packets the default
  // action decided (no ruleset in force) and packets that no rule matched.
  // A live filter has no such counters, and its listing leaves them out.
  bool tallied = false;
  uint64_t defaultPackets = 0, defaultBytes = 0;
  uint64_t noMatchPackets = 0, noMatchBytes = 0;
};

std::string CountersText(const CounterListing& c);
nlohmann::json CountersJson(const CounterListing& c);
// The listing back from CountersJson's document (as a client receives it);
// missing or mistyped fields are left at their defaults.
CounterListing CountersFromJson(const nlohmann::json& j);

// --- Module log ------------------------------------------------------------------

struct LogLine {
  int32_t urgency = 0;
  std::string object;
  std::string text;
};
std::string LogText(std::span<const LogLine> lines);
nlohmann::json LogJson(std::span<const LogLine> lines);

}  // namespace render
