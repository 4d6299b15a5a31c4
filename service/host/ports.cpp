#include "service/host/ports.h"

#include <arpa/inet.h>
#include <linux/if_packet.h>
#include <net/ethernet.h>
#include <net/if.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <sstream>
#include <vector>

namespace service {
namespace {

// Receive ring: 32 blocks of 256 KiB, a block handed over when full or
// after 1 ms, so a lone frame waits at most that long.
constexpr uint32_t kRingBlockSize = 1u << 18;
constexpr uint32_t kRingBlocks = 32;
constexpr uint32_t kRingFrameSize = 2048;
constexpr uint32_t kRingRetireMs = 1;

bool ParseU32(const std::string& v, uint32_t* out) {
  if (v.empty() || v.size() > 10) return false;
  char* end = nullptr;
  errno = 0;
  unsigned long n = std::strtoul(v.c_str(), &end, 0);
  if (errno != 0 || *end != '\0' || n > UINT32_MAX) return false;
  *out = static_cast<uint32_t>(n);
  return true;
}

bool CheckPort(const PortSettings& s, std::string* error) {
  if (s.name.empty() || s.agent.empty() || s.vmIf.empty() || s.switchIf.empty()) {
    *error = "a port needs name, agent, vm and switch";
    return false;
  }
  if (s.name.size() > 99 || s.vmUUID.size() > 127 || s.agent.size() > 99) {
    *error = "port name, agent or uuid too long";
    return false;
  }
  if (s.vmIf.size() >= IFNAMSIZ || s.switchIf.size() >= IFNAMSIZ || s.vmIf == s.switchIf) {
    *error = "vm and switch must be two different interface names";
    return false;
  }
  return true;
}

// A promiscuous packet socket bound to interface `ifname`, seeing only what
// arrives on it (not what this process sends).
int OpenInterface(const std::string& ifname, std::string* error) {
  const unsigned index = if_nametoindex(ifname.c_str());
  if (index == 0) {
    *error = "no interface " + ifname;
    return -1;
  }
  int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, htons(ETH_P_ALL));
  if (fd < 0) {
    *error = std::string("packet socket: ") + std::strerror(errno);
    return -1;
  }
  sockaddr_ll sll{};
  sll.sll_family = AF_PACKET;
  sll.sll_protocol = htons(ETH_P_ALL);
  sll.sll_ifindex = static_cast<int>(index);
  packet_mreq mr{};
  mr.mr_ifindex = static_cast<int>(index);
  mr.mr_type = PACKET_MR_PROMISC;
  const int one = 1;
  const int buf = 4 << 20;
  if (bind(fd, reinterpret_cast<sockaddr*>(&sll), sizeof sll) != 0 ||
      setsockopt(fd, SOL_PACKET, PACKET_ADD_MEMBERSHIP, &mr, sizeof mr) != 0 ||
      setsockopt(fd, SOL_PACKET, PACKET_IGNORE_OUTGOING, &one, sizeof one) != 0) {
    *error = ifname + ": " + std::strerror(errno);
    close(fd);
    return -1;
  }
  (void)setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &buf, sizeof buf);
  (void)setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &buf, sizeof buf);
  return fd;
}

// Maps a TPACKET_V3 receive ring on `fd`; false (and no ring) when the
// kernel refuses one.
bool MapRing(int fd, uint8_t** map, size_t* mapLen) {
  const int version = TPACKET_V3;
  tpacket_req3 req{};
  req.tp_block_size = kRingBlockSize;
  req.tp_block_nr = kRingBlocks;
  req.tp_frame_size = kRingFrameSize;
  req.tp_frame_nr = kRingBlockSize / kRingFrameSize * kRingBlocks;
  req.tp_retire_blk_tov = kRingRetireMs;
  if (setsockopt(fd, SOL_PACKET, PACKET_VERSION, &version, sizeof version) != 0 ||
      setsockopt(fd, SOL_PACKET, PACKET_RX_RING, &req, sizeof req) != 0) {
    return false;
  }
  const size_t len = size_t{kRingBlockSize} * kRingBlocks;
  void* m = mmap(nullptr, len, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_LOCKED, fd, 0);
  if (m == MAP_FAILED) m = mmap(nullptr, len, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (m == MAP_FAILED) return false;
  *map = static_cast<uint8_t*>(m);
  *mapLen = len;
  return true;
}

}  // namespace

