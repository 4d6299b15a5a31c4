// Resource pools of the virtual switch and the raw sockets the module opens
// for GRE copies. Pools only record; sockets either record (Memory backend)
// or send through a real raw socket (Kernel backend).
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"

namespace host {
namespace {

// ---------------------------------------------------------------------------
// Resource pools

struct PoolState {
  std::mutex mu;
  std::map<std::string, uint16_t, std::less<>> pools;
  std::map<uint16_t, int64_t> outstanding;   // tag -> handed out, not back
};

PoolState& Pools() {
  static PoolState* state = new PoolState;
  return *state;
}

void ResetPools() {
  PoolState& st = Pools();
  std::lock_guard<std::mutex> g(st.mu);
  st.pools.clear();
  st.outstanding.clear();
}

void PoolLeftovers(std::vector<std::string>* out) {
  PoolState& st = Pools();
  std::lock_guard<std::mutex> g(st.mu);
  for (const auto& [tag, n] : st.outstanding) {
    if (n != 0) {
      out->push_back("resource pool tag " + std::to_string(tag) + ": " + std::to_string(n) +
                     " outstanding");
    }
  }
}

[[maybe_unused]] const bool kPoolsRegistered =
    RegisterSubsystem(Subsystem{"resource pools", ResetPools, PoolLeftovers});

// ---------------------------------------------------------------------------
// Sockets

struct SocketRecord {
  SocketInfo info;
  std::vector<std::array<int32_t, 3>> options;
  int fd = -1;                 // Kernel backend: the real socket
};

struct SocketState {
  std::mutex mu;
  std::map<uint64_t, SocketRecord> sockets;  // every socket created since Reset
  std::vector<SentDatagram> sent;
  uint64_t nextHandle = 1;
  uint64_t open = 0;
  uint64_t sentCount = 0;
  uint64_t sendErrors = 0;
  SocketBackend backend = SocketBackend::Memory;
};

SocketState& Socks() {
  static SocketState* state = new SocketState;
  return *state;
}

// The open socket `s`; aborts otherwise. Caller holds the state lock.
SocketRecord& OpenSocket(SocketState& st, uint64_t s, const char* call) {
  auto it = st.sockets.find(s);
  if (it == st.sockets.end()) Fatal("%s: unknown socket %llu", call, (unsigned long long)s);
  if (!it->second.info.open) Fatal("%s: socket %llu is closed", call, (unsigned long long)s);
  return it->second;
}

void ResetSockets() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  for (auto& [handle, rec] : st.sockets) {
    if (rec.fd >= 0) close(rec.fd);
  }
  st.sockets.clear();
  st.sent.clear();
  st.open = 0;
  st.sentCount = 0;
  st.sendErrors = 0;
  st.backend = SocketBackend::Memory;
  // Handles keep counting up so that a handle from before a reset stays
  // unknown.
}

void SocketLeftovers(std::vector<std::string>* out) {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  for (const auto& [handle, rec] : st.sockets) {
    if (rec.info.open) out->push_back("socket " + std::to_string(handle) + " open");
  }
}

[[maybe_unused]] const bool kSocketsRegistered =
    RegisterSubsystem(Subsystem{"sockets", ResetSockets, SocketLeftovers});

}  // namespace

void ResPools::Define(const std::string& name, uint16_t tag) {
  if (tag == ZEL_INVALID_RES_POOL_TAG) Fatal("ResPools::Define: tag 0xffff means no pool");
  PoolState& st = Pools();
  std::lock_guard<std::mutex> g(st.mu);
  st.pools[name] = tag;
}

int64_t ResPools::Outstanding(uint16_t tag) {
  PoolState& st = Pools();
  std::lock_guard<std::mutex> g(st.mu);
  auto it = st.outstanding.find(tag);
  return it == st.outstanding.end() ? 0 : it->second;
}

int64_t ResPools::OutstandingTotal() {
  PoolState& st = Pools();
  std::lock_guard<std::mutex> g(st.mu);
  int64_t total = 0;
  for (const auto& [tag, n] : st.outstanding) total += n;
  return total;
}

void Sockets::SetBackend(SocketBackend backend) {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  st.backend = backend;
}

SocketBackend Sockets::Backend() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.backend;
}

uint64_t Sockets::SentCount() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.sentCount;
}

uint64_t Sockets::SendErrors() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.sendErrors;
}

std::vector<SentDatagram> Sockets::Sent() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.sent;
}

void Sockets::ClearSent() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  st.sent.clear();
}

uint64_t Sockets::Open() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.open;
}

uint64_t Sockets::Created() {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  return st.sockets.size();
}

SocketInfo Sockets::Info(uint64_t s) {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  auto it = st.sockets.find(s);
  if (it == st.sockets.end()) Fatal("Sockets::Info: unknown socket %llu", (unsigned long long)s);
  return it->second.info;
}

std::vector<std::array<int32_t, 3>> Sockets::Options(uint64_t s) {
  SocketState& st = Socks();
  std::lock_guard<std::mutex> g(st.mu);
  auto it = st.sockets.find(s);
  if (it == st.sockets.end()) Fatal("Sockets::Options: unknown socket %llu", (unsigned long long)s);
  return it->second.options;
}

}  // namespace host

using host::Fatal;
using host::Faults;

