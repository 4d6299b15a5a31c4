// The module loader and the module services (zel_Module*).
//
// One module at a time. Load applies parameter overrides, makes the module
// current and runs its init; Unload runs its cleanup. The parameter values
// seen at load are put back at unload (and after a failed init), so an
// override given to one load does not leak into the next one as it would
// not with a freshly loaded image.

#include <cstring>
#include <mutex>
#include <utility>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

namespace host {

namespace {

struct LoaderState {
  std::mutex mu;
  const ZelModuleImage* image = nullptr;   // loaded (or being loaded) module
  ZelModuleID currentId = -1;              // its identifier while set
  ZelModuleID nextId = 1;
  std::string pinnedName;                  // SetLoadName, until Reset
  std::string activeName;                  // name of the loaded module
  ZelHeapID defaultHeap = nullptr;         // zel_ModuleSetHeapID
  std::vector<std::pair<int32_t*, int32_t>> savedParams;
};

// Never destroyed: module code may call in from static destructors.
LoaderState& S() {
  static LoaderState* s = new LoaderState;
  return *s;
}

// Runs after cleanup or a failed init: whatever the module created and
// still exists is a leak; its parameters get their load-time values back.
void Forget(ZelModuleID id) {
  core::ReportTimersOf(id);
  core::ReportClientPortsOf(id);
  core::ReportLocksOf(id);
  core::ReportLogsOf(id);
  core::ReportHeapsOf(id);
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  for (auto& [where, value] : s.savedParams) *where = value;
  s.savedParams.clear();
  s.image = nullptr;
  s.currentId = -1;
  s.activeName.clear();
  s.defaultHeap = nullptr;
}

}  // namespace

namespace core {

ZelModuleID OwningModule() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  return s.currentId;
}

void ResetLoader() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  s.pinnedName.clear();
}

}  // namespace core

int Loader::Load(const ZelModuleImage* image, const std::map<std::string, int32_t>& params) {
  if (image == nullptr || image->init == nullptr) Fatal("Loader::Load: no image or no init");
  LoaderState& s = S();
  ZelModuleID id;
  {
    std::lock_guard<std::mutex> g(s.mu);
    if (s.image != nullptr) {
      Fatal("Loader::Load(%s): module %s is already loaded", image->name, s.image->name);
    }
    for (const auto& [name, value] : params) {
      bool found = false;
      for (uint32_t i = 0; i < image->numParams; i++) {
        if (name == image->params[i].name) found = true;
      }
      if (!found) Fatal("Loader::Load(%s): no parameter named %s", image->name, name.c_str());
    }
    s.savedParams.clear();
    for (uint32_t i = 0; i < image->numParams; i++) {
      const ZelModuleParam& p = image->params[i];
      if (p.value == nullptr) Fatal("Loader::Load(%s): parameter %s has no value", image->name, p.name);
      s.savedParams.emplace_back(p.value, *p.value);
      auto it = params.find(p.name);
      if (it != params.end()) *p.value = it->second;
    }
    s.image = image;
    id = s.currentId = s.nextId++;
    s.activeName = s.pinnedName.empty() ? std::string(image->name ? image->name : "") : s.pinnedName;
  }
  int result = image->init();
  // A module whose init failed is not loaded and gets no cleanup call; it
  // must have undone everything itself.
  if (result != 0) Forget(id);
  return result;
}

void Loader::Unload() {
  LoaderState& s = S();
  const ZelModuleImage* image;
  ZelModuleID id;
  {
    std::lock_guard<std::mutex> g(s.mu);
    if (s.image == nullptr) Fatal("Loader::Unload: no module is loaded");
    image = s.image;
    id = s.currentId;
  }
  if (image->cleanup != nullptr) image->cleanup();
  Forget(id);
}

bool Loader::Loaded() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  return s.image != nullptr;
}

const ZelModuleImage* Loader::Current() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  return s.image;
}

ZelModuleID Loader::CurrentID() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  return s.image != nullptr ? s.currentId : s.nextId;
}

void Loader::PinNextID(ZelModuleID id) {
  if (id <= 0) Fatal("Loader::PinNextID: module identifiers are positive, not %d", id);
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  s.nextId = id;
}

void Loader::SetLoadName(std::string name) {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  s.pinnedName = std::move(name);
}

ZelHeapID Loader::DefaultHeap() {
  LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  return s.defaultHeap;
}

}  // namespace host

using host::S;

// Module code run outside the loader (a test calling the module's start-up
// directly) sees the identifier and name the next load would give it.
ZelModuleID zel_ModuleCurrentID() { return host::Loader::CurrentID(); }

ZelStatus zel_ModuleGetName(ZelModuleID id, char* buf, size_t len) {
  if (ZelStatus st = host::Faults::Check("zel_ModuleGetName")) return st;
  if (buf == nullptr || len == 0) return ZEL_BAD_PARAM;
  host::LoaderState& s = S();
  std::string name;
  {
    std::lock_guard<std::mutex> g(s.mu);
    ZelModuleID current = s.image != nullptr ? s.currentId : s.nextId;
    if (id != current) return ZEL_NOT_FOUND;
    if (s.image != nullptr) {
      name = s.activeName;
    } else {
      name = s.pinnedName.empty() ? "unnamed-module" : s.pinnedName;
    }
  }
  size_t n = std::min(name.size(), len - 1);
  std::memcpy(buf, name.data(), n);
  buf[n] = '\0';
  return ZEL_OK;
}

ZelStatus zel_ModuleSetHeapID(ZelModuleID id, ZelHeapID heap) {
  if (ZelStatus st = host::Faults::Check("zel_ModuleSetHeapID")) return st;
  if (!host::Heaps::Exists(heap)) return ZEL_BAD_PARAM;
  host::LoaderState& s = S();
  std::lock_guard<std::mutex> g(s.mu);
  ZelModuleID current = s.image != nullptr ? s.currentId : s.nextId;
  if (id != current) return ZEL_NOT_FOUND;
  s.defaultHeap = heap;
  return ZEL_OK;
}
