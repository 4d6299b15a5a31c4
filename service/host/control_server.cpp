#include "service/host/control_server.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <sstream>

#include "control/control.h"
#include "host/control/control_host.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/module.h"
#include "tools/lib/filter_view.h"
#include "tools/lib/render.h"

namespace service {
namespace {

using slcproto::Message;
using slcproto::Reply;
using slcproto::Type;

// A client gets this long to finish a request it started; a stalled or
// silent client cannot hold the control thread.
constexpr int kRequestTimeoutMs = 2000;
constexpr int kIdleMs = 5000;
// Status replies show at most this many rules per filter unless asked.
constexpr int64_t kDefaultMaxRules = 1000;
constexpr int64_t kMaxRulesLimit = 100000;

Message Fail(const std::string& why) { return Reply(false, why); }

Message FailStatus(const std::string& what, ZelStatus st) {
  Message m = Fail(what + ": " + zel_StatusToString(st));
  m.args["status"] = st;
  return m;
}

bool StringArg(const nlohmann::json& args, const char* key, std::string* out, size_t maxLen,
               std::string* error) {
  if (!args.contains(key)) {
    *error = std::string("missing argument '") + key + "'";
    return false;
  }
  if (!args[key].is_string() || args[key].get_ref<const std::string&>().size() > maxLen) {
    *error = std::string("argument '") + key + "' must be a string of at most " +
             std::to_string(maxLen) + " bytes";
    return false;
  }
  *out = args[key].get<std::string>();
  return true;
}

// The "name: value" lines of a rendered status leaf as a JSON object.
nlohmann::json LeafToJson(const std::string& text) {
  nlohmann::json out = nlohmann::json::object();
  std::istringstream in(text);
  std::string line;
  while (std::getline(in, line)) {
    const size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    size_t start = colon + 1;
    while (start < line.size() && line[start] == ' ') start++;
    std::string key = line.substr(0, colon);
    while (!key.empty() && key.front() == ' ') key.erase(key.begin());
    out[key] = line.substr(start);
  }
  return out;
}

std::string QryString(const host::QryValue& v) {
  if (const auto* s = std::get_if<std::string>(&v)) return *s;
  return std::to_string(std::get<int64_t>(v));
}

}  // namespace

ControlServer::~ControlServer() {
  Stop();
  (void)CloseAllPorts();
}

bool ControlServer::Start(const std::string& path, std::string* error) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof addr.sun_path) {
    *error = "control socket path empty or too long";
    return false;
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (listenFd_ < 0) {
    *error = std::string("socket: ") + std::strerror(errno);
    return false;
  }
  struct stat st {};
  if (lstat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) unlink(path.c_str());
  // The socket is created with no access for anyone but the owner, so there
  // is no window in which another user could connect.
  const mode_t old = umask(0177);
  const int rc = bind(listenFd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  umask(old);
  if (rc != 0 || chmod(path.c_str(), 0600) != 0 || listen(listenFd_, 16) != 0) {
    *error = "cannot listen on " + path + ": " + std::strerror(errno);
    close(listenFd_);
    listenFd_ = -1;
    return false;
  }
  path_ = path;
  stop_ = false;
  hub_.Install();
  thread_ = std::thread([this] { Serve(); });
  return true;
}

void ControlServer::Stop() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
  // Slow paths go before the ports: their filters detach while the links
  // can still answer.
  hub_.Shutdown();
  if (listenFd_ >= 0) {
    close(listenFd_);
    listenFd_ = -1;
    unlink(path_.c_str());
  }
}

void ControlServer::Serve() {
  while (!stop_) {
    pollfd p{listenFd_, POLLIN, 0};
    if (poll(&p, 1, 100) <= 0) continue;
    int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    ServeConnection(fd);
    close(fd);
  }
}

