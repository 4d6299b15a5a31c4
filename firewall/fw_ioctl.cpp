// The module's side of the filter ioctl channel: echo, ruleset push, clear
// (all rules, or single rules removed or their counters reset) and the
// state query.
//
// Every request is hostile input. A message is read only within its
// payload length:
//  - shorter than 4 bytes, or of an unknown type: ignored, no reply;
//  - a push shorter than its 23-byte header, or a clear too short for its
//    method (8 bytes) or, for methods other than "all", for its ruleset
//    header (23 bytes): refused with a failure status reply, so the slow
//    path is told rather than left waiting;
//  - a clear whose version has no rule size, or whose payload holds fewer
//    than numRules records: refused with a failure status reply before any
//    rule is read or changed (all or nothing).
//
// Locks: a clear holds the filter's configLock exclusively; a push builds
// its rules first (an adding one with configLock held shared) and holds it
// exclusively only to swap them in; the state query holds it shared while
// it copies; every reply is sent after the lock is released.
#include "firewall/fw_ioctl.h"
#include "firewall/fw_index.h"

#include "module/locks.h"

namespace {

uint32_t ReadU32(const uint8_t* p) {
  uint32_t v;
  zel_Memcpy(&v, p, sizeof(v));
  return v;
}

void SendStatusReply(SLCGenericFilter* filter, uint32_t requestCode, uint32_t status) {
  FWIoctlStatusMsg reply{FWIoctlMsgStatus, status};
  ZelStatus sent = zel_SluiceSendFilterIoctlReply(filter->handle, requestCode, &reply, sizeof(reply));
  if (sent != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Return status on IoctlReply was: %d",
                 static_cast<int>(sent));
  }
}

// Echo: upper-cases the text in place (at most 64 characters, up to its NUL,
// never past the payload) and sends the whole payload back. Request code 0
// asks for no answer.
void HandleEcho(SLCGenericFilter* filter, uint32_t requestCode, uint8_t* msg, uint64_t len) {
  if (requestCode == 0) return;
  // The reply length is 32 bits; a longer payload cannot be echoed whole.
  if (len > UINT32_MAX) return;
  uint64_t end = sizeof(FWIoctlMsgHeader) + FW_IOCTL_ECHO_MAX_CHARS;
  if (end > len) end = len;
  for (uint64_t i = sizeof(FWIoctlMsgHeader); i < end && msg[i] != '\0'; ++i) {
    if (msg[i] >= 'a' && msg[i] <= 'z') msg[i] = static_cast<uint8_t>(msg[i] - 'a' + 'A');
  }
  ZelStatus sent =
      zel_SluiceSendFilterIoctlReply(filter->handle, requestCode, msg, static_cast<uint32_t>(len));
  if (sent != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Return status on IoctlReply was: %d",
                 static_cast<int>(sent));
  }
}

void HandlePush(SLCGenericFilter* filter, uint32_t requestCode, uint8_t* msg, uint64_t len) {
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name,
               "Received Firewall ruleset via Sluice IOCTL, payloadSize: %lu", len);
  if (len < FW_IOCTL_RULES_OFFSET) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Truncated firewall ioctl message of type %u, payloadSize: %lu",
                 FWIoctlMsgRuleset, len);
    SendStatusReply(filter, requestCode, FWIoctlStatusFailure);
    return;
  }
  auto* push = reinterpret_cast<FWIoctlRulesetMsg*>(msg);
  const uint32_t version = push->ruleset.version;
  const uint32_t numRules = push->ruleset.numRules;
  if (FWValidateRulesetSize(version, numRules, len - offsetof(FWIoctlRulesetMsg, ruleset),
                            filter->name) != ZEL_OK) {
    SendStatusReply(filter, requestCode, FWIoctlStatusFailure);
    return;
  }
  ZelStatus status = FWSetIoctlRuleset(filter, &push->ruleset, push->replace);
  SendStatusReply(filter, requestCode,
                  status == ZEL_OK ? FWIoctlStatusSuccess : FWIoctlStatusFailure);
}

