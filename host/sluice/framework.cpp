// The host's Sluice filter framework: agents, filters, packet hand-over,
// slow paths and the filter ioctl channel. Requests and their replies live
// in requests.cpp, agent properties in properties.cpp.
//
// Locking: every record is guarded by State::mu. Module callbacks are made
// with mu released; what a callback needs is copied out first.
#include <algorithm>
#include <chrono>
#include <cstring>
#include <new>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/sluice/sluice_internal.h"

namespace host::sluice {

namespace {

// How long unregistration keeps calling destroy / unregister callbacks that
// answer busy before it declares the module stuck.
constexpr auto kBusyGiveUp = std::chrono::seconds(5);
constexpr auto kBusyPause = std::chrono::milliseconds(1);

ZelSluiceFastPath* AgentByNameLocked(std::string_view name) {
  for (auto& a : S().agents) {
    if (a->name == name) return a.get();
  }
  return nullptr;
}

ZelSluiceFastPath* AgentOrDieLocked(std::string_view name, const char* call) {
  ZelSluiceFastPath* a = AgentByNameLocked(name);
  if (a == nullptr) {
    Fatal("Sluice::%s: no agent named '%.*s' is registered", call, static_cast<int>(name.size()),
          name.data());
  }
  return a;
}

void* SlowPathPrivLocked(ZelSluiceFastPath* agent, uint32_t id, const char* call) {
  for (auto& [spId, spPriv] : agent->slowPaths) {
    if (spId == id) return spPriv;
  }
  Fatal("Sluice::%s: slow path #%u is not registered with agent '%s'", call, id,
        agent->name.c_str());
}

// Marks a filter whose destroy callback succeeded as gone. A reply still
// queued for it would reach a freed record: the module must refuse
// destruction while it waits for replies.
void ForgetFilterLocked(ZelSluiceFilter* f) {
  if (size_t queued = QueuedRepliesLocked(f)) {
    Fatal("filter %llu '%s' of agent '%s' was destroyed while %zu request replies for it are "
          "still pending",
          static_cast<unsigned long long>(f->id), f->config.name.c_str(), f->agent->name.c_str(),
          queued);
  }
  f->alive = false;
  auto& list = f->agent->filters;
  list.erase(std::remove(list.begin(), list.end(), f), list.end());
  S().dead.push_back(f->id);
  while (S().dead.size() > State::kDeadFiltersKept) {
    auto it = S().filters.find(S().dead.front());
    S().dead.pop_front();
    if (it == S().filters.end()) continue;
    // Packets the test never took back stay counted as live packets.
    S().handles.erase(it->second.get());
    S().filters.erase(it);
  }
}

ZelStatus CopyText(const std::string& text, char* buf, uint32_t size) {
  if (buf == nullptr || size == 0) return ZEL_BAD_PARAM;
  size_t n = std::min<size_t>(text.size(), size - 1);
  std::memcpy(buf, text.data(), n);
  buf[n] = '\0';
  return ZEL_OK;
}

// Calls `attempt` until it answers ZEL_OK. Between tries, replies sent from
// the reply thread are let through (the module may be waiting for them to
// drop its references) and the caller pauses briefly.
template <typename Attempt>
void RetryUntilOk(Attempt attempt, const char* what, const std::string& name,
                  const std::string& agent) {
  auto start = std::chrono::steady_clock::now();
  for (;;) {
    ZelStatus s = attempt();
    if (s == ZEL_OK) return;
    if (std::chrono::steady_clock::now() - start > kBusyGiveUp) {
      Fatal("unregistering agent '%s': %s '%s' still answers %#x after %lld s", agent.c_str(),
            what, name.c_str(), s,
            static_cast<long long>(std::chrono::duration_cast<std::chrono::seconds>(kBusyGiveUp)
                                       .count()));
    }
    DrainThreadedReplies();
    std::this_thread::sleep_for(kBusyPause);
  }
}

void ReleasePackets(std::vector<ZelPkt*>& pkts) {
  for (ZelPkt* p : pkts) {
    // The packet subsystem may have been reset before this one.
    if (Packets::IsLive(p)) zel_PktRelease(p);
  }
  pkts.clear();
}

void ResetSluice() {
  std::vector<ZelPkt*> kept;
  {
    std::unique_lock<std::mutex> g(S().mu);
    S().threaded.clear();
    S().idleCv.wait(g, [] { return S().inFlight == 0; });
    for (auto& [id, f] : S().filters) {
      for (auto* deliveries : {&f->faulted, &f->issued}) {
        for (Delivery& d : *deliveries) kept.insert(kept.end(), d.packets.begin(), d.packets.end());
      }
    }
    S().agents.clear();
    S().deadAgents.clear();
    S().filters.clear();
    S().dead.clear();
    S().handles.clear();
    S().nextFilter = 1;
    ResetRequestsLocked();
    ResetPropertiesLocked();
  }
  ReleasePackets(kept);
}

void SluiceLeftovers(std::vector<std::string>* out) {
  std::lock_guard<std::mutex> g(S().mu);
  for (auto& a : S().agents) {
    out->push_back("sluice: agent '" + a->name + "' still registered");
  }
  for (auto& [id, f] : S().filters) {
    if (!f->alive) continue;
    out->push_back("sluice: filter " + std::to_string(id) + " '" + f->config.name +
                   "' of agent '" + f->agent->name + "' alive");
  }
  size_t pending = S().deferred.size() + S().threaded.size() + S().inFlight +
                   S().backendRequests.size();
  if (pending != 0) {
    out->push_back("sluice: " + std::to_string(pending) + " request replies pending");
  }
  PropertyLeftoversLocked(out);
}

[[maybe_unused]] const bool registered = RegisterSubsystem({"sluice", &ResetSluice, &SluiceLeftovers});

}  // namespace

State& S() {
  static State state;
  return state;
}

ZelSluiceFilter* FilterLocked(ZelSluiceFilterHandle handle, const char* call) {
  if (S().handles.count(handle) == 0) Fatal("%s: unknown filter handle %p", call, (void*)handle);
  if (!handle->alive) {
    Fatal("%s: filter %llu '%s' used after it was destroyed", call,
          static_cast<unsigned long long>(handle->id), handle->config.name.c_str());
  }
  return handle;
}

ZelSluiceFilter* FilterByIdLocked(FilterId id, const char* call) {
  auto it = S().filters.find(id);
  if (it == S().filters.end()) {
    Fatal("Sluice::%s: no filter %llu", call, static_cast<unsigned long long>(id));
  }
  return it->second.get();
}

ZelSluiceFilter* LiveFilterByIdLocked(FilterId id, const char* call) {
  ZelSluiceFilter* f = FilterByIdLocked(id, call);
  if (!f->alive) {
    Fatal("Sluice::%s: filter %llu '%s' was destroyed", call, static_cast<unsigned long long>(id),
          f->config.name.c_str());
  }
  return f;
}

std::vector<ZelPkt*> TakePackets(ZelPktList* list) {
  std::vector<ZelPkt*> out;
  if (list == nullptr) return out;
  size_t size = zel_PktListIterSizeOf();
  void* storage = ::operator new(size, std::align_val_t{16});
  auto* iter = static_cast<ZelPktListIter*>(storage);
  zel_PktListIterStart(list, iter);
  while (!zel_PktListIterIsAtEnd(iter)) {
    ZelPkt* p = nullptr;
    zel_PktListIterRemovePkt(iter, &p);
    out.push_back(p);
  }
  ::operator delete(storage, std::align_val_t{16});
  return out;
}

}  // namespace host::sluice

