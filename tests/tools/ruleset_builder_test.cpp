#include "tools/lib/ruleset_builder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <random>

namespace {

using rules::ParseRule;

TEST(RuleText, ExampleLineSetsWireFields) {
  FWRule r = ParseRule(
      "action=drop dir=to ipv4 proto=6 sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80  # web");
  EXPECT_EQ(+r.action, 1u);
  EXPECT_EQ(r.direction, 2u);
  EXPECT_EQ(+r.ruleFlags,
            FW_WC_DMAC | FW_WC_SMAC | FW_WC_ETHTYPE | FW_WC_VLAN | FW_WC_RPTAG | FW_FLAG_IPV4);
  EXPECT_EQ(r.ipProto, 6);
  const uint8_t sa[4] = {10, 0, 0, 1}, da[4] = {10, 0, 0, 2};
  EXPECT_EQ(std::memcmp(r.ipSa, sa, 4), 0);
  EXPECT_EQ(std::memcmp(r.ipDa, da, 4), 0);
  EXPECT_EQ(r.sPort[0], 0x04);  // 1234 = 0x04d2, network order
  EXPECT_EQ(r.sPort[1], 0xd2);
  EXPECT_EQ(FWNet16(r.dPort), 80);
  EXPECT_FALSE(rules::IsExactRule(r));
}

TEST(RuleText, FullySpecifiedRuleIsExact) {
  FWRule r = ParseRule(
      "action=accept dir=from dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 ethtype=0x0800 "
      "vlan=100/5 sa=10.0.0.1 da=10.0.0.2 proto=udp sport=53 dport=5353 rptag=7 bidir");
  EXPECT_TRUE(rules::IsExactRule(r));
  EXPECT_EQ(+r.ruleFlags, FW_FLAG_IPV4);
  const uint8_t vlan[4] = {0x81, 0x00, 0xa0, 0x64};
  EXPECT_EQ(std::memcmp(r.vlan1QTag, vlan, 4), 0);
  EXPECT_EQ(FWNet16(r.ethType), 0x0800);
  EXPECT_EQ(+r.rpTag, 7);
  EXPECT_EQ(r.bidirectional, 1);
  EXPECT_EQ(r.ipProto, 17);
}

TEST(RuleText, RangesMasksAndNegationsUseTheirOwnBits) {
  FWRule r = ParseRule(
      "ipv6 sa=!2001:db8::1-2001:db8::9 da=2001:db8::20 sport=!100-200 dport=!443 "
      "dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00 smac=!02:00:00:00:00:09 vlan=none");
  EXPECT_EQ(+r.ruleFlags & FW_FLAG_IPV4, 0u);
  EXPECT_EQ(+r.ruleFlags & (FW_RANGE_IPSA | FW_RANGE_IPDA | FW_RANGE_SPORT | FW_RANGE_DPORT),
            FW_RANGE_IPSA | FW_RANGE_SPORT);
  EXPECT_EQ(+r.ruleFlags & (FW_MASK_DMAC | FW_MASK_SMAC), FW_MASK_DMAC);
  // Source address is negation bit 5, source port bit 8, destination port 7.
  EXPECT_EQ(+r.negateFlags, FW_NEG_IPSA | FW_NEG_SPORT | FW_NEG_DPORT | FW_NEG_SMAC);
  EXPECT_EQ(r.ipSaHigh[15], 9);
  EXPECT_EQ(FWNet16(r.sPortHigh), 200);
  EXPECT_EQ(r.dMacMask[2], 0xff);
  EXPECT_EQ(r.dMacMask[3], 0x00);
  EXPECT_EQ(FWNet32(r.vlan1QTag), 0u);
  EXPECT_EQ(+r.ruleFlags & FW_WC_VLAN, 0u);
}

TEST(RuleText, StarIsWildcardAndDefaultsAreAcceptBoth) {
  FWRule r = ParseRule("sa=10.0.0.1 sa=* dport=*");
  EXPECT_EQ(+r.action, SLCGenericActionAccept);
  EXPECT_EQ(r.direction, SLCGenericDirectionBidirectional);
  EXPECT_EQ(+r.ruleFlags, FW_WC_ALL | FW_FLAG_IPV4);
}

TEST(RuleText, ErrorsNameTheToken) {
  const char* bad[] = {"action=explode", "sa=10.0.0.300", "sport=70000", "dmac=02:00:00:00:00",
                       "ipv4 sa=2001:db8::1", "sa=10.0.0.1 da=2001:db8::1",
                       "sa=10.0.0.1-2001:db8::9", "colour=red", "vlan=5000", "gre=2001:db8::1",
                       "ipv4 ipv4", "sport=1-x"};
  for (const char* line : bad) {
    FWRule r;
    std::string error;
    EXPECT_FALSE(rules::TryParseRule(line, &r, &error)) << line;
    EXPECT_FALSE(error.empty()) << line;
  }
  EXPECT_THROW(ParseRule("pool=" + std::string(128, 'p')), rules::RuleError);
  EXPECT_NO_THROW(ParseRule("pool=" + std::string(127, 'p')));
}

TEST(RulesetBytes, Version7WritesPrefixRecordsWithBit9Clear) {
  auto bytes = rules::RulesetBuilder(7)
                   .Features(3)
                   .FragOverride(SLCGenericActionDrop)
                   .Add("action=drop sa=10.0.0.1")
                   .Add("action=pooltag pool=gold")
                   .Bytes();
  ASSERT_EQ(bytes.size(), 15u + 2 * 259);
  FWRulesetHeader h;
  std::memcpy(&h, bytes.data(), sizeof(h));
  EXPECT_EQ(h.version, 7);
  EXPECT_EQ(h.highestSupportedVersion, 8);
  EXPECT_EQ(h.lowestSupportedVersion, 7);
  EXPECT_EQ(+h.numRules, 2u);
  EXPECT_EQ(+h.fwFeatures, 3u);
  EXPECT_EQ(+h.fragOverride, 1u);
  uint32_t flags;
  std::memcpy(&flags, bytes.data() + 15 + 4, 4);
  EXPECT_EQ(flags & FW_WC_RPTAG, 0u);
  EXPECT_STREQ(reinterpret_cast<const char*>(bytes.data() + 15 + 259 + 131), "gold");

  EXPECT_THROW(rules::RulesetBuilder(7).Add("rptag=3").Bytes(), rules::RuleError);
  EXPECT_THROW(rules::RulesetBuilder(7).Add("sport=!5").Bytes(), rules::RuleError);
  EXPECT_THROW(rules::RulesetBuilder(9).Bytes(), rules::RuleError);
}

TEST(RulesetBytes, DecoderRefusesWrongLengthOrVersion) {
  auto bytes = rules::ParseRuleset("ruleset version=8\naction=drop\n");
  EXPECT_NO_THROW(rules::DecodeRuleset(bytes));
  auto shorter = bytes;
  shorter.pop_back();
  EXPECT_THROW(rules::DecodeRuleset(shorter), rules::RuleError);
  auto longer = bytes;
  longer.push_back(0);
  EXPECT_THROW(rules::DecodeRuleset(longer), rules::RuleError);
  auto v9 = bytes;
  v9[0] = 9;
  EXPECT_THROW(rules::DecodeRuleset(v9), rules::RuleError);
  EXPECT_THROW(rules::DecodeRuleset(std::span<const uint8_t>(bytes.data(), 14)),
               rules::RuleError);
}

// Text -> bytes -> text -> bytes gives the same bytes, for both versions.
TEST(RulesetRoundTrip, TextAndBytesAgree) {
  const std::string body =
      "action=drop dir=to ipv4 proto=6 sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80\n"
      "action=punt dir=from ipv6 sa=2001:db8::1-2001:db8::ff da=2001:db8::2 proto=17\n"
      "action=gre gre=192.0.2.1 snaplen=128 ethtype=0x86dd vlan=raw:12345678 pkts=5 bytes=900\n"
      "action=l2rewrite rewrite=02:aa:bb:cc:dd:ee dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02"
      " ethtype=0x0800 vlan=7 sa=10.1.1.1 da=10.1.1.2 proto=17 sport=1-2 dport=3 bidir=2\n"
      "action=log dir=invalid rawflags=0x1ff\n"
      "action=13 dir=9 smac=02:00:00:00:00:02/00:00:00:00:00:00\n";
  for (const char* header : {"ruleset version=8 features=0x2 frag=punt\n",
                             "ruleset version=7 features=0x0 frag=none\n"}) {
    auto bytes = rules::ParseRuleset(std::string(header) + body);
    const std::string text = rules::FormatRuleset(bytes);
    EXPECT_EQ(rules::ParseRuleset(text), bytes) << text;
  }
  const std::string v8only =
      "ruleset version=8\n"
      "action=dscp+dot1p dscp=46 dot1p=5 rptag=9 dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00\n"
      "action=pooltag pool=silver sport=!100-200 rawneg=0x1ff\n"
      "action=punt da=!2001:db8::2 proto=!17 ethtype=!0x86dd\n";
  auto bytes = rules::ParseRuleset(v8only);
  EXPECT_EQ(rules::ParseRuleset(rules::FormatRuleset(bytes)), bytes);
}

// Arbitrary flag words read back exactly through the text form.
TEST(RulesetRoundTrip, ArbitraryFlagWordsSurviveText) {
  std::mt19937 rng(7);
  for (int i = 0; i < 500; i++) {
    FWRule r = ParseRule("sa=10.0.0.1-10.0.0.9 dport=5 smac=02:00:00:00:00:01/ff:00:00:00:00:00");
    r.ruleFlags = rng();
    r.negateFlags = rng();
    FWRule back = ParseRule(rules::FormatRule(r));
    EXPECT_EQ(+back.ruleFlags, +r.ruleFlags);
    EXPECT_EQ(+back.negateFlags, +r.negateFlags);
  }
}

}  // namespace
