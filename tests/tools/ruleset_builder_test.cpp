// The rule text language: located errors, the meaning of each field, and
// text -> wire -> text -> wire identity on random rulesets.
#include "tools/lib/ruleset_builder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <random>

#include "tools/lib/rule_analysis.h"

namespace {

constexpr char kExactTail[] =
    " dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 vlan=none ipv4 sa=10.0.0.1 da=10.0.0.2";

// Each bad text gives exactly one error, at this line and column, with this
// message.
TEST(RuleText, EachBadFieldIsReportedWhereItIs) {
  const struct {
    std::string text;
    size_t line, column;
    std::string message;
  } cases[] = {
      {"action=dscp dscp=64", 1, 18, "dscp '64' is out of range 0-63"},
      {"action=dot1p dot1p=8", 1, 20, "dot1p '8' is out of range 0-7"},
      {"action=gre", 1, 1, "action=gre needs gre=A.B.C.D, the IPv4 destination of the GRE copies"},
      {"action=l2rewrite", 1, 1,
       "action=l2rewrite needs rewrite=MAC, the address written into the frames"},
      {"action=pooltag pool=" + std::string(128, 'p'), 1, 21,
       "pool name is 128 characters long; at most 127 fit"},
      {"dport=80-22", 1, 7, "dport range 80-22 is empty: the low end is above the high end"},
      {"sa=10.0.0.9-10.0.0.1", 1, 4, "sa range is empty: the low end is above the high end"},
      {"dir=7", 1, 5, "unknown direction '7'"},
      {"action=99", 1, 8, "unknown action '99'"},
      {"action=gree", 1, 8, "unknown action 'gree'; did you mean 'gre'?"},
      {"proto=tpc", 1, 7, "unknown protocol 'tpc'; did you mean 'tcp'?"},
      {"acton=drop", 1, 1, "unknown field 'acton'; did you mean 'action'?"},
      {"# two lines\ndport=1 dport=2", 2, 9, "field 'dport' given twice (first at column 1)"},
      {"action=accept dscp=5", 1, 15,
       "dscp has no effect with action=accept; only action=dscp or dscp+dot1p uses it"},
      {"snaplen=64", 1, 1, "snaplen has no effect with action=accept; only action=gre uses it"},
      {"action=gre gre=0.0.0.0", 1, 16, "gre 0.0.0.0 is not a destination"},
      {"sport=70000", 1, 7, "sport '70000' is out of range 0-65535"},
      {"sa=10.0.0.1/24", 1, 4, "sa '10.0.0.1/24' has host bits set; did you mean 10.0.0.0/24?"},
      {"da=2001:db8::/129", 1, 4, "da prefix length '129' is out of range 0-128"},
      {"ipv4 sa=2001:db8::1", 1, 9, "sa is IPv6 but the rule is already IPv4"},
      {"sa=10.0.0.1-2001:db8::9", 1, 4, "sa range '10.0.0.1-2001:db8::9' mixes IPv4 and IPv6"},
      {"sa=10.0.0.1-<10.0.0.9", 1, 4, "sa '-<' (end excluded) is for IPv6 ranges only"},
      {"action=drop ipv6 ethtype=0x0800", 1, 18,
       "ipv6 already matches ethertype 0x86dd; ethtype=0x0800 contradicts it"},
      {"bidir=3", 1, 7, "bidir is written bare (install the mirrored rule) or bidir=2 (a mirrored half)"},
      {"ipv4 exact=1", 1, 12, "exact takes no value"},
      {"dport=", 1, 1, "dport needs a value (dport=...)"},
      {"vlan=5000", 1, 6, "vlan id '5000' is out of range 0-4095"},
      {"ruleset version=7\naction=dscp dscp=3", 2, 13,
       "dscp is a version-8 field; this ruleset is version 7"},
      {"ruleset version=7\nsport=!80", 2, 7,
       "negation ('!') needs a version-8 ruleset; this one is version 7"},
      {"ruleset version=7\nraw action=dscp dscp=3", 2, 1,
       "the rule sets version-8 bytes (rptag, marks, masks or negation) in a version-7 ruleset"},
      {"ruleset version=9", 1, 17, "version '9' is not 7 or 8"},
      {"ruleset features=drop-bdpu", 1, 18, "unknown feature 'drop-bdpu'; did you mean 'drop-bpdu'?"},
      {"ruleset frag=dorp", 1, 14, "unknown fragment action 'dorp'; did you mean 'drop'?"},
      {"action=drop\nruleset version=8", 2, 1, "the ruleset header line must come before the rules"},
      {"default=drop\naction=drop", 2, 1,
       "nothing may follow the default line (line 1): it is the last rule"},
      {"default=log", 1, 9, "unknown default action 'log'"},
      {std::string("action=drop") + kExactTail + " proto=tcp sport=!1 dport=2", 1, 114,
       "negation has no effect on an exact rule: with every field given and no range or mask, "
       "the module matches the values alone"},
      {"exact action=drop ipv4 dport=80", 1, 1,
       "the rule cannot be exact: dmac wildcard, smac wildcard, vlan wildcard, sa wildcard, "
       "da wildcard, proto wildcard, sport wildcard"},
      {std::string("action=drop") + kExactTail + " proto=tcp sport=1-2 dport=2 exact", 1, 126,
       "the rule cannot be exact: sport range"},
      {std::string("action=drop") + kExactTail + " proto=icmp sport=1 dport=2 exact", 1, 125,
       "an exact rule only matches TCP and UDP packets; proto=1 would never match"},
      {"sa=ffff::/16", 1, 4,
       "sa 'ffff::/16' reaches the last IPv6 address, which a range cannot include; leave the "
       "field out or write A-<ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff"},
  };
  for (const auto& c : cases) {
    const rules::RulesetText t = rules::ReadRulesetText(c.text);
    ASSERT_EQ(t.diagnostics.size(), 1u) << c.text << "\n" << rules::RenderDiagnostics("", t.diagnostics);
    EXPECT_EQ(t.diagnostics[0].line, c.line) << c.text;
    EXPECT_EQ(t.diagnostics[0].column, c.column) << c.text;
    EXPECT_EQ(t.diagnostics[0].message, c.message) << c.text;
    EXPECT_TRUE(t.rules.empty());
    // The same text through every entry point is refused the same way.
    std::vector<uint8_t> bytes;
    std::string error;
    EXPECT_FALSE(rules::TryParseRuleset(c.text, &bytes, &error));
    EXPECT_NE(error.find(c.message), std::string::npos) << error;
  }
}

TEST(RuleText, EveryErrorOfAFileIsReportedWithACaret) {
  const std::string text =
      "ruleset version=8\n"
      "action=drop proto=tcp dport=22\n"
      "action=explode dport=99999\n"
      "\n"
      "dscp=70 colour=red\n";
  const rules::RulesetText t = rules::ReadRulesetText(text);
  ASSERT_EQ(t.diagnostics.size(), 4u);
  EXPECT_EQ(rules::RenderDiagnostics("web.rules", {t.diagnostics[0], t.diagnostics[1]}),
            "web.rules:3:8: error: unknown action 'explode'\n"
            " 3 | action=explode dport=99999\n"
            "   |        ^~~~~~~\n"
            "   = actions: none drop accept punt copy l2rewrite gre log pooltag dscp dot1p dscp+dot1p\n"
            "web.rules:3:22: error: dport '99999' is out of range 0-65535\n"
            " 3 | action=explode dport=99999\n"
            "   |                      ^~~~~\n");
  EXPECT_EQ(t.diagnostics[2].line, 5u);
  EXPECT_EQ(t.diagnostics[3].column, 9u);

  // A long line shows a window around the fault, caret still under it.
  const std::string longLine = "action=drop " + std::string(300, ' ') + "dport=x";
  const rules::RulesetText l = rules::ReadRulesetText(longLine);
  ASSERT_EQ(l.diagnostics.size(), 1u);
  const std::string shown = rules::RenderDiagnostics("", l.diagnostics);
  EXPECT_NE(shown.find("1:319: error: dport 'x' is not a number"), std::string::npos) << shown;
  const size_t caretLine = shown.find('^');
  const size_t sourceLine = shown.find("dport=x");
  EXPECT_EQ(caretLine - shown.rfind('\n', caretLine), sourceLine - shown.rfind('\n', sourceLine) + 6);

  // The single-rule entry points report the same way.
  FWRule r;
  std::string error;
  EXPECT_FALSE(rules::TryParseRule("action=drop dir=sideways", &r, &error));
  EXPECT_EQ(error.rfind("1:17: error: unknown direction 'sideways'", 0), 0u) << error;
  EXPECT_THROW(rules::RulesetBuilder(7).Add("rptag=3").Bytes(), rules::RuleError);
}

// Bytes of a text that must compile.
std::vector<uint8_t> Bytes(const std::string& text) {
  std::vector<uint8_t> out;
  std::string error;
  EXPECT_TRUE(rules::TryParseRuleset(text, &out, &error)) << text << "\n" << error;
  return out;
}

FWRule Only(const std::string& text) {
  const rules::DecodedRuleset d = rules::DecodeRuleset(Bytes(text));
  EXPECT_EQ(d.rules.size(), 1u) << text;
  return d.rules.empty() ? FWRule{} : d.rules[0];
}

TEST(RuleText, FieldsMeanWhatAReaderExpects) {
  // ipv4/ipv6 pin the ethertype unless the rule frees it.
  FWRule r = Only("action=drop ipv6");
  EXPECT_FALSE(r.ruleFlags & FW_WC_ETHTYPE);
  EXPECT_EQ(FWNet16(r.ethType), 0x86dd);
  EXPECT_FALSE(r.ruleFlags & FW_FLAG_IPV4);
  r = Only("action=drop ipv6 ethtype=any");
  EXPECT_TRUE(r.ruleFlags & FW_WC_ETHTYPE);
  EXPECT_FALSE(r.ruleFlags & FW_FLAG_IPV4);
  EXPECT_EQ(FWNet16(Only("ipv4 proto=tcp").ethType), 0x0800);
  EXPECT_TRUE(Only("sa=10.0.0.1").ruleFlags & FW_WC_ETHTYPE);  // the address alone

  // CIDR in both families; IPv6 range ends inclusive in the text.
  r = Only("sa=10.1.0.0/16");
  EXPECT_TRUE(r.ruleFlags & FW_RANGE_IPSA);
  EXPECT_EQ(FWNet32(r.ipSa), 0x0a010000u);
  EXPECT_EQ(FWNet32(r.ipSaHigh), 0x0a01ffffu);
  r = Only("da=2001:db8::/120");
  EXPECT_EQ(r.ipDaHigh[14], 0x01);  // 2001:db8::100, excluded on the wire
  EXPECT_EQ(r.ipDaHigh[15], 0x00);
  EXPECT_EQ(std::memcmp(Only("da=2001:db8::-2001:db8::ff").ipDaHigh, r.ipDaHigh, 16), 0);
  EXPECT_EQ(std::memcmp(Only("da=2001:db8::-<2001:db8::100").ipDaHigh, r.ipDaHigh, 16), 0);

  // Header names and the default line.
  const rules::DecodedRuleset d =
      rules::DecodeRuleset(Bytes("ruleset version=8 features=drop-bpdu,drop-dhcp-server frag=punt\n"
                                 "action=drop proto=tcp dport=23\n"
                                 "default=drop\n"));
  EXPECT_EQ(d.fwFeatures, 3u);
  EXPECT_EQ(d.fragOverride, uint32_t{SLCGenericActionPunt});
  ASSERT_EQ(d.rules.size(), 2u);
  EXPECT_EQ(uint32_t{d.rules[1].action}, uint32_t{SLCGenericActionDrop});
  EXPECT_EQ(d.rules[1].ruleFlags & FW_WC_ALL, FW_WC_ALL);
  EXPECT_EQ(d.rules[1].direction, SLCGenericDirectionBidirectional);

  // A record the checked language cannot express is printed raw.
  EXPECT_EQ(rules::FormatRule(Only("raw action=gre")), "raw action=gre gre=0.0.0.0");
}

// A random record as a sender or the module could hand it over: any known
// flag bits, values in every field, masks, negations, ranges and mirrors.
FWRule RandomRule(std::mt19937& rng, uint8_t version) {
  auto byte = [&] { return static_cast<uint8_t>(rng()); };
  auto pick = [&](uint32_t n) { return static_cast<uint32_t>(rng() % n); };
  FWRule r;
  std::memset(&r, 0, sizeof(r));
  uint8_t* raw = reinterpret_cast<uint8_t*>(&r);
  for (size_t i = 8; i < 63; i++) raw[i] = byte();  // MACs .. ports
  for (size_t i = 79; i < 115; i++) raw[i] = byte();  // high bounds
  r.action = pick(5) == 0 ? rng() : pick(12);
  r.ruleFlags = rng() & (FW_WC_ALL | 0xf0000u | FW_FLAG_IPV4 | FW_MASK_DMAC | FW_MASK_SMAC);
  if (pick(4) == 0) r.ruleFlags &= ~FW_GENERAL_RULE_MASK;  // exact
  if (pick(3) == 0) r.ruleFlags = FW_WC_ALL | FW_FLAG_IPV4;  // catch-all
  if (pick(6) == 0) r.ruleFlags |= 1u << 25;  // a bit the module ignores
  r.bidirectional = static_cast<uint8_t>(pick(3));
  r.direction = static_cast<uint8_t>(pick(6) == 0 ? byte() : pick(4));
  if (pick(2)) for (uint8_t& b : r.rewriteMac) b = byte();
  if (pick(2)) for (uint8_t& b : r.greIP) b = byte();
  r.snapLen = pick(2) ? rng() : 0;
  const uint32_t poolLen = pick(3) == 0 ? pick(128) : 0;
  for (uint32_t i = 0; i < poolLen; i++) r.resourcePool[i] = static_cast<char>('a' + pick(26));
  r.pktCount = pick(2) ? rng() : 0;
  r.byteCount = pick(2) ? (uint64_t{rng()} << 32 | rng()) : 0;
  if (version == FW_RULESET_VERSION_8) {
    r.rpTag = static_cast<uint16_t>(rng());
    r.ethDot1PTag = static_cast<uint16_t>(pick(2) ? pick(8) : rng());
    r.dscpTag = static_cast<uint16_t>(pick(2) ? pick(64) : rng());
    for (uint8_t& b : r.dMacMask) b = byte();
    for (uint8_t& b : r.sMacMask) b = byte();
    r.negateFlags = rng() & (pick(4) == 0 ? 0xffffffffu : 0x1ffu);
  } else {
    r.ruleFlags &= ~FW_WC_RPTAG;
  }
  return r;
}

// The record as text builds it: no bytes under a wildcard, none past an
// IPv4 address, no bound without its range bit, no mask without its bit.
FWRule Canonical(FWRule r) {
  const uint32_t f = r.ruleFlags;
  const int n = (f & FW_FLAG_IPV4) ? 4 : 16;
  auto clear = [](uint8_t* p, size_t len) { std::memset(p, 0, len); };
  if (f & FW_WC_DMAC) clear(r.dMac, 6);
  if (f & FW_WC_SMAC) clear(r.sMac, 6);
  if (f & FW_WC_ETHTYPE) clear(r.ethType, 2);
  if (f & FW_WC_VLAN) clear(r.vlan1QTag, 4);
  if (f & FW_WC_IPSA) clear(r.ipSa, 16);
  if (f & FW_WC_IPDA) clear(r.ipDa, 16);
  if (f & FW_WC_IPPROTO) r.ipProto = 0;
  if (f & FW_WC_SPORT) clear(r.sPort, 2);
  if (f & FW_WC_DPORT) clear(r.dPort, 2);
  if (f & FW_WC_RPTAG) r.rpTag = 0;
  clear(r.ipSa + n, 16 - n);
  clear(r.ipDa + n, 16 - n);
  clear(r.ipSaHigh + n, 16 - n);
  clear(r.ipDaHigh + n, 16 - n);
  if (!(f & FW_RANGE_IPSA) || (f & FW_WC_IPSA)) clear(r.ipSaHigh, 16);
  if (!(f & FW_RANGE_IPDA) || (f & FW_WC_IPDA)) clear(r.ipDaHigh, 16);
  if (!(f & FW_RANGE_SPORT) || (f & FW_WC_SPORT)) clear(r.sPortHigh, 2);
  if (!(f & FW_RANGE_DPORT) || (f & FW_WC_DPORT)) clear(r.dPortHigh, 2);
  if (!(f & FW_MASK_DMAC) || (f & FW_WC_DMAC)) clear(r.dMacMask, 6);
  if (!(f & FW_MASK_SMAC) || (f & FW_WC_SMAC)) clear(r.sMacMask, 6);
  return r;
}

TEST(RulesetRoundTrip, RandomRulesetsSurviveTextAndBack) {
  std::mt19937 rng(12);
  for (int round = 0; round < 300; round++) {
    const uint8_t version = round % 2 ? FW_RULESET_VERSION_7 : FW_RULESET_VERSION_8;
    const bool canonical = round % 4 < 2;
    rules::RulesetBuilder b(version);
    b.Features(rng() % 4 == 0 ? rng() : rng() % 4).FragOverride(rng() % 4 == 0 ? rng() : rng() % 12);
    const int n = 1 + static_cast<int>(rng() % 8);
    for (int i = 0; i < n; i++) {
      FWRule r = RandomRule(rng, version);
      if (canonical) r = Canonical(r);
      b.Add(r);
      // The module returns a bidirectional exact rule with its mirrored half.
      if (rules::IsExactRule(r) && r.bidirectional == 1) b.Add(rules::MirrorOf(r));
    }
    const std::vector<uint8_t> wire = b.Bytes();
    const std::string text = rules::FormatRuleset(wire);
    std::vector<uint8_t> again;
    std::string error;
    ASSERT_TRUE(rules::TryParseRuleset(text, &again, &error)) << text << error;
    ASSERT_EQ(again, wire) << text;
    EXPECT_EQ(rules::FormatRuleset(again), text);
    // Only records that text cannot have built need the whole record in hex.
    if (canonical) {
      EXPECT_EQ(text.find("wire="), std::string::npos) << text;
    }
  }
}

TEST(RulesetRoundTrip, CheckedTextsComeBackAsWritten) {
  const std::string texts[] = {
      "ruleset version=8 features=drop-dhcp-server frag=punt\n"
      "action=drop dir=to ipv4 dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 vlan=7/3 "
      "sa=10.0.0.1 da=10.0.0.2 proto=tcp sport=1234 dport=80 bidir\n"
      "action=punt dir=from ipv6 sa=2001:db8::1-2001:db8::ff da=2001:db8::/64 proto=udp\n"
      "action=gre ethtype=0x86dd vlan=raw:12345678 gre=192.0.2.1 snaplen=128 pkts=5 bytes=900\n"
      "action=dscp+dot1p dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00 rptag=9 dot1p=5 dscp=46\n"
      "action=pooltag sport=!100-200 pool=silver\n"
      "action=l2rewrite da=!2001:db8::2 proto=!udp rewrite=02:aa:bb:cc:dd:ee\n"
      "default=drop\n",
      "ruleset version=7 features=drop-bpdu frag=drop\n"
      "action=copy dir=invalid ipv4 sa=192.168.0.0/16 dport=53\n"
      "action=log vlan=none sa=10.0.0.1-10.0.0.7\n",
  };
  for (const std::string& t : texts) EXPECT_EQ(rules::FormatRuleset(Bytes(t)), t);
}

// Hostile inputs end in an error or a result, with bounded work.
TEST(RuleText, HostileInputsGiveBoundedErrors) {
  std::mt19937 rng(7);
  std::string garbage(1 << 20, '\0');
  for (char& c : garbage) c = static_cast<char>(rng());
  rules::RulesetText t = rules::ReadRulesetText(garbage);
  EXPECT_FALSE(t.Ok());
  EXPECT_LE(t.diagnostics.size(), rules::kMaxDiagnostics + 1);
  EXPECT_TRUE(t.rules.empty());

  const std::string longLine(16u << 20, 'a');
  t = rules::ReadRulesetText(longLine + "\naction=drop\n");
  ASSERT_EQ(t.diagnostics.size(), 1u);
  EXPECT_EQ(t.diagnostics[0].message, "line is longer than 4096 bytes");
  EXPECT_LE(t.diagnostics[0].source.size(), 200u);

  // Ten million rules: refused once the limit is passed, without building
  // the rest.
  std::string many;
  many.reserve(10'000'000 * 8);
  for (int i = 0; i < 10'000'000; i++) many += "dport=1\n";
  t = rules::ReadRulesetText(many);
  ASSERT_EQ(t.diagnostics.size(), 1u);
  EXPECT_EQ(t.diagnostics[0].line, rules::kMaxRules + 1);
  EXPECT_EQ(t.diagnostics[0].message, "more than 262144 rules");
  EXPECT_TRUE(t.rules.empty());
}

}  // namespace
