// Host logs. Every message is captured as a LogRecord.
//
// The module writes long-form messages as "%s: %s:%d: " [+ "%s: "] + text
// with the log name, function, line [and object] as the leading arguments,
// and short-form messages as ["%s: "] + text with [the object]. Rather than
// split the rendered line (names and texts may contain ": "), the leading
// arguments are read off the argument list when the format starts with one
// of those prefixes and the rest of the format is rendered on its own.

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>

#include "host/core/core_internal.h"
#include "host/core/faults.h"
#include "host/core/host_core.h"

struct ZelLog {
  std::string name;
  ZelModuleID owner = -1;
  int32_t level = 0;
  bool alive = true;
};

namespace host {

namespace {

constexpr std::string_view kLongPrefix = "%s: %s:%d: ";
constexpr std::string_view kLongObjectPrefix = "%s: %s:%d: %s: ";
constexpr std::string_view kShortObjectPrefix = "%s: ";
constexpr size_t kMaxRecords = 200000;

struct LogState {
  std::mutex mu;
  // Every log ever registered since Reset; unregistered ones stay (marked)
  // so a late call through a stale handle is caught, not a use after free.
  std::vector<std::unique_ptr<ZelLog>> logs;
  std::vector<LogRecord> records;
  std::atomic<bool> echo{false};
};

LogState& L() {
  static LogState* s = new LogState;
  return *s;
}

// Caller holds L().mu.
ZelLog* CheckedLocked(ZelLogHandle log, const char* call) {
  for (auto& l : L().logs) {
    if (l.get() == log) {
      if (!l->alive) Fatal("%s: log %s was unregistered", call, l->name.c_str());
      return l.get();
    }
  }
  Fatal("%s: %p is not a log", call, static_cast<void*>(log));
}

// Renders `fmt` with `ap` (which is left untouched for the caller).
std::string Render(const char* fmt, va_list ap) {
  va_list sizing;
  va_copy(sizing, ap);
  int n = std::vsnprintf(nullptr, 0, fmt, sizing);
  va_end(sizing);
  if (n <= 0) return {};
  std::string out(static_cast<size_t>(n), '\0');
  va_list writing;
  va_copy(writing, ap);
  std::vsnprintf(out.data(), out.size() + 1, fmt, writing);
  va_end(writing);
  return out;
}

std::string TakeString(va_list* ap) {
  const char* s = va_arg(*ap, const char*);
  return s != nullptr ? s : "(null)";
}

void StripNewline(std::string* text) {
  if (!text->empty() && text->back() == '\n') text->pop_back();
}

void Capture(LogRecord record) {
  LogState& s = L();
  if (s.echo.load(std::memory_order_relaxed)) {
    std::fputs(record.rendered.c_str(), stderr);
    if (record.rendered.empty() || record.rendered.back() != '\n') std::fputc('\n', stderr);
  }
  std::lock_guard<std::mutex> g(s.mu);
  // Long runs (tools, benchmarks) that log per packet must not grow without
  // bound: past the cap the older half goes.
  if (s.records.size() >= kMaxRecords) {
    s.records.erase(s.records.begin(), s.records.begin() + kMaxRecords / 2);
  }
  s.records.push_back(std::move(record));
}

}  // namespace

namespace core {

void ResetLogs() {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  s.logs.clear();
  s.records.clear();
}

void LogLeftovers(std::vector<std::string>* out) {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  for (auto& l : s.logs) {
    if (l->alive) out->push_back("log " + l->name + ": still registered");
  }
}

void ReportLogsOf(ZelModuleID module) {
  if (module < 0) return;
  std::vector<std::string> leaks;
  {
    LogState& s = L();
    std::lock_guard<std::mutex> g(s.mu);
    for (auto& l : s.logs) {
      if (l->alive && l->owner == module) {
        leaks.push_back("log " + l->name + ": not unregistered at unload");
      }
    }
  }
  for (auto& leak : leaks) RecordLeak(std::move(leak));
}

}  // namespace core

std::vector<LogRecord> Log::Records() {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  return s.records;
}

size_t Log::Count(std::string_view text, int32_t urgency) {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  size_t n = 0;
  for (const LogRecord& r : s.records) {
    if (r.text == text && (urgency == -1 || r.urgency == urgency)) n++;
  }
  return n;
}

bool Log::Contains(std::string_view text, int32_t urgency) { return Count(text, urgency) != 0; }

size_t Log::CountContaining(std::string_view fragment) {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  size_t n = 0;
  for (const LogRecord& r : s.records) {
    if (r.text.find(fragment) != std::string::npos) n++;
  }
  return n;
}

void Log::Clear() {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  s.records.clear();
}

void Log::SetEcho(bool on) { L().echo.store(on, std::memory_order_relaxed); }

bool Log::LogExists(std::string_view name) {
  LogState& s = L();
  std::lock_guard<std::mutex> g(s.mu);
  for (auto& l : s.logs) {
    if (l->alive && l->name == name) return true;
  }
  return false;
}

}  // namespace host

