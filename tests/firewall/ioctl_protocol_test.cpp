// The filter ioctl channel as the slow path drives it: echo, ruleset push,
// clear (all, remove, reset counters), state query, and hostile messages.
#include "tests/control/control_test_util.h"

namespace {

using namespace controltest;

const std::string kExactA = "action=drop dir=to" + kFlowF + " dport=80";
const std::string kExactB = "action=accept dir=from" + kFlowF + " dport=5353";
const std::string kGen22 = "action=drop dir=both ipv4 proto=tcp dport=22";
const std::string kGen23 = "action=drop dir=both ipv4 proto=tcp dport=23";

// Rule i of a serialised ruleset with records of `size` bytes (zero-extended).
FWRule RuleAt(const Bytes& ruleset, size_t i, size_t size = 281) {
  FWRule r{};
  EXPECT_GE(ruleset.size(), 15 + (i + 1) * size);
  if (ruleset.size() >= 15 + (i + 1) * size) std::memcpy(&r, &ruleset[15 + i * size], size);
  return r;
}

// The ruleset in force as the state query returns it, after the 8-byte
// message header; the reply always counts 281 bytes per rule.
Bytes State(host::FilterId id) {
  auto replies = Ioctl(id, GetState(), 9);
  if (replies.size() != 1) return ADD_FAILURE() << replies.size() << " replies", Bytes{};
  const Bytes& m = replies[0].message;
  EXPECT_EQ(Bytes(m.begin(), m.begin() + 8), Msg(FWIoctlMsgRuleset, 0));
  EXPECT_EQ(m.size(), 23 + 281 * size_t{Get(m, 11)});
  return Bytes(m.begin() + 8, m.end());
}

using IoctlTest = FilterTest;

// The echo message: its type, then the text.
Bytes Echo(const std::string& text) {
  Bytes m = Msg(FWIoctlMsgEcho, 0, Bytes(text.begin(), text.end()));
  return m.erase(m.begin() + 4, m.begin() + 8), m;
}

TEST_F(IoctlTest, EchoUpperCasesAtMost64CharactersWithinThePayload) {
  const struct { std::string in, out; } rows[] = {
      {std::string("a1z\0cd", 6), std::string("A1Z\0cd", 6)},  // the text ends at its NUL
      {std::string(70, 'q') + '\0', std::string(64, 'Q') + std::string(6, 'q') + '\0'},
      {"abc", "ABC"},  // no NUL: the text ends with the payload
  };
  for (const auto& r : rows) {
    auto replies = Ioctl(id_, Echo(r.in), 5);
    ASSERT_EQ(replies.size(), 1u);
    EXPECT_EQ(replies[0].message, Echo(r.out));
  }
  EXPECT_TRUE(Ioctl(id_, Echo("ab"), 0).empty());
}

// Every push that passes the size check sets the ioctl flag, even one the
// apply step refuses; from then on property writes and restores are ignored.
TEST_F(IoctlTest, PushSetsTheIoctlFlagThatMakesPropertyWritesAndRestoresIgnored) {
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 1, true);
  EXPECT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA}))), 0);
  host::Faults::ClearAll();
  EXPECT_EQ(ctx_->ioctl, 1u);
  const Bytes other = Ruleset({kExactB, kGen22});
  EXPECT_EQ(PropWrite(other), ZEL_OK);
  EXPECT_EQ(FWRestoreState(Filter(id_), other.data(), other.size()), ZEL_OK);
  EXPECT_EQ(ctx_->ruleHash, nullptr);

  EXPECT_EQ(IoctlStatus(id_, Push(other)), 1);
  EXPECT_TRUE(host::Log::Contains("Received Firewall ruleset via Sluice IOCTL, payloadSize: 585"));
  EXPECT_EQ(ctx_->numRules, 2u);
}

TEST_F(IoctlTest, StateListsExactRulesFirstWithCountersIn281ByteRules) {
  rules::RulesetBuilder b(8);
  b.Add(rules::RuleBuilder().Set("action", "drop").Src("10.0.0.9").Counters(5, 700).Build());
  ASSERT_EQ(IoctlStatus(id_, Push(b.Add(kExactA).Add(kGen22).Bytes())), 1);
  Bytes state = State(id_);
  EXPECT_EQ(Bytes(state.begin(), state.begin() + 7), (Bytes{8, 8, 7, 3, 0, 0, 0}));
  EXPECT_EQ(FWNet16(RuleAt(state, 0).dPort), 80);
  const FWRule counted = RuleAt(state, 1);
  EXPECT_EQ(std::pair(+counted.pktCount, +counted.byteCount), std::pair(5ul, 700ul));

  // Version 7: records 259 bytes apart, then a zero tail.
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kGen22, kGen23}, 7))), 1);
  state = State(id_);
  ASSERT_EQ(state.size(), 15u + 2 * 281);
  EXPECT_EQ(FWNet16(RuleAt(state, 1, 259).dPort), 23);
  EXPECT_EQ(Bytes(state.begin() + 15 + 2 * 259, state.end()), Bytes(2 * 22));
}

