// Requests a module makes of the Sluice framework and their replies:
// inline, deferred and other-thread replies, each exactly once; refused
// requests without one; the clear answers; what the records keep.
#include <gtest/gtest.h>

#include <cstring>
#include <thread>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/host/sluice_fake_agent.h"
#include "tests/support/module_fixture.h"

namespace {

using host::FilterConfig;
using host::FilterId;
using host::ReplyMode;
using host::RequestKind;
using host::RequestPolicy;
using host::Sluice;
using namespace fakeagent;

RequestPolicy Policy(ReplyMode mode, ZelStatus replyStatus = ZEL_OK,
                     std::vector<uint8_t> data = {}) {
  RequestPolicy p;
  p.mode = mode;
  p.replyStatus = replyStatus;
  p.replyData = std::move(data);
  return p;
}

RequestPolicy Refuse(ZelStatus status) {
  RequestPolicy p;
  p.refuse = status;
  return p;
}

int cookieA;
int cookieB;

class SluiceRequestTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    agent = new Agent;
    handle_ = Register();
    ASSERT_NE(handle_, nullptr);
    ASSERT_EQ(Sluice::CreateFilter("fake", FilterConfig{}, &id_), ZEL_OK);
    f_ = Priv(id_);
  }
  void TearDown() override {
    Sluice::WaitReplies();
    if (Sluice::AgentRegistered("fake")) {
      EXPECT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
    }
    HostTest::TearDown();
    delete agent;
    agent = nullptr;
  }

  ZelStatus SetSlowPath(uint32_t id, void* cookie = &cookieA) {
    return AsModule(f_, [&] {
      return zel_SluiceSetSlowPath(f_->handle, id, SetSlowPathReply, cookie, 2000);
    });
  }
  ZelStatus Retrieve() {
    return AsModule(f_, [&] {
      return zel_SluiceRetrieveSlowPathState(f_->handle, RetrieveReply, &cookieB, 1500);
    });
  }

  ZelSluiceFastPathHandle handle_ = nullptr;
  FilterId id_ = 0;
  FakeFilter* f_ = nullptr;
};

TEST_F(SluiceRequestTest, InlineReplyArrivesBeforeTheCallReturns) {
  Sluice::SetPolicy(RequestKind::SetSlowPath, Policy(ReplyMode::Inline));
  ASSERT_EQ(SetSlowPath(4), ZEL_OK);
  std::vector<ReplySeen> r = agent->Replies();
  ASSERT_EQ(r.size(), 1u);
  EXPECT_TRUE(r[0].duringRequest);
  EXPECT_EQ(r[0].filterPriv, f_);
  EXPECT_EQ(r[0].cookie, &cookieA);
  EXPECT_EQ(r[0].status, ZEL_OK);
  EXPECT_EQ(Sluice::SlowPathOf(id_), 4u);

  std::vector<host::RequestRecord> recs = Sluice::Requests(RequestKind::SetSlowPath);
  ASSERT_EQ(recs.size(), 1u);
  EXPECT_EQ(recs[0].filter, id_);
  EXPECT_EQ(recs[0].slowPathId, 4u);
  EXPECT_EQ(recs[0].timeoutMs, 2000u);
  EXPECT_EQ(recs[0].result, ZEL_OK);
}

TEST_F(SluiceRequestTest, DeferredRepliesWaitAndLeaveOldestFirst) {
  Sluice::SetPolicy(RequestKind::SetSlowPath, Policy(ReplyMode::Deferred, ZEL_FAILURE));
  ASSERT_EQ(SetSlowPath(1, &cookieA), ZEL_OK);
  ASSERT_EQ(SetSlowPath(2, &cookieB), ZEL_OK);
  EXPECT_TRUE(agent->Replies().empty());
  EXPECT_EQ(Sluice::PendingReplies(RequestKind::SetSlowPath), 2u);
  EXPECT_EQ(Sluice::PendingReplies(RequestKind::RetrieveState), 0u);
  // A filter waiting for replies refuses destruction, as the module does.
  EXPECT_EQ(Sluice::DestroyFilter(id_), ZEL_BUSY);

  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::RetrieveState), 0u);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::SetSlowPath, 1), 1u);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::SetSlowPath), 1u);
  std::vector<ReplySeen> r = agent->Replies();
  ASSERT_EQ(r.size(), 2u);
  EXPECT_EQ(r[0].cookie, &cookieA);
  EXPECT_EQ(r[1].cookie, &cookieB);
  EXPECT_FALSE(r[0].duringRequest);
  EXPECT_EQ(r[0].status, ZEL_FAILURE);
  EXPECT_EQ(Sluice::SlowPathOf(id_), 0u);          // a failed set sets nothing
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::SetSlowPath), 0u);   // exactly once
}