bool MacsEqual(const uint8_t* a, const uint8_t* b) { return zel_Memcmp(a, b, 6) == 0; }

// The general rule that a clear request's rule R names: wildcard bits 0-9
// equal, and every field that R does not wildcard equal. Ranges, masks,
// negations, direction and action are not compared. Addresses are compared
// only when both rules are of the same family.
bool GeneralRuleNamedBy(const FWRule& entry, const FWRule& r) {
  const uint32_t wc = r.ruleFlags & FW_WC_ALL;
  if ((entry.ruleFlags & FW_WC_ALL) != wc) return false;
  if (!(wc & FW_WC_DMAC) && !MacsEqual(entry.dMac, r.dMac)) return false;
  if (!(wc & FW_WC_SMAC) && !MacsEqual(entry.sMac, r.sMac)) return false;
  if (!(wc & FW_WC_ETHTYPE) && zel_Memcmp(entry.ethType, r.ethType, 2) != 0) return false;
  if (!(wc & FW_WC_VLAN) && zel_Memcmp(entry.vlan1QTag, r.vlan1QTag, 4) != 0) return false;
  const bool entryV4 = (entry.ruleFlags & FW_FLAG_IPV4) != 0;
  const bool rV4 = (r.ruleFlags & FW_FLAG_IPV4) != 0;
  if (entryV4 == rV4) {
    const size_t addrLen = rV4 ? 4 : 16;
    if (!(wc & FW_WC_IPSA) && zel_Memcmp(entry.ipSa, r.ipSa, addrLen) != 0) return false;
    if (!(wc & FW_WC_IPDA) && zel_Memcmp(entry.ipDa, r.ipDa, addrLen) != 0) return false;
  }
  if (!(wc & FW_WC_IPPROTO) && entry.ipProto != r.ipProto) return false;
  if (!(wc & FW_WC_SPORT) && zel_Memcmp(entry.sPort, r.sPort, 2) != 0) return false;
  if (!(wc & FW_WC_DPORT) && zel_Memcmp(entry.dPort, r.dPort, 2) != 0) return false;
  return true;
}

// configLock held exclusively.
FWRuleEntry* FindGeneralRule(FWFilterContext* ctx, const FWRule& r) {
  // The list is kept newest at the front; its back is the first rule in
  // ruleset order.
  for (ListLinks* l = ctx->ruleList.prev; l != &ctx->ruleList; l = l->prev) {
    auto* entry = reinterpret_cast<FWRuleEntry*>(l);
    if (GeneralRuleNamedBy(entry->rule, r)) return entry;
  }
  return nullptr;
}

// configLock held exclusively; ctx->ruleHash is not null. The same probe as
// the packet path's exact stage, without its direction and pool-tag checks.
FWRuleEntry* FindExactRule(FWFilterContext* ctx, const FWRule& r) {
  FWRuleTuple tuple;
  const uint64_t hash = FWCreateTupleFromRule(&r, &tuple);
  Hash_Table* table = ctx->ruleHash;
  ListLinks* bucket = &table->buckets[static_cast<uint32_t>(hash) & (table->numBuckets - 1)];
  for (ListLinks* l = bucket->prev; l != bucket; l = l->prev) {
    auto* entry = reinterpret_cast<FWRuleEntry*>(l);
    if (FWRuleCompare(entry, &tuple) == 0) return entry;
  }
  return nullptr;
}

// The installed entry a clear request's rule names, or null.
//
// A rule with no wildcard among bits 0-8 names an exact rule and is looked
// up in the hash table. A rule that has range or MAC-mask bits but no
// wildcard is installed in the general list, where a hash probe can never
// find it; for such a rule the general list is searched as well, so that
// every rule the slow path installed can be removed or reset.
FWRuleEntry* FindRuleToClear(FWFilterContext* ctx, const FWRule& r) {
  if ((r.ruleFlags & FW_WC_FIELDS) != 0) return FindGeneralRule(ctx, r);
  FWRuleEntry* entry = FindExactRule(ctx, r);
  if (entry == nullptr && (r.ruleFlags & FW_GENERAL_RULE_MASK) != 0) {
    entry = FindGeneralRule(ctx, r);
  }
  return entry;
}

