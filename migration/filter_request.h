// Helpers shared by the save and restore sides: the reference protocol of an
// asynchronous framework request about one filter, and dropping a filter's
// fetched slow path state.
#pragma once

#include "agent/agent.h"
#include "module/locks.h"

// Sends one asynchronous request about `filter` with the filter's lock
// released, so that its reply can take the lock whenever it comes (also on
// this thread, before the request call has returned).
//
// Called with `guard` holding filter->lock and with the migration state the
// reply expects already set. Takes two references before releasing the lock:
// one for the call and one for the reply; they keep the record alive (destroy
// answers busy while refCount is above 1). After the call the lock is held
// again and the call's reference is dropped. A refused request (non-zero
// status) gets no reply, so its reference is dropped as well. Returns the
// request's status; the caller undoes its state change on failure.
template <typename Request>
[[nodiscard]] inline ZelStatus SLCGenericRequestUnlocked(SLCGenericFilter* filter,
                                                         SLCGenericSpinGuard& guard,
                                                         Request&& request) {
  filter->refCount += 2;
  guard.Unlock();
  const ZelStatus status = request();
  guard.Relock();
  filter->refCount -= 1;
  if (status != ZEL_OK) filter->refCount -= 1;
  return status;
}

// Frees the slow path state a prefetch fetched and makes the filter idle.
// Filter lock held.
void SLCGenericDiscardSavedState(SLCGenericFilter* filter);

// The request time-out every slow path request carries, in milliseconds.
inline uint32_t SLCGenericSlowPathTimeoutMs() {
  return static_cast<uint32_t>(SLCGENERIC_SLOWPATH_TIMEOUT);
}