// A reply callback that retries (as the module does on a failed set) queues
// a new reply; releasing "all" sends only the replies queued before.
TEST_F(SluiceRequestTest, ReleaseSendsOnlyRepliesQueuedBeforeTheCall) {
  Sluice::SetPolicy(RequestKind::SetSlowPath, Policy(ReplyMode::Deferred, ZEL_FAILURE));
  static FakeFilter* filter;
  filter = f_;
  auto retry = [](void* priv, void* cookie, ZelStatus status) {
    SetSlowPathReply(priv, cookie, status);
    (void)AsModule(filter, [&] {
      return zel_SluiceSetSlowPath(filter->handle, 1, SetSlowPathReply, cookie, 10);
    });
  };
  ASSERT_EQ(AsModule(f_, [&] { return zel_SluiceSetSlowPath(f_->handle, 1, retry, nullptr, 10); }),
            ZEL_OK);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::SetSlowPath), 1u);
  EXPECT_EQ(Sluice::PendingReplies(RequestKind::SetSlowPath), 1u);
  EXPECT_EQ(Sluice::ReleaseReplies(RequestKind::SetSlowPath), 1u);
  EXPECT_EQ(agent->Replies().size(), 2u);
}

TEST_F(SluiceRequestTest, OtherThreadRepliesComeOnceFromAnotherThread) {
  Sluice::SetPolicy(RequestKind::RetrieveState,
                    Policy(ReplyMode::OtherThread, ZEL_OK, {1, 2, 3, 4, 5}));
  for (int i = 0; i < 20; i++) ASSERT_EQ(Retrieve(), ZEL_OK);
  Sluice::WaitReplies();
  std::vector<ReplySeen> r = agent->Replies();
  ASSERT_EQ(r.size(), 20u);
  for (const ReplySeen& s : r) {
    EXPECT_NE(s.thread, std::this_thread::get_id());
    EXPECT_EQ(s.data, (std::vector<uint8_t>{1, 2, 3, 4, 5}));
    EXPECT_EQ(s.cookie, &cookieB);
  }
  EXPECT_EQ(f_->awaited, 0);
  EXPECT_EQ(Sluice::PendingReplies(RequestKind::RetrieveState), 0u);
}

TEST_F(SluiceRequestTest, RefusedRequestsAreRecordedAndNeverAnswered) {
  Sluice::SetPolicy(RequestKind::RetrieveState, Refuse(ZEL_WOULD_BLOCK));
  EXPECT_EQ(Retrieve(), ZEL_WOULD_BLOCK);
  host::Faults::Fail("zel_SluiceSetSlowPath", ZEL_NO_MEMORY);
  EXPECT_EQ(SetSlowPath(1), ZEL_NO_MEMORY);
  Sluice::WaitReplies();
  EXPECT_TRUE(agent->Replies().empty());
  std::vector<host::RequestRecord> recs = Sluice::Requests(RequestKind::RetrieveState);
  ASSERT_EQ(recs.size(), 1u);
  EXPECT_EQ(recs[0].result, ZEL_WOULD_BLOCK);
  EXPECT_EQ(recs[0].timeoutMs, 1500u);
  Sluice::ClearRequests();
  EXPECT_TRUE(Sluice::Requests(RequestKind::RetrieveState).empty());
}

