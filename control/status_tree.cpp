// The module's status tree: agents, their filters, each filter's ruleset
// summary and rules, and agent creation.
//
//   root
//   |- createAgent                       set: create an agent from its text
//   `- agents/<agent name>
//      `- filters/<name>-<position>
//         |- rules/<position>/ruleSummary   (rule_summary.cpp)
//         `- ruleSetSummary
//
// Handlers resolve the path's instance names under the agent's lock and
// then the filter's (the module's lock order), release them filter first on
// every path, and log nothing.
//
// agentList has no lock. Agents are only appended while the module runs,
// each published by a release store of the link that reaches it, so the
// walks here read every next pointer with an acquire load: they see either
// the old end of the list or a fully initialised agent.
#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "module/locks.h"

namespace {

// Longest create text taken from createAgent; agent names and
// configurations are far shorter, so nothing that matters is cut.
inline constexpr uint32_t kCreateTextMax = 4096;

ListLinks* NextAgentLink(ListLinks* l) { return __atomic_load_n(&l->next, __ATOMIC_ACQUIRE); }

template <typename Fn>
void ForEachAgent(Fn&& fn) {
  for (ListLinks* l = NextAgentLink(&agentList); l != &agentList; l = NextAgentLink(l)) {
    if (!fn(SLCGenericAgentFromLink(l))) return;
  }
}

void FormatInstanceName(char (&buf)[SLCGENERIC_QRY_INSTANCE_NAME_SIZE], SLCGenericFilter* filter,
                        int32_t position) {
  zel_StringFormat(buf, sizeof(buf), "%s-%d", filter->name, position);
}

[[nodiscard]] ZelStatus StringArg(QRY_ParamList* args, uint32_t index, const char** str) {
  QRY_Param* param = nullptr;
  if (QRY_ParamListGetParam(args, index, &param) != ZEL_OK || param == nullptr) {
    return ZEL_BAD_PARAM_TYPE;
  }
  if (QRY_ParamGetString(param, str) != ZEL_OK || *str == nullptr) return ZEL_BAD_PARAM_TYPE;
  return ZEL_OK;
}

// --- Type definitions --------------------------------------------------------

constexpr QRY_EnumElem kActionElems[] = {
    {"SLCGenericActionNone", "none", SLCGenericActionNone},
    {"SLCGenericActionDrop", "drop packets", SLCGenericActionDrop},
    {"SLCGenericActionAccept", "accept packets", SLCGenericActionAccept},
    {"SLCGenericActionPunt", "punt packets to slowpath", SLCGenericActionPunt},
    {"SLCGenericActionCopy", "copy packets to slowpath", SLCGenericActionCopy},
    {"SLGenericActionL2Rewrite", "perform L2 rewrite on packets", SLGenericActionL2Rewrite},
    {"SLCGenericActionGRE", "GRE encapsulate a copy of the packets", SLCGenericActionGRE},
    {"SLCGenericActionLog", "log the packets", SLCGenericActionLog},
    {"SLCGenericActionResourcePoolTag", "resource Pool tag", SLCGenericActionResourcePoolTag},
    {"SLCGenericActionDSCPMark", "mark packets with dscp tag", SLCGenericActionDSCPMark},
    {"SLCGenericActionEthDot1PMark", "mark packets with 802.1p tag",
     SLCGenericActionEthDot1PMark},
    {"SLCGenericActionDSCPMarkAndEthDot1PMark", "mark packets with dscp tag and 802.1p tag",
     SLCGenericActionDSCPMarkAndEthDot1PMark},
};

constexpr QRY_EnumElem kDirectionElems[] = {
    {"SLCGenericDirectionInvalid", "invalid", SLCGenericDirectionInvalid},
    {"SLCGenericDirectionFromSwitch", "from switch", SLCGenericDirectionFromSwitch},
    {"SLCGenericDirectionToSwitch", "to switch", SLCGenericDirectionToSwitch},
    {"SLCGenericDirectionBidirectional", "bidirectional", SLCGenericDirectionBidirectional},
};

#define SLCG_QRY_FIELD(Struct, field, type, description) \
  {#field, (type), offsetof(Struct, field), sizeof(Struct::field), (description)}

constexpr QRY_StructField kRuleSetSummaryFields[] = {
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, version, QRY_TYPE_DEC_U8, "Ruleset version"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, highestSupportedVersion, QRY_TYPE_DEC_U8,
                   "Highest supported ruleset version"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, lowestSupportedVersion, QRY_TYPE_DEC_U8,
                   "Lowest supported ruleset version"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, numRules, QRY_TYPE_DEC_U32,
                   "Number of rules in the ruleset"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, defaultAction, SLCGenericQryTypeActionEnum,
                   "Default action"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, fragOverride, SLCGenericQryTypeActionEnum,
                   "Fragment override policy"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, fwFeatures, QRY_TYPE_CHAR_ARRAY, "Features enabled"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSetSummary, ioctl, QRY_TYPE_DEC_U8, "Rules pushed via IOCTL"),
};

constexpr QRY_StructField kRuleSummaryFields[] = {
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, wildcardsEnabled, QRY_TYPE_CHAR_ARRAY,
                   "Wildcards Enabled"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, rangesEnabled, QRY_TYPE_CHAR_ARRAY, "Ranges Enabled"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, dMac, QRY_TYPE_CHAR_ARRAY, "Ethernet Destination MAC"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, sMac, QRY_TYPE_CHAR_ARRAY, "Ethernet Source MAC"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, ethType, QRY_TYPE_CHAR_ARRAY, "Ethertype"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, vlan1QTag, QRY_TYPE_CHAR_ARRAY,
                   "802.1Q VLAN/Priority tag"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, ipSa, QRY_TYPE_CHAR_ARRAY, "IP Source Address"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, ipDa, QRY_TYPE_CHAR_ARRAY, "IP Destination Address"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, ipProto, QRY_TYPE_CHAR_ARRAY, "IP Protocol"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, sPort, QRY_TYPE_CHAR_ARRAY, "Source Port"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, dPort, QRY_TYPE_CHAR_ARRAY, "Destination Port"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, bidirectional, QRY_TYPE_CHAR_ARRAY,
                   "Bidirectional Rule"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, direction, SLCGenericQryTypeDirectionEnum, "Direction"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, action, SLCGenericQryTypeActionEnum, "Action"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, greIP, QRY_TYPE_CHAR_ARRAY,
                   "GRE Destination IP Address"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, rewriteMac, QRY_TYPE_CHAR_ARRAY, "L2 Rewrite MAC"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, resourcePool, QRY_TYPE_CHAR_ARRAY,
                   "Resource pool name"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, rpTag, QRY_TYPE_CHAR_ARRAY, "Resource pool tag number"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, ethDot1PTag, QRY_TYPE_CHAR_ARRAY, "802.1p tag number"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, dscpTag, QRY_TYPE_CHAR_ARRAY, "DSCP tag number"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, pktCount, QRY_TYPE_CHAR_ARRAY,
                   "Number of packets matching this rule"),
    SLCG_QRY_FIELD(SLCGeneric_RuleSummary, byteCount, QRY_TYPE_CHAR_ARRAY,
                   "Total bytes of packets matching this rule"),
};