using namespace host;
using namespace host::sluice;

// ---------------------------------------------------------------------------
// zel_ calls: agents

ZelStatus zel_SluiceRegisterFastPath(const char* name, uint32_t version, uint32_t opsVersion,
                                     ZelModuleID module, const ZelSluiceFastPathOps* ops,
                                     void* priv, ZelSluiceFastPathHandle* handle) {
  if (ZelStatus s = Faults::Check("zel_SluiceRegisterFastPath")) return s;
  if (name == nullptr || ops == nullptr || handle == nullptr || name[0] == '\0') {
    return ZEL_BAD_PARAM;
  }
  if (version != ZEL_SLUICE_FASTPATH_VERSION || opsVersion != ZEL_SLUICE_FASTPATH_VERSION) {
    return ZEL_NOT_SUPPORTED;
  }
  std::lock_guard<std::mutex> g(S().mu);
  if (AgentByNameLocked(name) != nullptr) return ZEL_FAILURE;
  auto a = std::make_unique<ZelSluiceFastPath>();
  a->name = name;
  a->version = version;
  a->opsVersion = opsVersion;
  a->module = module;
  a->ops = ops;
  a->priv = priv;
  *handle = a.get();
  S().agents.push_back(std::move(a));
  return ZEL_OK;
}

ZelStatus zel_SluiceUnregisterFastPath(ZelSluiceFastPathHandle handle) {
  if (ZelStatus s = Faults::Check("zel_SluiceUnregisterFastPath")) return s;
  std::vector<std::pair<ZelSluiceFilter*, void*>> filters;
  std::vector<std::pair<uint32_t, void*>> slowPaths;
  const ZelSluiceFastPathOps* ops;
  std::string agentName;
  {
    std::lock_guard<std::mutex> g(S().mu);
    auto& agents = S().agents;
    auto it = std::find_if(agents.begin(), agents.end(),
                           [&](auto& a) { return a.get() == handle; });
    if (it == agents.end()) {
      Fatal("zel_SluiceUnregisterFastPath: unknown or unregistered fast path handle %p",
            (void*)handle);
    }
    ops = handle->ops;
    agentName = handle->name;
    for (ZelSluiceFilter* f : handle->filters) filters.emplace_back(f, f->priv);
    slowPaths = handle->slowPaths;
  }

  // Filters first, oldest first: a filter's destruction may detach it from
  // its slow path, which must still be registered then.
  for (auto& [f, priv] : filters) {
    RetryUntilOk(
        [&, f = f, priv = priv] {
          ZelStatus s = ops->destroyFilter != nullptr ? ops->destroyFilter(priv) : ZEL_OK;
          if (s == ZEL_OK) {
            std::lock_guard<std::mutex> g(S().mu);
            ForgetFilterLocked(f);
          }
          return s;
        },
        "filter", f->config.name, agentName);
  }
  for (auto& [id, spPriv] : slowPaths) {
    RetryUntilOk(
        [&, spPriv = spPriv] {
          return ops->unregisterSlowPath != nullptr ? ops->unregisterSlowPath(spPriv) : ZEL_OK;
        },
        "slow path", "#" + std::to_string(id), agentName);
  }

  std::lock_guard<std::mutex> g(S().mu);
  auto& agents = S().agents;
  auto it = std::find_if(agents.begin(), agents.end(), [&](auto& a) { return a.get() == handle; });
  // Filters created meanwhile (by a concurrent test thread) would outlive
  // their agent; a real framework serialises this, the host refuses it.
  if (!handle->filters.empty()) {
    Fatal("zel_SluiceUnregisterFastPath: agent '%s' got new filters while being unregistered",
          agentName.c_str());
  }
  handle->slowPaths.clear();
  handle->registered = false;
  S().deadAgents.push_back(std::move(*it));
  agents.erase(it);
  return ZEL_OK;
}

