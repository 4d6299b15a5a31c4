// A whole migration between two hosts: source filters carry exact and general
// rules of both versions, counters advanced by real traffic and an attached
// slow path with state of its own; the saved buffer is all that crosses to a
// freshly started destination host. The destination must treat every packet
// of the capture as the source did, count on from the source's counters and
// hand the slow path its state byte for byte.
#include <gtest/gtest.h>

#include <map>

#include "tests/support/migration_support.h"
#include "tools/lib/frames.h"

namespace {

using namespace migsupport;

// Added to SampleRules(7) on the first filter: one more exact rule and two
// general ones, in version 8.
Bytes Version8Rules() {
  return rules::RulesetBuilder(8)
      .Features(FW_FEATURE_DROP_DHCP_SERVER)
      .Add(ExactRule("copy", "tcp", "10.0.0.1", 2000, "10.0.0.4", 443))
      .Add("action=drop ipv4 ethtype=0x0800 proto=udp da=10.2.0.0-10.2.255.255")
      .Add("action=drop ipv4 ethtype=0x0800 proto=udp da=!10.0.0.0-10.255.255.255")
      .Bytes();
}

// Frames that hit every rule, in both directions, and frames that hit none.
std::vector<frames::CaptureRecord> Capture() {
  auto ip = [](uint32_t direction, const char* sa, const char* da) {
    const auto vm = frames::Mac(kVmMac), gw = frames::Mac(kGwMac);
    frames::FrameBuilder b;
    b.Eth(direction == 2 ? gw : vm, direction == 2 ? vm : gw)
        .Ipv4(frames::Ip4(sa), frames::Ip4(da));
    return b;
  };
  return {{2, ip(2, "10.0.0.1", "10.0.0.2").Tcp(1000, 80).Payload(40).Build()},
          {1, ip(1, "10.9.0.1", "10.0.0.1").Udp(5, 6).Build()},
          {2, ip(2, "10.0.0.1", "10.9.0.7").Udp(3333, 22).Payload(10).Build()},
          {2, ip(2, "10.0.0.1", "10.0.0.4").Tcp(2000, 443).Payload(120).Build()},
          {2, ip(2, "10.0.0.1", "192.168.1.1").Udp(7, 7).Build()},
          {2, ip(2, "10.0.0.1", "10.2.3.4").Udp(9, 9).Build()},
          {2, ip(2, "10.0.0.1", "10.0.0.9").Udp(67, 68).Payload(300).Build()}};
}

// {pktCount, byteCount} of every rule, keyed by its record without them (so
// that the exact rules' hash order does not matter), and the ruleset header.
std::map<Bytes, std::pair<uint64_t, uint64_t>> Counters(const Bytes& ruleset) {
  std::map<Bytes, std::pair<uint64_t, uint64_t>> out = {
      {Bytes(ruleset.begin(), ruleset.begin() + 15), {}}};
  const size_t size = ruleset[0] == FW_RULESET_VERSION_7 ? FW_RULE_SIZE_V7 : FW_RULE_SIZE_V8;
  for (size_t at = FW_RULESET_HEADER_SIZE; at < ruleset.size(); at += size) {
    Bytes rec(ruleset.begin() + at, ruleset.begin() + at + size);
    uint64_t counts[2];
    std::memcpy(counts, rec.data() + 63, sizeof(counts));
    std::fill(rec.begin() + 63, rec.begin() + 79, 0);
    out[rec] = {counts[0], counts[1]};
  }
  return out;
}

// What became of one packet: the frames passed on (after processing), and
// how many went to the slow path and back toward the switch.
using Verdict = std::tuple<std::vector<Bytes>, size_t, size_t>;

using MigrationEndToEndTest = MigrationTest;

TEST_F(MigrationEndToEndTest, DestinationContinuesWhereTheSourceStopped) {
  // The first filter adds version-8 rules to version-7 ones.
  struct Vm {
    std::string name;
    std::vector<Bytes> rulesets;
    Bytes slowState;
    host::FilterId id = 0;
    Bytes saved{}, rulesAtSave{};
    std::vector<Verdict> verdicts{};
  };
  // Each packet alone, so that its verdict can be told apart.
  auto run = [&](host::FilterId id) {
    std::vector<Verdict> verdicts;
    for (const frames::CaptureRecord& rec : Capture()) {
      std::vector<Bytes> passed;
      EXPECT_EQ(Deliver(id, {rec.frame}, rec.direction, &passed), ZEL_OK);
      verdicts.emplace_back(passed, DrainFaulted(id), DrainIssued(id));
    }
    return verdicts;
  };
  Vm vms[] = {{"vm1-nic0", {SampleRules(7), Version8Rules()}, Pattern(1000, 3)},
              {"vm2-nic0", {SampleRules(7)}, Pattern(1517, 5)}};
  for (Vm& vm : vms) {
    vm.id = NewFilter(vm.name);
    for (size_t r = 0; r < vm.rulesets.size(); r++) {
      ASSERT_EQ(Install(Filter(vm.id), vm.rulesets[r], r == 0), ZEL_OK);
    }
  }
  AttachSlowPath(3);
  for (Vm& vm : vms) {
    vm.verdicts = run(vm.id);
    SetPolicy(host::RequestKind::RetrieveState, host::ReplyMode::OtherThread, vm.slowState);
    SLCGenericPrefetchSavedState(Filter(vm.id));
    host::Sluice::WaitReplies();
    vm.rulesAtSave = Rules(Filter(vm.id));
    vm.saved = Save(Filter(vm.id));
  }

  // A new host: the source module is gone with everything it held.
  Unload();
  for (const std::string& what : host::Leftovers()) ADD_FAILURE() << "source left " << what;
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  Load();
  for (Vm& vm : vms) vm.id = NewFilter(vm.name);
  AttachSlowPath(5);
  SetPolicy(host::RequestKind::RestoreState, host::ReplyMode::Inline);
  for (size_t i = 0; i < std::size(vms); i++) {
    SCOPED_TRACE(vms[i].name);
    SLCGenericFilter* f = Filter(vms[i].id);
    ASSERT_EQ(SLCGenericRestoreState(f, vms[i].saved.data(), vms[i].saved.size()), ZEL_OK);
    const auto requests = host::Sluice::Requests(host::RequestKind::RestoreState);
    ASSERT_EQ(requests.size(), i + 1);
    EXPECT_EQ(requests[i].filter, vms[i].id);
    EXPECT_EQ(requests[i].data, vms[i].slowState);

    const auto before = Counters(vms[i].rulesAtSave);
    EXPECT_EQ(Counters(Rules(f)), before) << rules::FormatRuleset(Rules(f));
    EXPECT_EQ(run(vms[i].id), vms[i].verdicts);
    // One more pass of the same capture doubles every count.
    auto doubled = before;
    for (auto& [rule, counts] : doubled) counts = {2 * counts.first, 2 * counts.second};
    EXPECT_NE(doubled, before);
    EXPECT_EQ(Counters(Rules(f)), doubled);
  }
}

}  // namespace
