// The host's Sluice framework as a module meets it: agent registration and
// unregistration, filters and their configuration queries, packet hand-over,
// slow paths, the filter ioctl channel and agent properties.
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <thread>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "tests/host/sluice_fake_agent.h"
#include "tests/support/module_fixture.h"

namespace {

using host::FilterConfig;
using host::FilterId;
using host::Sluice;
using namespace fakeagent;

class SluiceTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    agent = new Agent;
    handle_ = Register();
    ASSERT_NE(handle_, nullptr);
  }
  void TearDown() override {
    if (Sluice::AgentRegistered("fake")) {
      EXPECT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
    }
    HostTest::TearDown();
    delete agent;
    agent = nullptr;
  }

  FilterId Make(const std::string& name, FilterConfig config = {}) {
    config.name = name;
    FilterId id = 0;
    EXPECT_EQ(Sluice::CreateFilter("fake", config, &id), ZEL_OK);
    return id;
  }

  ZelSluiceFastPathHandle handle_ = nullptr;
};

TEST_F(SluiceTest, RegistrationRecordsTheAgentAndRefusesItsNameTwice) {
  Sluice::AgentInfo info = Sluice::Agent("fake");
  EXPECT_EQ(info.version, ZEL_SLUICE_FASTPATH_VERSION);
  EXPECT_EQ(info.module, 7);
  EXPECT_EQ(info.ops, &kOps);
  EXPECT_EQ(info.priv, agent);

  EXPECT_EQ(Register("fake"), nullptr);
  ZelSluiceFastPathHandle h = nullptr;
  EXPECT_EQ(zel_SluiceRegisterFastPath("other", 0x01000000, ZEL_SLUICE_FASTPATH_VERSION, 7, &kOps,
                                       agent, &h),
            ZEL_NOT_SUPPORTED);
  host::Faults::Fail("zel_SluiceRegisterFastPath", ZEL_NO_MEMORY);
  EXPECT_EQ(zel_SluiceRegisterFastPath("other", ZEL_SLUICE_FASTPATH_VERSION,
                                       ZEL_SLUICE_FASTPATH_VERSION, 7, &kOps, agent, &h),
            ZEL_NO_MEMORY);
  EXPECT_EQ(Sluice::Agents(), std::vector<std::string>{"fake"});
}

TEST_F(SluiceTest, FilterHandleAnswersTheConfiguredQueries) {
  FilterConfig c;
  c.failurePolicy = 1;
  c.endPointType = 0;
  c.vmUUID = "42 1a-bb";
  c.vnicIndex = 3;
  c.parameters[1] = "p2";
  FilterId id = Make("vnic-long-name", c);
  ZelSluiceFilterHandle h = Priv(id)->handle;

  char small[5];
  std::memset(small, 'x', sizeof small);
  ASSERT_EQ(zel_SluiceGetName(h, small, sizeof small), ZEL_OK);
  EXPECT_STREQ(small, "vnic");                       // cut to size, terminated
  char uuid[128];
  ASSERT_EQ(zel_SluiceGetVMUUID(h, uuid, sizeof uuid), ZEL_OK);
  EXPECT_STREQ(uuid, "42 1a-bb");
  uint32_t v = 0;
  ASSERT_EQ(zel_SluiceGetFailurePolicy(h, &v), ZEL_OK);
  EXPECT_EQ(v, 1u);
  ASSERT_EQ(zel_SluiceGetVnicIndex(h, &v), ZEL_OK);
  EXPECT_EQ(v, 3u);
  char param[16];
  ASSERT_EQ(zel_SluiceGetConfigParameter(h, 2, param, sizeof param), ZEL_OK);
  EXPECT_STREQ(param, "p2");
  EXPECT_EQ(zel_SluiceGetConfigParameter(h, 5, param, sizeof param), ZEL_BAD_PARAM);

  c.vmUUIDUnset = true;
  c.name = "renamed";
  Sluice::SetFilterConfig(id, c);
  std::strcpy(uuid, "untouched");
  EXPECT_EQ(zel_SluiceGetVMUUID(h, uuid, sizeof uuid), ZEL_NOT_INITIALIZED);
  EXPECT_STREQ(uuid, "untouched");
  Sluice::ConfigurationChanged(id);
  EXPECT_EQ(Priv(id)->name, "renamed");

  host::Faults::Fail("zel_SluiceGetEndPointType", ZEL_FAILURE);
  EXPECT_EQ(zel_SluiceGetEndPointType(h, &v), ZEL_FAILURE);
  EXPECT_EQ(zel_SluiceGetEndPointType(h, &v), ZEL_OK);
  EXPECT_EQ(Sluice::DestroyFilter(id), ZEL_OK);
}

