// The per-agent character device: a user-level tool names one filter of the
// agent (by filter name, or by VM UUID and vNIC index) and sets its ruleset,
// reads it back, or sends it a test request over the filter ioctl channel.
//
// The request and everything behind it in user memory is hostile: it is
// read only through zel_CopyFromUser, its strings are cut to their fields,
// and sizes computed from its counts are checked before they are used.
//
// Locks: the lookups take the agent's lock, then a filter's lock inside it,
// and raise the filter's refCount, which keeps the record alive (destroy
// answers busy) once both are released. configLock is taken only after
// that, with neither held. The reference is dropped under the filter's lock
// on every path that took it.
#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "module/locks.h"

namespace {

constexpr ZelCharDevOps kFWCharDevOps = {
    FWCharDevNoOp,   // open
    FWCharDevNoOp,   // close
    FWCharDevIoctl,  // ioctl
    nullptr,         // read
    nullptr,         // write
    nullptr,         // poll
};

// The agent name for messages; empty for a record that is not an agent.
const char* AgentName(SLCGenericFastPath* fastPath) {
  if (fastPath == nullptr || !SLCGenericMagicIs(fastPath, kSLCGenericFastPathMagic)) return "";
  return fastPath->namePtr;
}

bool FastPathMagicOk(SLCGenericFastPath* fastPath) {
  if (fastPath != nullptr && SLCGenericMagicIs(fastPath, kSLCGenericFastPathMagic)) return true;
  SLCG_LOG(SLCG_ATTENTION, "Bad magic for fwFastPath");
  return false;
}

// The filter's lock keeps the reference count consistent with destroy.
void DropReference(SLCGenericFilter* filter) {
  SLCGenericSpinGuard hold(filter->lock);
  --filter->refCount;
}

// Test request: the filter's name with its NUL goes to the slow path; the
// answer arrives later in FWCharDevIoctlReplyCbk.
ZelStatus SendTestRequest(SLCGenericFastPath* fastPath, SLCGenericFilter* filter,
                          uint64_t userArg) {
  char payload[sizeof(filter->name) + 1];
  uint32_t len;
  {
    // A copy taken under the lock is complete even if the name is not
    // terminated within its field.
    SLCGenericSpinGuard hold(filter->lock);
    len = static_cast<uint32_t>(zel_Strnlen(filter->name, sizeof(filter->name)));
    zel_Memcpy(payload, filter->name, len);
  }
  payload[len] = '\0';
  ZelStatus status =
      zel_SluiceSendFilterIoctlRequest(filter->handle, payload, len + 1, FWCharDevIoctlReplyCbk,
                                       fastPath, static_cast<uint32_t>(userArg));
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Sending ioctl request failed: %s",
                 zel_StatusToString(status));
  }
  return status;
}

// Reads a ruleset from user memory after the request and installs it as an
// ioctl ruleset (replacing the rules in force). The tool sends 281 bytes per
// rule whatever the version; only what the header's version needs is used.
ZelStatus SetRuleset(SLCGenericFastPath* fastPath, SLCGenericFilter* filter, uint64_t userArg) {
  const uint64_t rulesetAddr = userArg + sizeof(FWCharDevRequest);
  FWRulesetHeader header;
  if (ZelStatus s = zel_CopyFromUser(&header, rulesetAddr, sizeof(header))) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, AgentName(fastPath), "Failed to copy user data (%#x): %s", s,
                 zel_StatusToString(s));
    return s;
  }
  const uint32_t numRules = header.numRules;
  const uint64_t size = FW_RULESET_HEADER_SIZE + static_cast<uint64_t>(numRules) * FW_RULE_SIZE_V8;
  SLCGenericHeapBlock ruleset(size);
  if (!ruleset) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, AgentName(fastPath),
                 "Failed to allocate ruleset in reading from character device");
    return ZEL_FAILURE;
  }
  if (ZelStatus s = zel_CopyFromUser(ruleset.bytes(), rulesetAddr, size)) return s;
  // The tool may have changed its header between the two copies; the buffer
  // is sized for the count read first, so that count is what gets applied.
  auto* copy = reinterpret_cast<FWRulesetHeader*>(ruleset.bytes());
  copy->numRules = numRules;
  return FWSetIoctlRuleset(filter, copy, 1);
}

// Writes the ruleset in force over the caller's request: 15 + 281 bytes per
// rule held.
ZelStatus GetRuleset(SLCGenericFilter* filter, uint64_t userArg) {
  FWFilterContext* ctx = FWContext(filter);
  SLCGenericReadGuard hold(ctx->configLock);
  const uint64_t size =
      FW_RULESET_HEADER_SIZE + static_cast<uint64_t>(ctx->numRules) * FW_RULE_SIZE_V8;
  SLCGenericHeapBlock ruleset(size);
  if (!ruleset) return ZEL_FAILURE;
  FWPopulateRuleset(ctx, reinterpret_cast<FWRuleset*>(ruleset.bytes()));
  hold.Unlock();
  return zel_CopyToUser(userArg, ruleset.bytes(), size);
}

}  // namespace

ZelStatus FWCharDevNoOp(ZelCharDevFile* /*file*/) { return ZEL_OK; }

