// Source side of a migration: prefetch, the retrieve reply, length and save.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <memory>

#include "migration/migration.h"
#include "module/locks.h"
#include "tests/support/migration_support.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using migsupport::Bytes;
using migsupport::ExactRule;
using migsupport::GetU32;
using migsupport::GetU64;
using migsupport::MigrationState;
using migsupport::RefCount;

constexpr uint32_t kSlowPathId = 7;

class SaveTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = CreateFilter();
    f_ = Filter(id_);
  }

  void AttachSlowPath() {
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, kSlowPathId), ZEL_OK);
    host::Timers::RunDue();
    SLCGenericSpinGuard guard(f_->lock);
    ASSERT_EQ(f_->spAttachState, SLCGenericSpAttached);
  }

  void SetRetrieve(host::ReplyMode mode, Bytes data, ZelStatus replyStatus = ZEL_OK,
                   ZelStatus refuse = ZEL_OK) {
    host::RequestPolicy p;
    p.mode = mode;
    p.replyData = std::move(data);
    p.replyStatus = replyStatus;
    p.refuse = refuse;
    host::Sluice::SetPolicy(host::RequestKind::RetrieveState, p);
  }

  uint64_t Length(ZelStatus expect = ZEL_OK) {
    uint64_t len = 0;
    EXPECT_EQ(SLCGenericGetSavedStateLen(f_, &len), expect);
    return len;
  }

  uint64_t HeapBytes() { return host::Heaps::Stats(host::Heaps::ModuleHeap()).bytes; }

  host::FilterId id_ = 0;
  SLCGenericFilter* f_ = nullptr;
};

Bytes Pattern(size_t n, uint8_t first = 1) {
  Bytes b(n);
  for (size_t i = 0; i < n; i++) b[i] = static_cast<uint8_t>(first + i * 7);
  return b;
}

// --- layout ------------------------------------------------------------------

TEST_F(SaveTest, EmptyFilterWithoutSlowPathSavesHeaderAndEmptyRulesetOnce) {
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateReady);
  EXPECT_TRUE(host::Sluice::Requests(host::RequestKind::RetrieveState).empty());
  EXPECT_EQ(Length(), 63u);

  migsupport::SaveResult r = migsupport::Save(f_);
  ASSERT_EQ(r.saveStatus, ZEL_OK);
  ASSERT_EQ(r.bytes.size(), 63u);
  EXPECT_EQ(std::memcmp(r.bytes.data(), "slcgsave", 8), 0);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kVersionAt), 1u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kFastOffsetAt), 48u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kFastLengthAt), 15u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowOffsetAt), 63u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowLengthAt), 0u);
  // A never-configured filter writes version 8, supported 8..7, no rules.
  const Bytes expect = {8, 8, 7, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  EXPECT_EQ(Bytes(r.bytes.begin() + 48, r.bytes.end()), expect);

  // One-shot: the next save needs a new prefetch.
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  uint64_t len = r.bytes.size();
  EXPECT_EQ(SLCGenericSaveState(f_, r.bytes.data(), &len), ZEL_INVALID_STATE);
  EXPECT_EQ(host::Log::Count("Unexpected request to save state", 2), 1u);
}

TEST_F(SaveTest, Version7RulesAreSizedForVersion8AndLeaveAZeroTail) {
  const Bytes ruleset =
      rules::RulesetBuilder(7)
          .Features(FW_FEATURE_DROP_BPDU)
          .FragOverride(SLCGenericActionDrop)
          .Add(ExactRule("drop", "tcp", "10.0.0.1", 1000, "10.0.0.2", 80))
          .Add(ExactRule("accept", "udp", "10.0.0.1", 53, "10.0.0.3", 53))
          .Add("action=punt ipv4 ethtype=0x0800 proto=tcp da=10.1.0.0-10.1.255.255")
          .Bytes();
  ASSERT_EQ(ruleset.size(), 15u + 3 * 259);
  ASSERT_EQ(migsupport::Install(f_, ruleset), ZEL_OK);

  const Bytes inForce = migsupport::Rules(f_);
  ASSERT_EQ(inForce.size(), 792u);

  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(Length(), 906u);
  migsupport::SaveResult r = migsupport::Save(f_);
  ASSERT_EQ(r.saveStatus, ZEL_OK);
  ASSERT_EQ(r.bytes.size(), 906u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kFastLengthAt), 858u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowOffsetAt), 906u);
  const Bytes part(r.bytes.begin() + 48, r.bytes.begin() + 48 + 792);
  EXPECT_EQ(part, inForce);
  EXPECT_EQ(Bytes(r.bytes.begin() + 48 + 792, r.bytes.end()), Bytes(66, 0));
  // Zero counters and bit 9 clear again: the records are those sent, the
  // exact ones in table order, then the general one.
  EXPECT_EQ(Bytes(part.begin(), part.begin() + 15), Bytes(ruleset.begin(), ruleset.begin() + 15));
  std::vector<Bytes> saved = migsupport::Records(part);
  std::vector<Bytes> sent = migsupport::Records(ruleset);
  EXPECT_EQ(saved.back(), sent.back());
  std::sort(saved.begin(), saved.end());
  std::sort(sent.begin(), sent.end());
  EXPECT_EQ(saved, sent);
}

