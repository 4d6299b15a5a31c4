// Rule lookup on hand-made packet summaries: stage order, range bounds,
// negation bits, masks, families, presence and pool tags.
#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <cstring>
#include <string>

#include "firewall/fw_ioctl.h"
#include "tests/support/fw_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using testsupport::FirewallTest;
using testsupport::ModelPacket;

void Mac(const char* text, uint8_t out[6]) {
  FWRule r = rules::ParseRule(std::string("dmac=") + text);
  std::memcpy(out, r.dMac, 6);
}

// A TCP/UDP packet with every field present.
ModelPacket Pkt(const std::string& sa, int sp, const std::string& da, int dp, int proto = 6) {
  ModelPacket p;
  const bool v6 = sa.find(':') != std::string::npos;
  p.presence = FW_PKT_L2 | FW_PKT_L3 | FW_PKT_PORTS | FW_PKT_RPTAG |
               (v6 ? FW_PKT_IPV6 : FW_PKT_IPV4) | (proto == 17 ? FW_PKT_UDP : FW_PKT_TCP);
  Mac("02:00:00:00:00:0a", p.dMac);
  Mac("02:00:00:00:00:0b", p.sMac);
  FWPutNet16(p.ethType, v6 ? 0x86dd : 0x0800);
  inet_pton(v6 ? AF_INET6 : AF_INET, sa.c_str(), p.ipSa);
  inet_pton(v6 ? AF_INET6 : AF_INET, da.c_str(), p.ipDa);
  p.ipProto = static_cast<uint8_t>(proto);
  FWPutNet16(p.sPort, static_cast<uint16_t>(sp));
  FWPutNet16(p.dPort, static_cast<uint16_t>(dp));
  return p;
}

// The same packet without ports (e.g. ICMP or a later fragment).
ModelPacket NoPorts(ModelPacket p, int proto = 1) {
  p.presence &= ~(FW_PKT_PORTS | FW_PKT_TCP | FW_PKT_UDP);
  p.ipProto = static_cast<uint8_t>(proto);
  return p;
}

constexpr const char* kKey =
    "dmac=02:00:00:00:00:0a smac=02:00:00:00:00:0b ethtype=0x0800 vlan=none proto=6 "
    "sa=10.0.0.1 sport=1000 da=10.0.0.2 dport=80 ";

class LookupTest : public FirewallTest {
 protected:
  void Load(const std::string& text, bool replace = true) {
    ASSERT_EQ(Apply(rules::ParseRuleset(text), replace), ZEL_OK);
  }
  // The action of the rule found, or -1.
  int Action(const ModelPacket& p, uint32_t dir = 2, uint16_t tag = 0) {
    FWRuleEntry* e = Lookup(p, dir, tag);
    return e ? static_cast<int>(e->rule.action) : -1;
  }
};

TEST_F(LookupTest, ExactRuleWinsUnlessItsDirectionOrTagRefuses) {
  Load("action=drop sport=1000\n" + std::string(kKey) + "action=accept dir=to\n" + kKey +
       "action=punt dir=from rptag=5 bidir=2\n");
  // The two exact records merged: direction both, action accept, tag
  // wildcard from the first record.
  EXPECT_EQ(Action(Pkt("10.0.0.1", 1000, "10.0.0.2", 80), 1), SLCGenericActionAccept);
  Load(std::string(kKey) + "action=accept dir=to rptag=5\n" + "action=drop sport=1000\n");
  const ModelPacket p = Pkt("10.0.0.1", 1000, "10.0.0.2", 80);
  EXPECT_EQ(Action(p, 2, 5), SLCGenericActionAccept);
  EXPECT_EQ(Action(p, 1, 5), SLCGenericActionDrop);  // wrong direction: general scan
  EXPECT_EQ(Action(p, 2, 4), SLCGenericActionDrop);  // wrong pool tag: general scan
  // Without ports the exact table is not probed at all.
  EXPECT_EQ(Action(NoPorts(p, 6), 2, 5), -1);
  Load("ruleset version=8\n");
  EXPECT_EQ(Action(p), -1);
}

