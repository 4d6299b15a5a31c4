// Record sizes and addressing, the version-7 wildcard bit, the tuple layout
// and comparison, table sizing and entry release.
#include <gtest/gtest.h>

#include <cstring>
#include <vector>

#include "firewall/firewall.h"
#include "module/module.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::ModuleTest;

TEST(RuleSize, OnlyVersions7And8) {
  uint64_t size = 12345;
  EXPECT_EQ(FWGetRuleSize(7, &size), ZEL_OK);
  EXPECT_EQ(size, 259u);
  EXPECT_EQ(FWGetRuleSize(8, &size), ZEL_OK);
  EXPECT_EQ(size, 281u);
  for (uint32_t v : {0u, 6u, 9u, 255u, 0x107u}) {
    size = 12345;
    EXPECT_EQ(FWGetRuleSize(v, &size), ZEL_BAD_PARAM) << v;
    EXPECT_EQ(size, 12345u) << v;
  }
}

TEST(RuleSize, RecordAddressIsHeaderPlusIndexTimesSize) {
  std::vector<uint8_t> buf(15 + 3 * 281);
  auto* rs = reinterpret_cast<FWRuleset*>(buf.data());
  uint64_t size = 0;
  EXPECT_EQ(FWGetRuleFromRuleset(7, rs, 2, &size), buf.data() + 15 + 2 * 259);
  EXPECT_EQ(size, 259u);
  EXPECT_EQ(FWGetRuleFromRuleset(8, rs, 2, &size), buf.data() + 15 + 2 * 281);
  EXPECT_EQ(size, 281u);
  size = 1;
  EXPECT_EQ(FWGetRuleFromRuleset(9, rs, 0, &size), nullptr);
  EXPECT_EQ(size, 1u);
}

TEST(RuleSize, Bit9IsTouchedOnlyUpToVersion7) {
  FWRule r{};
  for (uint32_t v : {0u, 5u, 7u}) {
    r.ruleFlags = 0x11;
    FWUpdateWildcardsToCurrent(v, &r);
    EXPECT_EQ(+r.ruleFlags, 0x211u);
    FWRevertWildcardsToOriginal(v, &r);
    EXPECT_EQ(+r.ruleFlags, 0x11u);
  }
  r.ruleFlags = 0x11;
  FWUpdateWildcardsToCurrent(8, &r);
  EXPECT_EQ(+r.ruleFlags, 0x11u);
  r.ruleFlags = 0x211;
  FWRevertWildcardsToOriginal(8, &r);
  EXPECT_EQ(+r.ruleFlags, 0x211u);
}

FWRule ExactV4() {
  return rules::ParseRule(
      "dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 ethtype=0x0800 vlan=100/3 "
      "sa=10.1.2.3 da=10.4.5.6 proto=6 sport=1234 dport=80");
}
FWRule ExactV6() {
  return rules::ParseRule(
      "dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 ethtype=0x86dd vlan=none "
      "sa=2001:db8::1:2 da=2001:db8::3:4 proto=17 sport=53 dport=5353");
}

TEST(Tuple, LayoutAndHashCoverage) {
  FWRule r = ExactV4();
  FWRuleTuple t;
  std::memset(&t, 0xaa, sizeof(t));
  const uint64_t h = FWCreateTupleFromRule(&r, &t);
  const uint8_t expect4[31] = {2, 0, 0, 0, 0, 1, 2, 0, 0, 0, 0, 2, 0x08, 0x00, 0x81, 0x00,
                               0x60, 100, 10, 1, 2, 3, 10, 4, 5, 6, 6, 0x04, 0xd2, 0, 80};
  EXPECT_EQ(std::memcmp(t.bytes, expect4, 31), 0);
  for (int i = 31; i < 55; i++) EXPECT_EQ(t.bytes[i], 0xaa) << "byte " << i << " written";
  EXPECT_EQ(t.isIPv4, 1);
  EXPECT_EQ(h, HashFunc_HashBytes(t.bytes, 31));

  FWRule r6 = ExactV6();
  const uint64_t h6 = FWCreateTupleFromRule(&r6, &t);
  EXPECT_EQ(t.isIPv4, 0);
  EXPECT_EQ(std::memcmp(t.bytes, reinterpret_cast<const uint8_t*>(&r6) + 8, 55), 0);
  EXPECT_EQ(t.bytes[50], 17);
  EXPECT_EQ(FWNet16(t.bytes + 53), 5353);
  EXPECT_EQ(h6, HashFunc_HashBytes(t.bytes, 55));
}

bool InKey(size_t offset, bool v4) {
  auto in = [&](size_t lo, size_t len) { return offset >= lo && offset < lo + len; };
  if (in(8, 18)) return true;  // dMac, sMac, ethType, vlan1QTag
  if (in(26, v4 ? 4 : 16) || in(42, v4 ? 4 : 16)) return true;
  if (in(58, 5)) return true;  // ipProto, sPort, dPort
  return false;
}