// --- prefetch and the retrieve reply -------------------------------------------

TEST_F(SaveTest, FetchedSlowPathStateIsAppendedUnchanged) {
  AttachSlowPath();
  const Bytes state = Pattern(100);
  SetRetrieve(host::ReplyMode::Deferred, state);

  SLCGenericPrefetchSavedState(f_);
  auto requests = host::Sluice::Requests(host::RequestKind::RetrieveState);
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].timeoutMs, 2000u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateFetching);
  EXPECT_EQ(RefCount(f_), 2u);  // the framework's and the outstanding reply's

  EXPECT_EQ(Length(ZEL_NOT_READY), 0u);
  EXPECT_EQ(host::Log::Count("Slow path agent state is not yet available", 1), 1u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateFetching);

  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RetrieveState), 1u);
  EXPECT_EQ(RefCount(f_), 1u);
  EXPECT_EQ(Length(), 48u + 15 + 100);

  migsupport::SaveResult r = migsupport::Save(f_);
  ASSERT_EQ(r.saveStatus, ZEL_OK);
  ASSERT_EQ(r.bytes.size(), 163u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowOffsetAt), 63u);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowLengthAt), 100u);
  EXPECT_EQ(Bytes(r.bytes.begin() + 63, r.bytes.end()), state);
}

// The reply may come before the request call returns (the lock must be
// free then) or from another thread.
TEST_F(SaveTest, ReplyInsideTheCallOrFromAnotherThreadCompletesTheFetch) {
  AttachSlowPath();
  for (host::ReplyMode mode : {host::ReplyMode::Inline, host::ReplyMode::OtherThread}) {
    SetRetrieve(mode, Pattern(33, static_cast<uint8_t>(mode)));
    SLCGenericPrefetchSavedState(f_);
    host::Sluice::WaitReplies();
    EXPECT_EQ(MigrationState(f_), SLCGenericStateReady);
    EXPECT_EQ(RefCount(f_), 1u);
    migsupport::SaveResult r = migsupport::Save(f_);
    ASSERT_EQ(r.saveStatus, ZEL_OK);
    EXPECT_EQ(Bytes(r.bytes.end() - 33, r.bytes.end()), Pattern(33, static_cast<uint8_t>(mode)));
  }
}

TEST_F(SaveTest, EmptyReplyMakesTheFilterReadyWithoutSlowPathPart) {
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Inline, {});
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateReady);
  EXPECT_EQ(Length(), 63u);
}

TEST_F(SaveTest, FailedReplyOrRefusedRequestLeavesTheFilterIdle) {
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Inline, Pattern(10), ZEL_WOULD_BLOCK);
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(host::Log::Count(std::string("Failed to retrieve slow path state (0xbad0006): ") +
                                 zel_StatusToString(ZEL_WOULD_BLOCK),
                             1),
            1u);
  EXPECT_EQ(Length(ZEL_FAILURE), 0u);  // idle: no message, general failure
  EXPECT_EQ(RefCount(f_), 1u);

  SetRetrieve(host::ReplyMode::Inline, Pattern(10), ZEL_OK, ZEL_BUSY);
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(host::Log::Count(std::string("Requesting slow path state failed (0xbad0004): ") +
                                 zel_StatusToString(ZEL_BUSY),
                             2),
            1u);
  // No reply will come for a refused request: both references are gone.
  EXPECT_EQ(RefCount(f_), 1u);
  EXPECT_EQ(host::Sluice::PendingReplies(host::RequestKind::RetrieveState), 0u);
}

