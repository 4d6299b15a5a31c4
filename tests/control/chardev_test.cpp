// The per-agent character device: filter lookups, ruleset set and get
// through user memory, the test request, and the use reference released on
// every path.
#include <algorithm>
#include <cstring>
#include <string>

#include "control/control.h"
#include "tests/control/control_test_util.h"
#include "tests/support/module_fixture.h"

namespace {

using controltest::Bytes;
using controltest::GetU32;
using controltest::PutU32;
using controltest::Ruleset;

const std::string kDev = testsupport::kDefaultAgent;
const std::string kRuleA = "action=drop dir=both ipv4 proto=tcp dport=22";
const std::string kRuleB = "action=punt dir=to ipv4 proto=udp sa=10.0.0.1-10.0.0.9";
const std::string kRuleC = "action=accept dir=from ipv4 proto=tcp sport=443";

// A request as a tool lays it out; the strings are copied raw (no NUL is
// added), so a string that fills its field arrives unterminated.
Bytes Request(uint32_t type, const std::string& name, const std::string& uuid = "",
              uint32_t vnic = 0) {
  Bytes r(sizeof(FWCharDevRequest), 0);
  PutU32(&r, 0, type);
  std::memcpy(r.data() + offsetof(FWCharDevRequest, filterName), name.data(),
              std::min<size_t>(name.size(), 100));
  std::memcpy(r.data() + offsetof(FWCharDevRequest, hqUUID), uuid.data(),
              std::min<size_t>(uuid.size(), 128));
  PutU32(&r, offsetof(FWCharDevRequest, vNicIndex), vnic);
  return r;
}

Bytes Concat(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

class CharDevTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    vnic0_ = CreateFilter(kDev, "vnic0");
    vnic1_ = CreateFilter(kDev, "vnic1");
  }

  // Issues one ioctl on the agent's device with a request mapped into user
  // memory; *addr receives the address.
  ZelStatus Issue(const Bytes& mapped, uint64_t* addr = nullptr, uint32_t cmd = 0) {
    uint64_t a = host::UserMemory::Map(mapped);
    if (addr != nullptr) *addr = a;
    int32_t result = -1;
    ZelStatus s = host::CharDevs::Ioctl(kDev, cmd, a, &result);
    EXPECT_EQ(result, 0);
    return s;
  }

  // Gets the ruleset of `name` into a user buffer of `room` bytes and
  // returns the buffer.
  Bytes Get(const std::string& name, size_t room, ZelStatus* status) {
    Bytes mapped = Request(FWCharDevReqGetRuleset, name);
    mapped.resize(room, 0xee);
    uint64_t addr = 0;
    *status = Issue(mapped, &addr);
    return host::UserMemory::Read(addr, room);
  }

  void ExpectNoReferencesHeld() {
    EXPECT_EQ(Filter(vnic0_)->refCount, 1u);
    EXPECT_EQ(Filter(vnic1_)->refCount, 1u);
  }

  ZelStatus PropertyWrite(host::FilterId id, const Bytes& ruleset) {
    return host::Sluice::PropertyWrite(kDev + ".ruleset", id, ruleset);
  }

  host::FilterId vnic0_ = 0;
  host::FilterId vnic1_ = 0;
};

TEST_F(CharDevTest, FailedRegistrationIsReported) {
  host::Faults::Fail("zel_CharDevRegister", ZEL_BUSY);
  EXPECT_NE(CreateAgents("third"), ZEL_OK);
  EXPECT_FALSE(host::CharDevs::Registered("third"));
  EXPECT_TRUE(host::Log::Contains(std::string("Failed to register fw character device (0xbad0004): ") +
                                      zel_StatusToString(ZEL_BUSY),
                                  2));
}

TEST_F(CharDevTest, GetWritesTheRulesetOverTheRequestAndNoFurther) {
  ASSERT_EQ(PropertyWrite(vnic1_, Ruleset({kRuleA, kRuleB})), ZEL_OK);
  ZelStatus status = ZEL_FAILURE;
  Bytes out = Get("vnic1", 700, &status);
  EXPECT_EQ(status, ZEL_OK);
  EXPECT_EQ(Bytes(out.begin(), out.begin() + 577), Ruleset({kRuleA, kRuleB}));
  EXPECT_TRUE(std::all_of(out.begin() + 577, out.end(), [](uint8_t b) { return b == 0xee; }));
  // A user buffer one byte short: the copy's status, the request untouched.
  out = Get("vnic1", 576, &status);
  EXPECT_EQ(status, ZEL_BAD_PARAM);
  EXPECT_EQ(GetU32(out, 0), FWCharDevReqGetRuleset);
  ExpectNoReferencesHeld();
}

