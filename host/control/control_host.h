// Character devices with emulated user memory, and the system-information
// (status) tree, as tools and tests drive them.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/zel.h"

namespace host {

// User memory of a calling tool. Map() gives back a user address for a copy
// of `bytes`; copies from and to user memory outside a mapping fail with
// ZEL_BAD_PARAM (and are counted), and any copy can be made to fail with
// Faults on "zel_CopyFromUser" / "zel_CopyToUser".
class UserMemory {
 public:
  static uint64_t Map(std::vector<uint8_t> bytes);
  static std::vector<uint8_t> Read(uint64_t addr, size_t len);
  static void Unmap(uint64_t addr);
  static uint64_t FailedCopies();
};

class CharDevs {
 public:
  static bool Registered(std::string_view name);
  // Opens device `name`, issues one ioctl and closes it; *result receives
  // the handler's out result. Aborts if no such device.
  static ZelStatus Ioctl(std::string_view name, uint32_t cmd, uint64_t userArg, int32_t* result);
};

// A status-tree parameter: a string or an integer.
using QryValue = std::variant<std::string, int64_t>;

class StatusTree {
 public:
  // Paths as a tool addresses them, e.g. {"agents"},
  // {"agents", "sluice-generic-quelmar", "filters"},
  // {"agents", "a", "filters", "vnic0-0", "ruleSetSummary"},
  // {"agents", "a", "filters", "vnic0-0", "rules", 2, "ruleSummary"}.
  using Path = std::vector<QryValue>;

  static bool Loaded();
  // Lists the instances under an instance-list node.
  static ZelStatus List(const Path& path, std::vector<QryValue>* out);
  // Reads a leaf into a buffer of its output type's size.
  static ZelStatus Get(const Path& path, std::vector<uint8_t>* out);
  static ZelStatus Set(const Path& path, const std::vector<QryValue>& input);
  // The leaf rendered field by field: "name: value" lines, enums shown as
  // element name and description.
  static ZelStatus Render(const Path& path, std::string* out);
  // Type lookup by id.
  static const QRY_TypeDef* Type(uint32_t id);
  // The node table as loaded.
  static std::vector<QRY_Node> Nodes();
};

// A host parameter list, for calling status-tree handlers directly (for
// instance with arguments of the wrong type).
class QryParams {
 public:
  explicit QryParams(const std::vector<QryValue>& values = {});
  ~QryParams();
  QryParams(const QryParams&) = delete;
  QryParams& operator=(const QryParams&) = delete;

  QRY_ParamList* get() { return list_; }
  std::vector<QryValue> Values() const;

 private:
  QRY_ParamList* list_;
};

}  // namespace host
