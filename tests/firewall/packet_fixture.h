// Helpers for the packet-path and action tests: one firewall filter, rules
// from text, frames from the frame builder, lists run through the filter.
#pragma once

#include <algorithm>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "firewall/fw_packet.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace fwpathtest {

using frames::Bytes;
using Frames = std::vector<Bytes>;
using frames::FrameBuilder;
using testsupport::Replies;

inline FrameBuilder Base() {
  return FrameBuilder().Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"));
}
inline FrameBuilder V4() { return Base().Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2")); }
inline Bytes Tcp4(uint16_t sport = 1234, uint16_t dport = 80, size_t payload = 20) {
  return V4().Tcp(sport, dport).Payload(payload).Build();
}

// An exact IPv4 TCP rule matching Tcp4(sport, dport).
inline std::string ExactTcp4(std::string_view action, uint16_t sport = 1234, uint16_t dport = 80,
                             std::string_view extra = "") {
  return "action=" + std::string(action) +
         " dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 vlan=none ethtype=0x0800 sa=10.0.0.1"
         " da=10.0.0.2 proto=tcp sport=" + std::to_string(sport) +
         " dport=" + std::to_string(dport) + " " + std::string(extra);
}

// The frame after an L2 rewrite to kRewriteMac: destination replaced and,
// when turned around, the old destination as the source.
inline constexpr char kRewriteMac[] = "0a:0b:0c:0d:0e:0f";
inline Bytes Rewritten(Bytes f, bool turnedAround) {
  const frames::MacAddr mac = frames::Mac(kRewriteMac);
  if (turnedAround) std::copy(f.begin(), f.begin() + 6, f.begin() + 6);
  std::copy(mac.begin(), mac.end(), f.begin());
  return f;
}

// A packet to make: scatter-gather element sizes (empty: one element) and the
// mapped length. A read-only packet aborts the host when written, so cases
// with one prove the original was left alone.
inline host::PacketSpec Pkt(const Bytes& frame, bool writable = true,
                            std::vector<uint32_t> sg = {}, uint32_t mapped = UINT32_MAX) {
  return {.frame = frame, .sgSizes = std::move(sg), .mappedLen = mapped, .writable = writable};
}

class PacketPathTest : public testsupport::FirewallTest {
 protected:
  void ApplyText(std::string_view text) {
    ASSERT_EQ(Apply(rules::ParseRuleset(text)), ZEL_OK) << text;
  }
  // Runs the packets through the filter as one list and returns those left
  // in it (alive until the next run).
  std::vector<ZelPkt*> Run(const std::vector<host::PacketSpec>& pkts, uint32_t direction) {
    list_ = std::make_unique<host::PacketList>();
    for (const host::PacketSpec& p : pkts) list_->Append(host::Packets::Make(p));
    EXPECT_EQ(host::Sluice::Deliver(id_, *list_, direction), ZEL_OK);
    return list_->Packets();
  }
  Frames RunFrames(const Frames& frames, uint32_t direction) {
    Frames passed;
    EXPECT_EQ(Deliver(id_, frames, direction, &passed), ZEL_OK);
    return passed;
  }
  static Frames FramesOf(const std::vector<ZelPkt*>& pkts) {
    Frames out;
    for (ZelPkt* p : pkts) out.push_back(host::Packets::Frame(p));
    return out;
  }

  // Registers a slow path; its attach reply is held back unless `finish`.
  void Attach(bool finish = true) {
    host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Replies(host::ReplyMode::Deferred));
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, 1), ZEL_OK);
    host::Timers::RunDue();
    ASSERT_EQ(ctx_->spAttachState, SLCGenericSpAttaching);
    if (finish) FinishAttach();
  }
  void FinishAttach() {
    host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    ASSERT_EQ(ctx_->spAttachState, SLCGenericSpAttached);
  }
  void TearDown() override {
    list_.reset();
    FirewallTest::TearDown();
  }

  // Lists handed to the framework: direction and frames (packets released).
  using Handed = std::pair<uint32_t, Frames>;
  static std::vector<Handed> Take(std::vector<host::Delivery> deliveries) {
    std::vector<Handed> out;
    for (const host::Delivery& d : deliveries) out.emplace_back(d.direction, FramesOf(d.packets));
    testsupport::ReleaseDeliveries(&deliveries);
    return out;
  }
  std::vector<Handed> Faulted() { return Take(host::Sluice::TakeFaulted(id_)); }
  std::vector<Handed> Issued() { return Take(host::Sluice::TakeIssued(id_)); }

  uint64_t ExactPkts(std::string_view line) {
    const FWRuleEntry* e = FindExact(rules::ParseRule(line));
    return e != nullptr ? +e->rule.pktCount : ~0ull;
  }
  uint64_t GeneralPkts(size_t i) { return +GeneralEntries().at(i)->rule.pktCount; }

  std::unique_ptr<host::PacketList> list_;
};

}  // namespace fwpathtest