TEST_F(SluiceTest, FailedCreateLeavesNoFilterAndBusyDestroyKeepsIt) {
  agent->createStatus = ZEL_NO_MEMORY;
  FilterId id = 99;
  EXPECT_EQ(Sluice::CreateFilter("fake", FilterConfig{}, &id), ZEL_NO_MEMORY);
  EXPECT_EQ(id, 0u);
  EXPECT_TRUE(Sluice::Filters("fake").empty());

  agent->createStatus = ZEL_OK;
  FilterId a = Make("a");
  agent->destroyBusy = 1;
  EXPECT_EQ(Sluice::DestroyFilter(a), ZEL_BUSY);        // one call, no retry
  EXPECT_TRUE(Sluice::FilterAlive(a));
  EXPECT_EQ(Sluice::Filters("fake"), std::vector<FilterId>{a});
  EXPECT_EQ(Sluice::DestroyFilter(a), ZEL_OK);
  EXPECT_FALSE(Sluice::FilterAlive(a));
  EXPECT_TRUE(Sluice::Filters("fake").empty());
  EXPECT_EQ(agent->Events(),
            (std::vector<std::string>{"createFilter vnic0", "createFilter a",
                                      "destroyFilter a busy", "destroyFilter a"}));
}

TEST_F(SluiceTest, UnregistrationDestroysFiltersThenSlowPathsRetryingWhileBusy) {
  Make("a");
  Make("b");
  ASSERT_EQ(Sluice::RegisterSlowPath("fake", 7), ZEL_OK);
  ASSERT_EQ(Sluice::RegisterSlowPath("fake", 9), ZEL_OK);
  agent->destroyBusy = 2;
  agent->unregisterBusy = 1;

  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  EXPECT_FALSE(Sluice::AgentRegistered("fake"));
  EXPECT_EQ(agent->Events(),
            (std::vector<std::string>{
                "createFilter a", "createFilter b", "registerSlowPath #7", "registerSlowPath #9",
                "destroyFilter a busy", "destroyFilter a busy", "destroyFilter a",
                "destroyFilter b", "unregisterSlowPath #7 busy", "unregisterSlowPath #7",
                "unregisterSlowPath #9"}));
}

// A filter whose reply is still outstanding answers busy; unregistration
// keeps trying, without holding anything the reply needs, until the reply
// has been delivered from another thread.
TEST_F(SluiceTest, UnregistrationWaitsOutAReplyReleasedMeanwhile) {
  FilterId id = Make("a");
  FakeFilter* f = Priv(id);
  host::RequestPolicy deferred;
  deferred.mode = host::ReplyMode::Deferred;
  Sluice::SetPolicy(host::RequestKind::SetSlowPath, deferred);
  ASSERT_EQ(AsModule(f, [&] {
              return zel_SluiceSetSlowPath(f->handle, 4, SetSlowPathReply, nullptr, 10);
            }),
            ZEL_OK);
  std::thread releaser([] {
    std::this_thread::sleep_for(std::chrono::milliseconds(30));
    Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
  });
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  releaser.join();
  ASSERT_EQ(agent->Replies().size(), 1u);
  std::vector<std::string> ev = agent->Events();
  EXPECT_GT(ev.size(), 2u);
  EXPECT_EQ(ev.back(), "destroyFilter a");
}

TEST_F(SluiceTest, HandedOverPacketsAreKeptInOrderUntilTaken) {
  FilterId id = Make("a");
  std::vector<ZelPkt*> made;
  {
    host::PacketList list;
    for (uint8_t i = 0; i < 3; i++) {
      made.push_back(host::Packets::Make(std::vector<uint8_t>(60, i)));
      list.Append(made.back());
    }
    agent->puntPackets = true;
    ASSERT_EQ(Sluice::Deliver(id, list, ZEL_SLUICE_DIR_TO_SWITCH), ZEL_OK);
    EXPECT_EQ(list.Count(), 0u);

    list.Append(host::Packets::Make(std::vector<uint8_t>(60, 9)));
    agent->puntPackets = false;
    agent->issuePackets = true;
    ASSERT_EQ(Sluice::Deliver(id, list, ZEL_SLUICE_DIR_FROM_SWITCH), ZEL_OK);
  }
  EXPECT_EQ(Sluice::FaultedCount(id), 1u);
  EXPECT_EQ(Sluice::IssuedCount(id), 1u);
  std::vector<host::Delivery> faulted = Sluice::TakeFaulted(id);
  ASSERT_EQ(faulted.size(), 1u);
  EXPECT_EQ(faulted[0].direction, ZEL_SLUICE_DIR_TO_SWITCH);
  EXPECT_EQ(faulted[0].packets, made);
  EXPECT_EQ(Sluice::FaultedCount(id), 0u);
  for (ZelPkt* p : faulted[0].packets) zel_PktRelease(p);

  // Packets still kept are the framework's: a reset releases them.
  EXPECT_EQ(host::Packets::Live(), 1u);
  ASSERT_EQ(Sluice::DestroyFilter(id), ZEL_OK);
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  host::Reset();
  EXPECT_EQ(host::Packets::Live(), 0u);
}

