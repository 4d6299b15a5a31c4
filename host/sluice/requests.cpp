// Requests the module makes of the framework (set and clear slow path,
// retrieve and restore slow path state, filter ioctl requests) and their
// replies.
//
// Each kind of request follows the policy a test set for it: refuse it (no
// reply), or accept it and reply inline, deferred or from the reply thread.
// An accepted request gets exactly one reply. A reply reads the filter's
// private pointer when it is delivered and is made with State::mu released.
#include <algorithm>
#include <cstring>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/sluice/sluice_internal.h"

namespace host::sluice {

namespace {

thread_local bool onReplyThread = false;
// Inline replies that make a new request (the module retrying a failed set
// request) recurse; a module retrying without end would overflow the stack.
thread_local int inlineDepth = 0;
constexpr int kMaxInlineDepth = 64;

const char* KindName(RequestKind kind) {
  switch (kind) {
    case RequestKind::SetSlowPath: return "set slow path";
    case RequestKind::RetrieveState: return "retrieve slow path state";
    case RequestKind::RestoreState: return "restore slow path state";
    case RequestKind::IoctlRequest: return "filter ioctl request";
  }
  return "request";
}

const RequestPolicy& PolicyLocked(RequestKind kind) {
  static const RequestPolicy kDefault;
  auto it = S().policies.find(kind);
  return it == S().policies.end() ? kDefault : it->second;
}

void Deliver(PendingReply& r) {
  void* priv;
  {
    std::lock_guard<std::mutex> g(S().mu);
    if (!r.filter->alive) {
      Fatal("%s reply for filter %llu '%s' is due after the filter was destroyed",
            KindName(r.kind), static_cast<unsigned long long>(r.filter->id),
            r.filter->config.name.c_str());
    }
    priv = r.filter->priv;
    if (r.kind == RequestKind::SetSlowPath && r.status == ZEL_OK) {
      r.filter->slowPath = r.slowPathId;
    }
  }
  r.call(priv);
}

void ReplyThread() {
  onReplyThread = true;
  std::unique_lock<std::mutex> g(S().mu);
  for (;;) {
    S().workCv.wait(g, [] { return S().stop || !S().threaded.empty(); });
    if (S().stop) return;
    PendingReply r = std::move(S().threaded.front());
    S().threaded.pop_front();
    S().inFlight++;
    g.unlock();
    Deliver(r);
    r = PendingReply{};
    g.lock();
    S().inFlight--;
    S().idleCv.notify_all();
  }
}

// A buffer of exactly `data`'s size for the duration of one reply callback,
// poisoned afterwards: the callback may not keep the pointer.
template <typename Fn>
void WithReplyBuffer(const std::vector<uint8_t>& data, Fn fn) {
  if (data.empty()) {
    fn(nullptr);
    return;
  }
  std::unique_ptr<uint8_t[]> buf(new uint8_t[data.size()]);
  std::memcpy(buf.get(), data.data(), data.size());
  fn(buf.get());
  std::memset(buf.get(), 0xdd, data.size());
}

// Records the request and refuses it or arranges its one reply, as the
// policy of its kind says. `badArgs` non-zero refuses it before that (after
// the handle check). `makeCall` turns the policy into the reply call.
//
// With a slow path backend installed, set, retrieve and restore requests go
// to it instead (not recorded: a long-running host would keep them forever);
// `makeBackendCall` gives the reply call that CompleteRequest makes.
template <typename MakeCall, typename MakeBackendCall>
ZelStatus Submit(const char* call, ZelSluiceFilterHandle filter, ZelStatus badArgs,
                 RequestRecord record, MakeCall makeCall, MakeBackendCall makeBackendCall) {
  PendingReply r;
  SlowPathBackend* backend = nullptr;
  SlowPathRequest out;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = FilterLocked(filter, call);
    if (badArgs != ZEL_OK) return badArgs;
    if (S().backend != nullptr && record.kind != RequestKind::IoctlRequest) {
      backend = S().backend;
      out.kind = record.kind;
      out.token = S().nextSeq++;
      out.filter = f->id;
      out.filterName = f->config.name;
      out.slowPathId = record.kind == RequestKind::SetSlowPath ? record.slowPathId : f->slowPath;
      out.timeoutMs = record.timeoutMs;
      out.data = std::move(record.data);
      S().backendRequests[out.token] =
          BackendRequest{record.kind, f, out.slowPathId, makeBackendCall()};
    } else {
      const RequestPolicy& policy = PolicyLocked(record.kind);
      record.filter = f->id;
      record.result = policy.refuse;
      r.kind = record.kind;
      r.slowPathId = record.slowPathId;
      S().requests[record.kind].push_back(std::move(record));
      if (policy.refuse != ZEL_OK) return policy.refuse;

      r.seq = S().nextSeq++;
      r.filter = f;
      r.status = policy.replyStatus;
      r.call = makeCall(policy);
      switch (policy.mode) {
        case ReplyMode::Inline:
          break;
        case ReplyMode::Deferred:
          S().deferred.push_back(std::move(r));
          return ZEL_OK;
        case ReplyMode::OtherThread:
          if (!S().worker.joinable()) S().worker = std::thread(ReplyThread);
          S().threaded.push_back(std::move(r));
          S().workCv.notify_one();
          return ZEL_OK;
      }
    }
  }
  if (backend != nullptr) {
    const uint64_t token = out.token;
    const ZelStatus s = backend->Request(std::move(out));
    if (s != ZEL_OK) {
      std::lock_guard<std::mutex> g(S().mu);
      S().backendRequests.erase(token);
    }
    return s;
  }
  if (++inlineDepth > kMaxInlineDepth) {
    Fatal("%s: inline replies nested %d deep; the module keeps re-requesting from its reply "
          "callback (use a deferred reply policy)",
          call, kMaxInlineDepth);
  }
  Deliver(r);
  --inlineDepth;
  return ZEL_OK;
}

}  // namespace

