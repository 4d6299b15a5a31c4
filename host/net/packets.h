// Host packets, as tests and tools make and inspect them.
//
// A packet owns its frame as a list of scatter-gather elements. Its mapped
// part is the first `mappedLen` bytes of element 0 (mappedLen may be less
// than the element). Machine addresses of elements are fake numbers that
// only zel_MA2VA turns back into pointers.
//
// The host counts live packets: a packet released twice, or a released
// packet used again, aborts; packets still alive at Leftovers() are leaks.
#pragma once

#include <cstdint>
#include <memory>
#include <array>
#include <span>
#include <string>
#include <vector>

#include "platform/zel.h"

namespace host {

struct PacketSpec {
  std::vector<uint8_t> frame;
  // Sizes of the scatter-gather elements; empty = one element for the whole
  // frame. The sizes must add up to the frame length.
  std::vector<uint32_t> sgSizes;
  // Mapped length; UINT32_MAX = all of element 0.
  uint32_t mappedLen = UINT32_MAX;
  uint16_t vlanId = 0;
  uint8_t priority = 0;
  uint16_t resPoolTag = 0;
  bool writable = true;
};

class Packets {
 public:
  static ZelPkt* Make(const PacketSpec& layout);
  static ZelPkt* Make(std::span<const uint8_t> frame);
  // The whole frame, gathered from its elements.
  static std::vector<uint8_t> Frame(ZelPkt* pkt);
  static uint16_t VlanId(ZelPkt* pkt);
  static uint8_t Priority(ZelPkt* pkt);
  static uint16_t ResPoolTag(ZelPkt* pkt);
  static bool IsLive(ZelPkt* pkt);
  // A number that names the packet for its whole life and is inherited by
  // clones and copies (so a test can follow "its" packet).
  static uint64_t Serial(ZelPkt* pkt);
  static uint64_t Live();
  // Fails element lookup for index `index` of `pkt` (simulates a missing
  // element).
  static void HideSgElement(ZelPkt* pkt, uint16_t index);
  // True while the packet is in a packet list.
  static bool InList(ZelPkt* pkt);
};

// A packet list with storage for the host's list object, for tests and tools.
// Releases the packets it still holds when destroyed.
class PacketList {
 public:
  PacketList();
  ~PacketList();
  PacketList(const PacketList&) = delete;
  PacketList& operator=(const PacketList&) = delete;

  ZelPktList* get() { return list_; }
  void Append(ZelPkt* pkt);
  uint32_t Count();
  // The packets in order (still owned by the list).
  std::vector<ZelPkt*> Packets();
  // Takes every packet out of the list; the caller owns them.
  std::vector<ZelPkt*> TakeAll();

 private:
  ZelPktList* list_;
  std::unique_ptr<uint8_t[]> storage_;
};

// Resource pools known to the host. zel_PortsetGetResPoolTag counts every
// tag it hands out (0xffff for an unknown name too); zel_PortsetPutResPoolTag
// of a tag not outstanding aborts.
class ResPools {
 public:
  static void Define(const std::string& name, uint16_t tag);
  // Tags handed out and not yet handed back (counting 0xffff too).
  static int64_t Outstanding(uint16_t tag);
  static int64_t OutstandingTotal();
};

// Raw sockets created by the module. Only IPv4 raw GRE sockets (2, 3, 47)
// can be created; using or closing a socket that is not open aborts.
//
// Two backends: Memory (after Reset) records each datagram and sends
// nothing; Kernel opens a real raw IPPROTO_GRE socket per module socket and
// sends through the kernel's routing, recording only counts. The backend in
// force when the module creates a socket serves it until it is closed.
struct SentDatagram {
  uint64_t socket;
  uint8_t family;            // from the socket address
  uint8_t addr[4];           // IPv4 destination
  uint16_t port = 0;         // host order
  int32_t flags = 0;
  std::vector<uint8_t> bytes;
};

struct SocketInfo {
  int32_t family = 0;
  int32_t type = 0;
  int32_t protocol = 0;
  bool open = false;
};

enum class SocketBackend { Memory, Kernel };

class Sockets {
 public:
  static void SetBackend(SocketBackend backend);
  static SocketBackend Backend();
  // Datagrams handed over since Reset (either backend), and kernel sends
  // that failed.
  static uint64_t SentCount();
  static uint64_t SendErrors();
  // Memory backend: the datagrams recorded.
  static std::vector<SentDatagram> Sent();
  static void ClearSent();
  // Sockets open now.
  static uint64_t Open();
  // Sockets created since the last Reset.
  static uint64_t Created();
  // Socket `s` as created; aborts for a handle never handed out.
  static SocketInfo Info(uint64_t s);
  // Options set on socket `s`: (level, option, value) triples, in order.
  static std::vector<std::array<int32_t, 3>> Options(uint64_t s);
};

}  // namespace host
