// The two-stage lookup (exact-rule table, then the compiled classifier of
// the general rules) against the reference model (the ordered first-match
// scan written from the rule semantics), and the classifier's build under
// allocation failure.
//
// The build limits are lowered so that small rulesets get deep trees, long
// residual lists and the memory bound; rules and packets are drawn from
// pools of prefixes, ranges and values that overlap a lot, in both
// families, with negations, masked MACs, 802.1Q tags, pool tags, version-7
// records, add sequences and single-rule removals. Packet directions other
// than 1 and 2, which the scan index does not encode, fall back to the full
// test of every rule. Exact rules draw their keys from small pools, so that
// repeats merge and mirrors meet their originals, and packets often carry
// an installed exact rule's very key.
#include <fmt/format.h>
#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <optional>
#include <random>
#include <string>
#include <tuple>
#include <vector>

#include "control/control.h"
#include "firewall/fw_classifier.h"
#include "firewall/fw_index.h"
#include "firewall/fw_ioctl.h"
#include "host/core/faults.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::FirewallTest;
using testsupport::FwModel;
using testsupport::ModelPacket;

class Gen {
 public:
  explicit Gen(uint32_t seed) : rng_(seed) {}

  // How often a rule compares each L2 field (MACs, ethertype, 802.1Q tag).
  int l2Percent = 10;

  static constexpr uint8_t kMacs[3][6] = {
      {2, 0, 0, 0, 0, 1}, {2, 0, 0, 0, 0, 2}, {2, 0x11, 0x22, 0x33, 0x44, 0x55}};

  uint32_t U(uint32_t n) { return rng_() % n; }
  bool P(int percent) { return static_cast<int>(U(100)) < percent; }

  // Addresses inside 10.0.0.0/22 (IPv4) or 2001:db8:X::/48 with X < 4 and
  // a small interface part (IPv6), so that prefixes and ranges overlap.
  void Addr(bool v4, uint8_t out[16]) {
    static const uint8_t kV6[4] = {0x20, 0x01, 0x0d, 0xb8};
    std::memset(out, 0, 16);
    if (v4) {
      const uint32_t a = htonl(0x0a000000u | U(1024));
      std::memcpy(out, &a, 4);
    } else {
      std::memcpy(out, kV6, 4);
      out[5] = static_cast<uint8_t>(U(4));
      out[15] = static_cast<uint8_t>(U(16));
    }
  }
  // A range [lo, hi] around lo (IPv4 inclusive, IPv6 exclusive: the rule's
  // own business), sometimes empty, sometimes a prefix.
  void AddrRange(bool v4, uint8_t lo[16], uint8_t hi[16]) {
    Addr(v4, lo);
    std::memcpy(hi, lo, 16);
    if (v4) {
      uint32_t l = FWNet32(lo);
      if (P(50)) l &= ~0u << U(10);  // a prefix
      uint32_t h = P(5) ? l - 1 : l + U(300);
      const uint32_t ln = htonl(l), hn = htonl(h);
      std::memcpy(lo, &ln, 4);
      std::memcpy(hi, &hn, 4);
    } else {
      hi[5] = static_cast<uint8_t>(lo[5] + U(2));
      hi[15] = static_cast<uint8_t>(U(16));
    }
  }
  uint16_t PortValue() {
    static const uint16_t kPorts[] = {53, 80, 443, 1000, 1001, 8080, 65535, 0};
    return P(70) ? kPorts[U(8)] : static_cast<uint16_t>(U(65536));
  }