// Exact rules are named by their tuple; general rules by wildcard bits and
// compared fields only (not action or direction); a range rule without
// wildcards is found in the general list although a hash probe cannot find
// it. "Clear all" keeps the version and the ioctl flag.
TEST_F(IoctlTest, RemoveAndResetSingleRulesThenClearAll) {
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({kExactA}))), 1);
  EXPECT_TRUE(host::Log::Contains("Asked to clear firewall rules, when none are in effect.", 2));
  const std::string range = "action=drop dir=to" + kFlowF + " dport=100-200";
  const std::string gen9 = kGen22 + " sport=9";
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kExactA, kExactB + " pkts=7 bytes=70", range, kGen23,
                                           kGen22 + " pkts=4", gen9 + " pkts=6"}, 7))), 1);
  const std::string other23 = "action=accept dir=from ipv4 proto=tcp dport=23";
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({kExactA, other23, range}))), 1);
  EXPECT_TRUE(host::Log::Contains("Received request to clear 3 firewall rules", 1));
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodStats, Ruleset({kExactB, gen9}))), 1);
  EXPECT_EQ(host::Log::CountContaining("non-existent"), 0u);
  const Bytes state = State(id_);
  ASSERT_EQ(Get(state, 3), 3u);
  EXPECT_EQ(FWNet16(RuleAt(state, 0, 259).dPort), 5353);
  EXPECT_EQ(+RuleAt(state, 0, 259).pktCount + RuleAt(state, 0, 259).byteCount, 0u);
  EXPECT_EQ(+RuleAt(state, 1, 259).pktCount, 4u);
  EXPECT_EQ(FWNet16(RuleAt(state, 2, 259).sPort), 9);
  EXPECT_EQ(+RuleAt(state, 2, 259).pktCount, 0u);
  EXPECT_EQ(ctx_->numRules, 6u);  // a removal does not lower the count

  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodRemove, Ruleset({kExactA}))), 1);
  EXPECT_EQ(host::Log::Count("Asked to remove non-existent rule, ignoring.", 2), 1u);
  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodStats, Ruleset({kGen22 + " sport=1"}))), 1);
  EXPECT_EQ(host::Log::Count("Asked to remove stats for non-existent rule, ignoring.", 2), 1u);

  EXPECT_EQ(IoctlStatus(id_, Clear(FWClearMethodAll)), 1);  // 8 bytes suffice
  EXPECT_TRUE(host::Log::Contains("Received request to clear all firewall state", 1));
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(std::pair(ctx_->version, ctx_->ioctl), std::pair(7u, 1u));  // both kept
}

// Each hostile message draws its status (-1: no reply) and message, reads
// nothing past its payload and changes no rule; no refused push sets the
// ioctl flag.
TEST_F(IoctlTest, HostileMessagesChangeNothing) {
  ASSERT_EQ(PropWrite(Ruleset({kExactA, kExactB})), ZEL_OK);
  const Bytes before = State(id_);
  const Bytes push = Push(Ruleset({kExactA}));
  const Bytes remove = Clear(FWClearMethodRemove, Ruleset({kExactA}));
  auto with = [](Bytes m, size_t off, uint32_t v) { return PutU32(&m, off, v), m; };
  auto cut = [](const Bytes& m, size_t n) { return Bytes(m.begin(), m.begin() + n); };
  auto v9 = [](Bytes m) { return m[8] = 9, m; };
  const std::string len = "Invalid ruleset length for version 8(ruleSize = 281). Got ";
  const std::string trunc = "Truncated firewall ioctl message of type ";
  const struct { Bytes msg; int reply; std::string log; } rows[] = {
      {{}, -1, ""}, {{2, 0, 0}, -1, ""}, {with(push, 0, 0), -1, ""}, {with(push, 0, 100), -1, ""},
      {with(push, 0, FWIoctlMsgStatus), -1, ""},
      {cut(Push(Ruleset({kExactA, kGen22})), 584), 0, len + "576, expecting 577"},
      {cut(push, 22), 0, trunc + "2, payloadSize: 22"},
      {v9(push), 0, "Failed to get rule size for version 9"},
      {with(push, 11, 0xffffffffu), 0, len + "296, expecting 1206885809910"},
      {cut(remove, 6), 0, trunc + "4, payloadSize: 6"},
      {cut(remove, 22), 0, trunc + "4, payloadSize: 22"},
      {with(remove, 11, 3), 0, len + "296, expecting 858"},
      {v9(remove), 0, "Failed to get rule size for version 9"},
      {Clear(7, Ruleset({kExactA})), 1, "Unexpected clear method"},
  };
  for (const auto& r : rows) {
    host::Log::Clear();
    if (r.reply < 0) { EXPECT_TRUE(Ioctl(id_, r.msg).empty()) << r.msg.size(); }
    if (r.reply >= 0) { EXPECT_EQ(IoctlStatus(id_, r.msg), r.reply) << r.log; }
    EXPECT_EQ(host::Log::Count(r.log, 2), r.log.empty() ? 0u : 1u) << r.log;
  }
  EXPECT_EQ(State(id_), before);
  EXPECT_EQ(ctx_->ioctl, 0u);
}

}  // namespace