size_t QueuedRepliesLocked(const ZelSluiceFilter* filter) {
  size_t n = 0;
  for (auto* q : {&S().deferred, &S().threaded}) {
    n += std::count_if(q->begin(), q->end(), [&](const PendingReply& r) {
      return r.filter == filter;
    });
  }
  for (const auto& [token, b] : S().backendRequests) n += b.filter == filter ? 1 : 0;
  return n;
}

void DrainThreadedReplies() {
  if (onReplyThread) return;
  std::unique_lock<std::mutex> g(S().mu);
  S().idleCv.wait(g, [] { return S().threaded.empty() && S().inFlight == 0; });
}

void ResetRequestsLocked() {
  S().policies.clear();
  S().clearAnswers.clear();
  S().requests.clear();
  S().deferred.clear();
  S().backend = nullptr;
  S().backendRequests.clear();
  S().nextSeq = 1;
  S().idleCv.notify_all();
}

State::~State() {
  {
    std::lock_guard<std::mutex> g(mu);
    stop = true;
  }
  workCv.notify_all();
  if (worker.joinable()) worker.join();
}

}  // namespace host::sluice

using namespace host;
using namespace host::sluice;

ZelStatus zel_SluiceSetSlowPath(ZelSluiceFilterHandle filter, uint32_t slowPathId,
                                ZelSluiceSetSlowPathReply reply, void* cookie,
                                uint32_t timeoutMs) {
  if (ZelStatus s = Faults::Check("zel_SluiceSetSlowPath")) return s;
  RequestRecord rec;
  rec.kind = RequestKind::SetSlowPath;
  rec.slowPathId = slowPathId;
  rec.timeoutMs = timeoutMs;
  return Submit("zel_SluiceSetSlowPath", filter, reply == nullptr ? ZEL_BAD_PARAM : ZEL_OK,
                std::move(rec), [&](const RequestPolicy& p) {
                  return [reply, cookie, status = p.replyStatus](void* priv) {
                    reply(priv, cookie, status);
                  };
                },
                [&] {
                  return [reply, cookie](void* priv, ZelStatus status, const std::vector<uint8_t>&) {
                    reply(priv, cookie, status);
                  };
                });
}