void ControlServer::ServeConnection(int fd) {
  std::string error;
  ucred cred{};
  socklen_t len = sizeof cred;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 ||
      (cred.uid != 0 && cred.uid != geteuid())) {
    (void)slcproto::WriteMessage(fd,
                                 Fail("permission denied: peer uid " + std::to_string(cred.uid) +
                                      " may not control this host"),
                                 &error);
    return;
  }
  // One connection is served at a time, which keeps requests (a port
  // removed, a ruleset written) in a simple order; a client idle for
  // kIdleMs is dropped so that it cannot hold the others off.
  int idleMs = 0;
  while (!stop_) {
    pollfd p{fd, POLLIN, 0};
    int r = poll(&p, 1, 100);
    if (r == 0) {
      if ((idleMs += 100) >= kIdleMs) return;
      continue;
    }
    idleMs = 0;
    if (r < 0 && errno == EINTR) continue;
    if (r < 0) return;
    Message req;
    if (!slcproto::ReadMessage(fd, &req, &error, kRequestTimeoutMs)) {
      // After a bad header or a short body the stream cannot be trusted to
      // find the next message: answer and hang up.
      if (error != "end of stream") (void)slcproto::WriteMessage(fd, Fail(error), &error);
      return;
    }
    if (req.type == Type::kSpRegister) {
      // The connection now belongs to the slow-path link.
      const int kept = dup(fd);
      if (kept < 0) {
        (void)slcproto::WriteMessage(fd, Fail("cannot keep the connection"), &error);
        return;
      }
      hub_.Adopt(kept, req);
      return;
    }
    Message reply;
    try {
      reply = Handle(req);
    } catch (const std::exception& e) {
      // A request that trips the JSON library (wrong types deep inside an
      // argument) is refused like any other malformed request.
      reply = Fail(std::string("malformed request: ") + e.what());
    }
    if (!slcproto::WriteMessage(fd, reply, &error)) return;
  }
}

bool ControlServer::CreateAgent(const std::string& text, std::string* error) {
  if (text.empty() || text.size() > 1024) {
    *error = "agent create text must be 1 to 1024 bytes";
    return false;
  }
  const std::string name = text.substr(0, text.find(':'));
  const bool existed = host::Sluice::AgentRegistered(name);
  const ZelStatus st = host::ClientPorts::Write(kSLCGenericCreateAgentPropName, text);
  if (st != ZEL_OK) {
    *error = std::string("agent not created: ") + zel_StatusToString(st);
    return false;
  }
  if (existed || !host::Sluice::AgentRegistered(name)) {
    *error = existed ? "agent " + name + " exists already" : "agent " + name + " was not created";
    return false;
  }
  return true;
}

bool ControlServer::AddPort(const PortSettings& settings, std::string* error) {
  std::lock_guard<std::mutex> g(mu_);
  if (ports_.count(settings.name) != 0) {
    *error = "port " + settings.name + " exists already";
    return false;
  }
  auto port = Port::Open(settings, error);
  if (!port) return false;
  ports_[settings.name] = std::move(port);
  return true;
}

bool ControlServer::RemovePort(const std::string& name, std::string* error) {
  std::unique_ptr<Port> port;
  {
    std::lock_guard<std::mutex> g(mu_);
    auto it = ports_.find(name);
    if (it == ports_.end()) {
      *error = "no port " + name;
      return false;
    }
    port = std::move(it->second);
    ports_.erase(it);
  }
  if (!port->Close()) {
    *error = "the filter of port " + name + " stayed busy";
    // Kept so that shutdown tries again.
    std::lock_guard<std::mutex> g(mu_);
    ports_[name] = std::move(port);
    return false;
  }
  return true;
}

bool ControlServer::CloseAllPorts() {
  std::lock_guard<std::mutex> g(mu_);
  bool ok = true;
  for (auto& [name, port] : ports_) ok = port->Close() && ok;
  if (ok) ports_.clear();
  return ok;
}

bool ControlServer::WithPort(const std::string& name, const std::function<void(Port&)>& fn) {
  std::lock_guard<std::mutex> g(mu_);
  auto it = ports_.find(name);
  if (it == ports_.end()) return false;
  fn(*it->second);
  return true;
}

