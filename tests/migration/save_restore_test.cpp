// Both sides of a migration around the slow path: saved layouts, fetching,
// one-shot saves, short buffers, the restore header checks, replies that
// come when the filter no longer waits for them, and hostile saved state.
#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <random>

#include "tests/support/migration_support.h"

namespace {

using namespace migsupport;
using enum host::ReplyMode;
using enum host::RequestKind;

constexpr uint32_t kSlowPathId = 7;

// The rules in force before a restore, so a refused one can be seen to leave them.
Bytes Baseline() {
  return rules::RulesetBuilder(8).Add(ExactRule("accept", "udp", "10.8.0.1", 5, "10.8.0.2", 6)).Bytes();
}

class SaveRestoreTest : public MigrationTest {
 protected:
  void SetUp() override {
    MigrationTest::SetUp();
    f_ = Filter(id_ = NewFilter("vnic0"));
    ASSERT_EQ(Install(f_, Baseline()), ZEL_OK);
  }
  uint64_t Length(ZelStatus expect = ZEL_OK) {
    uint64_t len = 0;
    EXPECT_EQ(SLCGenericGetSavedStateLen(f_, &len), expect);
    return len;
  }
  // From a heap block of exactly the buffer's size, so a read past it trips the sanitizer.
  static ZelStatus Restore(const Bytes& state, SLCGenericFilter* filter) {
    auto exact = std::make_unique<uint8_t[]>(state.size());
    std::copy(state.begin(), state.end(), exact.get());
    return SLCGenericRestoreState(filter, exact.get(), state.size());
  }
  static void ExpectUntouched(SLCGenericFilter* filter) {
    EXPECT_EQ(Rules(filter), Baseline());
    EXPECT_EQ(Of(filter), kIdle);
    EXPECT_TRUE(host::Sluice::Requests(RestoreState).empty());
  }
  static uint64_t HeapBytes() { return host::Heaps::Stats(host::Heaps::ModuleHeap()).bytes; }

