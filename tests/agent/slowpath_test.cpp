// The slow path link: choice of the least-loaded slow path, the attach
// timer, retries, detachment and unregistration.

#include <chrono>
#include <thread>

#include "tests/support/module_fixture.h"

namespace {

using testsupport::kDefaultAgent;
using testsupport::ModuleTest;
using testsupport::Refuses;
using testsupport::Replies;

class SlowPaths : public ModuleTest {
 protected:
  SLCGenericSlowPath* SlowPath(uint32_t id) {
    SLCGenericFastPath* fp = Agent();
    for (ListLinks* l = fp->slowPaths.next; l != &fp->slowPaths; l = l->next) {
      if (SLCGenericSlowPathFromLink(l)->id == id) return SLCGenericSlowPathFromLink(l);
    }
    return nullptr;
  }
  // Registers the slow paths, then runs the attach pass.
  static void Register(std::initializer_list<uint32_t> ids) {
    for (uint32_t id : ids) ASSERT_EQ(host::Sluice::RegisterSlowPath(kDefaultAgent, id), ZEL_OK);
    host::Timers::RunDue();
  }
  std::vector<host::FilterId> MakeFilters(int n) {
    std::vector<host::FilterId> ids;
    for (int i = 0; i < n; i++) ids.push_back(CreateFilter(kDefaultAgent, "f" + std::to_string(i)));
    return ids;
  }
};

TEST_F(SlowPaths, FiltersSpreadToTheLeastLoadedAndMoveWhenItGoes) {
  Register({1, 2});

  std::vector<host::FilterId> ids = MakeFilters(5);
  std::vector<uint32_t> chosen;
  for (host::FilterId id : ids) {
    EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
    chosen.push_back(host::Sluice::SlowPathOf(id));
  }
  EXPECT_EQ(chosen, (std::vector<uint32_t>{1, 2, 1, 2, 1}));
  EXPECT_EQ(SlowPath(1)->numFilters, 3u);
  EXPECT_EQ(SlowPath(1)->useCount, 4u);
  EXPECT_EQ(SlowPath(2)->numFilters, 2u);
  for (host::FilterId id : ids) EXPECT_EQ(Filter(id)->refCount, 1u);

  // Unregistering moves the filters to the one left; the last one leaves
  // them detached.
  ASSERT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 1), ZEL_OK);
  for (host::FilterId id : ids) EXPECT_EQ(host::Sluice::SlowPathOf(id), 2u);
  EXPECT_EQ(SlowPath(2)->numFilters, 5u);
  ASSERT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 2), ZEL_OK);
  for (host::FilterId id : ids) {
    EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);
    EXPECT_EQ(Ctx(id)->spAttachState, SLCGenericSpDetached);
  }
  EXPECT_TRUE(List_IsEmpty(&Agent()->slowPaths));
}

TEST_F(SlowPaths, RegistrationAttachesOnlyThroughTheTimer) {
  std::vector<host::FilterId> ids = MakeFilters(2);
  EXPECT_EQ(Filter(ids[0])->spAttachState, SLCGenericSpDetached);

  ASSERT_EQ(host::Sluice::RegisterSlowPath(kDefaultAgent, 7), ZEL_OK);
  EXPECT_EQ(Filter(ids[0])->spAttachState, SLCGenericSpDetached);
  EXPECT_TRUE(host::Sluice::Requests(host::RequestKind::SetSlowPath).empty());
  EXPECT_EQ(host::Timers::Pending(), 1u);

  // A second registration while the pass is pending asks for a rescan
  // instead of a second timer.
  ASSERT_EQ(host::Sluice::RegisterSlowPath(kDefaultAgent, 8), ZEL_OK);
  EXPECT_EQ(host::Timers::Pending(), 1u);
  EXPECT_EQ(Agent()->attachRescan, 1u);

  EXPECT_EQ(host::Timers::RunDue(), 1u);
  EXPECT_EQ(host::Sluice::SlowPathOf(ids[0]), 7u);
  EXPECT_EQ(host::Sluice::SlowPathOf(ids[1]), 8u);
}

TEST_F(SlowPaths, TimerRefusedWaitsForTheNextRegistration) {
  host::FilterId id = CreateFilter();
  host::Faults::Fail("zel_TimerSchedule", ZEL_NO_MEMORY);
  ASSERT_EQ(host::Sluice::RegisterSlowPath(kDefaultAgent, 1), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Could not schedule callback (0xbad0014): Out of memory", 2));
  EXPECT_EQ(Agent()->attachTimer, 0u);
  host::Timers::RunDue();
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);

  Register({2});
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(host::Sluice::SlowPathOf(id), 1u);
}

