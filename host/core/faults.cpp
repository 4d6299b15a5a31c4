#include "host/core/faults.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <map>
#include <mutex>
#include <set>

namespace host {

namespace {

struct Rule {
  ZelStatus status = ZEL_OK;
  uint64_t nth = 1;
  bool sticky = false;
  uint64_t seen = 0;
};

std::mutex& FaultMutex() {
  static std::mutex m;
  return m;
}

std::map<std::string, Rule, std::less<>>& Rules() {
  static std::map<std::string, Rule, std::less<>> rules;
  return rules;
}

std::map<std::string, uint64_t, std::less<>>& InjectedCounts() {
  static std::map<std::string, uint64_t, std::less<>> counts;
  return counts;
}

// What recording and point failures keep, under FaultMutex.
struct PointState {
  bool recording = false;
  std::set<Faults::Point> seen;
  std::vector<Faults::Point> reached;  // seen, in order of first reach
  std::map<Faults::Point, Rule> rules;
  std::vector<Faults::Point> injected;
};

PointState& Points() {
  static PointState p;
  return p;
}

}  // namespace

std::string Faults::Point::Describe() const {
  Dl_info info{};
  char where[256];
  if (dladdr(reinterpret_cast<const void*>(site), &info) != 0 && info.dli_fname != nullptr) {
    const char* base = std::strrchr(info.dli_fname, '/');
    std::snprintf(where, sizeof(where), "%s+%#lx", base != nullptr ? base + 1 : info.dli_fname,
                  static_cast<unsigned long>(site - reinterpret_cast<uintptr_t>(info.dli_fbase)));
  } else {
    std::snprintf(where, sizeof(where), "%#lx", static_cast<unsigned long>(site));
  }
  return call + " at " + where;
}

void Faults::UpdateArmedLocked() {
  const PointState& p = Points();
  armed_.store(!Rules().empty() || p.recording || !p.rules.empty(), std::memory_order_relaxed);
}

void Faults::StartRecording() {
  std::lock_guard<std::mutex> g(FaultMutex());
  PointState& p = Points();
  p.recording = true;
  p.seen.clear();
  p.reached.clear();
  UpdateArmedLocked();
}

void Faults::StopRecording() {
  std::lock_guard<std::mutex> g(FaultMutex());
  Points().recording = false;
  UpdateArmedLocked();
}

std::vector<Faults::Point> Faults::Reached() {
  std::lock_guard<std::mutex> g(FaultMutex());
  return Points().reached;
}

void Faults::FailAt(const Point& point, ZelStatus status, uint64_t nth) {
  std::lock_guard<std::mutex> g(FaultMutex());
  Points().rules[point] = Rule{status, nth == 0 ? 1 : nth, false, 0};
  UpdateArmedLocked();
}

std::vector<Faults::Point> Faults::InjectedPoints() {
  std::lock_guard<std::mutex> g(FaultMutex());
  return Points().injected;
}

std::atomic<bool> Faults::armed_{false};

void Faults::Fail(std::string_view call, ZelStatus status, uint64_t nth, bool sticky) {
  std::lock_guard<std::mutex> g(FaultMutex());
  Rules()[std::string(call)] = Rule{status, nth == 0 ? 1 : nth, sticky, 0};
  UpdateArmedLocked();
}

void Faults::Clear(std::string_view call) {
  std::lock_guard<std::mutex> g(FaultMutex());
  auto it = Rules().find(call);
  if (it != Rules().end()) Rules().erase(it);
  UpdateArmedLocked();
}

void Faults::ClearAll() {
  std::lock_guard<std::mutex> g(FaultMutex());
  Rules().clear();
  InjectedCounts().clear();
  Points() = PointState{};
  UpdateArmedLocked();
}

uint64_t Faults::Seen(std::string_view call) {
  std::lock_guard<std::mutex> g(FaultMutex());
  auto it = Rules().find(call);
  return it == Rules().end() ? 0 : it->second.seen;
}

uint64_t Faults::Injected(std::string_view call) {
  std::lock_guard<std::mutex> g(FaultMutex());
  auto it = InjectedCounts().find(call);
  return it == InjectedCounts().end() ? 0 : it->second;
}

ZelStatus Faults::CheckSlow(const char* call, uintptr_t site) {
  std::lock_guard<std::mutex> g(FaultMutex());
  PointState& p = Points();
  if (p.recording || !p.rules.empty()) {
    Point point{call, site};
    if (p.recording && p.seen.insert(point).second) p.reached.push_back(point);
    auto pr = p.rules.find(point);
    if (pr != p.rules.end() && ++pr->second.seen == pr->second.nth) {
      p.injected.push_back(point);
      InjectedCounts()[point.call]++;
      return pr->second.status;
    }
  }
  auto it = Rules().find(std::string_view(call));
  if (it == Rules().end()) return ZEL_OK;
  Rule& r = it->second;
  r.seen++;
  if (r.seen == r.nth || (r.sticky && r.seen > r.nth)) {
    InjectedCounts()[it->first]++;
    return r.status;
  }
  return ZEL_OK;
}

void Fatal(const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  std::fputs("host: fatal: ", stderr);
  std::vfprintf(stderr, fmt, ap);
  std::fputc('\n', stderr);
  va_end(ap);
  std::fflush(stderr);
  std::abort();
}

}  // namespace host
