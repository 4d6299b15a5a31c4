// A whole migration between two hosts: the source filter carries rules of
// both versions, counters advanced by real traffic and an attached slow path
// with state of its own; the saved buffer is all that crosses to a freshly
// started destination host. The destination must then treat every packet of
// the capture as the source did, count on from the source's counters and
// hand the slow path its state byte for byte.
#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <string>

#include "migration/migration.h"
#include "tests/support/migration_support.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using migsupport::Bytes;

using migsupport::ExactRule;
using migsupport::kGwMac;
using migsupport::kVmMac;

// Filter A gets a version-7 ruleset and then, added to it, a version-8 one;
// filter B keeps a version-7 ruleset (saved with a zero tail).
Bytes Version7Rules() {
  return rules::RulesetBuilder(7)
      .Features(FW_FEATURE_DROP_DHCP_SERVER)
      .Add(ExactRule("accept", "tcp", "10.0.0.1", 1000, "10.0.0.2", 80))
      .Add(std::string("action=accept dir=from ipv4 dmac=") + kVmMac + " smac=" + kGwMac +
           " ethtype=0x0800 vlan=none proto=tcp sa=10.0.0.2 da=10.0.0.1 sport=80 dport=1000")
      .Add(ExactRule("drop", "udp", "10.0.0.1", 5000, "10.0.0.3", 53))
      .Add("action=punt ipv4 ethtype=0x0800 proto=tcp da=10.1.0.0-10.1.0.255")
      .Bytes();
}

Bytes Version8Rules() {
  return rules::RulesetBuilder(8)
      .Features(FW_FEATURE_DROP_DHCP_SERVER)
      .Add(ExactRule("copy", "tcp", "10.0.0.1", 2000, "10.0.0.4", 443))
      .Add("action=drop ipv4 ethtype=0x0800 proto=udp da=10.2.0.0-10.2.255.255")
      .Add("action=drop ipv4 ethtype=0x0800 proto=udp da=!10.0.0.0-10.255.255.255")
      .Bytes();
}

// The capture both hosts see: frames that hit every rule, in both
// directions, and frames that hit none.
std::vector<frames::CaptureRecord> Capture() {
  using frames::FrameBuilder;
  using frames::Ip4;
  using frames::Mac;
  const auto vm = Mac(kVmMac);
  const auto gw = Mac(kGwMac);
  auto out = [&](const char* sa, const char* da) {
    return FrameBuilder().Eth(gw, vm).Ipv4(Ip4(sa), Ip4(da));
  };
  auto in = [&](const char* sa, const char* da) {
    return FrameBuilder().Eth(vm, gw).Ipv4(Ip4(sa), Ip4(da));
  };
  std::vector<frames::CaptureRecord> records = {
      {2, out("10.0.0.1", "10.0.0.2").Tcp(1000, 80).Payload(40).Build()},
      {1, in("10.0.0.2", "10.0.0.1").Tcp(80, 1000).Payload(900).Build()},
      {2, out("10.0.0.1", "10.0.0.3").Udp(5000, 53).Payload(30).Build()},
      {2, out("10.0.0.1", "10.1.0.7").Tcp(3333, 22).Payload(10).Build()},
      {1, in("10.1.0.9", "10.0.0.1").Tcp(22, 3333).Payload(10).Build()},
      {2, out("10.0.0.1", "10.0.0.4").Tcp(2000, 443).Payload(120).Build()},
      {2, out("10.0.0.1", "192.168.1.1").Udp(7, 7).Payload(64).Build()},
      {2, out("10.0.0.1", "10.2.3.4").Udp(9, 9).Payload(16).Build()},
      {2, out("10.0.0.1", "10.0.0.9").Udp(67, 68).Payload(300).Build()},
      {1, FrameBuilder().Eth(vm, gw).Arp(1, gw, Ip4("10.0.0.254"), vm, Ip4("10.0.0.1")).Build()},
      {2, FrameBuilder()
              .Eth(gw, vm)
              .Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::2"))
              .Tcp(1, 2)
              .Build()},
  };
  // Through the capture format and back, as a recorded capture would come.
  std::vector<frames::CaptureRecord> decoded;
  std::string error;
  EXPECT_TRUE(frames::DecodeCapture(frames::EncodeCapture(records), &decoded, &error)) << error;
  return decoded;
}

// What became of one packet: passed on (with its bytes after processing),
// handed to the slow path, sent back toward the switch.
struct Verdict {
  std::vector<Bytes> passed;
  std::vector<Bytes> faulted;
  std::vector<Bytes> issued;
  bool operator==(const Verdict&) const = default;
};

