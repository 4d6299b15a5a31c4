// The host's Sluice framework as a module meets it, driven by a small fake
// agent: request replies, unregistration against busy answers, packet
// hand-over and agent properties.
#include <atomic>
#include <chrono>
#include <cstring>
#include <mutex>
#include <thread>
#include <tuple>

#include "tests/support/module_fixture.h"

namespace {

using namespace host;

// --- the fake agent ------------------------------------------------------------

struct FakeFilter {
  ZelSluiceFilterHandle handle;
  std::string name;
  std::atomic<int> awaited{0};   // replies still due: destroy answers busy meanwhile
};
struct Reply {
  void *filterPriv, *cookie;
  std::vector<uint8_t> data;
  bool duringRequest;   // the request call had not returned yet
  std::thread::id thread;
};
struct FakeAgent {
  std::mutex mu;
  std::vector<std::string> events;   // destroy calls, in order (all on one thread)
  std::vector<Reply> replies;
  int destroyBusy = 0;   // destroy answers busy this many more times
  bool punt = false;     // fault the packets, else issue them
};
FakeAgent* gAgent;
thread_local bool tInRequest = false;

void RetrieveReply(void* filterPriv, void* cookie, const void* data, uint64_t len, uint32_t) {
  auto* p = static_cast<const uint8_t*>(data);
  std::lock_guard<std::mutex> g(gAgent->mu);
  gAgent->replies.push_back({filterPriv, cookie, {p, p + len}, tInRequest, std::this_thread::get_id()});
  static_cast<FakeFilter*>(filterPriv)->awaited--;
}

const ZelSluiceFastPathOps kOps = {
    nullptr, nullptr,
    [](void*, ZelSluiceFilterHandle handle, void** priv, uint8_t) -> ZelStatus {
      char name[32];
      if (ZelStatus s = zel_SluiceGetName(handle, name, sizeof name)) return s;
      *priv = new FakeFilter{handle, name};
      return ZEL_OK;
    },
    [](void* priv) -> ZelStatus {
      auto* f = static_cast<FakeFilter*>(priv);
      bool busy = f->awaited > 0 || gAgent->destroyBusy-- > 0;
      gAgent->events.push_back("destroy " + f->name + (busy ? " busy" : ""));
      if (busy) return ZEL_BUSY;
      delete f;
      return ZEL_OK;
    },
    nullptr, nullptr, nullptr, nullptr,
    [](void* priv, ZelPktList* list, uint32_t direction) -> ZelStatus {
      ZelSluiceFilterHandle h = static_cast<FakeFilter*>(priv)->handle;
      return gAgent->punt ? zel_SluiceFaultPackets(h, list, direction, 0)
                          : zel_SluiceIssuePackets(h, list, direction);
    },
    nullptr, nullptr, nullptr, nullptr,
};

class SluiceTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    HostTest::SetUp();
    gAgent = &agent_;
    ASSERT_EQ(zel_SluiceRegisterFastPath("fake", ZEL_SLUICE_FASTPATH_VERSION, ZEL_SLUICE_FASTPATH_VERSION, 7,
                                         &kOps, &agent_, &handle_), ZEL_OK);
    id_ = Make("a");
    f_ = static_cast<FakeFilter*>(Sluice::FilterPriv(id_));
  }
  void TearDown() override {
    if (Sluice::AgentRegistered("fake")) {
      EXPECT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
    }
    HostTest::TearDown();
  }
  static FilterId Make(const char* name) {
    FilterConfig config;
    config.name = name;
    FilterId id = 0;
    EXPECT_EQ(Sluice::CreateFilter("fake", config, &id), ZEL_OK);
    return id;
  }
  // Makes a request as the module does, counting the reply it then awaits.
  ZelStatus Retrieve(void* cookie) {
    f_->awaited++;
    tInRequest = true;
    ZelStatus s = zel_SluiceRetrieveSlowPathState(f_->handle, RetrieveReply, cookie, 1500);
    tInRequest = false;
    if (s != ZEL_OK) f_->awaited--;
    return s;
  }

  FakeAgent agent_;
  ZelSluiceFastPathHandle handle_ = nullptr;
  FilterId id_ = 0;
  FakeFilter* f_ = nullptr;
  int cookieA_ = 0, cookieB_ = 0;
};

TEST_F(SluiceTest, InlineAndOtherThreadRepliesComeOnceRefusedRequestsNever) {
  struct Row { ReplyMode mode; ZelStatus refuse; size_t replies; bool duringRequest, otherThread; };
  for (const Row& row : {Row{ReplyMode::Inline, ZEL_OK, 1, true, false},
                         Row{ReplyMode::OtherThread, ZEL_OK, 1, false, true},
                         Row{ReplyMode::Inline, ZEL_WOULD_BLOCK, 0, false, false}}) {
    agent_.replies.clear();
    Sluice::SetPolicy(RequestKind::RetrieveState, {row.refuse, row.mode, ZEL_OK, {1, 2, 3}});
    ASSERT_EQ(Retrieve(&cookieA_), row.refuse);
    Sluice::WaitReplies();
    ASSERT_EQ(agent_.replies.size(), row.replies);
    for (const Reply& r : agent_.replies) {
      EXPECT_EQ(std::tie(r.filterPriv, r.cookie), std::make_tuple(f_, &cookieA_));
      EXPECT_EQ(r.data, (std::vector<uint8_t>{1, 2, 3}));
      EXPECT_EQ(r.duringRequest, row.duringRequest);
      EXPECT_EQ(r.thread != std::this_thread::get_id(), row.otherThread);
    }
  }
}

