// Every control channel at once, on several threads, while packets flow
// through the same filters.
//
// Each ruleset used here is uniform: all its rules carry one action (drop
// or accept), and an exact rule for flow F sits beside a catch-all general
// rule. A packet list holding one F packet and one other packet is walked
// under one hold of configLock, so both packets must share a verdict; a
// ruleset seen half replaced would split them. Every ruleset read back
// (state query, property read, device get) must likewise be uniform. Only
// exact rules are ever removed singly, which keeps F's verdict unchanged.
//
// Bounded and seeded; run it under TSan (-DSLUICE_SANITIZE=thread) for
// races and under the host's lock-rank checks for ordering.
#include <atomic>
#include <mutex>
#include <random>
#include <string>
#include <thread>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/frames.h"

#if defined(__SANITIZE_THREAD__)
// Rule counters are plain 64-bit adds made under the shared hold of
// configLock (a lost increment is accepted), so exporting a ruleset, which
// copies the counters under the same shared hold, formally races with the
// packet walk that adds to them. Only reports whose access sits directly in
// the walk's own body (where the adds are) are silenced; the lookup, the
// apply and clear steps and every control channel stay checked.
extern "C" const char* __tsan_default_suppressions() { return "race_top:FWWalkList\n"; }
#endif

namespace {

using controltest::Bytes;
using controltest::Clear;
using controltest::GetU32;
using controltest::Push;
using controltest::Ruleset;
using host::QryValue;

const std::string kAgent = testsupport::kDefaultAgent;
const std::string kExactF =
    " dir=both ipv4 dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 vlan=none "
    "proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80";

constexpr int kControlIterations = 1500;
constexpr int kMaxPacketLists = 20000;

Bytes Uniform(const char* action, uint8_t version) {
  std::string a = std::string("action=") + action;
  return Ruleset({a + kExactF, a + " dir=both proto=tcp dport=22", a + " dir=both"}, version);
}

Bytes ExactF() { return Ruleset({"action=drop" + kExactF}); }

class ConcurrencyTest : public testsupport::ModuleTest {
 protected:
  void Fail(const std::string& what) {
    std::lock_guard<std::mutex> g(mu_);
    if (failures_.size() < 20) failures_.push_back(what);
  }

  // True when every rule of a serialised ruleset carries the same action.
  bool IsUniform(const uint8_t* ruleset, size_t len) {
    if (len < 15) return false;
    uint32_t n;
    std::memcpy(&n, ruleset + 3, 4);
    const size_t size = ruleset[0] == 7 ? 259 : 281;
    if (len < 15 + n * size) return false;
    for (uint32_t i = 1; i < n; ++i) {
      if (std::memcmp(ruleset + 15, ruleset + 15 + i * size, 4) != 0) return false;
    }
    return true;
  }

  Bytes RulesetFor(std::mt19937& rng) {
    return Uniform(rng() % 2 ? "drop" : "accept", rng() % 3 == 0 ? 7 : 8);
  }

  void IoctlThread(int seed) {
    std::mt19937 rng(seed);
    for (int i = 0; i < kControlIterations; ++i) {
      host::FilterId id = filters_[rng() % 2];
      switch (rng() % 6) {
        case 0:
        case 1:
          host::Sluice::SendIoctl(id, 1, Push(RulesetFor(rng)));
          break;
        case 2:
          host::Sluice::SendIoctl(id, 2, Clear(FWClearMethodRemove, ExactF()));
          break;
        case 3:
          host::Sluice::SendIoctl(id, 3, Clear(FWClearMethodStats, ExactF()));
          break;
        case 4:
          host::Sluice::SendIoctl(id, 4, Clear(rng() % 4 == 0 ? FWClearMethodAll : 1, ExactF()));
          break;
        default:
          host::Sluice::SendIoctl(id, 5, controltest::GetState());
          break;
      }
      for (const host::IoctlReplyRecord& r : host::Sluice::TakeIoctlReplies(id)) {
        if (GetU32(r.message, 0) != FWIoctlMsgRuleset) continue;
        if (!IsUniform(r.message.data() + 8, r.message.size() - 8)) Fail("torn state reply");
      }
    }
  }