TEST_F(SluiceTest, AFailedHandOverStillTakesThePacketsAndDropsThem) {
  FilterId id = Make("a");
  host::PacketList list;
  list.Append(host::Packets::Make(std::vector<uint8_t>(60, 1)));
  list.Append(host::Packets::Make(std::vector<uint8_t>(60, 2)));
  host::Faults::Fail("zel_SluiceIssuePackets", ZEL_FAILURE);
  EXPECT_EQ(zel_SluiceIssuePackets(Priv(id)->handle, list.get(), 2), ZEL_FAILURE);
  EXPECT_EQ(list.Count(), 0u);
  EXPECT_EQ(host::Packets::Live(), 0u);
  EXPECT_EQ(Sluice::IssuedCount(id), 0u);
  EXPECT_EQ(Sluice::DestroyFilter(id), ZEL_OK);
}

TEST_F(SluiceTest, SlowPathsAndTheirIoctlsReachTheirOwnPrivatePointer) {
  ASSERT_EQ(Sluice::RegisterSlowPath("fake", 3), ZEL_OK);
  ASSERT_EQ(Sluice::RegisterSlowPath("fake", 5), ZEL_OK);
  Sluice::SlowPathIoctl("fake", 5, 1, {1, 2, 3});
  ASSERT_EQ(agent->slowPathIoctls.size(), 1u);
  EXPECT_EQ(agent->slowPathIoctls[0].first, 5u);
  EXPECT_EQ(agent->slowPathIoctls[0].second, (std::vector<uint8_t>{1, 2, 3}));

  agent->unregisterBusy = 1;
  EXPECT_EQ(Sluice::UnregisterSlowPath("fake", 3), ZEL_BUSY);   // one call only
  EXPECT_EQ(Sluice::UnregisterSlowPath("fake", 3), ZEL_OK);
  ASSERT_EQ(zel_SluiceUnregisterFastPath(handle_), ZEL_OK);
  // #3 is gone already; unregistration only calls back for #5.
  std::vector<std::string> ev = agent->Events();
  EXPECT_EQ(std::count(ev.begin(), ev.end(), "unregisterSlowPath #3"), 1);
  EXPECT_EQ(ev.back(), "unregisterSlowPath #5");
}

TEST_F(SluiceTest, FilterIoctlChannelCarriesPayloadAndRecordsReplies) {
  FilterId id = Make("a");
  Sluice::SendIoctl(id, 0x11, {'h', 'i'});
  Sluice::SendIoctl(id, 0x12, {});
  std::vector<host::IoctlReplyRecord> replies = Sluice::TakeIoctlReplies(id);
  ASSERT_EQ(replies.size(), 2u);
  EXPECT_EQ(replies[0].requestCode, 0x11u);
  EXPECT_EQ(replies[0].message, (std::vector<uint8_t>{'h', 'i'}));
  EXPECT_TRUE(replies[1].message.empty());
  EXPECT_TRUE(Sluice::TakeIoctlReplies(id).empty());

  host::Faults::Fail("zel_SluiceSendFilterIoctlReply", ZEL_NO_MEMORY);
  Sluice::SendIoctl(id, 0x13, {1});
  EXPECT_TRUE(Sluice::TakeIoctlReplies(id).empty());
  EXPECT_EQ(Sluice::DestroyFilter(id), ZEL_OK);
}

// --- properties ---------------------------------------------------------------

struct PropSeen {
  void* priv = nullptr;
  void* ctx = nullptr;
  std::vector<uint8_t> written;
  uint32_t pollSize = 4;
  uint32_t readBytes = 4;
  int cleanups = 0;
};
PropSeen* prop = nullptr;

ZelStatus PropWrite(void* priv, void* ctx, const void* data, uint32_t len) {
  prop->priv = priv;
  prop->ctx = ctx;
  auto* p = static_cast<const uint8_t*>(data);
  prop->written.assign(p, p + len);
  return ZEL_OK;
}
ZelStatus PropRead(void* priv, void*, void* buf) {
  prop->priv = priv;
  std::memset(buf, 0x5e, prop->readBytes);
  return ZEL_OK;
}
bool PropPoll(void*, void*, uint32_t* size) {
  *size = prop->pollSize;
  return prop->pollSize != 0;
}
void PropCleanup() { prop->cleanups++; }
const ZelSluicePropOps kPropOps = {PropWrite, PropRead, PropPoll, PropCleanup};