  // Every field compared; four addresses per family and three ports.
  FWRule Exact(uint8_t version, uint64_t id) {
    FWRule r;
    std::memset(&r, 0, sizeof(r));
    r.action = 1 + U(3);
    r.direction = static_cast<uint8_t>(U(4));
    r.bidirectional = static_cast<uint8_t>(U(3));
    r.pktCount = id;
    const bool v4 = P(50);
    r.ruleFlags = v4 ? FW_FLAG_IPV4 : 0;
    if (P(40)) r.ruleFlags |= FW_WC_RPTAG; else r.rpTag = static_cast<uint16_t>(U(3));
    std::memcpy(r.dMac, kMacs[U(3)], 6);
    std::memcpy(r.sMac, kMacs[U(3)], 6);
    FWPutNet16(r.ethType, v4 ? 0x0800 : 0x86dd);
    if (P(30)) r.vlan1QTag[0] = 0x81, r.vlan1QTag[3] = static_cast<uint8_t>(U(2));
    for (uint8_t* a : {r.ipSa, r.ipDa}) {
      Addr(v4, a);
      a[v4 ? 3 : 15] &= 3;
      if (v4) a[2] = 0;
    }
    r.ipProto = P(50) ? 6 : 17;
    static const uint16_t kPorts[] = {53, 80, 443};
    FWPutNet16(r.sPort, kPorts[U(3)]);
    FWPutNet16(r.dPort, kPorts[U(3)]);
    if (version == 7) std::memset(reinterpret_cast<uint8_t*>(&r) + 259, 0, 281 - 259);
    return r;
  }

  FWRule Rule(uint8_t version, uint64_t id) {
    static const uint8_t kMasks[3][6] = {
        {0xff, 0xff, 0xff, 0, 0, 0}, {0xff, 0, 0, 0, 0, 0xff}, {}};
    FWRule r;
    std::memset(&r, 0, sizeof(r));
    r.action = 1 + U(3);
    r.direction = static_cast<uint8_t>(P(3) ? U(8) : 1 + U(3));
    r.bidirectional = static_cast<uint8_t>(U(3));
    r.pktCount = id;  // tells rules apart
    const bool v4 = P(60);
    // Start from "compares nothing" and add fields.
    r.ruleFlags = FW_WC_FIELDS | (v4 ? FW_FLAG_IPV4 : 0);
    if (P(60)) r.ruleFlags |= FW_WC_RPTAG; else r.rpTag = static_cast<uint16_t>(U(3));
    auto field = [&](uint32_t wc, int percent) {
      if (!P(percent)) return false;
      r.ruleFlags &= ~wc;
      return true;
    };
    for (auto [wc, range, lo, hi] : {std::tuple{FW_WC_IPSA, FW_RANGE_IPSA, r.ipSa, r.ipSaHigh},
                                     std::tuple{FW_WC_IPDA, FW_RANGE_IPDA, r.ipDa, r.ipDaHigh}}) {
      if (!field(wc, 60)) continue;
      if (P(40)) {
        r.ruleFlags |= range;
        AddrRange(v4, lo, hi);
      } else {
        Addr(v4, lo);
      }
    }
    if (field(FW_WC_IPPROTO, 60)) r.ipProto = P(90) ? (P(50) ? 6 : 17) : 1;
    for (auto [wc, range, lo, hi] : {std::tuple{FW_WC_SPORT, FW_RANGE_SPORT, r.sPort, r.sPortHigh},
                                     std::tuple{FW_WC_DPORT, FW_RANGE_DPORT, r.dPort, r.dPortHigh}}) {
      if (!field(wc, 50)) continue;
      const uint16_t l = PortValue();
      FWPutNet16(lo, l);
      if (P(40)) {
        r.ruleFlags |= range;
        FWPutNet16(hi, P(5) ? static_cast<uint16_t>(l - 1) : static_cast<uint16_t>(l + U(2000)));
      }
    }
    if (field(FW_WC_DMAC, l2Percent)) {
      std::memcpy(r.dMac, kMacs[U(3)], 6);
      if (P(50)) {
        r.ruleFlags |= FW_MASK_DMAC;
        std::memcpy(r.dMacMask, kMasks[U(3)], 6);
      }
    }
    if (field(FW_WC_SMAC, l2Percent)) std::memcpy(r.sMac, kMacs[U(3)], 6);
    if (field(FW_WC_ETHTYPE, l2Percent)) FWPutNet16(r.ethType, P(50) ? 0x0800 : 0x86dd);
    if (field(FW_WC_VLAN, l2Percent)) {
      r.vlan1QTag[0] = 0x81, r.vlan1QTag[3] = static_cast<uint8_t>(U(2));
    }
    for (uint32_t bit = 0; bit < 9; bit++) {
      if (P(4)) r.negateFlags |= 1u << bit;
    }
    if ((r.ruleFlags & FW_GENERAL_RULE_MASK) == 0) r.ruleFlags |= FW_WC_VLAN;  // keep it general
    if (version == 7) std::memset(reinterpret_cast<uint8_t*>(&r) + 259, 0, 281 - 259);
    return r;
  }

