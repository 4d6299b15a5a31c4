// sluice-run: loads the module into the userspace host, puts a filter on a
// virtual NIC, optionally installs a ruleset through the agent's ruleset
// property, pushes frames through the filter in both directions, and prints
// what became of each packet and what the module logged.
//
//   sluice-run                       built-in agent, ruleset and frames
//   sluice-run --agent 'fw:default-action=ACTION_DROP' --no-rules
//   sluice-run --rules examples/web.rules --capture examples/web.pcap
//   sluice-run --slow-path --save-capture out.pcap

#include <cstdio>
#include <cstring>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/module.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace {

constexpr const char kDefaultAgentText[] = "sluice-demo:default-action=ACTION_PUNT";

// The built-in ruleset: a small web server's policy.
constexpr const char kDefaultRules[] = R"(ruleset version=8 features=1
# web traffic to the server is accepted; its replies go out
action=accept dir=from exact dmac=02:00:00:00:00:10 smac=02:00:00:00:00:01 vlan=none ipv4 sa=10.0.0.1 da=10.0.0.10 proto=tcp sport=40000 dport=80 bidir
# ssh from the management range, counted in the ordered list
action=accept dir=from ipv4 proto=tcp sa=192.168.1.0-192.168.1.255 da=10.0.0.10 dport=22
# anything else for port 22 is dropped
action=drop ipv4 proto=tcp dport=22
# DNS replies get a copy for the slow path
action=copy dir=from ipv4 proto=udp sport=53
# telnet is never allowed
action=drop ipv4 proto=tcp dport=23
)";

struct Options {
  std::string agentText = kDefaultAgentText;
  std::string rulesPath;
  bool noRules = false;
  std::string capturePath;
  std::string saveCapturePath;
  bool slowPath = false;
  bool quietLog = false;
  uint32_t failurePolicy = 0;
};

void Usage() {
  std::printf(
      "usage: sluice-run [options]\n"
      "  --agent TEXT          agent create text, NAME[:default-action=ACTION_...]\n"
      "                        (default: %s)\n"
      "  --rules FILE          ruleset in the rule text syntax (default: built-in)\n"
      "  --no-rules            no ruleset: every packet gets the default action\n"
      "  --capture FILE        pcap capture to push (default: built-in frames)\n"
      "  --save-capture FILE   write the frames pushed as a pcap capture\n"
      "  --slow-path           register slow path #1 and attach the filter\n"
      "  --failure-policy N    filter failure policy (default 0)\n"
      "  --quiet-log           do not print the module log\n",
      kDefaultAgentText);
}

bool ParseArgs(int argc, char** argv, Options* o) {
  for (int i = 1; i < argc; i++) {
    std::string a = argv[i];
    auto value = [&](std::string* out) {
      if (i + 1 >= argc) {
        std::fprintf(stderr, "sluice-run: %s needs a value\n", a.c_str());
        return false;
      }
      *out = argv[++i];
      return true;
    };
    std::string v;
    if (a == "--agent") {
      if (!value(&o->agentText)) return false;
    } else if (a == "--rules") {
      if (!value(&o->rulesPath)) return false;
    } else if (a == "--no-rules") {
      o->noRules = true;
    } else if (a == "--capture") {
      if (!value(&o->capturePath)) return false;
    } else if (a == "--save-capture") {
      if (!value(&o->saveCapturePath)) return false;
    } else if (a == "--slow-path") {
      o->slowPath = true;
    } else if (a == "--failure-policy") {
      if (!value(&v)) return false;
      o->failurePolicy = static_cast<uint32_t>(std::strtoul(v.c_str(), nullptr, 0));
    } else if (a == "--quiet-log") {
      o->quietLog = true;
    } else if (a == "--help" || a == "-h") {
      Usage();
      std::exit(0);
    } else {
      std::fprintf(stderr, "sluice-run: unknown option %s (try --help)\n", a.c_str());
      return false;
    }
  }
  return true;
}

