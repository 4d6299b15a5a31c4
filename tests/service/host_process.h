// A sluice-host process for the service tests: one agent, no ports, a
// control socket in a fresh directory, bounded by --max-seconds and killed
// on every path by the destructor.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include "service/protocol/protocol.h"

struct HostProcess {
  std::string dir, sock;
  pid_t pid = -1;

  // Starts the host with agent create text `agent` (its standard error
  // discarded); true once it answers hello.
  bool Start(const char* agent) {
    char tmpl[] = "/tmp/sluice-service-test.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) return false;
    dir = tmpl;
    sock = dir + "/ctl.sock";
    pid = fork();
    if (pid < 0) return false;
    if (pid == 0) {
      int devnull = open("/dev/null", O_WRONLY);
      dup2(devnull, 2);
      execl(SLUICE_HOST_BIN, "sluice-host", "--socket", sock.c_str(), "--gre", "memory",
            "--agent", agent, "--max-seconds", "60", static_cast<char*>(nullptr));
      _exit(127);
    }
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
  // Stops the host with SIGTERM and returns its exit status.
  int Stop() {
    kill(pid, SIGTERM);
    int status = 0;
    waitpid(pid, &status, 0);
    pid = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  ~HostProcess() {
    if (pid > 0) {
      kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
    if (!sock.empty()) unlink(sock.c_str());
    if (!dir.empty()) rmdir(dir.c_str());
  }
};
