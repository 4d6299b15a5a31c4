// A run of the module over a capture that exercises every action: the trace
// names the rule whose counters rise, the counters listed add up to the
// packets that hit each rule, each packet's fates follow its action, and GRE
// datagrams leave as a receiver sees them. The bytes the module's marks and
// rewrites change are checked by actions_rewrite_test.
#include "tools/lib/run.h"

#include <gtest/gtest.h>

#include <map>

#include "tests/support/tool_frames.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using namespace toolframes;

Bytes Tcp(uint16_t dport, size_t payload = 20, bool toSwitch = false) {
  return (toSwitch ? ToSwitch() : FromSwitch()).Tos(0x01).Tcp(40000, dport).Payload(payload).Build();
}

// One rule per action, told apart by destination port; the exact one comes
// third so ruleset order differs from the module's (exact rules first).
constexpr char kRules[] = R"(ruleset version=8
action=drop ipv4 proto=tcp dport=1
action=accept ipv4 proto=tcp dport=2
action=punt dmac=02:00:00:00:00:10 smac=02:00:00:00:00:01 vlan=none ethtype=0x0800 sa=10.0.0.1 da=10.0.0.10 proto=tcp sport=40000 dport=3
action=copy ipv4 proto=tcp dport=4
action=l2rewrite ipv4 proto=tcp dport=5 rewrite=0a:0b:0c:0d:0e:0f
action=gre ipv4 proto=tcp dport=6 gre=198.51.100.7 snaplen=40
action=log ipv4 proto=tcp dport=7
action=pooltag ipv4 proto=tcp dport=8 pool=gold
action=dscp ipv4 proto=tcp dport=9 dscp=46
action=dot1p ipv4 proto=tcp dport=10 dot1p=5
action=dscp+dot1p ipv4 proto=tcp dport=11 dscp=10 dot1p=3
)";

class Run : public ::testing::Test {
 protected:
  void SetUp() override {
    config_.slowPath = true;
    config_.ruleset = rules::ParseRuleset(kRules);
    int64_t t = 1700000000;
    for (uint16_t port = 1; port <= 12; port++) {  // 12 matches nothing
      config_.records.push_back({1, Tcp(port, port * 3), 0, t++, port});
    }
    config_.records.push_back({2, Tcp(5, 8, true), 0, t++, 0});   // rewrite toward the switch
    config_.records.push_back({2, Tcp(9, 8, true), 0, t++, 0});   // marked toward the switch
    config_.records.push_back({1, Tcp(6, 200), 0, t++, 0});       // GRE, cut at the snap length
    config_.records.push_back({1, Tcp(1, 1), 0, t++, 0});
    result_ = runner::Run(config_);
    ASSERT_EQ(result_.error, "");
    ASSERT_FALSE(result_.rulesetRefused) << result_.rulesetStatus;
    ASSERT_EQ(result_.packets.size(), config_.records.size());
  }
  const render::PacketReport& Packet(size_t i) { return result_.packets.at(i); }

  runner::Config config_;
  runner::Result result_;
};

