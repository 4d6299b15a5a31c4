// Adding rules through the staged road (FWAddRuleset): built beside the
// rules in force under the shared hold, swapped in under the exclusive one.
// It must end exactly where the in-place addition ends, keep every packet
// counted between the two holds, notice a writer that came in between, and
// stay sound with packets and other writers running at once.
#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <functional>
#include <string>
#include <thread>

#include "firewall/fw_index.h"
#include "firewall/fw_ioctl.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using Bytes = std::vector<uint8_t>;
using testsupport::FirewallTest;

// Exact UDP flow i: 10.<i / 256>.<i % 256>.1:1000 -> 10.9.0.1:2000.
std::string FlowSource(uint32_t i) {
  return "10." + std::to_string(i / 256) + "." + std::to_string(i % 256) + ".1";
}
std::string Flow(uint32_t i, const std::string& action = "action=accept") {
  return "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=17 sa=" +
         FlowSource(i) + " sport=1000 da=10.9.0.1 dport=2000 " + action + "\n";
}

Bytes FlowFrame(uint32_t i, uint16_t dport = 2000) {
  return frames::FrameBuilder()
      .Eth(frames::Mac("02:00:00:00:00:0a"), frames::Mac("02:00:00:00:00:0b"))
      .Ipv4(frames::Ip4(FlowSource(i)), frames::Ip4("10.9.0.1"))
      .Udp(1000, dport)
      .Payload(10)
      .Build();
}

// Flows [from, to) plus general rules: one that flow frames to port 3000
// hit, and `general` that no frame hits.
Bytes Rules(uint32_t from, uint32_t to, uint32_t general, const std::string& header) {
  std::string text = header + "\n";
  for (uint32_t i = from; i < to; i++) text += Flow(i);
  text += "action=accept proto=17 dport=3000\n";
  for (uint32_t g = 0; g < general; g++) text += "action=drop proto=6 dport=" + std::to_string(4000 + g) + "\n";
  return rules::ParseRuleset(text);
}

class StagedAddTest : public FirewallTest {
 protected:
  void TearDown() override {
    g_fwAddBetweenHolds = nullptr;
    hook_ = nullptr;
    FirewallTest::TearDown();
  }

  ZelStatus Add(const Bytes& ruleset, bool fromIoctl = true) {
    Bytes copy(ruleset);
    return FWAddRuleset(filter_, reinterpret_cast<FWRuleset*>(copy.data()), fromIoctl ? 1 : 0);
  }

  // Runs `hook` between the holds of every staging that follows.
  void BetweenHolds(std::function<void()> hook) {
    hook_ = std::move(hook);
    g_fwAddBetweenHolds = [](SLCGenericFilter*) { hook_(); };
  }

  void Send(const std::vector<Bytes>& frames) { ASSERT_EQ(Deliver(id_, frames, 1), ZEL_OK); }

  // The scan index lists exactly the general entries, in order.
  void ExpectIndexMatchesList() {
    std::vector<FWRuleEntry*> listed;
    if (const FWScanIndex* index = ctx_->scanIndex) {
      for (uint32_t i = 0; i < index->count; i++) {
        if (index->entries[i] != nullptr) listed.push_back(index->entries[i]);
      }
    }
    EXPECT_EQ(listed, GeneralEntries());
  }

  static inline std::function<void()> hook_;
};

const std::string kUndoBefore =
    "ruleset version=7 features=0x1 frag=drop\n" + Flow(1, "action=drop dir=to bidir") +
    Flow(2, "action=pooltag pool=gold") + Flow(3, "action=gre gre=192.0.2.9") +
    "action=pooltag pool=gold sport=7\naction=punt sa=10.9.0.0-10.9.0.9\n";
const std::string kUndoNext =
    "ruleset version=8 features=0x2 frag=punt\n" + Flow(2, "action=accept dir=from") +
    Flow(4, "action=punt") + "action=drop sport=9\n" + Flow(5, "action=pooltag pool=gold bidir") +
    "action=accept dmac=02:00:00:00:00:00/ff:00:00:00:00:00\n";

