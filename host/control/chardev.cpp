// Character devices and the emulated user memory of the tools that call
// them.
//
// User addresses are fake numbers in a non-canonical range, so that a
// module that dereferences one instead of copying through zel_CopyFromUser /
// zel_CopyToUser faults at once. Each mapping is followed by an unmapped
// gap: a copy must lie inside one mapping.
#include <algorithm>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>

#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct ZelCharDev {
  ZelModuleID module = -1;
  std::string name;
  const ZelCharDevOps* ops = nullptr;
  uint32_t flags = 0;
  void* devPriv = nullptr;
};

namespace host {

namespace {

constexpr uint64_t kUserBase = 0x5a5a000000000000ull;
constexpr uint64_t kUserPage = 4096;

struct State {
  std::mutex mu;
  std::map<uint64_t, std::vector<uint8_t>> mappings;   // by start address
  uint64_t nextAddr = kUserBase;
  uint64_t failedCopies = 0;
  std::vector<std::unique_ptr<ZelCharDev>> devices;     // registered
  std::vector<std::unique_ptr<ZelCharDev>> deadDevices; // kept so stale handles stay unique
};

State& S() {
  static State state;
  return state;
}

// The mapping holding [addr, addr + len), or null. mu held.
std::vector<uint8_t>* MappingLocked(uint64_t addr, size_t len, uint64_t* offset) {
  auto it = S().mappings.upper_bound(addr);
  if (it == S().mappings.begin()) return nullptr;
  --it;
  uint64_t off = addr - it->first;
  uint64_t size = it->second.size();
  if (off > size || len > size - off) return nullptr;
  *offset = off;
  return &it->second;
}

ZelCharDev* DeviceLocked(std::string_view name) {
  for (auto& d : S().devices) {
    if (d->name == name) return d.get();
  }
  return nullptr;
}

void ResetControl() {
  std::lock_guard<std::mutex> g(S().mu);
  S().mappings.clear();
  S().nextAddr = kUserBase;
  S().failedCopies = 0;
  S().devices.clear();
  S().deadDevices.clear();
}

void ControlLeftovers(std::vector<std::string>* out) {
  std::lock_guard<std::mutex> g(S().mu);
  for (auto& d : S().devices) {
    out->push_back("chardev: device '" + d->name + "' still registered");
  }
}

[[maybe_unused]] const bool registered =
    RegisterSubsystem({"chardev", &ResetControl, &ControlLeftovers});

}  // namespace

uint64_t UserMemory::Map(std::vector<uint8_t> bytes) {
  std::lock_guard<std::mutex> g(S().mu);
  uint64_t addr = S().nextAddr;
  uint64_t pages = (bytes.size() + kUserPage - 1) / kUserPage;
  S().nextAddr += (pages + 1) * kUserPage;
  S().mappings.emplace(addr, std::move(bytes));
  return addr;
}

std::vector<uint8_t> UserMemory::Read(uint64_t addr, size_t len) {
  std::lock_guard<std::mutex> g(S().mu);
  uint64_t off = 0;
  std::vector<uint8_t>* m = MappingLocked(addr, len, &off);
  if (m == nullptr) {
    Fatal("UserMemory::Read: %zu bytes at %#llx are not inside one mapping", len,
          static_cast<unsigned long long>(addr));
  }
  return std::vector<uint8_t>(m->begin() + off, m->begin() + off + len);
}

void UserMemory::Unmap(uint64_t addr) {
  std::lock_guard<std::mutex> g(S().mu);
  if (S().mappings.erase(addr) == 0) {
    Fatal("UserMemory::Unmap: %#llx is not the start of a mapping",
          static_cast<unsigned long long>(addr));
  }
}

uint64_t UserMemory::FailedCopies() {
  std::lock_guard<std::mutex> g(S().mu);
  return S().failedCopies;
}

bool CharDevs::Registered(std::string_view name) {
  std::lock_guard<std::mutex> g(S().mu);
  return DeviceLocked(name) != nullptr;
}

ZelStatus CharDevs::Ioctl(std::string_view name, uint32_t cmd, uint64_t userArg,
                          int32_t* result) {
  ZelCharDevFile file{};
  const ZelCharDevOps* ops;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelCharDev* d = DeviceLocked(name);
    if (d == nullptr) {
      Fatal("CharDevs::Ioctl: no device named '%.*s' is registered",
            static_cast<int>(name.size()), name.data());
    }
    ops = d->ops;
    file.devPriv = d->devPriv;
  }
  if (ops->open != nullptr) {
    if (ZelStatus s = ops->open(&file)) return s;
  }
  int32_t out = 0;
  ZelStatus s = ops->ioctl != nullptr ? ops->ioctl(&file, cmd, userArg, 0, &out)
                                      : ZEL_NOT_SUPPORTED;
  if (result != nullptr) *result = out;
  if (ops->close != nullptr) {
    // A failed close does not change what the ioctl answered.
    (void)ops->close(&file);
  }
  return s;
}

}  // namespace host

using namespace host;

ZelStatus zel_CharDevRegister(ZelModuleID module, const char* name, const ZelCharDevOps* ops,
                              uint32_t flags, void* devPriv, ZelCharDevHandle* handle) {
  if (ZelStatus s = Faults::Check("zel_CharDevRegister")) return s;
  if (name == nullptr || name[0] == '\0' || ops == nullptr || handle == nullptr) {
    return ZEL_BAD_PARAM;
  }
  std::lock_guard<std::mutex> g(S().mu);
  if (DeviceLocked(name) != nullptr) return ZEL_FAILURE;
  auto d = std::make_unique<ZelCharDev>();
  d->module = module;
  d->name = name;
  d->ops = ops;
  d->flags = flags;
  d->devPriv = devPriv;
  *handle = d.get();
  S().devices.push_back(std::move(d));
  return ZEL_OK;
}

ZelStatus zel_CharDevUnregister(ZelCharDevHandle handle) {
  if (ZelStatus s = Faults::Check("zel_CharDevUnregister")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  auto& devs = S().devices;
  auto it = std::find_if(devs.begin(), devs.end(), [&](auto& d) { return d.get() == handle; });
  if (it == devs.end()) return ZEL_NOT_FOUND;
  S().deadDevices.push_back(std::move(*it));
  devs.erase(it);
  return ZEL_OK;
}

ZelStatus zel_CopyFromUser(void* dst, uint64_t userAddr, size_t len) {
  if (ZelStatus s = Faults::Check("zel_CopyFromUser")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  uint64_t off = 0;
  std::vector<uint8_t>* m = MappingLocked(userAddr, len, &off);
  if (m == nullptr || (dst == nullptr && len != 0)) {
    S().failedCopies++;
    return ZEL_BAD_PARAM;
  }
  if (len != 0) std::memcpy(dst, m->data() + off, len);
  return ZEL_OK;
}

ZelStatus zel_CopyToUser(uint64_t userAddr, const void* src, size_t len) {
  if (ZelStatus s = Faults::Check("zel_CopyToUser")) return s;
  std::lock_guard<std::mutex> g(S().mu);
  uint64_t off = 0;
  std::vector<uint8_t>* m = MappingLocked(userAddr, len, &off);
  if (m == nullptr || (src == nullptr && len != 0)) {
    S().failedCopies++;
    return ZEL_BAD_PARAM;
  }
  if (len != 0) std::memcpy(m->data() + off, src, len);
  return ZEL_OK;
}
