#include "service/host/slowpath_hub.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "service/host/ports.h"
#include "service/protocol/slowpath_link.h"

namespace service {
namespace {

using slcproto::Message;
using slcproto::Type;

// Punted frames waiting for a slow process beyond this are dropped.
constexpr size_t kQueueBound = 8u << 20;
// A request given no time-out by the module still ends.
constexpr uint32_t kMinTimeoutMs = 50;
// Unregistration is retried while the module answers busy, this long.
constexpr auto kUnregisterGiveUp = std::chrono::seconds(5);

Message Fail(const std::string& why) { return slcproto::Reply(false, why); }

bool U64Arg(const nlohmann::json& args, const char* key, uint64_t* out) {
  if (!args.contains(key) || !args[key].is_number_unsigned()) return false;
  *out = args[key].get<uint64_t>();
  return true;
}

bool NameArg(const nlohmann::json& args, const char* key, std::string* out) {
  if (!args.contains(key) || !args[key].is_string()) return false;
  const auto& s = args[key].get_ref<const std::string&>();
  if (s.empty() || s.size() > 99) return false;
  *out = s;
  return true;
}

Message WithSeq(Message m, const nlohmann::json& req) {
  if (req.contains("seq")) m.args["seq"] = req["seq"];
  return m;
}

}  // namespace

SlowPathHub::SlowPathHub(WithPortFn withPort) : withPort_(std::move(withPort)) {
  timeouts_ = std::thread([this] { TimeOuts(); });
}

SlowPathHub::~SlowPathHub() { Shutdown(); }

void SlowPathHub::Install() {
  std::lock_guard<std::mutex> g(mu_);
  host::Sluice::SetSlowPathBackend(this);
  installed_ = true;
}

void SlowPathHub::Shutdown() {
  std::vector<std::shared_ptr<Link>> links;
  {
    std::lock_guard<std::mutex> g(mu_);
    for (auto& [id, link] : links_) {
      // The reader sees the end of the stream and tears the link down.
      if (link->fd >= 0) ::shutdown(link->fd, SHUT_RDWR);
      links.push_back(link);
    }
  }
  for (auto& link : links) {
    if (link->reader.joinable()) link->reader.join();
  }
  stop_ = true;
  if (timeouts_.joinable()) timeouts_.join();
  std::lock_guard<std::mutex> g(mu_);
  links_.clear();
  if (installed_) {
    host::Sluice::SetSlowPathBackend(nullptr);
    installed_ = false;
  }
}

void SlowPathHub::ReapLocked() {
  for (auto it = links_.begin(); it != links_.end();) {
    if (it->second->finished) {
      if (it->second->reader.joinable()) it->second->reader.join();
      it = links_.erase(it);
    } else {
      ++it;
    }
  }
}

void SlowPathHub::Adopt(int fd, const Message& reg) {
  std::string agent, name = "slowpath", error;
  auto refuse = [&](const std::string& why) {
    (void)slcproto::WriteMessage(fd, Fail(why), &error);
    close(fd);
  };
  if (!NameArg(reg.args, "agent", &agent)) return refuse("a slow path names its agent (agent)");
  if (reg.args.contains("name") && !NameArg(reg.args, "name", &name)) {
    return refuse("name must be 1 to 99 bytes");
  }
  if (!host::Sluice::AgentRegistered(agent)) return refuse("no agent " + agent);

  auto link = std::make_shared<Link>();
  link->agent = agent;
  link->name = name;
  link->fd = fd;
  {
    std::lock_guard<std::mutex> g(mu_);
    if (stop_ || !installed_) return refuse("the host is stopping");
    ReapLocked();
    link->id = nextId_++;
    // Listed before registration: the attach pass may ask for it at once.
    links_[link->id] = link;
  }
  link->writer = std::thread([this, link] { Writer(link); });
  const ZelStatus st = host::Sluice::RegisterSlowPath(agent, link->id);
  Message reply = slcproto::Reply(st == ZEL_OK,
                                  std::string("the agent refused the slow path: ") +
                                      zel_StatusToString(st));
  reply.args["id"] = link->id;
  if (st != ZEL_OK) {
    {
      std::lock_guard<std::mutex> g(mu_);
      link->dead = true;
    }
    (void)Send(*link, reply, false);
    {
      std::lock_guard<std::mutex> q(link->qmu);
      link->closing = true;
    }
    link->qcv.notify_all();
    link->writer.join();
    std::lock_guard<std::mutex> g(mu_);
    close(fd);
    link->fd = -1;
    link->finished = true;
    return;
  }
  (void)Send(*link, reply, false);
  std::lock_guard<std::mutex> g(mu_);
  link->reader = std::thread([this, link] { Reader(link); });
}

bool SlowPathHub::Send(Link& link, const Message& msg, bool droppable) {
  std::vector<uint8_t> bytes;
  try {
    bytes = slcproto::Encode(msg);
  } catch (const std::length_error&) {
    return false;
  }
  {
    std::lock_guard<std::mutex> q(link.qmu);
    if (link.closing) return false;
    if (droppable && link.queuedBytes + bytes.size() > kQueueBound) return false;
    link.queuedBytes += bytes.size();
    link.queue.push_back(std::move(bytes));
  }
  link.qcv.notify_one();
  return true;
}

void SlowPathHub::Writer(std::shared_ptr<Link> link) {
  bool broken = false;
  for (;;) {
    std::vector<uint8_t> bytes;
    {
      std::unique_lock<std::mutex> q(link->qmu);
      link->qcv.wait(q, [&] { return link->closing || !link->queue.empty(); });
      if (link->queue.empty()) return;
      bytes = std::move(link->queue.front());
      link->queue.pop_front();
      link->queuedBytes -= bytes.size();
    }
    size_t done = 0;
    while (!broken && done < bytes.size()) {
      ssize_t n = send(link->fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        // The process is gone or stuck shut: the reader ends the link.
        broken = true;
        ::shutdown(link->fd, SHUT_RDWR);
        break;
      }
      done += static_cast<size_t>(n);
    }
  }
}

void SlowPathHub::Answer(const std::shared_ptr<Link>& link, const Message& reply) {
  (void)Send(*link, reply, false);
}

void SlowPathHub::Reader(std::shared_ptr<Link> link) {
  std::string error;
  for (;;) {
    Message m;
    if (!slcproto::ReadMessage(link->fd, &m, &error, 0)) break;
    try {
      if (m.type == Type::kReply) {
        uint64_t seq = 0;
        if (!U64Arg(m.args, "seq", &seq)) continue;
        Pending p;
        const bool ok = m.args.contains("ok") && m.args["ok"].is_boolean() && m.args["ok"].get<bool>();
        ZelStatus status = ok ? ZEL_OK : ZEL_FAILURE;
        uint64_t given = 0;
        if (!ok && U64Arg(m.args, "status", &given) && given != 0 && given <= UINT32_MAX) {
          status = static_cast<ZelStatus>(given);
        }
        {
          std::lock_guard<std::mutex> g(mu_);
          auto it = link->pending.find(seq);
          // Late (timed out) or made up: nothing waits for it.
          if (it == link->pending.end()) continue;
          p = std::move(it->second);
          link->pending.erase(it);
          if (p.kind == host::RequestKind::SetSlowPath && status == ZEL_OK) {
            link->filters[p.filter] = p.filterName;
          }
          if (p.kind == host::RequestKind::RestoreState) lastRestore_[p.filter] = status;
        }
        std::vector<uint8_t> data;
        if (p.kind == host::RequestKind::RetrieveState && status == ZEL_OK) data = std::move(m.blob);
        (void)host::Sluice::CompleteRequest(p.token, status, std::move(data));
        continue;
      }
      switch (m.type) {
        case Type::kSpReissue:
          Answer(link, WithSeq(Reissue(link, m), m.args));
          break;
        case Type::kSpIoctl:
          Answer(link, WithSeq(Ioctl(link, m), m.args));
          break;
        default:
          Answer(link, WithSeq(Fail("unexpected message type " +
                                    std::to_string(static_cast<unsigned>(m.type)) +
                                    " on a slow-path link"),
                               m.args));
          break;
      }
    } catch (const std::exception& e) {
      Answer(link, WithSeq(Fail(std::string("malformed message: ") + e.what()), m.args));
    }
  }
  Teardown(link);
}

void SlowPathHub::Teardown(const std::shared_ptr<Link>& link) {
  std::map<uint64_t, Pending> pending;
  {
    std::lock_guard<std::mutex> g(mu_);
    link->dead = true;
    pending.swap(link->pending);
    link->filters.clear();
    for (auto& [seq, p] : pending) {
      if (p.kind == host::RequestKind::RestoreState) lastRestore_[p.filter] = ZEL_FAILURE;
    }
  }
  // Each failed set request makes the module try again; the link is dead,
  // so that try is refused and the filter ends detached.
  for (auto& [seq, p] : pending) (void)host::Sluice::CompleteRequest(p.token, ZEL_FAILURE);

  auto registered = [&] {
    if (!host::Sluice::AgentRegistered(link->agent)) return false;
    for (uint32_t id : host::Sluice::SlowPaths(link->agent)) {
      if (id == link->id) return true;
    }
    return false;
  };
  const auto start = Clock::now();
  while (registered()) {
    const ZelStatus st = host::Sluice::UnregisterSlowPath(link->agent, link->id);
    if (st == ZEL_OK) break;
    if (Clock::now() - start > kUnregisterGiveUp) {
      std::fprintf(stderr, "sluice-host: slow path #%u of %s stays busy (%#x); left registered\n",
                   link->id, link->agent.c_str(), st);
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  {
    std::lock_guard<std::mutex> q(link->qmu);
    link->closing = true;
  }
  link->qcv.notify_all();
  // A process that stopped reading would hold the writer in send() for
  // ever; nothing queued for a dead link matters any more.
  ::shutdown(link->fd, SHUT_RDWR);
  if (link->writer.joinable()) link->writer.join();
  {
    // Under the lock: Shutdown must not shut down a number reused since.
    std::lock_guard<std::mutex> g(mu_);
    close(link->fd);
    link->fd = -1;
  }
  std::fprintf(stderr, "sluice-host: slow path #%u (%s) of %s went away\n", link->id,
               link->name.c_str(), link->agent.c_str());
  link->finished = true;
}

void SlowPathHub::TimeOuts() {
  while (!stop_) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    std::vector<Pending> expired;
    {
      std::lock_guard<std::mutex> g(mu_);
      const auto now = Clock::now();
      for (auto& [id, link] : links_) {
        for (auto it = link->pending.begin(); it != link->pending.end();) {
          if (it->second.deadline <= now) {
            if (it->second.kind == host::RequestKind::RestoreState) {
              lastRestore_[it->second.filter] = ZEL_FAILURE;
            }
            expired.push_back(std::move(it->second));
            it = link->pending.erase(it);
          } else {
            ++it;
          }
        }
      }
    }
    for (auto& p : expired) (void)host::Sluice::CompleteRequest(p.token, ZEL_FAILURE);
  }
}

ZelStatus SlowPathHub::Request(host::SlowPathRequest request) {
  std::lock_guard<std::mutex> g(mu_);
  auto it = links_.find(request.slowPathId);
  if (it == links_.end() || it->second->dead) return ZEL_NOT_FOUND;
  Link& link = *it->second;
  const uint64_t seq = link.nextSeq++;
  Message m;
  m.args["seq"] = seq;
  m.args["filter"] = request.filterName;
  switch (request.kind) {
    case host::RequestKind::SetSlowPath:
      m.type = Type::kSpAttach;
      m.args["slowPath"] = request.slowPathId;
      break;
    case host::RequestKind::RetrieveState:
      m.type = Type::kSpFetchState;
      break;
    case host::RequestKind::RestoreState:
      m.type = Type::kSpRestoreState;
      m.blob = std::move(request.data);
      break;
    default:
      return ZEL_NOT_SUPPORTED;
  }
  Pending p;
  p.token = request.token;
  p.kind = request.kind;
  p.filter = request.filter;
  p.filterName = request.filterName;
  p.deadline = Clock::now() + std::chrono::milliseconds(std::max(request.timeoutMs, kMinTimeoutMs));
  link.pending[seq] = std::move(p);
  if (!Send(link, m, false)) {
    link.pending.erase(seq);
    return ZEL_FAILURE;
  }
  return ZEL_OK;
}

void SlowPathHub::Cleared(host::FilterId filter, uint32_t slowPathId) {
  std::lock_guard<std::mutex> g(mu_);
  auto it = links_.find(slowPathId);
  if (it == links_.end() || it->second->dead) return;
  auto f = it->second->filters.find(filter);
  if (f == it->second->filters.end()) return;
  Message m;
  m.type = Type::kSpDetach;
  m.args["filter"] = f->second;
  it->second->filters.erase(f);
  (void)Send(*it->second, m, false);
}

void SlowPathHub::Faulted(host::FilterId filter, uint32_t slowPathId, uint32_t direction,
                          std::vector<ZelPkt*> packets) {
  Message m;
  m.type = Type::kSpPackets;
  m.args["direction"] = direction;
  m.args["count"] = packets.size();
  for (ZelPkt* p : packets) {
    const std::vector<uint8_t> frame = host::Packets::Frame(p);
    if (frame.size() <= slcproto::kMaxLinkFrame) slcproto::AppendFrame(&m.blob, frame);
    zel_PktRelease(p);
  }
  std::lock_guard<std::mutex> g(mu_);
  auto it = links_.find(slowPathId);
  if (it == links_.end() || it->second->dead) return;
  Link& link = *it->second;
  auto f = link.filters.find(filter);
  if (f == link.filters.end()) {
    link.puntDropped += packets.size();
    return;
  }
  m.args["filter"] = f->second;
  if (Send(link, m, true)) {
    link.punted += packets.size();
  } else {
    link.puntDropped += packets.size();
  }
}

host::FilterId SlowPathHub::AttachedFilter(const std::shared_ptr<Link>& link,
                                           const std::string& name) {
  std::lock_guard<std::mutex> g(mu_);
  for (auto& [id, n] : link->filters) {
    if (n == name) return id;
  }
  return 0;
}

Message SlowPathHub::Reissue(const std::shared_ptr<Link>& link, const Message& req) {
  std::string name, error;
  uint64_t direction = 0;
  if (!NameArg(req.args, "filter", &name)) return Fail("missing argument 'filter'");
  if (!U64Arg(req.args, "direction", &direction) || (direction != 1 && direction != 2)) {
    return Fail("direction must be 1 (from switch) or 2 (to switch)");
  }
  std::vector<std::vector<uint8_t>> frames;
  if (!slcproto::SplitFrames(req.blob, &frames, &error)) return Fail(error);
  const host::FilterId id = AttachedFilter(link, name);
  if (id == 0) return Fail("filter " + name + " is not attached to this slow path");
  size_t sent = 0;
  bool same = false;
  const bool found = withPort_(name, [&](Port& port) {
    same = port.filter() == id;
    if (same) sent = port.FromSlowPath(frames, static_cast<uint32_t>(direction));
  });
  if (!found || !same) return Fail("no port " + name);
  {
    std::lock_guard<std::mutex> g(mu_);
    link->reissued += sent;
  }
  Message m = slcproto::Reply(true);
  m.args["sent"] = sent;
  return m;
}

Message SlowPathHub::Ioctl(const std::shared_ptr<Link>& link, const Message& req) {
  std::string name;
  uint64_t code = 0;
  if (!NameArg(req.args, "filter", &name)) return Fail("missing argument 'filter'");
  if (!U64Arg(req.args, "code", &code) || code > UINT32_MAX) {
    return Fail("code must be an unsigned 32-bit number");
  }
  const host::FilterId id = AttachedFilter(link, name);
  if (id == 0) return Fail("filter " + name + " is not attached to this slow path");
  std::vector<host::IoctlReplyRecord> replies;
  bool same = false;
  const bool found = withPort_(name, [&](Port& port) {
    same = port.filter() == id;
    if (!same) return;
    std::lock_guard<std::mutex> g(ioctlMu_);
    host::Sluice::SendIoctl(id, static_cast<uint32_t>(code), req.blob);
    replies = host::Sluice::TakeIoctlReplies(id);
  });
  if (!found || !same) return Fail("no port " + name);
  {
    std::lock_guard<std::mutex> g(mu_);
    link->ioctls++;
  }
  Message m = slcproto::Reply(true);
  m.args["replies"] = nlohmann::json::array();
  for (auto& r : replies) {
    if (m.blob.size() + r.message.size() > slcproto::kMaxBlob) break;
    m.args["replies"].push_back({{"code", r.requestCode}, {"length", r.message.size()}});
    m.blob.insert(m.blob.end(), r.message.begin(), r.message.end());
  }
  return m;
}

nlohmann::json SlowPathHub::Stats() {
  std::lock_guard<std::mutex> g(mu_);
  nlohmann::json out = nlohmann::json::array();
  for (auto& [id, link] : links_) {
    if (link->dead) continue;
    nlohmann::json filters = nlohmann::json::array();
    for (auto& [fid, name] : link->filters) filters.push_back(name);
    out.push_back({{"id", id},
                   {"agent", link->agent},
                   {"name", link->name},
                   {"filters", filters},
                   {"punted", link->punted},
                   {"puntDropped", link->puntDropped},
                   {"reissued", link->reissued},
                   {"ioctls", link->ioctls},
                   {"outstanding", link->pending.size()}});
  }
  return out;
}

bool SlowPathHub::HasSlowPath(const std::string& agent) {
  std::lock_guard<std::mutex> g(mu_);
  for (auto& [id, link] : links_) {
    if (!link->dead && link->agent == agent) return true;
  }
  return false;
}

bool SlowPathHub::WaitQuiet(host::FilterId filter, int waitMs) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(waitMs);
  while (host::Sluice::OutstandingBackendRequests(filter) != 0) {
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

int64_t SlowPathHub::LastRestoreStatus(host::FilterId filter) {
  std::lock_guard<std::mutex> g(mu_);
  auto it = lastRestore_.find(filter);
  return it == lastRestore_.end() ? -1 : it->second;
}

}  // namespace service