#undef SLCG_QRY_FIELD

template <typename T, uint32_t N>
constexpr uint32_t CountOf(const T (&)[N]) {
  return N;
}

// The fields must tile their structure exactly, in order.
template <uint32_t N>
constexpr bool FieldsTile(const QRY_StructField (&fields)[N], uint32_t size) {
  uint32_t next = 0;
  for (const QRY_StructField& f : fields) {
    if (f.offset != next) return false;
    next += f.size;
  }
  return next == size;
}
static_assert(FieldsTile(kRuleSetSummaryFields, sizeof(SLCGeneric_RuleSetSummary)));
static_assert(FieldsTile(kRuleSummaryFields, sizeof(SLCGeneric_RuleSummary)));

}  // namespace

// --- Exported tables -----------------------------------------------------------

constexpr QRY_Node qryNodesLookupTab[] = {
    // name, parent, first child, next sibling, kind, output type, input type
    {"root", 0, 2, QRY_NO_NODE, QRY_NODE_BRANCH, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"agents", 0, 3, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"createAgent", 0, QRY_NO_NODE, 1, QRY_NODE_LEAF, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"filters", 1, 5, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"ruleSetSummary", 3, QRY_NO_NODE, QRY_NO_NODE, QRY_NODE_LEAF,
     SLCGenericQryTypeRuleSetSummary, QRY_TYPE_EMPTY},
    {"rules", 3, 6, 4, QRY_NODE_INSTANCES_INT, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"ruleSummary", 5, QRY_NO_NODE, QRY_NO_NODE, QRY_NODE_LEAF, SLCGenericQryTypeRuleSummary,
     QRY_TYPE_EMPTY},
};