  void PropertyThread(int seed) {
    std::mt19937 rng(seed);
    const std::string prop = kAgent + ".ruleset";
    for (int i = 0; i < kControlIterations; ++i) {
      host::FilterId id = filters_[rng() % 2];
      if (rng() % 2) {
        Bytes data = RulesetFor(rng);
        if (host::Sluice::PropertyWrite(prop, id, data) != ZEL_OK) Fail("property write");
      } else {
        // Poll and read are separate calls, so a write in between may grow
        // the ruleset past the polled size; the read gets room for the
        // largest ruleset used here (3 rules of 281 bytes) instead.
        const ZelSluicePropOps* ops = host::Sluice::PropertyOps(prop);
        uint32_t polled = 0;
        if (!ops->poll(Filter(id), nullptr, &polled) || polled > 15 + 3 * 281) Fail("property poll");
        Bytes out(15 + 3 * 281 + 64, 0);
        if (ops->read(Filter(id), nullptr, out.data()) != ZEL_OK) {
          Fail("property read");
        } else if (!IsUniform(out.data(), out.size())) {
          Fail("torn property read");
        }
      }
    }
  }

  void DeviceThread(int seed) {
    std::mt19937 rng(seed);
    for (int i = 0; i < kControlIterations; ++i) {
      const int which = static_cast<int>(rng() % 2);
      const char* name = which == 0 ? "vnic0" : "vnic1";
      const uint32_t op = rng() % 3;
      const uint32_t type = op == 0   ? FWCharDevReqSetRuleset
                            : op == 1 ? FWCharDevReqGetRuleset
                                      : FWCharDevReqSendIoctl;
      // The request, then room for 8 version-8 rules: a set ruleset padded
      // to 281 bytes per rule, or the space a get writes into.
      Bytes req(sizeof(FWCharDevRequest) + 15 + 8 * 281, 0);
      std::memcpy(req.data(), &type, sizeof(type));
      std::memcpy(req.data() + offsetof(FWCharDevRequest, filterName), name, 5);
      if (type == FWCharDevReqSetRuleset) {
        Bytes rs = RulesetFor(rng);
        std::memcpy(req.data() + sizeof(FWCharDevRequest), rs.data(), rs.size());
      }
      uint64_t addr = host::UserMemory::Map(req);
      int32_t result = 0;
      ZelStatus s = host::CharDevs::Ioctl(kAgent, 0, addr, &result);
      if (s != ZEL_OK) Fail("device request " + std::to_string(type));
      if (type == FWCharDevReqGetRuleset && s == ZEL_OK) {
        Bytes out = host::UserMemory::Read(addr, req.size());
        if (!IsUniform(out.data(), out.size())) Fail("torn device get");
      }
      host::UserMemory::Unmap(addr);
    }
  }

