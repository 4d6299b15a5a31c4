// Resource-pool tag accounting and raw socket recording.
#include <gtest/gtest.h>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"
#include "host/net/packets.h"

namespace {


class NetServicesTest : public testsupport::HostTest {
 protected:
};

TEST_F(NetServicesTest, PoolTagsAreCountedUntilHandedBack) {
  host::ResPools::Define("gold", 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("gold"), 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("gold"), 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("lead"), ZEL_INVALID_RES_POOL_TAG);
  EXPECT_EQ(host::ResPools::Outstanding(5), 2);
  EXPECT_EQ(host::ResPools::Outstanding(0xffff), 1);
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 3);

  zel_PortsetPutResPoolTag(5);
  zel_PortsetPutResPoolTag(0xffff);
  std::vector<std::string> left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_NE(left[0].find("resource pool tag 5: 1 outstanding"), std::string::npos) << left[0];
  zel_PortsetPutResPoolTag(5);
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 0);
  EXPECT_DEATH(zel_PortsetPutResPoolTag(5), "not outstanding");
}

TEST_F(NetServicesTest, OnlyRawGreIPv4SocketsAreCreated) {
  ZelSocket s = 0;
  EXPECT_EQ(zel_SocketCreate(ZEL_AF_INET, 2, ZEL_IPPROTO_GRE, &s), ZEL_BAD_PARAM);
  EXPECT_EQ(zel_SocketCreate(10, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_BAD_PARAM);
  EXPECT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, 17, &s), ZEL_BAD_PARAM);
  host::Faults::Fail("zel_SocketCreate", ZEL_NO_MEMORY);
  EXPECT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_NO_MEMORY);
  EXPECT_EQ(host::Sockets::Created(), 0u);

  ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_OK);
  host::SocketInfo info = host::Sockets::Info(s);
  EXPECT_EQ(info.family, 2);
  EXPECT_EQ(info.type, 3);
  EXPECT_EQ(info.protocol, 47);
  EXPECT_EQ(host::Sockets::Open(), 1u);
  std::vector<std::string> left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_NE(left[0].find("open"), std::string::npos) << left[0];
  zel_SocketClose(s);
  EXPECT_EQ(host::Sockets::Open(), 0u);
  EXPECT_FALSE(host::Sockets::Info(s).open);
  EXPECT_DEATH(zel_SocketClose(s), "is closed");
  int32_t one = 1;
  EXPECT_DEATH((void)zel_SocketSetSockOpt(s, ZEL_SOL_SOCKET, ZEL_SO_NONBLOCKING, &one, 4),
               "is closed");
}

TEST_F(NetServicesTest, OptionsAndDatagramsAreRecorded) {
  ZelSocket s = 0;
  ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_OK);
  int32_t one = 1;
  ASSERT_EQ(zel_SocketSetSockOpt(s, ZEL_SOL_SOCKET, ZEL_SO_NONBLOCKING, &one, 4), ZEL_OK);
  EXPECT_EQ(zel_SocketSetSockOpt(s, ZEL_SOL_SOCKET, ZEL_SO_NONBLOCKING, &one, 2), ZEL_BAD_PARAM);
  using Option = std::array<int32_t, 3>;
  EXPECT_EQ(host::Sockets::Options(s), (std::vector<Option>{Option{0xffff, 0x1015, 1}}));

  uint8_t addr[16] = {16, 2, 0x12, 0x34, 10, 0, 0, 7};
  const uint8_t payload[6] = {0, 0, 0x65, 0x58, 0xaa, 0xbb};
  size_t sent = 0;
  ASSERT_EQ(zel_SocketSendTo(s, 0, addr, payload, sizeof payload, &sent), ZEL_OK);
  EXPECT_EQ(sent, sizeof payload);

  addr[0] = 15;  // not a 16-byte IPv4 address
  EXPECT_EQ(zel_SocketSendTo(s, 0, addr, payload, sizeof payload, &sent), ZEL_BAD_PARAM);
  addr[0] = 16;
  host::Faults::Fail("zel_SocketSendTo", ZEL_WOULD_BLOCK);
  EXPECT_EQ(zel_SocketSendTo(s, 0, addr, payload, sizeof payload, &sent), ZEL_WOULD_BLOCK);

  std::vector<host::SentDatagram> d = host::Sockets::Sent();
  ASSERT_EQ(d.size(), 1u);
  EXPECT_EQ(d[0].socket, s);
  EXPECT_EQ(d[0].family, 2);
  EXPECT_EQ(d[0].port, 0x1234);
  EXPECT_EQ(std::vector<uint8_t>(d[0].addr, d[0].addr + 4), (std::vector<uint8_t>{10, 0, 0, 7}));
  EXPECT_EQ(d[0].bytes, (std::vector<uint8_t>{0, 0, 0x65, 0x58, 0xaa, 0xbb}));
  zel_SocketClose(s);
}

}  // namespace