  host::FilterId id_ = 0;
  SLCGenericFilter* f_ = nullptr;
};

TEST_F(SaveRestoreTest, SavedLayoutForBothVersionsWithAndWithoutSlowPathState) {
  // No slow path: ready at once, no request, no slow path part.
  SLCGenericPrefetchSavedState(f_);
  EXPECT_TRUE(host::Sluice::Requests(RetrieveState).empty());
  EXPECT_EQ(Save(f_), SavedState(Rules(f_)));

  // A slow path whose reply comes inside the request call (the lock must be
  // free then), with and without state. The part is sized for version-8
  // records: a version-7 ruleset leaves a zero tail.
  AttachSlowPath(kSlowPathId);
  for (const auto& [ruleset, slow, length] :
       {std::tuple(SampleRules(), Bytes(), 48u + 577),
        std::tuple(SampleRules(7), Pattern(100), 48u + 577 + 100)}) {
    ASSERT_EQ(Install(f_, ruleset), ZEL_OK);
    SetPolicy(RetrieveState, Inline, slow);
    SLCGenericPrefetchSavedState(f_);
    EXPECT_EQ(Length(), length);
    Bytes fast = Rules(f_);
    fast.resize(577, 0);
    EXPECT_EQ(Save(f_), SavedState(fast, slow));
    EXPECT_EQ(Of(f_), kIdle);
  }
}

TEST_F(SaveRestoreTest, StateIsNotYetAvailableWhileFetchingAndEverySaveIsOneShot) {
  AttachSlowPath(kSlowPathId);
  SetPolicy(RetrieveState, Deferred, Pattern(40));
  const uint64_t heapBefore = HeapBytes();
  SLCGenericPrefetchSavedState(f_);
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(host::Log::Count("Ignoring state prefetch request; wrong state (2)", 1), 1u);
  // The framework's reference and the one outstanding reply's.
  EXPECT_EQ(Of(f_), (RefsAndState{2, SLCGenericStateFetching}));
  EXPECT_EQ(Length(ZEL_NOT_READY), 0u);
  EXPECT_EQ(host::Log::Count("Slow path agent state is not yet available", 1), 1u);
  ASSERT_EQ(host::Sluice::ReleaseReplies(RetrieveState), 1u);

  // One byte short: refused untouched, and the fetched state is gone.
  const uint64_t len = 48 + 296 + 40;
  EXPECT_EQ(Length(), len);
  Bytes buf(len - 1, 0xA5);
  uint64_t size = buf.size();
  EXPECT_EQ(SLCGenericSaveState(f_, buf.data(), &size), ZEL_BUF_TOO_SMALL);
  EXPECT_EQ(host::Log::Count("Buffer too short for saved state (requested 384, got 383)", 2), 1u);
  EXPECT_EQ(std::tuple(buf, size, HeapBytes()),
            std::tuple(Bytes(len - 1, 0xA5), len - 1, heapBefore));
  EXPECT_EQ(SLCGenericSaveState(f_, buf.data(), &size), ZEL_INVALID_STATE);
  EXPECT_EQ(host::Log::Count("Unexpected request to save state", 2), 1u);

  // A full save, and null arguments, drop it as well.
  SetPolicy(RetrieveState, Inline, Pattern(40));
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(Save(f_), SavedState(Rules(f_), Pattern(40)));
  for (int which = 0; which < 3; which++) {
    SLCGenericPrefetchSavedState(f_);
    EXPECT_EQ(which == 0   ? SLCGenericGetSavedStateLen(f_, nullptr)
              : which == 1 ? SLCGenericSaveState(f_, nullptr, &size)
                           : SLCGenericSaveState(f_, buf.data(), nullptr),
              ZEL_OK);
    EXPECT_EQ(Of(f_), kIdle);
  }
  EXPECT_EQ(HeapBytes(), heapBefore);
}

// Whatever the slow path or the framework answers, the filter ends idle with
// its references returned, and a restore keeps the rules it put in force.
TEST_F(SaveRestoreTest, FailedRequestsAndRepliesReturnEveryReference) {
  AttachSlowPath(kSlowPathId);
  // {request, reply status, refusal, message (the status's text follows), urgency}
  const std::tuple<host::RequestKind, ZelStatus, ZelStatus, std::string, int> rows[] = {
      {RetrieveState, ZEL_WOULD_BLOCK, ZEL_OK,
       "Failed to retrieve slow path state (0xbad0006): ", 1},
      {RetrieveState, ZEL_OK, ZEL_BUSY, "Requesting slow path state failed (0xbad0004): ", 2},
      {RestoreState, ZEL_OK, ZEL_OK, "Finished restoring slow path state", 1},
      {RestoreState, ZEL_FAILURE, ZEL_OK, "Failed to restore slow path state (0xbad0001): ", 2},
      {RestoreState, ZEL_OK, ZEL_NO_MEMORY,
       "Couldn't request slow path state restore (0xbad0014): ", 1},
  };
  for (const auto& [kind, replyStatus, refuse, message, urgency] : rows) {
    SCOPED_TRACE(message);
    ASSERT_EQ(Install(f_, Baseline()), ZEL_OK);
    SetPolicy(kind, Inline, Pattern(10), replyStatus, refuse);
    if (kind == RestoreState) {
      EXPECT_EQ(Restore(SavedState(SampleRules(), Pattern(5)), f_), refuse);
      EXPECT_EQ(Rules(f_), SampleRules());
    } else {
      SLCGenericPrefetchSavedState(f_);
    }
    const ZelStatus failed = replyStatus | refuse;
    EXPECT_EQ(host::Log::Count(message + (failed ? zel_StatusToString(failed) : ""), urgency), 1u);
    EXPECT_EQ(Of(f_), kIdle);
    EXPECT_EQ(host::Sluice::PendingReplies(kind), 0u);
  }
}

TEST_F(SaveRestoreTest, RepliesInTheWrongStateOnlyReleaseTheirReference) {
  AttachSlowPath(kSlowPathId);
  SetPolicy(RetrieveState, Deferred, Pattern(20));
  // Retrieve reply after a detach (fetching -> ready): nothing is kept.
  SLCGenericPrefetchSavedState(f_);
  ASSERT_EQ(host::Sluice::UnregisterSlowPath(testsupport::kDefaultAgent, kSlowPathId), ZEL_OK);
  const uint64_t heapBefore = HeapBytes();
  ASSERT_EQ(host::Sluice::ReleaseReplies(RetrieveState), 1u);
  EXPECT_EQ(host::Log::Count("Ignoring slow path state reply; wrong state (3)", 1), 1u);
  EXPECT_EQ(HeapBytes(), heapBefore);
  EXPECT_EQ(Save(f_), SavedState(Rules(f_)));

  // A reply longer than the heap serves is refused before any byte of its
  // (short) data is read; the real reply then finds the filter idle. The
  // test holds the reference the framework would for its own call.
  AttachSlowPath(kSlowPathId);
  SLCGenericPrefetchSavedState(f_);
  {
    SLCGenericSpinGuard hold(f_->lock);
    f_->refCount++;
  }
  SLCGenericRetrieveSlowPathReply(f_, nullptr, Pattern(8).data(), uint64_t{1} << 32, ZEL_OK);
  EXPECT_EQ(host::Log::Count("Failed to alloc 4294967296 bytes for state buffer", 1), 1u);
  ASSERT_EQ(host::Sluice::ReleaseReplies(RetrieveState), 1u);
  EXPECT_EQ(host::Log::Count("Ignoring slow path state reply; wrong state (1)", 1), 1u);
  EXPECT_EQ(Of(f_), kIdle);

  // Restore under way: the fast part is in force and the slow part sent;
  // the rest waits. A save resets the filter and the late reply is unexpected.
  SetPolicy(RestoreState, Deferred);
  const Bytes state = SavedState(SampleRules(), Pattern(77));
  ASSERT_EQ(Restore(state, f_), ZEL_OK);
  EXPECT_EQ(Of(f_), (RefsAndState{2, SLCGenericStateRestoring}));
  EXPECT_EQ(Restore(state, f_), ZEL_FAILURE);
  EXPECT_EQ(host::Log::Count("Ignoring state restore request; wrong state (4)", 1), 1u);
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_BUSY);  // the reply holds the record
  uint64_t len = 0;
  EXPECT_EQ(SLCGenericSaveState(f_, &len, &len), ZEL_INVALID_STATE);
  ASSERT_EQ(host::Sluice::ReleaseReplies(RestoreState), 1u);
  EXPECT_EQ(host::Log::Count("Unexpected restore slow path state reply", 2), 1u);
  EXPECT_EQ(Of(f_), kIdle);
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_OK);
}