// The staged and the in-place addition end in the same filter, byte for
// byte (table order, merges, mirrors, counters, header values, tags).
TEST_F(StagedAddTest, EndsWhereTheInPlaceAdditionEnds) {
  host::ResPools::Define("gold", 21);
  const Bytes undoBefore = rules::ParseRuleset(kUndoBefore);
  const Bytes undoNext = rules::ParseRuleset(kUndoNext);
  const struct {
    const char* name;
    Bytes before;  // empty: the filter has no table
    std::vector<Bytes> added;
  } cases[] = {
      {"merges, mirrors, tags, header", undoBefore, {undoNext}},
      {"onto a filter without rules", {}, {undoNext}},
      {"twice, then nothing", undoBefore,
       {undoNext, undoNext, rules::ParseRuleset("ruleset version=8\n")}},
      // Large enough for a classifier.
      {"many exact and general rules", Rules(0, 200, 40, "ruleset version=8"),
       {Rules(200, 300, 60, "ruleset version=8 features=0x1")}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    Bytes results[2];
    int64_t tags[2];
    for (int staged = 0; staged < 2; staged++) {
      Clear();
      ASSERT_TRUE(c.before.empty() || Apply(c.before) == ZEL_OK);
      for (FWRuleEntry* e : ExactEntries()) e->rule.pktCount = 7 + FWNet16(e->rule.ipSa + 2);
      for (const Bytes& a : c.added) {
        ASSERT_EQ(staged ? Add(a) : Apply(a, /*replace=*/false), ZEL_OK);
        ExpectIndexMatchesList();
      }
      results[staged] = Populate();
      tags[staged] = host::ResPools::Outstanding(21);
    }
    EXPECT_EQ(results[0], results[1]);
    EXPECT_EQ(tags[0], tags[1]);
  }
}

// Packets counted between the two holds land on the originals after their
// copies were made; the swap takes them over, as it does a GRE socket a
// packet opened meanwhile (owned by the copy from then on: one socket,
// closed once at teardown).
TEST_F(StagedAddTest, PacketsBetweenTheHoldsKeepTheirCountsAndSockets) {
  ASSERT_EQ(Apply(rules::ParseRuleset("ruleset version=8\n" + Flow(1) +
                                      Flow(2, "action=gre gre=192.0.2.9") +
                                      "action=accept proto=17 dport=3000\n")),
            ZEL_OK);
  Send({FlowFrame(1), FlowFrame(1, 3000)});
  BetweenHolds([&] { Send({FlowFrame(1), FlowFrame(1), FlowFrame(1, 3000), FlowFrame(2)}); });
  ASSERT_EQ(Add(Rules(10, 20, 5, "ruleset version=8")), ZEL_OK);
  EXPECT_FALSE(host::Log::Contains("Firewall rules changed while rules to add were built"));

  const FWRuleEntry* flow1 = FindExact(rules::ParseRule(Flow(1)));
  const FWRuleEntry* flow2 = FindExact(rules::ParseRule(Flow(2)));
  ASSERT_NE(flow1, nullptr);
  ASSERT_NE(flow2, nullptr);
  EXPECT_EQ(+flow1->rule.pktCount, 3u);
  EXPECT_EQ(+flow1->rule.byteCount, 3u * FlowFrame(1).size());
  EXPECT_EQ(+GeneralEntries()[0]->rule.pktCount, 2u);
  EXPECT_EQ(+flow2->rule.pktCount, 1u);
  EXPECT_EQ(flow2->greSocketOpen, 1);
  EXPECT_EQ(host::Sockets::Open(), 1u);
  DrainIssued(id_);
  DrainFaulted(id_);
}

// A writer between the holds: the stale build is thrown away and the
// addition staged again; if the rules change again, it is built under the
// exclusive hold. Either way the outcome is the writer's change followed
// by the addition, as the in-place road gives it.
TEST_F(StagedAddTest, AWriterBetweenTheHoldsIsNoticed) {
  const Bytes before = Rules(0, 8, 30, "ruleset version=8");
  const Bytes next = Rules(8, 16, 30, "ruleset version=8 features=0x2");
  const Bytes other = Rules(20, 24, 2, "ruleset version=7");
  const Bytes flow0 = rules::ParseRuleset("ruleset version=8\n" + Flow(0));
  struct Writer {
    const char* name;
    bool everyTime;  // else only between the first two holds
    std::function<void()> change;
  };
  const std::vector<Writer> writers = {
      {"remove a rule", false, [&] { RemoveByIoctl(flow0); }},
      {"replace", false, [&] { ASSERT_EQ(Apply(other), ZEL_OK); }},
      {"replace every time", true, [&] { ASSERT_EQ(Apply(other), ZEL_OK); }},
      {"add in place every time", true, [&] { ASSERT_EQ(Apply(other, false), ZEL_OK); }},
      {"clear every time", true, [&] { Clear(); }},
  };
  for (const Writer& w : writers) {
    SCOPED_TRACE(w.name);
    // The reference: the writer's change(s), then the in-place addition.
    ASSERT_EQ(Apply(before), ZEL_OK);
    w.change();
    if (w.everyTime) w.change();
    ASSERT_EQ(Apply(next, false), ZEL_OK);
    const Bytes want = Populate();

    ASSERT_EQ(Apply(before), ZEL_OK);
    host::Log::Clear();
    int calls = 0;
    BetweenHolds([&] {
      if (calls++ == 0 || w.everyTime) w.change();
    });
    ASSERT_EQ(Add(next), ZEL_OK);
    g_fwAddBetweenHolds = nullptr;
    EXPECT_EQ(calls, 2);  // the stale staging and the next one
    EXPECT_EQ(host::Log::Count("Firewall rules changed while rules to add were built"),
              w.everyTime ? 2u : 1u);
    EXPECT_EQ(Populate(), want);
    ExpectIndexMatchesList();
  }
}

// A push by the ioctl between the holds makes an addition by another road
// ignored: nothing staged stays behind.
TEST_F(StagedAddTest, IgnoredWhenAnIoctlPushCameInBetween) {
  BetweenHolds([&] {
    Bytes rs = rules::ParseRuleset("ruleset version=8\n" + Flow(1));
    ASSERT_EQ(FWSetIoctlRuleset(filter_, reinterpret_cast<FWRuleset*>(rs.data()), 1), ZEL_OK);
  });
  ASSERT_EQ(Add(Rules(0, 4, 4, "ruleset version=8"), /*fromIoctl=*/false), ZEL_OK);
  EXPECT_EQ(ExactEntries().size(), 1u);
  EXPECT_TRUE(GeneralEntries().empty());
}

// Additions on one thread, another writer (replace, remove, add in place)
// on a second, packets on a third; then additions with packets alone,
// where no counted packet may be lost: the one packet thread counts
// everything it sends, so flow 0's counter must grow by exactly that.
TEST_F(StagedAddTest, AdditionsRaceAnotherWriterAndPackets) {
  constexpr int kRounds = 60;
  const Bytes base = Rules(0, 16, 30, "ruleset version=8");
  ASSERT_EQ(Apply(base), ZEL_OK);
  std::atomic<bool> stop{false};
  std::atomic<uint64_t> sent{0};
  auto sendUntilStopped = [&] {
    const std::vector<Bytes> frames = {FlowFrame(0), FlowFrame(3), FlowFrame(0, 3000)};
    while (!stop.load()) {
      EXPECT_EQ(Deliver(id_, frames, 1), ZEL_OK);
      sent.fetch_add(1);
    }
  };

  std::thread packets(sendUntilStopped);
  std::thread writer([&] {
    const Bytes flows = rules::ParseRuleset("ruleset version=8\n" + Flow(5) + Flow(6));
    const Bytes more = rules::ParseRuleset("ruleset version=8\n" + Flow(5));
    for (int i = 0; i < kRounds; i++) {
      Bytes copy(base);
      if (i % 3 == 0) {
        EXPECT_EQ(FWReplaceRuleset(filter_, reinterpret_cast<FWRuleset*>(copy.data()), 1), ZEL_OK);
      } else if (i % 3 == 1) {
        RemoveByIoctl(flows);
      } else {
        EXPECT_EQ(Apply(more, /*replace=*/false), ZEL_OK);
      }
    }
  });
  for (int i = 0; i < kRounds; i++) {
    ASSERT_EQ(Add(Rules(100 + i % 50, 101 + i % 50, 2, "ruleset version=8")), ZEL_OK);
  }
  writer.join();
  stop.store(true);
  packets.join();
  ExpectIndexMatchesList();

  // Flow 0 is in every ruleset here and never removed.
  const FWRuleEntry* flow0 = FindExact(rules::ParseRule(Flow(0)));
  ASSERT_NE(flow0, nullptr);
  const uint64_t before = flow0->rule.pktCount;
  stop.store(false);
  sent.store(0);
  packets = std::thread(sendUntilStopped);
  while (sent.load() == 0) std::this_thread::yield();
  for (int i = 0; i < 20 || sent.load() < 50; i++) {
    ASSERT_EQ(Add(Rules(60 + i % 100, 61 + i % 100, 1, "ruleset version=8")), ZEL_OK);
  }
  stop.store(true);
  packets.join();
  flow0 = FindExact(rules::ParseRule(Flow(0)));
  ASSERT_NE(flow0, nullptr);
  EXPECT_EQ(flow0->rule.pktCount - before, sent.load())
      << "packets counted while rules were added were lost";
}

}  // namespace
