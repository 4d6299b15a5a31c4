// Coverage between rules, lint findings and diffs, on cases whose answer is
// known by hand; verdict diffs are computed by the module loaded in the host.
#include "tools/lib/rule_analysis.h"

#include <gtest/gtest.h>

#include <tuple>

#include "tests/support/tool_frames.h"
#include "tools/lib/verdict_diff.h"

namespace {

rules::RulesetText Read(const std::string& text) {
  rules::RulesetText t = rules::ReadRulesetText(text);
  EXPECT_TRUE(t.Ok()) << rules::RenderDiagnostics("", t.diagnostics);
  return t;
}

constexpr char kTuple[] =
    "dmac=02:00:00:00:00:01 smac=02:00:00:00:00:02 vlan=none ipv4 sa=10.0.0.1 da=10.0.0.2 proto=tcp";

TEST(Covers, FollowsTheLookupFieldByField) {
  const struct {
    const char* outer;
    const char* inner;
    bool covers;
  } cases[] = {
      {"proto=tcp", "proto=tcp dport=80", true},
      {"proto=tcp dport=80", "proto=tcp", false},  // inner matches other ports
      {"dport=80", "dport=80 dir=from", true},
      {"dport=80 dir=from", "dport=80", false},    // inner also matches dir=to
      {"dport=80", "dport=80 rptag=3", true},
      {"dport=80 rptag=3", "dport=80", false},
      // Ranges and negation.
      {"dport=10-20", "dport=12-20", true},
      {"dport=10-20", "dport=9-20", false},
      {"dport=!80", "dport=81", true},
      {"dport=!80", "dport=80", false},
      {"dport=!80", "dport=!80-90", true},
      {"dport=!80-90", "dport=!80", false},
      {"dport=!0-100", "dport=200-65535", true},
      {"dport=80-90", "dport=!100", false},
      {"proto=!udp", "proto=tcp", true},
      {"proto=!udp", "proto=!tcp", false},
      // Masked MACs, plain and negated.
      {"dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=02:11:22:33:44:55", true},
      {"dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=02:11:23:00:00:01", false},
      {"dmac=02:11:22:33:00:00/ff:ff:ff:ff:00:00", "dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00", false},
      {"dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=02:11:22:33:00:00/ff:ff:ff:ff:00:00", true},
      {"dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=02:11:23:00:00:01", true},
      {"dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=02:11:22:00:00:01", false},
      {"dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00", "dmac=!02:11:00:00:00:00/ff:ff:00:00:00:00", true},
      {"dmac=!02:11:00:00:00:00/ff:ff:00:00:00:00", "dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00", false},
      {"dmac=02:00:00:00:00:00/00:00:00:00:00:00", "dmac=!02:11:22:00:00:00", true},  // zero mask: all
      // Addresses pin the family; CIDR and IPv6 ranges.
      {"sa=10.0.0.0/8", "proto=tcp", false},
      {"proto=tcp", "ipv4 proto=tcp sa=10.0.0.1", true},
      {"sa=10.0.0.0/8", "sa=10.1.0.0/16 proto=udp", true},
      {"sa=10.0.0.0/8", "sa=2001:db8::1", false},
      {"sa=2001:db8::/32", "sa=2001:db8::5-2001:db8::9", true},
      {"sa=2001:db8::-2001:db8::8", "sa=2001:db8::9", false},
      {"sa=!2001:db8::/64", "sa=2001:db9::1", true},
      {"sa=!2001:db8::/64", "sa=!2001:db8::/48", true},
      {"ipv6", "ipv4", false},  // the implied ethertypes differ
  };
  for (const auto& c : cases) {
    EXPECT_EQ(rules::Covers(rules::ParseRule(c.outer), rules::ParseRule(c.inner)), c.covers)
        << c.outer << "  over  " << c.inner;
  }
}

TEST(Lint, NamesBothRulesOfEachFinding) {
  const std::string t = kTuple;
  const std::string text =
      "action=drop proto=tcp dport=!22\n"                                          // 1
      "action=accept ipv4 proto=tcp dport=80\n"                                    // 2 shadowed by 1
      "action=drop proto=udp dport=22\n"                                           // 3 fine
      "action=punt dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00\n"                      // 4
      "action=punt dmac=02:11:22:33:44:55 proto=udp\n"                             // 5 shadowed by 4, same action
      "action=drop dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00 proto=udp\n"           // 6 fine
      "action=accept " + t + " sport=1000 dport=22 bidir\n"                        // 7 exact
      "action=drop dir=from " + t + " sport=1000 dport=22\n"                       // 8 same tuple as 7
      "action=drop dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 vlan=none ipv4 sa=10.0.0.2 "
      "da=10.0.0.1 proto=tcp sport=22 dport=1000\n"                                // 9 mirror of 7
      "action=log " + t + " sport=1000-1000 dport=22\n"                            // 10 under exact 7
      "action=log dir=invalid proto=udp\n"                                         // 11
      "action=accept proto=udp dport=53 bidir\n"                                   // 12 bidir, no effect
      "action=drop dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 vlan=none ipv4 sa=10.0.0.2 "
      "da=10.0.0.1 proto=tcp sport=22 dport=1001\n"                                // 13
      "action=accept " + t + " sport=1001 dport=22 bidir\n"                       // 14 mirror is 13
      "default=drop\n";                                                            // 15
  const std::vector<rules::Finding> got = rules::Lint(Read(text));
  const struct {
    size_t line, other;
    std::string message;
  } want[] = {
      {2, 1, "never matches: the earlier general rule at line 1 matches every packet it would, "
             "with a different action (drop instead of accept)"},
      {5, 4, "never matches: the earlier general rule at line 4 matches every packet it would"},
      {8, 7, "same tuple as line 7: the exact rules merge into one entry with line 7's action "
             "(accept), matching both directions; this rule's action drop is never used"},
      {9, 7, "same tuple as the mirrored half of line 7: the exact rules merge into one entry "
             "with line 7's action (accept); this rule's action drop is never used"},
      {10, 7, "never matches: every packet it would match hits the exact rule at line 7, which "
              "is probed before any general rule"},
      {11, 0, "dir=invalid: the rule never matches"},
      {12, 0, "bidir has no effect on a general rule: only exact rules get a mirrored half"},
      {14, 13, "its mirrored half has the same tuple as line 13 and merges into it: the replies "
               "get line 13's action (drop), not accept"},
  };
  ASSERT_EQ(got.size(), std::size(want));
  for (size_t i = 0; i < got.size(); i++) {
    EXPECT_EQ(got[i].line, want[i].line) << i;
    EXPECT_EQ(got[i].otherLine, want[i].other) << i;
    EXPECT_EQ(got[i].message, want[i].message) << i;
  }
}

TEST(Diff, PairsRulesByWhatTheyMatch) {
  const rules::RulesetText a = Read(
      "ruleset features=drop-bpdu\n"
      "action=drop proto=tcp dport=22\n"
      "action=gre proto=udp gre=192.0.2.1\n"
      "action=accept proto=tcp dport=80\n"
      "action=drop proto=tcp dport=80\n");
  const rules::RulesetText b = Read(
      "action=drop proto=tcp dport=80\n"
      "action=gre proto=udp gre=192.0.2.2\n"
      "action=accept proto=tcp dport=80\n"
      "action=punt proto=tcp dport=23\n");
  // Identical rules pair first, wherever they moved; the GRE rule pairs by
  // what it matches and shows its new destination; the header comes first.
  using C = rules::RuleChange;
  using Row = std::tuple<C::Kind, size_t, size_t, std::string, std::string>;
  const std::vector<Row> want = {
      {C::kChanged, 0, 0, "ruleset version=8 features=drop-bpdu frag=none",
       "ruleset version=8 features=none frag=none"},
      {C::kRemoved, 2, 0, "action=drop proto=tcp dport=22", ""},
      {C::kChanged, 3, 2, "action=gre proto=udp gre=192.0.2.1", "action=gre proto=udp gre=192.0.2.2"},
      {C::kAdded, 0, 4, "", "action=punt proto=tcp dport=23"},
  };
  std::vector<Row> got;
  for (const C& c : rules::DiffRules(a, b)) {
    got.emplace_back(c.kind, c.oldLine, c.newLine, c.oldText, c.newText);
  }
  EXPECT_EQ(got, want);
  EXPECT_TRUE(rules::DiffRules(a, a).empty());
}

TEST(Diff, CaptureVerdictsComeFromTheModule) {
  using namespace toolframes;
  using frames::Ip4;
  auto tcp = [&](uint16_t dport, uint8_t last = 1) {
    frames::Ip4Addr src = Ip4("10.0.0.1");
    src[3] = last;
    return FrameBuilder().Eth(kVm, kGw).Ipv4(src, Ip4("10.0.0.10")).Tcp(40000, dport).Build();
  };
  const std::vector<frames::CaptureRecord> capture = {
      {1, tcp(22), 0},                 // 1: general drop -> general accept
      {1, tcp(80), 0},                 // 2: exact accept on both sides
      {1, tcp(80, 7), 0},              // 3: no rule -> default drop
      {2, tcp(23), 0},                 // 4: same drop both sides
      {1, FrameBuilder().Eth(kGw, kVm).Arp(1, kVm, Ip4("10.0.0.10"), {}, Ip4("10.0.0.1")).Build(),
       0},  // 5: ARP: default drop
  };
  const std::string exact =
      "action=accept dmac=02:00:00:00:00:10 smac=02:00:00:00:00:01 vlan=none ipv4 sa=10.0.0.1 "
      "da=10.0.0.10 proto=tcp sport=40000 dport=80\n";
  const rules::RulesetText a = Read(exact + "action=drop proto=tcp dport=22\naction=drop dport=23\n");
  const rules::RulesetText b = Read("action=accept ipv4 proto=tcp dport=22\n" + exact +
                                    "action=drop dport=23\ndefault=drop\n");
  std::vector<rules::VerdictChange> got;
  std::string error;
  ASSERT_TRUE(rules::DiffVerdicts(a, b, capture, &got, &error)) << error;
  ASSERT_EQ(got.size(), 3u);
  EXPECT_EQ(got[0].packet, 1u);
  EXPECT_EQ(got[0].before.Describe(), "drop (general rule, line 2)");
  EXPECT_EQ(got[0].after.Describe(), "accept (general rule, line 1)");
  EXPECT_EQ(got[1].packet, 3u);
  EXPECT_EQ(got[1].before.Describe(), "accept (no rule matched)");
  EXPECT_EQ(got[1].after.Describe(), "drop (general rule, line 4)");
  EXPECT_EQ(got[2].packet, 5u);
  EXPECT_EQ(got[2].after.line, 4u);

  // Same action, another GRE destination: the copies go elsewhere.
  const rules::RulesetText g1 = Read("action=gre gre=192.0.2.1 proto=tcp\n");
  const rules::RulesetText g2 = Read("action=gre gre=192.0.2.2 proto=tcp\n");
  ASSERT_TRUE(rules::DiffVerdicts(g1, g2, capture, &got, &error)) << error;
  ASSERT_EQ(got.size(), 4u);  // every TCP packet, not the ARP frame
  EXPECT_EQ(got[0].before.Describe(), "gre gre=192.0.2.1 (general rule, line 1)");
  EXPECT_EQ(got[0].after.Describe(), "gre gre=192.0.2.2 (general rule, line 1)");

  // A ruleset the module refuses is reported, not traced.
  rules::RulesetText bad = a;
  bad.version = 9;
  EXPECT_FALSE(rules::DiffVerdicts(bad, b, capture, &got, &error));
  EXPECT_FALSE(error.empty());
}

}  // namespace
