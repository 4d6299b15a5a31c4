// The per-agent character device: filter lookups, ruleset set and get
// through user memory, the test request, hostile requests, and the use
// reference released on every path (requests of any content: fuzz_chardev).
#include "tests/control/control_test_util.h"

namespace {

using namespace controltest;

class CharDevTest : public FilterTest {
 protected:
  void SetUp() override { FilterTest::SetUp(), vnic1_ = CreateFilter(kAgent, "vnic1"); }
  // Every request, whatever it met, has dropped its use reference.
  void TearDown() override {
    EXPECT_EQ(std::pair(Filter(id_)->refCount, Filter(vnic1_)->refCount), std::pair(1u, 1u));
    FilterTest::TearDown();
  }
  // One ioctl on the agent's device with `mapped` in user memory at addr_.
  ZelStatus Issue(const Bytes& mapped, uint32_t cmd = 0) {
    int32_t result = -1;
    addr_ = host::UserMemory::Map(mapped);
    const ZelStatus s = host::CharDevs::Ioctl(kAgent, cmd, addr_, &result);
    EXPECT_EQ(result, 0);
    return s;
  }
  host::FilterId vnic1_ = 0;
  uint64_t addr_ = 0;
};

// The tool sends and gets 281 bytes per rule whatever the version: the
// header's version decides what is applied (as an ioctl ruleset), and a get
// writes the ruleset in force, zero-padded, over the request and no further.
TEST_F(CharDevTest, SetAndGetThroughUserMemoryIn281ByteRules) {
  Bytes v7 = Ruleset({kRuleA, kRuleB, kRuleA + " sport=9"}, 7);
  // Mapped only as far as the version-7 rules reach: the copy fails whole.
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSetRuleset, "vnic0", v7)), ZEL_BAD_PARAM);
  EXPECT_EQ(ctx_->ruleHash, nullptr);
  EXPECT_EQ(ctx_->ioctl, 0u);
  v7.resize(15 + 3 * 281, 0);
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSetRuleset, "vnic0", v7)), ZEL_OK);
  EXPECT_EQ(std::tuple(ctx_->numRules, ctx_->version, ctx_->ioctl), std::tuple(3u, 7u, 1u));
  EXPECT_EQ(Ctx(vnic1_)->ioctl, 0u);
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqGetRuleset, "vnic0", Bytes(1000 - 248, 0xee))), ZEL_OK);
  v7.resize(1000, 0xee);
  EXPECT_EQ(host::UserMemory::Read(addr_, 1000), v7);
}

TEST_F(CharDevTest, FailuresReturnTheirStatus) {
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqGetRuleset, "vnic0"), 1), ZEL_BAD_PARAM);
  EXPECT_TRUE(host::Log::Contains("Non-zero cmd 1", 1));
  EXPECT_EQ(host::UserMemory::FailedCopies(), 0u);  // refused before any copy
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSetRuleset, "vnic0")), ZEL_BAD_PARAM);  // no header
  EXPECT_TRUE(host::Log::Contains("Failed to copy user data (0xbad0007): " +
                                  std::string(zel_StatusToString(ZEL_BAD_PARAM)), 2));
  const Bytes huge = {8, 8, 7, 0xff, 0xff, 0xff, 0xff, 0, 0, 0, 0, 0, 0, 0, 0};
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSetRuleset, "vnic0", huge)), ZEL_FAILURE);
  EXPECT_TRUE(host::Log::Contains("Failed to allocate ruleset in reading from character device"));
  const Bytes v9 = {9, 8, 7, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};  // the apply step refuses it,
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSetRuleset, "vnic1", v9)), ZEL_NOT_SUPPORTED);
  EXPECT_EQ(Ctx(vnic1_)->ioctl, 1u);  // but still marks the filter
  EXPECT_EQ(Issue(DevRequest(3, "vnic0")), ZEL_OK);  // unknown type: nothing to do
}

// By name first; by UUID only for endpoint 0 with the vNIC index; strings
// that fill their fields are cut to 99 and 127 characters.
TEST_F(CharDevTest, FilterLookups) {
  const std::string uuid(127, 'u');
  auto make = [&](const std::string& name, uint32_t endPoint, uint32_t vnic) {
    return CreateFilter(kAgent, {.name = name, .endPointType = endPoint, .vmUUID = uuid,
                                 .vnicIndex = vnic, .parameters = {}});
  };
  make("port", 1, 1);  // not a VM: its UUID is never compared
  ASSERT_EQ(PropWrite(Ruleset({kRuleA}), make(std::string(99, 'n'), 0, 1)), ZEL_OK);
  ASSERT_EQ(PropWrite(Ruleset({kRuleA, kRuleB}), make("nic2", 0, 2)), ZEL_OK);
  const struct { std::string name, uuid; uint32_t vnic; int64_t rules; } rows[] = {
      {"", uuid + "u", 1, 1}, {"", uuid, 2, 2},     {"", uuid, 3, -1},    {"", "", 5, -1},
      {"nic2", "x", 1, 2},    {"vnic2", "", 0, -1}, {std::string(100, 'n'), "", 0, 1}};
  for (const auto& r : rows) {  // room for two rules behind the request
    const ZelStatus s =
        Issue(DevRequest(FWCharDevReqGetRuleset, r.name, Bytes(329), r.uuid, r.vnic));
    EXPECT_EQ(s == ZEL_OK ? int64_t{Get(host::UserMemory::Read(addr_, 15), 3)} : -1, r.rules);
  }
  EXPECT_TRUE(host::Log::Contains("Filter lookup failed (name: '', hqUUID: '',vNicIndex: 5)", 1));
}

TEST_F(CharDevTest, TestRequestSendsTheFilterNameAndLogsTheReply) {
  host::RequestPolicy policy;
  policy.replyData = {'p', 'o', 'n', 'g'};
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSendIoctl, "vnic1")), ZEL_OK);
  auto requests = host::Sluice::Requests(host::RequestKind::IoctlRequest);
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].filter, vnic1_);
  EXPECT_EQ(requests[0].data, (Bytes{'v', 'n', 'i', 'c', '1', '\0'}));
  EXPECT_EQ(requests[0].cookie, static_cast<uint32_t>(addr_));
  EXPECT_TRUE(host::Log::Contains("Received ioctl reply 'pong': " +
                                  std::string(zel_StatusToString(ZEL_OK)), 1));
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, testsupport::Refuses(ZEL_BUSY));
  EXPECT_EQ(Issue(DevRequest(FWCharDevReqSendIoctl, "vnic0")), ZEL_BUSY);
}

}  // namespace
