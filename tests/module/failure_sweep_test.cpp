// Every failure point failed: a whole filter life (module load, agent and
// filter creation, a slow path, rulesets through the property, the filter
// ioctl and the device, traffic with every action, read-back, the status
// tree, save, restore into a second filter, teardown, unload) is run once
// per failure point the host records, with exactly that point failed (the
// first time it is reached).
//
// After each run nothing may be left: heap blocks, packets, sockets, pool
// tags, locks, framework objects, pending replies, references. Where the
// module promises to undo a failed operation (agent and filter creation,
// rulesets by any channel, restore), what a client can observe afterwards
// must be identical to before.
//
// A point first reached on an error path (a clean-up call after a failure)
// is failed in turn together with the point that led there. The sweep ends
// with a check that every point any run reached was failed by some run, so
// a new host call in module code cannot go untested, and with a check that
// every failable host call the module library imports was reached at all.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <iterator>
#include <set>

#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "migration/migration.h"
#include "module/module.h"
#include "tests/control/control_test_util.h"
#include "tests/support/migration_support.h"

namespace {

using Bytes = std::vector<uint8_t>;
using host::Faults;
using Point = Faults::Point;
using controltest::kAgent;
using controltest::kProp;
constexpr uint32_t kSlowPath = 7;

// What a client can see of the module: agents, each filter's rules read
// back with their counters, and what the module holds of the host.
struct Observed {
  std::vector<std::string> agents;
  std::vector<Bytes> rules;
  uint64_t heapBlocks = 0, heapBytes = 0, sockets = 0, packets = 0;
  int64_t poolTags = 0;
  bool operator==(const Observed&) const = default;
};

Observed Observe() {
  Observed o;
  o.agents = host::Sluice::Agents();
  for (const std::string& agent : o.agents) {
    for (host::FilterId id : host::Sluice::Filters(agent)) {
      o.rules.push_back(migsupport::Rules(static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(id))));
    }
  }
  const host::HeapStats heap = host::Heaps::Stats(slcGenericHeapID);
  o.heapBlocks = heap.blocks;
  o.heapBytes = heap.bytes;
  o.sockets = host::Sockets::Open();
  o.packets = host::Packets::Live();
  o.poolTags = host::ResPools::OutstandingTotal();
  return o;
}

// One filter life. Failures are expected anywhere; every step copes with
// the ones before it and reports (through gtest) only broken promises.
class Life {
 public:
  void Run() {
    if (host::Loader::Load(&slcGenericModuleImage) != 0) return;  // init undid itself
    host::ResPools::Define("gold", 7);
    for (auto kind : {host::RequestKind::SetSlowPath, host::RequestKind::RetrieveState,
                      host::RequestKind::RestoreState, host::RequestKind::IoctlRequest}) {
      host::RequestPolicy policy;
      if (kind == host::RequestKind::RetrieveState) policy.replyData = Bytes(64, 0x5a);
      host::Sluice::SetPolicy(kind, policy);
    }
    if (host::Sluice::AgentRegistered(kAgent)) Filters();
    Teardown();
  }

 private:
  // `op` returns true when it succeeded; on failure the observable state
  // must be what it was before.
  template <typename Op>
  void Undoable(const char* what, Op op) {
    const Observed before = Observe();
    if (!op()) {
      EXPECT_TRUE(Observe() == before) << what << " failed without undoing itself";
    }
  }

  void Filters() {
    Undoable("agent creation", [&] {
      return !host::ClientPorts::Registered(kSLCGenericCreateAgentPropName) ||
             host::ClientPorts::Write(kSLCGenericCreateAgentPropName,
                                      "sweep-b:default-action=ACTION_DROP") == ZEL_OK;
    });
    Undoable("agent creation through the status tree", [&] {
      return host::StatusTree::Set({"createAgent"}, {"sweep-c"}) == ZEL_OK;
    });
    const host::FilterConfig config{.name = "vnic0", .vmUUID = "vm-a", .parameters = {"p1"}};
    Undoable("filter creation", [&] { return host::Sluice::CreateFilter(kAgent, config, &a_) == ZEL_OK; });
    slowPath_ = host::Sluice::RegisterSlowPath(kAgent, kSlowPath) == ZEL_OK;
    host::Timers::RunDue();
    if (a_ == 0) return;
    Rulesets();
    Traffic();
    ReadBack();
    MoveToSecondFilter();
  }

