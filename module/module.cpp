// Module start and stop, parameters, heap and log.

#include "module/module.h"

#include "agent/agent.h"
#include "control/control.h"

ListLinks agentList = {&agentList, &agentList};
ZelModuleID slcGenericModuleID = -1;
ZelHeapID slcGenericHeapID = nullptr;
ZelLogHandle slcGenericLogHandle = nullptr;
ZelTimerQueueHandle slcGenericTimerQueue = nullptr;
ZelLockDomainID slcGenericLockDomain = ZEL_INVALID_LOCK_DOMAIN;
ZelClientPortHandle slcGenericPortClient = nullptr;

const ZelPGXPropOps slcGenericCreateAgentOps = {SLCGenericAgentPropWrite, nullptr, nullptr,
                                                nullptr};

int32_t SLCGENERIC_SLOWPATH_TIMEOUT = 2000;
int32_t SLCGENERIC_HEAP_MAX_SIZE = 1073741824;
int32_t SLCGENERIC_HEAP_MIN_SIZE = 4096;

namespace {

constexpr ZelModuleParam kParams[] = {
    {"SLCGENERIC_SLOWPATH_TIMEOUT", "int", "Slow path communication timeout (default: 2000ms)",
     &SLCGENERIC_SLOWPATH_TIMEOUT},
    {"SLCGENERIC_HEAP_MAX_SIZE", "int", "Maximum heap size (default: 1GB)",
     &SLCGENERIC_HEAP_MAX_SIZE},
    {"SLCGENERIC_HEAP_MIN_SIZE", "int", "Minimum heap size (default: 4096 bytes)",
     &SLCGENERIC_HEAP_MIN_SIZE},
};

constexpr ZelModuleInfo kInfo[] = {
    {"version", "Verison 0.1.0-0 (Built on: Apr  3 2018)"},
    {"build_type", "release"},
    {"depends", "zelkernel"},
    {"depends", "com.quelmar.zelapi#v2_5_0_0"},
    {"depends", "com.quelmar.zelapi.incompat#v2_5_0_0"},
};

// Size of the buffer for the name the host loaded the module under.
constexpr size_t kLoadedNameLen = 32;
char slcGenericLoadedName[kLoadedNameLen];

}  // namespace

const ZelModuleImage slcGenericModuleImage = {
    kSLCGenericModuleName,
    init_module,
    cleanup_module,
    kParams,
    sizeof(kParams) / sizeof(kParams[0]),
    kInfo,
    sizeof(kInfo) / sizeof(kInfo[0]),
    &slcGenericQryTables,
};

int init_module() {
  // Agent creation may cut the text it is given, so it works on a copy.
  char defaultAgent[sizeof(kSLCGenericDefaultAgentName)];
  zel_Memcpy(defaultAgent, kSLCGenericDefaultAgentName, sizeof(defaultAgent));

  if (SLCGenericInit(kSLCGenericModuleName, kSLCGenericCreateAgentPropName) != ZEL_OK) {
    return 1;
  }
  SLCG_LOG(SLCG_PROGRESS, "Loading %s (%s)", kSLCGenericModuleName, "platform");

  // The module stays loaded without its default agent; creation logs why.
  (void)SLCGenericInitFastPathAgent(defaultAgent);
  return 0;
}

void cleanup_module() { SLCGenericCleanup(); }

