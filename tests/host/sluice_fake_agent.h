// A hand-written fast path agent for exercising the host's Sluice
// framework without the module: it records every callback in order and can
// be told to answer busy or fail. Header-only, shared by the sluice tests.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "host/sluice/framework.h"
#include "platform/zel.h"

namespace fakeagent {

struct FakeFilter {
  ZelSluiceFilterHandle handle = nullptr;
  std::string name;
  // Replies the "module" still waits for; destroy answers busy meanwhile,
  // as the module's reference count makes it.
  std::atomic<int> awaited{0};
};

struct FakeSlowPath {
  uint32_t id = 0;
};

struct ReplySeen {
  void* filterPriv = nullptr;
  void* cookie = nullptr;
  ZelStatus status = 0;
  std::vector<uint8_t> data;
  bool duringRequest = false;     // the request call had not returned yet
  std::thread::id thread;
};

struct Agent {
  std::mutex mu;
  std::vector<std::string> events;   // callbacks, in order
  int destroyBusy = 0;               // destroy answers busy this many times
  int unregisterBusy = 0;            // slow path unregistration likewise
  ZelStatus createStatus = ZEL_OK;
  bool puntPackets = false;          // processPackets faults the whole list
  bool issuePackets = false;         // processPackets issues the whole list
  uint32_t setSlowPathOnCreate = 0;  // made by createFilter once its priv is stored
  std::vector<std::unique_ptr<FakeFilter>> filters;
  std::vector<std::pair<uint32_t, std::vector<uint8_t>>> slowPathIoctls;
  std::vector<ReplySeen> replies;