bool ControlServer::FindPort(const nlohmann::json& args, std::string* agent, host::FilterId* id,
                             std::string* error) {
  std::string name;
  if (!StringArg(args, "filter", &name, 99, error)) return false;
  std::lock_guard<std::mutex> g(mu_);
  auto it = ports_.find(name);
  if (it == ports_.end()) {
    *error = "no port " + name;
    return false;
  }
  *agent = it->second->settings().agent;
  *id = it->second->filter();
  return true;
}

Message ControlServer::RulesetWrite(const Message& req) {
  std::string agent, error;
  host::FilterId id = 0;
  if (!FindPort(req.args, &agent, &id, &error)) return Fail(error);
  const ZelStatus st = host::Sluice::PropertyWrite(agent + ".ruleset", id, req.blob);
  if (st != ZEL_OK) return FailStatus("the ruleset property refused the ruleset", st);
  return Reply(true);
}

Message ControlServer::RulesetRead(const Message& req, bool pollOnly) {
  std::string agent, error;
  host::FilterId id = 0;
  if (!FindPort(req.args, &agent, &id, &error)) return Fail(error);
  const std::string prop = agent + ".ruleset";
  if (pollOnly) {
    uint32_t size = 0;
    const bool ready = host::Sluice::PropertyPoll(prop, id, &size);
    Message m = Reply(true);
    m.args["ready"] = ready;
    m.args["size"] = size;
    return m;
  }
  std::vector<uint8_t> bytes;
  ZelStatus st = ZEL_OK;
  if (!host::Sluice::PropertyRead(prop, id, &bytes, &st)) return Fail("no ruleset to read");
  if (st != ZEL_OK) return FailStatus("reading the ruleset property failed", st);
  if (bytes.size() > slcproto::kMaxBlob) return Fail("ruleset too large to send");
  Message m = Reply(true);
  m.blob = std::move(bytes);
  return m;
}