// Flipping any one byte of the record changes the comparison exactly when
// the byte belongs to the key; the family bit always does.
TEST(Tuple, CompareSeesExactlyTheKeyBytes) {
  for (FWRule base : {ExactV4(), ExactV6()}) {
    const bool v4 = base.ruleFlags & FW_FLAG_IPV4;
    FWRuleTuple t;
    FWCreateTupleFromRule(&base, &t);
    FWRuleEntry e{};
    e.rule = base;
    ASSERT_EQ(FWRuleCompare(&e, &t), 0);
    for (size_t off = 0; off < sizeof(FWRule); off++) {
      e.rule = base;
      reinterpret_cast<uint8_t*>(&e.rule)[off] ^= 0x5a;
      const bool familyByte = off == 6;  // ruleFlags bits 16-23 (bit 20)
      const int expect = (InKey(off, v4) || familyByte) ? 1 : 0;
      EXPECT_EQ(FWRuleCompare(&e, &t), expect) << "offset " << off << (v4 ? " v4" : " v6");
    }
  }
}

TEST(Tuple, FamiliesNeverCompareEqualAndUnusedTupleBytesDoNotMatter) {
  FWRule v4 = ExactV4();
  FWRule v6 = v4;
  v6.ruleFlags &= ~FW_FLAG_IPV4;  // same leading bytes, other family
  FWRuleTuple t4, t6;
  FWCreateTupleFromRule(&v4, &t4);
  FWCreateTupleFromRule(&v6, &t6);
  FWRuleEntry e4{}, e6{};
  e4.rule = v4;
  e6.rule = v6;
  EXPECT_EQ(FWRuleCompare(&e4, &t6), 1);
  EXPECT_EQ(FWRuleCompare(&e6, &t4), 1);
  std::memset(t4.bytes + 31, 0x77, 24);
  EXPECT_EQ(FWRuleCompare(&e4, &t4), 0);
}

class TableTest : public ModuleTest {};

TEST_F(TableTest, SizingIsFourBucketsPerRuleAndAtLeast256) {
  struct Case {
    uint32_t n, buckets, hint;
  } cases[] = {{0, 256, 0xffffffffu}, {1, 256, 0},         {2, 256, 1},
               {64, 256, 63},         {65, 512, 127},      {100, 512, 127},
               {1024, 4096, 1023},    {1025, 8192, 2047},  {10000, 65536, 16383},
               {(1u << 29) + 1, 256, (1u << 30) - 1}};
  for (const Case& c : cases) {
    Hash_Table* t = FWAllocRuleHash(c.n);
    ASSERT_NE(t, nullptr) << c.n;
    EXPECT_EQ(t->numBuckets, c.buckets) << c.n;
    EXPECT_EQ(t->sizeHint, c.hint) << c.n;
    EXPECT_EQ(t->heap, slcGenericHeapID);
    FWDestroyHash(&t);
    EXPECT_EQ(t, nullptr);
  }
  Hash_Table* none = nullptr;
  FWDestroyHash(&none);
  EXPECT_EQ(none, nullptr);
}

// An entry gives back exactly what it owns: its socket, and its pool tag
// only for the resource-pool action (0xffff included).
TEST_F(TableTest, EntryFreeReleasesSocketAndPoolTag) {
  host::ResPools::Define("gold", 12);
  for (uint32_t action : {SLCGenericActionResourcePoolTag, SLCGenericActionGRE}) {
    for (const char* pool : {"gold", "nosuch"}) {
      auto* e = static_cast<FWRuleEntry*>(SLCGenericAlloc(sizeof(FWRuleEntry)));
      ASSERT_NE(e, nullptr);
      e->rule.action = action;
      if (action == SLCGenericActionResourcePoolTag) e->poolTag = zel_PortsetGetResPoolTag(pool);
      ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &e->greSocket),
                ZEL_OK);
      e->greSocketOpen = 1;
      FWRuleEntryFree(e);
      EXPECT_EQ(host::ResPools::OutstandingTotal(), 0);
      EXPECT_EQ(host::Sockets::Open(), 0u);
    }
  }
}

// Exporting a version-7 record writes 259 bytes with bit 9 cleared.
TEST(Export, RulesetGetNarrowsVersion7) {
  std::vector<uint8_t> buf(15 + 2 * 281, 0xee);
  auto* rs = reinterpret_cast<FWRuleset*>(buf.data());
  rs->version = 7;
  rs->numRules = 0;
  FWRuleEntry e{};
  e.rule = rules::ParseRule("action=drop sa=10.0.0.1 rptag=0");
  e.rule.ruleFlags |= FW_WC_RPTAG;
  e.rule.rpTag = 0x1234;  // not part of a version-7 record
  EXPECT_TRUE(FWIterRulesetGet(&e, rs));
  EXPECT_TRUE(FWIterRulesetGet(&e, rs));
  EXPECT_EQ(+rs->numRules, 2u);
  FWRule expect = e.rule;
  expect.ruleFlags &= ~FW_WC_RPTAG;
  EXPECT_EQ(std::memcmp(buf.data() + 15, &expect, 259), 0);
  EXPECT_EQ(std::memcmp(buf.data() + 15 + 259, &expect, 259), 0);
  EXPECT_EQ(buf[15 + 2 * 259], 0xee);  // nothing beyond the second record
}

}  // namespace
