// Host packets: scatter-gather mapping, live counts, resource pool tags and
// raw sockets. List iteration, replacement, clones and partial copies are
// driven by the module's packet path and checked by the frames it passes
// (packet_verdict_test, actions_rewrite_test).
#include <cstring>
#include <numeric>

#include "tests/support/module_fixture.h"

namespace {

using NetTest = testsupport::HostTest;

ZelPkt* Numbered(uint8_t id) { return host::Packets::Make(std::vector<uint8_t>(60, id)); }
// 64 bytes 0..63 in elements of 20, 30 and 14 bytes, 10 of them mapped.
host::PacketSpec ThreeElements() {
  host::PacketSpec layout;
  layout.frame.resize(64);
  std::iota(layout.frame.begin(), layout.frame.end(), 0);
  layout.sgSizes = {20, 30, 14};
  layout.mappedLen = 10;
  return layout;
}

TEST_F(NetTest, ScatterGatherElementsMapBackOnlyWithinTheirBounds) {
  host::PacketSpec layout = ThreeElements();
  ZelPkt* pkt = host::Packets::Make(layout);
  ZelSgElem elem{}, none{};
  for (uint32_t i = 0, offset = 0; i < 3; offset += elem.length, i++) {
    ASSERT_EQ(zel_PktSgElemGet(pkt, uint16_t(i), &elem), ZEL_OK);
    ASSERT_EQ(elem.length, layout.sgSizes[i]);
    void *va = nullptr, *inner = nullptr;
    ASSERT_EQ(zel_MA2VA(elem.machineAddr, elem.length, &va), ZEL_OK);
    EXPECT_EQ(0, std::memcmp(va, layout.frame.data() + offset, elem.length));
    ASSERT_EQ(zel_MA2VA(elem.machineAddr + 5, elem.length - 5, &inner), ZEL_OK);
    EXPECT_EQ(inner, static_cast<uint8_t*>(va) + 5);
    EXPECT_EQ(zel_MA2VA(elem.machineAddr, elem.length + 1, &inner), ZEL_BAD_PARAM);
    EXPECT_EQ(zel_MA2VA(elem.machineAddr + elem.length - 1, 2, &inner), ZEL_BAD_PARAM);
  }
  EXPECT_EQ(zel_PktSgElemGet(pkt, 3, &none), ZEL_NOT_FOUND);
  zel_PktRelease(pkt);
  void* va = nullptr;   // a released packet's elements no longer map
  EXPECT_EQ(zel_MA2VA(elem.machineAddr, 1, &va), ZEL_BAD_PARAM);
}

TEST_F(NetTest, LivePacketsAreCountedAndADoubleReleaseAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  ZelPkt* a = Numbered(1);
  Numbered(2);
  std::vector<std::string> left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_NE(left[0].find("2 live packet"), std::string::npos) << left[0];
  zel_PktRelease(a);
  EXPECT_EQ(host::Packets::Live(), 1u);
  EXPECT_DEATH(zel_PktRelease(a), "packet released twice");
  host::Reset();
}

TEST_F(NetTest, PoolTagsAndSocketsAreAccountedUntilHandedBack) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  host::ResPools::Define("gold", 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("gold"), 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("gold"), 5);
  EXPECT_EQ(zel_PortsetGetResPoolTag("lead"), ZEL_INVALID_RES_POOL_TAG);   // counted too
  ZelSocket s = 0;
  ASSERT_EQ(zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &s), ZEL_OK);
  EXPECT_EQ(host::ResPools::OutstandingTotal(), 3);
  EXPECT_EQ(host::Sockets::Open(), 1u);
  zel_PortsetPutResPoolTag(5);
  zel_PortsetPutResPoolTag(0xffff);
  zel_SocketClose(s);
  EXPECT_EQ(host::Leftovers(), std::vector<std::string>{"resource pool tag 5: 1 outstanding"});
  zel_PortsetPutResPoolTag(5);
  EXPECT_DEATH(zel_PortsetPutResPoolTag(5), "not outstanding");
  EXPECT_DEATH(zel_SocketClose(s), "is closed");
}

}  // namespace
