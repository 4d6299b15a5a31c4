// Agent properties: the module registers a named handler table; a
// management client writes, polls and reads it for one filter at a time,
// and the framework passes that filter's private pointer to the handler.
#include <algorithm>
#include <cstring>

#include "host/core/faults.h"
#include "host/sluice/sluice_internal.h"

namespace host::sluice {

namespace {

// The framework's own context argument: handlers must not use it, but it is
// never null.
char propertyContext;

// Bytes past the polled size that a read must leave alone.
constexpr size_t kReadGuard = 64;
constexpr uint8_t kReadPattern = 0xa5;
// A poll answer above this is treated as a broken size.
constexpr uint32_t kMaxPropertySize = 256u << 20;

ZelSluiceProperty* PropertyOrDieLocked(std::string_view name, const char* call) {
  for (auto& p : S().properties) {
    if (p->name == name) return p.get();
  }
  Fatal("Sluice::%s: no property named '%.*s' is registered", call,
        static_cast<int>(name.size()), name.data());
}

struct Route {
  const ZelSluicePropOps* ops;
  void* filterPriv;
};

Route RouteTo(std::string_view name, FilterId id, const char* call) {
  std::lock_guard<std::mutex> g(S().mu);
  const ZelSluicePropOps* ops = PropertyOrDieLocked(name, call)->ops;
  return Route{ops, LiveFilterByIdLocked(id, call)->priv};
}

}  // namespace

void ResetPropertiesLocked() {
  S().properties.clear();
  S().deadProperties.clear();
}

void PropertyLeftoversLocked(std::vector<std::string>* out) {
  for (auto& p : S().properties) {
    out->push_back("sluice: property '" + p->name + "' still registered");
  }
}

}  // namespace host::sluice

using namespace host;
using namespace host::sluice;

ZelStatus zel_SluicePropertyRegister(ZelSluicePropHandle* handle, const char* name,
                                     const ZelSluicePropOps* ops) {
  if (ZelStatus s = Faults::Check("zel_SluicePropertyRegister")) return s;
  if (handle == nullptr || name == nullptr || name[0] == '\0' || ops == nullptr) {
    return ZEL_BAD_PARAM;
  }
  std::lock_guard<std::mutex> g(S().mu);
  for (auto& p : S().properties) {
    if (p->name == name) return ZEL_FAILURE;
  }
  auto p = std::make_unique<ZelSluiceProperty>();
  p->name = name;
  p->ops = ops;
  *handle = p.get();
  S().properties.push_back(std::move(p));
  return ZEL_OK;
}

ZelStatus zel_SluicePropertyUnregister(ZelSluicePropHandle handle) {
  if (ZelStatus s = Faults::Check("zel_SluicePropertyUnregister")) return s;
  void (*cleanup)() = nullptr;
  {
    std::lock_guard<std::mutex> g(S().mu);
    auto& props = S().properties;
    auto it = std::find_if(props.begin(), props.end(), [&](auto& p) { return p.get() == handle; });
    if (it == props.end()) return ZEL_NOT_FOUND;
    cleanup = (*it)->ops->cleanup;
    S().deadProperties.push_back(std::move(*it));
    props.erase(it);
  }
  // The property is gone; the module's cleanup hook runs once, unlocked.
  if (cleanup != nullptr) cleanup();
  return ZEL_OK;
}

namespace host {

bool Sluice::PropertyRegistered(std::string_view name) {
  std::lock_guard<std::mutex> g(S().mu);
  return std::any_of(S().properties.begin(), S().properties.end(),
                     [&](auto& p) { return p->name == name; });
}

const ZelSluicePropOps* Sluice::PropertyOps(std::string_view name) {
  std::lock_guard<std::mutex> g(S().mu);
  for (auto& p : S().properties) {
    if (p->name == name) return p->ops;
  }
  return nullptr;
}

ZelStatus Sluice::PropertyWrite(std::string_view name, FilterId id,
                                std::span<const uint8_t> data) {
  Route r = RouteTo(name, id, "PropertyWrite");
  if (r.ops->write == nullptr) return ZEL_NOT_SUPPORTED;
  // An exactly sized copy, so that a read past the written bytes is caught.
  std::unique_ptr<uint8_t[]> copy(new uint8_t[data.size()]);
  std::copy(data.begin(), data.end(), copy.get());
  return r.ops->write(r.filterPriv, &propertyContext, copy.get(),
                      static_cast<uint32_t>(data.size()));
}

bool Sluice::PropertyPoll(std::string_view name, FilterId id, uint32_t* size) {
  Route r = RouteTo(name, id, "PropertyPoll");
  if (r.ops->poll == nullptr) return false;
  uint32_t polled = 0;
  bool ok = r.ops->poll(r.filterPriv, &propertyContext, &polled);
  if (ok && size != nullptr) *size = polled;
  return ok;
}

bool Sluice::PropertyRead(std::string_view name, FilterId id, std::vector<uint8_t>* out,
                          ZelStatus* status) {
  Route r = RouteTo(name, id, "PropertyRead");
  uint32_t size = 0;
  if (r.ops->poll == nullptr || !r.ops->poll(r.filterPriv, &propertyContext, &size)) {
    return false;
  }
  if (size > kMaxPropertySize) {
    Fatal("Sluice::PropertyRead: property '%.*s' polled an implausible size of %u bytes",
          static_cast<int>(name.size()), name.data(), size);
  }
  if (r.ops->read == nullptr) {
    if (status != nullptr) *status = ZEL_NOT_SUPPORTED;
    return true;
  }
  std::vector<uint8_t> buf(size + kReadGuard, kReadPattern);
  ZelStatus s = r.ops->read(r.filterPriv, &propertyContext, buf.data());
  for (size_t i = size; i < buf.size(); i++) {
    if (buf[i] != kReadPattern) {
      Fatal("Sluice::PropertyRead: property '%.*s' wrote past the %u bytes its poll reported "
            "(byte %zu changed)",
            static_cast<int>(name.size()), name.data(), size, i);
    }
  }
  buf.resize(size);
  if (out != nullptr) *out = std::move(buf);
  if (status != nullptr) *status = s;
  return true;
}

}  // namespace host
