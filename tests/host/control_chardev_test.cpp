// Emulated user memory and character devices: copies succeed only inside
// one mapping, and a device's ioctl reaches its handler between open and
// close with the device's private data.
#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "host/control/control_host.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"

namespace {

using host::CharDevs;
using host::UserMemory;

using UserMemoryTest = testsupport::HostTest;

TEST_F(UserMemoryTest, CopiesMustLieWithinOneMapping) {
  uint64_t a = UserMemory::Map({1, 2, 3, 4, 5, 6, 7, 8});
  uint64_t b = UserMemory::Map(std::vector<uint8_t>(4096, 0xee));
  uint8_t buf[16] = {};

  ASSERT_EQ(zel_CopyFromUser(buf, a + 2, 6), ZEL_OK);     // exactly up to the end
  EXPECT_EQ(buf[0], 3);
  EXPECT_EQ(buf[5], 8);
  EXPECT_EQ(zel_CopyFromUser(buf, a + 2, 7), ZEL_BAD_PARAM);   // one byte past it
  EXPECT_EQ(zel_CopyFromUser(buf, a - 1, 2), ZEL_BAD_PARAM);   // starts before it
  EXPECT_EQ(zel_CopyFromUser(buf, b + 4090, 16), ZEL_BAD_PARAM);
  EXPECT_EQ(zel_CopyFromUser(buf, ~0ull - 3, 8), ZEL_BAD_PARAM);   // wraps around
  // Two mappings are never adjacent: a copy cannot run from one into the next.
  EXPECT_EQ(zel_CopyFromUser(buf, b - 8, 16), ZEL_BAD_PARAM);
  EXPECT_EQ(UserMemory::FailedCopies(), 5u);

  const uint8_t out[] = {0xa1, 0xa2};
  ASSERT_EQ(zel_CopyToUser(a + 6, out, 2), ZEL_OK);
  EXPECT_EQ(UserMemory::Read(a, 8), (std::vector<uint8_t>{1, 2, 3, 4, 5, 6, 0xa1, 0xa2}));
  EXPECT_EQ(zel_CopyToUser(a + 7, out, 2), ZEL_BAD_PARAM);
  EXPECT_EQ(UserMemory::Read(a + 7, 1), std::vector<uint8_t>{0xa2});   // untouched

  UserMemory::Unmap(a);
  EXPECT_EQ(zel_CopyFromUser(buf, a, 1), ZEL_BAD_PARAM);
  EXPECT_EQ(UserMemory::FailedCopies(), 7u);
}

TEST_F(UserMemoryTest, CopiesCanBeMadeToFail) {
  uint64_t a = UserMemory::Map({9, 9});
  uint8_t buf[2] = {};
  host::Faults::Fail("zel_CopyToUser", ZEL_FAILURE);
  EXPECT_EQ(zel_CopyToUser(a, buf, 2), ZEL_FAILURE);
  EXPECT_EQ(UserMemory::Read(a, 2), (std::vector<uint8_t>{9, 9}));
  host::Faults::Fail("zel_CopyFromUser", ZEL_NO_MEMORY, 2);
  EXPECT_EQ(zel_CopyFromUser(buf, a, 2), ZEL_OK);
  EXPECT_EQ(zel_CopyFromUser(buf, a, 2), ZEL_NO_MEMORY);
}

// --- character devices ------------------------------------------------------

struct DevSeen {
  std::vector<std::string> calls;
  void* priv = nullptr;
  uint32_t cmd = 0;
  uint64_t arg = 0;
  ZelStatus openStatus = ZEL_OK;
};
DevSeen* dev = nullptr;
int devPriv;

ZelStatus DevOpen(ZelCharDevFile* f) {
  dev->calls.push_back("open");
  dev->priv = f->devPriv;
  return dev->openStatus;
}
ZelStatus DevClose(ZelCharDevFile* f) {
  dev->calls.push_back(f->devPriv == dev->priv ? "close" : "close(other file)");
  return ZEL_OK;
}
// Reads 4 bytes at the user argument, writes them back incremented.
ZelStatus DevIoctl(ZelCharDevFile* f, uint32_t cmd, uint64_t arg, uint32_t, int32_t* result) {
  dev->calls.push_back("ioctl");
  dev->cmd = cmd;
  dev->arg = arg;
  dev->priv = f->devPriv;
  uint32_t v = 0;
  if (ZelStatus s = zel_CopyFromUser(&v, arg, sizeof v)) return s;
  v++;
  *result = 17;
  return zel_CopyToUser(arg, &v, sizeof v);
}
const ZelCharDevOps kDevOps = {DevOpen, DevClose, DevIoctl, nullptr, nullptr, nullptr};

class CharDevTest : public testsupport::HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    dev = &seen_;
    ASSERT_EQ(zel_CharDevRegister(3, "fw0", &kDevOps, 0, &devPriv, &handle_), ZEL_OK);
  }
  void TearDown() override {
    if (CharDevs::Registered("fw0")) {
      EXPECT_EQ(zel_CharDevUnregister(handle_), ZEL_OK);
    }
    HostTest::TearDown();
  }
  DevSeen seen_;
  ZelCharDevHandle handle_ = nullptr;
};

TEST_F(CharDevTest, IoctlOpensCallsTheHandlerAndCloses) {
  uint64_t arg = UserMemory::Map({41, 0, 0, 0});
  int32_t result = 0;
  ASSERT_EQ(CharDevs::Ioctl("fw0", 0, arg, &result), ZEL_OK);
  EXPECT_EQ(result, 17);
  EXPECT_EQ(seen_.calls, (std::vector<std::string>{"open", "ioctl", "close"}));
  EXPECT_EQ(seen_.priv, &devPriv);
  EXPECT_EQ(seen_.arg, arg);
  EXPECT_EQ(UserMemory::Read(arg, 4), (std::vector<uint8_t>{42, 0, 0, 0}));

  // The handler's status comes back; a bad user address is the handler's
  // copy failing, not the device's.
  EXPECT_EQ(CharDevs::Ioctl("fw0", 5, arg + 2, &result), ZEL_BAD_PARAM);
  EXPECT_EQ(seen_.cmd, 5u);
}

TEST_F(CharDevTest, AFailedOpenSkipsTheIoctl) {
  seen_.openStatus = ZEL_BUSY;
  int32_t result = -1;
  EXPECT_EQ(CharDevs::Ioctl("fw0", 0, 0, &result), ZEL_BUSY);
  EXPECT_EQ(seen_.calls, std::vector<std::string>{"open"});
}

TEST_F(CharDevTest, RegistrationIsByUniqueNameAndReportedUntilUnregistered) {
  ZelCharDevHandle other = nullptr;
  EXPECT_EQ(zel_CharDevRegister(3, "fw0", &kDevOps, 0, nullptr, &other), ZEL_FAILURE);
  host::Faults::Fail("zel_CharDevRegister", ZEL_NO_MEMORY);
  EXPECT_EQ(zel_CharDevRegister(3, "fw1", &kDevOps, 0, nullptr, &other), ZEL_NO_MEMORY);
  EXPECT_FALSE(CharDevs::Registered("fw1"));

  std::vector<std::string> left = host::Leftovers();
  EXPECT_NE(std::find(left.begin(), left.end(), "chardev: device 'fw0' still registered"),
            left.end());
  ASSERT_EQ(zel_CharDevUnregister(handle_), ZEL_OK);
  EXPECT_FALSE(CharDevs::Registered("fw0"));
  EXPECT_EQ(zel_CharDevUnregister(handle_), ZEL_NOT_FOUND);
}

}  // namespace