bool ParsePortSettings(const std::string& text, PortSettings* out, std::string* error) {
  PortSettings s;
  std::stringstream in(text);
  std::string item;
  while (std::getline(in, item, ',')) {
    const size_t eq = item.find('=');
    if (eq == std::string::npos) {
      *error = "port field without '=': " + item;
      return false;
    }
    const std::string k = item.substr(0, eq), v = item.substr(eq + 1);
    bool ok = true;
    if (k == "name") {
      s.name = v;
    } else if (k == "agent") {
      s.agent = v;
    } else if (k == "vm") {
      s.vmIf = v;
    } else if (k == "switch") {
      s.switchIf = v;
    } else if (k == "uuid") {
      s.vmUUID = v;
    } else if (k == "vnic") {
      ok = ParseU32(v, &s.vnicIndex);
    } else if (k == "endpoint") {
      ok = ParseU32(v, &s.endPointType);
    } else if (k == "failure") {
      ok = ParseU32(v, &s.failurePolicy);
    } else {
      *error = "unknown port field: " + k;
      return false;
    }
    if (!ok) {
      *error = "bad number for " + k + ": " + v;
      return false;
    }
  }
  if (!CheckPort(s, error)) return false;
  *out = s;
  return true;
}

nlohmann::json PortSettingsToJson(const PortSettings& s) {
  return {{"name", s.name},
          {"agent", s.agent},
          {"vm", s.vmIf},
          {"switch", s.switchIf},
          {"uuid", s.vmUUID},
          {"vnic", s.vnicIndex},
          {"endpoint", s.endPointType},
          {"failure", s.failurePolicy}};
}

bool PortSettingsFromJson(const nlohmann::json& j, PortSettings* out, std::string* error) {
  if (!j.is_object()) {
    *error = "port must be an object";
    return false;
  }
  PortSettings s;
  auto str = [&](const char* k, std::string* v) {
    if (!j.contains(k)) return true;
    if (!j[k].is_string()) return false;
    *v = j[k].get<std::string>();
    return true;
  };
  auto num = [&](const char* k, uint32_t* v) {
    if (!j.contains(k)) return true;
    if (!j[k].is_number_unsigned() || j[k].get<uint64_t>() > UINT32_MAX) return false;
    *v = j[k].get<uint32_t>();
    return true;
  };
  if (!str("name", &s.name) || !str("agent", &s.agent) || !str("vm", &s.vmIf) ||
      !str("switch", &s.switchIf) || !str("uuid", &s.vmUUID) || !num("vnic", &s.vnicIndex) ||
      !num("endpoint", &s.endPointType) || !num("failure", &s.failurePolicy)) {
    *error = "port fields have the wrong type";
    return false;
  }
  if (!CheckPort(s, error)) return false;
  *out = s;
  return true;
}

std::unique_ptr<Port> Port::Open(const PortSettings& settings, std::string* error, bool start) {
  std::unique_ptr<Port> port(new Port);
  port->settings_ = settings;
  port->fd_[1] = OpenInterface(settings.switchIf, error);
  if (port->fd_[1] < 0) return nullptr;
  port->fd_[2] = OpenInterface(settings.vmIf, error);
  if (port->fd_[2] < 0) return nullptr;
  for (int side : {1, 2}) {
    Ring& r = port->ring_[side];
    if (MapRing(port->fd_[side], &r.map, &r.mapLen)) {
      r.blockSize = kRingBlockSize;
      r.blocks = kRingBlocks;
    }
  }

  host::FilterConfig config;
  config.name = settings.name;
  config.vmUUID = settings.vmUUID;
  config.vmUUIDUnset = settings.vmUUID.empty();
  config.vnicIndex = settings.vnicIndex;
  config.endPointType = settings.endPointType;
  config.failurePolicy = settings.failurePolicy;
  if (!host::Sluice::AgentRegistered(settings.agent)) {
    *error = "no agent " + settings.agent;
    return nullptr;
  }
  const ZelStatus st = host::Sluice::CreateFilter(settings.agent, config, &port->filter_);
  if (st != ZEL_OK) {
    *error = std::string("the agent refused the filter: ") + zel_StatusToString(st);
    port->filter_ = 0;
    return nullptr;
  }
  if (start) port->StartReaders();
  return port;
}

void Port::StartReaders() {
  StopReaders();
  stop_ = false;
  for (int side : {1, 2}) {
    readers_[side] = ring_[side].map != nullptr ? std::thread([this, side] { RingReader(side); })
                                                : std::thread([this, side] { Reader(side); });
  }
}

void Port::StopReaders() {
  stop_ = true;
  for (int side : {1, 2}) {
    if (readers_[side].joinable()) readers_[side].join();
  }
}

