// A test fixture that gives each test a fresh host with the module loaded,
// and checks on the way out that the module left nothing behind: no heap
// bytes, no packets, no locks, timers, sockets, pool tags or framework
// objects.
#pragma once

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

#include "agent/agent.h"
#include "firewall/firewall.h"
#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"

namespace testsupport {

inline constexpr const char* kDefaultAgent = "sluice-generic-quelmar";

// Resets the host, without loading the module.
class HostTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;
};

class ModuleTest : public HostTest {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Loads the module; SetUp does this with default parameters.
  void Load(const std::map<std::string, int32_t>& params = {});
  // Unloads the module (TearDown does it if the test did not).
  void Unload();

  // Writes create texts to the create-agent property.
  ZelStatus CreateAgents(const std::string& text);
  host::FilterId CreateFilter(const std::string& agent = kDefaultAgent,
                              host::FilterConfig config = {});
  host::FilterId CreateFilter(const std::string& agent, const std::string& name);
  SLCGenericFilter* Filter(host::FilterId id);
  FWFilterContext* Ctx(host::FilterId id);
  SLCGenericFastPath* Agent(const std::string& name = kDefaultAgent);

  // Delivers frames as one list; returns the status and leaves in *passed
  // the frames still in the list afterwards (the packets are released).
  ZelStatus Deliver(host::FilterId id, const std::vector<std::vector<uint8_t>>& frames,
                    uint32_t direction, std::vector<std::vector<uint8_t>>* passed = nullptr);
  // Releases every packet handed to the framework and returns how many.
  size_t DrainFaulted(host::FilterId id);
  size_t DrainIssued(host::FilterId id);

  bool loaded_ = false;
};

// A request policy that accepts and replies in `mode` with `replyStatus`.
inline host::RequestPolicy Replies(host::ReplyMode mode, ZelStatus replyStatus = ZEL_OK) {
  host::RequestPolicy policy;
  policy.mode = mode;
  policy.replyStatus = replyStatus;
  return policy;
}
// A request policy that refuses every request with `status`.
inline host::RequestPolicy Refuses(ZelStatus status) {
  host::RequestPolicy policy;
  policy.refuse = status;
  return policy;
}

// Releases the packets of deliveries taken from the framework.
void ReleaseDeliveries(std::vector<host::Delivery>* deliveries);

}  // namespace testsupport
