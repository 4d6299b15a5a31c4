// Rule summaries: every field's text, positions in serialisation order,
// version-7 rules, and the failures.
#include <cstring>
#include <string>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"

namespace {

using controltest::Bytes;
using controltest::Clear;
using controltest::IoctlStatus;
using controltest::Push;
using controltest::Ruleset;

const std::string kAgent = testsupport::kDefaultAgent;
// What the host leaves in output bytes a handler does not write.
constexpr char kUnwritten = static_cast<char>(0xc7);

FWRule Blank() {
  FWRule r;
  std::memset(&r, 0, sizeof(r));
  return r;
}

void Set4(uint8_t* p, uint8_t a, uint8_t b, uint8_t c, uint8_t d) {
  p[0] = a;
  p[1] = b;
  p[2] = c;
  p[3] = d;
}

// The worked example: sMac, VLAN and rpTag wildcarded, a destination port
// range, IPv4, the destination address negated.
FWRule WorkedExample() {
  FWRule r = Blank();
  r.action = SLCGenericActionAccept;
  r.direction = SLCGenericDirectionToSwitch;
  r.ruleFlags = FW_WC_SMAC | FW_WC_VLAN | FW_WC_RPTAG | FW_RANGE_DPORT | FW_FLAG_IPV4;
  r.negateFlags = FW_NEG_IPDA;
  const uint8_t dmac[6] = {0x02, 0x00, 0x00, 0xaa, 0xbb, 0xcc};
  std::memcpy(r.dMac, dmac, 6);
  FWPutNet16(r.ethType, 0x0800);
  Set4(r.ipSa, 192, 168, 1, 10);
  Set4(r.ipDa, 10, 0, 0, 1);
  r.ipProto = 6;
  FWPutNet16(r.sPort, 1234);
  FWPutNet16(r.dPort, 80);
  FWPutNet16(r.dPortHigh, 90);
  return r;
}

class RuleSummaryTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = CreateFilter(kAgent, "vnic0");
  }
  void TearDown() override {
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
    ModuleTest::TearDown();
  }

  void Install(const std::vector<FWRule>& rules, uint8_t version = 8) {
    ASSERT_EQ(IoctlStatus(id_, Push(Ruleset(rules, version))), 1);
  }

  ZelStatus Get(host::QryValue position, SLCGeneric_RuleSummary* out) {
    Bytes bytes;
    ZelStatus s = host::StatusTree::Get(
        {"agents", kAgent, "filters", "vnic0-0", "rules", position, "ruleSummary"}, &bytes);
    EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
    if (s == ZEL_OK) {
      EXPECT_EQ(bytes.size(), sizeof(*out));
      std::memcpy(out, bytes.data(), sizeof(*out));
    }
    return s;
  }

  // The summary of the only rule of a freshly installed one-rule ruleset.
  SLCGeneric_RuleSummary Of(const FWRule& rule) {
    Install({rule});
    SLCGeneric_RuleSummary s;
    EXPECT_EQ(Get(int64_t(0), &s), ZEL_OK);
    return s;
  }

  host::FilterId id_ = 0;
};

TEST_F(RuleSummaryTest, WorkedExample) {
  SLCGeneric_RuleSummary s = Of(WorkedExample());
  EXPECT_STREQ(s.wildcardsEnabled, "sMac,vlan.1Q,rptag");
  EXPECT_STREQ(s.rangesEnabled, "dPort");
  EXPECT_STREQ(s.dMac, " (02:00:00:aa:bb:cc/00:00:00:00:00:00)");
  EXPECT_STREQ(s.sMac, "*");
  EXPECT_STREQ(s.vlan1QTag, "*");
  EXPECT_STREQ(s.rpTag, "*");
  EXPECT_STREQ(s.ethType, "0x0800");
  EXPECT_STREQ(s.ipSa, "(IPv4): (192.168.1.10)");
  EXPECT_STREQ(s.ipDa, "(IPv4): !(10.0.0.1)");
  EXPECT_STREQ(s.ipProto, "6");
  EXPECT_STREQ(s.sPort, "(1234)");
  EXPECT_STREQ(s.dPort, "(80 - 90)");
  EXPECT_STREQ(s.bidirectional, "False");
  EXPECT_EQ(uint32_t{s.direction}, 2u);
  EXPECT_EQ(uint32_t{s.action}, 2u);
  EXPECT_STREQ(s.pktCount, "0");
  EXPECT_STREQ(s.byteCount, "0");
  // Fields of other actions are left as the host's buffer held them.
  for (const char* f : {s.greIP, s.rewriteMac, s.resourcePool, s.ethDot1PTag, s.dscpTag}) {
    EXPECT_EQ(f[0], kUnwritten);
  }

  std::string text;
  ASSERT_EQ(host::StatusTree::Render(
                {"agents", kAgent, "filters", "vnic0-0", "rules", int64_t(0), "ruleSummary"}, &text),
            ZEL_OK);
  EXPECT_NE(text.find("direction: SLCGenericDirectionToSwitch (to switch)"), std::string::npos);
  EXPECT_NE(text.find("action: SLCGenericActionAccept (accept packets)"), std::string::npos);
}