// ---------------------------------------------------------------------------
// zel_ calls: filter configuration

ZelStatus zel_SluiceGetName(ZelSluiceFilterHandle filter, char* buf, uint32_t size) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetName")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  return CopyText(FilterLocked(filter, "zel_SluiceGetName")->config.name, buf, size);
}

ZelStatus zel_SluiceGetVMUUID(ZelSluiceFilterHandle filter, char* buf, uint32_t size) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetVMUUID")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceGetVMUUID");
  if (f->config.vmUUIDUnset) return ZEL_NOT_INITIALIZED;
  return CopyText(f->config.vmUUID, buf, size);
}

ZelStatus zel_SluiceGetFailurePolicy(ZelSluiceFilterHandle filter, uint32_t* policy) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetFailurePolicy")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceGetFailurePolicy");
  if (policy == nullptr) return ZEL_BAD_PARAM;
  *policy = f->config.failurePolicy;
  return ZEL_OK;
}

ZelStatus zel_SluiceGetEndPointType(ZelSluiceFilterHandle filter, uint32_t* type) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetEndPointType")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceGetEndPointType");
  if (type == nullptr) return ZEL_BAD_PARAM;
  *type = f->config.endPointType;
  return ZEL_OK;
}

ZelStatus zel_SluiceGetVnicIndex(ZelSluiceFilterHandle filter, uint32_t* index) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetVnicIndex")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceGetVnicIndex");
  if (index == nullptr) return ZEL_BAD_PARAM;
  *index = f->config.vnicIndex;
  return ZEL_OK;
}