std::vector<frames::CaptureRecord> DefaultFrames() {
  using frames::FrameBuilder;
  using frames::Ip4;
  using frames::Mac;
  const auto vm = Mac("02:00:00:00:00:10");
  const auto gw = Mac("02:00:00:00:00:01");
  std::vector<frames::CaptureRecord> out;
  auto add = [&](uint32_t dir, const frames::Bytes& f) { out.push_back({dir, f, 0}); };
  add(1, FrameBuilder().Eth(vm, gw).Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.10")).Tcp(40000, 80,
                                                                                frames::kTcpSyn)
             .Build());
  add(2, FrameBuilder().Eth(gw, vm).Ipv4(Ip4("10.0.0.10"), Ip4("10.0.0.1")).Tcp(80, 40000,
                                                                                frames::kTcpSyn |
                                                                                    frames::kTcpAck)
             .Build());
  add(1, FrameBuilder().Eth(vm, gw).Ipv4(Ip4("192.168.1.7"), Ip4("10.0.0.10")).Tcp(51000, 22)
             .Payload(32)
             .Build());
  add(1, FrameBuilder().Eth(vm, gw).Ipv4(Ip4("203.0.113.9"), Ip4("10.0.0.10")).Tcp(51000, 22)
             .Build());
  add(1, FrameBuilder().Eth(vm, gw).Ipv4(Ip4("10.0.0.53"), Ip4("10.0.0.10")).Udp(53, 33000)
             .Payload(48)
             .Build());
  add(2, FrameBuilder().Eth(gw, vm).Ipv4(Ip4("10.0.0.10"), Ip4("10.0.0.99")).Tcp(45000, 23)
             .Build());
  add(2, FrameBuilder().Eth(Mac("01:80:c2:00:00:00"), vm).EtherType(0x0027).Payload(46).Build());
  add(2, FrameBuilder().Eth(gw, vm).Arp(1, vm, Ip4("10.0.0.10"), Mac("00:00:00:00:00:00"),
                                        Ip4("10.0.0.1"))
             .Build());
  add(1, FrameBuilder().Eth(vm, gw).Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::10"))
             .Udp(5353, 5353)
             .Build());
  return out;
}

// A one-line description of a frame for the report.
std::string Describe(const frames::Bytes& f) {
  char buf[160];
  if (f.size() < 14) return "runt frame (" + std::to_string(f.size()) + " bytes)";
  size_t off = 12;
  uint16_t type = static_cast<uint16_t>((f[off] << 8) | f[off + 1]);
  if (type == 0x8100 && f.size() >= 18) {
    off = 16;
    type = static_cast<uint16_t>((f[off] << 8) | f[off + 1]);
  }
  size_t l3 = off + 2;
  auto port = [&](size_t at) { return (f[at] << 8) | f[at + 1]; };
  if (type == 0x0800 && f.size() >= l3 + 20) {
    size_t l4 = l3 + 4 * (f[l3] & 0xf);
    uint8_t proto = f[l3 + 9];
    std::snprintf(buf, sizeof(buf), "IPv4 %u.%u.%u.%u > %u.%u.%u.%u", f[l3 + 12], f[l3 + 13],
                  f[l3 + 14], f[l3 + 15], f[l3 + 16], f[l3 + 17], f[l3 + 18], f[l3 + 19]);
    std::string s = buf;
    if ((proto == 6 || proto == 17) && f.size() >= l4 + 4) {
      s += (proto == 6 ? " tcp " : " udp ") + std::to_string(port(l4)) + " > " +
           std::to_string(port(l4 + 2));
    } else {
      s += " proto " + std::to_string(proto);
    }
    return s;
  }
  if (type == 0x86dd && f.size() >= l3 + 40) {
    uint8_t nh = f[l3 + 6];
    std::string s = "IPv6";
    if ((nh == 6 || nh == 17) && f.size() >= l3 + 44) {
      s += (nh == 6 ? " tcp " : " udp ") + std::to_string(port(l3 + 40)) + " > " +
           std::to_string(port(l3 + 42));
    } else {
      s += " next header " + std::to_string(nh);
    }
    return s;
  }
  std::snprintf(buf, sizeof(buf), "ethertype 0x%04x to %02x:%02x:%02x:%02x:%02x:%02x", type, f[0],
                f[1], f[2], f[3], f[4], f[5]);
  return buf;
}

bool ReadFile(const std::string& path, std::string* out) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::stringstream ss;
  ss << in.rdbuf();
  *out = ss.str();
  return true;
}

