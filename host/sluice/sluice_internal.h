// Private state of the host's Sluice filter framework, shared by the files
// of host/sluice. Everything here is guarded by State::mu; no module
// callback is ever made with mu held (collect under the lock, call after).
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_set>
#include <utility>
#include <vector>

#include "host/sluice/framework.h"

// The framework's records behind the opaque handles of platform/zel_sluice.h.
// Destroyed filters and unregistered agents are kept (marked dead) until the
// host is reset, so that a stale handle is recognised instead of aliasing a
// new object at the same address.
struct ZelSluiceFastPath {
  std::string name;
  uint32_t version = 0;
  uint32_t opsVersion = 0;
  ZelModuleID module = -1;
  const ZelSluiceFastPathOps* ops = nullptr;
  void* priv = nullptr;
  std::vector<ZelSluiceFilter*> filters;                 // alive, oldest first
  std::vector<std::pair<uint32_t, void*>> slowPaths;     // id, private pointer
  bool registered = true;
};

struct ZelSluiceFilter {
  host::FilterId id = 0;
  ZelSluiceFastPath* agent = nullptr;
  host::FilterConfig config;
  // Written by the module through the create callback's out pointer, which
  // points here, so replies made during creation already see it.
  void* priv = nullptr;
  bool alive = true;
  uint32_t slowPath = 0;
  uint64_t clearCalls = 0;
  std::vector<host::Delivery> faulted;
  std::vector<host::Delivery> issued;
  std::vector<host::IoctlReplyRecord> ioctlReplies;
};

struct ZelSluiceProperty {
  std::string name;
  const ZelSluicePropOps* ops = nullptr;
};

namespace host::sluice {

// One accepted request's reply, waiting to be delivered.
struct PendingReply {
  uint64_t seq = 0;
  RequestKind kind = RequestKind::SetSlowPath;
  ZelSluiceFilter* filter = nullptr;
  uint32_t slowPathId = 0;      // set slow path: remembered on a status 0 reply
  ZelStatus status = ZEL_OK;
  // Calls the module's reply callback with the filter's private pointer.
  std::function<void(void* filterPriv)> call;
};

// A request handed to the slow path backend, waiting for CompleteRequest.
struct BackendRequest {
  RequestKind kind = RequestKind::SetSlowPath;
  ZelSluiceFilter* filter = nullptr;
  uint32_t slowPathId = 0;
  std::function<void(void* filterPriv, ZelStatus status, const std::vector<uint8_t>& data)> call;
};

struct State {
  std::mutex mu;

  SlowPathBackend* backend = nullptr;
  std::map<uint64_t, BackendRequest> backendRequests;   // by token

  std::vector<std::unique_ptr<ZelSluiceFastPath>> agents;   // registered, in order
  std::vector<std::unique_ptr<ZelSluiceFastPath>> deadAgents;
  // Alive filters, and the latest destroyed ones: kept so that a handle or
  // id used after its filter was destroyed is reported as such. Only the
  // latest kDeadFiltersKept are kept; a process that creates and destroys
  // filters without end (a fuzzer, a long-running host) stays flat.
  static constexpr size_t kDeadFiltersKept = 256;
  std::map<FilterId, std::unique_ptr<ZelSluiceFilter>> filters;
  std::deque<FilterId> dead;  // oldest first
  std::unordered_set<const ZelSluiceFilter*> handles;
  FilterId nextFilter = 1;

  std::map<RequestKind, RequestPolicy> policies;
  std::deque<ZelStatus> clearAnswers;
  std::map<RequestKind, std::vector<RequestRecord>> requests;
  uint64_t nextSeq = 1;
  std::deque<PendingReply> deferred;

  // The reply thread: `threaded` is its queue, `inFlight` counts replies it
  // has taken out of the queue and not finished delivering.
  std::deque<PendingReply> threaded;
  size_t inFlight = 0;
  std::condition_variable workCv;
  std::condition_variable idleCv;
  std::thread worker;
  bool stop = false;

  std::vector<std::unique_ptr<ZelSluiceProperty>> properties;   // registered
  std::vector<std::unique_ptr<ZelSluiceProperty>> deadProperties;

  ~State();
};

State& S();

// The live filter behind a handle the module passed to `call`; aborts on an
// unknown or destroyed handle. mu held.
ZelSluiceFilter* FilterLocked(ZelSluiceFilterHandle handle, const char* call);
// The filter numbered `id` (alive or not); aborts when there is none. mu held.
ZelSluiceFilter* FilterByIdLocked(FilterId id, const char* call);
// As FilterByIdLocked, and aborts when the filter was destroyed.
ZelSluiceFilter* LiveFilterByIdLocked(FilterId id, const char* call);

// Queued (not yet started) replies for `filter`. mu held.
size_t QueuedRepliesLocked(const ZelSluiceFilter* filter);
// Waits until the reply thread has delivered everything queued. Must not be
// called with mu held; does nothing on the reply thread itself.
void DrainThreadedReplies();

// Takes every packet out of `list`, in order.
std::vector<ZelPkt*> TakePackets(ZelPktList* list);

// Subsystem hooks of the files other than framework.cpp. mu held.
void ResetRequestsLocked();
void ResetPropertiesLocked();
void PropertyLeftoversLocked(std::vector<std::string>* out);

}  // namespace host::sluice