TEST_F(SluiceTest, DeferredRepliesComeOnceOldestFirst) {
  Sluice::SetPolicy(RequestKind::RetrieveState, {ZEL_OK, ReplyMode::Deferred, ZEL_OK, {}});
  ASSERT_EQ(Retrieve(&cookieA_), ZEL_OK);
  ASSERT_EQ(Retrieve(&cookieB_), ZEL_OK);
  EXPECT_TRUE(agent_.replies.empty());
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::RetrieveState, 1), 1u);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::RetrieveState), 1u);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::RetrieveState), 0u);
  ASSERT_EQ(agent_.replies.size(), 2u);
  EXPECT_EQ(agent_.replies[0].cookie, &cookieA_);
  EXPECT_EQ(agent_.replies[1].cookie, &cookieB_);
}

TEST_F(SluiceTest, UnregistrationRetriesBusyFilters) {
  Make("b");
  agent_.destroyBusy = 2;
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  EXPECT_EQ(agent_.events,
            (std::vector<std::string>{"destroy a busy", "destroy a busy", "destroy a", "destroy b"}));
}

// The filter answers busy until its reply comes; unregistration must keep
// trying without holding anything the reply (sent from another thread) needs.
TEST_F(SluiceTest, UnregistrationWaitsOutAReplyReleasedMeanwhile) {
  Sluice::SetPolicy(RequestKind::RetrieveState, {ZEL_OK, ReplyMode::Deferred, ZEL_OK, {}});
  ASSERT_EQ(Retrieve(&cookieA_), ZEL_OK);
  std::thread releaser([] {
    std::this_thread::sleep_for(std::chrono::milliseconds(30));
    Sluice::ReleaseReplies(RequestKind::RetrieveState);
  });
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  releaser.join();
  EXPECT_EQ(agent_.replies.size(), 1u);
  ASSERT_GE(agent_.events.size(), 2u);   // refused at least once, then destroyed
  EXPECT_EQ(agent_.events.back(), "destroy a");
}

TEST_F(SluiceTest, HandedOverPacketsAreKeptInOrderUntilTaken) {
  PacketList list;
  for (uint8_t i = 0; i < 3; i++) list.Append(Packets::Make(std::vector<uint8_t>(60, i)));
  std::vector<ZelPkt*> made = list.Packets();
  agent_.punt = true;
  ASSERT_EQ(Sluice::Deliver(id_, list, ZEL_SLUICE_DIR_TO_SWITCH), ZEL_OK);
  list.Append(Packets::Make(std::vector<uint8_t>(60, 9)));
  agent_.punt = false;
  ASSERT_EQ(Sluice::Deliver(id_, list, ZEL_SLUICE_DIR_FROM_SWITCH), ZEL_OK);
  EXPECT_EQ(Sluice::FaultedCount(id_), 1u);
  std::vector<Delivery> faulted = Sluice::TakeFaulted(id_), issued = Sluice::TakeIssued(id_);
  EXPECT_EQ(Sluice::FaultedCount(id_), 0u);
  ASSERT_EQ(faulted.size(), 1u);
  ASSERT_EQ(issued.size(), 1u);
  EXPECT_EQ(faulted[0].direction, ZEL_SLUICE_DIR_TO_SWITCH);
  EXPECT_EQ(faulted[0].packets, made);
  EXPECT_EQ(issued[0].direction, ZEL_SLUICE_DIR_FROM_SWITCH);
  for (ZelPkt* p : made) zel_PktRelease(p);
  zel_PktRelease(issued[0].packets.at(0));
}

uint32_t gReadBytes;
void* gReadPriv;
const ZelSluicePropOps kPropOps = {
    nullptr,
    [](void* priv, void*, void* buf) -> ZelStatus {
      gReadPriv = priv;
      std::memset(buf, 0x5e, gReadBytes);
      return ZEL_OK;
    },
    [](void*, void*, uint32_t* size) { *size = 4; return true; },
    nullptr,
};

TEST_F(SluiceTest, PropertyReadsReachTheFilterAndStayWithinThePolledSize) {
  ZelSluicePropHandle ph = nullptr;
  ASSERT_EQ(zel_SluicePropertyRegister(&ph, "fake.ruleset", &kPropOps), ZEL_OK);
  FilterId b = Make("b");
  std::vector<uint8_t> out;
  ZelStatus s = ZEL_FAILURE;
  gReadBytes = 4;
  ASSERT_TRUE(Sluice::PropertyRead("fake.ruleset", b, &out, &s));
  EXPECT_EQ(s, ZEL_OK);
  EXPECT_EQ(gReadPriv, Sluice::FilterPriv(b));
  EXPECT_EQ(out, std::vector<uint8_t>(4, 0x5e));
  gReadBytes = 5;
  EXPECT_DEATH(Sluice::PropertyRead("fake.ruleset", id_, &out, &s), "wrote past the 4 bytes");
  ASSERT_EQ(zel_SluicePropertyUnregister(ph), ZEL_OK);
}

}  // namespace
