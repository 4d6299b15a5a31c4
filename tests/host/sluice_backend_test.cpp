// The framework with an outside slow path installed: the module's set,
// retrieve and restore requests reach the backend, its completions reach
// the module as the requests' one reply, faulted packets and cleared
// attachments are handed over, and the framework's save and restore calls
// carry a filter's state through it.
#include <mutex>

#include "tools/lib/frames.h"

#include "tests/support/migration_support.h"

namespace {

using host::RequestKind;
using host::Sluice;
using host::SlowPathRequest;
using migsupport::Bytes;

class FakeBackend : public host::SlowPathBackend {
 public:
  ZelStatus Request(SlowPathRequest r) override {
    std::lock_guard<std::mutex> g(mu_);
    if (refuse_ != ZEL_OK) return refuse_;
    requests_.push_back(std::move(r));
    return ZEL_OK;
  }
  void Cleared(host::FilterId filter, uint32_t slowPathId) override {
    std::lock_guard<std::mutex> g(mu_);
    cleared_.push_back({filter, slowPathId});
  }
  void Faulted(host::FilterId filter, uint32_t slowPathId, uint32_t direction,
               std::vector<ZelPkt*> packets) override {
    std::lock_guard<std::mutex> g(mu_);
    for (ZelPkt* p : packets) {
      frames_.push_back({filter, slowPathId, direction, host::Packets::Frame(p)});
      zel_PktRelease(p);
    }
  }
  // The oldest request not yet taken; fails the test when there is none.
  SlowPathRequest Take() {
    std::lock_guard<std::mutex> g(mu_);
    EXPECT_FALSE(requests_.empty());
    if (requests_.empty()) return {};
    SlowPathRequest r = std::move(requests_.front());
    requests_.erase(requests_.begin());
    return r;
  }
  size_t Waiting() {
    std::lock_guard<std::mutex> g(mu_);
    return requests_.size();
  }
  void Refuse(ZelStatus s) {
    std::lock_guard<std::mutex> g(mu_);
    refuse_ = s;
  }

  struct Frame {
    host::FilterId filter;
    uint32_t slowPath, direction;
    Bytes bytes;
  };
  std::mutex mu_;
  ZelStatus refuse_ = ZEL_OK;
  std::vector<SlowPathRequest> requests_;
  std::vector<std::pair<host::FilterId, uint32_t>> cleared_;
  std::vector<Frame> frames_;
};

class SluiceBackendTest : public migsupport::MigrationTest {
 protected:
  void SetUp() override {
    MigrationTest::SetUp();
    Sluice::SetSlowPathBackend(&backend_);
  }
  void TearDown() override {
    // Whatever a test left outstanding is failed, as a departing slow path's
    // requests are, so that the module can let go of its filters.
    while (backend_.Waiting() != 0) (void)Sluice::CompleteRequest(backend_.Take().token, ZEL_FAILURE);
    Sluice::SetSlowPathBackend(nullptr);
    MigrationTest::TearDown();
  }
  // A filter attached to slow path 7 through the backend.
  host::FilterId AttachedFilter(const std::string& name, uint32_t failurePolicy = 0) {
    const host::FilterId id = NewFilter(name, failurePolicy);
    if (!registered_) {
      EXPECT_EQ(Sluice::RegisterSlowPath(testsupport::kDefaultAgent, 7), ZEL_OK);
      registered_ = true;
    }
    host::Timers::RunDue();
    SlowPathRequest set = backend_.Take();
    EXPECT_EQ(set.kind, RequestKind::SetSlowPath);
    EXPECT_TRUE(Sluice::CompleteRequest(set.token, ZEL_OK));
    return id;
  }
  FakeBackend backend_;
  bool registered_ = false;
};

TEST_F(SluiceBackendTest, AttachmentWaitsForTheBackendsAnswer) {
  const host::FilterId id = NewFilter("vm1");
  ASSERT_EQ(Sluice::RegisterSlowPath(testsupport::kDefaultAgent, 7), ZEL_OK);
  host::Timers::RunDue();
  SlowPathRequest set = backend_.Take();
  EXPECT_EQ(set.kind, RequestKind::SetSlowPath);
  EXPECT_EQ(set.filter, id);
  EXPECT_EQ(set.filterName, "vm1");
  EXPECT_EQ(set.slowPathId, 7u);
  EXPECT_GT(set.timeoutMs, 0u);
  EXPECT_EQ(Sluice::SlowPathOf(id), 0u) << "attached before the answer";
  EXPECT_EQ(Sluice::OutstandingBackendRequests(id), 1u);

  // A failed answer is the module's to retry; the retry is a new request.
  ASSERT_TRUE(Sluice::CompleteRequest(set.token, ZEL_FAILURE));
  SlowPathRequest retry = backend_.Take();
  EXPECT_NE(retry.token, set.token);
  EXPECT_FALSE(Sluice::CompleteRequest(set.token, ZEL_OK)) << "a token answers once";
  ASSERT_TRUE(Sluice::CompleteRequest(retry.token, ZEL_OK));
  EXPECT_EQ(Sluice::SlowPathOf(id), 7u);
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpAttached);
  EXPECT_EQ(Sluice::OutstandingBackendRequests(), 0u);
}

