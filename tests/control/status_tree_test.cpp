// The status tree: filter instance names, ruleset summaries, rule positions
// and rule summaries, and failures that leave no lock held. Agents made
// through the create-agent node: agents_test, concurrency_test and the
// control socket test.
#include <map>
#include <sstream>

#include "tests/control/control_test_util.h"

namespace {

using namespace controltest;
using host::QryValue;
using host::StatusTree;
using Values = std::vector<QryValue>;
using Fields = std::map<std::string, std::string>;

const StatusTree::Path kFilters = {"agents", kAgent, "filters"};

Values Strings(std::initializer_list<std::string> names) { return {names.begin(), names.end()}; }
StatusTree::Path At(std::string filter, std::initializer_list<QryValue> rest) {
  StatusTree::Path p = {"agents", kAgent, "filters", filter};
  return p.insert(p.end(), rest), p;
}
StatusTree::Path RuleAt(QryValue at) { return At("vnic0-0", {"rules", at, "ruleSummary"}); }

// Every handler returns with no lock held, whatever it answered.
Values List(const StatusTree::Path& path, ZelStatus want = ZEL_OK) {
  Values out;
  EXPECT_EQ(StatusTree::List(path, &out), want);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  return out;
}

// A leaf as the host renders it, field by field; "~" stands for a text
// field the module left unwritten (no terminator: rendered empty).
Fields Render(const StatusTree::Path& path) {
  std::string text;
  EXPECT_EQ(StatusTree::Render(path, &text), ZEL_OK);
  std::istringstream in(text);
  Fields fields;
  for (std::string line; std::getline(in, line);) {
    const std::string value = line.substr(line.find(": ") + 2);
    fields[line.substr(0, line.find(": "))] = value.empty() ? "~" : value;
  }
  return fields;
}

using StatusTreeTest = FilterTest;

// Instance names are "%s-%d" from the list position, renumbered when an
// older filter goes; same-named filters resolve to their own records.
TEST_F(StatusTreeTest, InstanceNamesAndRuleSetSummaries) {
  CreateFilter(kAgent, "fw");
  rules::RulesetBuilder b(7);
  b.FragOverride(SLCGenericActionPunt).Features(FW_FEATURE_DROP_BPDU).Add(kRuleA).Add(kRuleB);
  ASSERT_EQ(IoctlStatus(CreateFilter(kAgent, "fw"), Push(b.Bytes())), 1);
  EXPECT_EQ(List(kFilters), Strings({"vnic0-0", "fw-1", "fw-2"}));
  ASSERT_EQ(host::Sluice::DestroyFilter(id_), ZEL_OK);
  EXPECT_EQ(List(kFilters), Strings({"fw-0", "fw-1"}));
  Fields want = {{"version", "8"}, {"highestSupportedVersion", "8"},
                 {"lowestSupportedVersion", "7"}, {"numRules", "0"}, {"ioctl", "0"},
                 {"defaultAction", "SLCGenericActionAccept (accept packets)"},
                 {"fragOverride", "SLCGenericActionNone (none)"}, {"fwFeatures", "None"}};
  EXPECT_EQ(Render(At("fw-0", {"ruleSetSummary"})), want);
  want["version"] = "7", want["numRules"] = "2", want["ioctl"] = "1";
  want["fragOverride"] = "SLCGenericActionPunt (punt packets to slowpath)";
  EXPECT_EQ(Render(At("fw-1", {"ruleSetSummary"})), want);
}

// Every failure returns its status with no lock held. `fault`: a host call
// that fails once; a list must then stop, returning nothing.
TEST_F(StatusTreeTest, FailuresReturnTheirStatusWithNoLockHeld) {
  CreateFilter(kAgent, "vnic1");
  ASSERT_EQ(CreateAgents("beta"), ZEL_OK);
  EXPECT_TRUE(List(At("vnic1-1", {"rules"})).empty());
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kRuleA, kRuleB, kRuleA + " sport=1"}))), 1);
  EXPECT_EQ(List(At("vnic0-0", {"rules"})), (Values{int64_t(0), int64_t(1), int64_t(2)}));
  // A removed rule keeps the count; its position is past the serialised end.
  ASSERT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({kRuleB}))), 1);
  const QryValue summary = std::string("ruleSetSummary");
  const struct { StatusTree::Path path; bool list; std::string fault; ZelStatus status; } rows[] = {
      {{"agents"}, true, "QRY_ParamListAddString", ZEL_NO_MEMORY},
      {kFilters, true, "QRY_ParamListAddString", ZEL_NO_MEMORY},
      {At("vnic0-0", {"rules"}), true, "QRY_ParamListAddInt", ZEL_NO_MEMORY},
      {{"agents", "nobody", "filters"}, true, "", ZEL_NOT_FOUND},
      {At("none-0", {"rules"}), true, "", ZEL_NOT_FOUND},
      {{"agents", "nobody", "filters", "vnic0-0", summary}, false, "", ZEL_NOT_FOUND},
      {At("vnic0-1", {summary}), false, "", ZEL_NOT_FOUND},
      {{"agents", int64_t(1), "filters", "vnic0-0", summary}, false, "", ZEL_BAD_PARAM_TYPE},
      {{"agents", kAgent, "filters", int64_t(0), summary}, false, "", ZEL_BAD_PARAM_TYPE},
      {At("vnic1-1", {"rules", int64_t(0), "ruleSummary"}), false, "", ZEL_NOT_FOUND},
      {RuleAt(int64_t(2)), false, "", ZEL_NOT_FOUND},
      {RuleAt(int64_t(-1)), false, "", ZEL_NOT_FOUND},
      {RuleAt(std::string("0")), false, "", ZEL_BAD_PARAM_TYPE},
      {RuleAt(int64_t(0)), false, "zel_HeapAllocWithRA", ZEL_NO_MEMORY},
  };
  for (const auto& r : rows) {
    if (!r.fault.empty()) host::Faults::Fail(r.fault, ZEL_NO_MEMORY);
    Values out;
    Bytes bytes;
    EXPECT_EQ(r.list ? StatusTree::List(r.path, &out) : StatusTree::Get(r.path, &bytes), r.status);
    EXPECT_TRUE(out.empty());
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  }
}