  void Event(std::string e) {
    std::lock_guard<std::mutex> g(mu);
    events.push_back(std::move(e));
  }
  std::vector<std::string> Events() {
    std::lock_guard<std::mutex> g(mu);
    return events;
  }
  std::vector<ReplySeen> Replies() {
    std::lock_guard<std::mutex> g(mu);
    return replies;
  }
};

inline Agent* agent = nullptr;
inline thread_local bool inRequest = false;

inline void Record(void* filterPriv, void* cookie, ZelStatus status, const void* data,
                   uint64_t len) {
  ReplySeen r;
  r.filterPriv = filterPriv;
  r.cookie = cookie;
  r.status = status;
  if (len != 0) {
    auto* p = static_cast<const uint8_t*>(data);
    r.data.assign(p, p + len);
  }
  r.duringRequest = inRequest;
  r.thread = std::this_thread::get_id();
  {
    std::lock_guard<std::mutex> g(agent->mu);
    agent->replies.push_back(std::move(r));
  }
  static_cast<FakeFilter*>(filterPriv)->awaited--;
}

inline void SetSlowPathReply(void* filterPriv, void* cookie, ZelStatus status) {
  Record(filterPriv, cookie, status, nullptr, 0);
}
inline void RetrieveReply(void* filterPriv, void* cookie, const void* data, uint64_t len,
                          uint32_t status) {
  Record(filterPriv, cookie, status, data, len);
}
inline void RestoreReply(void* filterPriv, void* cookie, uint32_t status) {
  Record(filterPriv, cookie, status, nullptr, 0);
}
inline void IoctlReply(void* filterPriv, void* cbData, const void* payload, uint32_t len,
                       ZelStatus status) {
  Record(filterPriv, cbData, status, payload, len);
}

// Brackets a request call made "as the module", so replies can tell whether
// they arrived before it returned. The caller counts the reply it awaits.
template <typename Call>
ZelStatus AsModule(FakeFilter* f, Call call) {
  f->awaited++;
  inRequest = true;
  ZelStatus s = call();
  inRequest = false;
  if (s != ZEL_OK) f->awaited--;
  return s;
}

inline ZelStatus RegisterSlowPath(void* agentPriv, uint32_t id, void** spPriv) {
  auto* a = static_cast<Agent*>(agentPriv);
  a->Event("registerSlowPath #" + std::to_string(id));
  *spPriv = new FakeSlowPath{id};
  return ZEL_OK;
}

inline ZelStatus UnregisterSlowPath(void* spPriv) {
  auto* sp = static_cast<FakeSlowPath*>(spPriv);
  {
    std::lock_guard<std::mutex> g(agent->mu);
    if (agent->unregisterBusy > 0) {
      agent->unregisterBusy--;
      agent->events.push_back("unregisterSlowPath #" + std::to_string(sp->id) + " busy");
      return ZEL_BUSY;
    }
  }
  agent->Event("unregisterSlowPath #" + std::to_string(sp->id));
  delete sp;
  return ZEL_OK;
}

inline ZelStatus CreateFilter(void* agentPriv, ZelSluiceFilterHandle handle, void** priv,
                              uint8_t) {
  auto* a = static_cast<Agent*>(agentPriv);
  char name[100];
  if (ZelStatus s = zel_SluiceGetName(handle, name, sizeof name)) return s;
  a->Event(std::string("createFilter ") + name);
  if (a->createStatus != ZEL_OK) return a->createStatus;
  auto f = std::make_unique<FakeFilter>();
  f->handle = handle;
  f->name = name;
  *priv = f.get();
  FakeFilter* raw = f.get();
  {
    std::lock_guard<std::mutex> g(a->mu);
    a->filters.push_back(std::move(f));
  }
  if (a->setSlowPathOnCreate != 0) {
    ZelStatus s = AsModule(raw, [&] {
      return zel_SluiceSetSlowPath(handle, a->setSlowPathOnCreate, SetSlowPathReply, nullptr, 10);
    });
    if (s != ZEL_OK) return s;
  }
  return ZEL_OK;
}

inline ZelStatus DestroyFilter(void* priv) {
  auto* f = static_cast<FakeFilter*>(priv);
  {
    std::lock_guard<std::mutex> g(agent->mu);
    if (f->awaited > 0 || agent->destroyBusy > 0) {
      if (f->awaited == 0) agent->destroyBusy--;
      agent->events.push_back("destroyFilter " + f->name + " busy");
      return ZEL_BUSY;
    }
    agent->events.push_back("destroyFilter " + f->name);
    for (auto it = agent->filters.begin(); it != agent->filters.end(); ++it) {
      if (it->get() == f) {
        agent->filters.erase(it);
        break;
      }
    }
  }
  return ZEL_OK;
}

inline ZelStatus ProcessPackets(void* priv, ZelPktList* list, uint32_t direction) {
  auto* f = static_cast<FakeFilter*>(priv);
  if (agent->puntPackets) return zel_SluiceFaultPackets(f->handle, list, direction, 0);
  if (agent->issuePackets) return zel_SluiceIssuePackets(f->handle, list, direction);
  return ZEL_OK;
}

// Echoes every filter ioctl back through the reply channel.
inline void ProcessFilterIoctl(void* priv, uint32_t code, void* payload, uint64_t len) {
  auto* f = static_cast<FakeFilter*>(priv);
  agent->Event("filterIoctl " + f->name);
  (void)zel_SluiceSendFilterIoctlReply(f->handle, code, payload, static_cast<uint32_t>(len));
}

inline void ProcessSlowPathIoctl(void* spPriv, uint32_t, void* payload, uint64_t len) {
  auto* sp = static_cast<FakeSlowPath*>(spPriv);
  auto* p = static_cast<uint8_t*>(payload);
  std::lock_guard<std::mutex> g(agent->mu);
  agent->slowPathIoctls.emplace_back(sp->id, std::vector<uint8_t>(p, p + len));
}

inline void ConfigurationChanged(void* priv) {
  auto* f = static_cast<FakeFilter*>(priv);
  char name[100];
  if (zel_SluiceGetName(f->handle, name, sizeof name) == ZEL_OK) f->name = name;
  agent->Event("configurationChanged " + f->name);
}

inline const ZelSluiceFastPathOps kOps = {
    RegisterSlowPath, UnregisterSlowPath, CreateFilter, DestroyFilter,
    nullptr,          nullptr,            nullptr,      nullptr,
    ProcessPackets,   nullptr,            ProcessFilterIoctl, ProcessSlowPathIoctl,
    ConfigurationChanged,
};

inline ZelSluiceFastPathHandle Register(const char* name = "fake") {
  ZelSluiceFastPathHandle h = nullptr;
  ZelStatus s = zel_SluiceRegisterFastPath(name, ZEL_SLUICE_FASTPATH_VERSION,
                                           ZEL_SLUICE_FASTPATH_VERSION, 7, &kOps, agent, &h);
  return s == ZEL_OK ? h : nullptr;
}

inline FakeFilter* Priv(host::FilterId id) {
  return static_cast<FakeFilter*>(host::Sluice::FilterPriv(id));
}

}  // namespace fakeagent
