// The filter ioctl channel as the slow path drives it: echo, ruleset push,
// clear (all, remove, reset counters), state query, and hostile messages.
#include <string>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"

namespace {

using controltest::Bytes;
using controltest::Clear;
using controltest::GetState;
using controltest::GetU32;
using controltest::GetU64;
using controltest::Ioctl;
using controltest::IoctlStatus;
using controltest::Push;
using controltest::PutU32;
using controltest::Ruleset;

const std::string kL2 = " dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 vlan=none";
const std::string kExactA =
    "action=drop dir=to ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80" + kL2;
const std::string kExactB =
    "action=accept dir=from ipv4 proto=udp sa=10.0.0.3 da=10.0.0.4 sport=53 dport=5353" + kL2;
const std::string kGeneral22 = "action=drop dir=both ipv4 proto=tcp dport=22";
const std::string kGeneral23 = "action=drop dir=both ipv4 proto=tcp dport=23";

class IoctlTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = CreateFilter(testsupport::kDefaultAgent, "vnic0");
    ctx_ = Ctx(id_);
    ASSERT_NE(ctx_, nullptr);
  }

  // The ruleset in force as the state query returns it (after the 8-byte
  // message header).
  Bytes State() {
    auto replies = Ioctl(id_, GetState(), 9);
    EXPECT_EQ(replies.size(), 1u);
    if (replies.size() != 1) return {};
    const Bytes& m = replies[0].message;
    EXPECT_EQ(GetU32(m, 0), FWIoctlMsgRuleset);
    EXPECT_EQ(GetU32(m, 4), 0u);
    return Bytes(m.begin() + 8, m.end());
  }

  host::FilterId id_ = 0;
  FWFilterContext* ctx_ = nullptr;
};

Bytes EchoMsg(const std::string& text, bool nul = true) {
  Bytes m;
  PutU32(&m, 0, FWIoctlMsgEcho);
  m.insert(m.end(), text.begin(), text.end());
  if (nul) m.push_back('\0');
  return m;
}

TEST_F(IoctlTest, EchoUpperCasesAtMost64CharactersWithinThePayload) {
  auto replies = Ioctl(id_, EchoMsg("ab1z"), 5);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].requestCode, 5u);
  EXPECT_EQ(replies[0].message, EchoMsg("AB1Z"));  // 9 bytes, NUL included

  EXPECT_TRUE(Ioctl(id_, EchoMsg("ab1z"), 0).empty());

  replies = Ioctl(id_, EchoMsg(std::string(70, 'q')), 1);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].message, EchoMsg(std::string(64, 'Q') + std::string(6, 'q')));

  // No NUL: the text ends with the payload (the host's copy is exactly sized).
  replies = Ioctl(id_, EchoMsg("abc", false), 1);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].message, EchoMsg("ABC", false));
}

TEST_F(IoctlTest, PushMustHaveExactLength) {
  Bytes msg = Push(Ruleset({kExactA, kGeneral22}));
  ASSERT_EQ(msg.size(), 585u);
  Bytes shorter(msg.begin(), msg.end() - 1);
  EXPECT_EQ(IoctlStatus(id_, shorter), 0);
  EXPECT_TRUE(host::Log::Contains(
      "Invalid ruleset length for version 8(ruleSize = 281). Got 576, expecting 577", 2));
  Bytes v9 = msg;
  v9[8] = 9;
  EXPECT_EQ(IoctlStatus(id_, v9), 0);
  EXPECT_TRUE(host::Log::Contains("Failed to get rule size for version 9", 2));
  // Shorter than its header: refused without reading past it.
  for (size_t len : {4u, 11u, 22u}) {
    EXPECT_EQ(IoctlStatus(id_, Bytes(msg.begin(), msg.begin() + len)), 0) << len;
  }
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->ioctl, 0u);

  EXPECT_EQ(IoctlStatus(id_, msg), 1);
  EXPECT_TRUE(host::Log::Contains("Received Firewall ruleset via Sluice IOCTL, payloadSize: 585", 1));
  EXPECT_EQ(ctx_->numRules, 2u);
  EXPECT_EQ(ctx_->ioctl, 1u);
}

// Once a ruleset came through the ioctl channel, the property and restores
// are ignored, even when the ioctl ruleset itself was refused.
TEST_F(IoctlTest, IoctlRulesetMakesPropertyWritesAndRestoresIgnored) {
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 1, true);
  EXPECT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA}))), 0);
  host::Faults::ClearAll();
  EXPECT_EQ(ctx_->ioctl, 1u);

  Bytes other = Ruleset({kExactB, kGeneral22});
  std::string prop = std::string(testsupport::kDefaultAgent) + ".ruleset";
  EXPECT_EQ(host::Sluice::PropertyWrite(prop, id_, other), ZEL_OK);
  EXPECT_EQ(FWRestoreState(Filter(id_), other.data(), other.size()), ZEL_OK);
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->numRules, 0u);
}

