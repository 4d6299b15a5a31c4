// The module's two-stage lookup against the reference model, on thousands
// of seeded random rulesets (versions 7 and 8, exact rules with merges and
// mirrors, general rules with ranges, masks and negations, replace and add
// sequences) and random packet summaries drawn from the same small value
// pools, so that rules and packets meet often.
#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <cstring>
#include <random>
#include <string>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::FirewallTest;
using testsupport::FwModel;
using testsupport::ModelPacket;

struct Pools {
  uint8_t macs[4][6] = {{2, 0, 0, 0, 0, 1}, {2, 0, 0, 0, 0, 2}, {2, 0x11, 0x22, 0, 0, 3},
                        {2, 0x11, 0x22, 0x33, 0x44, 0x55}};
  uint8_t masks[3][6] = {{0xff, 0xff, 0xff, 0, 0, 0}, {0xff, 0xff, 0xff, 0xff, 0xff, 0xff}, {}};
  uint16_t ethTypes[3] = {0x0800, 0x86dd, 0x0806};
  uint32_t vlans[3] = {0, 0x81000064, 0x8100a064};
  uint8_t v4[6][4] = {{10, 0, 0, 1}, {10, 0, 0, 2}, {10, 0, 0, 9}, {10, 0, 1, 0}, {11, 0, 0, 5},
                      {9, 255, 255, 255}};
  uint8_t v6[6][16];
  uint8_t protos[3] = {6, 17, 1};
  uint16_t ports[6] = {53, 80, 443, 1000, 1001, 65535};

  Pools() {
    const char* text[6] = {"2001:db8::1", "2001:db8::2",  "2001:db8::100",
                           "2001:db8:1::", "fe80::1",      "::ffff:0:1"};
    for (int i = 0; i < 6; i++) inet_pton(AF_INET6, text[i], v6[i]);
  }
};

class Gen {
 public:
  explicit Gen(uint32_t seed) : rng_(seed) {}

  uint32_t U(uint32_t n) { return rng_() % n; }
  bool P(int percent) { return static_cast<int>(U(100)) < percent; }

  void Addr(bool v4, uint8_t out[16]) {
    std::memset(out, 0, 16);
    if (v4) {
      std::memcpy(out, pools_.v4[U(6)], 4);
    } else {
      std::memcpy(out, pools_.v6[U(6)], 16);
    }
  }
  void Port(uint8_t out[2]) { FWPutNet16(out, pools_.ports[U(6)]); }
  void Vlan(uint8_t out[4]) {
    const uint32_t v = pools_.vlans[U(3)];
    out[0] = v >> 24;
    out[1] = v >> 16;
    out[2] = v >> 8;
    out[3] = v;
  }

  FWRule Rule(uint8_t version, uint64_t id) {
    FWRule r;
    std::memset(&r, 0, sizeof(r));
    r.action = U(12);
    r.direction = P(5) ? 0 : static_cast<uint8_t>(1 + U(3));
    r.bidirectional = static_cast<uint8_t>(U(3));
    r.pktCount = id;  // tells rules apart
    const bool v4 = P(50);
    r.ruleFlags = v4 ? FW_FLAG_IPV4 : 0;
    std::memcpy(r.dMac, pools_.macs[U(4)], 6);
    std::memcpy(r.sMac, pools_.macs[U(4)], 6);
    FWPutNet16(r.ethType, pools_.ethTypes[U(3)]);
    Vlan(r.vlan1QTag);
    Addr(v4, r.ipSa);
    Addr(v4, r.ipDa);
    r.ipProto = pools_.protos[U(3)];
    Port(r.sPort);
    Port(r.dPort);
    if (P(40)) {
      r.ruleFlags |= FW_WC_RPTAG;
    } else {
      r.rpTag = static_cast<uint16_t>(U(3));
    }
    if (P(35)) return Finish(r, version);  // exact

    for (uint32_t bit = 0; bit < 9; bit++) {
      if (P(50)) r.ruleFlags |= 1u << bit;
    }
    if (P(30)) {
      r.ruleFlags |= FW_RANGE_IPSA;
      Addr(v4, r.ipSaHigh);
    }
    if (P(30)) {
      r.ruleFlags |= FW_RANGE_IPDA;
      Addr(v4, r.ipDaHigh);
    }
    if (P(30)) {
      r.ruleFlags |= FW_RANGE_SPORT;
      Port(r.sPortHigh);
    }
    if (P(30)) {
      r.ruleFlags |= FW_RANGE_DPORT;
      Port(r.dPortHigh);
    }
    if (P(30)) {
      r.ruleFlags |= FW_MASK_DMAC;
      std::memcpy(r.dMacMask, pools_.masks[U(3)], 6);
    }
    if (P(30)) {
      r.ruleFlags |= FW_MASK_SMAC;
      std::memcpy(r.sMacMask, pools_.masks[U(3)], 6);
    }
    for (uint32_t bit = 0; bit < 9; bit++) {
      if (P(15)) r.negateFlags |= 1u << bit;
    }
    // Now and then only a range or mask bit makes the rule general.
    if (P(10)) r.ruleFlags &= ~FW_WC_FIELDS;
    return Finish(r, version);
  }

