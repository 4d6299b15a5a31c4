// Destination side of a migration: header checks, the firewall's part, the
// slow path part and the restore reply.
#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <functional>
#include <memory>

#include "migration/migration.h"
#include "module/locks.h"
#include "tests/support/migration_support.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using migsupport::Bytes;
using migsupport::ExactRule;
using migsupport::MigrationState;
using migsupport::PutU64;
using migsupport::RefCount;

constexpr uint32_t kSlowPathId = 9;

std::string Fmt(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string Fmt(const char* fmt, ...) {
  char buf[512];
  va_list ap;
  va_start(ap, fmt);
  vsnprintf(buf, sizeof(buf), fmt, ap);
  va_end(ap);
  return buf;
}

// The rules every destination filter starts these tests with, so that a
// refused restore can be seen to leave them alone.
Bytes Baseline() {
  return rules::RulesetBuilder(8)
      .Add(ExactRule("accept", "udp", "192.168.0.1", 5, "192.168.0.2", 6))
      .Bytes();
}

// What the saved state carries: two version-8 rules (one exact, one general)
// in a part sized as the source sizes it.
Bytes SavedRules() {
  return rules::RulesetBuilder(8)
      .Add(ExactRule("drop", "tcp", "10.0.0.1", 1000, "10.0.0.2", 80))
      .Add("action=punt ipv4 ethtype=0x0800 proto=udp da=10.9.0.0-10.9.0.255")
      .Bytes();
}

Bytes Pattern(size_t n) {
  Bytes b(n);
  for (size_t i = 0; i < n; i++) b[i] = static_cast<uint8_t>(0x40 + i * 3);
  return b;
}

class RestoreTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = NewFilter("dest0", 0);
    f_ = Filter(id_);
  }

  host::FilterId NewFilter(const std::string& name, uint32_t failurePolicy) {
    host::FilterConfig config;
    config.name = name;
    config.failurePolicy = failurePolicy;
    host::FilterId id = CreateFilter(testsupport::kDefaultAgent, config);
    EXPECT_EQ(migsupport::Install(Filter(id), Baseline()), ZEL_OK);
    return id;
  }

  void AttachSlowPath() {
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, kSlowPathId), ZEL_OK);
    host::Timers::RunDue();
    SLCGenericSpinGuard guard(f_->lock);
    ASSERT_EQ(f_->spAttachState, SLCGenericSpAttached);
  }

  void SetRestorePolicy(host::ReplyMode mode, ZelStatus replyStatus = ZEL_OK,
                        ZelStatus refuse = ZEL_OK) {
    host::RequestPolicy p;
    p.mode = mode;
    p.replyStatus = replyStatus;
    p.refuse = refuse;
    host::Sluice::SetPolicy(host::RequestKind::RestoreState, p);
  }

  // Restores from a heap block of exactly the buffer's size, so that a read
  // past it trips the address sanitizer.
  ZelStatus Restore(const Bytes& state, SLCGenericFilter* filter = nullptr) {
    auto exact = std::make_unique<uint8_t[]>(state.size());
    std::memcpy(exact.get(), state.data(), state.size());
    return SLCGenericRestoreState(filter != nullptr ? filter : f_, exact.get(), state.size());
  }

  void ExpectUntouched(SLCGenericFilter* filter) {
    EXPECT_EQ(migsupport::Rules(filter), Baseline());
    EXPECT_EQ(MigrationState(filter), SLCGenericStateIdle);
    EXPECT_EQ(RefCount(filter), 1u);
    EXPECT_TRUE(host::Sluice::Requests(host::RequestKind::RestoreState).empty());
  }

  host::FilterId id_ = 0;
  SLCGenericFilter* f_ = nullptr;
};

// --- buffers that restore ----------------------------------------------------------