// The tool sends 281 bytes per rule whatever the version; the header's
// version decides what is applied.
TEST_F(CharDevTest, SetReads281BytesPerRuleAndAppliesAsIoctlRuleset) {
  Bytes v7 = Ruleset({kRuleA, kRuleB, kRuleC}, 7);
  Bytes padded = v7;
  padded.resize(15 + 3 * 281, 0);
  // Mapped only as far as the version-7 rules reach: the copy of 858 bytes
  // must fail and nothing is applied.
  EXPECT_EQ(Issue(Concat(Request(FWCharDevReqSetRuleset, "vnic0"), v7)), ZEL_BAD_PARAM);
  EXPECT_EQ(Ctx(vnic0_)->ruleHash, nullptr);
  EXPECT_EQ(Ctx(vnic0_)->ioctl, 0u);

  EXPECT_EQ(Issue(Concat(Request(FWCharDevReqSetRuleset, "vnic0"), padded)), ZEL_OK);
  EXPECT_EQ(Ctx(vnic0_)->numRules, 3u);
  EXPECT_EQ(Ctx(vnic0_)->version, 7u);
  EXPECT_EQ(Ctx(vnic0_)->ioctl, 1u);
  EXPECT_EQ(Ctx(vnic1_)->ioctl, 0u);

  // The property no longer changes that filter.
  EXPECT_EQ(PropertyWrite(vnic0_, Ruleset({kRuleA})), ZEL_OK);
  EXPECT_EQ(Ctx(vnic0_)->numRules, 3u);
  ExpectNoReferencesHeld();
}

TEST_F(CharDevTest, SetFailuresReturnTheirStatusAndReleaseEverything) {
  const uint64_t blocks = host::Heaps::Stats(host::Heaps::ModuleHeap()).blocks;
  // No header behind the request.
  EXPECT_EQ(Issue(Request(FWCharDevReqSetRuleset, "vnic0")), ZEL_BAD_PARAM);
  EXPECT_EQ(host::Log::CountContaining("Failed to copy user data (0xbad0007)"), 1u);

  // A count whose size cannot be allocated.
  Bytes huge = Ruleset(std::vector<std::string>{});
  PutU32(&huge, 3, 0xffffffffu);
  EXPECT_EQ(Issue(Concat(Request(FWCharDevReqSetRuleset, "vnic0"), huge)), ZEL_FAILURE);
  EXPECT_TRUE(
      host::Log::Contains("Failed to allocate ruleset in reading from character device", 2));

  // Version refused by the apply step (which still marks the filter).
  Bytes v9 = Ruleset({kRuleA});
  v9[0] = 9;
  EXPECT_EQ(Issue(Concat(Request(FWCharDevReqSetRuleset, "vnic1"), v9)), ZEL_NOT_SUPPORTED);
  EXPECT_EQ(Ctx(vnic1_)->ioctl, 1u);

  EXPECT_EQ(host::Heaps::Stats(host::Heaps::ModuleHeap()).blocks, blocks);
  ExpectNoReferencesHeld();
}

// Lookups: by name first; by UUID only for endpoint 0 with the vNIC index;
// strings that fill their fields are cut to 99 and 127 characters.
TEST_F(CharDevTest, FilterLookups) {
  host::FilterConfig c;
  c.vmUUID = std::string(127, 'u');
  c.name = "port";
  c.endPointType = 1;  // no VM: the UUID is not even read
  c.vnicIndex = 1;
  host::FilterId port = CreateFilter(kDev, c);
  c.name = std::string(99, 'n');
  c.endPointType = 0;
  host::FilterId nic1 = CreateFilter(kDev, c);
  c.name = "nic2";
  c.vnicIndex = 2;
  host::FilterId nic2 = CreateFilter(kDev, c);
  ASSERT_EQ(PropertyWrite(nic1, Ruleset({kRuleA})), ZEL_OK);
  ASSERT_EQ(PropertyWrite(nic2, Ruleset({kRuleA, kRuleB})), ZEL_OK);

  // The number of rules of the filter a request resolves to, or -1.
  auto rulesOf = [&](const std::string& name, const std::string& uuid, uint32_t vnic) -> int64_t {
    Bytes mapped = Request(FWCharDevReqGetRuleset, name, uuid, vnic);
    mapped.resize(15 + 2 * 281);
    uint64_t addr = 0;
    if (Issue(mapped, &addr) != ZEL_OK) return -1;
    return GetU32(host::UserMemory::Read(addr, 15), 3);
  };
  EXPECT_EQ(rulesOf("", std::string(128, 'u'), 1), 1);
  EXPECT_EQ(rulesOf("", std::string(127, 'u'), 2), 2);
  EXPECT_EQ(rulesOf("", std::string(127, 'u'), 3), -1);
  EXPECT_EQ(rulesOf(std::string(100, 'n'), "", 0), 1);
  EXPECT_EQ(rulesOf("nic2", "no-such-uuid", 1), 2);
  EXPECT_EQ(rulesOf("vnic2", "", 0), -1);
  EXPECT_EQ(rulesOf("", "", 5), -1);
  EXPECT_TRUE(host::Log::Contains("Filter lookup failed (name: '', hqUUID: '',vNicIndex: 5)", 1));
  for (host::FilterId id : {port, nic1, nic2}) EXPECT_EQ(Filter(id)->refCount, 1u);
  ExpectNoReferencesHeld();
}