// One run, three views of it: the trace against the counters, the fates,
// and the GRE datagrams.
TEST_F(Run, TraceCountersFatesAndGreDatagramsAgree) {
  std::map<uint32_t, std::pair<uint64_t, uint64_t>> hits;  // position -> packets, bytes
  uint64_t noMatch = 0;
  for (const render::PacketReport& p : result_.packets) {
    ASSERT_TRUE(p.traced);
    if (p.trace.decision == FWTraceNoRule) {
      noMatch++;
      continue;
    }
    ASSERT_TRUE(p.trace.decision == FWTraceExactRule || p.trace.decision == FWTraceGeneralRule)
        << p.index;
    EXPECT_FALSE(p.ruleText.empty());
    hits[p.trace.position].first++;
    hits[p.trace.position].second += p.frame.size();
  }
  EXPECT_EQ(noMatch, 1u);
  EXPECT_EQ(result_.counters.noMatchPackets, 1u);
  const auto& listed = result_.counters.rules;
  ASSERT_EQ(listed.size(), 11u);
  for (size_t i = 0; i < listed.size(); i++) {
    SCOPED_TRACE(i);
    EXPECT_EQ(listed[i].rulesetIndex, i + 1);  // in the order of the ruleset given
    EXPECT_EQ(listed[i].exact, i == 2);
    const auto hit = hits[listed[i].position];
    EXPECT_EQ(listed[i].packets, hit.first);
    EXPECT_EQ(listed[i].bytes, hit.second);
    EXPECT_EQ(listed[i].packets, i == 0 || i == 4 || i == 5 || i == 8 ? 2u : 1u);
  }
  // The exact rule sits first in the module, third in the ruleset.
  EXPECT_EQ(listed[2].position, 0u);
  EXPECT_EQ(Packet(2).trace.decision, +FWTraceExactRule);

  using render::Fate;
  const std::vector<std::vector<Fate>> want = {
      {Fate::Dropped},         {Fate::ToVm},       {Fate::SlowPath},
      {Fate::ToVm, Fate::SlowPath}, {Fate::TurnedBack}, {Fate::ToVm},
      {Fate::ToVm},            {Fate::ToVm},       {Fate::ToVm},
      {Fate::ToVm},            {Fate::ToVm},       {Fate::ToVm},
      {Fate::ToSwitch},        {Fate::ToSwitch},   {Fate::ToVm},
      {Fate::Dropped}};
  for (size_t i = 0; i < want.size(); i++) EXPECT_EQ(Packet(i).fates, want[i]) << i;
  EXPECT_EQ(Packet(9).priority, std::optional<uint8_t>(5));
  EXPECT_EQ(result_.outputs.dropped.size(), 2u);
  EXPECT_EQ(result_.outputs.slowPath.size(), 2u);
  EXPECT_EQ(result_.outputs.slowPath[0].tsNsec, 3u);  // timestamps travel with the frame
  // A marked frame lists its changed bytes, the TOS byte (ECN kept) first.
  ASSERT_FALSE(Packet(13).changes.empty());
  EXPECT_EQ(Packet(13).changes[0].offset, 15u);
  EXPECT_EQ(Packet(13).changes[0].after, (46 << 2) | 0x01);

  // GRE datagrams are what the receiver sees.
  ASSERT_EQ(result_.outputs.gre.size(), 2u);
  for (size_t i = 0; i < 2; i++) {
    SCOPED_TRACE(i);
    const Bytes& d = result_.outputs.gre[i].frame;
    const Bytes& inner = config_.records[i == 0 ? 5 : 14].frame;
    const size_t innerLen = std::min<size_t>(inner.size(), 40);
    ASSERT_EQ(d.size(), 20u + 4 + innerLen);
    EXPECT_EQ(d[0], 0x45);
    EXPECT_EQ((d[2] << 8 | d[3]), static_cast<int>(d.size()));
    EXPECT_EQ(d[9], 47);
    EXPECT_EQ(frames::InternetChecksum(std::span(d).first(20)), 0);
    EXPECT_EQ(frames::Hex(std::span(d).subspan(12, 8)), "c0 00 02 01 c6 33 64 07");
    EXPECT_EQ(frames::Hex(std::span(d).subspan(20, 4)), "00 00 65 58");  // no key, no checksum
    EXPECT_TRUE(std::equal(d.begin() + 24, d.end(), inner.begin()));
  }
  EXPECT_EQ(Packet(14).gre.at(0).innerBytes, 40u);
  EXPECT_EQ(Packet(14).gre.at(0).destination, "198.51.100.7");
}

TEST(RunHelpers, TagFrameInsertsOrUpdatesTheTag) {
  const Bytes plain = FrameBuilder().Eth(kVm, kGw).Ipv4({}, {}).Build();
  EXPECT_EQ(runner::TagFrame(plain, 0, 0), plain);
  const Bytes tagged = runner::TagFrame(plain, 100, 5);
  EXPECT_EQ(frames::Hex(std::span(tagged).subspan(12, 6)), "81 00 a0 64 08 00");
  EXPECT_EQ(runner::TagFrame(tagged, 100, 2)[14], 0x40);
}

}  // namespace
