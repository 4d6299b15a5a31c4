// sluice-host: keeps the module loaded in the userspace host, puts its
// filters on real Linux interfaces and serves operators on a Unix control
// socket until SIGTERM or SIGINT. Exits 0 only when the module, unloaded,
// left no heap bytes, packets, timers or other objects behind.
#include <signal.h>

#include <CLI/CLI.hpp>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <fstream>
#include <string>
#include <vector>

#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "module/module.h"
#include "service/host/control_server.h"

namespace {

// Set from the signal handler, which may run on any thread: a lock-free
// atomic, so that the main loop's read is ordered with it.
std::atomic<int> gStopSignal{0};
static_assert(std::atomic<int>::is_always_lock_free, "used from a signal handler");
void OnStopSignal(int sig) { gStopSignal.store(sig, std::memory_order_relaxed); }

struct Config {
  std::string socketPath = "/run/sluice-host.sock";
  std::vector<std::string> agents;
  std::vector<std::string> ports;
  std::string gre = "kernel";
  double maxSeconds = 0;
  bool logEcho = false;
};

// "agent TEXT", "port SETTINGS", "socket PATH", "gre MODE"; '#' comments.
bool ReadConfig(const std::string& path, Config* c, std::string* error) {
  std::ifstream in(path);
  if (!in) {
    *error = "cannot read " + path;
    return false;
  }
  std::string line;
  int n = 0;
  while (std::getline(in, line)) {
    n++;
    if (const size_t hash = line.find('#'); hash != std::string::npos) line.resize(hash);
    const size_t start = line.find_first_not_of(" \t");
    if (start == std::string::npos) continue;
    line = line.substr(start);
    while (!line.empty() && (line.back() == ' ' || line.back() == '\t' || line.back() == '\r')) {
      line.pop_back();
    }
    const size_t sp = line.find_first_of(" \t");
    const std::string key = line.substr(0, sp);
    const std::string value =
        sp == std::string::npos ? "" : line.substr(line.find_first_not_of(" \t", sp));
    if (value.empty()) {
      *error = path + ":" + std::to_string(n) + ": '" + key + "' needs a value";
      return false;
    }
    if (key == "agent") {
      c->agents.push_back(value);
    } else if (key == "port") {
      c->ports.push_back(value);
    } else if (key == "socket") {
      c->socketPath = value;
    } else if (key == "gre") {
      c->gre = value;
    } else {
      *error = path + ":" + std::to_string(n) + ": unknown setting '" + key + "'";
      return false;
    }
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  Config c;
  std::string configPath;
  CLI::App app{
      "sluice-host: runs the filter module on live traffic.\n\n"
      "Loads the module, creates the agents given, opens the ports given (a\n"
      "port is a filter between a VM-side and a switch-side interface) and\n"
      "serves sluice-ctl on a Unix control socket (mode 0600, only root and\n"
      "the host's own user). Frames read on the VM side go to the filter as\n"
      "direction 2 (to switch), frames read on the switch side as direction 1;\n"
      "what the filter passes goes out on the other interface, frames it turns\n"
      "back go out on the switch side, GRE copies go through a raw socket and\n"
      "the kernel's routing. Senders should have checksum and segmentation\n"
      "offload off (ethtool -K IF tx off tso off gso off).\n\n"
      "Slow paths (sluice-slowpath) register with an agent on the same socket;\n"
      "punted packets go to the slow path a filter is attached to. When one\n"
      "goes away its filters move to another or wait detached. 'sluice-ctl\n"
      "migrate PORT --to SOCKET' moves a port's filter, with its rules,\n"
      "counters and slow path state, to the sluice-host serving SOCKET.\n\n"
      "SIGTERM or SIGINT unloads the module; the exit status is 0 only when it\n"
      "left nothing behind (heap bytes, packets, timers, sockets).",
      "sluice-host"};
  app.add_option("--socket", c.socketPath, "control socket path")->capture_default_str();
  app.add_option("--agent", c.agents,
                 "create an agent: NAME[:default-action=ACTION_DROP|ACTION_PUNT|ACTION_ACCEPT]"
                 " (repeatable)");
  app.add_option("--port", c.ports,
                 "open a port: name=FILTER,agent=AGENT,vm=IF,switch=IF[,uuid=UUID][,vnic=N]"
                 "[,endpoint=N][,failure=N] (repeatable)");
  app.add_option("--config", configPath,
                 "read settings from a file, one per line: 'agent TEXT', 'port SETTINGS',"
                 " 'socket PATH', 'gre kernel|memory'");
  app.add_option("--gre", c.gre,
                 "where GRE copies go: 'kernel' (raw IPPROTO_GRE socket) or 'memory' (counted,"
                 " not sent)")
      ->check(CLI::IsMember({"kernel", "memory"}))
      ->capture_default_str();
  app.add_option("--max-seconds", c.maxSeconds,
                 "stop by itself after this many seconds, as on SIGTERM (0: never)");
  app.add_flag("--log-echo", c.logEcho, "print the module log on stderr as it is written");
  CLI11_PARSE(app, argc, argv);

  std::string error;
  if (!configPath.empty()) {
    Config fromFile;
    if (!ReadConfig(configPath, &fromFile, &error)) {
      std::fprintf(stderr, "sluice-host: %s\n", error.c_str());
      return 2;
    }
    // Command-line values come after the file's.
    fromFile.agents.insert(fromFile.agents.end(), c.agents.begin(), c.agents.end());
    fromFile.ports.insert(fromFile.ports.end(), c.ports.begin(), c.ports.end());
    if (app.count("--socket") == 0) c.socketPath = fromFile.socketPath;
    if (app.count("--gre") == 0) c.gre = fromFile.gre;
    c.agents = fromFile.agents;
    c.ports = fromFile.ports;
  }
  std::vector<service::PortSettings> ports;
  for (const auto& text : c.ports) {
    service::PortSettings settings;
    if (!service::ParsePortSettings(text, &settings, &error)) {
      std::fprintf(stderr, "sluice-host: --port %s: %s\n", text.c_str(), error.c_str());
      return 2;
    }
    ports.push_back(settings);
  }

  // The host's own threads exist before main runs, so a stop signal may land
  // on any of them: the handler only records it for the main loop.
  struct sigaction sa {};
  sa.sa_handler = OnStopSignal;
  sigemptyset(&sa.sa_mask);
  sigaction(SIGTERM, &sa, nullptr);
  sigaction(SIGINT, &sa, nullptr);
  signal(SIGPIPE, SIG_IGN);

  host::Reset();
  host::Sockets::SetBackend(c.gre == "kernel" ? host::SocketBackend::Kernel
                                              : host::SocketBackend::Memory);
  host::Log::SetEcho(c.logEcho);
  if (host::Loader::Load(&slcGenericModuleImage) != 0) {
    std::fprintf(stderr, "sluice-host: the module did not start\n");
    for (const auto& r : host::Log::Records()) std::fprintf(stderr, "  %s", r.rendered.c_str());
    return 1;
  }

  int rc = 0;
  {
    service::ControlServer server;
    for (const auto& text : c.agents) {
      if (!server.CreateAgent(text, &error)) {
        std::fprintf(stderr, "sluice-host: --agent %s: %s\n", text.c_str(), error.c_str());
        rc = 1;
      }
    }
    for (const auto& settings : ports) {
      if (rc == 0 && !server.AddPort(settings, &error)) {
        std::fprintf(stderr, "sluice-host: port %s: %s\n", settings.name.c_str(), error.c_str());
        rc = 1;
      }
    }
    if (rc == 0 && !server.Start(c.socketPath, &error)) {
      std::fprintf(stderr, "sluice-host: %s\n", error.c_str());
      rc = 1;
    }
    if (rc == 0) {
      std::fprintf(stderr, "sluice-host: serving on %s (pid %d)\n", c.socketPath.c_str(), getpid());
      const auto start = std::chrono::steady_clock::now();
      for (;;) {
        timespec tick{0, 100 * 1000 * 1000};
        nanosleep(&tick, nullptr);
        if (const int sig = gStopSignal.load(std::memory_order_relaxed); sig != 0) {
          std::fprintf(stderr, "sluice-host: %s, stopping\n",
                       sig == SIGTERM ? "SIGTERM" : "SIGINT");
          break;
        }
        if (c.maxSeconds > 0 && std::chrono::steady_clock::now() - start >
                                    std::chrono::duration<double>(c.maxSeconds)) {
          std::fprintf(stderr, "sluice-host: ran for %.0f seconds, stopping\n", c.maxSeconds);
          break;
        }
        // The log is for tools and tests that look back; a long-running host
        // keeps only what arrived since the last tick.
        host::Log::Clear();
      }
    }
    server.Stop();
    if (!server.CloseAllPorts()) {
      std::fprintf(stderr, "sluice-host: a filter stayed busy\n");
      rc = 1;
    }
  }
  host::Timers::WaitIdle();
  host::Loader::Unload();
  for (const std::string& what : host::Leftovers()) {
    std::fprintf(stderr, "sluice-host: left behind: %s\n", what.c_str());
    rc = 1;
  }
  host::Reset();
  return rc;
}