// --- State query ----------------------------------------------------------------

TEST_F(IoctlTest, StateReplyIsSizedForVersion8RulesAndCarriesCounters) {
  rules::RulesetBuilder b(8);
  b.Add(rules::RuleBuilder().Set("action", "drop").Src("10.0.0.9").Counters(5, 700).Build());
  b.Add(kExactA).Add(kGeneral22);
  ASSERT_EQ(IoctlStatus(id_, Push(b.Bytes())), 1);

  auto replies = Ioctl(id_, GetState(), 11);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].requestCode, 11u);
  ASSERT_EQ(replies[0].message.size(), 866u);
  EXPECT_TRUE(host::Log::Contains("Received request to get firewall state", 1));
  Bytes state(replies[0].message.begin() + 8, replies[0].message.end());
  EXPECT_EQ(state[0], 8);
  EXPECT_EQ(state[1], 8);
  EXPECT_EQ(state[2], 7);
  EXPECT_EQ(GetU32(state, 3), 3u);
  // The exact rule comes first; the general rules follow in ruleset order.
  const size_t second = 15 + 281 + offsetof(FWRule, pktCount);
  EXPECT_EQ(GetU64(state, second), 5u);
  EXPECT_EQ(GetU64(state, second + 8), 700u);

  // Version 7: records 259 bytes apart, bit 9 written clear, zero tail.
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kGeneral22, kGeneral23}, 7))), 1);
  state = State();
  ASSERT_EQ(state.size(), 15u + 2 * 281);
  EXPECT_EQ(state[0], 7);
  EXPECT_EQ(GetU32(state, 15 + 259 + offsetof(FWRule, ruleFlags)) & FW_WC_RPTAG, 0u);
  EXPECT_EQ(state[15 + 259 + offsetof(FWRule, dPort) + 1], 23);
  for (size_t i = 15 + 2 * 259; i < state.size(); ++i) ASSERT_EQ(state[i], 0) << i;
}

TEST_F(IoctlTest, StateQueryFailuresAreLoggedAndLeaveNoReply) {
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA}))), 1);
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_TRUE(Ioctl(id_, GetState()).empty());
  EXPECT_TRUE(host::Log::Contains("Failed allocating msg to get firewall state", 1));

  host::Faults::Fail("zel_SluiceSendFilterIoctlReply", ZEL_FAILURE);
  EXPECT_TRUE(Ioctl(id_, GetState()).empty());
  EXPECT_TRUE(host::Log::Contains("Error sending rules to slowpath", 2));

  host::Faults::Fail("zel_SluiceSendFilterIoctlReply", ZEL_FAILURE);
  EXPECT_TRUE(Ioctl(id_, Push(Ruleset({kExactA}))).empty());
  EXPECT_TRUE(host::Log::Contains("Return status on IoctlReply was: 195887105", 1));
}

// --- Clear ------------------------------------------------------------------------

TEST_F(IoctlTest, ClearAllDropsEveryRuleButKeepsVersionAndFlag) {
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA, kGeneral22}, 7))), 1);
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodAll)), 1);
  EXPECT_TRUE(host::Log::Contains("Received request to clear all firewall state", 1));
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_TRUE(List_IsEmpty(&ctx_->ruleList));
  EXPECT_EQ(ctx_->numRules, 0u);
  EXPECT_EQ(ctx_->version, 7u);
  EXPECT_EQ(ctx_->ioctl, 1u);
}

TEST_F(IoctlTest, RemoveExactRuleOnceThenReportsItMissing) {
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA, kExactB}))), 1);
  Bytes remove = Clear(FWClearMethodRemove, Ruleset({kExactA}));
  EXPECT_EQ(IoctlStatus(id_, remove), 1);
  EXPECT_TRUE(host::Log::Contains("Received request to clear 1 firewall rules", 1));
  Bytes state = State();
  ASSERT_EQ(GetU32(state, 3), 1u);
  EXPECT_EQ(state[15 + offsetof(FWRule, dPort) + 1], 5353 & 0xff);
  // The rule count of the context is not lowered by a removal.
  EXPECT_EQ(ctx_->numRules, 2u);

  EXPECT_EQ(IoctlStatus(id_, remove), 1);
  EXPECT_EQ(host::Log::Count("Asked to remove non-existent rule, ignoring.", 2), 1u);
}

