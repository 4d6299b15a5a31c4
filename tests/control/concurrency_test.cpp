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
#include <random>
#include <thread>

#include "tests/control/control_test_util.h"
#include "tools/lib/frames.h"


namespace {

using namespace controltest;
using host::StatusTree;

const std::string kExactF = " dir=both" + kFlowF + " dport=80";
constexpr int kControlIterations = 1500;
constexpr int kMaxPacketLists = 20000;

// A uniform ruleset: drop or accept, version 7 or 8.
Bytes Uniform(std::mt19937& rng) {
  const std::string a = rng() % 2 ? "action=drop" : "action=accept";
  return Ruleset({a + kExactF, a + " dir=both proto=tcp dport=22", a + " dir=both"},
                 rng() % 3 == 0 ? 7 : 8);
}

// True when every rule of the serialised ruleset at b[off] has one action.
bool IsUniform(const Bytes& b, size_t off = 0) {
  const size_t n = Get(b, off + 3), size = Get<uint8_t>(b, off) == 7 ? 259 : 281;
  if (b.size() < off + 15 + n * size) return false;
  for (size_t i = 1; i < n; ++i) {
    if (b[off + 15 + i * size] != b[off + 15]) return false;  // actions are below 256
  }
  return true;
}

using ConcurrencyTest = FilterTest;

TEST_F(ConcurrencyTest, ControlChannelsAndPacketsTogether) {
  const host::FilterId filters[2] = {id_, CreateFilter(kAgent, "vnic1")};
  host::RequestPolicy policy;
  policy.replyData = {'o', 'k'};
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);
  std::atomic<bool> controlRunning{true};
  std::atomic<uint64_t> lists{0};
  auto fail = [](const std::string& what) { ADD_FAILURE() << what; };  // thread-safe

  // Random operations on every control channel, each checked for its status,
  // a torn ruleset and a lock left held; each thread creates three agents.
  auto controlThread = [&](uint32_t seed) {
    std::mt19937 rng(seed);
    const Bytes exactF = Ruleset({"action=drop" + kExactF});
    const uint32_t methods[] = {FWClearMethodRemove, FWClearMethodStats, FWClearMethodAll, 7};
    uint32_t types[] = {FWCharDevReqSetRuleset, FWCharDevReqGetRuleset, FWCharDevReqSendIoctl};
    for (int i = 0, created = 0; i < kControlIterations; ++i) {
      const int which = static_cast<int>(rng() % 2);
      const host::FilterId id = filters[which];
      StatusTree::Path path = {"agents", kAgent, "filters", which ? "vnic1-1" : "vnic0-0"};
      const Bytes rs = Uniform(rng);
      // Room for a device request and 8 rules (a set pads its ruleset to 281
      // bytes per rule), more than the largest property read needs.
      Bytes bytes(sizeof(FWCharDevRequest) + 15 + 8 * 281, 0);
      std::vector<host::QryValue> out;
      uint64_t addr = 0;
      int32_t result = 0;
      ZelStatus s = ZEL_OK;
      switch (rng() % 9) {
        case 0: s = PropWrite(rs, id); break;
        case 1: Ioctl(id, Push(rs)); break;
        case 2: Ioctl(id, Clear(methods[rng() % 4], exactF)); break;  // and an unknown method
        case 3:  // replies are taken per filter, so another thread's (a status) may come too
          for (const auto& r : Ioctl(id, GetState())) {
            if (r.message.size() > 8 && !IsUniform(r.message, 8)) fail("torn state reply");
          }
          break;
        case 4:  // a write may come between a poll and this read: room enough for any
          s = host::Sluice::PropertyOps(kProp)->read(Filter(id), nullptr, bytes.data());
          if (!IsUniform(bytes)) fail("torn property read");
          break;
        case 5:
          PutU32(&bytes, 0, types[rng() % 3]);
          std::copy_n(which ? "vnic1" : "vnic0", 5, &bytes[offsetof(FWCharDevRequest, filterName)]);
          std::copy(rs.begin(), rs.end(), &bytes[sizeof(FWCharDevRequest)]);
          s = host::CharDevs::Ioctl(kAgent, 0, addr = host::UserMemory::Map(bytes), &result);
          if (bytes[0] == FWCharDevReqGetRuleset && !IsUniform(host::UserMemory::Read(addr, 858))) {
            fail("torn device get");
          }
          host::UserMemory::Unmap(addr);
          break;
        case 6: path.push_back("ruleSetSummary"), s = StatusTree::Get(path, &bytes); break;
        case 7: path.push_back("rules"), s = StatusTree::List(path, &out); break;
        default:
          path.insert(path.end(), {"rules", int64_t(rng() % 4), "ruleSummary"});
          s = StatusTree::Get(path, &bytes);
          if (s == ZEL_NOT_FOUND) s = ZEL_OK;
          if (created < 3) {
            s = StatusTree::Set({"createAgent"}, {"x" + std::to_string(seed + created++)});
          }
      }
      if (s != ZEL_OK) fail("status " + std::to_string(s));
      if (host::Locks::HeldByThisThread() != 0) fail("lock held after a control call");
    }
  };

  // One packet thread per filter: counters are plain adds under the shared
  // lock, so two walks of one filter would race on them by design.
  auto packetThread = [&](host::FilterId id) {
    using frames::Ip4, frames::Mac;
    const Bytes f = frames::FrameBuilder().Eth(Mac("02:00:00:00:00:02"), Mac("02:00:00:00:00:01"))
                        .Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.2")).Tcp(1234, 80).Payload(8).Build();
    const Bytes g = frames::FrameBuilder().Eth(Mac("02:00:00:00:00:04"), Mac("02:00:00:00:00:03"))
                        .Ipv4(Ip4("10.0.0.5"), Ip4("10.0.0.6")).Udp(53, 53).Payload(8).Build();
    for (int i = 0; i < kMaxPacketLists && controlRunning.load(); ++i, ++lists) {
      std::vector<Bytes> passed;
      const uint32_t dir = i % 2 ? ZEL_SLUICE_DIR_TO_SWITCH : ZEL_SLUICE_DIR_FROM_SWITCH;
      if (Deliver(id, {f, g}, dir, &passed) != ZEL_OK) fail("delivery status");
      if (passed.size() == 1) fail("split verdict in one list");
    }
  };

  std::vector<std::thread> packets, control;
  for (host::FilterId id : filters) packets.emplace_back(packetThread, id);
  for (uint32_t seed : {11u, 22u, 33u, 44u}) control.emplace_back(controlThread, seed);
  for (std::thread& t : control) t.join();
  controlRunning = false;
  for (std::thread& t : packets) t.join();
  EXPECT_GT(lists.load(), 0u);
  EXPECT_EQ(std::pair(Filter(id_)->refCount, Filter(filters[1])->refCount), std::pair(1u, 1u));
  std::vector<host::QryValue> agents;
  ASSERT_EQ(StatusTree::List({"agents"}, &agents), ZEL_OK);
  EXPECT_EQ(agents.size(), 1u + 4 * 3);
}

}  // namespace