TEST_F(RestoreTest, EmptySavedStateReplacesTheRulesWithNone) {
  const Bytes state = migsupport::SavedState(rules::RulesetBuilder(8).Bytes());
  ASSERT_EQ(state.size(), 63u);
  EXPECT_EQ(Restore(state), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Finished restoring state", 1), 1u);
  FWFilterContext* ctx = Ctx(id_);
  EXPECT_EQ(ctx->numRules, 0u);
  EXPECT_NE(ctx->ruleHash, nullptr);  // an empty ruleset in force, not none
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
}

TEST_F(RestoreTest, HeaderWithoutPartsSucceedsWithoutCallingTheAgent) {
  const Bytes state = migsupport::SavedState({});
  ASSERT_EQ(state.size(), 48u);
  host::Log::Clear();
  EXPECT_EQ(Restore(state), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Finished restoring state", 1), 1u);
  EXPECT_EQ(host::Log::CountContaining("Applying"), 0u);
  ExpectUntouched(f_);
}

TEST_F(RestoreTest, NoBufferOrZeroLengthIsIgnored) {
  host::Log::Clear();
  const Bytes state = migsupport::SavedState(SavedRules());
  EXPECT_EQ(SLCGenericRestoreState(f_, nullptr, state.size()), ZEL_OK);
  EXPECT_EQ(SLCGenericRestoreState(f_, state.data(), 0), ZEL_OK);
  EXPECT_TRUE(host::Log::Records().empty());
  ExpectUntouched(f_);
}

TEST_F(RestoreTest, GapBetweenThePartsIsAccepted) {
  Bytes state = migsupport::SavedState(SavedRules());
  state.insert(state.end(), 5, 0xEE);
  PutU64(&state, migsupport::kSlowOffsetAt, state.size());
  EXPECT_EQ(Restore(state), ZEL_OK);
  EXPECT_EQ(migsupport::Rules(f_), SavedRules());
}

TEST_F(RestoreTest, Version7RulesetInAPartSizedForVersion8) {
  const Bytes v7 =
      rules::RulesetBuilder(7).Add(ExactRule("drop", "tcp", "10.0.0.1", 1, "10.0.0.2", 2)).Bytes();
  Bytes part = v7;
  part.resize(15 + 281, 0);  // as the source writes it: a zero tail
  EXPECT_EQ(Restore(migsupport::SavedState(part)), ZEL_OK);
  EXPECT_EQ(migsupport::Rules(f_), v7);
}

// --- header checks ---------------------------------------------------------------------

struct HeaderCase {
  const char* what;
  std::function<void(Bytes*)> corrupt;
  // Message expected, given the corrupted buffer.
  std::function<std::string(const Bytes&)> message;
};

std::string OffsetsMessage(const Bytes& b) {
  return Fmt("Bad state header offsets (%" PRIu64 " %" PRIu64 " %" PRIu64 " %" PRIu64 ")",
             migsupport::GetU64(b, migsupport::kFastOffsetAt),
             migsupport::GetU64(b, migsupport::kFastLengthAt),
             migsupport::GetU64(b, migsupport::kSlowOffsetAt),
             migsupport::GetU64(b, migsupport::kSlowLengthAt));
}

std::string NotLargeEnough(uint64_t expected, const Bytes& b) {
  return Fmt("Buffer not large enough (expected %" PRIu64 ", got %zu)", expected, b.size());
}

// Every check in its order: each case breaks one thing (or several, to show
// that the first check in order reports), and each rejection must leave the
// filter exactly as it was, without taking part in any request.
TEST_F(RestoreTest, HeaderChecksRejectInOrderAndChangeNothing) {
  const Bytes slow = Pattern(10);
  const Bytes good = migsupport::SavedState(SavedRules(), slow);
  const uint64_t fastLen = SavedRules().size();
  const uint64_t slowOff = 48 + fastLen;
  const uint64_t kMax = UINT64_MAX;
  using migsupport::kFastLengthAt;
  using migsupport::kFastOffsetAt;
  using migsupport::kSlowLengthAt;
  using migsupport::kSlowOffsetAt;
  using migsupport::kVersionAt;

  const std::vector<HeaderCase> cases = {
      {"47 bytes", [](Bytes* b) { b->resize(47); },
       [](const Bytes&) { return std::string("Buffer too short for header (47 bytes)"); }},
      {"magic", [](Bytes* b) { (*b)[7] = 'f'; },
       [](const Bytes&) {
         return Fmt("Bad state header magic (got 0x%" PRIx64 ")",
                    uint64_t{0x6676617367636c73});  // "slcgsavf" read little-endian
       }},
      {"magic before version", [](Bytes* b) { (*b)[0] = 0; PutU64(b, kVersionAt, 2); },
       [](const Bytes&) { return std::string("Bad state header magic (got 0x6576617367636c00)"); }},
      {"version 2", [](Bytes* b) { PutU64(b, kVersionAt, 2); },
       [](const Bytes&) { return std::string("Bad state header verison (expected 1, got 2)"); }},
      {"version 0 before offsets",
       [](Bytes* b) { PutU64(b, kVersionAt, 0); PutU64(b, kFastOffsetAt, 0); },
       [](const Bytes&) { return std::string("Bad state header verison (expected 1, got 0)"); }},
      {"slow part one byte past the end",
       [](Bytes* b) { PutU64(b, kSlowLengthAt, 11); },
       [&](const Bytes& b) { return NotLargeEnough(b.size() + 1, b); }},
      {"slow offset past the end", [](Bytes* b) { PutU64(b, kSlowOffsetAt, b->size() + 1); },
       [&](const Bytes& b) { return NotLargeEnough(b.size() + 11, b); }},
      {"slow sum passes 2^64 by one",
       [&](Bytes* b) { PutU64(b, kSlowLengthAt, kMax - slowOff + 1); },
       [&](const Bytes& b) { return NotLargeEnough(kMax, b); }},
      {"slow offset at 2^64-1", [](Bytes* b) { PutU64(b, kSlowOffsetAt, UINT64_MAX); },
       [&](const Bytes& b) { return NotLargeEnough(kMax, b); }},
      {"slow part checked before offsets",
       [](Bytes* b) { PutU64(b, kFastOffsetAt, 0); PutU64(b, kSlowLengthAt, 1000); },
       [&](const Bytes& b) { return NotLargeEnough(slowOff + 1000, b); }},
      {"fast offset 40", [](Bytes* b) { PutU64(b, kFastOffsetAt, 40); }, OffsetsMessage},
      {"fast offset 47", [](Bytes* b) { PutU64(b, kFastOffsetAt, 47); }, OffsetsMessage},
      {"fast part one byte into the slow part",
       [&](Bytes* b) { PutU64(b, kFastLengthAt, fastLen + 1); }, OffsetsMessage},
      {"fast sum wraps past 2^64",
       [](Bytes* b) { PutU64(b, kFastOffsetAt, UINT64_MAX - 9); PutU64(b, kFastLengthAt, 20); },
       OffsetsMessage},
      {"fast length 2^64-1", [](Bytes* b) { PutU64(b, kFastLengthAt, UINT64_MAX); },
       OffsetsMessage},
  };

  for (const HeaderCase& c : cases) {
    SCOPED_TRACE(c.what);
    Bytes bad = good;
    c.corrupt(&bad);
    host::Log::Clear();
    EXPECT_EQ(Restore(bad), ZEL_FAILURE);
    const std::vector<host::LogRecord> records = host::Log::Records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].text, c.message(bad));
    EXPECT_EQ(records[0].urgency, 2);
    EXPECT_EQ(records[0].object, "dest0");
    ExpectUntouched(f_);
  }
}

