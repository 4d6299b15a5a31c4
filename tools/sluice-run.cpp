// sluice-run: loads the module into the userspace host, puts a filter on a
// virtual NIC, installs a ruleset, pushes captured frames through the filter
// and shows, packet by packet, how the filter decided and what it did; then
// every rule with its counters and the module log. Output captures receive
// the frames that left toward the VM or the switch, the drops, the
// slow-path copies and the GRE datagrams.
//
//   sluice-run                                   built-in ruleset and frames
//   sluice-run --rules examples/web.rules --capture in.pcapng --trace
//   sluice-run --capture in.pcap --vm-mac 02:00:00:00:00:10 --out-switch out.pcap
//   sluice-run --json --capture - < in.pcap
//
// Exit status: 0 when everything ran, 1 on an error (bad input, refused
// ruleset, something the module left behind), 2 for a bad command line,
// 3 when the capture was damaged and only the records before the damage
// were replayed.

#include <CLI/CLI.hpp>
#include <fmt/format.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "tools/lib/capture.h"
#include "tools/lib/frames.h"
#include "tools/lib/render.h"
#include "tools/lib/ruleset_builder.h"
#include "tools/lib/run.h"

namespace {

constexpr int kExitError = 1;
constexpr int kExitUsage = 2;
constexpr int kExitDamagedCapture = 3;
constexpr size_t kMaxRulesText = 64u << 20;

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
  std::string agentText = runner::Config().agentText;
  std::string rulesPath;
  bool noRules = false;
  std::string capturePath;
  std::string direction = "auto";
  std::string vmMac, vmIp;
  bool slowPath = false;
  uint32_t failurePolicy = 0;
  bool trace = false;
  bool json = false;
  bool quietLog = false;
  bool noCounters = false;
  std::string outVm, outSwitch, outDropped, outSlowPath, outGre;
  uint32_t snapLen = 262144;
  std::string greSource = "192.0.2.1";
};

std::vector<frames::CaptureRecord> DefaultFrames() {
  using frames::FrameBuilder;
  using frames::Ip4;
  using frames::Mac;
  const auto vm = Mac("02:00:00:00:00:10");
  const auto gw = Mac("02:00:00:00:00:01");
  std::vector<frames::CaptureRecord> out;
  int64_t t = 1700000000;
  auto add = [&](uint32_t dir, const frames::Bytes& f) { out.push_back({dir, f, 0, t++, 0}); };
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
  add(2, FrameBuilder().Eth(Mac("01:80:c2:00:00:00"), vm).Llc().EtherType(0x0027).Payload(38)
             .Build());
  add(2, FrameBuilder().Eth(gw, vm).Arp(1, vm, Ip4("10.0.0.10"), Mac("00:00:00:00:00:00"),
                                        Ip4("10.0.0.1"))
             .Build());
  add(1, FrameBuilder().Eth(vm, gw).Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("2001:db8::10"))
             .Udp(5353, 5353)
             .Build());
  return out;
}

// A one-line error and the status to exit with.
int Fail(const std::string& what, int status = kExitError) {
  std::fprintf(stderr, "sluice-run: %s\n", what.c_str());
  return status;
}

// The text of `path` ("-" = standard input); nullopt with *error set for a
// directory, an unreadable file or one too large.
std::optional<std::string> ReadText(const std::string& path, std::string* error) {
  if (path == "-") {
    std::string s(std::istreambuf_iterator<char>(std::cin), {});
    return s;
  }
  std::error_code ec;
  if (std::filesystem::is_directory(path, ec)) {
    *error = path + ": is a directory, not a ruleset file";
    return std::nullopt;
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    *error = path + ": cannot open";
    return std::nullopt;
  }
  const auto size = std::filesystem::file_size(path, ec);
  if (!ec && size > kMaxRulesText) {
    *error = path + ": larger than 64 MiB";
    return std::nullopt;
  }
  std::ostringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

struct Output {
  const std::string* path;
  const std::vector<frames::CaptureRecord>* records;
  frames::LinkType link;
};

}  // namespace

