// The system-information (status) tree: parameter lists, path resolution
// over the loaded module's node table, and typed rendering of leaf outputs.
//
// The module's tables are exported data, so they are checked like any other
// outside input before the host walks them: a broken table aborts with a
// message that names the node or type at fault.
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <limits>
#include <memory>

#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct QRY_Param {
  host::QryValue value;
};

struct QRY_ParamList {
  // Parameters are handed out by pointer, so each lives in its own block.
  std::vector<std::unique_ptr<QRY_Param>> params;
};

namespace host {

namespace {

// Outputs are allocated this much larger and the excess must stay as filled.
constexpr size_t kOutputGuard = 64;
constexpr uint8_t kOutputPattern = 0xc7;

const QRY_TypeDef kHostTypes[] = {
    {QRY_TYPE_EMPTY, "QRY_Empty_Output", QRY_KIND_BUILTIN, 0, "No output", nullptr, 0, nullptr, 0},
    {QRY_TYPE_DEC_U8, "QRY_DEC_U8", QRY_KIND_BUILTIN, 1, "Unsigned 8-bit, decimal", nullptr, 0,
     nullptr, 0},
    {QRY_TYPE_DEC_U32, "QRY_DEC_U32", QRY_KIND_BUILTIN, 4, "Unsigned 32-bit, decimal", nullptr, 0,
     nullptr, 0},
    {QRY_TYPE_CHAR_ARRAY, "QRY_CHAR_ARRAY", QRY_KIND_BUILTIN, 0, "Text", nullptr, 0, nullptr, 0},
};

const QRY_ModuleTables* Tables() {
  if (!Loader::Loaded()) return nullptr;
  const ZelModuleImage* image = Loader::Current();
  return image == nullptr ? nullptr : image->qry;
}

// Checks the node and handler tables enough to walk them safely.
void CheckTables(const QRY_ModuleTables* t) {
  if (t->nodes == nullptr || t->handlers == nullptr || t->maxNodes == 0) {
    Fatal("status tree: module tables without nodes or handlers");
  }
  auto inRange = [&](int32_t i) { return i == QRY_NO_NODE || (i >= 0 && uint32_t(i) < t->maxNodes); };
  for (uint32_t i = 0; i < t->maxNodes; i++) {
    const QRY_Node& n = t->nodes[i];
    if (n.name == nullptr || n.parent < 0 || uint32_t(n.parent) >= t->maxNodes ||
        !inRange(n.firstChild) || !inRange(n.nextSibling) || n.kind > QRY_NODE_LEAF) {
      Fatal("status tree: node %u ('%s') has a bad name, link or kind", i,
            n.name != nullptr ? n.name : "(null)");
    }
  }
  if (t->typeDefs == nullptr && t->maxTypeDefs != 0) {
    Fatal("status tree: %u type definitions announced without a table", t->maxTypeDefs);
  }
}

uint32_t Root(const QRY_ModuleTables* t) {
  for (uint32_t i = 0; i < t->maxNodes; i++) {
    if (uint32_t(t->nodes[i].parent) == i) return i;
  }
  Fatal("status tree: no root node (a node that is its own parent)");
}

// The child of `parent` named `name`, or -1. Checks that every child met
// names `parent` as its parent and that the sibling chain ends.
int32_t Child(const QRY_ModuleTables* t, uint32_t parent, const std::string& name) {
  int32_t c = t->nodes[parent].firstChild;
  for (uint32_t steps = 0; c != QRY_NO_NODE; steps++) {
    if (steps >= t->maxNodes) Fatal("status tree: children of node %u form a cycle", parent);
    const QRY_Node& n = t->nodes[c];
    if (uint32_t(n.parent) != parent) {
      Fatal("status tree: node %d ('%s') is a child of node %u but names %d as its parent", c,
            n.name, parent, n.parent);
    }
    if (name == n.name) return c;
    c = n.nextSibling;
  }
  return -1;
}

bool IsInstanceList(const QRY_Node& n) {
  return n.kind == QRY_NODE_INSTANCES_STRING || n.kind == QRY_NODE_INSTANCES_INT;
}

struct Resolved {
  uint32_t node = 0;
  bool instancePending = false;   // the path ends at an instance-list node
  QRY_ParamList args;
};

// Walks `path` from the root. Under an instance-list node the next element
// is an instance name, passed to the handlers with the type the caller gave
// it (so that the handlers' own type checks can be exercised); the path then
// goes on among that node's children.
ZelStatus Resolve(const StatusTree::Path& path, const QRY_ModuleTables** tables, Resolved* out) {
  const QRY_ModuleTables* t = Tables();
  if (t == nullptr) return ZEL_NOT_FOUND;
  CheckTables(t);
  *tables = t;
  uint32_t cur = Root(t);
  bool pending = false;
  for (const QryValue& elem : path) {
    if (pending) {
      out->args.params.push_back(std::make_unique<QRY_Param>(QRY_Param{elem}));
      pending = false;
      continue;
    }
    const std::string* name = std::get_if<std::string>(&elem);
    if (name == nullptr) return ZEL_NOT_FOUND;
    int32_t c = Child(t, cur, *name);
    if (c < 0) return ZEL_NOT_FOUND;
    cur = uint32_t(c);
    pending = IsInstanceList(t->nodes[cur]);
  }
  out->node = cur;
  out->instancePending = pending;
  return ZEL_OK;
}

const QRY_TypeDef* FindType(const QRY_ModuleTables* t, uint32_t id) {
  if (t != nullptr) {
    for (uint32_t i = 0; i < t->maxTypeDefs; i++) {
      if (t->typeDefs[i].id == id) return &t->typeDefs[i];
    }
  }
  for (const QRY_TypeDef& d : kHostTypes) {
    if (d.id == id) return &d;
  }
  return nullptr;
}

uint64_t ReadLE(const uint8_t* p, uint32_t size) {
  uint64_t v = 0;
  for (uint32_t i = 0; i < size && i < 8; i++) v |= uint64_t(p[i]) << (8 * i);
  return v;
}

void RenderValue(const QRY_ModuleTables* t, uint32_t typeId, const uint8_t* p, uint32_t size,
                 const std::string& label, std::string* out, int depth);

std::string RenderScalar(const QRY_TypeDef* type, const uint8_t* p, uint32_t size) {
  char buf[64];
  if (type->id == QRY_TYPE_DEC_U8 || type->id == QRY_TYPE_DEC_U32) {
    uint32_t width = type->id == QRY_TYPE_DEC_U8 ? 1 : 4;
    if (size < width) Fatal("status tree: field of %u bytes too small for %s", size, type->name);
    std::snprintf(buf, sizeof buf, "%u", static_cast<unsigned>(ReadLE(p, width)));
    return buf;
  }
  if (type->id == QRY_TYPE_CHAR_ARRAY) {
    // A text field is a terminated string. One without a terminator is a
    // field the handler left unwritten (it holds the output pattern) and
    // renders as empty rather than as bytes that are not text.
    const void* nul = std::memchr(p, '\0', size);
    if (nul == nullptr) return std::string();
    return std::string(reinterpret_cast<const char*>(p), static_cast<const uint8_t*>(nul) - p);
  }
  if (type->kind == QRY_KIND_ENUM) {
    if (size == 0 || size > 4) Fatal("status tree: enum %s stored in %u bytes", type->name, size);
    uint32_t v = static_cast<uint32_t>(ReadLE(p, size));
    for (uint32_t i = 0; i < type->numElems; i++) {
      const QRY_EnumElem& e = type->elems[i];
      if (e.value == v) return std::string(e.name) + " (" + e.description + ")";
    }
    std::snprintf(buf, sizeof buf, "%u", v);
    return buf;
  }
  Fatal("status tree: no rendering for type %u (%s)", type->id, type->name);
}

void RenderValue(const QRY_ModuleTables* t, uint32_t typeId, const uint8_t* p, uint32_t size,
                 const std::string& label, std::string* out, int depth) {
  const QRY_TypeDef* type = FindType(t, typeId);
  if (type == nullptr) Fatal("status tree: unknown type %u", typeId);
  if (type->id == QRY_TYPE_EMPTY) return;
  if (type->kind != QRY_KIND_STRUCT) {
    std::string text = RenderScalar(type, p, size);
    *out += label.empty() ? text + "\n" : label + ": " + text + "\n";
    return;
  }
  if (depth > 8) Fatal("status tree: struct %s nests too deep", type->name);
  if (type->fields == nullptr && type->numFields != 0) {
    Fatal("status tree: struct %s without its fields", type->name);
  }
  for (uint32_t i = 0; i < type->numFields; i++) {
    const QRY_StructField& f = type->fields[i];
    if (f.name == nullptr || f.offset > size || f.size > size - f.offset) {
      Fatal("status tree: field %u of %s lies outside its %u bytes", i, type->name, size);
    }
    std::string name = label.empty() ? f.name : label + "." + f.name;
    RenderValue(t, f.type, p + f.offset, f.size, name, out, depth + 1);
  }
}

std::vector<QryValue> Values(const QRY_ParamList& list) {
  std::vector<QryValue> out;
  for (auto& p : list.params) out.push_back(p->value);
  return out;
}

}  // namespace

bool StatusTree::Loaded() { return Tables() != nullptr; }

const QRY_TypeDef* StatusTree::Type(uint32_t id) { return FindType(Tables(), id); }

std::vector<QRY_Node> StatusTree::Nodes() {
  const QRY_ModuleTables* t = Tables();
  if (t == nullptr) return {};
  CheckTables(t);
  return std::vector<QRY_Node>(t->nodes, t->nodes + t->maxNodes);
}

ZelStatus StatusTree::List(const Path& path, std::vector<QryValue>* out) {
  const QRY_ModuleTables* t = nullptr;
  Resolved r;
  if (ZelStatus s = Resolve(path, &t, &r)) return s;
  if (!r.instancePending) return ZEL_BAD_PARAM;
  QRY_ListHandler list = t->handlers[r.node].list;
  if (list == nullptr) return ZEL_NOT_SUPPORTED;
  QRY_ParamList result;
  ZelStatus s = list(r.node, &r.args, &result);
  if (out != nullptr) *out = Values(result);
  return s;
}

ZelStatus StatusTree::Get(const Path& path, std::vector<uint8_t>* out) {
  const QRY_ModuleTables* t = nullptr;
  Resolved r;
  if (ZelStatus s = Resolve(path, &t, &r)) return s;
  const QRY_Node& node = t->nodes[r.node];
  if (node.kind != QRY_NODE_LEAF) return ZEL_BAD_PARAM;
  QRY_GetHandler get = t->handlers[r.node].get;
  if (get == nullptr) return ZEL_NOT_SUPPORTED;
  const QRY_TypeDef* type = FindType(t, node.outputType);
  if (type == nullptr) {
    Fatal("status tree: node '%s' has unknown output type %u", node.name, node.outputType);
  }
  // Not zeroed: a handler that leaves a field unwritten shows the pattern.
  std::vector<uint8_t> buf(size_t(type->size) + kOutputGuard, kOutputPattern);
  ZelStatus s = get(r.node, &r.args, buf.data());
  for (size_t i = type->size; i < buf.size(); i++) {
    if (buf[i] != kOutputPattern) {
      Fatal("status tree: get handler of '%s' wrote past its %u-byte output (byte %zu)",
            node.name, type->size, i);
    }
  }
  buf.resize(type->size);
  if (out != nullptr) *out = std::move(buf);
  return s;
}

ZelStatus StatusTree::Set(const Path& path, const std::vector<QryValue>& input) {
  const QRY_ModuleTables* t = nullptr;
  Resolved r;
  if (ZelStatus s = Resolve(path, &t, &r)) return s;
  if (t->nodes[r.node].kind != QRY_NODE_LEAF) return ZEL_BAD_PARAM;
  QRY_SetHandler set = t->handlers[r.node].set;
  if (set == nullptr) return ZEL_NOT_SUPPORTED;
  QRY_ParamList in;
  for (const QryValue& v : input) in.params.push_back(std::make_unique<QRY_Param>(QRY_Param{v}));
  return set(r.node, &r.args, &in);
}

ZelStatus StatusTree::Render(const Path& path, std::string* out) {
  std::vector<uint8_t> bytes;
  if (ZelStatus s = Get(path, &bytes)) return s;
  const QRY_ModuleTables* t = Tables();
  Resolved r;
  if (ZelStatus s = Resolve(path, &t, &r)) return s;
  std::string text;
  RenderValue(t, t->nodes[r.node].outputType, bytes.data(), static_cast<uint32_t>(bytes.size()),
              "", &text, 0);
  if (out != nullptr) *out = std::move(text);
  return ZEL_OK;
}

QryParams::QryParams(const std::vector<QryValue>& values) : list_(new QRY_ParamList) {
  for (const QryValue& v : values) {
    list_->params.push_back(std::make_unique<QRY_Param>(QRY_Param{v}));
  }
}

QryParams::~QryParams() { delete list_; }

std::vector<QryValue> QryParams::Values() const { return host::Values(*list_); }

}  // namespace host

