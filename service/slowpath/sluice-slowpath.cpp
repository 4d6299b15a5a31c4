// sluice-slowpath: a user-level slow path for a running sluice-host.
//
// It connects to the host's control socket, registers with one agent and
// from then on keeps the link open: the host attaches filters to it, hands
// it the packets their rules punt or copy, and asks it for its own state
// when a filter migrates away and gives it back on the destination. The
// state it keeps is real: per filter, the packets and bytes it received in
// each direction and how many it sent back.
//
// Everything it sees is printed as one line per event on stdout; commands
// read from stdin (one per line) push rulesets and query filters over the
// filter-ioctl channel. The program is one thread around poll(): host
// requests are answered in order, its own requests carry a sequence number
// and their answers are matched to them.
#include <poll.h>
#include <pcap/pcap.h>
#include <signal.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <span>
#include <sstream>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "service/protocol/protocol.h"
#include "service/protocol/slowpath_link.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using slcproto::Message;
using slcproto::Type;

std::atomic<int> gStop{0};  // lock-free, so the signal handler may set it
static_assert(std::atomic<int>::is_always_lock_free);
void OnStop(int) { gStop = 1; }

// Filter ioctl messages (the firewall's wire format, little-endian).
constexpr uint32_t kIoctlEcho = 1, kIoctlRuleset = 2, kIoctlStatus = 3, kIoctlClear = 4,
                   kIoctlGetState = 6;
constexpr size_t kRulesetHeader = 15;

// -------------------------------------------------------------------------
// The slow path's own state, per filter, and its saved form:
//
//   "SPST"  u16 version 1  u16 name length  name
//   u64 packets from switch, packets to switch, bytes from switch,
//       bytes to switch, packets sent back
//
// All little-endian; a restore must name the filter it is given to.

struct Counts {
  uint64_t packets[3] = {0, 0, 0};   // by direction 1, 2
  uint64_t bytes[3] = {0, 0, 0};
  uint64_t sentBack = 0;
};

constexpr char kStateMagic[4] = {'S', 'P', 'S', 'T'};
constexpr uint16_t kStateVersion = 1;
constexpr size_t kStateFixed = 4 + 2 + 2 + 5 * 8;

void PutLe(std::vector<uint8_t>* out, uint64_t v, int bytes) {
  for (int i = 0; i < bytes; i++) out->push_back(static_cast<uint8_t>(v >> (8 * i)));
}
uint64_t GetLe(const uint8_t* p, int bytes) {
  uint64_t v = 0;
  for (int i = bytes - 1; i >= 0; i--) v = v << 8 | p[i];
  return v;
}

std::vector<uint8_t> SaveCounts(const std::string& filter, const Counts& c) {
  std::vector<uint8_t> out(kStateMagic, kStateMagic + 4);
  PutLe(&out, kStateVersion, 2);
  PutLe(&out, filter.size(), 2);
  out.insert(out.end(), filter.begin(), filter.end());
  for (uint64_t v : {c.packets[1], c.packets[2], c.bytes[1], c.bytes[2], c.sentBack}) {
    PutLe(&out, v, 8);
  }
  return out;
}

bool LoadCounts(const std::vector<uint8_t>& in, const std::string& filter, Counts* c,
                std::string* error) {
  if (in.size() < kStateFixed || std::memcmp(in.data(), kStateMagic, 4) != 0) {
    *error = "not a slow path state";
    return false;
  }
  if (GetLe(in.data() + 4, 2) != kStateVersion) {
    *error = "unknown state version " + std::to_string(GetLe(in.data() + 4, 2));
    return false;
  }
  const size_t nameLen = GetLe(in.data() + 6, 2);
  if (in.size() != kStateFixed + nameLen) {
    *error = "state length does not match its name";
    return false;
  }
  const std::string name(in.begin() + 8, in.begin() + 8 + static_cast<long>(nameLen));
  if (name != filter) {
    *error = "state of filter " + name + " given to " + filter;
    return false;
  }
  const uint8_t* p = in.data() + 8 + nameLen;
  c->packets[1] = GetLe(p, 8);
  c->packets[2] = GetLe(p + 8, 8);
  c->bytes[1] = GetLe(p + 16, 8);
  c->bytes[2] = GetLe(p + 24, 8);
  c->sentBack = GetLe(p + 32, 8);
  return true;
}