// --- the firewall's part ---------------------------------------------------------------

TEST_F(RestoreTest, MalformedFastPartIsRefusedWithoutReadingPastIt) {
  const Bytes rules = SavedRules();  // 2 rules, exactly 15 + 2 * 281 bytes
  struct Case {
    const char* what;
    Bytes part;
  };
  std::vector<Case> cases;
  {
    Bytes p = rules;
    p[3] = 3;  // one record more than the part holds
    cases.push_back({"count one past", p});
  }
  {
    Bytes p = rules;
    p.pop_back();  // the last record one byte short
    cases.push_back({"last record short", p});
  }
  {
    Bytes p = rules;
    std::memset(p.data() + 3, 0xff, 4);
    cases.push_back({"count 2^32-1", p});
  }
  {
    Bytes p = rules::RulesetBuilder(7).Bytes();
    p[3] = 1;  // a version-7 record of 259 bytes would follow
    p.resize(15 + 258);
    cases.push_back({"version 7 record short", p});
  }
  cases.push_back({"part shorter than a ruleset header", Bytes(rules.begin(), rules.begin() + 14)});
  {
    Bytes p = rules;
    p[0] = 9;  // left to the apply step, which refuses it from the header
    cases.push_back({"version 9", p});
  }

  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    host::Log::Clear();
    EXPECT_EQ(Restore(migsupport::SavedState(c.part)), ZEL_FAILURE);
    EXPECT_EQ(host::Log::Count("Failed to restore fast path agent state", 2), 1u);
    EXPECT_EQ(host::Log::CountContaining("Applying"), 0u);
    ExpectUntouched(f_);
  }
}

