// A sluice-host process for the service tests: a control socket in a fresh
// directory, bounded by --max-seconds and killed on every path by the
// destructor, which also removes the directory.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "service/protocol/protocol.h"

struct HostProcess {
  std::string dir, sock;
  pid_t pid = -1;

  // A fresh directory for the socket (and any file a test puts there).
  bool MakeDir() {
    char tmpl[] = "/tmp/sluice-service-test.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) return false;
    dir = tmpl;
    sock = dir + "/ctl.sock";
    return true;
  }
  // Starts sluice-host with `args`, its standard error discarded.
  bool Spawn(std::vector<std::string> args) {
    args.insert(args.begin(), "sluice-host");
    args.insert(args.end(), {"--max-seconds", "60"});
    pid = fork();
    if (pid < 0) return false;
    if (pid == 0) {
      int devnull = open("/dev/null", O_WRONLY);
      dup2(devnull, 2);
      std::vector<char*> argv;
      for (std::string& a : args) argv.push_back(a.data());
      argv.push_back(nullptr);
      execv(SLUICE_HOST_BIN, argv.data());
      _exit(127);
    }
    return true;
  }
  // True once the host answers hello on `sock` (within five seconds).
  bool Answers() {
    slcproto::Message hello, reply;
    hello.type = slcproto::Type::kHello;
    for (int i = 0; i < 100; i++) {
      std::string error;
      if (slcproto::Call(sock, hello, &reply, &error, 5000) && reply.args.value("ok", false)) {
        return true;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
  }
  // The host with agent create text `agent`, no ports and GRE in memory.
  bool Start(const char* agent) {
    return MakeDir() &&
           Spawn({"--socket", sock, "--gre", "memory", "--agent", agent}) && Answers();
  }
  // One request on a new connection: the reply, or a message whose only
  // argument is the error when none came.
  slcproto::Message Call(slcproto::Type type, nlohmann::json args = nlohmann::json::object(),
                         std::vector<uint8_t> blob = {}) {
    slcproto::Message m, reply;
    m.type = type;
    m.args = std::move(args);
    m.blob = std::move(blob);
    std::string error;
    if (!slcproto::Call(sock, m, &reply, &error, 5000)) {
      reply = {};
      reply.args["error"] = error;
    }
    return reply;
  }
  uint64_t HeapBytes() {
    return Call(slcproto::Type::kStats).args.value("heapBytes", UINT64_MAX);
  }
  // Waits for the host to exit and returns its exit status (128 + signal).
  int Wait() {
    int status = 0;
    waitpid(pid, &status, 0);
    pid = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  // Stops the host with SIGTERM and returns its exit status.
  int Stop() {
    kill(pid, SIGTERM);
    return Wait();
  }
  ~HostProcess() {
    if (pid > 0) {
      kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
    std::error_code ignored;
    if (!dir.empty()) std::filesystem::remove_all(dir, ignored);
  }
};