std::string Hex(const std::vector<uint8_t>& b) {
  static const char* d = "0123456789abcdef";
  std::string s;
  for (uint8_t x : b) {
    s.push_back(d[x >> 4]);
    s.push_back(d[x & 15]);
  }
  return s;
}

// -------------------------------------------------------------------------

struct Options {
  std::string socketPath = "/run/sluice-host.sock";
  std::string agent;
  std::string name = "sluice-slowpath";
  std::string pcapPath;
  bool print = false;
  bool reissue = false;
  bool refuseRestore = false;
  bool commands = true;
  std::vector<std::string> pushes;   // FILTER=FILE, pushed once when attached
  double maxSeconds = 0;
};

class SlowPath {
 public:
  explicit SlowPath(Options o) : o_(std::move(o)) {}
  int Run();

 private:
  void Out(const char* fmt, ...) __attribute__((format(printf, 2, 3)));
  bool Send(const Message& m);
  // Sends a request of our own; `done` runs with its answer.
  using Done = std::function<void(const Message& reply)>;
  bool Ask(Message m, Done done);
  void OnHost(const Message& m);
  void OnCommand(const std::string& line);
  void Answer(const Message& req, Message reply);
  void Ioctl(const std::string& filter, std::vector<uint8_t> payload, const std::string& what);
  bool LoadRulesetFile(const std::string& path, std::vector<uint8_t>* out);
  void Push(const std::string& filter, const std::string& path, bool replace);

  Options o_;
  int fd_ = -1;
  uint32_t id_ = 0;
  uint64_t nextSeq_ = 1;
  std::map<uint64_t, Done> waiting_;
  std::map<std::string, Counts> counts_;
  std::map<std::string, bool> attached_;
  std::map<std::string, bool> pushed_;
  pcap_t* pcap_ = nullptr;
  pcap_dumper_t* dumper_ = nullptr;
};

void SlowPath::Out(const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  std::vprintf(fmt, ap);
  va_end(ap);
  std::putchar('\n');
  std::fflush(stdout);
}

bool SlowPath::Send(const Message& m) {
  std::string error;
  if (!slcproto::WriteMessage(fd_, m, &error)) {
    std::fprintf(stderr, "sluice-slowpath: %s\n", error.c_str());
    return false;
  }
  return true;
}

bool SlowPath::Ask(Message m, Done done) {
  const uint64_t seq = nextSeq_++;
  m.args["seq"] = seq;
  waiting_[seq] = std::move(done);
  return Send(m);
}

void SlowPath::Answer(const Message& req, Message reply) {
  if (req.args.contains("seq")) reply.args["seq"] = req.args["seq"];
  (void)Send(reply);
}