TEST_F(RestoreTest, RulesetFromTheSlowPathIsNotOverriddenByARestore) {
  Bytes ioctlRules = SavedRules();
  ioctlRules[3] = 1;
  ioctlRules.resize(15 + 281);
  ASSERT_EQ(FWSetIoctlRuleset(f_, reinterpret_cast<FWRuleset*>(ioctlRules.data()), 1), ZEL_OK);
  const Bytes before = migsupport::Rules(f_);
  EXPECT_EQ(Restore(migsupport::SavedState(Baseline())), ZEL_OK);
  EXPECT_EQ(migsupport::Rules(f_), before);
}

// --- the slow path part -------------------------------------------------------------------

TEST_F(RestoreTest, SlowPathPartWithoutSlowPathDependsOnTheFailurePolicy) {
  const Bytes state = migsupport::SavedState(SavedRules(), Pattern(10));

  EXPECT_EQ(Restore(state), ZEL_FAILURE);
  EXPECT_EQ(host::Log::Count("Have saved slow path state, but no slow path", 1), 1u);
  ExpectUntouched(f_);  // policy 0: nothing restored

  SLCGenericFilter* lenient = Filter(NewFilter("dest1", 1));
  EXPECT_EQ(Restore(state, lenient), ZEL_OK);
  EXPECT_EQ(host::Log::Count("Have saved slow path state, but no slow path", 1), 2u);
  EXPECT_EQ(host::Log::Count("Finished restoring state", 1), 1u);
  EXPECT_EQ(migsupport::Rules(lenient), SavedRules());
  EXPECT_TRUE(host::Sluice::Requests(host::RequestKind::RestoreState).empty());
}

TEST_F(RestoreTest, SlowPathPartIsSentAndTheReplyFinishesTheRestore) {
  AttachSlowPath();
  SetRestorePolicy(host::ReplyMode::Deferred);
  const Bytes slow = Pattern(77);
  const Bytes state = migsupport::SavedState(SavedRules(), slow);

  EXPECT_EQ(Restore(state), ZEL_OK);
  auto requests = host::Sluice::Requests(host::RequestKind::RestoreState);
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].data, slow);
  EXPECT_EQ(requests[0].timeoutMs, 2000u);
  EXPECT_EQ(requests[0].filter, id_);
  // The fast path part is in force before the slow path confirms.
  EXPECT_EQ(migsupport::Rules(f_), SavedRules());
  EXPECT_EQ(MigrationState(f_), SLCGenericStateRestoring);
  EXPECT_EQ(RefCount(f_), 2u);
  EXPECT_EQ(host::Log::Count("Finished restoring state"), 0u);

  EXPECT_EQ(Restore(state), ZEL_FAILURE);
  EXPECT_EQ(host::Log::Count("Ignoring state restore request; wrong state (4)", 1), 1u);
  SLCGenericPrefetchSavedState(f_);
  EXPECT_EQ(host::Log::Count("Ignoring state prefetch request; wrong state (4)", 1), 1u);
  uint64_t len = 0;
  EXPECT_EQ(SLCGenericGetSavedStateLen(f_, &len), ZEL_FAILURE);

  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RestoreState), 1u);
  EXPECT_EQ(host::Log::Count("Finished restoring slow path state", 1), 1u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
  EXPECT_EQ(RefCount(f_), 1u);
}

