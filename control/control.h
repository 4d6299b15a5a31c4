// Control channels and introspection: the per-agent ruleset property, the
// per-agent character device and the status tree.
#pragma once

#include "agent/agent.h"
#include "firewall/fw_types.h"

// --- Ruleset property "%s.ruleset" -------------------------------------------

extern const ZelSluicePropOps rulesetPropOps;

void SLCGenericFWInitProperty(SLCGenericFastPath* fastPath);
void SLCGenericFWCleanupProperty(SLCGenericFastPath* fastPath);
[[nodiscard]] ZelStatus SLCGenericRulesetPropWrite(void* filter, void* ctx, const void* data,
                                                   uint32_t len);
[[nodiscard]] ZelStatus SLCGenericRulesetPropRead(void* filter, void* ctx, void* buf);
bool SLCGenericRulesetPropPoll(void* filter, void* ctx, uint32_t* size);
void SLCGenericPropCleanup();

// --- Character device ----------------------------------------------------------

inline constexpr uint32_t FWCharDevReqSendIoctl = 2;
inline constexpr uint32_t FWCharDevReqSetRuleset = 4;
inline constexpr uint32_t FWCharDevReqGetRuleset = 8;

#pragma pack(push, 1)
struct FWCharDevRequest {
  uint32_t type;
  uint8_t reserved0[8];
  char filterName[100];
  char hqUUID[128];
  uint32_t vNicIndex;
  uint8_t reserved1[4];
};
#pragma pack(pop)
static_assert(sizeof(FWCharDevRequest) == 248);
static_assert(offsetof(FWCharDevRequest, filterName) == 12);
static_assert(offsetof(FWCharDevRequest, hqUUID) == 112);
static_assert(offsetof(FWCharDevRequest, vNicIndex) == 240);

[[nodiscard]] ZelStatus SLCGenericFWInitCharDev(SLCGenericFastPath* fastPath);
void SLCGenericFWCleanupCharDev(SLCGenericFastPath* fastPath);

// The device's operations (file->devPriv is the agent's SLCGenericFastPath).
[[nodiscard]] ZelStatus FWCharDevNoOp(ZelCharDevFile* file);
// Reads a FWCharDevRequest at userArg, finds the filter it names (holding a
// use reference on it for the length of the call) and sets, gets or tests
// it. *result is set to 0 unless the request buffer cannot be allocated.
[[nodiscard]] ZelStatus FWCharDevIoctl(ZelCharDevFile* file, uint32_t cmd, uint64_t userArg,
                                       uint32_t callerSize, int32_t* result);
// Reply callback of the test request; cbData is the agent's fast-path part.
void FWCharDevIoctlReplyCbk(void* filterPriv, void* cbData, const void* payload, uint32_t len,
                            ZelStatus status);
// Lookups: the first listed filter (with a context) that matches, with its
// refCount raised under its lock; null when none or when fastPath's magic
// is wrong. The caller drops the reference under the filter's lock.
SLCGenericFilter* FWCharDevLookupFilterByName(SLCGenericFastPath* fastPath, const char* name);
SLCGenericFilter* FWCharDevLookupFilterByUUID(SLCGenericFastPath* fastPath, const char* uuid,
                                              uint32_t vnicIndex);

// --- Status tree ---------------------------------------------------------------

extern const QRY_ModuleTables slcGenericQryTables;

// The exported tables the system-information facility reads.
extern const QRY_Node qryNodesLookupTab[];
extern const QRY_Handlers qryHandlers[];
extern const uint32_t qryMaxNodes;
extern const QRY_TypeDef qryTypeDefsLookupTab[];
extern const uint32_t qryMaxTypeDefs;
extern const int32_t qryOverlayModuleNodeID;