  FWRule Finish(FWRule r, uint8_t version) {
    if (version == 7) {
      uint8_t* b = reinterpret_cast<uint8_t*>(&r);
      std::memset(b + 259, 0, 281 - 259);
    }
    return r;
  }

  ModelPacket Packet(const FwModel& model) {
    ModelPacket p;
    const uint32_t shape = U(10);
    if (shape == 0) return p;  // too short to parse: only the pool-tag bit
    p.presence |= FW_PKT_L2;
    std::memcpy(p.dMac, pools_.macs[U(4)], 6);
    std::memcpy(p.sMac, pools_.macs[U(4)], 6);
    FWPutNet16(p.ethType, pools_.ethTypes[U(3)]);
    Vlan(p.vlan1QTag);
    if (shape == 1) return p;  // not IP
    const bool v4 = P(50);
    p.presence |= FW_PKT_L3 | (v4 ? FW_PKT_IPV4 : FW_PKT_IPV6);
    Addr(v4, p.ipSa);
    Addr(v4, p.ipDa);
    p.ipProto = pools_.protos[U(3)];
    if (shape < 4) return p;  // no ports: ICMP, fragments, failed extension walk
    p.presence |= FW_PKT_PORTS;
    if (p.ipProto == 1) p.ipProto = 6;
    Port(p.sPort);
    Port(p.dPort);
    // Often the very key of an installed exact rule.
    if (!model.Exact().empty() && P(40)) {
      const FWRule& r = model.Exact()[U(static_cast<uint32_t>(model.Exact().size()))];
      const bool rv4 = (r.ruleFlags & FW_FLAG_IPV4) != 0;
      p.presence = (p.presence & ~(FW_PKT_IPV4 | FW_PKT_IPV6)) |
                   (rv4 ? FW_PKT_IPV4 : FW_PKT_IPV6);
      std::memcpy(p.dMac, r.dMac, 6);
      std::memcpy(p.sMac, r.sMac, 6);
      std::memcpy(p.ethType, r.ethType, 2);
      std::memcpy(p.vlan1QTag, r.vlan1QTag, 4);
      std::memcpy(p.ipSa, r.ipSa, 16);
      std::memcpy(p.ipDa, r.ipDa, 16);
      p.ipProto = r.ipProto;
      std::memcpy(p.sPort, r.sPort, 2);
      std::memcpy(p.dPort, r.dPort, 2);
    }
    p.presence |= p.ipProto == 17 ? FW_PKT_UDP : FW_PKT_TCP;
    return p;
  }

 private:
  std::mt19937 rng_;
  Pools pools_;
};

class LookupModelTest : public FirewallTest {};

TEST_F(LookupModelTest, SameRuleAsTheModelForEveryPacket) {
  FwModel model;
  uint64_t id = 1;
  uint64_t hits = 0, exactHits = 0, checked = 0;
  for (uint32_t iter = 0; iter < 3000; iter++) {
    Gen gen(0x5eed0000u + iter);
    // A sequence of one to three applications, the first replacing.
    const uint32_t applications = 1 + gen.U(3);
    for (uint32_t a = 0; a < applications; a++) {
      const uint8_t version = gen.P(30) ? 7 : 8;
      rules::RulesetBuilder b(version);
      const uint32_t n = gen.U(16);
      for (uint32_t i = 0; i < n; i++) b.Add(gen.Rule(version, id++));
      const auto rs = b.Bytes();
      const bool replace = a == 0;
      ASSERT_EQ(Apply(rs, replace), ZEL_OK);
      model.Apply(rs, replace);
    }
    ASSERT_EQ(ctx_->numRules, model.NumRules()) << "iteration " << iter;

    for (int k = 0; k < 60; k++) {
      const ModelPacket p = gen.Packet(model);
      const uint32_t dir = 1 + gen.U(2);
      const uint16_t tag = static_cast<uint16_t>(gen.U(3));
      const FWRuleEntry* got = Lookup(p, dir, tag);
      const auto want = model.Match(p.Summary(), dir, tag);
      checked++;
      if (want) {
        hits++;
        if (rules::IsExactRule(*want)) exactHits++;
      }
      if (static_cast<bool>(got) != want.has_value() ||
          (got && !testsupport::SameRecord(got->rule, *want))) {
        ADD_FAILURE() << "iteration " << iter << " packet " << k << " dir " << dir << " tag "
                      << tag << " presence 0x" << std::hex << p.presence << std::dec
                      << "\n  module: " << (got ? rules::FormatRule(got->rule) : "none")
                      << "\n  model:  " << (want ? rules::FormatRule(*want) : "none");
        return;
      }
    }
  }
  // The pools make rules and packets meet: both stages are exercised.
  EXPECT_GT(hits, checked / 10);
  EXPECT_GT(exactHits, checked / 50);
  RecordProperty("hits", std::to_string(hits) + "/" + std::to_string(checked) +
                             " exact " + std::to_string(exactHits));
}

}  // namespace
