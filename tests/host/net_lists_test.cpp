// Packet lists and iterators: order after removal, replacement and
// prepending, counts, release of everything, and the one-list rule.
#include <gtest/gtest.h>

#include <memory>

#include "host/core/host_core.h"
#include "tests/support/module_fixture.h"
#include "host/net/packets.h"

namespace {


// A packet whose first frame byte is `id`, so a list's order can be read.
ZelPkt* Numbered(uint8_t id) {
  std::vector<uint8_t> frame(60, 0);
  frame[0] = id;
  return host::Packets::Make(frame);
}

std::vector<int> Ids(host::PacketList& list) {
  std::vector<int> ids;
  for (ZelPkt* p : list.Packets()) ids.push_back(zel_PktFrameMappedPointerGet(p)[0]);
  return ids;
}

void Fill(host::PacketList& list, std::initializer_list<uint8_t> ids) {
  for (uint8_t id : ids) list.Append(Numbered(id));
}

// An iterator in raw storage, as the module keeps one on its stack.
class Iter {
 public:
  explicit Iter(ZelPktList* list)
      : storage_(new uint8_t[zel_PktListIterSizeOf()]),
        iter_(reinterpret_cast<ZelPktListIter*>(storage_.get())) {
    zel_PktListIterStart(list, iter_);
  }
  ZelPktListIter* get() { return iter_; }
  int Id() { return zel_PktFrameMappedPointerGet(zel_PktListIterGetPkt(iter_))[0]; }

 private:
  std::unique_ptr<uint8_t[]> storage_;
  ZelPktListIter* iter_;
};

class PacketListTest : public testsupport::HostTest {
 protected:
};

TEST_F(PacketListTest, RemoveAndReplaceKeepTheRestInOrder) {
  host::PacketList list;
  Fill(list, {0, 1, 2, 3, 4, 5});
  Iter it(list.get());
  zel_PktListIterMove(it.get());

  ZelPkt* removed = nullptr;
  zel_PktListIterRemovePkt(it.get(), &removed);
  EXPECT_EQ(zel_PktFrameMappedPointerGet(removed)[0], 1);
  EXPECT_FALSE(host::Packets::InList(removed));
  EXPECT_EQ(it.Id(), 2) << "removal leaves the iterator on the next packet";

  zel_PktListIterMove(it.get());
  ZelPkt* replaced = zel_PktListIterGetPkt(it.get());
  zel_PktListIterReplace(it.get(), Numbered(30));
  EXPECT_FALSE(host::Packets::IsLive(replaced)) << "the host releases the replaced packet";
  EXPECT_EQ(it.Id(), 30);
  zel_PktListIterMove(it.get());
  EXPECT_EQ(it.Id(), 4);

  // Remove the tail, then append: the new tail follows 4.
  zel_PktListIterMove(it.get());
  ZelPkt* tail = nullptr;
  zel_PktListIterRemovePkt(it.get(), &tail);
  EXPECT_TRUE(zel_PktListIterIsAtEnd(it.get()));
  EXPECT_EQ(zel_PktListIterGetPkt(it.get()), nullptr);
  list.Append(removed);
  EXPECT_EQ(Ids(list), (std::vector<int>{0, 2, 30, 4, 1}));
  EXPECT_EQ(list.Count(), 5u);
  zel_PktRelease(tail);
  EXPECT_EQ(host::Packets::Live(), 5u);
}

TEST_F(PacketListTest, RemovingEveryPacketEmptiesTheList) {
  host::PacketList list;
  Fill(list, {0, 1, 2});
  Iter it(list.get());
  std::vector<ZelPkt*> out;
  while (!zel_PktListIterIsAtEnd(it.get())) {
    ZelPkt* p = nullptr;
    zel_PktListIterRemovePkt(it.get(), &p);
    out.push_back(p);
  }
  EXPECT_EQ(list.Count(), 0u);
  EXPECT_TRUE(Ids(list).empty());
  // Replacing at the head and at the tail of a one-packet list.
  list.Append(out[2]);
  Iter one(list.get());
  zel_PktListIterReplace(one.get(), out[0]);
  list.Append(out[1]);
  EXPECT_EQ(Ids(list), (std::vector<int>{0, 1}));
}

TEST_F(PacketListTest, PrependMovesTheWholeSourceToTheFront) {
  host::PacketList dst;
  host::PacketList src;
  Fill(dst, {10, 11});
  Fill(src, {1, 2, 3});
  zel_PktListPrepend(dst.get(), src.get());
  EXPECT_EQ(Ids(dst), (std::vector<int>{1, 2, 3, 10, 11}));
  EXPECT_EQ(dst.Count(), 5u);
  EXPECT_EQ(src.Count(), 0u);

  // The emptied source is an ordinary empty list again.
  Fill(src, {7});
  zel_PktListPrepend(dst.get(), src.get());
  EXPECT_EQ(Ids(dst), (std::vector<int>{7, 1, 2, 3, 10, 11}));
  zel_PktListPrepend(dst.get(), src.get());  // empty source: no change
  EXPECT_EQ(dst.Count(), 6u);

  host::PacketList empty;
  zel_PktListPrepend(empty.get(), dst.get());
  EXPECT_EQ(Ids(empty), (std::vector<int>{7, 1, 2, 3, 10, 11}));
  Fill(empty, {99});
  EXPECT_EQ(Ids(empty), (std::vector<int>{7, 1, 2, 3, 10, 11, 99}));
}

TEST_F(PacketListTest, ReleaseAllReleasesEveryPacket) {
  host::PacketList list;
  Fill(list, {0, 1, 2, 3});
  zel_PktListReleaseAllPkts(list.get());
  EXPECT_EQ(list.Count(), 0u);
  EXPECT_EQ(host::Packets::Live(), 0u);
}

using PacketListDeathTest = PacketListTest;

TEST_F(PacketListDeathTest, APacketIsInOneListAtATime) {
  host::PacketList a;
  host::PacketList b;
  ZelPkt* p = Numbered(1);
  a.Append(p);
  EXPECT_DEATH(b.Append(p), "already in list");
  EXPECT_DEATH(zel_PktRelease(p), "still in list");
  ZelPkt* q = Numbered(2);
  b.Append(q);
  Iter it(a.get());
  EXPECT_DEATH(zel_PktListIterReplace(it.get(), q), "already in list");
  // An iterator whose packet was taken away behind its back.
  a.TakeAll();
  EXPECT_DEATH(zel_PktListIterMove(it.get()), "left its list");
  zel_PktRelease(p);
}

}  // namespace