// Every check in its order: each row breaks one thing (or two, to show that
// the earlier check reports), and nothing is changed or requested.
TEST_F(SaveRestoreTest, RestoreHeaderChecksRejectInOrderAndChangeNothing) {
  const Bytes good = SavedState(SampleRules(), Pattern(10));  // 635 bytes, slow part at 625
  const std::string magic = "Bad state header magic (got 0x",
                    version = "Bad state header verison (expected 1, got ",
                    large = "Buffer not large enough (expected ",
                    offsets = "Bad state header offsets (";
  const std::pair<std::vector<std::pair<size_t, uint64_t>>, std::string> rows[] = {
      {{}, "Buffer too short for header (47 bytes)"},
      {{{0, 0x6676617367636c73}}, magic + "6676617367636c73)"},
      {{{0, 0x6576617367636c00}, {kVersionAt, 2}}, magic + "6576617367636c00)"},
      {{{kVersionAt, 2}}, version + "2)"},
      {{{kVersionAt, 0}, {kFastOffsetAt, 0}}, version + "0)"},
      {{{kSlowLengthAt, 11}}, large + "636, got 635)"},
      {{{kSlowOffsetAt, 636}}, large + "646, got 635)"},
      {{{kSlowLengthAt, UINT64_MAX - 624}}, large + "18446744073709551615, got 635)"},
      {{{kFastOffsetAt, 0}, {kSlowLengthAt, 1000}}, large + "1625, got 635)"},
      {{{kFastOffsetAt, 47}}, offsets + "47 577 625 10)"},
      {{{kFastLengthAt, 578}}, offsets + "48 578 625 10)"},
      {{{kFastOffsetAt, UINT64_MAX - 9}, {kFastLengthAt, 20}},
       offsets + "18446744073709551606 20 625 10)"},
      {{{kFastLengthAt, UINT64_MAX}}, offsets + "48 18446744073709551615 625 10)"},
  };
  for (const auto& [puts, message] : rows) {
    SCOPED_TRACE(message);
    Bytes bad = good;
    for (const auto& [at, value] : puts) PutU64(&bad, at, value);
    bad.resize(puts.empty() ? 47 : bad.size());
    host::Log::Clear();
    EXPECT_EQ(Restore(bad, f_), ZEL_FAILURE);
    const std::vector<host::LogRecord> records = host::Log::Records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(std::make_tuple(records[0].text, records[0].urgency, records[0].object),
              std::make_tuple(message, 2, std::string("vnic0")));
    ExpectUntouched(f_);
  }
}

