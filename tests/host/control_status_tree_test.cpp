// The status tree over a small hand-made node table: path resolution with
// string and integer instances, list/get/set routing with the instance
// arguments, typed rendering, parameter list types and fault injection.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"

namespace {

using host::QryValue;
using host::StatusTree;

#pragma pack(push, 1)
struct Summary {
  uint8_t version;
  uint32_t count;
  uint32_t action;
  char text[16];
  uint8_t spare;      // left unwritten by the handler
};
#pragma pack(pop)
static_assert(sizeof(Summary) == 26);

enum : uint32_t { kSummaryType = 1000, kActionType = 1001 };

const QRY_EnumElem kActions[] = {
    {"Accept", "Accept the packet", 0},
    {"Drop", "Drop the packet", 1},
};
const QRY_StructField kSummaryFields[] = {
    {"version", QRY_TYPE_DEC_U8, 0, 1, "Ruleset version"},
    {"count", QRY_TYPE_DEC_U32, 1, 4, "Number of rules"},
    {"action", kActionType, 5, 4, "Default action"},
    {"text", QRY_TYPE_CHAR_ARRAY, 9, 16, "Features"},
};
const QRY_TypeDef kTypes[] = {
    {kSummaryType, "Summary", QRY_KIND_STRUCT, sizeof(Summary), "Summary", kSummaryFields, 4,
     nullptr, 0},
    {kActionType, "Action", QRY_KIND_ENUM, 4, "Rule action", nullptr, 0, kActions, 2},
};

// What the handlers saw.
struct Seen {
  std::vector<QryValue> args;
  std::vector<QryValue> input;
  ZelStatus stringOfInt = 0, intOfString = 0, pastEnd = 0;
  bool overrun = false;
};
Seen* seen = nullptr;

std::vector<QryValue> Args(QRY_ParamList* list) {
  std::vector<QryValue> out;
  for (uint32_t i = 0;; i++) {
    QRY_Param* p = nullptr;
    if (QRY_ParamListGetParam(list, i, &p) != ZEL_OK) break;
    const char* s = nullptr;
    int32_t v = 0;
    if (QRY_ParamGetString(p, &s) == ZEL_OK) {
      out.emplace_back(std::string(s));
    } else if (QRY_ParamListGetInt32(list, i, &v) == ZEL_OK) {
      out.emplace_back(int64_t{v});
    }
  }
  return out;
}

ZelStatus ListAgents(uint32_t node, QRY_ParamList* args, QRY_ParamList* out) {
  EXPECT_EQ(node, 2u);
  seen->args = Args(args);
  if (ZelStatus s = QRY_ParamListAddString(out, "a")) return s;
  return QRY_ParamListAddString(out, "b");
}

ZelStatus ListFilters(uint32_t, QRY_ParamList* args, QRY_ParamList* out) {
  seen->args = Args(args);
  const char* agent = nullptr;
  if (ZelStatus s = QRY_ParamListGetString(args, 0, &agent)) return s;
  return QRY_ParamListAddString(out, (std::string(agent) + "-f-0").c_str());
}

ZelStatus GetSummary(uint32_t, QRY_ParamList* args, void* out) {
  seen->args = Args(args);
  Summary s;
  std::memcpy(&s, out, sizeof s);
  s.version = 8;
  s.count = 3;
  s.action = 1;
  std::memset(s.text, 0, sizeof s.text);
  std::strcpy(s.text, "hello");
  std::memcpy(out, &s, offsetof(Summary, spare));
  if (seen->overrun) static_cast<uint8_t*>(out)[sizeof(Summary)] = 0;
  return ZEL_OK;
}

ZelStatus ListRules(uint32_t, QRY_ParamList* args, QRY_ParamList* out) {
  seen->args = Args(args);
  for (int64_t i = 0; i < 3; i++) {
    if (ZelStatus s = QRY_ParamListAddInt(out, i)) return s;
  }
  return ZEL_OK;
}

ZelStatus GetRule(uint32_t, QRY_ParamList* args, void* out) {
  seen->args = Args(args);
  const char* str = nullptr;
  int32_t v = 0;
  seen->stringOfInt = QRY_ParamListGetString(args, 2, &str);
  seen->intOfString = QRY_ParamListGetInt32(args, 0, &v);
  seen->pastEnd = QRY_ParamListGetInt32(args, 3, &v);
  if (ZelStatus s = QRY_ParamListGetInt32(args, 2, &v)) return s;
  uint32_t value = uint32_t(v) * 10;
  std::memcpy(out, &value, sizeof value);
  return ZEL_OK;
}

ZelStatus SetConfig(uint32_t, QRY_ParamList* args, QRY_ParamList* input) {
  seen->args = Args(args);
  seen->input = Args(input);
  return ZEL_OK;
}

const QRY_Node kNodes[] = {
    {"root", 0, 1, QRY_NO_NODE, QRY_NODE_BRANCH, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"config", 0, QRY_NO_NODE, 2, QRY_NODE_LEAF, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"agents", 0, 3, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"filters", 2, 4, QRY_NO_NODE, QRY_NODE_INSTANCES_STRING, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"summary", 3, QRY_NO_NODE, 5, QRY_NODE_LEAF, kSummaryType, QRY_TYPE_EMPTY},
    {"rules", 3, 6, QRY_NO_NODE, QRY_NODE_INSTANCES_INT, QRY_TYPE_EMPTY, QRY_TYPE_EMPTY},
    {"rule", 5, QRY_NO_NODE, QRY_NO_NODE, QRY_NODE_LEAF, QRY_TYPE_DEC_U32, QRY_TYPE_EMPTY},
};
const QRY_Handlers kHandlers[] = {
    {nullptr, nullptr, nullptr},      {nullptr, QRY_NULL_Get, SetConfig},
    {ListAgents, nullptr, nullptr},   {ListFilters, nullptr, nullptr},
    {nullptr, GetSummary, QRY_NULL_Set}, {ListRules, nullptr, nullptr},
    {nullptr, GetRule, QRY_NULL_Set},
};
const QRY_ModuleTables kTables = {kNodes, kHandlers, 7, kTypes, 2, -1};

int InitOk() { return 0; }
const ZelModuleImage kImage = {"qrytest", InitOk, nullptr, nullptr, 0, nullptr, 0, &kTables};

class StatusTreeTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    seen = &seen_;
    ASSERT_EQ(host::Loader::Load(&kImage), 0);
  }
  void TearDown() override {
    if (host::Loader::Loaded()) host::Loader::Unload();
    HostTest::TearDown();
  }
  Seen seen_;
};