  // Some packets with an installed exact rule's key, some too short to
  // parse; of the rest, half inside a random general rule's ranges, half
  // from the pools.
  ModelPacket Packet(const FwModel& model) {
    ModelPacket p;
    if (!model.Exact().empty() && P(30)) {
      const FWRule& r = model.Exact()[U(static_cast<uint32_t>(model.Exact().size()))];
      p.presence |= FW_PKT_L2 | FW_PKT_L3 | FW_PKT_PORTS |
                    (r.ruleFlags & FW_FLAG_IPV4 ? FW_PKT_IPV4 : FW_PKT_IPV6) |
                    (r.ipProto == 17 ? FW_PKT_UDP : FW_PKT_TCP);
      std::memcpy(p.dMac, r.dMac, 6);
      std::memcpy(p.sMac, r.sMac, 6);
      std::memcpy(p.ethType, r.ethType, 2);
      std::memcpy(p.vlan1QTag, r.vlan1QTag, 4);
      std::memcpy(p.ipSa, r.ipSa, 16);
      std::memcpy(p.ipDa, r.ipDa, 16);
      p.ipProto = r.ipProto;
      std::memcpy(p.sPort, r.sPort, 2);
      std::memcpy(p.dPort, r.dPort, 2);
      return p;
    }
    if (P(2)) return p;  // too short to parse: only the pool-tag bit
    p.presence |= FW_PKT_L2;
    p.dMac[0] = 2;
    p.dMac[5] = static_cast<uint8_t>(1 + U(2));
    p.sMac[0] = 2;
    p.sMac[5] = static_cast<uint8_t>(1 + U(2));
    if (P(20)) p.vlan1QTag[0] = 0x81, p.vlan1QTag[3] = static_cast<uint8_t>(U(2));
    if (P(5)) return p;  // not IP
    const FWRule* inside = nullptr;
    if (!model.General().empty() && P(50)) {
      inside = &model.General()[U(static_cast<uint32_t>(model.General().size()))];
    }
    const bool v4 = inside ? (inside->ruleFlags & FW_FLAG_IPV4) != 0 : P(60);
    FWPutNet16(p.ethType, v4 ? 0x0800 : 0x86dd);
    p.presence |= FW_PKT_L3 | (v4 ? FW_PKT_IPV4 : FW_PKT_IPV6);
    Addr(v4, p.ipSa);
    Addr(v4, p.ipDa);
    p.ipProto = P(45) ? 6 : P(80) ? 17 : 1;
    FWPutNet16(p.sPort, PortValue());
    FWPutNet16(p.dPort, PortValue());
    if (inside != nullptr) {
      const uint32_t f = inside->ruleFlags;
      if (!(f & FW_WC_IPSA)) Pick(inside->ipSa, inside->ipSaHigh, f & FW_RANGE_IPSA, v4, p.ipSa);
      if (!(f & FW_WC_IPDA)) Pick(inside->ipDa, inside->ipDaHigh, f & FW_RANGE_IPDA, v4, p.ipDa);
      if (!(f & FW_WC_IPPROTO)) p.ipProto = inside->ipProto;
      if (!(f & FW_WC_SPORT)) PickPort(inside->sPort, inside->sPortHigh, f & FW_RANGE_SPORT, p.sPort);
      if (!(f & FW_WC_DPORT)) PickPort(inside->dPort, inside->dPortHigh, f & FW_RANGE_DPORT, p.dPort);
    }
    if ((p.ipProto == 6 || p.ipProto == 17) && P(90)) {
      p.presence |= FW_PKT_PORTS | (p.ipProto == 17 ? FW_PKT_UDP : FW_PKT_TCP);
    }
    return p;
  }