// Node numbers, in table order.
inline constexpr uint32_t SLCGenericQryNodeRoot = 0;
inline constexpr uint32_t SLCGenericQryNodeAgents = 1;
inline constexpr uint32_t SLCGenericQryNodeCreateAgent = 2;
inline constexpr uint32_t SLCGenericQryNodeFilters = 3;
inline constexpr uint32_t SLCGenericQryNodeRuleSetSummary = 4;
inline constexpr uint32_t SLCGenericQryNodeRules = 5;
inline constexpr uint32_t SLCGenericQryNodeRuleSummary = 6;

// The module's type ids.
inline constexpr uint32_t SLCGenericQryTypeRuleSetSummary = QRY_TYPE_MODULE_BASE + 0;
inline constexpr uint32_t SLCGenericQryTypeRuleSummary = QRY_TYPE_MODULE_BASE + 1;
inline constexpr uint32_t SLCGenericQryTypeActionEnum = QRY_TYPE_MODULE_BASE + 2;
inline constexpr uint32_t SLCGenericQryTypeDirectionEnum = QRY_TYPE_MODULE_BASE + 3;

// A filter's instance name: "%s-%d" (name, position in the agent's list),
// cut to 102 characters.
inline constexpr uint32_t SLCGENERIC_QRY_INSTANCE_NAME_SIZE = 103;
// Agent names are compared over this many characters.
inline constexpr uint32_t SLCGENERIC_QRY_AGENT_NAME_CMP = 100;

#pragma pack(push, 1)

struct SLCGeneric_RuleSetSummary {
  uint8_t version;
  uint8_t highestSupportedVersion;
  uint8_t lowestSupportedVersion;
  uint32_t numRules;
  uint32_t defaultAction;     // SLCGenericActionEnum
  uint32_t fragOverride;      // SLCGenericActionEnum
  char fwFeatures[1024];
  uint8_t ioctl;
};

struct SLCGeneric_RuleSummary {
  char wildcardsEnabled[1024];
  char rangesEnabled[1024];
  char dMac[64];
  char sMac[64];
  char ethType[64];
  char vlan1QTag[64];
  char ipSa[1024];
  char ipDa[1024];
  char ipProto[64];
  char sPort[64];
  char dPort[64];
  char bidirectional[64];
  uint32_t direction;         // SLCGenericDirectionEnum, widened
  uint32_t action;            // SLCGenericActionEnum
  char greIP[64];
  char rewriteMac[64];
  char resourcePool[128];
  char rpTag[64];
  char ethDot1PTag[64];
  char dscpTag[64];
  char pktCount[64];
  char byteCount[64];
};

#pragma pack(pop)

static_assert(sizeof(SLCGeneric_RuleSetSummary) == 1040);
static_assert(offsetof(SLCGeneric_RuleSetSummary, numRules) == 3);
static_assert(offsetof(SLCGeneric_RuleSetSummary, defaultAction) == 7);
static_assert(offsetof(SLCGeneric_RuleSetSummary, fragOverride) == 11);
static_assert(offsetof(SLCGeneric_RuleSetSummary, fwFeatures) == 15);
static_assert(offsetof(SLCGeneric_RuleSetSummary, ioctl) == 1039);