TEST_F(SluiceRequestTest, ClearAnswersInTurnThenSucceedsAndForgetsTheSlowPath) {
  ASSERT_EQ(SetSlowPath(6), ZEL_OK);
  ASSERT_EQ(Sluice::SlowPathOf(id_), 6u);
  Sluice::SetClearAnswers({ZEL_BUSY, ZEL_NO_MEMORY});
  EXPECT_EQ(zel_SluiceClearSlowPath(f_->handle), ZEL_BUSY);
  EXPECT_EQ(Sluice::SlowPathOf(id_), 6u);
  EXPECT_EQ(zel_SluiceClearSlowPath(f_->handle), ZEL_NO_MEMORY);
  EXPECT_EQ(zel_SluiceClearSlowPath(f_->handle), ZEL_OK);
  EXPECT_EQ(Sluice::SlowPathOf(id_), 0u);
  EXPECT_EQ(Sluice::ClearCalls(id_), 3u);
}

TEST_F(SluiceRequestTest, RestoreAndIoctlRequestsKeepTheirBytes) {
  const uint8_t state[] = {0xde, 0xad, 0xbe, 0xef};
  ASSERT_EQ(AsModule(f_, [&] {
              return zel_SluiceRestoreSlowPathState(f_->handle, state, sizeof state, RestoreReply,
                                                    &cookieA, 30);
            }),
            ZEL_OK);
  Sluice::SetPolicy(RequestKind::IoctlRequest, Policy(ReplyMode::Inline, ZEL_OK, {'o', 'k'}));
  const char payload[] = "vnic0";
  ASSERT_EQ(AsModule(f_, [&] {
              return zel_SluiceSendFilterIoctlRequest(f_->handle, payload, sizeof payload,
                                                      IoctlReply, &cookieB, 0xabcd);
            }),
            ZEL_OK);

  std::vector<host::RequestRecord> restore = Sluice::Requests(RequestKind::RestoreState);
  ASSERT_EQ(restore.size(), 1u);
  EXPECT_EQ(restore[0].data, std::vector<uint8_t>(state, state + 4));
  std::vector<host::RequestRecord> ioctl = Sluice::Requests(RequestKind::IoctlRequest);
  ASSERT_EQ(ioctl.size(), 1u);
  EXPECT_EQ(ioctl[0].data, std::vector<uint8_t>(payload, payload + sizeof payload));
  EXPECT_EQ(ioctl[0].cookie, 0xabcdu);
  std::vector<ReplySeen> r = agent->Replies();
  ASSERT_EQ(r.size(), 2u);
  EXPECT_EQ(r[1].cookie, &cookieB);
  EXPECT_EQ(r[1].data, (std::vector<uint8_t>{'o', 'k'}));
}

// The module stores its private pointer through the create callback's out
// argument before it asks for a slow path; an inline reply must see it.
TEST_F(SluiceRequestTest, ReplyDuringCreationCarriesTheNewFilterPrivatePointer) {
  agent->setSlowPathOnCreate = 8;
  FilterId id = 0;
  FilterConfig config;
  config.name = "b";
  ASSERT_EQ(Sluice::CreateFilter("fake", config, &id), ZEL_OK);
  std::vector<ReplySeen> r = agent->Replies();
  ASSERT_EQ(r.size(), 1u);
  EXPECT_EQ(r[0].filterPriv, Priv(id));
  EXPECT_EQ(Sluice::SlowPathOf(id), 8u);
}

using SluiceRequestDeathTest = SluiceRequestTest;

// A module that lets its filter be destroyed while a reply is queued would
// get the reply on a freed record: the host stops it there.
TEST_F(SluiceRequestDeathTest, DestroyingAFilterWithAQueuedReplyAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  Sluice::SetPolicy(RequestKind::RestoreState, Policy(ReplyMode::Deferred));
  ASSERT_EQ(zel_SluiceRestoreSlowPathState(f_->handle, nullptr, 0, RestoreReply, nullptr, 5),
            ZEL_OK);   // not counted in `awaited`: the fake agent will let it go
  EXPECT_DEATH((void)Sluice::DestroyFilter(id_), "destroyed while 1 request replies");
  f_->awaited++;    // balance the reply TearDown's unregistration waits for
  Sluice::ReleaseReplies(RequestKind::RestoreState);
}

}  // namespace