TEST_F(SlowPaths, FailedRepliesAreRetriedCountingUp) {
  host::FilterId id = CreateFilter();
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath,
                          Replies(host::ReplyMode::Deferred, ZEL_FAILURE));
  Register({3});
  for (int i = 0; i < 3; i++) {
    ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath), 1u);
    EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttaching);
    EXPECT_EQ(Filter(id)->refCount, 2u);  // the framework's and the reply's
  }
  EXPECT_EQ(host::Log::Count("Couldn't set slow path (0xbad0001): Failure", 1), 3u);
  for (int i = 1; i <= 3; i++) {
    EXPECT_TRUE(host::Log::Contains("Retry (#" + std::to_string(i) + ") to attach slow path #3"));
  }
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Replies(host::ReplyMode::Deferred));
  host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);  // fails, asks again
  host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);  // succeeds
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(Filter(id)->spRetries, 4u);
  EXPECT_EQ(Filter(id)->refCount, 1u);
  EXPECT_TRUE(host::Log::Contains("Successfully set slow path #3", 1));
}

TEST_F(SlowPaths, RefusedRequestLeavesTheFilterDetached) {
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Refuses(ZEL_WOULD_BLOCK));
  Register({1});
  host::FilterId id = CreateFilter();
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);
  EXPECT_EQ(Filter(id)->slowPath, nullptr);
  EXPECT_EQ(Filter(id)->refCount, 1u);
  EXPECT_EQ(SlowPath(1)->numFilters, 0u);
  EXPECT_EQ(SlowPath(1)->useCount, 1u);
  EXPECT_TRUE(host::Log::Contains("Request to set slow path failed (0xbad0006): Would block", 1));
  // A refused request was never on its way, so nothing was cleared.
  EXPECT_EQ(host::Log::Count("Detaching from slow path #1"), 1u);
}

TEST_F(SlowPaths, UnregistrationWhileAttachingIsBusyUntilTheReply) {
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Replies(host::ReplyMode::Deferred));
  Register({5});
  host::FilterId id = CreateFilter();
  ASSERT_EQ(Filter(id)->spAttachState, SLCGenericSpAttaching);

  EXPECT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 5), ZEL_BUSY);
  EXPECT_TRUE(host::Log::Contains("Could not unregister slow path, use count = 2", 1));
  EXPECT_TRUE(List_IsEmpty(&Agent()->slowPaths));  // unlisted, kept

  host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 5), ZEL_OK);
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);
}

// Unloading while a filter's attach reply is outstanding: the filter
// answers busy until the reply comes, and the framework keeps asking,
// holding nothing the reply (sent from another thread) needs.
TEST_F(SlowPaths, UnloadWaitsOutAnAttachReplyReleasedMeanwhile) {
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Replies(host::ReplyMode::Deferred));
  Register({1});
  ASSERT_EQ(Filter(CreateFilter())->spAttachState, SLCGenericSpAttaching);
  std::thread releaser([] {
    std::this_thread::sleep_for(std::chrono::milliseconds(30));
    host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
  });
  Unload();
  releaser.join();
  EXPECT_FALSE(host::Sluice::AgentRegistered(kDefaultAgent));
}

TEST_F(SlowPaths, TransientClearKeepsTheFilterAttached) {
  Register({1});
  host::FilterId id = CreateFilter();

  host::Sluice::SetClearAnswers({ZEL_BUSY});
  EXPECT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 1), ZEL_BUSY);
  EXPECT_TRUE(
      host::Log::Contains("Transient failure in clearing slow path (0xbad0004): Busy", 2));
  EXPECT_TRUE(host::Log::Contains("Could not unregister slow path, use count = 2", 1));
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(Ctx(id)->spAttachState, SLCGenericSpAttached);

  EXPECT_EQ(host::Sluice::UnregisterSlowPath(kDefaultAgent, 1), ZEL_OK);
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);
}

TEST_F(SlowPaths, DestroyRetriesTransientClearsAndGoesOnAfterOthers) {
  Register({1});
  host::FilterId a = CreateFilter(kDefaultAgent, "a");
  host::FilterId b = CreateFilter(kDefaultAgent, "b");
  host::Sluice::SetClearAnswers({ZEL_NO_MEMORY, ZEL_FAILURE});
  EXPECT_EQ(host::Sluice::DestroyFilter(a), ZEL_BUSY);   // still counted, kept
  EXPECT_EQ(SlowPath(1)->numFilters, 2u);
  EXPECT_EQ(host::Sluice::DestroyFilter(a), ZEL_OK);     // failed for good: detached anyway
  EXPECT_TRUE(host::Log::Contains("Request to clear slow path failed (0xbad0001): Failure", 2));
  EXPECT_EQ(SlowPath(1)->numFilters, 1u);
  EXPECT_EQ(host::Sluice::DestroyFilter(b), ZEL_OK);
  EXPECT_EQ(SlowPath(1)->useCount, 1u);
}

TEST_F(SlowPaths, RepliesFromAnotherThread) {
  host::Sluice::SetPolicy(host::RequestKind::SetSlowPath, Replies(host::ReplyMode::OtherThread));
  Register({1, 2});
  std::vector<host::FilterId> ids = MakeFilters(6);
  host::Sluice::WaitReplies();
  for (host::FilterId id : ids) {
    EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
    EXPECT_EQ(Filter(id)->refCount, 1u);
  }
  EXPECT_EQ(SlowPath(1)->numFilters + SlowPath(2)->numFilters, 6u);
}

}  // namespace