TEST_F(LookupTest, RangeBoundsPerFamily) {
  Load("action=drop da=10.0.0.1-10.0.0.9\n");
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "10.0.0.1", 1)), 1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "10.0.0.9", 1)), 1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "10.0.0.10", 1)), -1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "10.0.0.0", 1)), -1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "11.0.0.5", 1)), -1);  // big-endian numbers

  Load("action=drop da=2001:db8::1-<2001:db8::9\n");  // the wire bounds
  EXPECT_EQ(Action(Pkt("::1", 1, "2001:db8::1", 1)), 1);
  EXPECT_EQ(Action(Pkt("::1", 1, "2001:db8::8", 1)), 1);
  EXPECT_EQ(Action(Pkt("::1", 1, "2001:db8::9", 1)), -1);  // IPv6 upper bound excluded
  EXPECT_EQ(Action(Pkt("::1", 1, "2001:db7:ffff::5", 1)), -1);

  Load("action=drop sa=!2001:db8::100-<2001:db8:0:1::\n");
  EXPECT_EQ(Action(Pkt("2001:db8::ff", 1, "::2", 1)), 1);
  EXPECT_EQ(Action(Pkt("2001:db8::100", 1, "::2", 1)), -1);
  EXPECT_EQ(Action(Pkt("2001:db8::ffff:ffff:ffff", 1, "::2", 1)), -1);
  EXPECT_EQ(Action(Pkt("2001:db8:0:1::", 1, "::2", 1)), 1);
}

TEST_F(LookupTest, NegationBitsOfPortsAndAddressesAreSwapped) {
  Load("action=drop sport=!100-200\n");
  EXPECT_EQ(Action(Pkt("1.1.1.1", 99, "2.2.2.2", 150)), 1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 201, "2.2.2.2", 150)), 1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 100, "2.2.2.2", 150)), -1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 200, "2.2.2.2", 150)), -1);
  // Raw bits: negateFlags bit 8 negates the source port, bit 4 the
  // destination address.
  Load("action=drop sport=5 da=10.0.0.1 rawneg=0x110\n");
  EXPECT_EQ(Action(Pkt("1.1.1.1", 6, "10.0.0.2", 5)), 1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 5, "10.0.0.2", 5)), -1);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 6, "10.0.0.1", 5)), -1);
}

TEST_F(LookupTest, MacMasksAndNegation) {
  Load("action=drop dmac=02:11:22:00:00:00/ff:ff:ff:00:00:00\n");
  ModelPacket p = Pkt("1.1.1.1", 1, "2.2.2.2", 2);
  Mac("02:11:22:33:44:55", p.dMac);
  EXPECT_EQ(Action(p), 1);
  Mac("02:11:23:00:00:00", p.dMac);
  EXPECT_EQ(Action(p), -1);
  Load("action=drop dmac=!02:11:22:00:00:00/ff:ff:ff:00:00:00\n");
  EXPECT_EQ(Action(p), 1);
  Mac("02:11:22:00:00:01", p.dMac);
  EXPECT_EQ(Action(p), -1);
  // Version 7 has no mask: bit 22 compares under an all-zero mask.
  Load("ruleset version=7\nraw action=punt smac=0e:0e:0e:0e:0e:0e/00:00:00:00:00:00\n");
  EXPECT_EQ(Action(p), SLCGenericActionPunt);
}

TEST_F(LookupTest, AddressFamilyMattersOnlyWhenAnAddressIsCompared) {
  Load("action=drop ipv6 ethtype=any proto=6\n");  // both addresses wildcarded
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "2.2.2.2", 2)), 1);
  EXPECT_EQ(Action(Pkt("::1", 1, "::2", 2)), 1);
  Load("action=drop sa=2001:db8::1\n");
  ModelPacket v4 = Pkt("1.1.1.1", 1, "2.2.2.2", 2);
  std::memset(v4.ipSa, 0, 16);
  inet_pton(AF_INET6, "2001:db8::1", v4.ipSa);  // same bytes, IPv4 packet
  EXPECT_EQ(Action(v4), -1);
  EXPECT_EQ(Action(Pkt("2001:db8::1", 1, "::2", 2)), 1);
}

