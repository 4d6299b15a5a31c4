// The actions that modify or encapsulate packets: the L2 rewrite in both
// directions (in place and through a partial copy), the DSCP mark on IPv4
// and IPv6, the 802.1p mark, the resource-pool tag, and GRE-encapsulated
// copies with their sockets. Read-only packets prove that a copy, not the
// original, was written.
#include <atomic>
#include <set>
#include <thread>
#include <tuple>

#include "tests/firewall/packet_fixture.h"

namespace {

using namespace fwpathtest;

using Actions = PacketPathTest;

TEST_F(Actions, L2RewriteInPlaceOrOnACopy) {
  // A general rule: a packet with less than 26 mapped bytes has no fields.
  ApplyText(std::string("action=l2rewrite rawflags=0x3ff rewrite=") + kRewriteMac);
  const Bytes a = Tcp4(1, 2, 1), b = Tcp4(1, 2, 2), c = Tcp4(1, 2, 3);
  const std::vector<host::PacketSpec> pkts = {
      Pkt(a), Pkt(b, false), Pkt(c, true, {10, static_cast<uint32_t>(c.size() - 10)})};
  // From the switch: turned around and re-issued toward it, in order.
  EXPECT_TRUE(Run(pkts, 1).empty());
  EXPECT_EQ(Issued(), (std::vector<Handed>{
                          {2, {Rewritten(a, true), Rewritten(b, true), Rewritten(c, true)}}}));
  // Toward the switch: only the destination changes; the packet stays.
  const std::vector<ZelPkt*> left = Run(pkts, 2);
  EXPECT_EQ(FramesOf(left),
            (Frames{Rewritten(a, false), Rewritten(b, false), Rewritten(c, false)}));
  for (ZelPkt* p : left) EXPECT_TRUE(zel_PktIsBufDescWritable(p));
  EXPECT_TRUE(Issued().empty());

  // A copy that fails leaves the packet as it was, in the list.
  host::Faults::Fail("zel_PktPartialCopy", ZEL_NO_MEMORY, 1, true);
  EXPECT_EQ(FramesOf(Run({Pkt(a, false), Pkt(b, false)}, 1)), (Frames{a, b}));
  EXPECT_EQ(host::Log::Count("copy error when forwarding pkt", 2), 2u);
  EXPECT_TRUE(Issued().empty());
}

FrameBuilder Marked(uint8_t tos) { return V4().Tos(tos).IpId(0x1c46).Tcp(1234, 80).Payload(12); }

// The expected frames come from the builder, which computes its own header
// checksum; the checksum is also verified on its own. A header beyond the
// mapped part is marked on a copy; when that copy fails, silently not at all.
TEST_F(Actions, DscpOnIpv4KeepsEcnAndRecomputesTheChecksum) {
  ApplyText("action=dscp ipv4 dscp=46");
  const Bytes opts = {0x94, 0x04, 0, 0, 0x01, 0x01, 0x01, 0x00}, longOpts(40, 1);
  struct Row {
    FrameBuilder before, after;
    size_t l3;
    uint32_t mapped = UINT32_MAX;  // and element 0 ends there
  };
  const std::vector<Row> rows = {
      {Marked(0x01), Marked(0xb9), 14},
      {Marked(0x02).Ipv4Options(opts), Marked(0xba).Ipv4Options(opts), 14},
      {Marked(0xff).Vlan(3).Llc(), Marked(0xbb).Vlan(3).Llc(), 26},
      {Marked(0x03).Ipv4Options(longOpts), Marked(0xbb).Ipv4Options(longOpts), 14, 34}};
  for (const Row& r : rows) {
    const Bytes before = r.before.Build();
    std::vector<uint32_t> sg;
    if (r.mapped != UINT32_MAX) sg = {r.mapped, static_cast<uint32_t>(before.size() - r.mapped)};
    for (bool writable : {true, false}) {
      const Bytes got = FramesOf(Run({Pkt(before, writable, sg, r.mapped)}, 1)).at(0);
      EXPECT_EQ(frames::Hex(got), frames::Hex(r.after.Build())) << r.l3 << " " << writable;
      EXPECT_TRUE(frames::Ipv4HeaderChecksumOk(got, r.l3));
    }
    host::Faults::Fail("zel_PktPartialCopy", ZEL_NO_MEMORY);
    host::Log::Clear();
    EXPECT_EQ(FramesOf(Run({Pkt(before, r.mapped == UINT32_MAX, sg, r.mapped)}, 1)).at(0),
              r.mapped == UINT32_MAX ? r.after.Build() : before);
    EXPECT_TRUE(host::Log::Records().empty());
    host::Faults::ClearAll();
  }
}

TEST_F(Actions, DscpOnIpv6KeepsVersionEcnAndFlowLabel) {
  ApplyText("action=dscp ipv6 proto=udp dscp=46");
  auto v6 = [](int tc) {
    return Base().Ipv6({}, {}).TrafficClass(tc).FlowLabel(0xabcde).HopByHop().Udp(1, 2).Build();
  };
  for (int ecn : {0, 1, 2, 3}) {
    EXPECT_EQ(FramesOf(Run({Pkt(v6(0x10 | ecn))}, 1)), (Frames{v6(46 << 2 | ecn)}));
  }
}

// DSCP skips what it cannot mark; 802.1p and the pool tag set metadata only.
TEST_F(Actions, MetadataMarksAndUnmarkableFrames) {
  host::ResPools::Define("gold", 7);
  ApplyText(ExactTcp4("dot1p", 1, 1, "dot1p=5") + "\n" + ExactTcp4("pooltag", 2, 2, "pool=gold") +
            "\n" + ExactTcp4("pooltag", 3, 3, "pool=nosuchpool") +
            "\naction=dscp+dot1p rawflags=0x3ff dscp=46 dot1p=6");
  // Frame before and after, priority, pool tag.
  for (const auto& [before, after, priority, tag] : std::vector<std::tuple<Bytes, Bytes, int, int>>{
           {Tcp4(1, 1), Tcp4(1, 1), 5, 0},
           {Tcp4(2, 2), Tcp4(2, 2), 0, 7},
           {Tcp4(3, 3), Tcp4(3, 3), 0, 0xffff},
           {Marked(0).Build(), Marked(46 << 2).Build(), 6, 0},  // the copy gets the priority
           {Base().Ipv4({}, {}).Ihl(4).Udp(1, 2).Build(), {}, 6, 0},
           {Base().Ipv4({}, {}).Ihl(15).Udp(1, 2).Build(), {}, 6, 0},
           {Base().Arp(1, {}, {}, {}, {}).Build(), {}, 6, 0},
           {Bytes(20, 0x45), {}, 6, 0}}) {
    const std::vector<ZelPkt*> left = Run({Pkt(before, false)}, 2);
    ASSERT_EQ(left.size(), 1u);
    EXPECT_EQ(host::Packets::Frame(left[0]), after.empty() ? before : after);
    EXPECT_EQ(host::Packets::Priority(left[0]), priority);
    EXPECT_EQ(host::Packets::ResPoolTag(left[0]), tag);
  }
}

// --- GRE --------------------------------------------------------------------------

TEST_F(Actions, GreDatagramIsHeaderPlusFrameUpToTheSnapLength) {
  const Bytes big = Tcp4(1234, 80, 1500 - 54);
  const std::vector<uint32_t> three = {100, 700, 700};
  // Snap length, scatter-gather element sizes, datagram length.
  for (const auto& [snap, sg, len] : std::vector<std::tuple<int, std::vector<uint32_t>, size_t>>{
           {0, {}, 1504}, {64, {}, 68}, {0, three, 1504}, {750, three, 754}, {800, three, 804},
           {5000, {}, 1504}}) {
    SCOPED_TRACE(testing::Message() << "snapLen " << snap << " elements " << sg.size());
    ApplyText(ExactTcp4("gre", 1234, 80, "gre=192.0.2.9 snaplen=" + std::to_string(snap)));
    host::Sockets::ClearSent();
    EXPECT_EQ(FramesOf(Run({Pkt(big, false, sg)}, 1)), (Frames{big}));
    const std::vector<host::SentDatagram> sent = host::Sockets::Sent();
    ASSERT_EQ(sent.size(), 1u);
    Bytes expect = {0x00, 0x00, 0x65, 0x58};  // no flags, transparent Ethernet bridging
    expect.insert(expect.end(), big.begin(), big.begin() + static_cast<ptrdiff_t>(len - 4));
    EXPECT_EQ(sent[0].bytes, expect);
    EXPECT_EQ(sent[0].family, 2);
    EXPECT_EQ(frames::Hex(sent[0].addr), "c0 00 02 09");
  }
}

// Walks racing on first use open one socket per entry, made non-blocking,
// and closed with the entry.
TEST_F(Actions, GreOpensOneNonBlockingSocketPerRuleEntry) {
  ApplyText(ExactTcp4("gre", 1, 1, "gre=192.0.2.9") + "\n" +
            ExactTcp4("gre", 2, 2, "gre=198.51.100.1 snaplen=96"));
  constexpr int kThreads = 4, kPerList = 16;
  std::atomic<int> ready{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++) {
    threads.emplace_back([&] {
      host::PacketList list;
      for (uint16_t i = 0; i < kPerList; i++) {
        list.Append(host::Packets::Make(Tcp4(1 + i % 2, 1 + i % 2)));
      }
      for (ready++; ready < kThreads;) {
      }
      EXPECT_EQ(host::Sluice::Deliver(id_, list, 1), ZEL_OK);
      EXPECT_EQ(list.Count(), static_cast<uint32_t>(kPerList));
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(host::Log::Count("Got packet for GRE encapsulation to IP 198.51.100.1 with snapLen 96"),
            size_t{kThreads * kPerList / 2});
  std::set<uint64_t> sockets;
  for (const host::SentDatagram& d : host::Sockets::Sent()) sockets.insert(d.socket);
  EXPECT_EQ(host::Sockets::Sent().size(), size_t{kThreads * kPerList});
  EXPECT_EQ(sockets.size(), 2u);
  for (uint64_t s : sockets) {
    EXPECT_EQ(host::Sockets::Options(s),
              (std::vector<std::array<int32_t, 3>>{{0xffff, 0x1015, 1}}));  // non-blocking
  }
  EXPECT_EQ(host::Sockets::Open(), 2u);
  ApplyText(ExactTcp4("accept"));
  EXPECT_EQ(host::Sockets::Open(), 0u);
}

TEST_F(Actions, GreFailuresAreLoggedOrSilentAndThePacketsPass) {
  ApplyText(ExactTcp4("gre", 1234, 80, "gre=192.0.2.9"));
  host::Faults::Fail("zel_SocketCreate", ZEL_NO_MEMORY, 1, true);
  EXPECT_EQ(RunFrames({Tcp4(), Tcp4(), Tcp4()}, 1).size(), 3u);
  EXPECT_EQ(host::Log::Count("Unable to create socket for GRE encapsulation", 2), 3u);
  EXPECT_TRUE(host::Sockets::Sent().empty());

  // A socket whose non-blocking option failed is kept, and used from the next packet.
  host::Faults::ClearAll();
  host::Faults::Fail("zel_SocketSetSockOpt", ZEL_FAILURE);
  EXPECT_EQ(RunFrames({Tcp4(), Tcp4()}, 1).size(), 2u);
  EXPECT_EQ(host::Log::Count("Non-blocking sockopt failed: " + std::to_string(ZEL_FAILURE), 2), 1u);
  EXPECT_EQ(host::Sockets::Sent().size(), 1u);

  // No buffer, an unmappable or a missing element: nothing sent, no leak.
  host::Sockets::ClearSent();
  for (const char* call : {"zel_HeapAllocWithRA", "zel_MA2VA"}) {
    host::Faults::Fail(call, ZEL_NO_MEMORY);
    EXPECT_EQ(Run({Pkt(Tcp4(), false)}, 1).size(), 1u);
    EXPECT_EQ(host::Faults::Injected(call), 1u);
  }
  list_ = std::make_unique<host::PacketList>();
  list_->Append(host::Packets::Make(Pkt(Tcp4(), false, {60, 14})));
  host::Packets::HideSgElement(list_->Packets()[0], 1);
  ASSERT_EQ(host::Sluice::Deliver(id_, *list_, 1), ZEL_OK);
  EXPECT_EQ(list_->Count(), 1u);
  EXPECT_TRUE(host::Sockets::Sent().empty());
  EXPECT_EQ(ExactPkts(ExactTcp4("gre", 1234, 80, "raw")), 8u);
}

}  // namespace