ZelStatus zel_SluiceClearSlowPath(ZelSluiceFilterHandle filter) {
  if (ZelStatus s = Faults::Check("zel_SluiceClearSlowPath")) return s;
  SlowPathBackend* backend = nullptr;
  FilterId id = 0;
  uint32_t was = 0;
  ZelStatus answer = ZEL_OK;
  {
    std::lock_guard<std::mutex> g(S().mu);
    ZelSluiceFilter* f = FilterLocked(filter, "zel_SluiceClearSlowPath");
    f->clearCalls++;
    if (!S().clearAnswers.empty()) {
      answer = S().clearAnswers.front();
      S().clearAnswers.pop_front();
    }
    if (answer == ZEL_OK) {
      backend = S().backend;
      id = f->id;
      was = std::exchange(f->slowPath, 0);
    }
  }
  if (backend != nullptr && was != 0) backend->Cleared(id, was);
  return answer;
}

ZelStatus zel_SluiceRetrieveSlowPathState(ZelSluiceFilterHandle filter,
                                          ZelSluiceRetrieveStateReply reply, void* cookie,
                                          uint32_t timeoutMs) {
  if (ZelStatus s = Faults::Check("zel_SluiceRetrieveSlowPathState")) return s;
  RequestRecord rec;
  rec.kind = RequestKind::RetrieveState;
  rec.timeoutMs = timeoutMs;
  return Submit("zel_SluiceRetrieveSlowPathState", filter,
                reply == nullptr ? ZEL_BAD_PARAM : ZEL_OK, std::move(rec),
                [&](const RequestPolicy& p) {
                  return [reply, cookie, status = p.replyStatus, data = p.replyData](void* priv) {
                    WithReplyBuffer(data, [&](const uint8_t* buf) {
                      reply(priv, cookie, buf, data.size(), status);
                    });
                  };
                },
                [&] {
                  return [reply, cookie](void* priv, ZelStatus status,
                                         const std::vector<uint8_t>& data) {
                    WithReplyBuffer(data, [&](const uint8_t* buf) {
                      reply(priv, cookie, buf, data.size(), status);
                    });
                  };
                });
}

ZelStatus zel_SluiceRestoreSlowPathState(ZelSluiceFilterHandle filter, const void* buf,
                                         uint64_t len, ZelSluiceRestoreStateReply reply,
                                         void* cookie, uint32_t timeoutMs) {
  if (ZelStatus s = Faults::Check("zel_SluiceRestoreSlowPathState")) return s;
  RequestRecord rec;
  rec.kind = RequestKind::RestoreState;
  rec.timeoutMs = timeoutMs;
  bool bad = reply == nullptr || (buf == nullptr && len != 0);
  if (!bad && len != 0) {
    const auto* p = static_cast<const uint8_t*>(buf);
    rec.data.assign(p, p + len);
  }
  return Submit("zel_SluiceRestoreSlowPathState", filter, bad ? ZEL_BAD_PARAM : ZEL_OK,
                std::move(rec), [&](const RequestPolicy& p) {
                  return [reply, cookie, status = p.replyStatus](void* priv) {
                    reply(priv, cookie, status);
                  };
                },
                [&] {
                  return [reply, cookie](void* priv, ZelStatus status, const std::vector<uint8_t>&) {
                    reply(priv, cookie, status);
                  };
                });
}

ZelStatus zel_SluiceSendFilterIoctlRequest(ZelSluiceFilterHandle filter, const void* payload,
                                           uint32_t len, ZelSluiceIoctlReply reply, void* cbData,
                                           uint32_t cookie) {
  if (ZelStatus s = Faults::Check("zel_SluiceSendFilterIoctlRequest")) return s;
  RequestRecord rec;
  rec.kind = RequestKind::IoctlRequest;
  rec.cookie = cookie;
  bool bad = reply == nullptr || (payload == nullptr && len != 0);
  if (!bad && len != 0) {
    const auto* p = static_cast<const uint8_t*>(payload);
    rec.data.assign(p, p + len);
  }
  return Submit("zel_SluiceSendFilterIoctlRequest", filter, bad ? ZEL_BAD_PARAM : ZEL_OK,
                std::move(rec), [&](const RequestPolicy& p) {
                  return [reply, cbData, status = p.replyStatus, data = p.replyData](void* priv) {
                    WithReplyBuffer(data, [&](const uint8_t* buf) {
                      reply(priv, cbData, buf, static_cast<uint32_t>(data.size()), status);
                    });
                  };
                },
                [] {
                  return std::function<void(void*, ZelStatus, const std::vector<uint8_t>&)>{};
                });
}