void SlowPath::OnHost(const Message& m) {
  const std::string filter =
      m.args.contains("filter") && m.args["filter"].is_string() ? m.args["filter"].get<std::string>()
                                                                : std::string();
  switch (m.type) {
    case Type::kReply: {
      if (!m.args.contains("seq")) {
        // The answer to the registration.
        if (!m.args.value("ok", false)) {
          std::fprintf(stderr, "sluice-slowpath: registration refused: %s\n",
                       m.args.value("error", std::string("no reason")).c_str());
          gStop = 2;
          return;
        }
        id_ = m.args.value("id", 0u);
        Out("registered id=%u agent=%s", id_, o_.agent.c_str());
        return;
      }
      const uint64_t seq = m.args["seq"].is_number_unsigned() ? m.args["seq"].get<uint64_t>() : 0;
      auto it = waiting_.find(seq);
      if (it == waiting_.end()) return;
      Done done = std::move(it->second);
      waiting_.erase(it);
      done(m);
      return;
    }
    case Type::kSpAttach: {
      attached_[filter] = true;
      counts_[filter];
      Out("attached %s slowpath=%u", filter.c_str(), m.args.value("slowPath", 0u));
      Answer(m, slcproto::Reply(true));
      for (const auto& p : o_.pushes) {
        const size_t eq = p.find('=');
        if (p.substr(0, eq) == filter && !pushed_[filter]) {
          pushed_[filter] = true;
          Push(filter, p.substr(eq + 1), true);
        }
      }
      return;
    }
    case Type::kSpDetach:
      attached_.erase(filter);
      Out("detached %s", filter.c_str());
      return;
    case Type::kSpPackets: {
      const uint32_t dir = m.args.value("direction", 0u);
      std::vector<std::vector<uint8_t>> frames;
      std::string error;
      if (dir < 1 || dir > 2 || !slcproto::SplitFrames(m.blob, &frames, &error)) {
        Out("bad-packets %s %s", filter.c_str(), error.c_str());
        return;
      }
      Counts& c = counts_[filter];
      for (const auto& f : frames) {
        c.packets[dir]++;
        c.bytes[dir] += f.size();
        if (o_.print) Out("packet %s dir=%u len=%zu", filter.c_str(), dir, f.size());
        if (dumper_ != nullptr) {
          pcap_pkthdr h{};
          gettimeofday(&h.ts, nullptr);
          h.caplen = h.len = static_cast<bpf_u_int32>(f.size());
          pcap_dump(reinterpret_cast<u_char*>(dumper_), &h, f.data());
        }
      }
      if (dumper_ != nullptr) pcap_dump_flush(dumper_);
      if (o_.reissue && !frames.empty()) {
        Message back;
        back.type = Type::kSpReissue;
        back.args["filter"] = filter;
        back.args["direction"] = dir;
        back.blob = m.blob;
        const size_t n = frames.size();
        Ask(std::move(back), [this, filter, n](const Message& r) {
          if (r.args.value("ok", false)) {
            counts_[filter].sentBack += n;
            Out("reissued %s n=%zu", filter.c_str(), n);
          } else {
            Out("reissue-failed %s %s", filter.c_str(),
                r.args.value("error", std::string()).c_str());
          }
        });
      }
      return;
    }
    case Type::kSpFetchState: {
      const std::vector<uint8_t> state = SaveCounts(filter, counts_[filter]);
      Out("fetched %s bytes=%zu state=%s", filter.c_str(), state.size(), Hex(state).c_str());
      Message r = slcproto::Reply(true);
      r.blob = state;
      Answer(m, std::move(r));
      return;
    }
    case Type::kSpRestoreState: {
      Counts c;
      std::string error;
      if (o_.refuseRestore) error = "refusing restores (--refuse-restore)";
      if (error.empty() && LoadCounts(m.blob, filter, &c, &error)) {
        counts_[filter] = c;
        Out("restored %s bytes=%zu state=%s", filter.c_str(), m.blob.size(), Hex(m.blob).c_str());
        Answer(m, slcproto::Reply(true));
      } else {
        Out("restore-refused %s %s", filter.c_str(), error.c_str());
        Answer(m, slcproto::Reply(false, error));
      }
      return;
    }
    default:
      if (m.args.contains("seq")) Answer(m, slcproto::Reply(false, "not a slow path request"));
      return;
  }
}

bool SlowPath::LoadRulesetFile(const std::string& path, std::vector<uint8_t>* out) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    Out("error cannot read %s", path.c_str());
    return false;
  }
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  std::string error;
  if (!rules::TryParseRuleset(text, out, &error)) {
    // Not rule text: taken as a wire ruleset if its header says so.
    if (text.size() >= kRulesetHeader && (text[0] == 7 || text[0] == 8)) {
      out->assign(text.begin(), text.end());
      return true;
    }
    Out("error %s: %s", path.c_str(), error.c_str());
    return false;
  }
  return true;
}

void SlowPath::Ioctl(const std::string& filter, std::vector<uint8_t> payload,
                     const std::string& what) {
  Message m;
  m.type = Type::kSpIoctl;
  m.args["filter"] = filter;
  m.args["code"] = static_cast<uint32_t>(nextSeq_);  // any non-zero code
  m.blob = std::move(payload);
  Ask(std::move(m), [this, filter, what](const Message& r) {
    if (!r.args.value("ok", false)) {
      Out("%s %s error=%s", what.c_str(), filter.c_str(),
          r.args.value("error", std::string()).c_str());
      return;
    }
    const std::vector<uint8_t>& b = r.blob;
    const uint32_t type = b.size() >= 4 ? static_cast<uint32_t>(GetLe(b.data(), 4)) : 0;
    if (b.empty()) {
      Out("%s %s no-reply", what.c_str(), filter.c_str());
    } else if (type == kIoctlStatus && b.size() >= 8) {
      Out("%s %s status=%u", what.c_str(), filter.c_str(),
          static_cast<uint32_t>(GetLe(b.data() + 4, 4)));
    } else if (type == kIoctlEcho) {
      std::string text(b.begin() + 4, b.end());
      text.resize(std::strlen(text.c_str()));
      Out("%s %s %s", what.c_str(), filter.c_str(), text.c_str());
    } else if (type == kIoctlRuleset && b.size() >= 8 + kRulesetHeader) {
      const std::span<const uint8_t> rs(b.data() + 8, b.size() - 8);
      Out("%s %s rules=%u", what.c_str(), filter.c_str(),
          static_cast<uint32_t>(GetLe(b.data() + 8 + 3, 4)));
      std::string text = rules::FormatRuleset(rs);
      std::istringstream lines(text);
      std::string line;
      while (std::getline(lines, line)) Out("  %s", line.c_str());
    } else {
      Out("%s %s reply-type=%u bytes=%zu", what.c_str(), filter.c_str(), type, b.size());
    }
  });
}