ZelStatus zel_SluiceGetConfigParameter(ZelSluiceFilterHandle filter, uint32_t number, char* buf,
                                       uint32_t size) {
  if (ZelStatus s = Faults::Check("zel_SluiceGetConfigParameter")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceGetConfigParameter");
  if (number < 1 || number > f->config.parameters.size()) return ZEL_BAD_PARAM;
  // Parameters are at most 256 bytes of text.
  const std::string& p = f->config.parameters[number - 1];
  return CopyText(p.substr(0, 256), buf, size);
}

// ---------------------------------------------------------------------------
// zel_ calls: packets

namespace {

ZelStatus TakeOver(ZelSluiceFilterHandle filter, ZelPktList* list, uint32_t direction,
                   const char* call, bool faulted, const void* site) {
  ZelStatus injected = Faults::Check(call, site);
  std::vector<ZelPkt*> pkts;
  SlowPathBackend* backend = nullptr;
  FilterId id = 0;
  uint32_t slowPath = 0;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = FilterLocked(filter, call);
    if (list == nullptr) return ZEL_BAD_PARAM;
    pkts = TakePackets(list);
    if (injected == ZEL_OK && faulted && S().backend != nullptr && f->slowPath != 0) {
      backend = S().backend;
      id = f->id;
      slowPath = f->slowPath;
    } else if (injected == ZEL_OK) {
      auto& to = faulted ? f->faulted : f->issued;
      to.push_back(Delivery{direction, std::move(pkts)});
      return ZEL_OK;
    }
  }
  if (backend != nullptr) {
    backend->Faulted(id, slowPath, direction, std::move(pkts));
    return ZEL_OK;
  }
  // The framework takes the packets over even when it fails the call: they
  // are dropped, as the caller may no longer touch them.
  ReleasePackets(pkts);
  return injected;
}

}  // namespace

ZelStatus zel_SluiceFaultPackets(ZelSluiceFilterHandle filter, ZelPktList* list,
                                 uint32_t direction, uint32_t /*flags*/) {
  return TakeOver(filter, list, direction, "zel_SluiceFaultPackets", true,
                  __builtin_return_address(0));
}

ZelStatus zel_SluiceIssuePackets(ZelSluiceFilterHandle filter, ZelPktList* list,
                                 uint32_t direction) {
  return TakeOver(filter, list, direction, "zel_SluiceIssuePackets", false,
                  __builtin_return_address(0));
}

// ---------------------------------------------------------------------------
// zel_ calls: filter ioctl replies