using V = std::vector<QryValue>;

TEST_F(StatusTreeTest, InstanceListsAreListedWithThePathInstancesAsArguments) {
  EXPECT_TRUE(StatusTree::Loaded());
  EXPECT_EQ(StatusTree::Nodes().size(), 7u);
  V out;
  ASSERT_EQ(StatusTree::List({"agents"}, &out), ZEL_OK);
  EXPECT_EQ(out, (V{"a", "b"}));
  EXPECT_TRUE(seen_.args.empty());

  ASSERT_EQ(StatusTree::List({"agents", "b", "filters"}, &out), ZEL_OK);
  EXPECT_EQ(out, V{"b-f-0"});
  EXPECT_EQ(seen_.args, V{"b"});

  ASSERT_EQ(StatusTree::List({"agents", "b", "filters", "b-f-0", "rules"}, &out), ZEL_OK);
  EXPECT_EQ(out, (V{int64_t{0}, int64_t{1}, int64_t{2}}));
  EXPECT_EQ(seen_.args, (V{"b", "b-f-0"}));
}

TEST_F(StatusTreeTest, GetFillsAnUnzeroedBufferOfTheOutputTypeSize) {
  std::vector<uint8_t> out;
  ASSERT_EQ(StatusTree::Get({"agents", "a", "filters", "x", "summary"}, &out), ZEL_OK);
  EXPECT_EQ(seen_.args, (V{"a", "x"}));
  ASSERT_EQ(out.size(), sizeof(Summary));
  EXPECT_EQ(out[0], 8);
  EXPECT_NE(out[offsetof(Summary, spare)], 0);   // what the handler left is not zero

  std::string text;
  ASSERT_EQ(StatusTree::Render({"agents", "a", "filters", "x", "summary"}, &text), ZEL_OK);
  EXPECT_EQ(text, "version: 8\ncount: 3\naction: Drop (Drop the packet)\ntext: hello\n");
  EXPECT_EQ(StatusTree::Type(kActionType), &kTypes[1]);
  ASSERT_NE(StatusTree::Type(QRY_TYPE_DEC_U32), nullptr);
  EXPECT_EQ(StatusTree::Type(QRY_TYPE_DEC_U32)->size, 4u);
}