uint16_t zel_PortsetGetResPoolTag(const char* name) {
  host::PoolState& st = host::Pools();
  std::lock_guard<std::mutex> g(st.mu);
  uint16_t tag = ZEL_INVALID_RES_POOL_TAG;
  if (name != nullptr) {
    auto it = st.pools.find(std::string_view(name));
    if (it != st.pools.end()) tag = it->second;
  }
  st.outstanding[tag]++;
  return tag;
}

void zel_PortsetPutResPoolTag(uint16_t tag) {
  host::PoolState& st = host::Pools();
  std::lock_guard<std::mutex> g(st.mu);
  auto it = st.outstanding.find(tag);
  if (it == st.outstanding.end() || it->second <= 0) {
    Fatal("zel_PortsetPutResPoolTag: tag %u handed back but not outstanding", tag);
  }
  if (--it->second == 0) st.outstanding.erase(it);
}

ZelStatus zel_SocketCreate(int32_t family, int32_t type, int32_t protocol, ZelSocket* sock) {
  if (ZelStatus s = Faults::Check("zel_SocketCreate")) return s;
  if (sock == nullptr) return ZEL_BAD_PARAM;
  if (family != ZEL_AF_INET || type != ZEL_SOCK_RAW || protocol != ZEL_IPPROTO_GRE) {
    return ZEL_BAD_PARAM;
  }
  host::SocketState& st = host::Socks();
  std::lock_guard<std::mutex> g(st.mu);
  int fd = -1;
  if (st.backend == host::SocketBackend::Kernel) {
    fd = socket(AF_INET, SOCK_RAW | SOCK_CLOEXEC, IPPROTO_GRE);
    if (fd < 0) return ZEL_FAILURE;
  }
  uint64_t handle = st.nextHandle++;
  st.sockets[handle] =
      host::SocketRecord{host::SocketInfo{family, type, protocol, true}, {}, fd};
  st.open++;
  *sock = handle;
  return ZEL_OK;
}

ZelStatus zel_SocketSetSockOpt(ZelSocket sock, int32_t level, int32_t option, const void* value,
                               uint32_t len) {
  if (ZelStatus s = Faults::Check("zel_SocketSetSockOpt")) return s;
  host::SocketState& st = host::Socks();
  std::lock_guard<std::mutex> g(st.mu);
  host::SocketRecord& rec = host::OpenSocket(st, sock, __func__);
  if (value == nullptr || len != sizeof(int32_t)) return ZEL_BAD_PARAM;
  int32_t v;
  std::memcpy(&v, value, sizeof v);
  if (rec.fd >= 0) {
    // Only the non-blocking option has a meaning here; others are recorded.
    if (level == ZEL_SOL_SOCKET && option == ZEL_SO_NONBLOCKING) {
      int flags = fcntl(rec.fd, F_GETFL);
      if (flags < 0 || fcntl(rec.fd, F_SETFL, v ? flags | O_NONBLOCK : flags & ~O_NONBLOCK) < 0) {
        return ZEL_FAILURE;
      }
    }
  }
  rec.options.push_back({level, option, v});
  return ZEL_OK;
}

ZelStatus zel_SocketSendTo(ZelSocket sock, int32_t flags, const void* addr, const void* buf,
                           size_t len, size_t* sent) {
  if (ZelStatus s = Faults::Check("zel_SocketSendTo")) return s;
  host::SocketState& st = host::Socks();
  std::lock_guard<std::mutex> g(st.mu);
  host::SocketRecord& rec = host::OpenSocket(st, sock, __func__);
  if (addr == nullptr || (buf == nullptr && len != 0)) return ZEL_BAD_PARAM;
  // A BSD IPv4 socket address: length 16, family, port (network order),
  // address, 8 bytes of zero padding.
  uint8_t sa[16];
  std::memcpy(sa, addr, sizeof sa);
  if (sa[0] != sizeof sa || sa[1] != ZEL_AF_INET) return ZEL_BAD_PARAM;
  if (rec.fd >= 0) {
    sockaddr_in dest{};
    dest.sin_family = AF_INET;
    std::memcpy(&dest.sin_port, sa + 2, 2);
    std::memcpy(&dest.sin_addr, sa + 4, 4);
    // The kernel adds the IPv4 header and routes; a full queue or an
    // unreachable destination loses the copy, as on a real host.
    ssize_t n = sendto(rec.fd, buf, len, MSG_NOSIGNAL,
                       reinterpret_cast<const sockaddr*>(&dest), sizeof dest);
    if (n < 0) {
      st.sendErrors++;
      return errno == EAGAIN || errno == EWOULDBLOCK ? ZEL_WOULD_BLOCK : ZEL_FAILURE;
    }
    st.sentCount++;
    if (sent != nullptr) *sent = static_cast<size_t>(n);
    return ZEL_OK;
  }
  st.sentCount++;
  host::SentDatagram d;
  d.socket = sock;
  d.family = sa[1];
  d.port = static_cast<uint16_t>((sa[2] << 8) | sa[3]);
  std::memcpy(d.addr, sa + 4, 4);
  d.flags = flags;
  const uint8_t* p = static_cast<const uint8_t*>(buf);
  d.bytes.assign(p, p + len);
  st.sent.push_back(std::move(d));
  if (sent != nullptr) *sent = len;
  return ZEL_OK;
}

void zel_SocketClose(ZelSocket sock) {
  host::SocketState& st = host::Socks();
  std::lock_guard<std::mutex> g(st.mu);
  host::SocketRecord& rec = host::OpenSocket(st, sock, __func__);
  rec.info.open = false;
  if (rec.fd >= 0) {
    close(rec.fd);
    rec.fd = -1;
  }
  st.open--;
}