ZelStatus zel_SluiceSendFilterIoctlReply(ZelSluiceFilterHandle filter, uint32_t requestCode,
                                         const void* msg, uint32_t len) {
  if (ZelStatus s = Faults::Check("zel_SluiceSendFilterIoctlReply")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceSendFilterIoctlReply");
  if (msg == nullptr && len != 0) return ZEL_BAD_PARAM;
  IoctlReplyRecord r;
  r.requestCode = requestCode;
  if (len != 0) {
    const auto* p = static_cast<const uint8_t*>(msg);
    r.message.assign(p, p + len);
  }
  f->ioctlReplies.push_back(std::move(r));
  return ZEL_OK;
}

// ---------------------------------------------------------------------------
// Test-facing side

namespace host {

bool Sluice::AgentRegistered(std::string_view name) {
  std::lock_guard<std::mutex> g(S().mu);
  return AgentByNameLocked(name) != nullptr;
}

std::vector<std::string> Sluice::Agents() {
  std::lock_guard<std::mutex> g(S().mu);
  std::vector<std::string> out;
  for (auto& a : S().agents) out.push_back(a->name);
  return out;
}

Sluice::AgentInfo Sluice::Agent(std::string_view name) {
  std::lock_guard<std::mutex> g(S().mu);
  ZelSluiceFastPath* a = AgentOrDieLocked(name, "Agent");
  return AgentInfo{a->name, a->version, a->opsVersion, a->module, a->ops, a->priv};
}

ZelStatus Sluice::CreateFilter(std::string_view agent, const FilterConfig& config, FilterId* id) {
  ZelSluiceFilter* f;
  const ZelSluiceFastPathOps* ops;
  void* agentPriv;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFastPath* a = AgentOrDieLocked(agent, "CreateFilter");
    auto owned = std::make_unique<ZelSluiceFilter>();
    f = owned.get();
    f->id = S().nextFilter++;
    f->agent = a;
    f->config = config;
    S().handles.insert(f);
    S().filters.emplace(f->id, std::move(owned));
    // Listed at once: the module may make requests about the filter from
    // inside its create callback.
    a->filters.push_back(f);
    ops = a->ops;
    agentPriv = a->priv;
  }
  ZelStatus s = ops->createFilter != nullptr ? ops->createFilter(agentPriv, f, &f->priv, 0)
                                             : ZEL_NOT_SUPPORTED;
  std::lock_guard<std::mutex> g(S().mu);
  if (s != ZEL_OK) {
    ForgetFilterLocked(f);
    if (id != nullptr) *id = 0;
    return s;
  }
  if (id != nullptr) *id = f->id;
  return ZEL_OK;
}

ZelStatus Sluice::DestroyFilter(FilterId id) {
  ZelSluiceFilter* f;
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    f = LiveFilterByIdLocked(id, "DestroyFilter");
    priv = f->priv;
    ops = f->agent->ops;
  }
  ZelStatus s = ops->destroyFilter != nullptr ? ops->destroyFilter(priv) : ZEL_OK;
  if (s == ZEL_OK) {
    std::lock_guard<std::mutex> g(S().mu);
    ForgetFilterLocked(f);
  }
  return s;
}

void* Sluice::FilterPriv(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return LiveFilterByIdLocked(id, "FilterPriv")->priv;
}

bool Sluice::FilterAlive(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  auto it = S().filters.find(id);
  return it != S().filters.end() && it->second->alive;
}

std::vector<FilterId> Sluice::Filters(std::string_view agent) {
  std::lock_guard<std::mutex> g(S().mu);
  std::vector<FilterId> out;
  for (ZelSluiceFilter* f : AgentOrDieLocked(agent, "Filters")->filters) out.push_back(f->id);
  return out;
}

void Sluice::SetFilterConfig(FilterId id, const FilterConfig& config) {
  std::lock_guard<std::mutex> g(S().mu);
  LiveFilterByIdLocked(id, "SetFilterConfig")->config = config;
}

