// GRE-encapsulated copies: the datagram bytes with and without a snap
// length and across scatter-gather elements, the lazily opened socket (one
// per rule entry, also when walks race to open it), and every failure:
// socket creation, the non-blocking option, the buffer and a missing element.

#include <atomic>
#include <thread>

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

constexpr char kGreLog0[] = "Got packet for GRE encapsulation to IP 192.0.2.9 with snapLen 0";

class GreAction : public PacketPathTest {
 protected:
  void UseSnapLen(uint32_t snapLen) {
    ApplyText(ExactTcp4("gre", 1234, 80, "gre=192.0.2.9 snaplen=" + std::to_string(snapLen)));
  }
  // Runs one packet made from `spec`; expects it to pass unchanged.
  void RunOne(const host::PacketSpec& spec) {
    host::PacketList list;
    list.Append(host::Packets::Make(spec));
    ASSERT_EQ(host::Sluice::Deliver(id_, list, 1), ZEL_OK);
    std::vector<ZelPkt*> left = list.Packets();
    ASSERT_EQ(left.size(), 1u);
    EXPECT_EQ(host::Packets::Frame(left[0]), spec.frame);
  }
  static host::PacketSpec Spec(const Bytes& frame, std::vector<uint32_t> sg = {}) {
    host::PacketSpec spec;
    spec.frame = frame;
    spec.sgSizes = std::move(sg);
    spec.writable = false;  // the action must not write the packet
    return spec;
  }
  static Bytes Datagram(const Bytes& frame, size_t snap) {
    Bytes d = {0x00, 0x00, 0x65, 0x58};
    size_t n = snap == 0 ? frame.size() : std::min(snap, frame.size());
    d.insert(d.end(), frame.begin(), frame.begin() + static_cast<ptrdiff_t>(n));
    return d;
  }
};

TEST_F(GreAction, DatagramIsHeaderPlusFrameUpToTheSnapLength) {
  const Bytes big = Tcp4(1234, 80, 1500 - 54);
  ASSERT_EQ(big.size(), 1500u);
  struct Case {
    uint32_t snap;
    std::vector<uint32_t> sg;
    size_t expectLen;
  };
  for (Case c : {Case{0, {}, 1504}, Case{64, {}, 68}, Case{0, {100, 700, 700}, 1504},
                 Case{750, {100, 700, 700}, 754}, Case{800, {100, 700, 700}, 804},
                 Case{5000, {}, 1504}}) {
    SCOPED_TRACE(testing::Message() << "snapLen " << c.snap << " elements " << c.sg.size());
    UseSnapLen(c.snap);
    host::Sockets::ClearSent();
    RunOne(Spec(big, c.sg));
    std::vector<host::SentDatagram> sent = host::Sockets::Sent();
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].bytes.size(), c.expectLen);
    EXPECT_EQ(sent[0].bytes, Datagram(big, c.snap));
    EXPECT_EQ(sent[0].family, 2);
    EXPECT_EQ(frames::Hex(sent[0].addr), "c0 00 02 09");
  }
}

TEST_F(GreAction, OneNonBlockingSocketPerRuleEntryAndAProgressLogPerPacket) {
  ApplyText(ExactTcp4("gre", 1, 1, "gre=192.0.2.9") + "\n" +
            ExactTcp4("gre", 2, 2, "gre=198.51.100.1 snaplen=96"));
  host::Log::Clear();
  RunFrames({Tcp4(1, 1), Tcp4(2, 2), Tcp4(1, 1)}, 1);
  RunFrames({Tcp4(1, 1)}, 2);
  EXPECT_EQ(host::Log::Count(kGreLog0, 1), 3u);
  EXPECT_EQ(host::Log::Count("Got packet for GRE encapsulation to IP 198.51.100.1 with snapLen 96",
                             1),
            1u);
  EXPECT_EQ(host::Sockets::Open(), 2u);
  std::vector<host::SentDatagram> sent = host::Sockets::Sent();
  ASSERT_EQ(sent.size(), 4u);
  EXPECT_EQ(sent[0].socket, sent[2].socket);
  EXPECT_EQ(sent[0].socket, sent[3].socket);
  EXPECT_NE(sent[0].socket, sent[1].socket);
  for (uint64_t s : {sent[0].socket, sent[1].socket}) {
    EXPECT_EQ(host::Sockets::Options(s), (std::vector<std::array<int32_t, 3>>{{0xffff, 0x1015, 1}}));
  }
  EXPECT_EQ(Pkts(Exact(ExactTcp4("gre", 1, 1))), 3u);

  // The socket lives as long as its entry.
  ApplyText(ExactTcp4("accept"));
  EXPECT_EQ(host::Sockets::Open(), 0u);
}