// Hostile saved state: every header field corrupted in turn (alone or with a
// second one, sums past 2^64 included), then rule counts running past the
// fast path part, for both versions. Restored, or rejected with a message and
// the filter unchanged. Seeded and replayable: MIGRATION_FUZZ_SEED.
TEST_F(SaveRestoreTest, HostileStateRestoresOrIsRejectedWithoutChange) {
  std::mt19937_64 rng(EnvOr("MIGRATION_FUZZ_SEED", 20240611));
  // Policy 1: a slow path part without a slow path is dropped, so the fast
  // part is reached whatever the slow path fields say.
  SLCGenericFilter* f = Filter(NewFilter("hostile", 1));
  constexpr size_t kRounds = 6 * 300;
  size_t accepted = 0;
  for (size_t round = 0; round < kRounds + 12; round++) {
    Bytes b = SavedState(SampleRules(round % 2 == 0 ? 8 : 7), Pattern(24));
    const uint64_t n = b.size(), m = UINT64_MAX;
    const uint64_t values[] = {0, 1, 47, 48, n - 1, n, n + 1, 1ull << 32, m - n, m - 47, m, rng()};
    if (round < kRounds) {
      PutU64(&b, 8 * (round % 6), values[rng() % std::size(values)]);
      if (rng() % 2 != 0) PutU64(&b, 8 * (2 + rng() % 4), values[rng() % std::size(values)]);
    } else {
      const uint32_t count = round % 3 == 0 ? 3 : round % 3 == 1 ? UINT32_MAX : 3 + rng() % 1000000;
      std::copy_n(reinterpret_cast<const uint8_t*>(&count), 4, b.begin() + 48 + 3);
    }
    ASSERT_EQ(Install(f, Baseline()), ZEL_OK);
    host::Log::Clear();
    const ZelStatus status = Restore(b, f);
    EXPECT_EQ(Of(f), kIdle);
    if (status == ZEL_OK && round < kRounds && ++accepted) continue;
    EXPECT_EQ(status, ZEL_FAILURE) << round;
    const std::vector<host::LogRecord> records = host::Log::Records();
    ASSERT_FALSE(records.empty());
    EXPECT_EQ(records.back().urgency, 2);
    EXPECT_TRUE(round < kRounds ||
                records.back().text == "Failed to restore fast path agent state");
    EXPECT_EQ(Rules(f), Baseline());
  }
  EXPECT_GT(accepted, 0u);
}

}  // namespace