 private:
  void Pick(const uint8_t* lo, const uint8_t* hi, bool range, bool v4, uint8_t* out) {
    std::memcpy(out, lo, v4 ? 4 : 16);
    if (!range) return;
    if (v4) {
      const uint32_t l = FWNet32(lo), h = FWNet32(hi);
      const uint32_t v = htonl(l <= h ? l + U(h - l + 1) : l);
      std::memcpy(out, &v, 4);
    } else if (P(50)) {
      std::memcpy(out, hi, 16);  // the excluded upper end
    }
  }
  void PickPort(const uint8_t* lo, const uint8_t* hi, bool range, uint8_t* out) {
    std::memcpy(out, lo, 2);
    const uint32_t l = FWNet16(lo), h = FWNet16(hi);
    if (range && l <= h) FWPutNet16(out, static_cast<uint16_t>(l + U(h - l + 1)));
  }

  std::mt19937 rng_;
};

// Whether the module found the model's rule (or none where it has none),
// and both as text for a failure message.
bool Same(const FWRuleEntry* got, const std::optional<FWRule>& want) {
  return got ? want && testsupport::SameRecord(got->rule, *want) : !want;
}
std::string Versus(const FWRuleEntry* got, const std::optional<FWRule>& want) {
  return "\n  module: " + (got ? rules::FormatRule(got->rule) : "none") +
         "\n  model:  " + (want ? rules::FormatRule(*want) : "none");
}

class ClassifierTest : public FirewallTest {
 protected:
  void TearDown() override {
    g_fwClassifierTuning = kFWClassifierDefaults;
    FirewallTest::TearDown();
  }

  // Every packet gets the model's rule.
  void ExpectSameAsModel(Gen& gen, const FwModel& model, uint32_t iter, uint32_t packets) {
    for (uint32_t k = 0; k < packets; k++) {
      const ModelPacket p = gen.Packet(model);
      const uint32_t dir = gen.P(5) ? gen.U(8) : 1 + gen.U(2);
      const uint16_t tag = static_cast<uint16_t>(gen.U(3));
      const FWRuleEntry* got = Lookup(p, dir, tag);
      const auto want = model.Match(p.Summary(), dir, tag);
      checked_++;
      hits_ += want.has_value();
      exactHits_ += want && rules::IsExactRule(*want);
      if (!Same(got, want)) {
        ADD_FAILURE() << "iteration " << iter << " packet " << k << " dir " << dir << " tag "
                      << tag << " presence 0x" << std::hex << p.presence << Versus(got, want);
        return;
      }
    }
  }

  // Runs `attempt` with allocation 1, 2, ... failed until an attempt makes
  // no allocation fail: each failed attempt must report the failure and
  // leave the filter as it was; the last must succeed. Returns the
  // attempts that failed.
  template <typename Attempt>
  uint64_t FailEachAllocation(const char* what, Attempt attempt) {
    for (uint64_t n = 1;; n++) {
      const Fingerprint before = Capture();
      host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, n);
      const ZelStatus status = attempt();
      const bool injected = host::Faults::Injected("zel_HeapAllocWithRA") > 0;
      host::Faults::ClearAll();
      if (!injected) {
        EXPECT_EQ(status, ZEL_OK) << what;
        return n - 1;
      }
      if (status != ZEL_FAILURE || !(Capture() == before)) {
        ADD_FAILURE() << what << ": allocation " << n << " failed, status " << status
                      << (Capture() == before ? "" : ", the filter changed");
        return n;
      }
    }
  }

  uint64_t checked_ = 0, hits_ = 0, exactHits_ = 0;
};

