// Ruleset format helpers: record sizes per version, record addressing and
// the version-7 wildcard adjustment.
//
// A version-7 record is the first 259 bytes of the version-8 layout. It has
// no rpTag, so inside the module every version-7 rule carries ruleFlags bit
// 9 (rpTag wildcard); the bit is cleared again when the rule is written out
// so that a record reads back exactly as it was sent.

#include "firewall/firewall.h"

ZelStatus FWGetRuleSize(uint32_t version, uint64_t* size) {
  switch (version) {
    case FW_RULESET_VERSION_7:
      *size = FW_RULE_SIZE_V7;
      return ZEL_OK;
    case FW_RULESET_VERSION_8:
      *size = FW_RULE_SIZE_V8;
      return ZEL_OK;
    default:
      return ZEL_BAD_PARAM;
  }
}

uint8_t* FWGetRuleFromRuleset(uint32_t version, FWRuleset* ruleset, uint32_t index,
                              uint64_t* size) {
  uint64_t recordSize = 0;
  if (FWGetRuleSize(version, &recordSize) != ZEL_OK) return nullptr;
  *size = recordSize;
  // 64-bit arithmetic: index * 281 does not wrap for any u32 index.
  return FWRulesetRules(ruleset) + static_cast<uint64_t>(index) * recordSize;
}

void FWUpdateWildcardsToCurrent(uint32_t version, FWRule* rule) {
  if (version <= FW_RULESET_VERSION_7) rule->ruleFlags |= FW_WC_RPTAG;
}

void FWRevertWildcardsToOriginal(uint32_t version, FWRule* rule) {
  if (version <= FW_RULESET_VERSION_7) rule->ruleFlags &= ~FW_WC_RPTAG;
}