TEST_F(CharDevTest, RefusedRequestsLeaveNothingBehind) {
  const uint64_t blocks = host::Heaps::Stats(host::Heaps::ModuleHeap()).blocks;
  EXPECT_EQ(Issue(Request(FWCharDevReqGetRuleset, "vnic0"), nullptr, 1), ZEL_BAD_PARAM);
  EXPECT_TRUE(host::Log::Contains("Non-zero cmd 1", 1));
  EXPECT_EQ(host::UserMemory::FailedCopies(), 0u);

  int32_t result = -1;
  EXPECT_EQ(host::CharDevs::Ioctl(kDev, 0, 0x1000, &result), ZEL_BAD_PARAM);
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(host::Log::Contains(std::string("Failed to copy user data (0xbad0007): ") +
                                      zel_StatusToString(ZEL_BAD_PARAM),
                                  2));
  EXPECT_EQ(Issue(Request(3, "vnic0")), ZEL_OK);  // unknown type: nothing to do
  EXPECT_EQ(Ctx(vnic0_)->ruleHash, nullptr);

  ZelCharDevFile agentFile{Agent()};
  int32_t untouched = -5;
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(FWCharDevIoctl(&agentFile, 0, 0, 0, &untouched), ZEL_NO_MEMORY);
  EXPECT_EQ(untouched, -5);

  SLCGenericFastPath bogus{};
  ZelCharDevFile bogusFile{&bogus};
  uint64_t addr = host::UserMemory::Map(Request(FWCharDevReqGetRuleset, "vnic0"));
  EXPECT_EQ(FWCharDevIoctl(&bogusFile, 0, addr, 0, &result), ZEL_NOT_FOUND);
  EXPECT_TRUE(host::Log::Contains("Bad magic for fwFastPath", 2));

  EXPECT_EQ(host::Heaps::Stats(host::Heaps::ModuleHeap()).blocks, blocks);
  ExpectNoReferencesHeld();
}

TEST_F(CharDevTest, TestRequestSendsTheFilterNameAndLogsTheReply) {
  host::RequestPolicy policy;
  policy.replyData = {'p', 'o', 'n', 'g'};
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);
  uint64_t addr = 0;
  EXPECT_EQ(Issue(Request(FWCharDevReqSendIoctl, "vnic1"), &addr), ZEL_OK);

  auto requests = host::Sluice::Requests(host::RequestKind::IoctlRequest);
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].filter, vnic1_);
  EXPECT_EQ(requests[0].data, (Bytes{'v', 'n', 'i', 'c', '1', '\0'}));
  EXPECT_EQ(requests[0].cookie, static_cast<uint32_t>(addr));
  EXPECT_TRUE(host::Log::Contains(
      std::string("Received ioctl reply 'pong': ") + zel_StatusToString(ZEL_OK), 1));

  policy.refuse = ZEL_BUSY;
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);
  EXPECT_EQ(Issue(Request(FWCharDevReqSendIoctl, "vnic0")), ZEL_BUSY);
  EXPECT_TRUE(host::Log::Contains(
      std::string("Sending ioctl request failed: ") + zel_StatusToString(ZEL_BUSY), 1));
  ExpectNoReferencesHeld();
}

// The use reference is what keeps a filter alive during a request; once
// every request has returned, the filter can be destroyed at once.
TEST_F(CharDevTest, FiltersAreDestroyableAfterEveryKindOfRequest) {
  host::RequestPolicy policy;
  policy.refuse = ZEL_BUSY;
  host::Sluice::SetPolicy(host::RequestKind::IoctlRequest, policy);
  Bytes mapped = Concat(Request(FWCharDevReqSetRuleset, "vnic0"), Ruleset({kRuleA}));
  mapped.resize(248 + 15 + 281);
  (void)Issue(mapped);
  (void)Issue(Request(FWCharDevReqGetRuleset, "vnic0"));
  (void)Issue(Request(FWCharDevReqSendIoctl, "vnic0"));
  (void)Issue(Request(9, "vnic0"));
  EXPECT_EQ(host::Sluice::DestroyFilter(vnic0_), ZEL_OK);
}

}  // namespace
