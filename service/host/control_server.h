// The host's side of the control socket: accepts operator connections on a
// Unix socket (mode 0600, peers of another user refused by their
// credentials), reads length-bounded requests and answers each through the
// module's own channel for it: the create-agent property, the agent's
// ruleset property, the agent's character device and the status tree.
// A connection that opens with kSpRegister is a slow path: it is handed to
// the slow-path hub for the rest of its life. Migration requests move a
// port's filter to or from another host (migration.cpp).
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "service/host/ports.h"
#include "service/host/slowpath_hub.h"
#include "service/protocol/protocol.h"

namespace service {

class ControlServer {
 public:
  ControlServer() = default;
  ~ControlServer();

  // Creates the socket at `path` (replacing a stale one) and starts serving.
  bool Start(const std::string& path, std::string* error);
  void Stop();

  // Agents and ports, also used by the host for its command-line
  // configuration. Thread-safe.
  bool CreateAgent(const std::string& text, std::string* error);
  bool AddPort(const PortSettings& settings, std::string* error);
  bool RemovePort(const std::string& name, std::string* error);
  // Closes every port; false when a filter would not go.
  bool CloseAllPorts();

  // One request to its reply (exposed for tests of the dispatch).
  slcproto::Message Handle(const slcproto::Message& request);

 private:
  void Serve();
  void ServeConnection(int fd);

  // Resolves args {filter} to a port's agent and filter id.
  bool FindPort(const nlohmann::json& args, std::string* agent, host::FilterId* id,
                std::string* error);

  slcproto::Message RulesetWrite(const slcproto::Message& req);
  slcproto::Message RulesetRead(const slcproto::Message& req, bool pollOnly);
  slcproto::Message Device(const slcproto::Message& req);
  slcproto::Message Status(const slcproto::Message& req);
  slcproto::Message Stats();
  slcproto::Message MigrateOut(const slcproto::Message& req);
  slcproto::Message MigrateIn(const slcproto::Message& req);
  bool WithPort(const std::string& name, const std::function<void(Port&)>& fn);

  std::string path_;
  int listenFd_ = -1;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  std::mutex mu_;  // ports_
  std::map<std::string, std::unique_ptr<Port>> ports_;
  SlowPathHub hub_{[this](const std::string& name, const std::function<void(Port&)>& fn) {
    return WithPort(name, fn);
  }};
};

}  // namespace service