std::ostream& operator<<(std::ostream& os, const Verdict& v) {
  return os << "{passed " << v.passed.size() << ", faulted " << v.faulted.size() << ", issued "
            << v.issued.size() << "}";
}

// The filter's rules in a form that does not depend on hash iteration order:
// the header, the exact records sorted, the general records in order.
struct RulesView {
  Bytes header;
  std::vector<Bytes> exact;
  std::vector<Bytes> general;
  bool operator==(const RulesView&) const = default;
};

RulesView View(const Bytes& ruleset) {
  RulesView v;
  v.header.assign(ruleset.begin(), ruleset.begin() + 15);
  for (Bytes& rec : migsupport::Records(ruleset)) {
    const bool general = (migsupport::GetU32(rec, 4) & FW_GENERAL_RULE_MASK) != 0;
    (general ? v.general : v.exact).push_back(std::move(rec));
  }
  std::sort(v.exact.begin(), v.exact.end());
  return v;
}

// pktCount/byteCount of every record, keyed by the record without them.
std::map<Bytes, std::pair<uint64_t, uint64_t>> Counters(const Bytes& ruleset) {
  std::map<Bytes, std::pair<uint64_t, uint64_t>> out;
  for (Bytes& rec : migsupport::Records(ruleset)) {
    const auto counts = std::make_pair(migsupport::GetU64(rec, 63), migsupport::GetU64(rec, 71));
    std::fill(rec.begin() + 63, rec.begin() + 79, 0);
    out[rec] = counts;
  }
  return out;
}

class MigrationEndToEndTest : public testsupport::ModuleTest {
 protected:
  struct Vm {
    std::string name;
    std::vector<Bytes> rulesets;  // applied in order, the first replacing
    Bytes slowPathState;
    host::FilterId id = 0;
    Bytes saved;  // what crossed to the destination
    Bytes rulesAtSave;
    std::vector<Verdict> verdicts;  // on the source
  };

  host::FilterId NewFilter(const std::string& name) {
    host::FilterConfig config;
    config.name = name;
    config.vmUUID = "4c4c4544-0042-3510-8051-b7c04f" + name;
    return CreateFilter(testsupport::kDefaultAgent, config);
  }

  void AttachSlowPath(uint32_t slowPathId, const std::vector<host::FilterId>& filters) {
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, slowPathId), ZEL_OK);
    host::Timers::RunDue();
    for (host::FilterId id : filters) ASSERT_EQ(host::Sluice::SlowPathOf(id), slowPathId);
  }

  // Each packet alone, so that its verdict can be told apart.
  std::vector<Verdict> Run(host::FilterId id, const std::vector<frames::CaptureRecord>& capture) {
    std::vector<Verdict> verdicts;
    for (const frames::CaptureRecord& rec : capture) {
      Verdict v;
      EXPECT_EQ(Deliver(id, {rec.frame}, rec.direction, &v.passed), ZEL_OK);
      for (auto* list : {&v.faulted, &v.issued}) {
        std::vector<host::Delivery> d =
            list == &v.faulted ? host::Sluice::TakeFaulted(id) : host::Sluice::TakeIssued(id);
        for (const host::Delivery& delivery : d) {
          for (ZelPkt* pkt : delivery.packets) list->push_back(host::Packets::Frame(pkt));
        }
        testsupport::ReleaseDeliveries(&d);
      }
      verdicts.push_back(std::move(v));
    }
    return verdicts;
  }

  // A new host: the source module is gone with everything it held.
  void MoveToNewHost() {
    Unload();
    for (const std::string& what : host::Leftovers()) ADD_FAILURE() << "source left " << what;
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    Load();
  }
};