ZelStatus zel_LogRegister(const char* name, ZelModuleID module, ZelHeapID heap, int32_t defaultLevel,
                          uint64_t flags, ZelLogHandle* log) {
  (void)module;
  (void)heap;
  (void)flags;
  if (ZelStatus st = host::Faults::Check("zel_LogRegister")) return st;
  if (name == nullptr || log == nullptr) return ZEL_BAD_PARAM;
  auto l = std::make_unique<ZelLog>();
  l->name = name;
  l->owner = host::core::OwningModule();
  l->level = defaultLevel;
  host::LogState& s = host::L();
  std::lock_guard<std::mutex> g(s.mu);
  *log = l.get();
  s.logs.push_back(std::move(l));
  return ZEL_OK;
}

void zel_LogUnregister(ZelLogHandle log) {
  host::LogState& s = host::L();
  std::lock_guard<std::mutex> g(s.mu);
  host::CheckedLocked(log, "zel_LogUnregister")->alive = false;
}

const char* zel_LogGetName(ZelLogHandle log) {
  host::LogState& s = host::L();
  std::lock_guard<std::mutex> g(s.mu);
  return host::CheckedLocked(log, "zel_LogGetName")->name.c_str();
}

int32_t zel_LogGetCurrentLogLevel(ZelLogHandle log) {
  host::LogState& s = host::L();
  std::lock_guard<std::mutex> g(s.mu);
  return host::CheckedLocked(log, "zel_LogGetCurrentLogLevel")->level;
}

void zel_LogLevel(int32_t urgency, ZelLogHandle log, int32_t level, const char* fmt, ...) {
  (void)level;   // the host keeps every message; levels only matter to readers
  host::LogRecord record;
  record.urgency = urgency;
  record.form = host::LogForm::Long;
  {
    host::LogState& s = host::L();
    std::lock_guard<std::mutex> g(s.mu);
    record.logName = host::CheckedLocked(log, "zel_LogLevel")->name;
  }
  std::string_view format(fmt);
  va_list ap;
  va_start(ap, fmt);
  record.rendered = host::Render(fmt, ap);
  if (format.starts_with(host::kLongPrefix)) {
    bool withObject = format.starts_with(host::kLongObjectPrefix);
    record.logName = host::TakeString(&ap);
    record.function = host::TakeString(&ap);
    record.line = va_arg(ap, int);
    if (withObject) record.object = host::TakeString(&ap);
    size_t skip = withObject ? host::kLongObjectPrefix.size() : host::kLongPrefix.size();
    record.text = host::Render(fmt + skip, ap);
  } else {
    record.text = record.rendered;
  }
  va_end(ap);
  host::StripNewline(&record.text);
  host::Capture(std::move(record));
}

void zel_LogNoLevel(int32_t urgency, const char* fmt, ...) {
  host::LogRecord record;
  record.urgency = urgency;
  record.form = host::LogForm::Short;
  va_list ap;
  va_start(ap, fmt);
  record.rendered = host::Render(fmt, ap);
  if (std::string_view(fmt).starts_with(host::kShortObjectPrefix)) {
    record.object = host::TakeString(&ap);
    record.text = host::Render(fmt + host::kShortObjectPrefix.size(), ap);
  } else {
    record.text = record.rendered;
  }
  va_end(ap);
  host::StripNewline(&record.text);
  host::Capture(std::move(record));
}