TEST_F(ClassifierTest, SameRuleAsTheOrderedScanForEveryPacket) {
  uint64_t id = 1, residual = 0, prepared = 0, oneTree = 0, oneLeaf = 0, noL2 = 0;
  for (uint32_t iter = 0; iter < 400; iter++) {
    Gen gen(0xc1a55000u + iter);
    // Leaves of 1 to 8 rules, now and then a budget that stops the cutting
    // early; one tree or a tree per separating field; 16- or 32-bit slot
    // numbers.
    g_fwClassifierTuning = {1, 1 + gen.U(8), 1 + gen.U(24), gen.P(20) ? 1u + gen.U(4) : 64u,
                            gen.P(30) ? 1u + gen.U(4) : 0u, 150, gen.P(50) ? 1000u : 0u,
                            gen.P(50) ? 2u + gen.U(3) : 16u, gen.P(70) ? 65536u : 0u};
    // Now and then no rule compares an L2 field, so the lookup leaves the
    // L2 key words out.
    gen.l2Percent = gen.P(30) ? 0 : 10;
    // Now and then one rule in four is exact (never the first, so that
    // the classifier always has rules).
    const bool withExact = gen.P(30);
    FwModel model;
    const uint32_t applications = 1 + gen.U(3);
    for (uint32_t a = 0; a < applications; a++) {
      const uint8_t version = gen.P(25) ? 7 : 8;
      rules::RulesetBuilder b(version);
      const uint32_t n = 1 + gen.U(a == 0 ? 300 : 60);
      for (uint32_t i = 0; i < n; i++) {
        b.Add(withExact && i % 4 == 3 ? gen.Exact(version, id++) : gen.Rule(version, id++));
      }
      const auto rs = b.Bytes();
      if (a == 0 && gen.P(50)) {
        // The control channels' road: everything built before the
        // exclusive hold.
        std::vector<uint8_t> copy(rs);
        ASSERT_EQ(FWSetIoctlRuleset(filter_, reinterpret_cast<FWRuleset*>(copy.data()), 1),
                  ZEL_OK);
        prepared++;
      } else {
        ASSERT_EQ(Apply(rs, a == 0), ZEL_OK);
      }
      model.Apply(rs, a == 0);
    }
    ASSERT_EQ(ctx_->numRules, model.NumRules()) << "iteration " << iter;
    ASSERT_NE(ctx_->scanIndex, nullptr);
    const FWClassifier* cls = ctx_->scanIndex->classifier;
    ASSERT_NE(cls, nullptr);
    residual += cls->numResidual;
    oneTree += cls->numTrees == 1;
    oneLeaf += cls->numTrees == 1 && cls->numResidual == 0;
    noL2 += !ctx_->scanIndex->l2Words;
    ExpectSameAsModel(gen, model, iter, 300);
    if (HasFailure()) return;
    if (withExact) continue;

    // Remove a few rules one by one. The reference is the model of the
    // rules left in the list, in order (which of several equal rules a
    // removal picks is the removal's business).
    const std::vector<FWRule>& general = model.General();
    for (uint32_t r = 0; r < 3 && general.size() > 1; r++) {
      RemoveByIoctl(rules::RulesetBuilder(8).Add(general[gen.U(uint32_t(general.size()))]).Bytes());
    }
    // A lone general rule is kept, so that the classifier has rules left.
    if (general.size() > 1) {
      ASSERT_LT(GeneralEntries().size(), general.size()) << "iteration " << iter;
    }
    rules::RulesetBuilder left(8);
    for (const FWRuleEntry* e : GeneralEntries()) left.Add(e->rule);
    FwModel after;
    after.Apply(left.Bytes(), true);
    ExpectSameAsModel(gen, after, iter, 100);
    if (HasFailure()) return;
  }
  EXPECT_GT(prepared, 100u);
  EXPECT_GT(residual, 0u);
  EXPECT_GT(oneTree, 100u);
  EXPECT_GT(oneLeaf, 5u);  // a lookup with a single leaf to walk (the sweep below: always)
  EXPECT_GT(noL2, 50u);
  EXPECT_GT(hits_, checked_ / 3);
  EXPECT_GT(exactHits_, checked_ / 100);
  RecordProperty("hits", std::to_string(hits_) + "/" + std::to_string(checked_) + " exact " +
                             std::to_string(exactHits_));
}

