// Unregistering an agent in the host's Sluice framework against filters
// that answer busy, driven by a small fake agent. Request replies, packet
// hand-over and properties are driven through the real module by the agent,
// filter and slow-path tests.
#include <atomic>
#include <chrono>
#include <thread>

#include "tests/support/module_fixture.h"

namespace {

using namespace host;

// --- the fake agent ------------------------------------------------------------

struct FakeFilter {
  ZelSluiceFilterHandle handle;
  std::string name;
  std::atomic<int> awaited{0};   // replies still due: destroy answers busy meanwhile
};
struct FakeAgent {
  std::vector<std::string> events;   // destroy calls, in order (all on one thread)
  std::atomic<int> replies{0};
  int destroyBusy = 0;   // destroy answers busy this many more times
};
FakeAgent* gAgent;

void RetrieveReply(void* filterPriv, void*, const void*, uint64_t, uint32_t) {
  gAgent->replies++;
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
    nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
};

class SluiceTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    gAgent = &agent_;
    ASSERT_EQ(zel_SluiceRegisterFastPath("fake", ZEL_SLUICE_FASTPATH_VERSION, ZEL_SLUICE_FASTPATH_VERSION, 7,
                                         &kOps, &agent_, &handle_), ZEL_OK);
    f_ = static_cast<FakeFilter*>(Sluice::FilterPriv(Make("a")));
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
  FakeAgent agent_;
  ZelSluiceFastPathHandle handle_ = nullptr;
  FakeFilter* f_ = nullptr;
};

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
  f_->awaited++;
  ASSERT_EQ(zel_SluiceRetrieveSlowPathState(f_->handle, RetrieveReply, nullptr, 1500), ZEL_OK);
  std::thread releaser([] {
    std::this_thread::sleep_for(std::chrono::milliseconds(30));
    Sluice::ReleaseReplies(RequestKind::RetrieveState);
  });
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  releaser.join();
  EXPECT_EQ(agent_.replies, 1);
  ASSERT_GE(agent_.events.size(), 2u);   // refused at least once, then destroyed
  EXPECT_EQ(agent_.events.back(), "destroy a");
}

}  // namespace
