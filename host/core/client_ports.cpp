// Distributed switch client-port properties: the module registers a table
// of handlers under a name; tests write to a property through ClientPorts.

#include <map>
#include <mutex>
#include <vector>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct ZelClientPort {
  std::string name;
  const ZelPGXPropOps* ops;
  ZelModuleID owner = -1;
};

namespace host {

namespace {

struct PortState {
  std::mutex mu;
  std::map<std::string, ZelClientPort*, std::less<>> byName;   // owns the records
};

PortState& P() {
  static PortState* p = new PortState;
  return *p;
}

}  // namespace

namespace core {

void ResetClientPorts() {
  PortState& p = P();
  std::lock_guard<std::mutex> g(p.mu);
  for (auto& [name, port] : p.byName) delete port;
  p.byName.clear();
}

void ClientPortLeftovers(std::vector<std::string>* out) {
  PortState& p = P();
  std::lock_guard<std::mutex> g(p.mu);
  for (auto& [name, port] : p.byName) out->push_back("client port " + name + ": still registered");
}

void ReportClientPortsOf(ZelModuleID module) {
  if (module < 0) return;
  std::vector<std::string> leaks;
  {
    PortState& p = P();
    std::lock_guard<std::mutex> g(p.mu);
    for (auto& [name, port] : p.byName) {
      if (port->owner == module) leaks.push_back("client port " + name + ": not unregistered at unload");
    }
  }
  for (auto& leak : leaks) RecordLeak(std::move(leak));
}

}  // namespace core

bool ClientPorts::Registered(std::string_view name) {
  PortState& p = P();
  std::lock_guard<std::mutex> g(p.mu);
  return p.byName.count(name) != 0;
}

ZelStatus ClientPorts::Write(std::string_view name, std::string_view text) {
  const ZelPGXPropOps* ops;
  {
    PortState& p = P();
    std::lock_guard<std::mutex> g(p.mu);
    auto it = p.byName.find(name);
    if (it == p.byName.end()) {
      Fatal("ClientPorts::Write: no client port %.*s", static_cast<int>(name.size()), name.data());
    }
    ops = it->second->ops;
  }
  if (ops->write == nullptr) {
    Fatal("ClientPorts::Write: client port %.*s has no write handler", static_cast<int>(name.size()),
          name.data());
  }
  // The handler may cut the text in place; it gets its own copy, exactly
  // `len` bytes long with no terminator, as the switch would hand it over.
  std::vector<char> data(text.begin(), text.end());
  return ops->write(nullptr, nullptr, nullptr, data.data(), static_cast<int32_t>(data.size()));
}

}  // namespace host

ZelStatus zel_PGXClientPortRegister(ZelClientPortHandle* handle, uint32_t flags, const char* name,
                                    const ZelPGXPropOps* ops) {
  (void)flags;
  if (ZelStatus st = host::Faults::Check("zel_PGXClientPortRegister")) return st;
  if (handle == nullptr || name == nullptr || ops == nullptr) return ZEL_BAD_PARAM;
  host::PortState& p = host::P();
  std::lock_guard<std::mutex> g(p.mu);
  if (p.byName.count(std::string_view(name)) != 0) return ZEL_BUSY;
  auto* port = new ZelClientPort{name, ops, host::core::OwningModule()};
  p.byName.emplace(port->name, port);
  *handle = port;
  return ZEL_OK;
}

void zel_PGXClientPortUnregister(ZelClientPortHandle handle) {
  host::PortState& p = host::P();
  std::lock_guard<std::mutex> g(p.mu);
  for (auto it = p.byName.begin(); it != p.byName.end(); ++it) {
    if (it->second == handle) {
      delete it->second;
      p.byName.erase(it);
      return;
    }
  }
  host::Fatal("zel_PGXClientPortUnregister: %p is not a registered client port", static_cast<void*>(handle));
}