void Sluice::ConfigurationChanged(FilterId id) {
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = LiveFilterByIdLocked(id, "ConfigurationChanged");
    priv = f->priv;
    ops = f->agent->ops;
  }
  if (ops->configurationChanged != nullptr) ops->configurationChanged(priv);
}

uint32_t Sluice::SlowPathOf(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return FilterByIdLocked(id, "SlowPathOf")->slowPath;
}

uint64_t Sluice::ClearCalls(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return FilterByIdLocked(id, "ClearCalls")->clearCalls;
}

ZelStatus Sluice::Deliver(FilterId id, PacketList& list, uint32_t direction) {
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = LiveFilterByIdLocked(id, "Deliver");
    priv = f->priv;
    ops = f->agent->ops;
  }
  if (ops->processPackets == nullptr) return ZEL_NOT_SUPPORTED;
  return ops->processPackets(priv, list.get(), direction);
}

ZelStatus Sluice::DeliverFromSlowPath(FilterId id, PacketList& list, uint32_t direction) {
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = LiveFilterByIdLocked(id, "DeliverFromSlowPath");
    priv = f->priv;
    ops = f->agent->ops;
  }
  if (ops->processSlowPathPackets == nullptr) return ZEL_NOT_SUPPORTED;
  return ops->processSlowPathPackets(priv, list.get(), direction);
}

size_t Sluice::FaultedCount(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return FilterByIdLocked(id, "FaultedCount")->faulted.size();
}

size_t Sluice::IssuedCount(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return FilterByIdLocked(id, "IssuedCount")->issued.size();
}

std::vector<Delivery> Sluice::TakeFaulted(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return std::exchange(FilterByIdLocked(id, "TakeFaulted")->faulted, {});
}

std::vector<Delivery> Sluice::TakeIssued(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return std::exchange(FilterByIdLocked(id, "TakeIssued")->issued, {});
}

ZelStatus Sluice::RegisterSlowPath(std::string_view agent, uint32_t slowPathId) {
  const ZelSluiceFastPathOps* ops;
  void* agentPriv;
  ZelSluiceFastPath* a;
  {
    std::lock_guard<std::mutex> g(S().mu);
    a = AgentOrDieLocked(agent, "RegisterSlowPath");
    for (auto& sp : a->slowPaths) {
      if (sp.first == slowPathId) {
        Fatal("Sluice::RegisterSlowPath: slow path #%u is already registered with agent '%s'",
              slowPathId, a->name.c_str());
      }
    }
    ops = a->ops;
    agentPriv = a->priv;
  }
  void* spPriv = nullptr;
  ZelStatus s = ops->registerSlowPath != nullptr
                    ? ops->registerSlowPath(agentPriv, slowPathId, &spPriv)
                    : ZEL_NOT_SUPPORTED;
  if (s == ZEL_OK) {
    std::lock_guard<std::mutex> g(S().mu);
    a->slowPaths.emplace_back(slowPathId, spPriv);
  }
  return s;
}

ZelStatus Sluice::UnregisterSlowPath(std::string_view agent, uint32_t slowPathId) {
  const ZelSluiceFastPathOps* ops;
  void* spPriv;
  ZelSluiceFastPath* a;
  {
    std::lock_guard<std::mutex> g(S().mu);
    a = AgentOrDieLocked(agent, "UnregisterSlowPath");
    spPriv = SlowPathPrivLocked(a, slowPathId, "UnregisterSlowPath");
    ops = a->ops;
  }
  ZelStatus s = ops->unregisterSlowPath != nullptr ? ops->unregisterSlowPath(spPriv) : ZEL_OK;
  if (s == ZEL_OK) {
    std::lock_guard<std::mutex> g(S().mu);
    auto& sps = a->slowPaths;
    sps.erase(std::remove_if(sps.begin(), sps.end(),
                             [&](auto& sp) { return sp.first == slowPathId; }),
              sps.end());
  }
  return s;
}