TEST_F(SaveTest, SecondPrefetchWhileFetchingIsIgnored) {
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Deferred, Pattern(20));
  SLCGenericPrefetchSavedState(f_);
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(host::Log::Count("Ignoring state prefetch request; wrong state (2)", 1), 1u);
  EXPECT_EQ(host::Sluice::Requests(host::RequestKind::RetrieveState).size(), 1u);
  EXPECT_EQ(RefCount(f_), 2u);

  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RetrieveState), 1u);
  EXPECT_EQ(Length(), 48u + 15 + 20);
  EXPECT_EQ(RefCount(f_), 1u);
}

TEST_F(SaveTest, OutstandingReplyKeepsTheFilterFromBeingDestroyed) {
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Deferred, Pattern(20));
  SLCGenericPrefetchSavedState(f_);
  // Destroy detaches the slow path (fetching -> ready) but must not free
  // the record while the reply holds its reference.
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_BUSY);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateReady);
  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RetrieveState), 1u);
  EXPECT_EQ(host::Log::Count("Ignoring slow path state reply; wrong state (3)", 1), 1u);
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_OK);
}

TEST_F(SaveTest, DetachWhileFetchingSavesWithoutSlowPathPartAndLateReplyOnlyReleases) {
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Deferred, Pattern(20));
  SLCGenericPrefetchSavedState(f_);
  ASSERT_EQ(host::Sluice::UnregisterSlowPath(testsupport::kDefaultAgent, kSlowPathId), ZEL_OK);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateReady);
  EXPECT_EQ(Length(), 63u);

  const uint64_t heapBefore = HeapBytes();
  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RetrieveState), 1u);
  EXPECT_EQ(host::Log::Count("Ignoring slow path state reply; wrong state (3)", 1), 1u);
  EXPECT_EQ(HeapBytes(), heapBefore);  // nothing kept
  EXPECT_EQ(RefCount(f_), 1u);
  migsupport::SaveResult r = migsupport::Save(f_);
  ASSERT_EQ(r.saveStatus, ZEL_OK);
  EXPECT_EQ(GetU64(r.bytes, migsupport::kSlowLengthAt), 0u);
}

TEST_F(SaveTest, ReplyTheHeapCannotServeIsRefusedLikeAFailedAllocation) {
  // A heap of 1 MiB cannot hold a 2 MiB state.
  Unload();
  Load({{"SLCGENERIC_HEAP_MAX_SIZE", 1 << 20}});
  id_ = CreateFilter();
  f_ = Filter(id_);
  AttachSlowPath();
  SetRetrieve(host::ReplyMode::Inline, Bytes(2u << 20, 0x5a));
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(host::Log::Count("Failed to alloc 2097152 bytes for state buffer", 1), 1u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(RefCount(f_), 1u);

  // A length the 32-bit allocator cannot even be asked for: refused before
  // any byte of the (short) data is read. The test stands in for the
  // framework and holds the reply's reference itself.
  SetRetrieve(host::ReplyMode::Deferred, Pattern(8));
  SLCGenericPrefetchSavedState(f_);
  {
    SLCGenericSpinGuard guard(f_->lock);
    f_->refCount++;
  }
  const uint8_t small[8] = {};
  SLCGenericRetrieveSlowPathReply(f_, nullptr, small, uint64_t{1} << 32, ZEL_OK);
  EXPECT_EQ(host::Log::Count("Failed to alloc 4294967296 bytes for state buffer", 1), 1u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RetrieveState), 1u);
  EXPECT_EQ(host::Log::Count("Ignoring slow path state reply; wrong state (1)", 1), 1u);
  EXPECT_EQ(RefCount(f_), 1u);
}

// --- length and save ------------------------------------------------------------

