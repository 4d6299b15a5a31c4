// Rule lookup for packet directions other than 1 and 2, which the scan
// index does not encode: the scan falls back to the full test of every rule
// and must still honour each rule's direction and family and the ruleset
// order. The keyed scan, ranges, negations, masks, families, pool tags,
// merges and removals are checked against the reference model in
// lookup_model_test and classifier_test.
#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <cstring>

#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using LookupTest = testsupport::FirewallTest;

TEST_F(LookupTest, UnkeyedDirectionsMeetOnlyTheirOwnAndBidirectionalRules) {
  ASSERT_EQ(Apply(rules::ParseRuleset("action=drop dport=80\n"
                                      "raw action=log dport=81 dir=7\n"
                                      "action=punt dir=to dport=81\n"
                                      "action=accept dport=81\n"
                                      "action=copy sa=101:101:: dport=83\n")),
            ZEL_OK);
  testsupport::ModelPacket p;
  p.presence = FW_PKT_L2 | FW_PKT_L3 | FW_PKT_PORTS | FW_PKT_RPTAG | FW_PKT_IPV4 | FW_PKT_TCP;
  FWPutNet16(p.ethType, 0x0800);
  inet_pton(AF_INET, "1.1.1.1", p.ipSa);
  inet_pton(AF_INET, "2.2.2.2", p.ipDa);
  p.ipProto = 6;
  FWPutNet16(p.sPort, 1);
  FWPutNet16(p.dPort, 81);
  auto action = [&](uint32_t dir) {
    const FWRuleEntry* e = Lookup(p, dir);
    return e != nullptr ? static_cast<int>(e->rule.action) : -1;
  };
  EXPECT_EQ(action(7), SLCGenericActionLog);
  EXPECT_EQ(action(0), SLCGenericActionAccept);
  EXPECT_EQ(action(3), SLCGenericActionAccept);
  EXPECT_EQ(action(2), SLCGenericActionPunt);  // the keyed scan, for comparison
  FWPutNet16(p.dPort, 80);
  EXPECT_EQ(action(7), SLCGenericActionDrop);
  FWPutNet16(p.dPort, 83);  // an IPv6 rule whose address has the packet's bytes
  EXPECT_EQ(action(0), -1);
}

}  // namespace
