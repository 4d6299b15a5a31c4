// Host packets: layout and metadata, scatter-gather lookup and mapping,
// clones and partial copies, live-packet accounting and misuse.
#include <gtest/gtest.h>

#include <cstring>
#include <numeric>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"
#include "host/net/packets.h"

namespace {


std::vector<uint8_t> Bytes(size_t n, uint8_t first = 0) {
  std::vector<uint8_t> v(n);
  std::iota(v.begin(), v.end(), first);
  return v;
}

class PacketTest : public testsupport::HostTest {
 protected:
  // 64 bytes in elements of 20, 30 and 14 bytes, 10 of them mapped.
  static host::PacketSpec ThreeElements() {
    host::PacketSpec layout;
    layout.frame = Bytes(64);
    layout.sgSizes = {20, 30, 14};
    layout.mappedLen = 10;
    layout.vlanId = 0x123;
    layout.priority = 5;
    layout.resPoolTag = 7;
    return layout;
  }
};

TEST_F(PacketTest, GettersReportFrameAndMetadata) {
  host::PacketSpec layout = ThreeElements();
  ZelPkt* pkt = host::Packets::Make(layout);
  EXPECT_EQ(zel_PktFrameLenGet(pkt), 64u);
  EXPECT_EQ(zel_PktFrameMappedLenGet(pkt), 10u);
  EXPECT_EQ(0, std::memcmp(zel_PktFrameMappedPointerGet(pkt), layout.frame.data(), 10));
  EXPECT_EQ(zel_PktVlanIDGet(pkt), 0x123);
  EXPECT_EQ(zel_PktPriorityGet(pkt), 5);
  uint16_t tag = 0;
  ASSERT_EQ(zel_PktResPoolTagGet(pkt, &tag), ZEL_OK);
  EXPECT_EQ(tag, 7);
  EXPECT_EQ(zel_PktSgArrayGet(pkt), 3);
  EXPECT_EQ(host::Packets::Frame(pkt), layout.frame);

  ASSERT_EQ(zel_PktPrioritySet(pkt, 3), ZEL_OK);
  EXPECT_EQ(zel_PktPrioritySet(pkt, 8), ZEL_BAD_PARAM);
  ASSERT_EQ(zel_PktResPoolTagSet(pkt, 0xffff), ZEL_OK);
  EXPECT_EQ(host::Packets::Priority(pkt), 3);
  EXPECT_EQ(host::Packets::ResPoolTag(pkt), 0xffff);
  zel_PktRelease(pkt);
}

TEST_F(PacketTest, ElementsMapBackToTheirBytesWithinBounds) {
  host::PacketSpec layout = ThreeElements();
  ZelPkt* pkt = host::Packets::Make(layout);
  uint32_t offset = 0;
  std::vector<uint64_t> addrs;
  for (uint16_t i = 0; i < 3; i++) {
    ZelSgElem elem{};
    ASSERT_EQ(zel_PktSgElemGet(pkt, i, &elem), ZEL_OK);
    ASSERT_EQ(elem.length, layout.sgSizes[i]);
    void* va = nullptr;
    ASSERT_EQ(zel_MA2VA(elem.machineAddr, elem.length, &va), ZEL_OK);
    EXPECT_NE(elem.machineAddr, reinterpret_cast<uintptr_t>(va)) << "machine address is a pointer";
    EXPECT_EQ(0, std::memcmp(va, layout.frame.data() + offset, elem.length));
    // A range inside the element maps to the matching place.
    void* inner = nullptr;
    ASSERT_EQ(zel_MA2VA(elem.machineAddr + 5, elem.length - 5, &inner), ZEL_OK);
    EXPECT_EQ(inner, static_cast<uint8_t*>(va) + 5);
    // Ranges that run past the element's end do not.
    EXPECT_EQ(zel_MA2VA(elem.machineAddr, elem.length + 1, &inner), ZEL_BAD_PARAM);
    EXPECT_EQ(zel_MA2VA(elem.machineAddr + elem.length - 1, 2, &inner), ZEL_BAD_PARAM);
    offset += elem.length;
    addrs.push_back(elem.machineAddr);
  }
  ZelSgElem elem{};
  EXPECT_EQ(zel_PktSgElemGet(pkt, 3, &elem), ZEL_NOT_FOUND);

  host::Packets::HideSgElement(pkt, 1);
  EXPECT_EQ(zel_PktSgElemGet(pkt, 1, &elem), ZEL_NOT_FOUND);
  EXPECT_EQ(zel_PktSgElemGet(pkt, 2, &elem), ZEL_OK);

  host::Faults::Fail("zel_MA2VA", ZEL_FAILURE);
  void* va = nullptr;
  EXPECT_EQ(zel_MA2VA(addrs[0], 1, &va), ZEL_FAILURE);

  zel_PktRelease(pkt);
  // The elements of a released packet no longer map.
  EXPECT_EQ(zel_MA2VA(addrs[0], 1, &va), ZEL_BAD_PARAM);
}

TEST_F(PacketTest, CloneIsAnIndependentCopyWithTheSameSerial) {
  ZelPkt* pkt = host::Packets::Make(ThreeElements());
  uint64_t serial = host::Packets::Serial(pkt);
  ZelPkt* clone = nullptr;
  ASSERT_EQ(zel_PktClone(pkt, &clone), ZEL_OK);
  EXPECT_EQ(host::Packets::Live(), 2u);
  EXPECT_EQ(host::Packets::Serial(clone), host::Packets::Serial(pkt));
  EXPECT_EQ(host::Packets::Frame(clone), host::Packets::Frame(pkt));
  EXPECT_EQ(zel_PktSgArrayGet(clone), 3);
  EXPECT_EQ(zel_PktFrameMappedLenGet(clone), 10u);
  EXPECT_EQ(zel_PktVlanIDGet(clone), 0x123);

  zel_PktFrameMappedPointerGet(clone)[0] = 0xee;
  ASSERT_EQ(zel_PktPrioritySet(clone, 1), ZEL_OK);
  EXPECT_EQ(host::Packets::Frame(pkt), Bytes(64));
  EXPECT_EQ(zel_PktPriorityGet(pkt), 5);
  zel_PktRelease(pkt);
  EXPECT_EQ(host::Packets::Frame(clone)[1], 1);  // still readable after the original is gone
  zel_PktRelease(clone);

  ZelPkt* other = host::Packets::Make(Bytes(8));
  EXPECT_NE(host::Packets::Serial(other), serial);
  zel_PktRelease(other);
}

TEST_F(PacketTest, PartialCopyMapsTheRequestedBytesWritable) {
  host::PacketSpec layout = ThreeElements();
  layout.writable = false;
  ZelPkt* pkt = host::Packets::Make(layout);
  for (uint32_t n : {1u, 14u, 30u, 64u}) {
    SCOPED_TRACE(n);
    ZelPkt* copy = nullptr;
    ASSERT_EQ(zel_PktPartialCopy(pkt, n, &copy), ZEL_OK);
    EXPECT_EQ(zel_PktFrameMappedLenGet(copy), n);
    EXPECT_TRUE(zel_PktIsBufDescWritable(copy));
    EXPECT_EQ(host::Packets::Frame(copy), layout.frame);
    EXPECT_EQ(host::Packets::Serial(copy), host::Packets::Serial(pkt));
    EXPECT_EQ(zel_PktVlanIDGet(copy), 0x123);
    ZelSgElem e0{};
    ASSERT_EQ(zel_PktSgElemGet(copy, 0, &e0), ZEL_OK);
    EXPECT_EQ(e0.length, n);
    std::memset(zel_PktFrameMappedPointerGet(copy), 0xff, n);
    zel_PktRelease(copy);
  }
  // The read-only original was never touched (its release would abort).
  EXPECT_FALSE(zel_PktIsBufDescWritable(pkt));

  ZelPkt* copy = nullptr;
  EXPECT_EQ(zel_PktPartialCopy(pkt, 65, &copy), ZEL_BAD_PARAM);
  host::Faults::Fail("zel_PktPartialCopy", ZEL_NO_MEMORY);
  EXPECT_EQ(zel_PktPartialCopy(pkt, 14, &copy), ZEL_NO_MEMORY);
  host::Faults::Fail("zel_PktClone", ZEL_NO_MEMORY);
  EXPECT_EQ(zel_PktClone(pkt, &copy), ZEL_NO_MEMORY);
  EXPECT_EQ(host::Packets::Live(), 1u);
  zel_PktRelease(pkt);
}

TEST_F(PacketTest, LivePacketsAreCountedAndReported) {
  ZelPkt* a = host::Packets::Make(Bytes(60));
  ZelPkt* b = host::Packets::Make(Bytes(60));
  EXPECT_EQ(host::Packets::Live(), 2u);
  EXPECT_TRUE(host::Packets::IsLive(a));
  std::vector<std::string> left = host::Leftovers();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_NE(left[0].find("2 live packet"), std::string::npos) << left[0];
  zel_PktRelease(a);
  EXPECT_FALSE(host::Packets::IsLive(a));
  EXPECT_EQ(host::Packets::Live(), 1u);

  // Reset frees what is left; a late release of such a packet (by another
  // subsystem's reset) is harmless.
  host::Reset();
  EXPECT_EQ(host::Packets::Live(), 0u);
  zel_PktRelease(b);
}

using PacketDeathTest = PacketTest;

TEST_F(PacketDeathTest, MisuseAborts) {
  ZelPkt* pkt = host::Packets::Make(Bytes(60));
  zel_PktRelease(pkt);
  EXPECT_DEATH(zel_PktRelease(pkt), "packet released twice");
  EXPECT_DEATH(zel_PktFrameLenGet(pkt), "use of released packet");
  uint64_t bogus[4] = {};
  EXPECT_DEATH(zel_PktFrameLenGet(reinterpret_cast<ZelPkt*>(bogus)), "is not a packet");

  host::PacketSpec ro;
  ro.frame = Bytes(60);
  ro.writable = false;
  ZelPkt* readOnly = host::Packets::Make(ro);
  zel_PktFrameMappedPointerGet(readOnly)[3] ^= 1;
  EXPECT_DEATH(zel_PktRelease(readOnly), "written in place");
  zel_PktFrameMappedPointerGet(readOnly)[3] ^= 1;
  zel_PktRelease(readOnly);
}

}  // namespace