namespace host {

void Sluice::SetPolicy(RequestKind kind, const RequestPolicy& policy) {
  std::lock_guard<std::mutex> g(S().mu);
  S().policies[kind] = policy;
}

void Sluice::SetClearAnswers(std::vector<ZelStatus> answers) {
  std::lock_guard<std::mutex> g(S().mu);
  S().clearAnswers.assign(answers.begin(), answers.end());
}

size_t Sluice::PendingReplies(RequestKind kind) {
  std::lock_guard<std::mutex> g(S().mu);
  size_t n = 0;
  for (auto* q : {&S().deferred, &S().threaded}) {
    n += std::count_if(q->begin(), q->end(), [&](const PendingReply& r) {
      return r.kind == kind;
    });
  }
  return n;
}

size_t Sluice::ReleaseReplies(RequestKind kind, size_t n) {
  uint64_t limit;
  {
    std::lock_guard<std::mutex> g(S().mu);
    limit = S().nextSeq;
  }
  size_t done = 0;
  while (done < n) {
    PendingReply r;
    {
      std::lock_guard<std::mutex> g(S().mu);
      auto& q = S().deferred;
      auto it = std::find_if(q.begin(), q.end(), [&](const PendingReply& p) {
        return p.kind == kind && p.seq < limit;
      });
      if (it == q.end()) break;
      r = std::move(*it);
      q.erase(it);
    }
    sluice::Deliver(r);
    done++;
  }
  return done;
}

void Sluice::WaitReplies() { DrainThreadedReplies(); }

void Sluice::SetSlowPathBackend(SlowPathBackend* backend) {
  std::lock_guard<std::mutex> g(S().mu);
  if (backend == nullptr && !S().backendRequests.empty()) {
    Fatal("Sluice::SetSlowPathBackend: removed with %zu requests outstanding",
          S().backendRequests.size());
  }
  S().backend = backend;
}

bool Sluice::CompleteRequest(uint64_t token, ZelStatus status, std::vector<uint8_t> data) {
  BackendRequest b;
  void* priv;
  {
    std::lock_guard<std::mutex> g(S().mu);
    auto it = S().backendRequests.find(token);
    if (it == S().backendRequests.end()) return false;
    b = std::move(it->second);
    S().backendRequests.erase(it);
    if (!b.filter->alive) {
      Fatal("%s reply for filter %llu '%s' is due after the filter was destroyed",
            KindName(b.kind), static_cast<unsigned long long>(b.filter->id),
            b.filter->config.name.c_str());
    }
    priv = b.filter->priv;
    if (b.kind == RequestKind::SetSlowPath && status == ZEL_OK) b.filter->slowPath = b.slowPathId;
  }
  b.call(priv, status, data);
  return true;
}

size_t Sluice::OutstandingBackendRequests(FilterId filter) {
  std::lock_guard<std::mutex> g(S().mu);
  size_t n = 0;
  for (const auto& [token, b] : S().backendRequests) {
    n += filter == 0 || b.filter->id == filter ? 1 : 0;
  }
  return n;
}

std::vector<RequestRecord> Sluice::Requests(RequestKind kind) {
  std::lock_guard<std::mutex> g(S().mu);
  auto it = S().requests.find(kind);
  return it == S().requests.end() ? std::vector<RequestRecord>{} : it->second;
}

void Sluice::ClearRequests() {
  std::lock_guard<std::mutex> g(S().mu);
  S().requests.clear();
}

}  // namespace host