static_assert(sizeof(SLCGeneric_RuleSummary) == 5192);
static_assert(offsetof(SLCGeneric_RuleSummary, rangesEnabled) == 1024);
static_assert(offsetof(SLCGeneric_RuleSummary, dMac) == 2048);
static_assert(offsetof(SLCGeneric_RuleSummary, sMac) == 2112);
static_assert(offsetof(SLCGeneric_RuleSummary, ethType) == 2176);
static_assert(offsetof(SLCGeneric_RuleSummary, vlan1QTag) == 2240);
static_assert(offsetof(SLCGeneric_RuleSummary, ipSa) == 2304);
static_assert(offsetof(SLCGeneric_RuleSummary, ipDa) == 3328);
static_assert(offsetof(SLCGeneric_RuleSummary, ipProto) == 4352);
static_assert(offsetof(SLCGeneric_RuleSummary, sPort) == 4416);
static_assert(offsetof(SLCGeneric_RuleSummary, dPort) == 4480);
static_assert(offsetof(SLCGeneric_RuleSummary, bidirectional) == 4544);
static_assert(offsetof(SLCGeneric_RuleSummary, direction) == 4608);
static_assert(offsetof(SLCGeneric_RuleSummary, action) == 4612);
static_assert(offsetof(SLCGeneric_RuleSummary, greIP) == 4616);
static_assert(offsetof(SLCGeneric_RuleSummary, rewriteMac) == 4680);
static_assert(offsetof(SLCGeneric_RuleSummary, resourcePool) == 4744);
static_assert(offsetof(SLCGeneric_RuleSummary, rpTag) == 4872);
static_assert(offsetof(SLCGeneric_RuleSummary, ethDot1PTag) == 4936);
static_assert(offsetof(SLCGeneric_RuleSummary, dscpTag) == 5000);
static_assert(offsetof(SLCGeneric_RuleSummary, pktCount) == 5064);
static_assert(offsetof(SLCGeneric_RuleSummary, byteCount) == 5128);

// Handlers. The node id is ignored by all of them; none logs anything, and
// every one returns with no lock held.
[[nodiscard]] ZelStatus SLCGenericQryListAgents(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                                QRY_ParamList* out);
[[nodiscard]] ZelStatus SLCGenericQryCreateAgent(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                                 QRY_ParamList* input);
[[nodiscard]] ZelStatus SLCGenericQryListFilters(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                                 QRY_ParamList* out);
[[nodiscard]] ZelStatus SLCGenericQryRuleSetSummaryGet(uint32_t nodeId,
                                                       QRY_ParamList* instanceArgs, void* out);
[[nodiscard]] ZelStatus SLCGenericQryListRules(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                               QRY_ParamList* out);
[[nodiscard]] ZelStatus SLCGenericQryRuleSummaryGet(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                                    void* out);

// Resolves instance argument 0 to an agent and, when `filter` is not null,
// instance argument 1 to one of its filters. On success returns with the
// agent's lock held and, when a filter was asked for, the filter's lock held
// too; the caller adopts them with SLCGenericQryLocks. On failure
// (ZEL_BAD_PARAM_TYPE for an argument that is not a string, ZEL_NOT_FOUND)
// holds no lock.
[[nodiscard]] ZelStatus SLCGenericQryPreprocess(QRY_ParamList* instanceArgs,
                                                SLCGenericAgent** agent,
                                                SLCGenericFilter** filter);

// The agent lock and, optionally, a filter lock of a status-tree handler,
// released filter first when the holder goes out of scope.
class [[nodiscard]] SLCGenericQryLocks {
 public:
  SLCGenericQryLocks() = default;
  // Adopts the locks a successful SLCGenericQryPreprocess returned with.
  SLCGenericQryLocks(SLCGenericAgent* agent, SLCGenericFilter* filter)
      : agent_(agent), filter_(filter) {}
  ~SLCGenericQryLocks() {
    UnlockFilter();
    if (agent_ != nullptr) zel_SpinlockUnlock(agent_->fastPath.lock);
  }
  SLCGenericQryLocks(const SLCGenericQryLocks&) = delete;
  SLCGenericQryLocks& operator=(const SLCGenericQryLocks&) = delete;

  void LockAgent(SLCGenericAgent* agent) {
    zel_SpinlockLock(agent->fastPath.lock);
    agent_ = agent;
  }
  // Agent lock held.
  void LockFilter(SLCGenericFilter* filter) {
    zel_SpinlockLock(filter->lock);
    filter_ = filter;
  }
  void UnlockFilter() {
    if (filter_ != nullptr) zel_SpinlockUnlock(filter_->lock);
    filter_ = nullptr;
  }
  // Leaves the locks held and forgets them (handing them to the caller).
  void Release() {
    agent_ = nullptr;
    filter_ = nullptr;
  }

 private:
  SLCGenericAgent* agent_ = nullptr;
  SLCGenericFilter* filter_ = nullptr;
};