size_t Port::FromSlowPath(const std::vector<std::vector<uint8_t>>& frames, uint32_t direction) {
  host::PacketList list;
  for (const auto& f : frames) list.Append(host::Packets::Make(f));
  (void)host::Sluice::DeliverFromSlowPath(filter_, list, direction);
  // What the callback left in the list continues the way it was going.
  Transmit(fd_[direction == 1 ? 2 : 1], list, direction);
  if (host::Sluice::IssuedCount(filter_) > 0) TransmitDeliveries(host::Sluice::TakeIssued(filter_));
  counters_.fromSlowPath += frames.size();
  return frames.size();
}

bool Port::Close(int waitMs) {
  StopReaders();
  if (filter_ == 0) return true;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(waitMs);
  for (;;) {
    const ZelStatus st = host::Sluice::DestroyFilter(filter_);
    if (st == ZEL_OK) break;
    if (st != ZEL_BUSY || std::chrono::steady_clock::now() > deadline) return false;
    host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  // Lists handed back after the last delivery belong to no one else.
  for (auto& d : host::Sluice::TakeFaulted(filter_)) {
    for (ZelPkt* p : d.packets) zel_PktRelease(p);
  }
  for (auto& d : host::Sluice::TakeIssued(filter_)) {
    for (ZelPkt* p : d.packets) zel_PktRelease(p);
  }
  filter_ = 0;
  return true;
}

Port::~Port() {
  if (filter_ != 0 || readers_[1].joinable() || readers_[2].joinable()) (void)Close();
  for (int side : {1, 2}) {
    if (ring_[side].map != nullptr) munmap(ring_[side].map, ring_[side].mapLen);
    if (fd_[side] >= 0) close(fd_[side]);
  }
}

nlohmann::json Port::Stats() const {
  auto& c = counters_;
  return {{"rxFromSwitch", c.rx[1].load()},
          {"rxFromVm", c.rx[2].load()},
          {"txToVm", c.tx[1].load()},
          {"txToSwitch", c.tx[2].load()},
          {"turnedBack", c.turnedBack.load()},
          {"slowPath", c.slowPath.load()},
          {"fromSlowPath", c.fromSlowPath.load()},
          {"oversize", c.oversize.load()},
          {"txErrors", c.txErrors.load()},
          {"batches", c.batches.load()},
          {"busyNs", c.busyNs.load()},
          {"moduleNs", c.moduleNs.load()},
          {"txNs", c.txNs.load()},
          {"rxRings", ring_[1].map != nullptr && ring_[2].map != nullptr}};
}

// Sends every packet left in `list` on `fd` and releases them.
void Port::Transmit(int fd, host::PacketList& list, uint32_t direction) {
  std::vector<ZelPkt*> pkts = list.TakeAll();
  if (pkts.empty()) return;
  std::vector<std::vector<uint8_t>> frames;
  frames.reserve(pkts.size());
  for (ZelPkt* p : pkts) {
    frames.push_back(host::Packets::Frame(p));
    zel_PktRelease(p);
  }
  std::vector<iovec> iov(frames.size());
  std::vector<mmsghdr> msgs(frames.size());
  for (size_t i = 0; i < frames.size(); i++) {
    iov[i] = {frames[i].data(), frames[i].size()};
    msgs[i] = {};
    msgs[i].msg_hdr.msg_iov = &iov[i];
    msgs[i].msg_hdr.msg_iovlen = 1;
  }
  size_t done = 0;
  int waits = 0;
  while (done < msgs.size()) {
    int n = sendmmsg(fd, msgs.data() + done, static_cast<unsigned>(msgs.size() - done), 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      // The interface queue is full: wait for it rather than lose an
      // accepted frame, but not past a second or a stop.
      if ((errno == ENOBUFS || errno == EAGAIN) && waits++ < 100 && !stop_.load()) {
        pollfd p{fd, POLLOUT, 0};
        (void)poll(&p, 1, 10);
        continue;
      }
      // This frame cannot go (too long for the interface, interface down):
      // count it and go on with the rest.
      counters_.txErrors++;
      done++;
      continue;
    }
    done += static_cast<size_t>(n);
    counters_.tx[direction] += static_cast<uint64_t>(n);
  }
}

void Port::TransmitDeliveries(std::vector<host::Delivery> deliveries) {
  for (auto& d : deliveries) {
    const uint32_t direction = d.direction == 1 ? 1 : 2;
    if (direction == 2) counters_.turnedBack += d.packets.size();
    host::PacketList list;
    for (ZelPkt* p : d.packets) list.Append(p);
    Transmit(fd_[direction == 1 ? 2 : 1], list, direction);
  }
}

void Port::Process(int side, std::span<const RxFrame> frames) {
  const auto t0 = std::chrono::steady_clock::now();
  const uint32_t direction = static_cast<uint32_t>(side);
  counters_.rx[side] += frames.size();
  counters_.batches++;
  host::PacketList list;
  for (const RxFrame& f : frames) {
    if (f.len < f.wireLen || f.wireLen > kFrameMax) {
      counters_.oversize++;
      continue;
    }
    list.Append(host::Packets::Make(std::span<const uint8_t>(f.data, f.len)));
  }
  if (list.Count() == 0) return;
  const auto t1 = std::chrono::steady_clock::now();
  (void)host::Sluice::Deliver(filter_, list, direction);
  const auto t2 = std::chrono::steady_clock::now();
  counters_.moduleNs +=
      static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(t2 - t1).count());
  Transmit(fd_[side == 1 ? 2 : 1], list, direction);
  counters_.txNs += static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now() - t2)
          .count());
  if (host::Sluice::IssuedCount(filter_) > 0) {
    TransmitDeliveries(host::Sluice::TakeIssued(filter_));
  }
  if (host::Sluice::FaultedCount(filter_) > 0) {
    for (auto& d : host::Sluice::TakeFaulted(filter_)) {
      counters_.slowPath += d.packets.size();
      for (ZelPkt* pkt : d.packets) zel_PktRelease(pkt);
    }
  }
  counters_.busyNs += static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now() - t0)
          .count());
}

