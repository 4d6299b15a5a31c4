// Moving a port's filter to another sluice-host: the source pauses the
// port, has the framework prefetch the slow path's state, asks for the
// saved-state length and saves; the saved state goes to the destination,
// which creates the filter on its own port (same name, VM, vNIC and failure
// policy), waits for the filter to be attached to a slow path if the agent
// has one there, restores, waits for the slow path's answer and only then
// lets traffic in. The source removes its port once the destination has
// taken the filter; if anything fails before that, the source port resumes
// as it was.
#include <cstdio>
#include <cstring>
#include <thread>

#include "host/core/host_core.h"
#include "service/host/control_server.h"

namespace service {
namespace {

using slcproto::Message;
using Clock = std::chrono::steady_clock;

// The module's own slow path time-out is 2 s; these leave room around it.
constexpr int kFetchWaitMs = 3000;
constexpr int kAttachWaitMs = 3000;
constexpr int kRestoreWaitMs = 3000;
constexpr int kPeerTimeoutMs = 15000;

// Saved-state header: u64 fields, little-endian.
constexpr size_t kStateHeaderSize = 48;
constexpr size_t kFastLengthAt = 24, kSlowLengthAt = 40;

uint64_t HeaderField(const std::vector<uint8_t>& state, size_t at) {
  uint64_t v = 0;
  if (state.size() >= kStateHeaderSize) {
    for (int i = 7; i >= 0; i--) v = v << 8 | state[at + static_cast<size_t>(i)];
  }
  return v;
}

Message Fail(const std::string& why) { return slcproto::Reply(false, why); }

Message FailStatus(const std::string& what, ZelStatus st) {
  char code[16];
  std::snprintf(code, sizeof code, "%#x", st);
  Message m = Fail(what + ": " + code + " " + zel_StatusToString(st));
  m.args["status"] = st;
  return m;
}

bool OptionalName(const nlohmann::json& args, const char* key, std::string* out,
                  std::string* error) {
  if (!args.contains(key)) return true;
  if (!args[key].is_string() || args[key].get_ref<const std::string&>().size() > 99) {
    *error = std::string("argument '") + key + "' must be a short string";
    return false;
  }
  *out = args[key].get<std::string>();
  return true;
}

}  // namespace

Message ControlServer::MigrateOut(const Message& req) {
  std::string name, to, vmIf, switchIf, error;
  if (!req.args.contains("port") || !req.args["port"].is_string() ||
      !req.args.contains("to") || !req.args["to"].is_string()) {
    return Fail("migrate needs 'port' and 'to' (the destination's control socket)");
  }
  name = req.args["port"].get<std::string>();
  to = req.args["to"].get<std::string>();
  if (!OptionalName(req.args, "vm", &vmIf, &error) ||
      !OptionalName(req.args, "switch", &switchIf, &error)) {
    return Fail(error);
  }
  if (to == path_) return Fail("the destination is this host");
  // Ports are removed only on this (the control) thread, so the port stays
  // while this request runs.
  Port* port = nullptr;
  {
    std::lock_guard<std::mutex> g(mu_);
    auto it = ports_.find(name);
    if (it == ports_.end()) return Fail("no port " + name);
    port = it->second.get();
  }
  PortSettings settings = port->settings();
  if (!vmIf.empty()) settings.vmIf = vmIf;
  if (!switchIf.empty()) settings.switchIf = switchIf;
  const host::FilterId id = port->filter();

  port->StopReaders();
  auto abandon = [&](Message why) {
    // A null length discards whatever the prefetch fetched and makes the
    // filter idle again; the port carries on here.
    (void)host::Sluice::GetSavedStateLen(id, nullptr);
    port->StartReaders();
    return why;
  };

  host::Sluice::PrefetchSavedState(id);
  uint64_t len = 0;
  ZelStatus st;
  const auto deadline = Clock::now() + std::chrono::milliseconds(kFetchWaitMs);
  while ((st = host::Sluice::GetSavedStateLen(id, &len)) == ZEL_NOT_READY &&
         Clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  if (st != ZEL_OK) return abandon(FailStatus("the filter's saved-state length", st));
  if (len > slcproto::kMaxBlob) return abandon(Fail("saved state too large to carry"));
  std::vector<uint8_t> state(len);
  st = host::Sluice::SaveState(id, state.data(), &len);
  if (st != ZEL_OK) return abandon(FailStatus("saving the filter's state", st));
  state.resize(len);

  Message in;
  in.type = slcproto::Type::kMigrateIn;
  in.args["port"] = PortSettingsToJson(settings);
  in.blob = state;
  Message answer;
  if (!slcproto::Call(to, in, &answer, &error, kPeerTimeoutMs)) {
    return abandon(Fail("destination " + to + ": " + error));
  }
  if (!answer.args.value("ok", false)) {
    Message m = abandon(Fail("destination refused the filter: " +
                             answer.args.value("error", std::string("no reason given"))));
    if (answer.args.contains("status")) m.args["status"] = answer.args["status"];
    return m;
  }
  if (!RemovePort(name, &error)) {
    Message m = Fail("the destination took the filter but " + error);
    m.args["destination"] = answer.args;
    return m;
  }
  Message m = slcproto::Reply(true);
  m.args["savedBytes"] = state.size();
  m.args["fastPathBytes"] = HeaderField(state, kFastLengthAt);
  m.args["slowPathBytes"] = HeaderField(state, kSlowLengthAt);
  m.args["destination"] = answer.args;
  return m;
}

Message ControlServer::MigrateIn(const Message& req) {
  std::string error;
  PortSettings settings;
  if (!req.args.contains("port") || !PortSettingsFromJson(req.args["port"], &settings, &error)) {
    return Fail(error.empty() ? "missing argument 'port'" : error);
  }
  {
    std::lock_guard<std::mutex> g(mu_);
    if (ports_.count(settings.name) != 0) return Fail("port " + settings.name + " exists already");
  }
  // Opened without readers: no frame meets the filter before its rules do.
  std::unique_ptr<Port> port = Port::Open(settings, &error, false);
  if (!port) return Fail(error);
  const host::FilterId id = port->filter();

  if (hub_.HasSlowPath(settings.agent)) {
    const auto deadline = Clock::now() + std::chrono::milliseconds(kAttachWaitMs);
    while (host::Sluice::SlowPathOf(id) == 0 && Clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
  }
  const uint32_t slowPath = host::Sluice::SlowPathOf(id);
  const ZelStatus st = host::Sluice::RestoreState(id, req.blob.data(), req.blob.size());
  if (st != ZEL_OK) {
    (void)hub_.WaitQuiet(id, kRestoreWaitMs);
    (void)port->Close();
    return FailStatus("the filter refused the saved state", st);
  }
  (void)hub_.WaitQuiet(id, kRestoreWaitMs);

  std::string slowPart = "none";
  if (HeaderField(req.blob, kSlowLengthAt) != 0) {
    if (slowPath == 0) {
      slowPart = "dropped";
    } else {
      slowPart = hub_.LastRestoreStatus(id) == ZEL_OK ? "restored" : "failed";
    }
  }
  port->StartReaders();
  {
    std::lock_guard<std::mutex> g(mu_);
    if (ports_.count(settings.name) == 0) {
      ports_[settings.name] = std::move(port);
    }
  }
  if (port) {
    // Closed outside the lock: destroying the filter talks to its slow path.
    (void)port->Close();
    return Fail("port " + settings.name + " appeared meanwhile");
  }
  Message m = slcproto::Reply(true);
  m.args["slowPath"] = slowPath;
  m.args["slowPathState"] = slowPart;
  return m;
}

}  // namespace service
