// The per-agent ruleset property "%s.ruleset": a management client writes a
// whole ruleset to one filter, reads it back, or polls its size first.
//
// The framework routes each operation to one filter and passes that
// filter's record; the handlers rely on it being live (they neither compare
// its magic nor take its lock). A write is validated without any lock and
// built before configLock is taken exclusively to swap it in; read and
// poll hold it shared,
// so a poll's size is exactly what a read at that moment produces.
#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "module/locks.h"

namespace {

inline constexpr uint32_t kPropertyNameSize = 128;

FWFilterContext* ContextOf(void* filterPriv) {
  if (filterPriv == nullptr) return nullptr;
  return FWContext(static_cast<SLCGenericFilter*>(filterPriv));
}

}  // namespace

constexpr ZelSluicePropOps rulesetPropOps = {
    SLCGenericRulesetPropWrite,
    SLCGenericRulesetPropRead,
    SLCGenericRulesetPropPoll,
    SLCGenericPropCleanup,
};

void SLCGenericFWInitProperty(SLCGenericFastPath* fastPath) {
  char name[kPropertyNameSize];
  zel_StringFormat(name, sizeof(name), "%s.ruleset", fastPath->namePtr);
  ZelStatus status = zel_SluicePropertyRegister(&fastPath->rulesetProp, name, &rulesetPropOps);
  if (status != ZEL_OK) {
    // The agent lives on without the property; cleanup sees no handle.
    fastPath->rulesetProp = nullptr;
    SLCG_LOG_OBJ(SLCG_ATTENTION, fastPath->namePtr,
                 "Failed to register fw rules property handler (%#x): %s", status,
                 zel_StatusToString(status));
    return;
  }
  SLCG_LOG_OBJ(SLCG_PROGRESS, fastPath->namePtr, "Registered fw rules property handler");
}

void SLCGenericFWCleanupProperty(SLCGenericFastPath* fastPath) {
  if (fastPath->rulesetProp == nullptr) return;
  SLCG_LOG_OBJ(SLCG_PROGRESS, fastPath->namePtr, "Unregistering ruleset property handler");
  ZelStatus status = zel_SluicePropertyUnregister(fastPath->rulesetProp);
  fastPath->rulesetProp = nullptr;
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, fastPath->namePtr,
                 "Failed to unregister ruleset property handler (%#x): %s", status,
                 zel_StatusToString(status));
  }
}

// Checks in a fixed order, the first failure ending the call: data, version,
// length, filter. The ruleset checks come before the filter check on
// purpose, so a malformed write is always reported as such.
//
// A write shorter than the 15-byte header can never be valid. Its version
// byte (when there is one) is still checked first, so a wrong version gets
// the version message whatever the length; otherwise it gets "Invalid
// ruleset" and ZEL_BAD_PARAM, without the rule count being read.
ZelStatus SLCGenericRulesetPropWrite(void* filter, void* /*ctx*/, const void* data, uint32_t len) {
  if (data == nullptr) {
    SLCG_LOG(SLCG_ATTENTION, "Invalid ruleset");
    return ZEL_BAD_PARAM;
  }
  const auto* ruleset = static_cast<const FWRulesetHeader*>(data);
  if (len >= 1 && ruleset->version != FW_RULESET_VERSION_7 &&
      ruleset->version != FW_RULESET_VERSION_8) {
    SLCG_LOG(SLCG_ATTENTION, "Invalid ruleset version. Got %d, expecting %d",
             static_cast<int>(ruleset->version), static_cast<int>(FW_RULESET_VERSION_8));
    return ZEL_NOT_SUPPORTED;
  }
  if (len < FW_RULESET_HEADER_SIZE) {
    SLCG_LOG(SLCG_ATTENTION, "Invalid ruleset");
    return ZEL_BAD_PARAM;
  }
  if (ZelStatus s = FWValidateRulesetSize(ruleset->version, ruleset->numRules, len, nullptr)) {
    return s;
  }
  FWFilterContext* ctx = ContextOf(filter);
  if (ctx == nullptr) {
    SLCG_LOG(SLCG_ATTENTION, "Filter not found: %p", filter);
    return ZEL_INVALID_STATE;
  }
  SLCG_LOG(SLCG_PROGRESS, "Got SLCGenericPropWrite of length %d", static_cast<int>(len));
  // The apply step only reads the ruleset; its signature is shared with
  // callers that own their buffer. It takes configLock itself, exclusively
  // only to swap the rules it built in.
  return FWReplaceRuleset(static_cast<SLCGenericFilter*>(filter),
                          const_cast<FWRulesetHeader*>(ruleset), 0);
}

// The framework sizes `buf` from the last poll; no size is checked here.
ZelStatus SLCGenericRulesetPropRead(void* filter, void* /*ctx*/, void* buf) {
  FWFilterContext* ctx = ContextOf(filter);
  if (ctx == nullptr || buf == nullptr) return ZEL_FAILURE;
  SLCGenericReadGuard hold(ctx->configLock);
  FWPopulateRuleset(ctx, static_cast<FWRuleset*>(buf));
  return ZEL_OK;
}

bool SLCGenericRulesetPropPoll(void* filter, void* /*ctx*/, uint32_t* size) {
  FWFilterContext* ctx = ContextOf(filter);
  if (ctx == nullptr || size == nullptr) return false;
  SLCGenericReadGuard hold(ctx->configLock);
  // The context only ever holds a version it accepted (7 or 8).
  uint64_t ruleSize = FW_RULE_SIZE_V8;
  (void)FWGetRuleSize(ctx->version, &ruleSize);
  *size = ctx->numRules * static_cast<uint32_t>(ruleSize) + FW_RULESET_HEADER_SIZE;
  return true;
}

void SLCGenericPropCleanup() {}