TEST_F(MigrationEndToEndTest, DestinationContinuesWhereTheSourceStopped) {
  const std::vector<frames::CaptureRecord> capture = Capture();
  ASSERT_EQ(capture.size(), 11u);

  std::vector<Vm> vms(2);
  vms[0].name = "vm1-nic0";
  vms[0].rulesets = {Version7Rules(), Version8Rules()};
  vms[1].name = "vm2-nic0";
  vms[1].rulesets = {Version7Rules()};
  for (size_t i = 0; i < vms.size(); i++) {
    vms[i].slowPathState.resize(1000 + 517 * i);
    for (size_t k = 0; k < vms[i].slowPathState.size(); k++) {
      vms[i].slowPathState[k] = static_cast<uint8_t>(k * 31 + i);
    }
  }

  // --- source host ---
  for (Vm& vm : vms) {
    vm.id = NewFilter(vm.name);
    for (size_t r = 0; r < vm.rulesets.size(); r++) {
      ASSERT_EQ(migsupport::Install(Filter(vm.id), vm.rulesets[r], r == 0 ? 1 : 0), ZEL_OK);
    }
  }
  AttachSlowPath(3, {vms[0].id, vms[1].id});
  for (Vm& vm : vms) vm.verdicts = Run(vm.id, capture);

  // The capture exercises more than one outcome.
  size_t dropped = 0, faulted = 0, passed = 0;
  for (const Verdict& v : vms[0].verdicts) {
    dropped += v.passed.empty() && v.faulted.empty() && v.issued.empty();
    faulted += !v.faulted.empty();
    passed += !v.passed.empty();
  }
  EXPECT_GT(dropped, 0u);
  EXPECT_GT(faulted, 0u);
  EXPECT_GT(passed, 0u);

  for (Vm& vm : vms) {
    host::RequestPolicy retrieve;
    retrieve.mode = host::ReplyMode::OtherThread;
    retrieve.replyData = vm.slowPathState;
    host::Sluice::SetPolicy(host::RequestKind::RetrieveState, retrieve);

    SLCGenericFilter* f = Filter(vm.id);
    SLCGenericPrefetchSavedState(f);
    host::Sluice::WaitReplies();
    vm.rulesAtSave = migsupport::Rules(f);
    migsupport::SaveResult r = migsupport::Save(f);
    ASSERT_EQ(r.lenStatus, ZEL_OK);
    ASSERT_EQ(r.saveStatus, ZEL_OK);
    vm.saved = r.bytes;
    EXPECT_EQ(migsupport::GetU64(vm.saved, migsupport::kSlowLengthAt), vm.slowPathState.size());
  }
  // Filter B: 259-byte records in a part sized for 281-byte ones.
  const uint64_t fastB = migsupport::GetU64(vms[1].saved, migsupport::kFastLengthAt);
  const size_t rulesB = vms[1].rulesAtSave.size();
  EXPECT_EQ(fastB, 15 + 281 * ((rulesB - 15) / 259));
  EXPECT_EQ(Bytes(vms[1].saved.begin() + 48 + rulesB, vms[1].saved.begin() + 48 + fastB),
            Bytes(fastB - rulesB, 0));

  // --- destination host ---
  MoveToNewHost();
  for (Vm& vm : vms) vm.id = NewFilter(vm.name);
  AttachSlowPath(5, {vms[0].id, vms[1].id});
  host::Sluice::SetPolicy(host::RequestKind::RestoreState, {});  // inline, success

  for (size_t i = 0; i < vms.size(); i++) {
    Vm& vm = vms[i];
    SCOPED_TRACE(vm.name);
    SLCGenericFilter* f = Filter(vm.id);
    ASSERT_EQ(SLCGenericRestoreState(f, vm.saved.data(), vm.saved.size()), ZEL_OK);
    EXPECT_EQ(migsupport::MigrationState(f), SLCGenericStateIdle);

    const auto requests = host::Sluice::Requests(host::RequestKind::RestoreState);
    ASSERT_EQ(requests.size(), i + 1);
    EXPECT_EQ(requests[i].filter, vm.id);
    EXPECT_EQ(requests[i].data, vm.slowPathState);

    const Bytes restored = migsupport::Rules(f);
    EXPECT_TRUE(View(restored) == View(vm.rulesAtSave))
        << rules::FormatRuleset(restored) << "\n---- source:\n"
        << rules::FormatRuleset(vm.rulesAtSave);

    const std::vector<Verdict> verdicts = Run(vm.id, capture);
    ASSERT_EQ(verdicts.size(), capture.size());
    for (size_t p = 0; p < capture.size(); p++) {
      EXPECT_EQ(verdicts[p], vm.verdicts[p]) << "packet " << p;
    }

    // One more pass of the same capture doubles every count.
    const auto before = Counters(vm.rulesAtSave);
    const auto after = Counters(migsupport::Rules(f));
    ASSERT_EQ(after.size(), before.size());
    uint64_t counted = 0;
    for (const auto& [rule, counts] : before) {
      ASSERT_EQ(after.count(rule), 1u);
      EXPECT_EQ(after.at(rule).first, 2 * counts.first);
      EXPECT_EQ(after.at(rule).second, 2 * counts.second);
      counted += counts.first;
    }
    EXPECT_GT(counted, 0u);
  }
}

}  // namespace
