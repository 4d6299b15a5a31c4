// The filter ioctl protocol between a user-level slow path and a firewall
// filter: message layouts and the size check shared with the ruleset
// property.
//
// Every message is packed and little-endian and starts with a u32 type.
// Requests come in through FWFilterIoctlRequest (firewall/firewall.h); the
// module answers with zel_SluiceSendFilterIoctlReply, echoing the request
// code unchanged.
#pragma once

#include "firewall/firewall.h"

inline constexpr uint32_t FWIoctlMsgEcho = 1;
inline constexpr uint32_t FWIoctlMsgRuleset = 2;     // push, and the reply to GetState
inline constexpr uint32_t FWIoctlMsgStatus = 3;      // reply to Ruleset and Clear
inline constexpr uint32_t FWIoctlMsgClear = 4;
inline constexpr uint32_t FWIoctlMsgGetState = 6;

inline constexpr uint32_t FWClearMethodAll = 0;
inline constexpr uint32_t FWClearMethodStats = 1;
inline constexpr uint32_t FWClearMethodRemove = 2;

inline constexpr uint32_t FWIoctlStatusSuccess = 1;
inline constexpr uint32_t FWIoctlStatusFailure = 0;

// Longest text an echo upper-cases.
inline constexpr uint32_t FW_IOCTL_ECHO_MAX_CHARS = 64;

#pragma pack(push, 1)

struct FWIoctlMsgHeader {
  uint32_t type;
};

// Ruleset push, and the state reply. A Clear has the same layout with
// `method` in place of `replace`.
struct FWIoctlRulesetMsg {
  uint32_t type;
  uint32_t replace;            // Clear: method
  FWRulesetHeader ruleset;     // the rules follow at byte 23
};

struct FWIoctlStatusMsg {
  uint32_t type;
  uint32_t status;
};

#pragma pack(pop)

static_assert(sizeof(FWIoctlMsgHeader) == 4);
static_assert(sizeof(FWIoctlRulesetMsg) == 23);
static_assert(offsetof(FWIoctlRulesetMsg, replace) == 4);
static_assert(offsetof(FWIoctlRulesetMsg, ruleset) == 8);
static_assert(offsetof(FWIoctlRulesetMsg, ruleset) + offsetof(FWRulesetHeader, numRules) == 11);
static_assert(sizeof(FWIoctlStatusMsg) == 8);

// Offset of the rules in a Ruleset or Clear message.
inline constexpr uint32_t FW_IOCTL_RULES_OFFSET = sizeof(FWIoctlRulesetMsg);
// Bytes a Clear needs before its method can be read.
inline constexpr uint32_t FW_IOCTL_CLEAR_METHOD_END = 8;

// Checks that `len` bytes hold exactly a ruleset of `version` with
// `numRules` records: 15 + numRules * ruleSize, in 64 bits. Logs (urgency 2,
// naming `object` when it is not null) and returns the reason on failure:
//  - ZEL_BAD_PARAM, "Failed to get rule size for version %u", for a version
//    other than 7 or 8;
//  - ZEL_BAD_PARAM, "Invalid ruleset length for version %u(ruleSize = %u).
//    Got %lu, expecting %lu", for any other length.
// Reads nothing but its arguments.
[[nodiscard]] ZelStatus FWValidateRulesetSize(uint32_t version, uint32_t numRules, uint64_t len,
                                              const char* object);

// A zero-filled block from the module heap, freed when it goes out of scope.
// Sizes above 4 GiB - 1 are refused like any failed allocation, so callers
// can compute sizes from hostile counts in 64 bits and test for null once.
// Always inlined, so the heap records each block under the line that made it.
class [[nodiscard]] SLCGenericHeapBlock {
 public:
  [[gnu::always_inline]] explicit SLCGenericHeapBlock(uint64_t size)
      : block_(size <= UINT32_MAX ? SLCGenericAlloc(static_cast<uint32_t>(size)) : nullptr) {}
  ~SLCGenericHeapBlock() {
    if (block_ != nullptr) SLCGenericFree(block_);
  }
  SLCGenericHeapBlock(const SLCGenericHeapBlock&) = delete;
  SLCGenericHeapBlock& operator=(const SLCGenericHeapBlock&) = delete;

  explicit operator bool() const { return block_ != nullptr; }
  uint8_t* bytes() const { return static_cast<uint8_t*>(block_); }

 private:
  void* block_;
};