  void Rulesets() {
    Undoable("property write", [&] {
      return !host::Sluice::PropertyRegistered(kProp) ||
             host::Sluice::PropertyWrite(kProp, a_, migsupport::EveryAction()) == ZEL_OK;
    });
    Undoable("ioctl ruleset", [&] {
      host::Sluice::SendIoctl(a_, 3, controltest::Msg(FWIoctlMsgRuleset, 0 /* add */,
                                                      migsupport::EveryAction(7)));
      return LastIoctlStatusOk();
    });
    Undoable("device ruleset", [&] {
      return Device(FWCharDevReqSetRuleset, migsupport::EveryAction(), nullptr);
    });
  }

  // Every frame twice: writable and fully mapped, then read-only with only
  // the Ethernet header mapped and a resource-pool tag (the actions must
  // copy before they write).
  void Traffic() {
    for (uint32_t dir = 1; dir <= 2; dir++) {
      host::PacketList list;
      for (const Bytes& f : migsupport::FramesForEveryAction()) {
        host::PacketSpec shared;
        shared.frame = f;
        shared.mappedLen = 14;
        shared.writable = false;
        shared.resPoolTag = 7;
        shared.priority = 3;
        host::PacketSpec readOnly;
        readOnly.frame = f;
        readOnly.writable = false;
        list.Append(host::Packets::Make(f));
        list.Append(host::Packets::Make(shared));
        list.Append(host::Packets::Make(readOnly));
      }
      (void)host::Sluice::Deliver(a_, list, dir);
    }
    host::PacketList fromSlowPath;
    fromSlowPath.Append(host::Packets::Make(migsupport::FramesForEveryAction()[0]));
    (void)host::Sluice::DeliverFromSlowPath(a_, fromSlowPath, 1);
    Drain(a_);
  }

  void ReadBack() {
    Bytes out;
    ZelStatus status;
    if (host::Sluice::PropertyRegistered(kProp)) {
      (void)host::Sluice::PropertyRead(kProp, a_, &out, &status);
    }
    host::Sluice::SendIoctl(a_, 4, Bytes{FWIoctlMsgGetState, 0, 0, 0});
    (void)host::Sluice::TakeIoctlReplies(a_);
    Bytes got;
    (void)Device(FWCharDevReqGetRuleset, Bytes(15 + 16 * 281), &got);
    (void)Device(FWCharDevReqSendIoctl, controltest::Msg(FWIoctlMsgEcho, 0), nullptr);
    host::Sluice::SendIoctl(a_, 5, Bytes{FWIoctlMsgEcho, 0, 0, 0, 'h', 'i'});
    host::Sluice::SendIoctl(a_, 6, controltest::Msg(FWIoctlMsgClear, FWClearMethodStats));
    (void)host::Sluice::TakeIoctlReplies(a_);
    StatusTree();
  }

  // Every level of the tree, down to one rule of each filter.
  static void StatusTree() {
    using host::StatusTree, host::QryValue;
    std::vector<QryValue> agents, filters, rules;
    Bytes leaf;
    (void)StatusTree::List({"agents"}, &agents);
    (void)StatusTree::Get({"agents", kAgent, "ruleSetSummary"}, &leaf);
    if (StatusTree::List({"agents", kAgent, "filters"}, &filters) != ZEL_OK) return;
    for (const QryValue& f : filters) {
      const StatusTree::Path at = {"agents", kAgent, "filters", f};
      (void)StatusTree::Get({at[0], at[1], at[2], at[3], "ruleSetSummary"}, &leaf);
      if (StatusTree::List({at[0], at[1], at[2], at[3], "rules"}, &rules) != ZEL_OK) continue;
      if (!rules.empty()) {
        (void)StatusTree::Get({at[0], at[1], at[2], at[3], "rules", rules[0], "ruleSummary"}, &leaf);
      }
    }
  }