std::vector<uint32_t> Sluice::SlowPaths(std::string_view agent) {
  std::lock_guard<std::mutex> g(S().mu);
  std::vector<uint32_t> out;
  if (ZelSluiceFastPath* a = AgentByNameLocked(agent)) {
    for (auto& sp : a->slowPaths) out.push_back(sp.first);
  }
  return out;
}

void Sluice::SlowPathIoctl(std::string_view agent, uint32_t slowPathId, uint32_t code,
                           std::vector<uint8_t> payload) {
  const ZelSluiceFastPathOps* ops;
  void* spPriv;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFastPath* a = AgentOrDieLocked(agent, "SlowPathIoctl");
    spPriv = SlowPathPrivLocked(a, slowPathId, "SlowPathIoctl");
    ops = a->ops;
  }
  if (ops->processSlowPathIoctl == nullptr) return;
  // An exactly sized copy, so that a read past the payload is caught.
  std::unique_ptr<uint8_t[]> copy(new uint8_t[payload.size()]);
  std::copy(payload.begin(), payload.end(), copy.get());
  ops->processSlowPathIoctl(spPriv, code, copy.get(), payload.size());
}

void Sluice::SendIoctl(FilterId id, uint32_t requestCode, std::vector<uint8_t> payload) {
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = LiveFilterByIdLocked(id, "SendIoctl");
    priv = f->priv;
    ops = f->agent->ops;
  }
  if (ops->processFilterIoctl == nullptr) return;
  std::unique_ptr<uint8_t[]> copy(new uint8_t[payload.size()]);
  std::copy(payload.begin(), payload.end(), copy.get());
  ops->processFilterIoctl(priv, requestCode, copy.get(), payload.size());
}

std::vector<IoctlReplyRecord> Sluice::TakeIoctlReplies(FilterId id) {
  std::lock_guard<std::mutex> g(S().mu);
  return std::exchange(FilterByIdLocked(id, "TakeIoctlReplies")->ioctlReplies, {});
}

}  // namespace host

// ---------------------------------------------------------------------------
// Migration: the framework's save and restore calls

namespace host {

namespace {

template <typename Fn>
auto WithFilterOps(FilterId id, const char* call, Fn fn) {
  void* priv;
  const ZelSluiceFastPathOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = LiveFilterByIdLocked(id, call);
    priv = f->priv;
    ops = f->agent->ops;
  }
  return fn(ops, priv);
}

}  // namespace

void Sluice::PrefetchSavedState(FilterId id) {
  WithFilterOps(id, "PrefetchSavedState", [](const ZelSluiceFastPathOps* ops, void* priv) {
    if (ops->prefetchSavedState != nullptr) ops->prefetchSavedState(priv);
  });
}

ZelStatus Sluice::GetSavedStateLen(FilterId id, uint64_t* len) {
  return WithFilterOps(id, "GetSavedStateLen", [&](const ZelSluiceFastPathOps* ops, void* priv) {
    return ops->getSavedStateLen != nullptr ? ops->getSavedStateLen(priv, len)
                                            : ZEL_NOT_SUPPORTED;
  });
}

ZelStatus Sluice::SaveState(FilterId id, void* buf, uint64_t* len) {
  return WithFilterOps(id, "SaveState", [&](const ZelSluiceFastPathOps* ops, void* priv) {
    return ops->saveState != nullptr ? ops->saveState(priv, buf, len) : ZEL_NOT_SUPPORTED;
  });
}

ZelStatus Sluice::RestoreState(FilterId id, const void* buf, uint64_t len) {
  return WithFilterOps(id, "RestoreState", [&](const ZelSluiceFastPathOps* ops, void* priv) {
    return ops->restoreState != nullptr ? ops->restoreState(priv, buf, len) : ZEL_NOT_SUPPORTED;
  });
}

}  // namespace host