TEST_F(SaveTest, BufferOneByteShortIsRefusedUntouchedAndDropsTheFetchedState) {
  AttachSlowPath();
  const uint64_t heapBefore = HeapBytes();
  SetRetrieve(host::ReplyMode::Inline, Pattern(40));
  SLCGenericPrefetchSavedState(f_);
  const uint64_t len = Length();
  ASSERT_EQ(len, 48u + 15 + 40);

  Bytes buf(len - 1, 0xA5);
  uint64_t size = buf.size();
  EXPECT_EQ(SLCGenericSaveState(f_, buf.data(), &size), ZEL_BUF_TOO_SMALL);
  EXPECT_EQ(host::Log::Count("Buffer too short for saved state (requested 103, got 102)", 2), 1u);
  EXPECT_EQ(buf, Bytes(len - 1, 0xA5));
  EXPECT_EQ(size, len - 1);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(HeapBytes(), heapBefore);
  Length(ZEL_FAILURE);  // a new prefetch is needed
}

TEST_F(SaveTest, NullArgumentsDiscardTheFetchedState) {
  AttachSlowPath();
  const uint64_t heapBefore = HeapBytes();
  SetRetrieve(host::ReplyMode::Inline, Pattern(40));

  SLCGenericPrefetchSavedState(f_);
  ASSERT_GT(HeapBytes(), heapBefore);
  EXPECT_EQ(SLCGenericGetSavedStateLen(f_, nullptr), ZEL_OK);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(HeapBytes(), heapBefore);

  for (int which = 0; which < 2; which++) {
    SLCGenericPrefetchSavedState(f_);
    ASSERT_EQ(MigrationState(f_), SLCGenericStateReady);
    uint8_t buf[256];
    uint64_t len = sizeof(buf);
    EXPECT_EQ(SLCGenericSaveState(f_, which == 0 ? nullptr : buf, which == 0 ? &len : nullptr),
              ZEL_OK);
    EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
    EXPECT_EQ(HeapBytes(), heapBefore);
  }
}

TEST_F(SaveTest, RecordWithBadMagicIsNotTouched) {
  Bytes fake(sizeof(SLCGenericFilter), 0x33);
  const Bytes before = fake;
  uint64_t len = 99;
  SLCGenericPrefetchSavedState(fake.data());
  EXPECT_EQ(SLCGenericGetSavedStateLen(fake.data(), &len), ZEL_BAD_PARAM);
  EXPECT_EQ(SLCGenericSaveState(fake.data(), fake.data(), &len), ZEL_BAD_PARAM);
  SLCGenericRetrieveSlowPathReply(fake.data(), nullptr, nullptr, 5, ZEL_OK);
  EXPECT_EQ(host::Log::Count("Bad magic for filter", 2), 4u);
  EXPECT_EQ(fake, before);
  EXPECT_EQ(len, 99u);
}

// --- the firewall's part -----------------------------------------------------------

// Rules applied between the length computation and the write must not make
// the agent write past the room it was given.
TEST_F(SaveTest, FirewallPartNeverWritesPastItsRoom) {
  rules::RulesetBuilder builder(8);
  for (const char* da : {"10.0.0.2", "10.0.0.3", "10.0.0.4"}) {
    builder.Add(ExactRule("drop", "tcp", "10.0.0.1", 1000, da, 80));
  }
  ASSERT_EQ(migsupport::Install(f_, builder.Bytes()), ZEL_OK);
  const Bytes whole = migsupport::Rules(f_);
  ASSERT_EQ(whole.size(), 15u + 3 * 281);

  SLCGenericSpinGuard guard(f_->lock);
  EXPECT_EQ(FWGetSavedStateLen(f_), 15u + 3 * 281);
  // Exactly sized heap blocks, so a write past the room trips the sanitizer.
  const uint32_t room = 15 + 2 * 281 + 100;
  auto part = std::make_unique<uint8_t[]>(room);
  std::memset(part.get(), 0, room);
  FWSaveState(f_, part.get(), room);
  EXPECT_EQ(GetU32(Bytes(part.get(), part.get() + 15), 3), 2u);
  EXPECT_EQ(Bytes(part.get() + 15, part.get() + 15 + 2 * 281),
            Bytes(whole.begin() + 15, whole.begin() + 15 + 2 * 281));
  EXPECT_EQ(Bytes(part.get() + 15 + 2 * 281, part.get() + room), Bytes(100, 0));

  auto tiny = std::make_unique<uint8_t[]>(10);
  std::memset(tiny.get(), 0, 10);
  FWSaveState(f_, tiny.get(), 10);
  EXPECT_EQ(Bytes(tiny.get(), tiny.get() + 10), Bytes(10, 0));
}

}  // namespace