TEST_F(StatusTreeTest, IntegerInstancesKeepTheirTypeForTheHandler) {
  std::vector<uint8_t> out;
  ASSERT_EQ(StatusTree::Get({"agents", "a", "filters", "x", "rules", 2, "rule"}, &out), ZEL_OK);
  EXPECT_EQ(seen_.args, (V{"a", "x", int64_t{2}}));
  EXPECT_EQ(out, (std::vector<uint8_t>{20, 0, 0, 0}));
  EXPECT_EQ(seen_.stringOfInt, ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(seen_.intOfString, ZEL_BAD_PARAM_TYPE);
  EXPECT_EQ(seen_.pastEnd, ZEL_NOT_FOUND);
  std::string text;
  ASSERT_EQ(StatusTree::Render({"agents", "a", "filters", "x", "rules", 4, "rule"}, &text),
            ZEL_OK);
  EXPECT_EQ(text, "40\n");

  // A number where the handler expects a name reaches it as a number.
  V list;
  EXPECT_EQ(StatusTree::List({"agents", int64_t{5}, "filters"}, &list), ZEL_BAD_PARAM_TYPE);
}

TEST_F(StatusTreeTest, PathsThatNameNothingOrTheWrongKindOfNodeFail) {
  V list;
  std::vector<uint8_t> out;
  EXPECT_EQ(StatusTree::List({"nosuch"}, &list), ZEL_NOT_FOUND);
  EXPECT_EQ(StatusTree::List({"agents", "a", "filter"}, &list), ZEL_NOT_FOUND);
  EXPECT_EQ(StatusTree::List({int64_t{1}}, &list), ZEL_NOT_FOUND);
  EXPECT_EQ(StatusTree::List({"config"}, &list), ZEL_BAD_PARAM);        // a leaf
  EXPECT_EQ(StatusTree::List({"agents", "a"}, &list), ZEL_BAD_PARAM);   // an instance
  EXPECT_EQ(StatusTree::Get({"agents"}, &out), ZEL_BAD_PARAM);
  EXPECT_EQ(StatusTree::Set({"agents", "a", "filters"}, {}), ZEL_BAD_PARAM);
}

TEST_F(StatusTreeTest, SetPassesTheInputListAndNullHandlersDoNothing) {
  ASSERT_EQ(StatusTree::Set({"config"}, {"new:default-action=drop", int64_t{-3}}), ZEL_OK);
  EXPECT_EQ(seen_.input, (V{"new:default-action=drop", int64_t{-3}}));
  std::vector<uint8_t> out{1};
  EXPECT_EQ(StatusTree::Get({"config"}, &out), ZEL_OK);
  EXPECT_TRUE(out.empty());
  EXPECT_EQ(StatusTree::Set({"agents", "a", "filters", "x", "summary"}, {"v"}), ZEL_OK);
}

TEST_F(StatusTreeTest, AFailedAddEndsTheListWithItsStatus) {
  host::Faults::Fail("QRY_ParamListAddString", ZEL_NO_MEMORY, 2);
  V out;
  EXPECT_EQ(StatusTree::List({"agents"}, &out), ZEL_NO_MEMORY);
  EXPECT_EQ(out, V{"a"});
  host::Faults::Fail("QRY_ParamListAddInt", ZEL_NO_MEMORY);
  EXPECT_EQ(StatusTree::List({"agents", "a", "filters", "x", "rules"}, &out), ZEL_NO_MEMORY);
  EXPECT_TRUE(out.empty());
}

TEST_F(StatusTreeTest, DirectParameterListsCarryValuesBothWays) {
  host::QryParams params({"x", int64_t{7}});
  const char* s = nullptr;
  int32_t v = 0;
  EXPECT_EQ(QRY_ParamListGetString(params.get(), 0, &s), ZEL_OK);
  EXPECT_STREQ(s, "x");
  EXPECT_EQ(QRY_ParamListGetInt32(params.get(), 1, &v), ZEL_OK);
  EXPECT_EQ(v, 7);
  ASSERT_EQ(QRY_ParamListAddInt(params.get(), int64_t{1} << 40), ZEL_OK);
  EXPECT_EQ(QRY_ParamListGetInt32(params.get(), 2, &v), ZEL_BAD_PARAM);   // beyond 32 bits
  EXPECT_EQ(params.Values().size(), 3u);
}

TEST(StatusTreeUnloaded, AnswersNotFoundWithoutAModule) {
  host::Reset();
  V out;
  EXPECT_FALSE(StatusTree::Loaded());
  EXPECT_EQ(StatusTree::List({"agents"}, &out), ZEL_NOT_FOUND);
  EXPECT_TRUE(StatusTree::Nodes().empty());
}

using StatusTreeDeathTest = StatusTreeTest;

TEST_F(StatusTreeDeathTest, AGetThatWritesPastItsOutputAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  seen_.overrun = true;
  std::vector<uint8_t> out;
  EXPECT_DEATH((void)StatusTree::Get({"agents", "a", "filters", "x", "summary"}, &out),
               "wrote past its 26-byte output");
}

}  // namespace