// Device requests: a request record in the caller's (emulated) user memory,
// the ruleset after it when setting, one ioctl on the agent's device.
Message ControlServer::Device(const Message& req) {
  std::string error, agent, filterName, uuid;
  uint32_t vnic = 0;
  if (req.args.contains("filter")) {
    if (!StringArg(req.args, "filter", &filterName, sizeof(FWCharDevRequest::filterName) - 1,
                   &error)) {
      return Fail(error);
    }
  } else if (req.args.contains("uuid")) {
    if (!StringArg(req.args, "uuid", &uuid, sizeof(FWCharDevRequest::hqUUID) - 1, &error)) {
      return Fail(error);
    }
    if (req.args.contains("vnic")) {
      if (!req.args["vnic"].is_number_unsigned() || req.args["vnic"].get<uint64_t>() > UINT32_MAX) {
        return Fail("argument 'vnic' must be an unsigned 32-bit number");
      }
      vnic = req.args["vnic"].get<uint32_t>();
    }
  } else {
    return Fail("a device request names a filter, or a uuid and vnic index");
  }
  if (req.args.contains("agent")) {
    if (!StringArg(req.args, "agent", &agent, 99, &error)) return Fail(error);
  } else {
    std::lock_guard<std::mutex> g(mu_);
    // The agent of the port named, or of the port with that VM and vNIC.
    auto it = filterName.empty() ? ports_.end() : ports_.find(filterName);
    if (it == ports_.end() && !uuid.empty()) {
      for (it = ports_.begin(); it != ports_.end(); ++it) {
        if (it->second->settings().vmUUID == uuid && it->second->settings().vnicIndex == vnic) break;
      }
    }
    if (it != ports_.end()) {
      agent = it->second->settings().agent;
    } else {
      auto agents = host::Sluice::Agents();
      if (agents.size() != 1) return Fail("say which agent's device to use (agent)");
      agent = agents[0];
    }
  }
  if (!host::CharDevs::Registered(agent)) return Fail("no device for agent " + agent);

  FWCharDevRequest r{};
  std::memcpy(r.filterName, filterName.data(), filterName.size());
  std::memcpy(r.hqUUID, uuid.data(), uuid.size());
  r.vNicIndex = vnic;
  size_t size = sizeof r;
  switch (req.type) {
    case Type::kDevSetRuleset:
      r.type = FWCharDevReqSetRuleset;
      if (req.blob.size() < FW_RULESET_HEADER_SIZE) return Fail("no ruleset to set");
      size += req.blob.size();
      break;
    case Type::kDevGetRuleset: {
      r.type = FWCharDevReqGetRuleset;
      // The device writes header plus records over the request: room for
      // the rules in force as the status tree counts them, and some.
      uint64_t rules = 0;
      std::vector<host::QryValue> filters;
      std::vector<uint8_t> summary;
      if (host::StatusTree::List({"agents", agent, "filters"}, &filters) == ZEL_OK) {
        for (const auto& f : filters) {
          if (host::StatusTree::Get({"agents", agent, "filters", f, "ruleSetSummary"}, &summary) ==
                  ZEL_OK &&
              summary.size() >= sizeof(SLCGeneric_RuleSetSummary)) {
            uint32_t n;
            std::memcpy(&n, summary.data() + offsetof(SLCGeneric_RuleSetSummary, numRules), 4);
            rules = std::max<uint64_t>(rules, n);
          }
        }
      }
      size = std::max<size_t>(size, FW_RULESET_HEADER_SIZE + (rules + 64) * FW_RULE_SIZE_V8);
      if (size > slcproto::kMaxBlob) return Fail("ruleset too large to fetch");
      break;
    }
    default:
      r.type = FWCharDevReqSendIoctl;
      break;
  }
  std::vector<uint8_t> user(size);
  std::memcpy(user.data(), &r, sizeof r);
  if (req.type == Type::kDevSetRuleset) {
    std::memcpy(user.data() + sizeof r, req.blob.data(), req.blob.size());
  }
  const uint64_t addr = host::UserMemory::Map(std::move(user));
  int32_t result = 0;
  const ZelStatus st = host::CharDevs::Ioctl(agent, 0, addr, &result);
  std::vector<uint8_t> back;
  if (st == ZEL_OK && req.type == Type::kDevGetRuleset) back = host::UserMemory::Read(addr, size);
  host::UserMemory::Unmap(addr);
  if (st != ZEL_OK) return FailStatus("the device refused the request", st);
  Message m = Reply(true);
  m.args["result"] = result;
  if (req.type == Type::kDevGetRuleset && back.size() >= FW_RULESET_HEADER_SIZE) {
    uint32_t n;
    std::memcpy(&n, back.data() + offsetof(FWRulesetHeader, numRules), 4);
    const uint64_t len = FW_RULESET_HEADER_SIZE + uint64_t{n} * FW_RULE_SIZE_V8;
    if (len <= back.size()) back.resize(len);
    m.blob = std::move(back);
  }
  return m;
}

Message ControlServer::Status(const Message& req) {
  int64_t maxRules = kDefaultMaxRules;
  if (req.args.contains("maxRules")) {
    if (!req.args["maxRules"].is_number_integer()) return Fail("maxRules must be a number");
    maxRules = std::clamp<int64_t>(req.args["maxRules"].get<int64_t>(), 0, kMaxRulesLimit);
  }
  std::string only;
  if (req.args.contains("agent")) {
    std::string error;
    if (!StringArg(req.args, "agent", &only, 99, &error)) return Fail(error);
  }
  nlohmann::json tree = nlohmann::json::array();
  std::vector<host::QryValue> agents;
  ZelStatus st = host::StatusTree::List({"agents"}, &agents);
  if (st != ZEL_OK) return FailStatus("listing agents failed", st);
  for (const auto& a : agents) {
    const std::string agentName = QryString(a);
    if (!only.empty() && agentName != only) continue;
    nlohmann::json agentJson = {{"name", agentName}, {"filters", nlohmann::json::array()}};
    std::vector<host::QryValue> filters;
    if (host::StatusTree::List({"agents", a, "filters"}, &filters) != ZEL_OK) continue;
    for (const auto& f : filters) {
      nlohmann::json fj = {{"name", QryString(f)}};
      std::string text;
      if (host::StatusTree::Render({"agents", a, "filters", f, "ruleSetSummary"}, &text) ==
          ZEL_OK) {
        fj["ruleSetSummary"] = LeafToJson(text);
      }
      // Rules and counters as every tool lists them (tools/lib/render.h).
      size_t omitted = 0;
      const render::CounterListing listing = filterview::ReadCounters(
          agentName, QryString(f), {}, static_cast<size_t>(maxRules), &omitted);
      fj["counters"] = render::CountersJson(listing);
      if (omitted != 0) fj["rulesOmitted"] = omitted;
      agentJson["filters"].push_back(std::move(fj));
    }
    tree.push_back(std::move(agentJson));
  }
  Message m = Reply(true);
  m.args["agents"] = std::move(tree);
  std::string dumped = m.args.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  if (dumped.size() > slcproto::kMaxArgs) {
    // Too big for the argument part: the tree goes in the blob as JSON.
    m.args = Reply(true).args;
    m.args["inBlob"] = true;
    nlohmann::json agentsOnly = {{"agents", std::move(tree)}};
    std::string text = agentsOnly.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
    if (text.size() > slcproto::kMaxBlob) return Fail("status tree too large; ask for fewer rules");
    m.blob.assign(text.begin(), text.end());
  }
  return m;
}

