// Saved state from an untrusted source: randomly corrupted headers and
// firewall parts. Whatever arrives, a restore either succeeds or leaves the
// filter exactly as it was, and never reads outside the buffer (run under
// the address sanitizer to check the latter: every buffer is a heap block
// of exactly its length).
//
// Seeded and replayable: MIGRATION_FUZZ_SEED and MIGRATION_FUZZ_ROUNDS
// override the defaults; a failure prints the seed and the round.
#include <gtest/gtest.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <memory>
#include <random>

#include "migration/migration.h"
#include "tests/support/migration_support.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using migsupport::Bytes;
using migsupport::ExactRule;

uint64_t EnvOr(const char* name, uint64_t fallback) {
  const char* v = std::getenv(name);
  return v != nullptr ? std::strtoull(v, nullptr, 0) : fallback;
}

Bytes Baseline() {
  return rules::RulesetBuilder(8)
      .Add(ExactRule("accept", "udp", "192.168.0.1", 5, "192.168.0.2", 6))
      .Bytes();
}

Bytes SourceRules() {
  return rules::RulesetBuilder(8)
      .Add(ExactRule("drop", "tcp", "10.0.0.1", 1000, "10.0.0.2", 80))
      .Add("action=punt ipv4 ethtype=0x0800 proto=udp da=10.9.0.0-10.9.0.255")
      .Add(ExactRule("copy", "tcp", "10.0.0.1", 7, "10.0.0.3", 8))
      .Bytes();
}

class HostileStateTest : public testsupport::ModuleTest {};

TEST_F(HostileStateTest, CorruptedStateRestoresOrChangesNothing) {
  const uint64_t seed = EnvOr("MIGRATION_FUZZ_SEED", 20240611);
  const uint64_t rounds = EnvOr("MIGRATION_FUZZ_ROUNDS", 3000);
  std::mt19937_64 rng(seed);

  // Failure policy 1: a slow path part without a slow path is dropped, so
  // the firewall's part is reached whatever the slow path fields say.
  host::FilterConfig config;
  config.name = "hostile";
  config.failurePolicy = 1;
  SLCGenericFilter* f = Filter(CreateFilter(testsupport::kDefaultAgent, config));
  ASSERT_EQ(migsupport::Install(f, Baseline()), ZEL_OK);
  const Bytes baseline = migsupport::Rules(f);

  Bytes slow(24);
  for (size_t i = 0; i < slow.size(); i++) slow[i] = static_cast<uint8_t>(i);
  const Bytes good = migsupport::SavedState(SourceRules(), slow);

  auto pick = [&](uint64_t n) { return static_cast<uint64_t>(rng() % n); };
  auto interesting = [&](uint64_t len) -> uint64_t {
    const uint64_t values[] = {0,        1,          47,         48,         63,
                               len - 1,  len,        len + 1,    len / 2,    uint64_t{1} << 32,
                               UINT64_MAX, UINT64_MAX - 47, UINT64_MAX - len, uint64_t{1} << 63,
                               rng()};
    return values[pick(std::size(values))];
  };

  uint64_t restored = 0;
  for (uint64_t round = 0; round < rounds; round++) {
    SCOPED_TRACE(testing::Message() << "seed " << seed << " round " << round);
    Bytes b = good;
    const int mutations = 1 + static_cast<int>(pick(3));
    for (int m = 0; m < mutations; m++) {
      switch (pick(6)) {
        case 0:  // one header field (past the magic and version: those only reject)
          migsupport::PutU64(&b, 16 + 8 * pick(4), interesting(b.size()));
          break;
        case 1:  // the ruleset's version byte
          b[48] = static_cast<uint8_t>(std::array<int, 6>{0, 6, 7, 8, 9, 255}[pick(6)]);
          break;
        case 2: {  // the ruleset's rule count
          const uint32_t counts[] = {0, 1, 2, 3, 4, 0xffffffffu, static_cast<uint32_t>(rng())};
          const uint32_t n = counts[pick(std::size(counts))];
          std::memcpy(b.data() + 48 + 3, &n, 4);
          break;
        }
        case 3:  // cut the buffer short
          b.resize(pick(b.size() + 1));
          break;
        case 4:  // random bytes anywhere past the magic
          if (b.size() > 8) b[8 + pick(b.size() - 8)] = static_cast<uint8_t>(rng());
          break;
        default:  // the whole header
          if (b.size() >= 48) {
            for (size_t at = 8; at < 48; at += 8) {
              if (pick(2) != 0) migsupport::PutU64(&b, at, interesting(b.size()));
            }
          }
          break;
      }
    }

    auto exact = std::make_unique<uint8_t[]>(b.size() == 0 ? 1 : b.size());
    if (!b.empty()) std::memcpy(exact.get(), b.data(), b.size());
    const ZelStatus status = SLCGenericRestoreState(f, exact.get(), b.size());

    EXPECT_EQ(migsupport::MigrationState(f), SLCGenericStateIdle);
    EXPECT_EQ(migsupport::RefCount(f), 1u);
    if (status == ZEL_OK) {
      restored++;
      ASSERT_EQ(migsupport::Install(f, Baseline()), ZEL_OK);
    } else {
      EXPECT_EQ(status, ZEL_FAILURE);
      ASSERT_EQ(migsupport::Rules(f), baseline);
    }
    host::Log::Clear();
  }
  // The mutations are mild enough that some buffers still restore.
  EXPECT_GT(restored, 0u);
  EXPECT_TRUE(host::Sluice::Requests(host::RequestKind::RestoreState).empty());
}

}  // namespace