TEST_F(GreAction, SocketCreationFailureIsLoggedForEveryPacketAndRetried) {
  UseSnapLen(0);
  host::Faults::Fail("zel_SocketCreate", ZEL_NO_MEMORY, 1, true);
  host::Log::Clear();
  EXPECT_EQ(RunFrames({Tcp4(), Tcp4(), Tcp4()}, 1).size(), 3u);
  EXPECT_EQ(host::Log::Count("Unable to create socket for GRE encapsulation", 2), 3u);
  EXPECT_TRUE(host::Sockets::Sent().empty());
  EXPECT_EQ(Exact(ExactTcp4("gre"))->greSocketOpen, 0u);

  host::Faults::ClearAll();
  RunFrames({Tcp4()}, 1);
  EXPECT_EQ(host::Sockets::Sent().size(), 1u);
  EXPECT_EQ(Exact(ExactTcp4("gre"))->greSocketOpen, 1u);
}

TEST_F(GreAction, SocketWhoseOptionFailedIsKeptAndUsedFromTheNextPacket) {
  UseSnapLen(0);
  host::Faults::Fail("zel_SocketSetSockOpt", ZEL_FAILURE);
  host::Log::Clear();
  RunFrames({Tcp4(), Tcp4()}, 1);
  EXPECT_EQ(host::Log::Count("Non-blocking sockopt failed: " + std::to_string(ZEL_FAILURE), 2),
            1u);
  EXPECT_EQ(host::Sockets::Open(), 1u);
  EXPECT_EQ(host::Sockets::Sent().size(), 1u);  // only the second packet
  EXPECT_EQ(host::Faults::Seen("zel_SocketSetSockOpt"), 1u);  // not retried
}

TEST_F(GreAction, BufferOrElementFailuresSendNothingAndLeakNothing) {
  UseSnapLen(0);
  RunFrames({Tcp4()}, 1);  // opens the socket
  host::Sockets::ClearSent();

  host::Faults::Fail("zel_HeapAllocWithRA", ZEL_NO_MEMORY);
  RunOne(Spec(Tcp4()));
  host::PacketSpec split = Spec(Tcp4(), {60, 14});
  ZelPkt* hidden = host::Packets::Make(split);
  host::Packets::HideSgElement(hidden, 1);
  host::PacketList list;
  list.Append(hidden);
  ASSERT_EQ(host::Sluice::Deliver(id_, list, 1), ZEL_OK);
  EXPECT_EQ(list.Count(), 1u);
  host::Faults::Fail("zel_MA2VA", ZEL_BAD_PARAM);
  RunOne(Spec(Tcp4()));
  EXPECT_TRUE(host::Sockets::Sent().empty());
  EXPECT_EQ(Pkts(Exact(ExactTcp4("gre"))), 4u);
}

TEST_F(GreAction, ConcurrentWalksOpenTheSocketOnce) {
  UseSnapLen(0);
  constexpr int kThreads = 4, kPerList = 16;
  std::atomic<int> ready{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++) {
    threads.emplace_back([&] {
      host::PacketList list;
      for (int i = 0; i < kPerList; i++) list.Append(host::Packets::Make(Tcp4()));
      ready.fetch_add(1);
      while (ready.load() < kThreads) {
      }
      EXPECT_EQ(host::Sluice::Deliver(id_, list, 1), ZEL_OK);
      EXPECT_EQ(list.Count(), static_cast<uint32_t>(kPerList));
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(host::Sockets::Open(), 1u);
  EXPECT_EQ(host::Sockets::Sent().size(), static_cast<size_t>(kThreads * kPerList));
}

}  // namespace