const std::string kExact443 = "action=accept dir=to" + kFlowF + " dport=443";

// Every field's text, row by row: the rules, their version, the position
// shown (exact rules first, then the general rules in ruleset order), and
// the fields to check.
TEST_F(StatusTreeTest, RuleSummaryRendersEveryField) {
  FWRule pool = rules::ParseRule("raw action=pooltag proto=udp");
  std::memset(pool.resourcePool, 'p', sizeof(pool.resourcePool));  // no NUL: cut, not overread
  auto rule = [](const std::string& text) { return rules::ParseRule(text); };
  const struct { std::vector<FWRule> rules; uint8_t version; int64_t at; Fields want; } rows[] = {
      // The worked example: wildcards 1, 3, 9, dPort range, IPv4, ipDa negated.
      {{rule("action=accept dir=to rawflags=0x18020a rawneg=0x10 dmac=02:00:00:aa:bb:cc "
             "ethtype=0x0800 sa=192.168.1.10 da=10.0.0.1 proto=6 sport=1234 dport=80-90")}, 8, 0,
       {{"wildcardsEnabled", "sMac,vlan.1Q,rptag"}, {"rangesEnabled", "dPort"},
        {"dMac", " (02:00:00:aa:bb:cc/00:00:00:00:00:00)"}, {"sMac", "*"}, {"ethType", "0x0800"},
        {"vlan1QTag", "*"}, {"ipSa", "(IPv4): (192.168.1.10)"}, {"ipDa", "(IPv4): !(10.0.0.1)"},
        {"ipProto", "6"}, {"sPort", "(1234)"}, {"dPort", "(80 - 90)"}, {"bidirectional", "False"},
        {"direction", "SLCGenericDirectionToSwitch (to switch)"},
        {"action", "SLCGenericActionAccept (accept packets)"}, {"greIP", "~"}, {"rewriteMac", "~"},
        {"resourcePool", "~"}, {"rpTag", "*"}, {"ethDot1PTag", "~"}, {"dscpTag", "~"},
        {"pktCount", "0"}, {"byteCount", "0"}}},
      {{rule("action=drop dir=both bidir dmac=00:11:22:33:44:55/ff:ff:ff:00:00:00 "
             "smac=!00:11:22:33:44:55/00:11:22:33:44:55 ethtype=!0x0800 vlan=!raw:8100000a "
             "sa=10.0.0.1-10.0.0.9 da=!10.0.0.3-10.0.0.7 proto=!17 sport=80 dport=!1000-2000 "
             "pkts=18446744073709551615 bytes=1234567890123")}, 8, 0,
       {{"dMac", " (00:11:22:33:44:55/ff:ff:ff:00:00:00)"}, {"sMac", " ! (00:11:22:33:44:55)"},
        {"ethType", " !(0x0800)"}, {"vlan1QTag", " !(167772289)"},
        {"ipSa", "(IPv4): (10.0.0.1 - 10.0.0.9)"}, {"ipDa", "(IPv4): !(10.0.0.3 - 10.0.0.7)"},
        {"ipProto", " !(17)"}, {"sPort", "(80)"}, {"dPort", " !(1000 - 2000)"},
        {"bidirectional", "True"}, {"wildcardsEnabled", "rptag"},
        {"direction", "SLCGenericDirectionBidirectional (bidirectional)"},
        {"rangesEnabled", "ipSa,ipDa,dPort,ethDA,ethSA"},
        {"pktCount", "18446744073709551615"}, {"byteCount", "1234567890123"}}},
      {{rule("action=drop ipv6 ethtype=any sa=2001:db8::1-<2001:db8::9 da=!fe80::aa:1")}, 8, 0,
       {{"ipSa", "(IPv6): (2001:db8:0:0:0:0:0:1 - 2001:db8:0:0:0:0:0:9)"},
        {"ipDa", "(IPv6): !(fe80:0:0:0:0:0:aa:1)"}, {"rangesEnabled", "ipSa"},
        {"wildcardsEnabled", "dMac,sMac,ethType,vlan.1Q,ipProto,sPort,dPort,rptag"}}},
      {{rule("action=gre gre=192.0.2.7 vlan=raw:8100000a")}, 8, 0,
       {{"greIP", "192.0.2.7"}, {"vlan1QTag", "167772289"}, {"rangesEnabled", "None"}}},
      {{rule("action=l2rewrite rewrite=0a:0b:0c:0d:0e:0f")}, 8, 0, {{"rewriteMac", "0a:0b:0c:0d:0e:0f"}}},
      {{rule("action=dscp+dot1p dscp=46 dot1p=5 rptag=300")}, 8, 0,
       {{"dscpTag", "46"}, {"ethDot1PTag", "5"}, {"rpTag", "300"}}},
      {{pool}, 8, 0, {{"resourcePool", std::string(127, 'p')}}},
      {{rule(kRuleA), rule(kExact443)}, 8, 0, {{"dPort", "(443)"}}},
      {{rule(kRuleA), rule(kExact443)}, 8, 1, {{"dPort", "(22)"}}},
      // Version 7: shown as the version-8 rule the filter holds for it (the
      // pool tag never compared, nothing negated, zero masks and tags).
      {{rule("proto=tcp dport=21"), rule("proto=tcp dport=22"),
        rule("raw action=dscp+dot1p ipv4 ethtype=any dmac=00:11:22:33:44:55 proto=tcp dport=23")}, 7, 2,
       {{"dPort", "(23)"}, {"wildcardsEnabled", "sMac,ethType,vlan.1Q,ipSa,ipDa,sPort,rptag"},
        {"rpTag", "*"}, {"dMac", " (00:11:22:33:44:55/00:00:00:00:00:00)"}, {"ipProto", "6"},
        {"ethDot1PTag", "0"}, {"dscpTag", "0"}}},
  };
  for (const auto& r : rows) {
    ASSERT_EQ(IoctlStatus(id_, Push(Ruleset(r.rules, r.version))), 1);
    const Fields got = Render(RuleAt(r.at));
    EXPECT_EQ(got.size(), 22u);
    for (const auto& [field, text] : r.want) {
      EXPECT_EQ(got.count(field) ? got.at(field) : "(missing)", text) << field;
    }
  }
}

}  // namespace
