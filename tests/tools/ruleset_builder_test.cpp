// Rule text to wire bytes and back, and errors that name the bad token.
#include "tools/lib/ruleset_builder.h"

#include <gtest/gtest.h>

namespace {

TEST(RuleText, ErrorsNameTheToken) {
  const std::pair<std::string, std::string> bad[] = {
      {"action=explode", "explode"},     {"sa=10.0.0.300", "10.0.0.300"},
      {"sport=70000", "70000"},          {"dmac=02:00:00:00:00", "02:00:00:00:00"},
      {"ipv4 sa=2001:db8::1", "sa"},     {"sa=10.0.0.1-2001:db8::9", "10.0.0.1-2001:db8::9"},
      {"colour=red", "colour"},          {"vlan=5000", "5000"},
      {"gre=2001:db8::1", "2001:db8::1"}, {"ipv4 ipv4", "ipv4"},
      {"sport=1-x", "'x'"},              {"pool=" + std::string(128, 'p'), "pool"},
  };
  for (const auto& [line, token] : bad) {
    FWRule r;
    std::string error;
    EXPECT_FALSE(rules::TryParseRule(line, &r, &error)) << line;
    EXPECT_NE(error.find(token), std::string::npos) << line << ": " << error;
  }
  std::vector<uint8_t> bytes;
  std::string error;
  EXPECT_FALSE(rules::TryParseRuleset("ruleset frag=drop\naction=drop\ndport=x\n", &bytes, &error));
  EXPECT_NE(error.find("'x'"), std::string::npos) << error;
  EXPECT_THROW(rules::RulesetBuilder(7).Add("rptag=3").Bytes(), rules::RuleError);
}

// Text -> bytes -> text -> bytes gives the same bytes, for both versions;
// a version-7 ruleset has 259-byte records with bit 9 clear.
TEST(RulesetRoundTrip, TextAndBytesAgree) {
  const std::string body =
      "action=drop dir=to ipv4 proto=6 sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80\n"
      "action=punt dir=from ipv6 sa=2001:db8::1-2001:db8::ff da=2001:db8::2 proto=17\n"
      "action=gre gre=192.0.2.1 snaplen=128 ethtype=0x86dd vlan=raw:12345678 pkts=5 bytes=900\n"
      "action=l2rewrite rewrite=02:aa:bb:cc:dd:ee dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02"
      " ethtype=0x0800 vlan=7 sa=10.1.1.1 da=10.1.1.2 proto=17 sport=1-2 dport=3 bidir=2\n"
      "action=log dir=invalid rawflags=0x1ff\n"
      "action=13 dir=9 smac=02:00:00:00:00:02/00:00:00:00:00:00 pool=gold\n";
  const std::string v8only =
      "action=dscp+dot1p dscp=46 dot1p=5 rptag=9 dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00\n"
      "action=pooltag pool=silver sport=!100-200 rawneg=0x1ff\n"
      "action=punt da=!2001:db8::2 proto=!17 ethtype=!0x86dd\n";
  for (const std::string& text : {"ruleset version=8 features=0x2 frag=punt\n" + body + v8only,
                                  "ruleset version=7 features=0x3 frag=drop\n" + body}) {
    const std::vector<uint8_t> bytes = rules::ParseRuleset(text);
    EXPECT_EQ(rules::ParseRuleset(rules::FormatRuleset(bytes)), bytes) << text;
    const rules::DecodedRuleset back = rules::DecodeRuleset(bytes);
    EXPECT_EQ(bytes.size(), 15 + back.rules.size() * (back.version == 7 ? 259 : 281));
    EXPECT_EQ(back.fwFeatures, back.version == 7 ? 3u : 2u);
    for (const FWRule& r : back.rules) {
      EXPECT_TRUE(back.version == 8 || !(r.ruleFlags & FW_WC_RPTAG));
    }
  }
}

}  // namespace
