// One run of the module in the userspace host: load it, create an agent
// and one filter on a virtual NIC, install a ruleset through the agent's
// ruleset property, push captured frames through the filter one by one, and
// report for each how the module decided it (its read-only trace entry
// point, asked just before the packet goes through) and what became of it:
// the frames leaving toward the VM and toward the switch after marks and
// rewrites, slow-path copies and punts, GRE datagrams as their receiver
// sees them, and drops. After the packets, the rules' counters are read
// back through the module's own channels (status tree summaries for text
// and counters, the character device's get request to place each rule in
// the ruleset as given).
//
// The run resets the host before and after; it is not reentrant.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tools/lib/capture.h"
#include "tools/lib/render.h"

namespace runner {

struct Config {
  std::string agentText = "sluice-demo:default-action=ACTION_PUNT";
  std::string filterName = "vm1.eth0";
  std::vector<uint8_t> ruleset;            // wire ruleset; empty = none
  bool slowPath = false;                   // register slow path 1 and attach
  uint32_t failurePolicy = 0;
  std::vector<frames::CaptureRecord> records;   // directions resolved (1 or 2)
  frames::Ip4Addr greSource = {192, 0, 2, 1};   // outer source of GRE datagrams
};

// The frames each output capture receives, in the order they left.
struct Outputs {
  std::vector<frames::CaptureRecord> toVm, toSwitch, dropped, slowPath, gre;
};

struct Result {
  std::string error;                       // setup failure; nothing ran
  std::string rulesetStatus;               // status of the ruleset write, when one was given
  bool rulesetRefused = false;
  std::vector<render::PacketReport> packets;
  render::CounterListing counters;
  std::vector<render::LogLine> log;
  Outputs outputs;
  std::vector<std::string> leftovers;      // what the module left behind at unload
};

Result Run(const Config& config);

// The datagram a GRE receiver gets for `payload` (GRE header and inner
// frame, as the module sends it): an IPv4 header with protocol 47, a valid
// checksum and identification `id`.
frames::Bytes GreDatagram(const frames::Ip4Addr& src, const uint8_t dst[4],
                          const std::vector<uint8_t>& payload, uint16_t id);

// `frame` as it appears on a tagged link when the packet carries VLAN or
// priority metadata: an existing 802.1Q tag gets the priority, otherwise a
// tag is inserted after the MACs. Unchanged when both are 0.
frames::Bytes TagFrame(const frames::Bytes& frame, uint16_t vlanId, uint8_t priority);

}  // namespace runner