ZelStatus SLCGenericInit(const char* moduleName, const char* createAgentPropName) {
  List_Init(&agentList);
  slcGenericModuleID = zel_ModuleCurrentID();

  ZelStatus status = zel_ModuleGetName(slcGenericModuleID, slcGenericLoadedName, kLoadedNameLen);
  if (status != ZEL_OK) {
    // The heap cannot be named without it; report it as the heap's failure.
    SLCG_LOG(SLCG_ATTENTION, "Failed to create heap (%#x): %s", status, zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  const ZelHeapCreateProps heapProps = {
      0,
      slcGenericLoadedName,
      slcGenericModuleID,
      static_cast<uint64_t>(static_cast<uint32_t>(SLCGENERIC_HEAP_MIN_SIZE)),
      static_cast<uint64_t>(static_cast<uint32_t>(SLCGENERIC_HEAP_MAX_SIZE)),
      0,
  };
  status = zel_HeapCreate(&heapProps, &slcGenericHeapID);
  if (status != ZEL_OK) {
    slcGenericHeapID = nullptr;
    SLCG_LOG(SLCG_ATTENTION, "Failed to create heap (%#x): %s", status, zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }
  status = zel_ModuleSetHeapID(slcGenericModuleID, slcGenericHeapID);
  if (status != ZEL_OK) {
    SLCG_LOG(SLCG_ATTENTION, "Failed to create heap (%#x): %s", status, zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  status = zel_LogRegister(slcGenericLoadedName, slcGenericModuleID, slcGenericHeapID, 0, 0,
                           &slcGenericLogHandle);
  if (status != ZEL_OK) {
    slcGenericLogHandle = nullptr;
    SLCG_LOG(SLCG_ATTENTION, "Failed to allocate log handle (%#x): %s", status,
             zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  status = zel_TimerQueueCreate(moduleName, slcGenericModuleID, slcGenericHeapID, 0,
                                &slcGenericTimerQueue);
  if (status != ZEL_OK) {
    slcGenericTimerQueue = nullptr;
    SLCG_LOG(SLCG_ATTENTION, "Failed to create timer queue: %s", zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  status = zel_LockDomainCreate(slcGenericModuleID, slcGenericHeapID, moduleName,
                                &slcGenericLockDomain);
  if (status != ZEL_OK) {
    slcGenericLockDomain = ZEL_INVALID_LOCK_DOMAIN;
    SLCG_LOG(SLCG_ATTENTION, "Failed to create lock domain (%#x): %s", status,
             zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  status = zel_PGXClientPortRegister(&slcGenericPortClient, 0, createAgentPropName,
                                     &slcGenericCreateAgentOps);
  if (status != ZEL_OK) {
    slcGenericPortClient = nullptr;
    SLCG_LOG(SLCG_ATTENTION,
             "Failed to register sluice generic create agent prop handler (%#x): %s", status,
             zel_StatusToString(status));
    SLCGenericCleanup();
    return status;
  }

  SLCG_LOG(SLCG_PROGRESS, "Registered sluice generic create agent property handler");
  return ZEL_OK;
}

void SLCGenericCleanup() {
  while (!List_IsEmpty(&agentList)) {
    SLCGenericAgent* agent = SLCGenericAgentFromLink(agentList.next);
    List_Remove(&agent->link);
    SLCGenericCleanupFastPathAgent(agent);
  }
  SLCGenericCleanupRetiredAgents();
  if (slcGenericPortClient != nullptr) {
    zel_PGXClientPortUnregister(slcGenericPortClient);
    slcGenericPortClient = nullptr;
  }
  if (slcGenericLockDomain != ZEL_INVALID_LOCK_DOMAIN) {
    zel_LockDomainDestroy(slcGenericLockDomain);
    slcGenericLockDomain = ZEL_INVALID_LOCK_DOMAIN;
  }
  if (slcGenericTimerQueue != nullptr) {
    zel_TimerQueueDestroy(slcGenericTimerQueue);
    slcGenericTimerQueue = nullptr;
  }
  if (slcGenericLogHandle != nullptr) {
    zel_LogUnregister(slcGenericLogHandle);
    slcGenericLogHandle = nullptr;
  }
  if (slcGenericHeapID != nullptr) {
    zel_HeapDestroy(slcGenericHeapID);
    slcGenericHeapID = nullptr;
  }
  slcGenericModuleID = -1;
}

void* SLCGenericAlloc(uint32_t size) {
  void* block = zel_HeapAllocWithRA(slcGenericHeapID, size, __builtin_return_address(0));
  if (block != nullptr) {
    zel_Memset(block, 0, size);
  }
  return block;
}

void SLCGenericFree(void* block) { zel_HeapFree(slcGenericHeapID, block); }