TEST_F(IoctlTest, ResetCountersOfGeneralRuleKeepsItsEntry) {
  rules::RulesetBuilder b(8);
  b.Add(rules::ParseRule(kGeneral22 + " pkts=4 bytes=400"));
  b.Add(rules::ParseRule(kGeneral23 + " pkts=6 bytes=600"));
  ASSERT_EQ(IoctlStatus(id_, Push(b.Bytes())), 1);

  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodStats, Ruleset({kGeneral23}))), 1);
  Bytes state = State();
  ASSERT_EQ(GetU32(state, 3), 2u);
  EXPECT_EQ(GetU64(state, 15 + offsetof(FWRule, pktCount)), 4u);
  EXPECT_EQ(GetU64(state, 15 + 281 + offsetof(FWRule, pktCount)), 0u);
  EXPECT_EQ(GetU64(state, 15 + 281 + offsetof(FWRule, byteCount)), 0u);

  // A rule that differs in a compared field names nothing.
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodStats, Ruleset({kGeneral22 + " sport=1"}))), 1);
  EXPECT_TRUE(host::Log::Contains("Asked to remove stats for non-existent rule, ignoring.", 2));
}

// General rules are named by wildcard bits and compared fields only (not
// action or direction); a range rule without wildcards is found in the
// general list although a hash probe cannot find it.
TEST_F(IoctlTest, RemoveGeneralAndRangeRules) {
  const std::string range =
      "action=drop dir=to ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1 dport=100-200" + kL2;
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kGeneral22, kGeneral23, range, kExactA}))), 1);
  const std::string other23 = "action=accept dir=from ipv4 proto=tcp dport=23";
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({other23, range}))), 1);
  EXPECT_EQ(host::Log::Count("Asked to remove non-existent rule, ignoring."), 0u);
  Bytes state = State();
  ASSERT_EQ(GetU32(state, 3), 2u);
  EXPECT_EQ(state[15 + offsetof(FWRule, dPort) + 1], 80);
  EXPECT_EQ(state[15 + 281 + offsetof(FWRule, dPort) + 1], 22);
}

TEST_F(IoctlTest, UnexpectedMethodOrNoRulesetChangesNothing) {
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({kExactA}))), 1);
  EXPECT_TRUE(host::Log::Contains("Asked to clear firewall rules, when none are in effect.", 2));

  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA}))), 1);
  EXPECT_EQ(IoctlStatus(id_, Clear(7, Ruleset({kExactA, kExactB}))), 1);
  EXPECT_EQ(host::Log::Count("Unexpected clear method", 2), 1u);
  EXPECT_EQ(host::Log::Count("Asked to remove non-existent rule, ignoring.", 2), 1u);
  EXPECT_EQ(GetU32(State(), 3), 1u);
}

// Hostile clears: nothing is read past the payload and nothing changes.
TEST_F(IoctlTest, MalformedClearsAreRefusedBeforeAnyRuleIsTouched) {
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA, kExactB}))), 1);
  Bytes remove = Clear(FWClearMethodRemove, Ruleset({kExactA}));

  // Without its method, or without its ruleset header.
  EXPECT_EQ(IoctlStatus(id_, Bytes(remove.begin(), remove.begin() + 6)), 0);
  EXPECT_EQ(IoctlStatus(id_, Bytes(remove.begin(), remove.begin() + 22)), 0);
  EXPECT_EQ(host::Log::Count("Truncated firewall ioctl message of type 4, payloadSize: 22", 2), 1u);

  // More rules announced than carried.
  Bytes tooMany = remove;
  PutU32(&tooMany, 11, 3);
  EXPECT_EQ(IoctlStatus(id_, tooMany), 0);
  EXPECT_TRUE(host::Log::Contains(
      "Invalid ruleset length for version 8(ruleSize = 281). Got 296, expecting 858", 2));
  Bytes huge = remove;
  PutU32(&huge, 11, 0xffffffffu);
  EXPECT_EQ(IoctlStatus(id_, huge), 0);

  // A version with no rule size.
  Bytes v9 = remove;
  v9[8] = 9;
  EXPECT_EQ(IoctlStatus(id_, v9), 0);
  EXPECT_TRUE(host::Log::Contains("Failed to get rule size for version 9", 2));

  EXPECT_EQ(GetU32(State(), 3), 2u);
  // "Clear all" needs only its method.
  ASSERT_EQ(Clear(FWClearMethodAll).size(), 8u);
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodAll)), 1);
  EXPECT_EQ(ctx_->ruleHash, nullptr);
}

TEST_F(IoctlTest, UnknownAndShortMessagesAreIgnoredWithoutReply) {
  for (uint32_t type : {0u, 3u, 5u, 7u, 100u}) {
    Bytes m = Push(Ruleset({kExactA}));
    PutU32(&m, 0, type);
    EXPECT_TRUE(Ioctl(id_, m).empty()) << type;
  }
  EXPECT_TRUE(Ioctl(id_, Bytes{2, 0, 0}).empty());
  EXPECT_TRUE(Ioctl(id_, Bytes{}).empty());
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->ioctl, 0u);
}

}  // namespace