// Acts on single rules. configLock held exclusively. Returns the status to
// reply with.
uint32_t ClearSingleRules(SLCGenericFilter* filter, FWFilterContext* ctx, const uint8_t* msg,
                          uint64_t len, uint32_t method) {
  const auto* clear = reinterpret_cast<const FWIoctlRulesetMsg*>(msg);
  const uint32_t version = clear->ruleset.version;
  const uint32_t numRules = clear->ruleset.numRules;
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Received request to clear %u firewall rules",
               numRules);
  if (ctx->ruleHash == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Asked to clear firewall rules, when none are in effect.");
    return FWIoctlStatusSuccess;
  }
  uint64_t ruleSize = 0;
  if (FWGetRuleSize(version, &ruleSize) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to get rule size for version %u", version);
    return FWIoctlStatusFailure;
  }
  const uint64_t needed = FW_IOCTL_RULES_OFFSET + static_cast<uint64_t>(numRules) * ruleSize;
  if (len < needed) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Invalid ruleset length for version %u(ruleSize = %u). Got %lu, expecting %lu",
                 version, static_cast<uint32_t>(ruleSize),
                 len - offsetof(FWIoctlRulesetMsg, ruleset),
                 needed - offsetof(FWIoctlRulesetMsg, ruleset));
    return FWIoctlStatusFailure;
  }
  for (uint32_t i = 0; i < numRules; ++i) {
    // A version-7 record leaves the version-8 fields zero; bit 9 is kept as
    // the request carries it.
    FWRule r;
    zel_Memset(&r, 0, sizeof(r));
    zel_Memcpy(&r, msg + FW_IOCTL_RULES_OFFSET + i * ruleSize, ruleSize);
    FWRuleEntry* entry = FindRuleToClear(ctx, r);
    if (entry == nullptr) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Asked to remove %snon-existent rule, ignoring.",
                   method == FWClearMethodStats ? "stats for " : "");
      continue;
    }
    if (method == FWClearMethodRemove) {
      // numRules is deliberately not lowered: it counts what was installed.
      // A general entry leaves the scan index first (no allocation).
      FWScanIndexForget(ctx->scanIndex, entry);
      List_Remove(&entry->link);
      FWRuleEntryFree(entry);
      ctx->generation++;
    } else if (method == FWClearMethodStats) {
      entry->rule.pktCount = 0;
      entry->rule.byteCount = 0;
    } else {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Unexpected clear method");
    }
  }
  return FWIoctlStatusSuccess;
}

void HandleClear(SLCGenericFilter* filter, FWFilterContext* ctx, uint32_t requestCode,
                 const uint8_t* msg, uint64_t len) {
  if (len < FW_IOCTL_CLEAR_METHOD_END) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Truncated firewall ioctl message of type %u, payloadSize: %lu", FWIoctlMsgClear,
                 len);
    SendStatusReply(filter, requestCode, FWIoctlStatusFailure);
    return;
  }
  const uint32_t method = ReadU32(msg + offsetof(FWIoctlRulesetMsg, replace));
  if (method != FWClearMethodAll && len < FW_IOCTL_RULES_OFFSET) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                 "Truncated firewall ioctl message of type %u, payloadSize: %lu", FWIoctlMsgClear,
                 len);
    SendStatusReply(filter, requestCode, FWIoctlStatusFailure);
    return;
  }
  uint32_t status = FWIoctlStatusSuccess;
  FWFilterContext former;
  bool cleared = false;
  {
    SLCGenericWriteGuard hold(ctx->configLock);
    if (method == FWClearMethodAll) {
      SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Received request to clear all firewall state");
      // The rules are released after the hold: packets wait only for the
      // swap, not for every entry, socket and pool tag to go.
      FWTakeRules(ctx, &former);
      cleared = true;
    } else {
      status = ClearSingleRules(filter, ctx, msg, len, method);
    }
  }
  if (cleared) FWClearRules(&former);
  SendStatusReply(filter, requestCode, status);
}