TEST_F(LookupTest, PresenceDirectionAndPoolTag) {
  ModelPacket unparsed;  // only the pool-tag bit
  ModelPacket arp = unparsed;
  arp.presence |= FW_PKT_L2;
  FWPutNet16(arp.ethType, 0x0806);
  Load("action=drop dir=invalid\n"
       "action=copy ethtype=0x0806\n"
       "action=punt rptag=3\n"
       "action=log dir=from\n");
  EXPECT_EQ(Action(arp, 2), SLCGenericActionCopy);
  EXPECT_EQ(Action(unparsed, 2, 3), SLCGenericActionPunt);
  EXPECT_EQ(Action(unparsed, 2, 2), -1);
  EXPECT_EQ(Action(unparsed, 1, 2), SLCGenericActionLog);
  // An ICMP packet meets the L3 rule but not one that needs ports.
  Load("action=drop proto=1 sport=0 dport=0\n" "action=punt proto=1\n");
  EXPECT_EQ(Action(NoPorts(Pkt("1.1.1.1", 0, "2.2.2.2", 0))), SLCGenericActionPunt);
}

TEST_F(LookupTest, EarliestGeneralRuleWinsAcrossAddedRulesets) {
  Load("action=drop dport=80\naction=punt proto=6\n");
  Load("action=copy dport=80\n", /*replace=*/false);
  const ModelPacket p = Pkt("1.1.1.1", 1, "2.2.2.2", 80);
  EXPECT_EQ(Action(p), SLCGenericActionDrop);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "2.2.2.2", 81)), SLCGenericActionPunt);
  Load("action=copy dport=80\n" "action=drop dport=80\n");
  EXPECT_EQ(Action(p), SLCGenericActionCopy);
}

// A general rule removed through the ioctl channel no longer matches, and
// the rules after it keep their order; a packet direction other than 1 or
// 2 still meets only rules of its own direction or of both.
TEST_F(LookupTest, RemovedGeneralRuleStopsMatchingAndOthersKeepOrder) {
  Load("action=drop dport=80\n" "action=punt proto=6 sport=7\n" "action=copy dport=80\n"
       "raw action=log dport=81 dir=7\n" "action=accept dport=81\n");
  const ModelPacket p = Pkt("1.1.1.1", 7, "2.2.2.2", 80);
  EXPECT_EQ(Action(p), SLCGenericActionDrop);
  auto remove = [&](const char* line) {
    std::vector<uint8_t> msg(8);
    const uint32_t head[2] = {FWIoctlMsgClear, FWClearMethodRemove};
    std::memcpy(msg.data(), head, sizeof(head));
    const auto rs = rules::RulesetBuilder(8).Add(rules::ParseRule(line)).Bytes();
    msg.insert(msg.end(), rs.begin(), rs.end());
    FWFilterIoctlRequest(filter_, 7, msg.data(), msg.size());
  };
  remove("dport=80");
  EXPECT_EQ(Action(p), SLCGenericActionPunt);
  EXPECT_EQ(Action(Pkt("1.1.1.1", 1, "2.2.2.2", 80)), SLCGenericActionCopy);
  const ModelPacket p81 = Pkt("1.1.1.1", 1, "2.2.2.2", 81);
  EXPECT_EQ(Action(p81, 7), SLCGenericActionLog);
  EXPECT_EQ(Action(p81, 2), SLCGenericActionAccept);
  EXPECT_EQ(Action(p81, 0), SLCGenericActionAccept);
  remove("proto=6 sport=7");
  remove("dport=80");
  EXPECT_EQ(Action(p), -1);
  EXPECT_EQ(Action(p81, 2), SLCGenericActionAccept);
}

}  // namespace