int main(int argc, char** argv) {
  Options o;
  CLI::App app{"Runs captured frames through the module's filter and shows what it did.",
               "sluice-run"};
  app.add_option("--agent", o.agentText, "agent create text, NAME[:default-action=ACTION_...]")
      ->capture_default_str();
  app.add_option("--rules", o.rulesPath,
                 "ruleset in the rule text syntax (- = standard input; default: built-in)");
  app.add_flag("--no-rules", o.noRules, "no ruleset: every packet gets the default action");
  app.add_option("--capture", o.capturePath,
                 "pcap or pcapng capture to push (- = standard input; default: built-in)");
  app.add_option("--direction", o.direction,
                 "direction of records whose capture does not give one: from (the switch), "
                 "to (the switch) or auto (by --vm-mac/--vm-ip)")
      ->check(CLI::IsMember({"from", "to", "auto"}))
      ->capture_default_str();
  app.add_option("--vm-mac", o.vmMac, "MAC address of the VM side, for --direction auto");
  app.add_option("--vm-ip", o.vmIp, "IPv4 or IPv6 address of the VM side, for --direction auto");
  app.add_flag("--slow-path", o.slowPath, "register slow path #1 and attach the filter");
  app.add_option("--failure-policy", o.failurePolicy, "filter failure policy (0 drop, 1 pass)")
      ->check(CLI::Range(0u, 1u))
      ->capture_default_str();
  app.add_flag("--trace", o.trace, "show how each verdict was reached and what it did");
  app.add_flag("--json", o.json, "print one JSON document instead of text");
  app.add_flag("--quiet-log", o.quietLog, "do not show the module log");
  app.add_flag("--no-counters", o.noCounters, "do not list the rules' counters");
  app.add_option("--out-vm", o.outVm, "write frames leaving toward the VM (pcap; - = stdout)");
  app.add_option("--out-switch", o.outSwitch, "write frames leaving toward the switch");
  app.add_option("--out-dropped", o.outDropped, "write the dropped frames");
  app.add_option("--out-slow-path", o.outSlowPath, "write slow-path copies and punts");
  app.add_option("--out-gre", o.outGre, "write GRE datagrams as their receiver sees them (raw IPv4)");
  app.add_option("--snap-len", o.snapLen, "snap length of the output captures")
      ->check(CLI::Range(1u, 262144u))
      ->capture_default_str();
  app.add_option("--gre-source", o.greSource, "outer source address of GRE datagrams")
      ->capture_default_str();
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    if (e.get_exit_code() == 0) return app.exit(e);
    return Fail(std::string(e.what()) + " (try --help)", kExitUsage);
  }

  // Inputs.
  if (o.rulesPath == "-" && o.capturePath == "-") {
    return Fail("--rules and --capture cannot both read standard input", kExitUsage);
  }
  const Output outputs[] = {
      {&o.outVm, nullptr, frames::LinkType::Ethernet},
      {&o.outSwitch, nullptr, frames::LinkType::Ethernet},
      {&o.outDropped, nullptr, frames::LinkType::Ethernet},
      {&o.outSlowPath, nullptr, frames::LinkType::Ethernet},
      {&o.outGre, nullptr, frames::LinkType::RawIpv4},
  };
  int toStdout = o.json ? 1 : 0;
  for (const Output& out : outputs) toStdout += *out.path == "-" ? 1 : 0;
  if (toStdout > 1) return Fail("only one output can go to standard output", kExitUsage);

  frames::DirectionRule directionRule;
  {
    std::string error;
    if (!frames::MakeDirectionRule(o.direction, o.vmMac, o.vmIp, &directionRule, &error)) {
      return Fail(error, kExitUsage);
    }
  }

  runner::Config config;
  config.agentText = o.agentText;
  config.slowPath = o.slowPath;
  config.failurePolicy = o.failurePolicy;
  if (!frames::TryParseIp4(o.greSource, &config.greSource)) {
    return Fail("--gre-source: not an IPv4 address: " + o.greSource, kExitUsage);
  }
  if (!o.noRules) {
    std::string text = kDefaultRules;
    if (!o.rulesPath.empty()) {
      std::string error;
      std::optional<std::string> read = ReadText(o.rulesPath, &error);
      if (!read) return Fail(error);
      text = std::move(*read);
    }
    // Rule text errors come located, as sluice-rules reports them.
    const rules::RulesetText read = rules::ReadRulesetText(text);
    if (!read.Ok()) {
      const std::string file = o.rulesPath.empty() ? "built-in rules"
                               : o.rulesPath == "-" ? "<stdin>"
                                                    : o.rulesPath;
      std::fputs(rules::RenderDiagnostics(file, read.diagnostics).c_str(), stderr);
      return kExitError;
    }
    config.ruleset = rules::RulesetBytes(read);
  }

  int exitStatus = 0;
  std::string captureWarning;
  if (o.capturePath.empty()) {
    config.records = DefaultFrames();
  } else {
    frames::CaptureRead read = frames::ReadCapture(o.capturePath);
    if (!read.ok() && !read.badRecord) return Fail(o.capturePath + ": " + read.error);
    if (!read.ok()) {
      captureWarning = o.capturePath + ": " + read.error + "; replaying the " +
                       std::to_string(read.records.size()) + " records before it";
      exitStatus = kExitDamagedCapture;
    }
    config.records = std::move(read.records);
    if (std::optional<size_t> bad = frames::ResolveDirections(&config.records, directionRule)) {
      return Fail(fmt::format("{}: record {} has no direction (the capture records none; give "
                              "--direction, --vm-mac or --vm-ip)",
                              o.capturePath, *bad + 1));
    }
  }
  if (!captureWarning.empty()) std::fprintf(stderr, "sluice-run: %s\n", captureWarning.c_str());

  // Output captures are opened before the run, so a bad path costs nothing.
  std::vector<frames::CaptureWriter> writers(std::size(outputs));
  for (size_t i = 0; i < std::size(outputs); i++) {
    if (outputs[i].path->empty()) continue;
    std::string error;
    if (!writers[i].Open(*outputs[i].path, outputs[i].link, o.snapLen, &error)) {
      return Fail(*outputs[i].path + ": " + error);
    }
  }

  const runner::Result result = runner::Run(config);
  if (!result.error.empty()) return Fail(result.error);

  const std::vector<frames::CaptureRecord>* produced[] = {
      &result.outputs.toVm, &result.outputs.toSwitch, &result.outputs.dropped,
      &result.outputs.slowPath, &result.outputs.gre};
  for (size_t i = 0; i < std::size(outputs); i++) {
    if (!writers[i].IsOpen()) continue;
    for (const frames::CaptureRecord& r : *produced[i]) writers[i].Write(r);
    std::string error;
    if (!writers[i].Close(&error)) {
      std::fprintf(stderr, "sluice-run: %s: %s\n", outputs[i].path->c_str(), error.c_str());
      exitStatus = kExitError;
    }
  }

  const bool textToStderr = toStdout > 0 && !o.json;
  FILE* text = textToStderr ? stderr : stdout;
  if (o.json) {
    nlohmann::json doc;
    doc["schema"] = render::kJsonSchema;
    doc["tool"] = "sluice-run";
    if (!config.ruleset.empty()) {
      doc["ruleset"] = {{"status", result.rulesetStatus}, {"bytes", config.ruleset.size()}};
    }
    if (!captureWarning.empty()) doc["captureError"] = captureWarning;
    nlohmann::json packets = nlohmann::json::array();
    for (const render::PacketReport& p : result.packets) packets.push_back(render::PacketJson(p));
    doc["packets"] = packets;
    if (!o.noCounters) doc["counters"] = render::CountersJson(result.counters);
    if (!o.quietLog) doc["log"] = render::LogJson(result.log);
    doc["leftovers"] = result.leftovers;
    std::string s = doc.dump(2, ' ', false, nlohmann::json::error_handler_t::replace);
    std::fprintf(stdout, "%s\n", s.c_str());
  } else {
    if (!config.ruleset.empty()) {
      std::fprintf(text, "ruleset of %zu bytes written: %s\n\n", config.ruleset.size(),
                   result.rulesetStatus.c_str());
    }
    std::fprintf(text, "%-4s %-4s %-60s %s\n", "#", "dir", "frame", "verdict");
    for (const render::PacketReport& p : result.packets) {
      std::fputs(render::PacketText(p, o.trace).c_str(), text);
    }
    if (!o.noCounters) {
      std::fprintf(text, "\ncounters:\n%s", render::CountersText(result.counters).c_str());
    }
    if (!o.quietLog) std::fprintf(text, "\nmodule log:\n%s", render::LogText(result.log).c_str());
  }

  if (result.rulesetRefused) {
    std::fprintf(stderr, "sluice-run: the module refused the ruleset (%s)\n",
                 result.rulesetStatus.c_str());
    exitStatus = kExitError;
  }
  for (const std::string& what : result.leftovers) {
    std::fprintf(stderr, "sluice-run: left behind: %s\n", what.c_str());
    exitStatus = kExitError;
  }
  return exitStatus;
}