constexpr QRY_Handlers qryHandlers[] = {
    {nullptr, nullptr, nullptr},                                  // root
    {SLCGenericQryListAgents, nullptr, nullptr},                  // agents
    {nullptr, QRY_NULL_Get, SLCGenericQryCreateAgent},            // createAgent
    {SLCGenericQryListFilters, nullptr, nullptr},                 // filters
    {nullptr, SLCGenericQryRuleSetSummaryGet, QRY_NULL_Set},      // ruleSetSummary
    {SLCGenericQryListRules, nullptr, nullptr},                   // rules
    {nullptr, SLCGenericQryRuleSummaryGet, QRY_NULL_Set},         // ruleSummary
};

constexpr uint32_t qryMaxNodes = CountOf(qryNodesLookupTab);
static_assert(qryMaxNodes == 7);
static_assert(CountOf(qryHandlers) == qryMaxNodes);

// Only the module's own types; ids below QRY_TYPE_MODULE_BASE are the host's.
constexpr QRY_TypeDef qryTypeDefsLookupTab[] = {
    {SLCGenericQryTypeRuleSetSummary, "SLCGeneric_RuleSetSummary", QRY_KIND_STRUCT,
     sizeof(SLCGeneric_RuleSetSummary), "Ruleset summary", kRuleSetSummaryFields,
     CountOf(kRuleSetSummaryFields), nullptr, 0},
    {SLCGenericQryTypeRuleSummary, "SLCGeneric_RuleSummary", QRY_KIND_STRUCT,
     sizeof(SLCGeneric_RuleSummary), "Rule summary", kRuleSummaryFields,
     CountOf(kRuleSummaryFields), nullptr, 0},
    {SLCGenericQryTypeActionEnum, "SLCGenericActionEnum", QRY_KIND_ENUM, sizeof(uint32_t),
     "Rule action", nullptr, 0, kActionElems, CountOf(kActionElems)},
    {SLCGenericQryTypeDirectionEnum, "SLCGenericDirectionEnum", QRY_KIND_ENUM, sizeof(uint32_t),
     "Rule direction", nullptr, 0, kDirectionElems, CountOf(kDirectionElems)},
};

constexpr uint32_t qryMaxTypeDefs = CountOf(qryTypeDefsLookupTab);
constexpr int32_t qryOverlayModuleNodeID = -1;

constexpr QRY_ModuleTables slcGenericQryTables = {
    qryNodesLookupTab, qryHandlers,    qryMaxNodes,
    qryTypeDefsLookupTab, qryMaxTypeDefs, qryOverlayModuleNodeID,
};

// --- Handlers --------------------------------------------------------------------

ZelStatus SLCGenericQryPreprocess(QRY_ParamList* instanceArgs, SLCGenericAgent** agentOut,
                                  SLCGenericFilter** filterOut) {
  const char* agentName = nullptr;
  if (ZelStatus s = StringArg(instanceArgs, 0, &agentName)) return s;

  SLCGenericAgent* agent = nullptr;
  ForEachAgent([&](SLCGenericAgent* a) {
    if (zel_Strncmp(a->name, agentName, SLCGENERIC_QRY_AGENT_NAME_CMP) != 0) return true;
    agent = a;
    return false;
  });
  if (agent == nullptr) return ZEL_NOT_FOUND;

  SLCGenericQryLocks locks;
  locks.LockAgent(agent);
  if (filterOut == nullptr) {
    *agentOut = agent;
    locks.Release();
    return ZEL_OK;
  }

  const char* instance = nullptr;
  if (ZelStatus s = StringArg(instanceArgs, 1, &instance)) return s;

  SLCGenericFastPath* fastPath = &agent->fastPath;
  int32_t position = 0;
  for (ListLinks* l = fastPath->filters.next; l != &fastPath->filters; l = l->next, ++position) {
    SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
    char name[SLCGENERIC_QRY_INSTANCE_NAME_SIZE];
    FormatInstanceName(name, filter, position);
    locks.LockFilter(filter);
    if (zel_Strncmp(instance, name, sizeof(name)) == 0) {
      *agentOut = agent;
      *filterOut = filter;
      locks.Release();
      return ZEL_OK;
    }
    locks.UnlockFilter();
  }
  return ZEL_NOT_FOUND;
}

