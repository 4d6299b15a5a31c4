// Host log capture: long and short forms, with and without an object, are
// split into their fields; plus the string helpers and status texts.

#include <gtest/gtest.h>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "platform/zel.h"

namespace {

class LogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::Reset();
    ASSERT_EQ(zel_LogRegister("modlog", 1, nullptr, 3, 0, &log_), ZEL_OK);
  }
  void TearDown() override {
    if (log_ != nullptr) zel_LogUnregister(log_);
    EXPECT_TRUE(host::Leftovers().empty());
    host::Reset();
  }

  ZelLogHandle log_ = nullptr;
};

TEST_F(LogTest, LongFormIsSplitIntoItsFields) {
  EXPECT_STREQ(zel_LogGetName(log_), "modlog");
  EXPECT_EQ(zel_LogGetCurrentLogLevel(log_), 3);
  EXPECT_TRUE(host::Log::LogExists("modlog"));

  // Object names and texts may themselves contain ": ".
  zel_LogLevel(2, log_, 3, "%s: %s:%d: %s: " "Failed to set %s (%#x): %s" "\n", zel_LogGetName(log_),
               "SLCGenericAttach", 412, "vm: nic0", "slow path", 0xbad0001, "Failure");
  zel_LogLevel(1, log_, 3, "%s: %s:%d: " "Loading %s (%s)" "\n", zel_LogGetName(log_), "init_module", 7,
               "sluice-generic-fastpath", "platform");

  std::vector<host::LogRecord> r = host::Log::Records();
  ASSERT_EQ(r.size(), 2u);
  EXPECT_EQ(r[0].form, host::LogForm::Long);
  EXPECT_EQ(r[0].urgency, 2);
  EXPECT_EQ(r[0].logName, "modlog");
  EXPECT_EQ(r[0].function, "SLCGenericAttach");
  EXPECT_EQ(r[0].line, 412);
  EXPECT_EQ(r[0].object, "vm: nic0");
  EXPECT_EQ(r[0].text, "Failed to set slow path (0xbad0001): Failure");
  EXPECT_EQ(r[0].rendered,
            "modlog: SLCGenericAttach:412: vm: nic0: Failed to set slow path (0xbad0001): Failure\n");
  EXPECT_EQ(r[1].object, "");
  EXPECT_EQ(r[1].function, "init_module");
  EXPECT_EQ(r[1].text, "Loading sluice-generic-fastpath (platform)");
}

TEST_F(LogTest, ShortFormWithAndWithoutObject) {
  zel_LogNoLevel(2, "%s: " "Failed to register (%#x): %s" "\n", "agent-x", 0xbad0014, "Out of memory");
  zel_LogNoLevel(2, "Failed to create heap (%#x): %s" "\n", 0xbad0014, "Out of memory");

  std::vector<host::LogRecord> r = host::Log::Records();
  ASSERT_EQ(r.size(), 2u);
  EXPECT_EQ(r[0].form, host::LogForm::Short);
  EXPECT_EQ(r[0].object, "agent-x");
  EXPECT_EQ(r[0].text, "Failed to register (0xbad0014): Out of memory");
  EXPECT_EQ(r[0].logName, "");
  EXPECT_EQ(r[1].object, "");
  EXPECT_EQ(r[1].text, "Failed to create heap (0xbad0014): Out of memory");
  EXPECT_EQ(r[1].rendered, "Failed to create heap (0xbad0014): Out of memory\n");
}

TEST_F(LogTest, QueriesMatchTextExactlyOrBySubstring) {
  zel_LogLevel(1, log_, 0, "%s: %s:%d: " "Filter attached" "\n", "modlog", "f", 1);
  zel_LogLevel(2, log_, 0, "%s: %s:%d: %s: " "Filter attached" "\n", "modlog", "f", 2, "nic1");
  zel_LogNoLevel(2, "Filter attached late" "\n");

  EXPECT_EQ(host::Log::Count("Filter attached"), 2u);
  EXPECT_EQ(host::Log::Count("Filter attached", 2), 1u);
  EXPECT_FALSE(host::Log::Contains("Filter attached", 3));
  EXPECT_FALSE(host::Log::Contains("Filter"));
  EXPECT_EQ(host::Log::CountContaining("attached"), 3u);
  host::Log::Clear();
  EXPECT_TRUE(host::Log::Records().empty());

  zel_LogUnregister(log_);
  EXPECT_FALSE(host::Log::LogExists("modlog"));
  EXPECT_DEATH(zel_LogLevel(1, log_, 0, "%s", "late\n"), "log modlog was unregistered");
  log_ = nullptr;
}

TEST(StringsTest, FormattingCutsAndStatusTexts) {
  char buf[8];
  EXPECT_EQ(zel_StringFormat(buf, sizeof buf, "%s-%d", "abcdef", 42), 7);
  EXPECT_STREQ(buf, "abcdef-");
  EXPECT_EQ(zel_Sprintf(buf, sizeof buf, "%s-%d", "abcdef", 42), 9);
  EXPECT_EQ(zel_StringFormat(buf, sizeof buf, "%d", 5), 1);
  EXPECT_EQ(zel_StringFormat(buf, 0, "%d", 5), 0);

  EXPECT_STREQ(zel_StatusToString(ZEL_OK), "Success");
  EXPECT_STREQ(zel_StatusToString(ZEL_FAILURE), "Failure");
  EXPECT_STREQ(zel_StatusToString(ZEL_NO_MEMORY), "Out of memory");
  EXPECT_STREQ(zel_StatusToString(ZEL_BUF_TOO_SMALL), "Buffer too small");
  EXPECT_STREQ(zel_StatusToString(0xbad0999), "Unknown status");
}

}  // namespace
