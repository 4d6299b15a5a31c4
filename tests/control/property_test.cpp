// The per-agent ruleset property: registration, the ordered checks of a
// write, and read/poll agreeing byte for byte.
#include <cstdio>
#include <string>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"

namespace {

using controltest::Bytes;
using controltest::IoctlStatus;
using controltest::Push;
using controltest::Ruleset;

const std::string kProp = std::string(testsupport::kDefaultAgent) + ".ruleset";
const std::string kGeneral22 = "action=drop dir=both ipv4 proto=tcp dport=22";
const std::string kGeneral23 = "action=punt dir=to ipv4 proto=udp sa=10.0.0.1-10.0.0.9";
const std::string kGeneralV6 = "action=accept dir=from ipv6 sa=2001:db8::1 proto=tcp sport=!80";

class PropertyTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = CreateFilter(testsupport::kDefaultAgent, "vnic0");
    ctx_ = Ctx(id_);
    ASSERT_NE(ctx_, nullptr);
  }

  ZelStatus Write(const Bytes& data) { return host::Sluice::PropertyWrite(kProp, id_, data); }

  Bytes Read() {
    Bytes out;
    ZelStatus status = ZEL_FAILURE;
    EXPECT_TRUE(host::Sluice::PropertyRead(kProp, id_, &out, &status));
    EXPECT_EQ(status, ZEL_OK);
    return out;
  }

  uint32_t Poll() {
    uint32_t size = 0;
    EXPECT_TRUE(host::Sluice::PropertyPoll(kProp, id_, &size));
    return size;
  }

  const ZelSluicePropOps* Ops() { return host::Sluice::PropertyOps(kProp); }

  host::FilterId id_ = 0;
  FWFilterContext* ctx_ = nullptr;
};

TEST_F(PropertyTest, EachAgentRegistersItsOwnProperty) {
  EXPECT_TRUE(host::Sluice::PropertyRegistered(kProp));
  EXPECT_EQ(Ops(), &rulesetPropOps);
  ASSERT_EQ(CreateAgents("second"), ZEL_OK);
  EXPECT_TRUE(host::Sluice::PropertyRegistered("second.ruleset"));
  EXPECT_EQ(host::Log::Count("Registered fw rules property handler", 1), 2u);
  Unload();
  EXPECT_EQ(host::Log::Count("Unregistering ruleset property handler", 1), 2u);
}

TEST_F(PropertyTest, FailedRegistrationLeavesAgentWithoutProperty) {
  host::Faults::Fail("zel_SluicePropertyRegister", ZEL_NO_MEMORY);
  ASSERT_EQ(CreateAgents("noprop"), ZEL_OK);
  EXPECT_TRUE(host::Sluice::AgentRegistered("noprop"));
  EXPECT_FALSE(host::Sluice::PropertyRegistered("noprop.ruleset"));
  EXPECT_EQ(Agent("noprop")->rulesetProp, nullptr);
  const std::string msg = std::string("Failed to register fw rules property handler (0xbad0014): ") +
                          zel_StatusToString(ZEL_NO_MEMORY);
  EXPECT_TRUE(host::Log::Contains(msg, 2));
  // Teardown must not unregister what never was registered (the fixture
  // checks that nothing is left).
  Unload();
  EXPECT_EQ(host::Log::Count("Unregistering ruleset property handler"), 1u);
}

TEST_F(PropertyTest, ExactLengthsAreAcceptedAndApplied) {
  Bytes v7 = Ruleset({kGeneral22, kGeneral23}, 7);
  ASSERT_EQ(v7.size(), 533u);
  EXPECT_EQ(Write(v7), ZEL_OK);
  EXPECT_TRUE(host::Log::Contains("Got SLCGenericPropWrite of length 533", 1));
  EXPECT_EQ(ctx_->numRules, 2u);
  EXPECT_EQ(ctx_->version, 7u);

  Bytes v8 = Ruleset({kGeneral22, kGeneral23}, 8);
  ASSERT_EQ(v8.size(), 577u);
  EXPECT_EQ(Write(v8), ZEL_OK);
  EXPECT_EQ(ctx_->version, 8u);

  // An empty ruleset replaces the rules with none (an empty table).
  EXPECT_EQ(Write(Ruleset(std::vector<std::string>{})), ZEL_OK);
  EXPECT_NE(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->numRules, 0u);
  EXPECT_EQ(ctx_->ioctl, 0u);
}

