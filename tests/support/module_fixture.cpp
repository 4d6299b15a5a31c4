#include "tests/support/module_fixture.h"

#include "module/module.h"

namespace testsupport {

void HostTest::SetUp() {
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
}

void HostTest::TearDown() {
  std::vector<std::string> left = host::Leftovers();
  for (const std::string& what : left) {
    ADD_FAILURE() << "left behind: " << what;
  }
  EXPECT_EQ(host::Locks::HeldByThisThread(), 0u);
  host::Reset();
}

void ModuleTest::SetUp() {
  HostTest::SetUp();
  Load();
}

void ModuleTest::TearDown() {
  if (loaded_) {
    Unload();
  }
  HostTest::TearDown();
}

void ModuleTest::Load(const std::map<std::string, int32_t>& params) {
  ASSERT_FALSE(loaded_);
  ASSERT_EQ(host::Loader::Load(&slcGenericModuleImage, params), 0);
  loaded_ = true;
}

void ModuleTest::Unload() {
  ASSERT_TRUE(loaded_);
  // Whatever the framework still holds for us goes back before unloading.
  for (const std::string& agent : host::Sluice::Agents()) {
    for (host::FilterId id : host::Sluice::Filters(agent)) {
      DrainFaulted(id);
      DrainIssued(id);
    }
  }
  host::Loader::Unload();
  loaded_ = false;
}

ZelStatus ModuleTest::CreateAgents(const std::string& text) {
  return host::ClientPorts::Write(kSLCGenericCreateAgentPropName, text);
}

host::FilterId ModuleTest::CreateFilter(const std::string& agent, host::FilterConfig config) {
  host::FilterId id = 0;
  ZelStatus status = host::Sluice::CreateFilter(agent, config, &id);
  EXPECT_EQ(status, ZEL_OK) << "creating filter " << config.name;
  return id;
}

host::FilterId ModuleTest::CreateFilter(const std::string& agent, const std::string& name) {
  host::FilterConfig config;
  config.name = name;
  return CreateFilter(agent, config);
}

SLCGenericFilter* ModuleTest::Filter(host::FilterId id) {
  return static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(id));
}

FWFilterContext* ModuleTest::Ctx(host::FilterId id) { return FWContext(Filter(id)); }

SLCGenericFastPath* ModuleTest::Agent(const std::string& name) {
  return static_cast<SLCGenericFastPath*>(host::Sluice::Agent(name).priv);
}

ZelStatus ModuleTest::Deliver(host::FilterId id, const std::vector<std::vector<uint8_t>>& frames,
                              uint32_t direction, std::vector<std::vector<uint8_t>>* passed) {
  host::PacketList list;
  for (const auto& frame : frames) {
    list.Append(host::Packets::Make(frame));
  }
  ZelStatus status = host::Sluice::Deliver(id, list, direction);
  if (passed != nullptr) {
    passed->clear();
    for (ZelPkt* pkt : list.Packets()) {
      passed->push_back(host::Packets::Frame(pkt));
    }
  }
  return status;
}

void ReleaseDeliveries(std::vector<host::Delivery>* deliveries) {
  for (host::Delivery& d : *deliveries) {
    for (ZelPkt* pkt : d.packets) {
      zel_PktRelease(pkt);
    }
    d.packets.clear();
  }
}

// Releases the packets of the deliveries and returns how many there were.
static size_t Drain(std::vector<host::Delivery> deliveries) {
  size_t n = 0;
  for (const auto& d : deliveries) n += d.packets.size();
  ReleaseDeliveries(&deliveries);
  return n;
}

size_t ModuleTest::DrainFaulted(host::FilterId id) { return Drain(host::Sluice::TakeFaulted(id)); }
size_t ModuleTest::DrainIssued(host::FilterId id) { return Drain(host::Sluice::TakeIssued(id)); }

}  // namespace testsupport