TEST_F(RuleSummaryTest, WildcardAndRangeListsDropTheLastComma) {
  FWRule r = WorkedExample();
  r.ruleFlags = FW_FLAG_IPV4 | FW_RANGE_SPORT;  // no wildcard: an exact-looking general rule
  SLCGeneric_RuleSummary s = Of(r);
  EXPECT_STREQ(s.wildcardsEnabled, "None");
  EXPECT_STREQ(s.rangesEnabled, "sPort");

  r.ruleFlags = 0x2ff | FW_FLAG_IPV4;  // bits 0-7 and 9
  s = Of(r);
  EXPECT_STREQ(s.wildcardsEnabled, "dMac,sMac,ethType,vlan.1Q,ipSa,ipDa,ipProto,sPort,rptag");
  EXPECT_STREQ(s.rangesEnabled, "None");

  r.ruleFlags = FW_FLAG_IPV4 | FW_RANGE_IPSA | FW_MASK_DMAC | FW_MASK_SMAC | FW_WC_DPORT;
  s = Of(r);
  EXPECT_STREQ(s.rangesEnabled, "ipSa,ethDA,ethSA");
  // No "direction" word follows dPort: a rule has no direction wildcard.
  EXPECT_STREQ(s.wildcardsEnabled, "dPort");
}

TEST_F(RuleSummaryTest, NegationsRangesAndMasks) {
  const std::string fields =
      "action=drop dir=both bidir ipv4 dmac=00:11:22:33:44:55/ff:ff:ff:00:00:00 "
      "smac=!00:11:22:33:44:55/00:11:22:33:44:55 ethtype=!0x0800 vlan=!raw:8100000a "
      "sa=!10.0.0.1-10.0.0.9 da=0.0.0.0 proto=!17 sport=80 dport=!1000-2000 "
      "pkts=18446744073709551615 bytes=1234567890123";
  SLCGeneric_RuleSummary s = Of(rules::ParseRule(fields));
  EXPECT_STREQ(s.dMac, " (00:11:22:33:44:55/ff:ff:ff:00:00:00)");
  EXPECT_STREQ(s.sMac, " ! (00:11:22:33:44:55)");
  EXPECT_STREQ(s.ethType, " !(0x0800)");
  EXPECT_STREQ(s.vlan1QTag, " !(167772289)");
  EXPECT_STREQ(s.ipSa, "(IPv4): !(10.0.0.1 - 10.0.0.9)");
  EXPECT_STREQ(s.ipDa, "(IPv4): (0.0.0.0)");
  EXPECT_STREQ(s.ipProto, " !(17)");
  EXPECT_STREQ(s.sPort, "(80)");
  EXPECT_STREQ(s.dPort, " !(1000 - 2000)");
  EXPECT_STREQ(s.bidirectional, "True");
  EXPECT_EQ(uint32_t{s.direction}, 3u);
  EXPECT_STREQ(s.pktCount, "18446744073709551615");
  EXPECT_STREQ(s.byteCount, "1234567890123");

  FWRule plain = rules::ParseRule(fields);
  plain.negateFlags = 0;
  s = Of(plain);
  EXPECT_STREQ(s.ipSa, "(IPv4): (10.0.0.1 - 10.0.0.9)");
  EXPECT_STREQ(s.vlan1QTag, "167772289");
  EXPECT_STREQ(s.sMac, " (00:11:22:33:44:55)");
}

TEST_F(RuleSummaryTest, Ipv6AddressesAndRanges) {
  FWRule r = rules::ParseRule("action=drop ipv6 sa=2001:db8::1-2001:db8::9 da=!fe80::aa:1");
  SLCGeneric_RuleSummary s = Of(r);
  EXPECT_STREQ(s.ipSa, "(IPv6): (2001:db8:0:0:0:0:0:1 - 2001:db8:0:0:0:0:0:9)");
  EXPECT_STREQ(s.ipDa, "(IPv6): !(fe80:0:0:0:0:0:aa:1)");
}

