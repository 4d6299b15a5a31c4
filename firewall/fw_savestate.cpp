// The firewall agent's part of a filter's saved state: its ruleset in the
// wire format, sized for version-8 records whatever the version in force.
//
// All three operations are called with the filter's lock held (rank 3) and
// take the context's configLock (rank 4) inside.
#include "firewall/firewall.h"
#include "module/locks.h"

uint32_t FWGetSavedStateLen(SLCGenericFilter* filter) {
  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return 0;
  SLCGenericReadGuard config(ctx->configLock);
  // Unsigned 32 bits, as the saved-state format defines it; FWSaveState
  // never writes more than it is given, so a wrapped value only truncates.
  return FW_RULESET_HEADER_SIZE + FW_RULE_SIZE_V8 * ctx->numRules;
}

// Writes the ruleset in force into `room` bytes at `dst`.
//
// The caller sized `room` with FWGetSavedStateLen under an earlier hold of
// configLock; rules applied since may have made the ruleset longer. The
// whole ruleset is written only when it fits. Otherwise it is built in a
// scratch block and only the records that fit are kept, with the header's
// count lowered to match, so the part still reads back as a well-formed
// ruleset and nothing is written past `room`. If even that is impossible
// (no scratch memory, or a room smaller than the header) the part is left
// as the caller prepared it (zeroed), which the destination refuses as an
// invalid version rather than installing a partial set silently.
void FWSaveState(SLCGenericFilter* filter, void* dst, uint32_t room) {
  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr || dst == nullptr) return;

  SLCGenericReadGuard config(ctx->configLock);
  uint64_t ruleSize = FW_RULE_SIZE_V8;  // kept if the version were ever not 7 or 8
  (void)FWGetRuleSize(ctx->version, &ruleSize);
  const uint64_t need = FW_RULESET_HEADER_SIZE + ruleSize * ctx->numRules;
  if (need <= room) {
    FWPopulateRuleset(ctx, static_cast<FWRuleset*>(dst));
    return;
  }

  const uint32_t total = ctx->numRules;
  void* scratch = (room >= FW_RULESET_HEADER_SIZE && need <= UINT32_MAX)
                      ? SLCGenericAlloc(static_cast<uint32_t>(need))
                      : nullptr;
  if (scratch == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Ruleset of %u rules does not fit the saved state (%u bytes); not saved", total,
                 room);
    return;
  }
  auto* ruleset = static_cast<FWRuleset*>(scratch);
  FWPopulateRuleset(ctx, ruleset);
  const uint32_t kept = static_cast<uint32_t>((room - FW_RULESET_HEADER_SIZE) / ruleSize);
  ruleset->numRules = kept;
  zel_Memcpy(dst, scratch, FW_RULESET_HEADER_SIZE + kept * ruleSize);
  SLCGenericFree(scratch);
  SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
               "Ruleset grew while saving; saved %u of %u rules", kept, total);
}

ZelStatus FWRestoreState(SLCGenericFilter* filter, const void* src, uint64_t len) {
  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return ZEL_INVALID_STATE;

  // The part is hostile: its header's version and count must not make the
  // apply step read past `len`. Trailing bytes are expected (the part is
  // sized for version-8 records, so a version-7 ruleset leaves a zero tail).
  if (src == nullptr || len < FW_RULESET_HEADER_SIZE) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Saved ruleset too short (%lu bytes)",
                 static_cast<unsigned long>(len));
    return ZEL_BAD_PARAM;
  }
  FWRulesetHeader header;
  zel_Memcpy(&header, src, sizeof(header));
  uint64_t ruleSize;
  if (FWGetRuleSize(header.version, &ruleSize) == ZEL_OK) {
    // At most 15 + 2^32 * 281: no overflow in 64 bits.
    const uint64_t need = FW_RULESET_HEADER_SIZE + ruleSize * header.numRules;
    if (need > len) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                   "Saved ruleset runs past its part (version %u, %u rules, %lu bytes)",
                   static_cast<unsigned>(header.version), header.numRules,
                   static_cast<unsigned long>(len));
      return ZEL_BAD_PARAM;
    }
  }
  // Any other version is refused by the apply step from the header alone.

  // The apply step only reads the ruleset, and takes configLock itself.
  return FWReplaceRuleset(filter, const_cast<FWRuleset*>(static_cast<const FWRuleset*>(src)), 0);
}