// Every value of one dimension, against rulesets of overlapping port
// ranges crowded together so that the tree cuts deep and sibling regions
// often hold the same rules (and share a subtree): every cut boundary and
// every range end is met, which packets drawn at random seldom do.
TEST_F(ClassifierTest, EveryDestinationPortAgainstTheOrderedScan) {
  g_fwClassifierTuning = {1, 1, 24, 256, 0, 0, 0, 4, 65536};
  uint64_t differing = 0;
  for (uint32_t seed = 0; seed < 12; seed++) {
    Gen gen(0x9047u + seed);
    rules::RulesetBuilder b(8);
    const uint32_t n = 20 + gen.U(40);
    const uint32_t window = gen.U(65536 - 2048);
    for (uint32_t i = 0; i < n; i++) {
      static const uint32_t kSpan[] = {1, 8, 64, 300};
      const uint32_t lo = window + gen.U(1024);
      const uint32_t hi = std::min<uint32_t>(65535, lo + gen.U(kSpan[gen.U(4)]));
      b.Add(fmt::format("action=drop ipv4 ethtype=any dport={}-{} pkts={}", lo, hi, i + 1));
    }
    const auto rs = b.Bytes();
    ASSERT_EQ(Apply(rs, true), ZEL_OK);
    FwModel model;
    model.Apply(rs, true);
    const FWClassifier* cls = ctx_->scanIndex->classifier;
    ASSERT_NE(cls, nullptr);
    // Every rule in the port tree: one leaf per lookup.
    ASSERT_TRUE(cls->numTrees == 1 && cls->numResidual == 0);
    ModelPacket p;
    p.presence |= FW_PKT_L2 | FW_PKT_L3 | FW_PKT_IPV4 | FW_PKT_PORTS | FW_PKT_TCP;
    FWPutNet16(p.ethType, 0x0800);
    p.ipProto = 6;
    std::optional<FWRule> previous;
    for (uint32_t port = 0; port < 65536; port++) {
      FWPutNet16(p.dPort, static_cast<uint16_t>(port));
      const FWRuleEntry* got = Lookup(p, 1);
      const auto want = model.Match(p.Summary(), 1, 0);
      ASSERT_TRUE(Same(got, want)) << "seed " << seed << " port " << port << Versus(got, want);
      differing += want.has_value() != previous.has_value() ||
                   (want && !testsupport::SameRecord(*want, *previous));
      previous = want;
    }
  }
  // The sweep crossed many rule boundaries.
  EXPECT_GT(differing, 200u);
}

// Default limits on a larger ruleset, so the shipped configuration is
// checked too (its one tree), and the same limits with a tree per field:
// lists this long choose their cuts on a sample.
TEST_F(ClassifierTest, DefaultLimitsOnThousandsOfRules) {
  Gen gen(0xc1a5f00d);
  FwModel model;
  rules::RulesetBuilder b(8);
  for (uint64_t i = 0; i < 3000; i++) b.Add(gen.Rule(8, i + 1));
  const auto rs = b.Bytes();
  model.Apply(rs, true);
  for (const uint32_t oneTreeRules : {kFWClassifierDefaults.oneTreeRules, 0u}) {
    g_fwClassifierTuning = kFWClassifierDefaults;
    g_fwClassifierTuning.oneTreeRules = oneTreeRules;
    ASSERT_EQ(Apply(rs, true), ZEL_OK);
    const FWClassifier* cls = ctx_->scanIndex->classifier;
    ASSERT_NE(cls, nullptr);
    EXPECT_EQ(cls->numTrees == 1, oneTreeRules != 0);
    EXPECT_LT(cls->bytes, 3000u * 2048);
    ExpectSameAsModel(gen, model, oneTreeRules, 20000);
  }
}

