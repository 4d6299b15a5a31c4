// Filter records: configuration reads failing, creation failing at each
// step, and garbage on every callback. What a filter reads is what the
// character device finds it by (chardev_test: name, VM UUID and vNIC index,
// endpoint type) and how it treats punted packets (context_test: failure
// policy); destruction while requests are in flight: slowpath_test.

#include <cstring>

#include "tests/support/module_fixture.h"

namespace {

using testsupport::kDefaultAgent;
using testsupport::ModuleTest;

using Filters = ModuleTest;

// Each configuration query failing cancels the filter with its message,
// which names the filter once its name is known.
TEST_F(Filters, ConfigReadFailureCancelsTheFilter) {
  const struct { const char* call; const char* message; bool namesFilter; } rows[] = {
      {"zel_SluiceGetName", "Could not get filter name (0xbad0001): Failure", false},
      {"zel_SluiceGetFailurePolicy", "Could not get filter failure policy (0xbad0001): Failure",
       true},
      {"zel_SluiceGetEndPointType", "Could not get filter endpoint type (0xbad0001): Failure",
       true},
      {"zel_SluiceGetVMUUID", "Could not get filter vm uuid (0xbad0001): Failure", true},
      {"zel_SluiceGetVnicIndex", "Could not get filter vnic index (0xbad0001): Failure", true},
  };
  for (const auto& r : rows) {
    SCOPED_TRACE(r.call);
    host::Log::Clear();
    host::Faults::Fail(r.call, ZEL_FAILURE);
    host::FilterId id = 0;
    EXPECT_EQ(host::Sluice::CreateFilter(kDefaultAgent, {}, &id), ZEL_FAILURE);
    EXPECT_TRUE(List_IsEmpty(&Agent()->filters));
    const std::vector<host::LogRecord> records = host::Log::Records();
    auto it = std::find_if(records.begin(), records.end(),
                           [&](const host::LogRecord& l) { return l.text == r.message; });
    ASSERT_NE(it, records.end());
    EXPECT_EQ(it->urgency, 2);
    EXPECT_EQ(it->object, r.namesFilter ? "vnic0" : "");
    host::Faults::ClearAll();
  }
  // The UUID query's "not set" is no failure: the filter has no UUID.
  host::FilterConfig unset;
  unset.vmUUIDUnset = true;
  EXPECT_STREQ(Filter(CreateFilter(kDefaultAgent, unset))->vmUUID, "");
}

TEST_F(Filters, CreationFailuresFreeEverything) {
  host::FilterId id = 0;
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  EXPECT_EQ(host::Sluice::CreateFilter(kDefaultAgent, {}, &id), ZEL_NO_MEMORY);
  EXPECT_TRUE(host::Log::Contains("Failed to allocate memory for filter", 1));

  // The filter lock, then the firewall's configuration lock.
  host::Faults::Fail("zel_SpinlockCreate", ZEL_FAILURE);
  EXPECT_EQ(host::Sluice::CreateFilter(kDefaultAgent, {}, &id), ZEL_FAILURE);
  host::Faults::Fail("zel_SpinlockCreate", ZEL_FAILURE, 2);
  EXPECT_EQ(host::Sluice::CreateFilter(kDefaultAgent, {}, &id), ZEL_FAILURE);
  EXPECT_TRUE(host::Log::Contains("Could not allocate configuration lock", 2));

  // The record, then the firewall context.
  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY, 2);
  EXPECT_EQ(host::Sluice::CreateFilter(kDefaultAgent, {}, &id), ZEL_NO_MEMORY);
  EXPECT_TRUE(host::Log::Contains("Failed to allocate memory for agent context", 2));

  EXPECT_TRUE(List_IsEmpty(&Agent()->filters));
}

TEST_F(Filters, ConfigurationChangeRereadsOnlyTheRecord) {
  host::FilterId id = CreateFilter();
  FWFilterContext before = *Ctx(id);
  host::FilterConfig config;
  config.name = "renamed";
  config.failurePolicy = 1;
  host::Sluice::SetFilterConfig(id, config);
  host::Sluice::ConfigurationChanged(id);
  EXPECT_STREQ(Filter(id)->name, "renamed");
  EXPECT_EQ(Filter(id)->failurePolicy, 1u);
  EXPECT_EQ(std::memcmp(&before, Ctx(id), sizeof(before)), 0);
}

// A record-shaped block of garbage: every callback must look at its first
// eight bytes only.
TEST_F(ModuleTest, GarbageOnEveryCallbackIsRefused) {
  alignas(16) uint8_t garbage[512];
  std::memset(garbage, 0x5a, sizeof(garbage));
  std::vector<uint8_t> before(garbage, garbage + sizeof(garbage));
  host::PacketList list;
  list.Append(host::Packets::Make(std::vector<uint8_t>(64, 1)));
  void* priv = nullptr;
  uint64_t len = 0;

  EXPECT_EQ(slcGenericOps.registerSlowPath(garbage, 1, &priv), ZEL_BAD_PARAM);
  EXPECT_EQ(slcGenericOps.createFilter(garbage, nullptr, &priv, 0), ZEL_BAD_PARAM);
  EXPECT_EQ(slcGenericOps.destroyFilter(garbage), ZEL_OK);
  EXPECT_EQ(slcGenericOps.unregisterSlowPath(garbage), ZEL_OK);
  EXPECT_EQ(slcGenericOps.processPackets(garbage, list.get(), 1), ZEL_BAD_PARAM);
  EXPECT_EQ(slcGenericOps.processSlowPathPackets(garbage, list.get(), 1), ZEL_BAD_PARAM);
  slcGenericOps.processFilterIoctl(garbage, 1, garbage, 8);
  slcGenericOps.processSlowPathIoctl(garbage, 1, garbage, 8);
  slcGenericOps.configurationChanged(garbage);
  slcGenericOps.prefetchSavedState(garbage);
  EXPECT_EQ(slcGenericOps.getSavedStateLen(garbage, &len), ZEL_BAD_PARAM);
  EXPECT_EQ(slcGenericOps.saveState(garbage, garbage, &len), ZEL_BAD_PARAM);
  EXPECT_EQ(slcGenericOps.restoreState(garbage, garbage, 64), ZEL_BAD_PARAM);
  SLCGenericSetSlowPathReply(garbage, garbage, ZEL_OK);
  SLCGenericAttachSlowPathsToFilters(garbage);

  EXPECT_EQ(std::vector<uint8_t>(garbage, garbage + sizeof(garbage)), before);
  EXPECT_EQ(list.Count(), 1u);
  EXPECT_GE(host::Log::Count("Bad magic for filter", 2), 8u);
  EXPECT_EQ(host::Log::Count("Bad magic for fastPath", 2), 3u);
  EXPECT_EQ(host::Log::Count("Bad magic for slowPath", 2), 2u);
}

}  // namespace
