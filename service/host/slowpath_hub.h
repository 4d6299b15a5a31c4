// The host's end of the slow-path link: every connected sluice-slowpath
// process is one slow path of one agent, registered with the framework
// under a number the hub hands out. The hub is the framework's slow path
// backend: the module's set, retrieve and restore requests become messages
// to the process, its answers become the requests' replies, faulted packets
// are forwarded, and what the process sends back (frames to re-issue, filter
// ioctl messages) goes to the filter through the framework.
//
// Guarantees the module relies on:
//  - every request the hub accepts gets exactly one reply: the process's
//    answer, or a failure when the request's time-out passes or the process
//    goes away first;
//  - a process that goes away (killed, closed, garbage on the link) has its
//    outstanding requests failed and its slow path unregistered, retried
//    while the module answers busy, so its filters move to another slow path
//    of the agent or wait detached.
//
// Threads: one reader and one writer per link, one time-out thread. Nothing
// calls into the module or the framework with the hub's lock held; sending
// to a process only queues (the queue is bounded for packets, which are
// dropped and counted when a process does not keep up).
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/sluice/framework.h"
#include "service/protocol/protocol.h"

namespace service {

class Port;

class SlowPathHub : public host::SlowPathBackend {
 public:
  // Runs `fn` on the port named `filter` while the port cannot be removed;
  // false when there is no such port.
  using WithPortFn = std::function<bool(const std::string& filter, const std::function<void(Port&)>& fn)>;

  explicit SlowPathHub(WithPortFn withPort);
  ~SlowPathHub() override;

  // Becomes the framework's slow path backend.
  void Install();
  // Closes every link (their slow paths unregistered) and stops being the
  // backend. Call before the ports' filters are destroyed.
  void Shutdown();

  // Takes over a connection whose first message, `reg`, was kSpRegister:
  // registers the slow path and answers; on failure answers with the reason
  // and closes `fd`. The hub owns `fd` either way.
  void Adopt(int fd, const slcproto::Message& reg);

  // Links and what passed over them, for the status reply.
  nlohmann::json Stats();
  // Whether the agent has a slow path connected now.
  bool HasSlowPath(const std::string& agent);
  // Waits (at most `waitMs`) until no request for the filter is outstanding.
  bool WaitQuiet(host::FilterId filter, int waitMs);
  // Status of the last slow-path restore reply for the filter; -1 if none.
  int64_t LastRestoreStatus(host::FilterId filter);

  // host::SlowPathBackend
  ZelStatus Request(host::SlowPathRequest request) override;
  void Cleared(host::FilterId filter, uint32_t slowPathId) override;
  void Faulted(host::FilterId filter, uint32_t slowPathId, uint32_t direction,
               std::vector<ZelPkt*> packets) override;

 private:
  using Clock = std::chrono::steady_clock;

  struct Pending {
    uint64_t token = 0;
    host::RequestKind kind = host::RequestKind::SetSlowPath;
    host::FilterId filter = 0;
    std::string filterName;
    Clock::time_point deadline;
  };

  struct Link {
    uint32_t id = 0;
    std::string agent, name;
    int fd = -1;                          // closed (-1) under the hub's mu_
    std::thread reader, writer;
    std::atomic<bool> finished{false};   // reader done, link torn down

    // Outgoing queue, guarded by qmu.
    std::mutex qmu;
    std::condition_variable qcv;
    std::deque<std::vector<uint8_t>> queue;
    size_t queuedBytes = 0;
    bool closing = false;

    // Guarded by the hub's mu_.
    bool dead = false;
    uint64_t nextSeq = 1;
    std::map<uint64_t, Pending> pending;                 // by seq
    std::map<host::FilterId, std::string> filters;       // attached
    uint64_t punted = 0, puntDropped = 0, reissued = 0, ioctls = 0;
  };

  void Reader(std::shared_ptr<Link> link);
  void Writer(std::shared_ptr<Link> link);
  void TimeOuts();
  void Teardown(const std::shared_ptr<Link>& link);
  // Queues a message; `droppable` ones are refused past the queue bound.
  bool Send(Link& link, const slcproto::Message& msg, bool droppable);
  void Answer(const std::shared_ptr<Link>& link, const slcproto::Message& reply);
  slcproto::Message Reissue(const std::shared_ptr<Link>& link, const slcproto::Message& req);
  slcproto::Message Ioctl(const std::shared_ptr<Link>& link, const slcproto::Message& req);
  // The filter id of `name` when it is attached to `link`; 0 otherwise.
  host::FilterId AttachedFilter(const std::shared_ptr<Link>& link, const std::string& name);
  void ReapLocked();

  WithPortFn withPort_;
  std::mutex mu_;
  std::map<uint32_t, std::shared_ptr<Link>> links_;    // live and being torn down
  std::map<host::FilterId, int64_t> lastRestore_;
  uint32_t nextId_ = 1;
  bool installed_ = false;
  // One filter ioctl at a time: the replies are collected from the filter
  // right after the request.
  std::mutex ioctlMu_;
  std::atomic<bool> stop_{false};
  std::thread timeouts_;
};

}  // namespace service
