// Helpers for the packet-path and action tests: one firewall filter, rules
// from text, frames from the frame builder, and lists run through the
// framework's process-packets callback.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "firewall/fw_packet.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace fwpathtest {

using frames::Bytes;
using frames::FrameBuilder;

inline const frames::MacAddr kDstMac = frames::Mac("02:00:00:00:00:02");
inline const frames::MacAddr kSrcMac = frames::Mac("02:00:00:00:00:01");

// The L2 part of an exact rule that matches frames built from Base().
inline constexpr char kExactL2[] =
    "dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 vlan=none ";

inline FrameBuilder Base() { return FrameBuilder().Eth(kDstMac, kSrcMac); }

inline Bytes Tcp4(uint16_t sport = 1234, uint16_t dport = 80, size_t payload = 20) {
  return Base()
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Tcp(sport, dport)
      .Payload(payload)
      .Build();
}

inline Bytes Udp4(uint16_t sport, uint16_t dport, size_t payload = 20) {
  return Base()
      .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
      .Udp(sport, dport)
      .Payload(payload)
      .Build();
}

// An exact IPv4 TCP rule for Tcp4(sport, dport).
inline std::string ExactTcp4(std::string_view action, uint16_t sport = 1234, uint16_t dport = 80,
                             std::string_view extra = "") {
  return std::string("action=") + std::string(action) + " " + kExactL2 +
         "ethtype=0x0800 sa=10.0.0.1 da=10.0.0.2 proto=tcp sport=" + std::to_string(sport) +
         " dport=" + std::to_string(dport) + " " + std::string(extra);
}

class PacketPathTest : public testsupport::FirewallTest {
 protected:
  // Applies ruleset text (rules, optional header line), replacing.
  void ApplyText(std::string_view text) {
    ASSERT_EQ(Apply(rules::ParseRuleset(text)), ZEL_OK) << text;
  }

  // Runs the packets through the filter as one list; returns the frames
  // still in the list afterwards (their packets are released).
  std::vector<Bytes> Run(const std::vector<ZelPkt*>& pkts, uint32_t direction,
                         ZelStatus* status = nullptr) {
    host::PacketList list;
    for (ZelPkt* p : pkts) list.Append(p);
    ZelStatus st = host::Sluice::Deliver(id_, list, direction);
    if (status != nullptr) *status = st;
    std::vector<Bytes> passed;
    for (ZelPkt* p : list.Packets()) passed.push_back(host::Packets::Frame(p));
    return passed;
  }
  std::vector<Bytes> RunFrames(const std::vector<Bytes>& frames, uint32_t direction) {
    std::vector<ZelPkt*> pkts;
    for (const Bytes& f : frames) pkts.push_back(host::Packets::Make(f));
    return Run(pkts, direction);
  }

  // Registers a slow path whose attach request is answered later: the
  // filter stays attaching until FinishAttach().
  void StartAttaching() {
    host::RequestPolicy deferred;
    deferred.mode = host::ReplyMode::Deferred;
    host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, deferred);
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, 1), ZEL_OK);
    host::Timers::RunDue();
    ASSERT_EQ(ctx_->spAttachState, SLCGenericSpAttaching);
  }
  void FinishAttach() {
    host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    ASSERT_EQ(ctx_->spAttachState, SLCGenericSpAttached);
  }
  void Attach() {
    StartAttaching();
    FinishAttach();
  }
  void TearDown() override {
    host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    FirewallTest::TearDown();
  }

  // Frames of every list handed to the framework, with the direction of
  // each list; the packets are released.
  struct Handed {
    uint32_t direction;
    std::vector<Bytes> frames;
    bool operator==(const Handed&) const = default;
  };
  static std::vector<Handed> Frames(std::vector<host::Delivery> deliveries) {
    std::vector<Handed> out;
    for (const host::Delivery& d : deliveries) {
      Handed h{d.direction, {}};
      for (ZelPkt* p : d.packets) h.frames.push_back(host::Packets::Frame(p));
      out.push_back(h);
    }
    testsupport::ReleaseDeliveries(&deliveries);
    return out;
  }
  std::vector<Handed> Faulted() { return Frames(host::Sluice::TakeFaulted(id_)); }
  std::vector<Handed> Issued() { return Frames(host::Sluice::TakeIssued(id_)); }

  // Counters by value (the record is packed: no references into it).
  static uint64_t Pkts(const FWRuleEntry* e) { return e->rule.pktCount; }
  static uint64_t Octets(const FWRuleEntry* e) { return e->rule.byteCount; }

  // The installed rule entries, exact ones first.
  FWRuleEntry* Exact(std::string_view line) { return FindExact(rules::ParseRule(line)); }
  FWRuleEntry* General(size_t index) {
    std::vector<FWRuleEntry*> g = GeneralEntries();
    return index < g.size() ? g[index] : nullptr;
  }
};

}  // namespace fwpathtest