void SlowPath::Push(const std::string& filter, const std::string& path, bool replace) {
  std::vector<uint8_t> ruleset;
  if (!LoadRulesetFile(path, &ruleset)) return;
  std::vector<uint8_t> msg;
  PutLe(&msg, kIoctlRuleset, 4);
  PutLe(&msg, replace ? 1 : 0, 4);
  msg.insert(msg.end(), ruleset.begin(), ruleset.end());
  Ioctl(filter, std::move(msg), "push");
}

void SlowPath::OnCommand(const std::string& line) {
  std::istringstream in(line);
  std::string cmd, filter;
  in >> cmd >> filter;
  if (cmd.empty() || cmd[0] == '#') return;
  if (cmd == "quit") {
    gStop = 1;
    return;
  }
  if (cmd == "counts") {
    for (const auto& [name, c] : counts_) {
      Out("counts %s from-switch=%llu to-switch=%llu bytes=%llu sent-back=%llu", name.c_str(),
          static_cast<unsigned long long>(c.packets[1]),
          static_cast<unsigned long long>(c.packets[2]),
          static_cast<unsigned long long>(c.bytes[1] + c.bytes[2]),
          static_cast<unsigned long long>(c.sentBack));
    }
    Out("counts-end");
    return;
  }
  if (filter.empty()) {
    Out("error '%s' needs a filter name", cmd.c_str());
    return;
  }
  std::vector<uint8_t> msg;
  if (cmd == "push" || cmd == "add") {
    std::string path;
    in >> path;
    Push(filter, path, cmd == "push");
  } else if (cmd == "rules") {
    PutLe(&msg, kIoctlGetState, 4);
    Ioctl(filter, std::move(msg), "rules");
  } else if (cmd == "clear") {
    PutLe(&msg, kIoctlClear, 4);
    PutLe(&msg, 0, 4);
    msg.resize(8 + kRulesetHeader, 0);
    Ioctl(filter, std::move(msg), "clear");
  } else if (cmd == "echo") {
    std::string text;
    std::getline(in >> std::ws, text);
    PutLe(&msg, kIoctlEcho, 4);
    msg.insert(msg.end(), text.begin(), text.end());
    msg.push_back(0);
    Ioctl(filter, std::move(msg), "echo");
  } else {
    Out("error unknown command '%s'", cmd.c_str());
  }
}