class SluicePropertyTest : public SluiceTest {
 protected:
  void SetUp() override {
    SluiceTest::SetUp();
    prop = &seen_;
    ASSERT_EQ(zel_SluicePropertyRegister(&ph_, "fake.ruleset", &kPropOps), ZEL_OK);
  }
  void TearDown() override {
    if (Sluice::PropertyRegistered("fake.ruleset")) {
      EXPECT_EQ(zel_SluicePropertyUnregister(ph_), ZEL_OK);
    }
    SluiceTest::TearDown();
  }
  PropSeen seen_;
  ZelSluicePropHandle ph_ = nullptr;
};

TEST_F(SluicePropertyTest, OperationsRouteToTheFilterPrivatePointer) {
  FilterId a = Make("a");
  FilterId b = Make("b");
  const uint8_t bytes[] = {7, 0, 0};
  ASSERT_EQ(Sluice::PropertyWrite("fake.ruleset", b, bytes), ZEL_OK);
  EXPECT_EQ(seen_.priv, Priv(b));
  EXPECT_NE(seen_.ctx, nullptr);
  EXPECT_EQ(seen_.written, (std::vector<uint8_t>{7, 0, 0}));

  std::vector<uint8_t> out;
  ZelStatus s = ZEL_FAILURE;
  ASSERT_TRUE(Sluice::PropertyRead("fake.ruleset", a, &out, &s));
  EXPECT_EQ(s, ZEL_OK);
  EXPECT_EQ(seen_.priv, Priv(a));
  EXPECT_EQ(out, std::vector<uint8_t>(4, 0x5e));

  seen_.pollSize = 0;
  EXPECT_FALSE(Sluice::PropertyRead("fake.ruleset", a, &out, &s));
  EXPECT_EQ(Sluice::DestroyFilter(a), ZEL_OK);
  EXPECT_EQ(Sluice::DestroyFilter(b), ZEL_OK);
}

TEST_F(SluicePropertyTest, RegistrationIsByUniqueNameAndUnregistrationCleansUp) {
  ZelSluicePropHandle other = nullptr;
  EXPECT_EQ(zel_SluicePropertyRegister(&other, "fake.ruleset", &kPropOps), ZEL_FAILURE);
  EXPECT_EQ(Sluice::PropertyOps("fake.ruleset"), &kPropOps);

  std::vector<std::string> left = host::Leftovers();
  EXPECT_NE(std::find(left.begin(), left.end(), "sluice: property 'fake.ruleset' still registered"),
            left.end());
  ASSERT_EQ(zel_SluicePropertyUnregister(ph_), ZEL_OK);
  EXPECT_EQ(seen_.cleanups, 1);
  EXPECT_FALSE(Sluice::PropertyRegistered("fake.ruleset"));
  EXPECT_EQ(zel_SluicePropertyUnregister(ph_), ZEL_NOT_FOUND);
}

using SluicePropertyDeathTest = SluicePropertyTest;

TEST_F(SluicePropertyDeathTest, AReadPastThePolledSizeAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  FilterId a = Make("a");
  seen_.readBytes = 5;
  std::vector<uint8_t> out;
  ZelStatus s;
  EXPECT_DEATH(Sluice::PropertyRead("fake.ruleset", a, &out, &s), "wrote past the 4 bytes");
  EXPECT_EQ(Sluice::DestroyFilter(a), ZEL_OK);
}

// --- misuse and leftovers ---------------------------------------------------------

using SluiceDeathTest = SluiceTest;

TEST_F(SluiceDeathTest, ADestroyedFilterHandleAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  FilterId a = Make("a");
  ZelSluiceFilterHandle h = Priv(a)->handle;
  ASSERT_EQ(Sluice::DestroyFilter(a), ZEL_OK);
  char name[10];
  EXPECT_DEATH((void)zel_SluiceGetName(h, name, sizeof name), "used after it was destroyed");
  EXPECT_DEATH((void)zel_SluiceGetName(reinterpret_cast<ZelSluiceFilterHandle>(name), name, 1),
               "unknown filter handle");
}

TEST_F(SluiceTest, LeftoversNameLiveFiltersAndAgents) {
  Make("a");
  std::vector<std::string> left = host::Leftovers();
  EXPECT_NE(std::find(left.begin(), left.end(), "sluice: agent 'fake' still registered"),
            left.end());
  EXPECT_NE(std::find(left.begin(), left.end(), "sluice: filter 1 'a' of agent 'fake' alive"),
            left.end());
}

}  // namespace