void Port::Reader(int side) {
  const int inFd = fd_[side];
  std::vector<uint8_t> storage(size_t{kBatch} * kFrameMax);
  iovec iov[kBatch];
  mmsghdr msgs[kBatch];
  RxFrame frames[kBatch];
  while (!stop_.load(std::memory_order_relaxed)) {
    pollfd p{inFd, POLLIN, 0};
    if (poll(&p, 1, 50) <= 0) continue;
    for (unsigned i = 0; i < kBatch; i++) {
      iov[i] = {storage.data() + size_t{i} * kFrameMax, kFrameMax};
      msgs[i] = {};
      msgs[i].msg_hdr.msg_iov = &iov[i];
      msgs[i].msg_hdr.msg_iovlen = 1;
    }
    int n = recvmmsg(inFd, msgs, kBatch, MSG_DONTWAIT | MSG_TRUNC, nullptr);
    if (n <= 0) continue;
    for (int i = 0; i < n; i++) {
      // With MSG_TRUNC msg_len is the frame's real length.
      frames[i] = {storage.data() + size_t(i) * kFrameMax,
                   std::min<uint32_t>(msgs[i].msg_len, kFrameMax), msgs[i].msg_len};
    }
    Process(side, std::span<const RxFrame>(frames, static_cast<size_t>(n)));
  }
}

// Walks the ring block by block: a block belongs to this thread from the
// kernel's TP_STATUS_USER until it is handed back with TP_STATUS_KERNEL.
void Port::RingReader(int side) {
  Ring& ring = ring_[side];
  // A restarted reader goes on with the block the kernel fills next.
  uint32_t current = ring.next;
  RxFrame frames[kBatch];
  while (!stop_.load(std::memory_order_relaxed)) {
    auto* block =
        reinterpret_cast<tpacket_block_desc*>(ring.map + size_t{current} * ring.blockSize);
    if ((__atomic_load_n(&block->hdr.bh1.block_status, __ATOMIC_ACQUIRE) & TP_STATUS_USER) == 0) {
      pollfd p{fd_[side], POLLIN | POLLERR, 0};
      (void)poll(&p, 1, 50);
      continue;
    }
    const uint32_t count = block->hdr.bh1.num_pkts;
    const uint8_t* const blockEnd = ring.map + size_t{current + 1} * ring.blockSize;
    const uint8_t* at =
        reinterpret_cast<const uint8_t*>(block) + block->hdr.bh1.offset_to_first_pkt;
    size_t n = 0;
    for (uint32_t i = 0; i < count && at + sizeof(tpacket3_hdr) <= blockEnd; i++) {
      const auto* h = reinterpret_cast<const tpacket3_hdr*>(at);
      const uint8_t* data = at + h->tp_mac;
      if (data + h->tp_snaplen <= blockEnd) {
        frames[n++] = {data, h->tp_snaplen, h->tp_len};
        if (n == kBatch) {
          Process(side, std::span<const RxFrame>(frames, n));
          n = 0;
        }
      }
      if (h->tp_next_offset == 0) break;
      at += h->tp_next_offset;
    }
    if (n > 0) Process(side, std::span<const RxFrame>(frames, n));
    __atomic_store_n(&block->hdr.bh1.block_status, TP_STATUS_KERNEL, __ATOMIC_RELEASE);
    current = (current + 1) % ring.blocks;
  }
  ring.next = current;
}

}  // namespace service