TEST_F(SluiceBackendTest, ARefusedRetryLeavesTheFilterDetached) {
  const host::FilterId id = NewFilter("vm1");
  ASSERT_EQ(Sluice::RegisterSlowPath(testsupport::kDefaultAgent, 7), ZEL_OK);
  host::Timers::RunDue();
  SlowPathRequest set = backend_.Take();
  // The slow path went away: its requests fail and new ones are refused.
  backend_.Refuse(ZEL_NOT_FOUND);
  ASSERT_TRUE(Sluice::CompleteRequest(set.token, ZEL_FAILURE));
  EXPECT_EQ(Filter(id)->spAttachState, SLCGenericSpDetached);
  EXPECT_EQ(Sluice::OutstandingBackendRequests(), 0u);
  EXPECT_EQ(Sluice::UnregisterSlowPath(testsupport::kDefaultAgent, 7), ZEL_OK);
}

TEST_F(SluiceBackendTest, PuntedPacketsAndClearedAttachmentsGoToTheBackend) {
  const host::FilterId id = AttachedFilter("vm1");
  ASSERT_EQ(migsupport::Install(Filter(id), migsupport::SampleRules()), ZEL_OK);
  // The sample's general rule punts UDP to 10.9.0.0/24.
  const Bytes frame = frames::FrameBuilder()
                          .Eth(frames::Mac(migsupport::kGwMac), frames::Mac(migsupport::kVmMac))
                          .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.9.0.7"))
                          .Udp(1000, 53)
                          .Payload(20, 0x5a)
                          .Build();
  std::vector<Bytes> passed;
  ASSERT_EQ(Deliver(id, {frame, frame}, ZEL_SLUICE_DIR_TO_SWITCH, &passed), ZEL_OK);
  EXPECT_TRUE(passed.empty());
  EXPECT_EQ(Sluice::FaultedCount(id), 0u) << "kept by the framework instead of handed over";
  ASSERT_EQ(backend_.frames_.size(), 2u);
  EXPECT_EQ(backend_.frames_[0].filter, id);
  EXPECT_EQ(backend_.frames_[0].slowPath, 7u);
  EXPECT_EQ(backend_.frames_[0].direction, ZEL_SLUICE_DIR_TO_SWITCH);
  EXPECT_EQ(backend_.frames_[1].bytes, frame);

  ASSERT_EQ(Sluice::DestroyFilter(id), ZEL_OK);
  ASSERT_EQ(backend_.cleared_.size(), 1u);
  EXPECT_EQ(backend_.cleared_[0], std::make_pair(id, 7u));
}

TEST_F(SluiceBackendTest, SaveAndRestoreCarryTheSlowPathsBytes) {
  const host::FilterId src = AttachedFilter("vm1");
  ASSERT_EQ(migsupport::Install(Filter(src), migsupport::SampleRules()), ZEL_OK);
  Sluice::PrefetchSavedState(src);
  SlowPathRequest fetch = backend_.Take();
  EXPECT_EQ(fetch.kind, RequestKind::RetrieveState);
  EXPECT_EQ(fetch.slowPathId, 7u);
  uint64_t len = 0;
  EXPECT_EQ(Sluice::GetSavedStateLen(src, &len), ZEL_NOT_READY);
  const Bytes spState = migsupport::Pattern(100);
  ASSERT_TRUE(Sluice::CompleteRequest(fetch.token, ZEL_OK, spState));
  ASSERT_EQ(Sluice::GetSavedStateLen(src, &len), ZEL_OK);
  Bytes saved(len);
  ASSERT_EQ(Sluice::SaveState(src, saved.data(), &len), ZEL_OK);
  ASSERT_EQ(saved.size(), 48 + 15 + 2 * 281 + spState.size());
  EXPECT_EQ(Bytes(saved.end() - 100, saved.end()), spState);

  const host::FilterId dst = AttachedFilter("vm1-moved");
  ASSERT_EQ(Sluice::RestoreState(dst, saved.data(), saved.size()), ZEL_OK);
  SlowPathRequest restore = backend_.Take();
  EXPECT_EQ(restore.kind, RequestKind::RestoreState);
  EXPECT_EQ(restore.filter, dst);
  EXPECT_EQ(restore.data, spState);
  EXPECT_EQ(migsupport::Of(Filter(dst)).state, SLCGenericStateRestoring);
  // A slow path that cannot take its state back leaves the rules restored.
  ASSERT_TRUE(Sluice::CompleteRequest(restore.token, ZEL_FAILURE));
  EXPECT_EQ(migsupport::Of(Filter(dst)), migsupport::kIdle);
  EXPECT_EQ(migsupport::Rules(Filter(dst)), migsupport::Rules(Filter(src)));
}

}  // namespace