// ---------------------------------------------------------------------------
// QRY_ calls

using host::Faults;

ZelStatus QRY_ParamListGetParam(QRY_ParamList* list, uint32_t index, QRY_Param** param) {
  if (ZelStatus s = Faults::Check("QRY_ParamListGetParam")) return s;
  if (list == nullptr || param == nullptr) return ZEL_BAD_PARAM;
  if (index >= list->params.size()) return ZEL_NOT_FOUND;
  *param = list->params[index].get();
  return ZEL_OK;
}

ZelStatus QRY_ParamGetString(QRY_Param* param, const char** str) {
  if (ZelStatus s = Faults::Check("QRY_ParamGetString")) return s;
  if (param == nullptr || str == nullptr) return ZEL_BAD_PARAM;
  const std::string* v = std::get_if<std::string>(&param->value);
  if (v == nullptr) return ZEL_BAD_PARAM_TYPE;
  *str = v->c_str();
  return ZEL_OK;
}

ZelStatus QRY_ParamListGetString(QRY_ParamList* list, uint32_t index, const char** str) {
  if (ZelStatus s = Faults::Check("QRY_ParamListGetString")) return s;
  if (list == nullptr || str == nullptr) return ZEL_BAD_PARAM;
  if (index >= list->params.size()) return ZEL_NOT_FOUND;
  const std::string* v = std::get_if<std::string>(&list->params[index]->value);
  if (v == nullptr) return ZEL_BAD_PARAM_TYPE;
  *str = v->c_str();
  return ZEL_OK;
}