Message ControlServer::Stats() {
  Message m = Reply(true);
  const ZelHeapID heap = host::Heaps::ModuleHeap();
  const host::HeapStats hs =
      heap != nullptr && host::Heaps::Exists(heap) ? host::Heaps::Stats(heap) : host::HeapStats{};
  m.args["heapBytes"] = hs.bytes;
  m.args["heapBlocks"] = hs.blocks;
  m.args["livePackets"] = host::Packets::Live();
  m.args["pendingTimers"] = host::Timers::Pending();
  m.args["greSent"] = host::Sockets::SentCount();
  m.args["greErrors"] = host::Sockets::SendErrors();
  nlohmann::json ports = nlohmann::json::array();
  {
    std::lock_guard<std::mutex> g(mu_);
    for (auto& [name, port] : ports_) {
      nlohmann::json pj = PortSettingsToJson(port->settings());
      pj["traffic"] = port->Stats();
      ports.push_back(std::move(pj));
    }
  }
  m.args["ports"] = std::move(ports);
  m.args["slowPaths"] = hub_.Stats();
  return m;
}

Message ControlServer::Handle(const Message& req) {
  std::string error;
  switch (req.type) {
    case Type::kHello: {
      Message m = Reply(true);
      m.args["host"] = "sluice-host";
      m.args["protocol"] = slcproto::kVersion;
      m.args["pid"] = getpid();
      return m;
    }
    case Type::kCreateAgent: {
      std::string text;
      if (!StringArg(req.args, "text", &text, 1024, &error) || !CreateAgent(text, &error)) {
        return Fail(error);
      }
      return Reply(true);
    }
    case Type::kAddPort: {
      PortSettings settings;
      if (!req.args.contains("port") || !PortSettingsFromJson(req.args["port"], &settings, &error) ||
          !AddPort(settings, &error)) {
        return Fail(error.empty() ? "missing argument 'port'" : error);
      }
      return Reply(true);
    }
    case Type::kRemovePort: {
      std::string name;
      if (!StringArg(req.args, "name", &name, 99, &error) || !RemovePort(name, &error)) {
        return Fail(error);
      }
      return Reply(true);
    }
    case Type::kListPorts:
    case Type::kStats:
      return Stats();
    case Type::kRulesetWrite:
      return RulesetWrite(req);
    case Type::kRulesetRead:
      return RulesetRead(req, false);
    case Type::kRulesetPoll:
      return RulesetRead(req, true);
    case Type::kDevSetRuleset:
    case Type::kDevGetRuleset:
    case Type::kDevTestIoctl:
      return Device(req);
    case Type::kStatus:
      return Status(req);
    case Type::kMigrateOut:
      return MigrateOut(req);
    case Type::kMigrateIn:
      return MigrateIn(req);
    default:
      return Fail("unknown request type " + std::to_string(static_cast<unsigned>(req.type)));
  }
}

}  // namespace service
