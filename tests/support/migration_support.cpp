#include "tests/support/migration_support.h"

#include <cstring>

#include "module/locks.h"

namespace migsupport {

std::string ExactRule(const char* action, const char* proto, const char* sa, int sport,
                      const char* da, int dport, const char* extra) {
  return std::string("action=") + action + " dir=to ipv4 dmac=" + kGwMac + " smac=" + kVmMac +
         " ethtype=0x0800 vlan=none proto=" + proto + " sa=" + sa + " da=" + da +
         " sport=" + std::to_string(sport) + " dport=" + std::to_string(dport) + " " + extra;
}

std::vector<Bytes> Records(const Bytes& ruleset) {
  std::vector<Bytes> out;
  if (ruleset.size() < FW_RULESET_HEADER_SIZE) return out;
  const size_t size = ruleset[0] == FW_RULESET_VERSION_7 ? FW_RULE_SIZE_V7 : FW_RULE_SIZE_V8;
  for (size_t at = FW_RULESET_HEADER_SIZE; at + size <= ruleset.size(); at += size) {
    out.emplace_back(ruleset.begin() + at, ruleset.begin() + at + size);
  }
  return out;
}

uint64_t GetU64(const Bytes& b, size_t at) {
  uint64_t v = 0;
  std::memcpy(&v, b.data() + at, sizeof(v));
  return v;
}

void PutU64(Bytes* b, size_t at, uint64_t v) { std::memcpy(b->data() + at, &v, sizeof(v)); }

uint32_t GetU32(const Bytes& b, size_t at) {
  uint32_t v = 0;
  std::memcpy(&v, b.data() + at, sizeof(v));
  return v;
}

Bytes SavedState(const Bytes& fast, const Bytes& slow) {
  Bytes out(sizeof(SLCGenericStateHeader));
  std::memcpy(out.data(), kSLCGenericSaveMagic, 8);
  PutU64(&out, kVersionAt, kSLCGenericStateVersion);
  PutU64(&out, kFastOffsetAt, 48);
  PutU64(&out, kFastLengthAt, fast.size());
  PutU64(&out, kSlowOffsetAt, 48 + fast.size());
  PutU64(&out, kSlowLengthAt, slow.size());
  out.insert(out.end(), fast.begin(), fast.end());
  out.insert(out.end(), slow.begin(), slow.end());
  return out;
}

ZelStatus Install(SLCGenericFilter* filter, const Bytes& ruleset, uint32_t replace) {
  Bytes copy = ruleset;  // the apply step takes a mutable pointer
  SLCGenericWriteGuard config(FWContext(filter)->configLock);
  return FWApplyRuleset(filter, reinterpret_cast<FWRuleset*>(copy.data()), replace, 0);
}

Bytes Rules(SLCGenericFilter* filter) {
  FWFilterContext* ctx = FWContext(filter);
  SLCGenericReadGuard config(ctx->configLock);
  Bytes out(FW_RULESET_HEADER_SIZE + size_t{FW_RULE_SIZE_V8} * ctx->numRules);
  FWPopulateRuleset(ctx, reinterpret_cast<FWRuleset*>(out.data()));
  const size_t size = ctx->version == FW_RULESET_VERSION_7 ? FW_RULE_SIZE_V7 : FW_RULE_SIZE_V8;
  out.resize(FW_RULESET_HEADER_SIZE + size * ctx->numRules);
  return out;
}

SaveResult Save(SLCGenericFilter* filter) {
  SaveResult r;
  uint64_t len = 0;
  r.lenStatus = SLCGenericGetSavedStateLen(filter, &len);
  if (r.lenStatus != ZEL_OK) return r;
  r.bytes.assign(len, 0xA5);
  uint64_t size = len;
  r.saveStatus = SLCGenericSaveState(filter, r.bytes.data(), &size);
  if (r.saveStatus == ZEL_OK) r.bytes.resize(size);
  return r;
}

uint32_t RefCount(SLCGenericFilter* filter) {
  SLCGenericSpinGuard guard(filter->lock);
  return filter->refCount;
}

uint32_t MigrationState(SLCGenericFilter* filter) {
  SLCGenericSpinGuard guard(filter->lock);
  return filter->migrationState;
}

}  // namespace migsupport