ZelStatus SLCGenericFWInitCharDev(SLCGenericFastPath* fastPath) {
  ZelStatus status = zel_CharDevRegister(slcGenericModuleID, fastPath->namePtr, &kFWCharDevOps, 0,
                                         fastPath, &fastPath->charDev);
  if (status != ZEL_OK) {
    fastPath->charDev = nullptr;
    SLCG_LOG_OBJ(SLCG_ATTENTION, fastPath->namePtr,
                 "Failed to register fw character device (%#x): %s", status,
                 zel_StatusToString(status));
    return status;
  }
  SLCG_LOG_OBJ(SLCG_PROGRESS, fastPath->namePtr, "Registered fw character device");
  return ZEL_OK;
}

void SLCGenericFWCleanupCharDev(SLCGenericFastPath* fastPath) {
  if (fastPath->charDev == nullptr) return;
  SLCG_LOG_OBJ(SLCG_PROGRESS, fastPath->namePtr, "Unregistering character device");
  ZelStatus status = zel_CharDevUnregister(fastPath->charDev);
  if (status != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, fastPath->namePtr,
                 "Failed to unregister character device (%#x): %s", status,
                 zel_StatusToString(status));
  }
  fastPath->charDev = nullptr;
}

SLCGenericFilter* FWCharDevLookupFilterByName(SLCGenericFastPath* fastPath, const char* name) {
  if (!FastPathMagicOk(fastPath)) return nullptr;
  SLCGenericSpinGuard agentHold(fastPath->lock);
  for (ListLinks* l = fastPath->filters.next; l != &fastPath->filters; l = l->next) {
    SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
    if (filter->agentPriv == nullptr) continue;
    SLCGenericSpinGuard filterHold(filter->lock);
    if (zel_Strncmp(filter->name, name, sizeof(filter->name)) == 0) {
      ++filter->refCount;
      return filter;
    }
  }
  return nullptr;
}

SLCGenericFilter* FWCharDevLookupFilterByUUID(SLCGenericFastPath* fastPath, const char* uuid,
                                              uint32_t vnicIndex) {
  if (!FastPathMagicOk(fastPath)) return nullptr;
  SLCGenericSpinGuard agentHold(fastPath->lock);
  for (ListLinks* l = fastPath->filters.next; l != &fastPath->filters; l = l->next) {
    SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
    if (filter->agentPriv == nullptr) continue;
    SLCGenericSpinGuard filterHold(filter->lock);
    if (filter->endPointType == 0 && filter->vnicIndex == vnicIndex &&
        zel_Strncmp(filter->vmUUID, uuid, sizeof(filter->vmUUID)) == 0) {
      ++filter->refCount;
      return filter;
    }
  }
  return nullptr;
}

ZelStatus FWCharDevIoctl(ZelCharDevFile* file, uint32_t cmd, uint64_t userArg,
                         uint32_t /*callerSize*/, int32_t* result) {
  SLCGenericHeapBlock block(sizeof(FWCharDevRequest));
  if (!block) return ZEL_NO_MEMORY;
  auto* fastPath = static_cast<SLCGenericFastPath*>(file != nullptr ? file->devPriv : nullptr);
  const char* agentName = AgentName(fastPath);
  SLCG_LOG_OBJ(SLCG_PROGRESS, agentName, "FWCharDevIoctl called");
  if (result != nullptr) *result = 0;

  if (cmd != 0) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, agentName, "Non-zero cmd %d", static_cast<int>(cmd));
    return ZEL_BAD_PARAM;
  }
  auto* req = reinterpret_cast<FWCharDevRequest*>(block.bytes());
  if (ZelStatus s = zel_CopyFromUser(req, userArg, sizeof(*req))) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, agentName, "Failed to copy user data (%#x): %s", s,
                 zel_StatusToString(s));
    return s;
  }
  req->filterName[sizeof(req->filterName) - 1] = '\0';
  req->hqUUID[sizeof(req->hqUUID) - 1] = '\0';

  SLCGenericFilter* filter = nullptr;
  if (req->filterName[0] != '\0') {
    filter = FWCharDevLookupFilterByName(fastPath, req->filterName);
  } else if (req->hqUUID[0] != '\0') {
    filter = FWCharDevLookupFilterByUUID(fastPath, req->hqUUID, req->vNicIndex);
  }
  if (filter == nullptr) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, agentName,
                 "Filter lookup failed (name: '%s', hqUUID: '%s',vNicIndex: %d)", req->filterName,
                 req->hqUUID, static_cast<int>(req->vNicIndex));
    return ZEL_NOT_FOUND;
  }

  ZelStatus status = ZEL_OK;
  switch (req->type) {
    case FWCharDevReqSendIoctl:
      status = SendTestRequest(fastPath, filter, userArg);
      break;
    case FWCharDevReqSetRuleset:
      status = SetRuleset(fastPath, filter, userArg);
      break;
    case FWCharDevReqGetRuleset:
      status = GetRuleset(filter, userArg);
      break;
    default:
      break;  // nothing to do
  }
  DropReference(filter);
  return status;
}

// Runs on the framework's context with no lock held; takes none.
void FWCharDevIoctlReplyCbk(void* /*filterPriv*/, void* cbData, const void* payload, uint32_t len,
                            ZelStatus status) {
  const char* agentName = AgentName(static_cast<SLCGenericFastPath*>(cbData));
  int shown = len > INT32_MAX ? INT32_MAX : static_cast<int>(len);
  if (payload == nullptr) shown = 0;
  SLCG_LOG_OBJ(SLCG_PROGRESS, agentName, "Received ioctl reply '%.*s': %s", shown,
               payload != nullptr ? static_cast<const char*>(payload) : "",
               zel_StatusToString(status));
}