ZelStatus QRY_ParamListGetInt32(QRY_ParamList* list, uint32_t index, int32_t* value) {
  if (ZelStatus s = Faults::Check("QRY_ParamListGetInt32")) return s;
  if (list == nullptr || value == nullptr) return ZEL_BAD_PARAM;
  if (index >= list->params.size()) return ZEL_NOT_FOUND;
  const int64_t* v = std::get_if<int64_t>(&list->params[index]->value);
  if (v == nullptr) return ZEL_BAD_PARAM_TYPE;
  if (*v < std::numeric_limits<int32_t>::min() || *v > std::numeric_limits<int32_t>::max()) {
    return ZEL_BAD_PARAM;
  }
  *value = static_cast<int32_t>(*v);
  return ZEL_OK;
}

ZelStatus QRY_ParamListAddString(QRY_ParamList* list, const char* str) {
  if (ZelStatus s = Faults::Check("QRY_ParamListAddString")) return s;
  if (list == nullptr || str == nullptr) return ZEL_BAD_PARAM;
  list->params.push_back(std::make_unique<QRY_Param>(QRY_Param{std::string(str)}));
  return ZEL_OK;
}

ZelStatus QRY_ParamListAddInt(QRY_ParamList* list, int64_t value) {
  if (ZelStatus s = Faults::Check("QRY_ParamListAddInt")) return s;
  if (list == nullptr) return ZEL_BAD_PARAM;
  list->params.push_back(std::make_unique<QRY_Param>(QRY_Param{value}));
  return ZEL_OK;
}

ZelStatus QRY_NULL_Get(uint32_t, QRY_ParamList*, void*) { return ZEL_OK; }

ZelStatus QRY_NULL_Set(uint32_t, QRY_ParamList*, QRY_ParamList*) { return ZEL_OK; }
