// The per-agent ruleset property: the ordered checks of a write, and read
// and poll agreeing byte for byte.
#include <cstdio>

#include "tests/control/control_test_util.h"

namespace {

using namespace controltest;

using PropertyTest = FilterTest;
// The bytes cut or padded to n, with a u32 at `at`.
Bytes With(Bytes b, size_t n, size_t at, uint32_t v) { return b.resize(n), PutU32(&b, at, v), b; }
const ZelSluicePropOps* Ops() { return host::Sluice::PropertyOps(kProp); }

// Checks in order, the first failure ending the write: data, version
// (whatever the length), header present, exact length (in 64 bits), filter.
TEST_F(PropertyTest, WriteChecksRunInOrderWithTheirStatusAndMessage) {
  SLCGenericFilter bare{};
  char notFound[64];
  std::snprintf(notFound, sizeof(notFound), "Filter not found: %p", static_cast<void*>(&bare));
  const Bytes good = Ruleset({kRuleA, kRuleB}, 7);  // 533 bytes
  const std::string len7 = "Invalid ruleset length for version 7(ruleSize = 259). Got ";
  enum Via { kHost, kNoData, kBare };
  const struct { Via via; Bytes data; ZelStatus status; std::string log; } rows[] = {
      {kNoData, good, ZEL_BAD_PARAM, "Invalid ruleset"},
      {kHost, {9}, ZEL_NOT_SUPPORTED, "Invalid ruleset version. Got 9, expecting 8"},
      {kBare, {9}, ZEL_NOT_SUPPORTED, "Invalid ruleset version. Got 9, expecting 8"},
      {kHost, {}, ZEL_BAD_PARAM, "Invalid ruleset"},
      {kHost, With(good, 14, 7, 0), ZEL_BAD_PARAM, "Invalid ruleset"},
      {kHost, With(good, 532, 7, 0), ZEL_BAD_PARAM, len7 + "532, expecting 533"},
      {kBare, With(good, 532, 7, 0), ZEL_BAD_PARAM, len7 + "532, expecting 533"},
      {kHost, With(good, 534, 7, 0), ZEL_BAD_PARAM, len7 + "534, expecting 533"},
      {kHost, With({8}, 15, 3, 0xffffffffu), ZEL_BAD_PARAM,
       "Invalid ruleset length for version 8(ruleSize = 281). Got 15, expecting 1206885809910"},
      {kBare, good, ZEL_INVALID_STATE, notFound},
  };
  for (const auto& r : rows) {
    host::Log::Clear();
    const ZelStatus s = r.via == kHost ? PropWrite(r.data)
                                       : Ops()->write(r.via == kBare ? &bare : Filter(id_), nullptr,
                                                      r.via == kNoData ? nullptr : r.data.data(),
                                                      uint32_t(r.data.size()));
    EXPECT_EQ(s, r.status) << r.log;
    EXPECT_EQ(host::Log::Records().size(), 1u) << r.log;
    EXPECT_TRUE(host::Log::Contains(r.log, 2)) << r.log;
  }
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(Ops()->write(nullptr, nullptr, good.data(), uint32_t(good.size())), ZEL_INVALID_STATE);
  uint32_t size = 0;
  EXPECT_FALSE(Ops()->poll(&bare, nullptr, &size) || Ops()->poll(nullptr, nullptr, &size));
  EXPECT_EQ(Ops()->read(&bare, nullptr, &size), ZEL_FAILURE);
}

// A fresh filter reads as an empty version-8 ruleset; what was written reads
// back unchanged in either version (general rules in their order). The host
// reads into a buffer of the polled size and fails a read that writes past it.
TEST_F(PropertyTest, PollAndReadAgreeWithWhatWasWritten) {
  auto readBack = [&] {
    Bytes out;
    ZelStatus status = ZEL_FAILURE;
    EXPECT_TRUE(host::Sluice::PropertyRead(kProp, id_, &out, &status) && status == ZEL_OK);
    return out;
  };
  const Bytes empty = {8, 8, 7, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  EXPECT_EQ(readBack(), empty);
  for (const Bytes& written : {Ruleset({kRuleA, kRuleB, kRuleA + " sport=1"}, 7),
                               Ruleset({kRuleB, "ipv6 sa=2001:db8::1 sport=!80", kRuleA}), empty}) {
    ASSERT_EQ(PropWrite(written), ZEL_OK);
    EXPECT_EQ(readBack(), written);
  }
  EXPECT_TRUE(host::Log::Contains("Got SLCGenericPropWrite of length 792", 1));
  EXPECT_NE(ctx_->ruleHash, nullptr);  // an empty ruleset leaves an empty table
}

}  // namespace
