// The system-information facility: a tree of nodes that a module publishes
// and an operator lists, reads and writes by path.
//
// A module exports its node table, the handlers of each node (in node
// order) and the type definitions of its output structures. Instance-list
// nodes stand for a variable set of children named by strings or integers;
// a path's instance names reach every handler as a parameter list (instance
// argument 0 is the outermost).
#pragma once

#include "platform/zel_status.h"

struct QRY_ParamList;
struct QRY_Param;

// Parameter lists.
[[nodiscard]] ZelStatus QRY_ParamListGetParam(QRY_ParamList* list, uint32_t index,
                                              QRY_Param** param);
// ZEL_BAD_PARAM_TYPE when the parameter is not a string.
[[nodiscard]] ZelStatus QRY_ParamGetString(QRY_Param* param, const char** str);
[[nodiscard]] ZelStatus QRY_ParamListGetString(QRY_ParamList* list, uint32_t index,
                                               const char** str);
[[nodiscard]] ZelStatus QRY_ParamListGetInt32(QRY_ParamList* list, uint32_t index, int32_t* value);
[[nodiscard]] ZelStatus QRY_ParamListAddString(QRY_ParamList* list, const char* str);
[[nodiscard]] ZelStatus QRY_ParamListAddInt(QRY_ParamList* list, int64_t value);

// Node kinds.
enum QRY_NodeKind : uint32_t {
  QRY_NODE_BRANCH = 0,
  QRY_NODE_INSTANCES_STRING = 1,   // instance list named by strings
  QRY_NODE_INSTANCES_INT = 2,      // instance list named by integers
  QRY_NODE_LEAF = 3,
};

inline constexpr int32_t QRY_NO_NODE = -1;

struct QRY_Node {
  const char* name;
  int32_t parent;        // the root is its own parent
  int32_t firstChild;    // QRY_NO_NODE when none
  int32_t nextSibling;   // QRY_NO_NODE when none
  QRY_NodeKind kind;
  uint32_t outputType;   // type id; QRY_TYPE_EMPTY for none
  uint32_t inputType;
};

using QRY_ListHandler = ZelStatus (*)(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                      QRY_ParamList* out);
using QRY_GetHandler = ZelStatus (*)(uint32_t nodeId, QRY_ParamList* instanceArgs, void* out);
using QRY_SetHandler = ZelStatus (*)(uint32_t nodeId, QRY_ParamList* instanceArgs,
                                     QRY_ParamList* input);

struct QRY_Handlers {
  QRY_ListHandler list;
  QRY_GetHandler get;
  QRY_SetHandler set;
};

// The host's do-nothing handlers.
ZelStatus QRY_NULL_Get(uint32_t nodeId, QRY_ParamList* instanceArgs, void* out);
ZelStatus QRY_NULL_Set(uint32_t nodeId, QRY_ParamList* instanceArgs, QRY_ParamList* input);

// Types. Ids below QRY_TYPE_MODULE_BASE are the host's own.
enum QRY_TypeKind : uint32_t {
  QRY_KIND_BUILTIN = 0,
  QRY_KIND_STRUCT = 1,
  QRY_KIND_ENUM = 2,
};

inline constexpr uint32_t QRY_TYPE_EMPTY = 0;        // QRY_Empty_Output
inline constexpr uint32_t QRY_TYPE_DEC_U8 = 1;       // QRY_DEC_U8, shown with "%u"
inline constexpr uint32_t QRY_TYPE_DEC_U32 = 2;      // QRY_DEC_U32, shown with "%u"
inline constexpr uint32_t QRY_TYPE_CHAR_ARRAY = 3;   // NUL-terminated text
inline constexpr uint32_t QRY_TYPE_MODULE_BASE = 1000;

struct QRY_EnumElem {
  const char* name;
  const char* description;
  uint32_t value;
};

struct QRY_StructField {
  const char* name;
  uint32_t type;
  uint32_t offset;
  uint32_t size;
  const char* description;
};

struct QRY_TypeDef {
  uint32_t id;
  const char* name;
  QRY_TypeKind kind;
  uint32_t size;
  const char* description;
  const QRY_StructField* fields;   // structs
  uint32_t numFields;
  const QRY_EnumElem* elems;       // enums
  uint32_t numElems;
};

// What a module exports to the facility.
struct QRY_ModuleTables {
  const QRY_Node* nodes;
  const QRY_Handlers* handlers;
  uint32_t maxNodes;
  const QRY_TypeDef* typeDefs;
  uint32_t maxTypeDefs;
  int32_t overlayModuleNodeID;
};