// Checks in order: data, version (whatever the length), header present,
// exact length (compared in 64 bits).
TEST_F(PropertyTest, WriteChecksVersionThenLength) {
  EXPECT_EQ(Ops()->write(Filter(id_), nullptr, nullptr, 15), ZEL_BAD_PARAM);
  EXPECT_EQ(host::Log::Count("Invalid ruleset", 2), 1u);
  for (size_t len : {1u, 3u, 15u, 40u}) {
    Bytes data(len, 0);
    data[0] = 9;
    EXPECT_EQ(Write(data), ZEL_NOT_SUPPORTED) << len;
  }
  EXPECT_EQ(host::Log::Count("Invalid ruleset version. Got 9, expecting 8", 2), 4u);
  // Shorter than the header: refused without the count being read (the
  // host hands the handler an exactly sized copy).
  for (size_t len = 0; len < 15; ++len) {
    Bytes data(len, 0);
    if (len > 0) data[0] = 8;
    EXPECT_EQ(Write(data), ZEL_BAD_PARAM) << len;
  }
  EXPECT_EQ(host::Log::Count("Invalid ruleset", 2), 16u);

  Bytes v7 = Ruleset({kGeneral22, kGeneral23}, 7);
  EXPECT_EQ(Write(Bytes(v7.begin(), v7.end() - 1)), ZEL_BAD_PARAM);
  EXPECT_TRUE(host::Log::Contains(
      "Invalid ruleset length for version 7(ruleSize = 259). Got 532, expecting 533", 2));
  v7.push_back(0);
  EXPECT_EQ(Write(v7), ZEL_BAD_PARAM);
  EXPECT_TRUE(host::Log::Contains(
      "Invalid ruleset length for version 7(ruleSize = 259). Got 534, expecting 533", 2));
  Bytes huge = Ruleset(std::vector<std::string>{});
  controltest::PutU32(&huge, 3, 0xffffffffu);
  EXPECT_EQ(Write(huge), ZEL_BAD_PARAM);
  EXPECT_TRUE(host::Log::Contains(
      "Invalid ruleset length for version 8(ruleSize = 281). Got 15, expecting 1206885809910", 2));
  EXPECT_EQ(ctx_->ruleHash, nullptr);
}

// The ruleset checks come first; only a well-formed write reaches the
// filter check.
TEST_F(PropertyTest, FilterWithoutContextIsReportedAfterTheRulesetChecks) {
  SLCGenericFilter bare{};
  Bytes good = Ruleset({kGeneral22});
  EXPECT_EQ(Ops()->write(&bare, nullptr, good.data(), uint32_t(good.size())), ZEL_INVALID_STATE);
  char text[64];
  std::snprintf(text, sizeof(text), "Filter not found: %p", static_cast<void*>(&bare));
  EXPECT_TRUE(host::Log::Contains(text, 2));
  EXPECT_EQ(Ops()->write(nullptr, nullptr, good.data(), uint32_t(good.size())), ZEL_INVALID_STATE);

  Bytes bad(good.begin(), good.end() - 1);
  EXPECT_EQ(Ops()->write(&bare, nullptr, bad.data(), uint32_t(bad.size())), ZEL_BAD_PARAM);
  EXPECT_EQ(host::Log::CountContaining("Filter not found"), 2u);

  uint32_t size = 77;
  Bytes buf(64);
  EXPECT_FALSE(Ops()->poll(&bare, nullptr, &size));
  EXPECT_FALSE(Ops()->poll(nullptr, nullptr, &size));
  EXPECT_EQ(size, 77u);
  EXPECT_EQ(Ops()->read(&bare, nullptr, buf.data()), ZEL_FAILURE);
  EXPECT_EQ(Ops()->read(nullptr, nullptr, buf.data()), ZEL_FAILURE);
}

TEST_F(PropertyTest, FreshFilterReadsAsEmptyVersion8Ruleset) {
  EXPECT_EQ(Poll(), 15u);
  Bytes out = Read();
  ASSERT_EQ(out.size(), 15u);
  EXPECT_EQ(out, (Bytes{8, 8, 7, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}));
}

// What was written reads back unchanged (general rules keep their order),
// in both versions, and the poll announces exactly that size.
TEST_F(PropertyTest, ReadReturnsWhatWasWrittenAndPollMatches) {
  for (uint8_t version : {uint8_t(7), uint8_t(8)}) {
    std::vector<std::string> lines = {kGeneral22, kGeneral23, kGeneral22 + " sport=1"};
    if (version == 8) lines.push_back(kGeneralV6);
    Bytes written = Ruleset(lines, version);
    ASSERT_EQ(Write(written), ZEL_OK);
    EXPECT_EQ(Poll(), written.size());
    EXPECT_EQ(Read(), written) << int(version);
  }
}

TEST_F(PropertyTest, WritesAfterAnIoctlRulesetSucceedWithoutEffect) {
  ASSERT_EQ(IoctlStatus(id_, Push(Ruleset({kGeneral22}))), 1);
  Bytes before = Read();
  EXPECT_EQ(Write(Ruleset({kGeneral23, kGeneral22}, 7)), ZEL_OK);
  EXPECT_EQ(Read(), before);
  EXPECT_EQ(ctx_->version, 8u);
}

}  // namespace