// Cuts of large lists are chosen on a sample. Here the sample (every other
// rule) sees only single addresses, while the rules between them each span
// a quarter of the destination space: the finest cut the sample suggests
// copies far too much, and a coarser cut must be taken instead of leaving
// all the rules in one leaf, which would be a scan of the whole list.
TEST_F(ClassifierTest, ACutTheSampleMisjudgedGivesWayToACoarserOne) {
  rules::RulesetBuilder b(8);
  for (uint32_t i = 0; i < 2048; i++) {
    if (i % 2 == 0) {
      b.Add(fmt::format("action=drop ipv4 ethtype=any da={}.{}.0.1 pkts={}", i / 8, i % 8, i + 1));
    } else {
      b.Add(fmt::format("action=drop ipv4 ethtype=any proto=udp dport={} da={}.0.0.0/2 pkts={}",
                        i, (i % 4) * 64, i + 1));
    }
  }
  const auto rs = b.Bytes();
  ASSERT_EQ(Apply(rs, true), ZEL_OK);
  const FWClassifier* cls = ctx_->scanIndex->classifier;
  ASSERT_NE(cls, nullptr);
  ASSERT_GT(cls->numNodes, 1u) << "the root stayed a leaf of every rule";
  FwModel model;
  model.Apply(rs, true);
  Gen gen(0x5a3b1e);
  ExpectSameAsModel(gen, model, 0, 2000);
}

// An allocation failed anywhere in building a new ruleset (records, table,
// index, the classifier's blocks and growing arrays) undoes the whole
// application on every road, in replace and in add mode: the filter as it
// was, nothing leaked. The replacing channels build all of it before the
// exclusive hold; with every allocation granted the filter holds the new
// rules, and the former ones are released after the hold.
TEST_F(ClassifierTest, AllocationFailureAnywhereInTheBuildChangesNothing) {
  Gen gen(0xfa11);
  rules::RulesetBuilder first(8), next(8);
  for (uint64_t i = 0; i < 150; i++) first.Add(gen.Rule(8, i + 1));
  for (uint64_t i = 0; i < 150; i++) next.Add(gen.Rule(8, 1000 + i));
  const std::vector<uint8_t> rs = next.Bytes();
  struct Road {
    const char* name;
    bool replace, fromIoctl;
    uint32_t oneTreeRules;
    std::function<ZelStatus(std::vector<uint8_t>&)> apply;
  };
  // The ioctl roads last: after them the other two are ignored for good.
  const Road roads[] = {
      {"property", true, false, 0, [&](std::vector<uint8_t>& b) {
         return SLCGenericRulesetPropWrite(filter_, nullptr, b.data(), uint32_t(b.size()));
       }},
      {"restore", true, false, 0,
       [&](std::vector<uint8_t>& b) { return FWRestoreState(filter_, b.data(), b.size()); }},
      {"replace", true, true, 1000, [&](std::vector<uint8_t>& b) { return Apply(b, true); }},
      {"add", false, true, 1000, [&](std::vector<uint8_t>& b) { return Apply(b, false); }},
      {"ioctl", true, true, 0, [&](std::vector<uint8_t>& b) {
         return FWSetIoctlRuleset(filter_, reinterpret_cast<FWRuleset*>(b.data()), 1);
       }},
  };
  for (const Road& road : roads) {
    g_fwClassifierTuning = {1, 2, 24, 64, 0, 0, road.oneTreeRules, 4, 65536};
    ASSERT_EQ(Apply(first.Bytes(), true, road.fromIoctl), ZEL_OK) << road.name;
    const uint64_t heapBlocks = Capture().heapBlocks;
    const uint64_t failures = FailEachAllocation(road.name, [&] {
      std::vector<uint8_t> copy = rs;
      return road.apply(copy);
    });
    if (HasFailure()) return;
    // Every rule record, the index and the classifier's blocks.
    EXPECT_GT(failures, 150u + 5u) << road.name;
    ASSERT_NE(ctx_->scanIndex->classifier, nullptr);
    FwModel model;
    model.Apply(first.Bytes(), true);
    model.Apply(rs, road.replace);
    ExpectSameAsModel(gen, model, 0, 1000);
    ASSERT_EQ(Apply(first.Bytes(), true, road.fromIoctl), ZEL_OK);
    EXPECT_EQ(Capture().heapBlocks, heapBlocks) << road.name;
    Clear();
  }
}

}  // namespace
