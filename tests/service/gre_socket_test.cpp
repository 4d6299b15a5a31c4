// The host's kernel socket backend: what the module sends on a GRE socket
// leaves through a real raw socket and arrives, behind an IPv4 header the
// kernel added, at the destination (here loopback).
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "platform/zel.h"

namespace {

class ServiceGreSocketTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root for raw sockets";
    host::Reset();
    host::Sockets::SetBackend(host::SocketBackend::Kernel);
    rx_ = socket(AF_INET, SOCK_RAW, IPPROTO_GRE);
    ASSERT_GE(rx_, 0);
  }
  void TearDown() override {
    if (rx_ >= 0) close(rx_);
    if (geteuid() == 0) {
      EXPECT_TRUE(host::Leftovers().empty());
      host::Reset();
    }
  }
  // A BSD socket address as the module lays it out.
  static void Dest(uint8_t* sa, uint8_t a, uint8_t b, uint8_t c, uint8_t d) {
    std::memset(sa, 0, 16);
    sa[0] = 16;
    sa[1] = ZEL_AF_INET;
    sa[4] = a, sa[5] = b, sa[6] = c, sa[7] = d;
  }
  int rx_ = -1;
};

TEST_F(ServiceGreSocketTest, DatagramsReachTheDestinationBehindAnIpv4Header) {
  ZelSocket s = 0;
  ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_OK);
  const int32_t one = 1;
  ASSERT_EQ(zel_SocketSetSockOpt(s, ZEL_SOL_SOCKET, ZEL_SO_NONBLOCKING, &one, sizeof one), ZEL_OK);
  uint8_t payload[40];
  for (size_t i = 0; i < sizeof payload; i++) payload[i] = static_cast<uint8_t>(i);
  payload[2] = 0x65, payload[3] = 0x58;  // GRE carrying Ethernet
  payload[0] = payload[1] = 0;
  uint8_t sa[16];
  Dest(sa, 127, 0, 0, 1);
  size_t sent = 0;
  ASSERT_EQ(zel_SocketSendTo(s, 0, sa, payload, sizeof payload, &sent), ZEL_OK);
  EXPECT_EQ(sent, sizeof payload);

  pollfd p{rx_, POLLIN, 0};
  ASSERT_EQ(poll(&p, 1, 2000), 1) << "no datagram arrived";
  uint8_t buf[256];
  const ssize_t n = recv(rx_, buf, sizeof buf, 0);
  ASSERT_EQ(n, static_cast<ssize_t>(20 + sizeof payload));
  EXPECT_EQ(buf[9], IPPROTO_GRE);
  EXPECT_EQ(std::memcmp(buf + 20, payload, sizeof payload), 0);
  EXPECT_EQ(host::Sockets::SentCount(), 1u);
  EXPECT_TRUE(host::Sockets::Sent().empty()) << "the kernel backend records no bytes";

  zel_SocketClose(s);
  EXPECT_EQ(host::Sockets::Open(), 0u);
}

TEST_F(ServiceGreSocketTest, AnUnroutableDestinationIsAnErrorNotACrash) {
  ZelSocket s = 0;
  ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_OK);
  uint8_t sa[16];
  Dest(sa, 0, 0, 0, 0);
  sa[0] = 15;  // a wrong address length is refused before the kernel
  uint8_t payload[8] = {};
  EXPECT_EQ(zel_SocketSendTo(s, 0, sa, payload, sizeof payload, nullptr), ZEL_BAD_PARAM);
  Dest(sa, 255, 255, 255, 255);  // broadcast without SO_BROADCAST
  EXPECT_NE(zel_SocketSendTo(s, 0, sa, payload, sizeof payload, nullptr), ZEL_OK);
  EXPECT_EQ(host::Sockets::SendErrors(), 1u);
  zel_SocketClose(s);
}

}  // namespace
