#include "host/core/faults.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <mutex>

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

}  // namespace

std::atomic<bool> Faults::armed_{false};

void Faults::Fail(std::string_view call, ZelStatus status, uint64_t nth, bool sticky) {
  std::lock_guard<std::mutex> g(FaultMutex());
  Rules()[std::string(call)] = Rule{status, nth == 0 ? 1 : nth, sticky, 0};
  armed_.store(true, std::memory_order_relaxed);
}

void Faults::Clear(std::string_view call) {
  std::lock_guard<std::mutex> g(FaultMutex());
  auto it = Rules().find(call);
  if (it != Rules().end()) Rules().erase(it);
  armed_.store(!Rules().empty(), std::memory_order_relaxed);
}

void Faults::ClearAll() {
  std::lock_guard<std::mutex> g(FaultMutex());
  Rules().clear();
  InjectedCounts().clear();
  armed_.store(false, std::memory_order_relaxed);
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

ZelStatus Faults::CheckSlow(const char* call) {
  std::lock_guard<std::mutex> g(FaultMutex());
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