// The reply arrives inside the request call (the lock must be free then);
// whatever it or the request says, the restored rules stay and the filter
// ends idle with its references returned.
TEST_F(RestoreTest, SlowPathOutcomesKeepTheRestoredRules) {
  AttachSlowPath();
  struct Case {
    ZelStatus replyStatus;
    ZelStatus refuse;
    ZelStatus result;
    std::string message;
    int urgency;
  };
  const Case cases[] = {
      {ZEL_OK, ZEL_OK, ZEL_OK, "Finished restoring slow path state", 1},
      {ZEL_FAILURE, ZEL_OK, ZEL_OK,
       std::string("Failed to restore slow path state (0xbad0001): ") +
           zel_StatusToString(ZEL_FAILURE),
       2},
      {ZEL_OK, ZEL_NO_MEMORY, ZEL_NO_MEMORY,
       std::string("Couldn't request slow path state restore (0xbad0014): ") +
           zel_StatusToString(ZEL_NO_MEMORY),
       1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.message);
    ASSERT_EQ(migsupport::Install(f_, Baseline()), ZEL_OK);
    host::Log::Clear();
    SetRestorePolicy(host::ReplyMode::Inline, c.replyStatus, c.refuse);
    EXPECT_EQ(Restore(migsupport::SavedState(SavedRules(), Pattern(5))), c.result);
    EXPECT_EQ(host::Log::Count(c.message, c.urgency), 1u);
    EXPECT_EQ(migsupport::Rules(f_), SavedRules());
    EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);
    EXPECT_EQ(RefCount(f_), 1u);
  }
}

TEST_F(RestoreTest, ReplyAfterASaveResetOnlyReleasesItsReference) {
  AttachSlowPath();
  SetRestorePolicy(host::ReplyMode::Deferred);
  ASSERT_EQ(Restore(migsupport::SavedState(SavedRules(), Pattern(5))), ZEL_OK);
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_BUSY);

  uint8_t buf[64];
  uint64_t len = sizeof(buf);
  EXPECT_EQ(SLCGenericSaveState(f_, buf, &len), ZEL_INVALID_STATE);
  EXPECT_EQ(host::Log::Count("Unexpected request to save state", 2), 1u);
  EXPECT_EQ(MigrationState(f_), SLCGenericStateIdle);

  ASSERT_EQ(host::Sluice::ReleaseReplies(host::RequestKind::RestoreState), 1u);
  EXPECT_EQ(host::Log::Count("Unexpected restore slow path state reply", 2), 1u);
  EXPECT_EQ(host::Log::Count("Finished restoring slow path state"), 0u);
  EXPECT_EQ(RefCount(f_), 1u);
  EXPECT_EQ(host::Sluice::DestroyFilter(id_), ZEL_OK);
}

TEST_F(RestoreTest, RecordWithBadMagicIsNotTouched) {
  Bytes fake(sizeof(SLCGenericFilter), 0x44);
  const Bytes before = fake;
  const Bytes state = migsupport::SavedState(SavedRules());
  EXPECT_EQ(SLCGenericRestoreState(fake.data(), state.data(), state.size()), ZEL_BAD_PARAM);
  SLCGenericRestoreSlowPathReply(fake.data(), nullptr, ZEL_OK);
  EXPECT_EQ(host::Log::Count("Bad magic for filter", 2), 2u);
  EXPECT_EQ(fake, before);
}

}  // namespace