  void MoveToSecondFilter() {
    SLCGenericFilter* fa = Priv(a_);
    SLCGenericPrefetchSavedState(fa);
    const Bytes state = migsupport::Save(fa);
    const host::FilterConfig config{.name = "vnic1", .vmUUID = "vm-b", .parameters = {}};
    Undoable("second filter creation",
             [&] { return host::Sluice::CreateFilter(kAgent, config, &b_) == ZEL_OK; });
    if (b_ == 0 || state.empty()) return;
    // The fast path part is installed before the slow path's part is sent:
    // a refused request for the latter leaves the former in force.
    const size_t savedRules = migsupport::Rules(fa).size();
    Undoable("restore", [&] {
      if (SLCGenericRestoreState(Priv(b_), state.data(), state.size()) == ZEL_OK) return true;
      if (host::Log::CountContaining("Couldn't request slow path state restore (0xbad0001)") == 0) {
        return false;
      }
      EXPECT_EQ(migsupport::Rules(Priv(b_)).size(), savedRules);
      return true;
    });
  }

  void Teardown() {
    if (!host::Loader::Loaded()) return;
    if (slowPath_) (void)host::Sluice::UnregisterSlowPath(kAgent, kSlowPath);
    for (host::FilterId id : {a_, b_}) {
      if (id == 0 || !host::Sluice::FilterAlive(id)) continue;
      Drain(id);
      EXPECT_EQ(migsupport::Of(Priv(id)), migsupport::kIdle) << "a reference or state left";
      EXPECT_EQ(host::Sluice::DestroyFilter(id), ZEL_OK);
    }
    host::Loader::Unload();
  }

  // False only when a status reply says the ruleset was refused: with the
  // reply itself failed, the outcome is unknown and nothing is checked.
  bool LastIoctlStatusOk() {
    bool ok = true;
    for (const host::IoctlReplyRecord& r : host::Sluice::TakeIoctlReplies(a_)) {
      uint32_t type = 0, status = 0;
      if (r.message.size() != 8) continue;
      std::memcpy(&type, r.message.data(), 4);
      std::memcpy(&status, r.message.data() + 4, 4);
      if (type == FWIoctlMsgStatus && status != FWIoctlStatusSuccess) ok = false;
    }
    return ok;
  }

  // A device request naming filter vnic0, followed by `body`.
  bool Device(uint32_t type, const Bytes& body, Bytes* out) {
    if (!host::CharDevs::Registered(kAgent)) return true;
    Bytes req(sizeof(FWCharDevRequest) + body.size());
    std::memcpy(req.data(), &type, 4);
    std::memcpy(req.data() + offsetof(FWCharDevRequest, filterName), "vnic0", 5);
    std::copy(body.begin(), body.end(), req.begin() + sizeof(FWCharDevRequest));
    const uint64_t addr = host::UserMemory::Map(req);
    int32_t result = 0;
    const ZelStatus s = host::CharDevs::Ioctl(kAgent, 0, addr, &result);
    if (out != nullptr) *out = host::UserMemory::Read(addr, req.size());
    host::UserMemory::Unmap(addr);
    return s == ZEL_OK && result == 0;
  }

  static void Drain(host::FilterId id) {
    for (auto* take : {&host::Sluice::TakeFaulted, &host::Sluice::TakeIssued}) {
      std::vector<host::Delivery> d = take(id);
      testsupport::ReleaseDeliveries(&d);
    }
  }

  static SLCGenericFilter* Priv(host::FilterId id) {
    return static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(id));
  }

  host::FilterId a_ = 0, b_ = 0;
  bool slowPath_ = false;
};

// Runs a life with `failed` armed; returns the points it reached. Fails the
// test if the run left anything behind.
std::vector<Point> LiveWith(const std::vector<Point>& failed, std::set<Point>* injected) {
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  Faults::StartRecording();
  for (const Point& p : failed) Faults::FailAt(p, ZEL_FAILURE);
  std::string label = "failed:";
  for (const Point& p : failed) label += " " + p.Describe();
  {
    SCOPED_TRACE(label);
    Life().Run();
    // A refused unregistration at unload can only be logged, with its
    // status; the host keeps what the module could not give back.
    bool unregisterFailed = false;
    for (const Point& p : Faults::InjectedPoints()) {
      if (p.call.find("Unregister") == std::string::npos) continue;
      unregisterFailed = true;
      size_t logged = 0;
      for (const host::LogRecord& r : host::Log::Records()) {
        logged += r.text.find("Failed to unregister") == 0 &&
                  r.text.find("(0xbad0001): ") != std::string::npos;
      }
      EXPECT_GT(logged, 0u) << p.Describe() << " failed without its status in the log";
    }
    for (const std::string& what : host::Leftovers()) {
      if (!unregisterFailed || what.find("still registered") == std::string::npos) {
        ADD_FAILURE() << "left behind: " << what;
      }
    }
    for (const host::LeakReport& leak : host::Heaps::Leaks()) ADD_FAILURE() << "leak: " << leak.what;
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  }
  for (const Point& p : Faults::InjectedPoints()) injected->insert(p);
  std::vector<Point> reached = Faults::Reached();
  host::Reset();
  return reached;
}