std::string AgentName(const std::string& createText) {
  return createText.substr(0, createText.find(':'));
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  if (!ParseArgs(argc, argv, &o)) return 2;

  std::vector<uint8_t> ruleset;
  if (!o.noRules) {
    std::string text = kDefaultRules;
    if (!o.rulesPath.empty() && !ReadFile(o.rulesPath, &text)) {
      std::fprintf(stderr, "sluice-run: cannot read %s\n", o.rulesPath.c_str());
      return 1;
    }
    try {
      ruleset = rules::RulesetBuilder().AddText(text).Bytes();
    } catch (const rules::RuleError& e) {
      std::fprintf(stderr, "sluice-run: %s: %s\n",
                   o.rulesPath.empty() ? "built-in rules" : o.rulesPath.c_str(), e.what());
      return 1;
    }
  }

  std::vector<frames::CaptureRecord> records;
  if (o.capturePath.empty()) {
    records = DefaultFrames();
  } else {
    std::string error;
    if (!frames::ReadCapture(o.capturePath, &records, &error)) {
      std::fprintf(stderr, "sluice-run: %s: %s\n", o.capturePath.c_str(), error.c_str());
      return 1;
    }
  }
  if (!o.saveCapturePath.empty()) {
    std::string error;
    if (!frames::WriteCapture(o.saveCapturePath, records, &error)) {
      std::fprintf(stderr, "sluice-run: %s: %s\n", o.saveCapturePath.c_str(), error.c_str());
      return 1;
    }
  }

  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  if (host::Loader::Load(&slcGenericModuleImage) != 0) {
    std::fprintf(stderr, "sluice-run: the module did not start\n");
    for (const auto& r : host::Log::Records()) std::fprintf(stderr, "  %s", r.rendered.c_str());
    return 1;
  }

  const std::string agent = AgentName(o.agentText);
  int rc = 0;
  ZelStatus status = host::ClientPorts::Write(kSLCGenericCreateAgentPropName, o.agentText);
  host::FilterId filter = 0;
  if (status != ZEL_OK || !host::Sluice::AgentRegistered(agent)) {
    std::fprintf(stderr, "sluice-run: agent '%s' was not created (%#x)\n", agent.c_str(), status);
    rc = 1;
  } else {
    host::FilterConfig config;
    config.name = "vm1.eth0";
    config.vmUUID = "564d-demo-vm1";
    config.failurePolicy = o.failurePolicy;
    status = host::Sluice::CreateFilter(agent, config, &filter);
    if (status != ZEL_OK) {
      std::fprintf(stderr, "sluice-run: filter not created (%#x)\n", status);
      rc = 1;
    }
  }

  if (rc == 0 && o.slowPath) {
    (void)host::Sluice::RegisterSlowPath(agent, 1);
    host::Timers::RunDue();
  }
  if (rc == 0 && !ruleset.empty()) {
    status = host::Sluice::PropertyWrite(agent + ".ruleset", filter, ruleset);
    std::printf("ruleset of %zu bytes written to %s.ruleset: %s\n", ruleset.size(), agent.c_str(),
                zel_StatusToString(status));
    if (status != ZEL_OK) rc = 1;
  }

  if (rc == 0) {
    std::printf("\n%-3s %-5s %-48s %s\n", "#", "dir", "frame", "fate");
    for (size_t i = 0; i < records.size(); i++) {
      const frames::CaptureRecord& rec = records[i];
      uint32_t dir = rec.direction == 2 ? 2 : 1;
      host::PacketList list;
      ZelPkt* pkt = host::Packets::Make(rec.frame);
      uint64_t serial = host::Packets::Serial(pkt);
      list.Append(pkt);
      size_t gre = host::Sockets::Sent().size();
      ZelStatus st = host::Sluice::Deliver(filter, list, dir);

      std::vector<std::string> fate;
      for (ZelPkt* p : list.Packets()) {
        if (host::Packets::Serial(p) == serial) fate.push_back("passed");
      }
      for (auto& d : host::Sluice::TakeFaulted(filter)) {
        for (ZelPkt* p : d.packets) {
          if (host::Packets::Serial(p) == serial) fate.push_back("to slow path");
          zel_PktRelease(p);
        }
      }
      for (auto& d : host::Sluice::TakeIssued(filter)) {
        for (ZelPkt* p : d.packets) {
          if (host::Packets::Serial(p) == serial) fate.push_back("turned back to switch");
          zel_PktRelease(p);
        }
      }
      size_t sent = host::Sockets::Sent().size() - gre;
      if (sent > 0) fate.push_back("GRE copy sent");
      if (fate.empty()) fate.push_back("dropped");
      std::string text;
      for (const auto& f : fate) text += (text.empty() ? "" : ", ") + f;
      if (st != ZEL_OK) text += std::string(" (status ") + zel_StatusToString(st) + ")";
      std::printf("%-3zu %-5s %-48s %s\n", i + 1, dir == 1 ? "from" : "to",
                  Describe(rec.frame).c_str(), text.c_str());
    }
  }

  if (!o.quietLog) {
    std::printf("\nmodule log:\n");
    for (const auto& r : host::Log::Records()) {
      std::printf("  [%d] %s", r.urgency, r.rendered.c_str());
    }
  }

  if (filter != 0) {
    while (host::Sluice::DestroyFilter(filter) == ZEL_BUSY) {
      host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    }
  }
  host::Loader::Unload();
  for (const std::string& what : host::Leftovers()) {
    std::fprintf(stderr, "sluice-run: left behind: %s\n", what.c_str());
    rc = 1;
  }
  host::Reset();
  return rc;
}