int SlowPath::Run() {
  std::string error;
  fd_ = slcproto::Connect(o_.socketPath, &error);
  if (fd_ < 0) {
    std::fprintf(stderr, "sluice-slowpath: %s\n", error.c_str());
    return 3;
  }
  if (!o_.pcapPath.empty()) {
    pcap_ = pcap_open_dead(DLT_EN10MB, 65535);
    dumper_ = pcap_ != nullptr ? pcap_dump_open(pcap_, o_.pcapPath.c_str()) : nullptr;
    if (dumper_ == nullptr) {
      std::fprintf(stderr, "sluice-slowpath: cannot write %s\n", o_.pcapPath.c_str());
      return 2;
    }
  }
  Message reg;
  reg.type = Type::kSpRegister;
  reg.args["agent"] = o_.agent;
  reg.args["name"] = o_.name;
  if (!Send(reg)) return 3;

  const auto start = std::chrono::steady_clock::now();
  std::string pendingInput;
  bool input = o_.commands;
  int rc = 0;
  while (!gStop) {
    pollfd p[2] = {{fd_, POLLIN, 0}, {STDIN_FILENO, POLLIN, 0}};
    const int n = poll(p, input ? 2 : 1, 100);
    if (o_.maxSeconds > 0 && std::chrono::steady_clock::now() - start >
                                 std::chrono::duration<double>(o_.maxSeconds)) {
      break;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) continue;
    if (p[0].revents != 0) {
      Message m;
      if (!slcproto::ReadMessage(fd_, &m, &error, 5000)) {
        std::fprintf(stderr, "sluice-slowpath: link to the host closed: %s\n", error.c_str());
        rc = 1;
        break;
      }
      try {
        OnHost(m);
      } catch (const std::exception& e) {
        std::fprintf(stderr, "sluice-slowpath: malformed message from the host: %s\n", e.what());
      }
    }
    if (input && p[1].revents != 0) {
      char buf[4096];
      const ssize_t got = read(STDIN_FILENO, buf, sizeof buf);
      if (got <= 0) {
        input = false;   // end of commands; keep serving the host
        continue;
      }
      pendingInput.append(buf, static_cast<size_t>(got));
      size_t nl;
      while ((nl = pendingInput.find('\n')) != std::string::npos) {
        OnCommand(pendingInput.substr(0, nl));
        pendingInput.erase(0, nl + 1);
      }
      if (pendingInput.size() > 65536) pendingInput.clear();
    }
  }
  if (gStop == 2) rc = 1;
  if (dumper_ != nullptr) pcap_dump_close(dumper_);
  if (pcap_ != nullptr) pcap_close(pcap_);
  close(fd_);
  return rc;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  CLI::App app{
      "sluice-slowpath: a user-level slow path for a running sluice-host.\n\n"
      "A slow path's life:\n"
      "  register  connects to the host's control socket and registers with\n"
      "            one agent; the host gives it a number and attaches the\n"
      "            agent's filters to it (the least loaded slow path gets\n"
      "            each filter). Prints 'registered', 'attached FILTER'.\n"
      "  receive   packets that a rule punts or copies arrive with their\n"
      "            direction; they are counted per filter and direction,\n"
      "            printed (--print) and written to a capture (--pcap).\n"
      "  answer    with --reissue every packet received is sent back and\n"
      "            the host re-issues it in its direction.\n"
      "  push      commands on stdin (or --push) go to a filter over the\n"
      "            filter-ioctl channel:\n"
      "              push FILTER FILE   replace the rules (rule text or wire)\n"
      "              add FILTER FILE    add to the rules\n"
      "              rules FILTER       print the rules with their counters\n"
      "              clear FILTER       remove every rule\n"
      "              echo FILTER TEXT   check the channel\n"
      "              counts             print this slow path's own counts\n"
      "              quit\n"
      "  migrate   when a filter moves (sluice-ctl migrate), the host asks\n"
      "            for this slow path's state of the filter (its counts, as\n"
      "            bytes: 'fetched FILTER ... state=HEX'); the destination's\n"
      "            slow path is given them back ('restored FILTER ...') and\n"
      "            its counts continue from there.\n"
      "  leave     on exit, or when killed, the host unregisters the slow\n"
      "            path; its filters move to another slow path of the agent\n"
      "            or wait detached. Traffic the rules accept is not touched.\n\n"
      "Exit status: 0 stopped, 1 link closed or refused, 2 usage, 3 no host.",
      "sluice-slowpath"};
  app.add_option("--socket", o.socketPath, "the host's control socket")->capture_default_str();
  app.add_option("--agent", o.agent, "the agent to register with")->required();
  app.add_option("--name", o.name, "a name for this slow path in the host's stats")
      ->capture_default_str();
  app.add_flag("--print", o.print, "print a line for every packet received");
  app.add_option("--pcap", o.pcapPath, "write the packets received to this capture file");
  app.add_flag("--reissue", o.reissue, "send every packet received back to be re-issued");
  app.add_option("--push", o.pushes,
                 "FILTER=FILE: push this ruleset when FILTER is first attached (repeatable)");
  app.add_flag("--refuse-restore", o.refuseRestore,
               "answer every state restore with a failure (to see the host's failure path)");
  bool noCommands = false;
  app.add_flag("--no-commands", noCommands, "do not read commands from stdin");
  app.add_option("--max-seconds", o.maxSeconds, "stop by itself after this long (0: never)");
  CLI11_PARSE(app, argc, argv);
  o.commands = !noCommands;

  struct sigaction sa {};
  sa.sa_handler = OnStop;
  sigemptyset(&sa.sa_mask);
  sigaction(SIGTERM, &sa, nullptr);
  sigaction(SIGINT, &sa, nullptr);
  signal(SIGPIPE, SIG_IGN);
  return SlowPath(o).Run();
}