TEST(FailureSweep, EveryReachedPointFailedLeavesNothingAndUndoes) {
  std::set<Point> injected, reachedAll, queued;
  std::vector<std::vector<Point>> work;
  for (const Point& p : LiveWith({}, &injected)) {
    reachedAll.insert(p);
    queued.insert(p);
    work.push_back({p});
  }
  ASSERT_TRUE(injected.empty());
  ASSERT_GT(work.size(), 40u) << "the life reaches too few host calls to be a whole one";
  // Breadth first: a point first seen on an error path is failed together
  // with the failures that led there (up to three at once).
  for (size_t i = 0; i < work.size() && !HasFatalFailure(); i++) {
    const std::vector<Point> failed = work[i];
    for (const Point& p : LiveWith(failed, &injected)) {
      reachedAll.insert(p);
      if (failed.size() < 3 && queued.insert(p).second) {
        std::vector<Point> deeper = failed;
        deeper.push_back(p);
        work.push_back(deeper);
      }
    }
  }
  size_t missed = 0;
  for (const Point& p : reachedAll) {
    if (injected.count(p) == 0) {
      ADD_FAILURE() << "reached but never failed: " << p.Describe();
      missed++;
    }
  }
  std::set<std::string> calls;
  for (const Point& p : reachedAll) {
    calls.insert(p.call);
    if (std::getenv("SLUICE_SWEEP_LIST") != nullptr) std::printf("  %s\n", p.Describe().c_str());
  }
  std::printf("failure points: %zu reached (%zu host calls), %zu failed, %zu runs\n",
              reachedAll.size(), calls.size(), reachedAll.size() - missed, work.size() + 1);

  // Every failable host call the module library imports (found in the built
  // library at build time) must have been reached at some call site. This
  // is per call, not per site: a second site of a call already reached
  // elsewhere is not found here.
  const char* const kImported[] = {
#include "failable_imports.inc"
  };
  ASSERT_GT(std::size(kImported), 20u) << "the list of imported host calls looks broken";
  for (const char* call : kImported) {
    EXPECT_EQ(calls.count(call), 1u) << "the module calls " << call
                                     << " but no run of the sweep reaches it";
  }
}

// An agent whose creation fails after registering, and whose unregistration
// then fails too, stays registered: the framework may still call in with
// it. It must refuse those calls without touching freed memory and be
// unregistered at unload.
class FailedUndoTest : public testsupport::HostTest {};

TEST_F(FailedUndoTest, AgentThatCannotBeUnregisteredIsRefusedThenUnregisteredAtUnload) {
  Faults::Fail("zel_CharDevRegister", ZEL_FAILURE);
  Faults::Fail("zel_SluiceUnregisterFastPath", ZEL_FAILURE);
  ASSERT_EQ(host::Loader::Load(&slcGenericModuleImage), 0);
  EXPECT_TRUE(host::Log::Contains("Failed to unregister agent (0xbad0001): " +
                                  std::string(zel_StatusToString(ZEL_FAILURE))));
  ASSERT_TRUE(host::Sluice::AgentRegistered(kAgent));
  host::FilterId id = 0;
  EXPECT_NE(host::Sluice::CreateFilter(kAgent, {}, &id), ZEL_OK);
  host::Loader::Unload();
  EXPECT_FALSE(host::Sluice::AgentRegistered(kAgent));
  EXPECT_TRUE(host::Heaps::Leaks().empty());
}

}  // namespace