TEST_F(RuleSummaryTest, ActionFieldsAreWrittenForTheirActionsOnly) {
  FWRule gre = rules::ParseRule("action=gre gre=192.0.2.7 proto=tcp");
  SLCGeneric_RuleSummary s = Of(gre);
  EXPECT_STREQ(s.greIP, "192.0.2.7");
  for (const char* f : {s.rewriteMac, s.resourcePool, s.ethDot1PTag, s.dscpTag}) {
    EXPECT_EQ(f[0], kUnwritten);
  }

  s = Of(rules::ParseRule("action=l2rewrite rewrite=0a:0b:0c:0d:0e:0f proto=tcp"));
  EXPECT_STREQ(s.rewriteMac, "0a:0b:0c:0d:0e:0f");
  EXPECT_EQ(s.greIP[0], kUnwritten);

  s = Of(rules::ParseRule("action=dscp+dot1p dscp=46 dot1p=5 rptag=300 proto=udp"));
  EXPECT_STREQ(s.dscpTag, "46");
  EXPECT_STREQ(s.ethDot1PTag, "5");
  EXPECT_STREQ(s.rpTag, "300");

  s = Of(rules::ParseRule("action=dscp dscp=10 proto=udp"));
  EXPECT_STREQ(s.dscpTag, "10");
  EXPECT_EQ(s.ethDot1PTag[0], kUnwritten);

  // A pool name that fills its field without a NUL is cut, not overread.
  FWRule pool = rules::ParseRule("action=pooltag proto=udp");
  std::memset(pool.resourcePool, 'p', sizeof(pool.resourcePool));
  s = Of(pool);
  EXPECT_EQ(std::string(s.resourcePool), std::string(127, 'p'));
}

// Positions follow the serialisation: exact rules first, then the general
// rules in ruleset order.
TEST_F(RuleSummaryTest, PositionsFollowSerialisationOrder) {
  FWRule general = rules::ParseRule("action=drop proto=tcp dport=22");
  FWRule exact = rules::ParseRule(
      "action=accept dir=to ipv4 dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
      "vlan=none proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=443");
  Install({general, exact});
  SLCGeneric_RuleSummary s;
  ASSERT_EQ(Get(int64_t(0), &s), ZEL_OK);
  EXPECT_STREQ(s.dPort, "(443)");
  ASSERT_EQ(Get(int64_t(1), &s), ZEL_OK);
  EXPECT_STREQ(s.dPort, "(22)");
  EXPECT_EQ(Get(int64_t(2), &s), ZEL_NOT_FOUND);
  EXPECT_EQ(Get(int64_t(-1), &s), ZEL_NOT_FOUND);

  // A removed rule keeps the count; its position is past the serialised end.
  ASSERT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({exact}))), 1);
  ASSERT_EQ(Get(int64_t(0), &s), ZEL_OK);
  EXPECT_STREQ(s.dPort, "(22)");
  EXPECT_EQ(Get(int64_t(1), &s), ZEL_NOT_FOUND);
}

// A version-7 rule is shown as the version-8 rule the filter holds for it:
// the pool tag never compared, nothing negated, zero masks and tags.
TEST_F(RuleSummaryTest, Version7RulesetThirdRule) {
  std::vector<FWRule> rules = {
      rules::ParseRule("action=drop ipv4 proto=tcp dport=21"),
      rules::ParseRule("action=drop ipv4 proto=tcp dport=22"),
      rules::ParseRule("action=dscp+dot1p ipv4 dmac=00:11:22:33:44:55 proto=tcp dport=23"),
  };
  Install(rules, 7);
  SLCGeneric_RuleSummary s;
  ASSERT_EQ(Get(int64_t(2), &s), ZEL_OK);
  EXPECT_STREQ(s.dPort, "(23)");
  EXPECT_STREQ(s.wildcardsEnabled, "sMac,ethType,vlan.1Q,ipSa,ipDa,sPort,rptag");
  EXPECT_STREQ(s.rpTag, "*");
  EXPECT_STREQ(s.dMac, " (00:11:22:33:44:55/00:00:00:00:00:00)");
  EXPECT_STREQ(s.ipProto, "6");
  EXPECT_STREQ(s.ethDot1PTag, "0");
  EXPECT_STREQ(s.dscpTag, "0");
  EXPECT_EQ(uint32_t{s.action}, uint32_t(SLCGenericActionDSCPMarkAndEthDot1PMark));
  ASSERT_EQ(Get(int64_t(0), &s), ZEL_OK);
  EXPECT_STREQ(s.dPort, "(21)");
  EXPECT_EQ(Get(int64_t(3), &s), ZEL_NOT_FOUND);
}

TEST_F(RuleSummaryTest, FailuresLeaveOutputUnwrittenAndNoLockHeld) {
  SLCGeneric_RuleSummary s;
  EXPECT_EQ(Get(int64_t(0), &s), ZEL_NOT_FOUND);  // no rules at all
  Install({WorkedExample()});
  EXPECT_EQ(Get(std::string("0"), &s), ZEL_BAD_PARAM_TYPE);

  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(Get(int64_t(0), &s), ZEL_NO_MEMORY);

  Bytes bytes;
  EXPECT_EQ(host::StatusTree::Get(
                {"agents", kAgent, "filters", "vnic9-0", "rules", int64_t(0), "ruleSummary"}, &bytes),
            ZEL_NOT_FOUND);
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
}

}  // namespace