ZelStatus SLCGenericQryListAgents(uint32_t /*nodeId*/, QRY_ParamList* /*instanceArgs*/,
                                  QRY_ParamList* out) {
  ZelStatus status = ZEL_OK;
  ForEachAgent([&](SLCGenericAgent* agent) {
    status = QRY_ParamListAddString(out, agent->name);
    return status == ZEL_OK;
  });
  return status;
}

// The text goes to agent creation as it stands: unlike the create-agent
// property, no existing agent of that name is looked for. Creation cuts the
// text in place, so it works on a private copy.
ZelStatus SLCGenericQryCreateAgent(uint32_t /*nodeId*/, QRY_ParamList* /*instanceArgs*/,
                                   QRY_ParamList* input) {
  const char* text = nullptr;
  if (ZelStatus s = QRY_ParamListGetString(input, 0, &text)) return s;
  if (text == nullptr) return ZEL_BAD_PARAM_TYPE;
  const size_t len = zel_Strnlen(text, kCreateTextMax);
  SLCGenericHeapBlock copy(len + 1);
  if (!copy) return ZEL_NO_MEMORY;
  zel_Memcpy(copy.bytes(), text, len);
  return SLCGenericInitFastPathAgent(reinterpret_cast<char*>(copy.bytes()));
}

ZelStatus SLCGenericQryListFilters(uint32_t /*nodeId*/, QRY_ParamList* instanceArgs,
                                   QRY_ParamList* out) {
  SLCGenericAgent* agent = nullptr;
  if (ZelStatus s = SLCGenericQryPreprocess(instanceArgs, &agent, nullptr)) return s;
  SLCGenericQryLocks locks(agent, nullptr);

  SLCGenericFastPath* fastPath = &agent->fastPath;
  int32_t position = 0;
  for (ListLinks* l = fastPath->filters.next; l != &fastPath->filters; l = l->next, ++position) {
    SLCGenericFilter* filter = SLCGenericFilterFromLink(l);
    char name[SLCGENERIC_QRY_INSTANCE_NAME_SIZE];
    FormatInstanceName(name, filter, position);
    locks.LockFilter(filter);
    ZelStatus status = QRY_ParamListAddString(out, name);
    locks.UnlockFilter();
    if (status != ZEL_OK) return status;
  }
  return ZEL_OK;
}

// The summary is read under configLock held shared (the last lock in the
// module's order), so it never mixes two rulesets; the two status-tree
// locks alone would let a concurrent apply be seen half done.
ZelStatus SLCGenericQryRuleSetSummaryGet(uint32_t /*nodeId*/, QRY_ParamList* instanceArgs,
                                         void* out) {
  SLCGenericAgent* agent = nullptr;
  SLCGenericFilter* filter = nullptr;
  if (ZelStatus s = SLCGenericQryPreprocess(instanceArgs, &agent, &filter)) return s;
  SLCGenericQryLocks locks(agent, filter);

  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return ZEL_NOT_FOUND;
  auto* summary = static_cast<SLCGeneric_RuleSetSummary*>(out);
  {
    SLCGenericReadGuard hold(ctx->configLock);
    summary->version = static_cast<uint8_t>(ctx->version);
    summary->highestSupportedVersion = FW_RULESET_VERSION_8;
    summary->lowestSupportedVersion = FW_RULESET_VERSION_7;
    summary->numRules = ctx->numRules;
    summary->defaultAction = ctx->defaultAction;
    summary->fragOverride = ctx->fragOverride;
    summary->ioctl = static_cast<uint8_t>(ctx->ioctl);
  }
  zel_Sprintf(summary->fwFeatures, sizeof(summary->fwFeatures), "%s", "None");
  return ZEL_OK;
}

ZelStatus SLCGenericQryListRules(uint32_t /*nodeId*/, QRY_ParamList* instanceArgs,
                                 QRY_ParamList* out) {
  SLCGenericAgent* agent = nullptr;
  SLCGenericFilter* filter = nullptr;
  if (ZelStatus s = SLCGenericQryPreprocess(instanceArgs, &agent, &filter)) return s;
  SLCGenericQryLocks locks(agent, filter);

  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return ZEL_OK;
  // numRules is read again at every step, under configLock, as rulesets may
  // change while the list is being built.
  auto numRules = [ctx] {
    SLCGenericReadGuard hold(ctx->configLock);
    return ctx->numRules;
  };
  for (uint32_t i = 0; i < numRules(); ++i) {
    if (ZelStatus s = QRY_ParamListAddInt(out, i)) return s;
  }
  return ZEL_OK;
}
