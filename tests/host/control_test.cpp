// Emulated user memory, character device ioctls and the status tree's path
// resolution over a small hand-made node table.
#include <cstring>

#include "tests/support/module_fixture.h"

namespace {

using namespace host;
using V = std::vector<QryValue>;

using ControlTest = testsupport::HostTest;

TEST_F(ControlTest, UserCopiesMustLieWithinOneMapping) {
  uint64_t a = UserMemory::Map({1, 2, 3, 4, 5, 6, 7, 8});
  uint64_t b = UserMemory::Map(std::vector<uint8_t>(4096, 0xee));
  uint8_t buf[16] = {};
  ASSERT_EQ(zel_CopyFromUser(buf, a + 2, 6), ZEL_OK);   // exactly up to the end
  EXPECT_EQ(buf[5], 8);
  // One byte past the end, starting before, wrapping around, and running
  // from one mapping into the next.
  for (auto [addr, len] :
       {std::pair{a + 2, 7u}, {a - 1, 2u}, {b + 4090, 16u}, {~0ull - 3, 8u}, {b - 8, 16u}}) {
    EXPECT_EQ(zel_CopyFromUser(buf, addr, len), ZEL_BAD_PARAM) << addr - a << " " << len;
  }
  const uint8_t out[] = {0xa1, 0xa2};
  ASSERT_EQ(zel_CopyToUser(a + 6, out, 2), ZEL_OK);
  EXPECT_EQ(zel_CopyToUser(a + 7, out, 2), ZEL_BAD_PARAM);
  EXPECT_EQ(UserMemory::Read(a, 8), (std::vector<uint8_t>{1, 2, 3, 4, 5, 6, 0xa1, 0xa2}));
  UserMemory::Unmap(a);
  EXPECT_EQ(zel_CopyFromUser(buf, a, 1), ZEL_BAD_PARAM);
}

struct { std::vector<std::string> calls; void* priv; uint32_t cmd; } gDev;
int gDevPriv;
const ZelCharDevOps kDevOps = {
    [](ZelCharDevFile*) -> ZelStatus { gDev.calls.push_back("open"); return ZEL_OK; },
    [](ZelCharDevFile*) -> ZelStatus { gDev.calls.push_back("close"); return ZEL_OK; },
    // Reads 4 bytes at the user argument and writes them back incremented.
    [](ZelCharDevFile* f, uint32_t cmd, uint64_t arg, uint32_t, int32_t* result) -> ZelStatus {
      gDev.calls.push_back("ioctl");
      gDev.priv = f->devPriv;
      gDev.cmd = cmd;
      uint32_t v = 0;
      if (ZelStatus s = zel_CopyFromUser(&v, arg, sizeof v)) return s;
      v++;
      *result = 17;
      return zel_CopyToUser(arg, &v, sizeof v);
    },
    nullptr, nullptr, nullptr};

TEST_F(ControlTest, DeviceIoctlsReachTheHandlerBetweenOpenAndClose) {
  gDev = {};
  ZelCharDevHandle dev = nullptr;
  ASSERT_EQ(zel_CharDevRegister(3, "fw0", &kDevOps, 0, &gDevPriv, &dev), ZEL_OK);
  uint64_t arg = UserMemory::Map({41, 0, 0, 0});
  int32_t result = 0;
  ASSERT_EQ(CharDevs::Ioctl("fw0", 5, arg, &result), ZEL_OK);
  EXPECT_EQ(result, 17);
  EXPECT_EQ(gDev.calls, (std::vector<std::string>{"open", "ioctl", "close"}));
  EXPECT_EQ(gDev.priv, &gDevPriv);
  EXPECT_EQ(gDev.cmd, 5u);
  EXPECT_EQ(UserMemory::Read(arg, 4), (std::vector<uint8_t>{42, 0, 0, 0}));
  EXPECT_EQ(CharDevs::Ioctl("fw0", 5, arg + 2, &result), ZEL_BAD_PARAM);   // the handler's copy failed
  ASSERT_EQ(zel_CharDevUnregister(dev), ZEL_OK);
}

// --- the status tree -------------------------------------------------------------

struct { V args; ZelStatus stringOfInt, intOfString, pastEnd; } gSeen;   // what the handlers saw

V Args(QRY_ParamList* list) {
  V out;
  const char* s = nullptr;
  int32_t v = 0;
  for (uint32_t i = 0;; i++) {
    if (QRY_ParamListGetString(list, i, &s) == ZEL_OK) out.emplace_back(std::string(s));
    else if (QRY_ParamListGetInt32(list, i, &v) == ZEL_OK) out.emplace_back(int64_t{v});
    else return out;
  }
}

// One agent "a", one filter "<agent>-f-0" per agent, one rule 7 per filter.
ZelStatus List(uint32_t node, QRY_ParamList* args, QRY_ParamList* out) {
  gSeen.args = Args(args);
  const char* agent = nullptr;
  if (node == 1) return QRY_ParamListAddString(out, "a");
  if (node == 3) return QRY_ParamListAddInt(out, 7);
  if (ZelStatus s = QRY_ParamListGetString(args, 0, &agent)) return s;
  return QRY_ParamListAddString(out, (std::string(agent) + "-f-0").c_str());
}
ZelStatus GetRule(uint32_t, QRY_ParamList* args, void* out) {
  gSeen.args = Args(args);
  const char* str = nullptr;
  int32_t v = 0;
  gSeen.stringOfInt = QRY_ParamListGetString(args, 2, &str);
  gSeen.intOfString = QRY_ParamListGetInt32(args, 0, &v);
  gSeen.pastEnd = QRY_ParamListGetInt32(args, 3, &v);
  if (ZelStatus s = QRY_ParamListGetInt32(args, 2, &v)) return s;
  uint32_t value = uint32_t(v) * 10;
  std::memcpy(out, &value, sizeof value);
  return ZEL_OK;
}

const QRY_Node kNodes[] = {
    {"root", 0, 1, QRY_NO_NODE, QRY_NODE_BRANCH, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"agents", 0, 2, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"filters", 1, 3, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"rules", 2, 4, QRY_NO_NODE, QRY_NODE_INSTANCES_INT, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"rule", 3, QRY_NO_NODE, QRY_NO_NODE, QRY_NODE_LEAF, QRY_TYPE_DEC_U32, QRY_TYPE_EMPTY},
};
const QRY_Handlers kHandlers[] = {{}, {List, nullptr, nullptr}, {List, nullptr, nullptr},
                                  {List, nullptr, nullptr}, {nullptr, GetRule, nullptr}};
const QRY_ModuleTables kTables = {kNodes, kHandlers, 5, nullptr, 0, -1};
const ZelModuleImage kImage = {"qrytest", [] { return 0; }, nullptr, nullptr, 0, nullptr, 0, &kTables};

TEST_F(ControlTest, StatusTreeResolvesPathsAndHandsInstancesOnWithTheirTypes) {
  ASSERT_EQ(Loader::Load(&kImage), 0);
  V list;
  EXPECT_EQ(StatusTree::List({"agents"}, &list), ZEL_OK);
  EXPECT_EQ(list, V{"a"});
  EXPECT_TRUE(gSeen.args.empty());
  EXPECT_EQ(StatusTree::List({"agents", "b", "filters"}, &list), ZEL_OK);
  EXPECT_EQ(list, V{"b-f-0"});
  EXPECT_EQ(gSeen.args, V{"b"});
  EXPECT_EQ(StatusTree::List({"agents", "b", "filters", "b-f-0", "rules"}, &list), ZEL_OK);
  EXPECT_EQ(list, V{int64_t{7}});
  EXPECT_EQ(gSeen.args, (V{"b", "b-f-0"}));

  std::vector<uint8_t> out;
  EXPECT_EQ(StatusTree::Get({"agents", "a", "filters", "x", "rules", 2, "rule"}, &out), ZEL_OK);
  EXPECT_EQ(gSeen.args, (V{"a", "x", int64_t{2}}));
  EXPECT_EQ(out, (std::vector<uint8_t>{20, 0, 0, 0}));
  // Asking for an instance as the wrong type, or past the last, fails.
  EXPECT_EQ(gSeen.stringOfInt, ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(gSeen.intOfString, ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(gSeen.pastEnd, ZEL_NOT_FOUND);
  // A number where the handler expects a name reaches it as a number.
  EXPECT_EQ(StatusTree::List({"agents", int64_t{5}, "filters"}, &list), ZEL_BAD_PARAM_TYPE);

  // Paths that name nothing, or the wrong kind of node.
  EXPECT_EQ(StatusTree::List({"nosuch"}, &list), ZEL_NOT_FOUND);
  EXPECT_EQ(StatusTree::List({"agents", "a", "filter"}, &list), ZEL_NOT_FOUND);
  EXPECT_EQ(StatusTree::List({int64_t{1}}, &list), ZEL_NOT_FOUND);
  // A leaf cannot be listed, nor a list read or set.
  EXPECT_EQ(StatusTree::List({"agents", "a", "filters", "x", "rules", 1, "rule"}, &list), ZEL_BAD_PARAM);
  EXPECT_EQ(StatusTree::List({"agents", "a"}, &list), ZEL_BAD_PARAM);   // an instance, not a list
  EXPECT_EQ(StatusTree::Get({"agents"}, &out), ZEL_BAD_PARAM);
  EXPECT_EQ(StatusTree::Set({"agents", "a", "filters"}, {}), ZEL_BAD_PARAM);
  Loader::Unload();
}

}  // namespace