  // Agents are created by one thread only: appends to agentList are
  // published for lock-free readers but not serialised among writers.
  void StatusThread(int seed, bool createAgents) {
    std::mt19937 rng(seed);
    int created = 0;
    for (int i = 0; i < kControlIterations; ++i) {
      std::vector<QryValue> out;
      Bytes bytes;
      const std::string filter = rng() % 2 ? "vnic0-0" : "vnic1-1";
      switch (rng() % 6) {
        case 0:
          if (host::StatusTree::List({"agents"}, &out) != ZEL_OK || out.empty()) Fail("agents");
          break;
        case 1:
          if (host::StatusTree::List({"agents", kAgent, "filters"}, &out) != ZEL_OK ||
              out.size() != 2) {
            Fail("filters");
          }
          break;
        case 2:
          if (host::StatusTree::Get({"agents", kAgent, "filters", filter, "ruleSetSummary"},
                                    &bytes) != ZEL_OK) {
            Fail("ruleset summary");
          }
          break;
        case 3:
          if (host::StatusTree::List({"agents", kAgent, "filters", filter, "rules"}, &out) !=
              ZEL_OK) {
            Fail("rules");
          }
          break;
        case 4: {
          ZelStatus s = host::StatusTree::Get({"agents", kAgent, "filters", filter, "rules",
                                               int64_t(rng() % 4), "ruleSummary"},
                                              &bytes);
          if (s != ZEL_OK && s != ZEL_NOT_FOUND) Fail("rule summary");
          break;
        }
        default:
          if (createAgents && created < 3) {
            std::string text = "extra" + std::to_string(seed) + "-" + std::to_string(created++);
            if (host::StatusTree::Set({"createAgent"}, {QryValue(text)}) != ZEL_OK) {
              Fail("createAgent");
            }
          }
          break;
      }
      if (host::Locks::HeldByThisThread() != 0) Fail("lock held after a status-tree call");
    }
  }

  // One packet thread per filter: counters are plain adds under the shared
  // lock, so two walks of one filter would race on them by design.
  void PacketThread(host::FilterId id) {
    const Bytes f = frames::FrameBuilder()
                        .Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"))
                        .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
                        .Tcp(1234, 80)
                        .Payload(8)
                        .Build();
    const Bytes g = frames::FrameBuilder()
                        .Eth(frames::Mac("02:00:00:00:00:04"), frames::Mac("02:00:00:00:00:03"))
                        .Ipv4(frames::Ip4("10.0.0.5"), frames::Ip4("10.0.0.6"))
                        .Udp(53, 53)
                        .Payload(8)
                        .Build();
    for (int i = 0; i < kMaxPacketLists && controlRunning_.load(); ++i) {
      std::vector<Bytes> passed;
      ZelStatus s = Deliver(id, {f, g}, i % 2 ? ZEL_SLUICE_DIR_TO_SWITCH : ZEL_SLUICE_DIR_FROM_SWITCH,
                            &passed);
      if (s != ZEL_OK) Fail("delivery status");
      if (passed.size() == 1) Fail("split verdict in one list");
      ++lists_;
    }
  }

  host::FilterId filters_[2] = {0, 0};
  std::atomic<bool> controlRunning_{true};
  std::atomic<uint64_t> lists_{0};
  std::mutex mu_;
  std::vector<std::string> failures_;
};

TEST_F(ConcurrencyTest, ControlChannelsAndPacketsTogether) {
  filters_[0] = CreateFilter(kAgent, "vnic0");
  filters_[1] = CreateFilter(kAgent, "vnic1");
  host::RequestPolicy policy;
  policy.replyData = {'o', 'k'};
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);

  std::thread packets0([this] { PacketThread(filters_[0]); });
  std::thread packets1([this] { PacketThread(filters_[1]); });
  std::vector<std::thread> control;
  control.emplace_back([this] { IoctlThread(11); });
  control.emplace_back([this] { PropertyThread(22); });
  control.emplace_back([this] { DeviceThread(33); });
  control.emplace_back([this] { StatusThread(44, true); });
  control.emplace_back([this] { StatusThread(55, false); });
  for (std::thread& t : control) t.join();
  controlRunning_ = false;
  packets0.join();
  packets1.join();

  for (const std::string& f : failures_) ADD_FAILURE() << f;
  EXPECT_GT(lists_.load(), 0u);
  for (host::FilterId id : filters_) EXPECT_EQ(Filter(id)->refCount, 1u);
  std::vector<QryValue> agents;
  ASSERT_EQ(host::StatusTree::List({"agents"}, &agents), ZEL_OK);
  EXPECT_EQ(agents.size(), 1u + 3);
  for (host::FilterId id : filters_) EXPECT_EQ(host::Sluice::DestroyFilter(id), ZEL_OK);
}

}  // namespace
