// Helpers for the migration tests: exact rules in the ruleset builder's
// text, saved-state buffers and their header fields, and the module-side steps a
// test repeats (installing rules, reading them back, a whole save).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "firewall/firewall.h"
#include "migration/migration.h"

namespace migsupport {

using Bytes = std::vector<uint8_t>;

inline constexpr const char* kVmMac = "02:00:00:00:00:01";
inline constexpr const char* kGwMac = "02:00:00:00:00:02";

// The text of an exact IPv4 rule (ruleset builder syntax) for traffic that
// leaves the VM (direction 2): kVmMac to kGwMac, untagged, every field given.
// `extra` adds tokens ("bidir", "pkts=5").
std::string ExactRule(const char* action, const char* proto, const char* sa, int sport,
                      const char* da, int dport, const char* extra = "");

// The rule records of a wire ruleset, each of its version's size.
std::vector<Bytes> Records(const Bytes& ruleset);

// Header field offsets in the saved-state buffer.
inline constexpr size_t kMagicAt = 0;
inline constexpr size_t kVersionAt = 8;
inline constexpr size_t kFastOffsetAt = 16;
inline constexpr size_t kFastLengthAt = 24;
inline constexpr size_t kSlowOffsetAt = 32;
inline constexpr size_t kSlowLengthAt = 40;

uint64_t GetU64(const Bytes& b, size_t at);
void PutU64(Bytes* b, size_t at, uint64_t v);
uint32_t GetU32(const Bytes& b, size_t at);

// A well-formed saved state: header, `fast`, then `slow`, no gaps.
Bytes SavedState(const Bytes& fast, const Bytes& slow = {});

// Installs `ruleset` as a property write would (not from ioctl), replacing
// or adding to the rules in force, holding configLock for writing.
ZelStatus Install(SLCGenericFilter* filter, const Bytes& ruleset, uint32_t replace = 1);
// The filter's ruleset as FWPopulateRuleset writes it, exactly
// 15 + numRules * size(version) bytes.
Bytes Rules(SLCGenericFilter* filter);

// Length request, then a save into a buffer of exactly that size.
struct SaveResult {
  ZelStatus lenStatus = ZEL_OK;
  ZelStatus saveStatus = ZEL_OK;
  Bytes bytes;
};
SaveResult Save(SLCGenericFilter* filter);

// Locked reads of the filter's (L) fields.
uint32_t RefCount(SLCGenericFilter* filter);
uint32_t MigrationState(SLCGenericFilter* filter);

}  // namespace migsupport
