// The host's Sluice filter framework, as tests and tools drive it.
//
// It keeps the agents that registered, creates and destroys their filters,
// delivers packet lists, announces slow paths, answers the module's
// requests (set/clear slow path, retrieve/restore slow path state, filter
// ioctl requests) as a test programs it, and records what the module hands
// back (faulted and issued packet lists, ioctl replies).
//
// Request replies honour the framework contract: an accepted request gets
// exactly one reply, a refused one none. Replies can be made inline (before
// the request call returns), deferred (until the test releases them) or sent
// from another thread.
#pragma once

#include <array>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "host/net/packets.h"
#include "platform/zel.h"

namespace host {

struct FilterConfig {
  std::string name = "vnic0";
  uint32_t failurePolicy = 0;
  uint32_t endPointType = 0;
  std::string vmUUID;
  bool vmUUIDUnset = false;      // the UUID query answers ZEL_NOT_INITIALIZED
  uint32_t vnicIndex = 0;
  // Numbered configuration parameters 1 to 4 (element 0 is parameter 1).
  std::array<std::string, 4> parameters;
};

// The host's number for a filter; 0 = none.
using FilterId = uint64_t;

struct Delivery {
  uint32_t direction = 0;
  std::vector<ZelPkt*> packets;  // owned by the host until taken
};

enum class RequestKind { SetSlowPath, RetrieveState, RestoreState, IoctlRequest };

enum class ReplyMode {
  Inline,        // reply before the request call returns
  Deferred,      // reply when the test calls ReleaseReplies
  OtherThread,   // reply from a host thread, soon
};

struct RequestPolicy {
  ZelStatus refuse = ZEL_OK;         // non-zero: the call fails with it, no reply
  ReplyMode mode = ReplyMode::Inline;
  ZelStatus replyStatus = ZEL_OK;
  std::vector<uint8_t> replyData;    // retrieve: the slow path's state; ioctl: the answer
};

struct RequestRecord {
  RequestKind kind;
  FilterId filter = 0;
  uint32_t slowPathId = 0;           // set slow path
  uint32_t timeoutMs = 0;
  std::vector<uint8_t> data;         // restore: the bytes sent; ioctl: the payload
  uint32_t cookie = 0;               // ioctl request cookie
  ZelStatus result = ZEL_OK;         // what the call returned
};

// A slow path that lives outside the framework (a process on the other end
// of a socket). While one is installed, the framework hands it the set,
// retrieve and restore requests the module makes, tells it of cleared
// attachments and gives it the packets the module faults; test policies then
// apply only to filter ioctl requests.
struct SlowPathRequest {
  RequestKind kind = RequestKind::SetSlowPath;
  uint64_t token = 0;             // names the request in Sluice::CompleteRequest
  FilterId filter = 0;
  std::string filterName;
  uint32_t slowPathId = 0;        // set: the one asked for; else the filter's own
  uint32_t timeoutMs = 0;
  std::vector<uint8_t> data;      // restore: the slow path's saved bytes
};

class SlowPathBackend {
 public:
  virtual ~SlowPathBackend() = default;
  // Called without framework locks, possibly from inside a module callback.
  // A non-zero status refuses the request (the module gets it, no reply
  // follows). ZEL_OK obliges the backend to call Sluice::CompleteRequest
  // exactly once for the token, from a thread that holds none of the
  // backend's own locks (the module's reply may make a new request at once).
  virtual ZelStatus Request(SlowPathRequest request) = 0;
  // zel_SluiceClearSlowPath succeeded for the filter (synchronous, no reply).
  virtual void Cleared(FilterId filter, uint32_t slowPathId) = 0;
  // Faulted packets of a filter attached to `slowPathId`; the backend owns
  // them and must release each. Called from inside the packet callback.
  virtual void Faulted(FilterId filter, uint32_t slowPathId, uint32_t direction,
                       std::vector<ZelPkt*> packets) = 0;
};

struct IoctlReplyRecord {
  uint32_t requestCode = 0;
  std::vector<uint8_t> message;
};

class Sluice {
 public:
  // --- agents ---
  struct AgentInfo {
    std::string name;
    uint32_t version = 0;
    uint32_t opsVersion = 0;
    ZelModuleID module = -1;
    const ZelSluiceFastPathOps* ops = nullptr;
    void* priv = nullptr;
  };
  static bool AgentRegistered(std::string_view name);
  static std::vector<std::string> Agents();
  static AgentInfo Agent(std::string_view name);

