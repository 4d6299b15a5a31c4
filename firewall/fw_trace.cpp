// The read-only trace of one packet's verdict (fw_trace.h). Every decision
// is taken by the functions the walk calls, in the walk's order; what is
// added here is only bookkeeping: which step decided and where the rule
// sits.

#include "firewall/fw_trace.h"

#include "firewall/fw_packet.h"
#include "firewall/fw_rules.h"
#include "module/locks.h"

namespace {

struct FWPositionSearch {
  const FWRuleEntry* wanted;
  uint32_t index;
};

bool FWIterFindPosition(void* elem, void* arg) {
  auto* search = static_cast<FWPositionSearch*>(arg);
  if (static_cast<const FWRuleEntry*>(elem) == search->wanted) return false;
  search->index++;
  return true;
}

// Which feature dropped the packet. The check is asked again with only the
// bridge-protocol bit on a private copy of the context, so the answer comes
// from the same test the walk ran.
uint32_t FWDecidingFeature(FWFilterContext* ctx, ZelPkt* pkt, const FWPktSummary* summary,
                           uint32_t direction) {
  FWFilterContext probe = *ctx;
  probe.fwFeatures = ctx->fwFeatures & FW_FEATURE_DROP_BPDU;
  if (probe.fwFeatures != 0 &&
      FWProcessFeatures(&probe, pkt, summary, direction) == SLCGenericActionDrop) {
    return FW_FEATURE_DROP_BPDU;
  }
  return FW_FEATURE_DROP_DHCP_SERVER;
}

// The rule's position in the serialised order (configLock held).
void FWLocateRule(FWFilterContext* ctx, const FWRuleEntry* entry, bool exact, FWTrace* out) {
  uint32_t exactCount = 0;
  if (ctx->ruleHash != nullptr) {
    FWPositionSearch search = {exact ? entry : nullptr, 0};
    (void)Hash_IterateWithCheck(ctx->ruleHash, FWIterFindPosition, &search);
    if (exact) {
      out->position = search.index;
      return;
    }
    exactCount = search.index;  // nothing wanted: the walk counted every entry
  }
  uint32_t index = 0;
  for (ListLinks* l = ctx->ruleList.prev; l != &ctx->ruleList; l = l->prev, index++) {
    if (FWEntryFromLink(l) == entry) break;
  }
  out->generalIndex = index;
  out->position = exactCount + index;
}

// The rule as installed. Its counters are the only bytes concurrent walks
// write under the shared hold; they are read as plain loads, which may see
// a count a walk is about to raise, as any statistics reader does.
__attribute__((no_sanitize("thread"))) void FWCopyRule(const FWRule* from, FWRule* to) {
  constexpr size_t kCounters = offsetof(FWRule, pktCount);
  constexpr size_t kAfter = offsetof(FWRule, byteCount) + sizeof(uint64_t);
  static_assert(offsetof(FWRule, byteCount) == kCounters + sizeof(uint64_t));
  zel_Memcpy(to, from, kCounters);
  to->pktCount = from->pktCount;
  to->byteCount = from->byteCount;
  zel_Memcpy(reinterpret_cast<uint8_t*>(to) + kAfter,
             reinterpret_cast<const uint8_t*>(from) + kAfter, sizeof(FWRule) - kAfter);
}

}  // namespace

ZelStatus FWTracePacket(SLCGenericFilter* filter, ZelPkt* pkt, uint32_t direction,
                        FWTrace* out) {
  if (filter == nullptr || pkt == nullptr || out == nullptr) return ZEL_BAD_PARAM;
  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return ZEL_BAD_PARAM;

  FWTrace t;
  zel_Memset(&t, 0, sizeof(t));
  SLCGenericReadGuard hold(ctx->configLock);
  t.numRules = ctx->numRules;
  t.fragOverride = ctx->fragOverride;
  t.spAttachState = ctx->spAttachState;
  t.failurePolicy = filter->failurePolicy;

  FWPktSummary summary;
  FWParsePacket(pkt, ctx->fragOverride, &summary);
  t.presence = summary.presence;

  if (ctx->ruleHash == nullptr) {
    t.decision = FWTraceNoRuleset;
    t.action = ctx->defaultAction;
  } else if (ctx->fwFeatures != 0 &&
             FWProcessFeatures(ctx, pkt, &summary, direction) == SLCGenericActionDrop) {
    t.decision = FWTraceFeature;
    t.action = SLCGenericActionDrop;
    t.feature = FWDecidingFeature(ctx, pkt, &summary, direction);
  } else if ((summary.presence & (FW_PKT_FIRST_FRAG | FW_PKT_LATER_FRAG)) != 0 &&
             ctx->fragOverride != 0) {
    t.decision = FWTraceFragOverride;
    t.action = FWOverrideAction(ctx->fragOverride);
  } else {
    FWRuleEntry* entry = nullptr;
    if (summary.presence & FW_PKT_PORTS) {
      FWRuleTuple tuple;
      const uint64_t hash = FWPacketTuple(&summary, &tuple);
      t.exactProbed = 1;
      entry = FWFindExactRule(ctx, &tuple, hash, direction, pkt);
    }
    const bool exact = entry != nullptr;
    if (!exact && !List_IsEmpty(&ctx->ruleList)) {
      t.generalScanned = 1;
      entry = FWFindRuleForPacket(filter, pkt, direction, &summary);
    }
    if (entry == nullptr) {
      t.decision = FWTraceNoRule;
      t.action = SLCGenericActionAccept;
    } else {
      t.decision = exact ? FWTraceExactRule : FWTraceGeneralRule;
      t.exactHit = exact ? 1 : 0;
      t.action = entry->rule.action;
      t.poolTag = entry->poolTag;
      FWCopyRule(&entry->rule, &t.rule);
      FWLocateRule(ctx, entry, exact, &t);
    }
  }
  hold.Unlock();
  zel_Memcpy(out, &t, sizeof(t));
  return ZEL_OK;
}
