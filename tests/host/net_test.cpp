// Host packets and packet lists, resource pool tags and raw sockets.
#include <cstring>
#include <numeric>

#include "tests/support/module_fixture.h"

namespace {

using NetTest = testsupport::HostTest;

// A packet whose bytes are all `id`, so a list's order can be read.
ZelPkt* Numbered(uint8_t id) { return host::Packets::Make(std::vector<uint8_t>(60, id)); }
int Id(ZelPkt* pkt) { return zel_PktFrameMappedPointerGet(pkt)[0]; }
std::vector<int> Ids(host::PacketList& list) {
  std::vector<int> ids;
  for (ZelPkt* p : list.Packets()) ids.push_back(Id(p));
  return ids;
}
// 64 bytes 0..63 in elements of 20, 30 and 14 bytes, 10 of them mapped.
host::PacketSpec ThreeElements() {
  host::PacketSpec layout;
  layout.frame.resize(64);
  std::iota(layout.frame.begin(), layout.frame.end(), 0);
  layout.sgSizes = {20, 30, 14};
  layout.mappedLen = 10;
  return layout;
}

TEST_F(NetTest, IteratorRemoveReplaceAndPrependKeepTheOrder) {
  host::PacketList list, front;
  for (uint8_t id : {0, 1, 2, 3, 4}) list.Append(Numbered(id));
  std::vector<uint8_t> storage(zel_PktListIterSizeOf());   // as the module keeps one on its stack
  auto* it = reinterpret_cast<ZelPktListIter*>(storage.data());
  zel_PktListIterStart(list.get(), it);
  zel_PktListIterMove(it);
  ZelPkt *removed = nullptr, *tail = nullptr;
  zel_PktListIterRemovePkt(it, &removed);
  EXPECT_EQ(Id(removed), 1);
  ZelPkt* replaced = zel_PktListIterGetPkt(it);
  EXPECT_EQ(Id(replaced), 2);   // removal leaves the iterator on the next packet
  zel_PktListIterReplace(it, Numbered(20));
  EXPECT_FALSE(host::Packets::IsLive(replaced));   // the host releases the replaced packet
  zel_PktListIterMove(it);
  zel_PktListIterMove(it);
  zel_PktListIterRemovePkt(it, &tail);
  EXPECT_TRUE(zel_PktListIterIsAtEnd(it));
  list.Append(removed);   // the new tail follows 3
  EXPECT_EQ(Ids(list), (std::vector<int>{0, 20, 3, 1}));

  for (ZelPkt* p : {Numbered(7), Numbered(8), tail}) front.Append(p);
  zel_PktListPrepend(list.get(), front.get());
  EXPECT_EQ(Ids(list), (std::vector<int>{7, 8, 4, 0, 20, 3, 1}));
  EXPECT_EQ(list.Count(), 7u);
  front.Append(Numbered(9));   // the emptied source is an ordinary list again
  EXPECT_EQ(Ids(front), std::vector<int>{9});
  zel_PktListReleaseAllPkts(list.get());
  EXPECT_EQ(host::Packets::Live(), 1u);
}

TEST_F(NetTest, ClonesAndPartialCopiesAreIndependent) {
  host::PacketSpec layout = ThreeElements();
  ZelPkt* pkt = host::Packets::Make(layout);
  ZelPkt* clone = nullptr;
  ASSERT_EQ(zel_PktClone(pkt, &clone), ZEL_OK);
  EXPECT_EQ(host::Packets::Frame(clone), layout.frame);
  zel_PktFrameMappedPointerGet(clone)[0] = 0xee;
  EXPECT_EQ(host::Packets::Frame(pkt), layout.frame);
  zel_PktRelease(pkt);
  EXPECT_EQ(host::Packets::Frame(clone)[1], 1);   // readable after the original is gone
  zel_PktRelease(clone);

  layout.writable = false;   // releasing it aborts if its bytes changed
  pkt = host::Packets::Make(layout);
  for (uint32_t n : {1u, 14u, 30u, 64u}) {
    ZelPkt* copy = nullptr;
    ASSERT_EQ(zel_PktPartialCopy(pkt, n, &copy), ZEL_OK);
    EXPECT_EQ(zel_PktFrameMappedLenGet(copy), n);
    EXPECT_TRUE(zel_PktIsBufDescWritable(copy));
    EXPECT_EQ(host::Packets::Frame(copy), layout.frame);
    std::memset(zel_PktFrameMappedPointerGet(copy), 0xff, n);
    zel_PktRelease(copy);
  }
  ZelPkt* copy = nullptr;
  EXPECT_EQ(zel_PktPartialCopy(pkt, 65, &copy), ZEL_BAD_PARAM);
  zel_PktRelease(pkt);
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