void HandleGetState(SLCGenericFilter* filter, FWFilterContext* ctx, uint32_t requestCode) {
  uint32_t written = 0;
  SLCGenericReadGuard hold(ctx->configLock);
  // Room for the filter's rules at the version-8 size, whatever its version.
  SLCGenericHeapBlock reply(FW_IOCTL_RULES_OFFSET +
                            static_cast<uint64_t>(ctx->numRules) * FW_RULE_SIZE_V8);
  if (!reply) {
    hold.Unlock();
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Failed allocating msg to get firewall state");
    return;
  }
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Received request to get firewall state");
  auto* msg = reinterpret_cast<FWIoctlRulesetMsg*>(reply.bytes());
  msg->type = FWIoctlMsgRuleset;
  msg->replace = 0;
  FWPopulateRuleset(ctx, &msg->ruleset);
  written = msg->ruleset.numRules;
  hold.Unlock();

  const uint64_t len = FW_IOCTL_RULES_OFFSET + static_cast<uint64_t>(written) * FW_RULE_SIZE_V8;
  if (zel_SluiceSendFilterIoctlReply(filter->handle, requestCode, reply.bytes(),
                                     static_cast<uint32_t>(len)) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Error sending rules to slowpath");
  }
}

}  // namespace

ZelStatus FWValidateRulesetSize(uint32_t version, uint32_t numRules, uint64_t len,
                                const char* object) {
  uint64_t ruleSize = 0;
  if (FWGetRuleSize(version, &ruleSize) != ZEL_OK) {
    if (object != nullptr) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, object, "Failed to get rule size for version %u", version);
    } else {
      SLCG_LOG(SLCG_ATTENTION, "Failed to get rule size for version %u", version);
    }
    return ZEL_BAD_PARAM;
  }
  const uint64_t expected = static_cast<uint64_t>(numRules) * ruleSize + FW_RULESET_HEADER_SIZE;
  if (len == expected) return ZEL_OK;
  if (object != nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, object,
                 "Invalid ruleset length for version %u(ruleSize = %u). Got %lu, expecting %lu",
                 version, static_cast<uint32_t>(ruleSize), len, expected);
  } else {
    SLCG_LOG(SLCG_ATTENTION,
             "Invalid ruleset length for version %u(ruleSize = %u). Got %lu, expecting %lu",
             version, static_cast<uint32_t>(ruleSize), len, expected);
  }
  return ZEL_BAD_PARAM;
}

ZelStatus FWSetIoctlRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, uint32_t replace) {
  // Both are built before the exclusive hold, so the packet path keeps
  // flowing meanwhile: a replacement with no lock, an addition, which reads
  // the rules in force, with configLock held shared.
  if (replace != 0) return FWReplaceRuleset(filter, ruleset, 1);
  return FWAddRuleset(filter, ruleset, 1);
}

void FWFilterIoctlRequest(SLCGenericFilter* filter, uint32_t requestCode, void* payload,
                          uint64_t payloadLen) {
  FWFilterContext* ctx = FWContext(filter);
  // A filter without a firewall context has nothing to answer with.
  if (ctx == nullptr || payload == nullptr || payloadLen < sizeof(FWIoctlMsgHeader)) return;
  auto* msg = static_cast<uint8_t*>(payload);
  switch (ReadU32(msg)) {
    case FWIoctlMsgEcho:
      HandleEcho(filter, requestCode, msg, payloadLen);
      break;
    case FWIoctlMsgRuleset:
      HandlePush(filter, requestCode, msg, payloadLen);
      break;
    case FWIoctlMsgClear:
      HandleClear(filter, ctx, requestCode, msg, payloadLen);
      break;
    case FWIoctlMsgGetState:
      HandleGetState(filter, ctx, requestCode);
      break;
    default:
      break;  // not a request: no reply
  }
}