  // --- filters ---
  // Calls the agent's create-filter callback. On success *id names the
  // filter; on failure no filter exists.
  static ZelStatus CreateFilter(std::string_view agent, const FilterConfig& config, FilterId* id);
  // One call of the destroy callback; on ZEL_OK the filter is forgotten.
  static ZelStatus DestroyFilter(FilterId id);
  static void* FilterPriv(FilterId id);
  // True from creation until a destroy call succeeded.
  static bool FilterAlive(FilterId id);
  static std::vector<FilterId> Filters(std::string_view agent);
  // Changes what the configuration queries answer, then (optionally) calls
  // the configuration-changed callback.
  static void SetFilterConfig(FilterId id, const FilterConfig& config);
  static void ConfigurationChanged(FilterId id);
  // The slow path the framework has set on the filter (0 = none).
  static uint32_t SlowPathOf(FilterId id);

  // --- packets ---
  static ZelStatus Deliver(FilterId id, PacketList& list, uint32_t direction);
  static ZelStatus DeliverFromSlowPath(FilterId id, PacketList& list, uint32_t direction);
  // Lists handed to zel_SluiceFaultPackets / zel_SluiceIssuePackets, in
  // order. Take* hands the packets to the caller (who releases them).
  static size_t FaultedCount(FilterId id);
  static size_t IssuedCount(FilterId id);
  static std::vector<Delivery> TakeFaulted(FilterId id);
  static std::vector<Delivery> TakeIssued(FilterId id);

  // --- slow paths ---
  static ZelStatus RegisterSlowPath(std::string_view agent, uint32_t slowPathId);
  // One call of the unregister callback; on ZEL_OK the slow path is forgotten.
  static ZelStatus UnregisterSlowPath(std::string_view agent, uint32_t slowPathId);
  static std::vector<uint32_t> SlowPaths(std::string_view agent);
  static void SlowPathIoctl(std::string_view agent, uint32_t slowPathId, uint32_t code,
                            std::vector<uint8_t> payload);

  // --- requests ---
  static void SetPolicy(RequestKind kind, const RequestPolicy& policy);
  // Successive answers of zel_SluiceClearSlowPath; ZEL_OK once used up.
  static void SetClearAnswers(std::vector<ZelStatus> answers);
  // Calls of zel_SluiceClearSlowPath for the filter (whatever they answered).
  static uint64_t ClearCalls(FilterId id);
  static size_t PendingReplies(RequestKind kind);
  // Sends up to `n` deferred replies of `kind`, oldest first, on this thread.
  // Only replies queued before the call are sent: a reply callback that makes
  // a new request (a retry) queues a reply for the next call.
  static size_t ReleaseReplies(RequestKind kind, size_t n = SIZE_MAX);
  // Waits until every reply sent from another thread has been delivered.
  static void WaitReplies();
  static std::vector<RequestRecord> Requests(RequestKind kind);
  static void ClearRequests();

  // --- an outside slow path ---
  // Installs (or, with null, removes) the backend. Removing it while
  // requests are outstanding aborts: complete them first.
  static void SetSlowPathBackend(SlowPathBackend* backend);
  // Delivers the one reply of an accepted backend request: the status, and
  // for a retrieve the slow path's bytes. False for an unknown token.
  static bool CompleteRequest(uint64_t token, ZelStatus status, std::vector<uint8_t> data = {});
  // Backend requests accepted and not yet completed, for one filter or all.
  static size_t OutstandingBackendRequests(FilterId filter = 0);

  // --- migration (the framework's save and restore calls) ---
  static void PrefetchSavedState(FilterId id);
  static ZelStatus GetSavedStateLen(FilterId id, uint64_t* len);
  static ZelStatus SaveState(FilterId id, void* buf, uint64_t* len);
  static ZelStatus RestoreState(FilterId id, const void* buf, uint64_t len);

  // --- filter ioctl channel (slow path side) ---
  static void SendIoctl(FilterId id, uint32_t requestCode, std::vector<uint8_t> payload);
  static std::vector<IoctlReplyRecord> TakeIoctlReplies(FilterId id);

  // --- agent properties (management client side) ---
  static bool PropertyRegistered(std::string_view name);
  static ZelStatus PropertyWrite(std::string_view name, FilterId id, std::span<const uint8_t> data);
  // Poll, then read into a buffer of the polled size. The host checks that
  // the read wrote within that size. False when the poll answered false.
  static bool PropertyRead(std::string_view name, FilterId id, std::vector<uint8_t>* out,
                           ZelStatus* status);
  static bool PropertyPoll(std::string_view name, FilterId id, uint32_t* size);
  // Direct handler access with any private pointer (for hostile input).
  static const ZelSluicePropOps* PropertyOps(std::string_view name);
};

}  // namespace host
