// sluice-ctl: the operator's command for a running sluice-host. Every
// request goes over the host's control socket and is answered through the
// module's own channel for it.
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "service/ctl/render.h"
#include "service/protocol/protocol.h"
#include "tools/lib/ruleset_builder.h"

namespace {

using slcproto::Message;
using slcproto::Type;

struct Common {
  std::string socketPath = "/run/sluice-host.sock";
  bool json = false;
  int timeoutMs = 30000;
};

bool ReadInput(const std::string& path, std::string* out) {
  if (path == "-") {
    out->assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    return true;
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::stringstream ss;
  ss << in.rdbuf();
  *out = ss.str();
  return true;
}

// A ruleset from a file: rule text compiled by the rules library, or with
// `wire` the wire bytes as they are.
bool LoadRuleset(const std::string& path, bool wire, std::vector<uint8_t>* out) {
  std::string text;
  if (!ReadInput(path, &text)) {
    std::fprintf(stderr, "sluice-ctl: cannot read %s\n", path.c_str());
    return false;
  }
  if (wire) {
    out->assign(text.begin(), text.end());
    return true;
  }
  std::string error;
  if (!rules::TryParseRuleset(text, out, &error)) {
    std::fprintf(stderr, "sluice-ctl: %s: %s\n", path.c_str(), error.c_str());
    return false;
  }
  return true;
}

// Sends `req`; prints the error of a failed exchange or reply. Returns the
// exit status (0 ok, 1 refused, 3 no exchange).
int Call(const Common& c, const Message& req, Message* reply) {
  std::string error;
  if (!slcproto::Call(c.socketPath, req, reply, &error, c.timeoutMs)) {
    std::fprintf(stderr, "sluice-ctl: %s\n", error.c_str());
    return 3;
  }
  if (!reply->args.value("ok", false)) {
    std::fprintf(stderr, "sluice-ctl: %s\n",
                 reply->args.value("error", std::string("request refused")).c_str());
    return 1;
  }
  return 0;
}

// Prints a returned ruleset as rule text, or writes its wire bytes.
int PrintRuleset(const Message& reply, const std::string& wireOut) {
  if (!wireOut.empty()) {
    std::ofstream out(wireOut, std::ios::binary);
    out.write(reinterpret_cast<const char*>(reply.blob.data()),
              static_cast<std::streamsize>(reply.blob.size()));
    if (!out) {
      std::fprintf(stderr, "sluice-ctl: cannot write %s\n", wireOut.c_str());
      return 1;
    }
    return 0;
  }
  std::fputs(rules::FormatRuleset(reply.blob).c_str(), stdout);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  Common c;
  CLI::App app{
      "sluice-ctl: controls a running sluice-host over its control socket.\n\n"
      "Rulesets are rule text (the syntax of sluice-rules, '-' reads stdin)\n"
      "unless --wire says the file holds wire bytes. Filters are named by\n"
      "their port name; device requests may instead name a VM UUID and vNIC\n"
      "index. Exit status: 0 done, 1 refused by the host, 2 usage, 3 no\n"
      "answer from the host.",
      "sluice-ctl"};
  app.add_option("--socket", c.socketPath, "the host's control socket")->capture_default_str();
  app.add_flag("--json", c.json, "print replies as JSON");
  app.add_option("--timeout-ms", c.timeoutMs, "give up on a reply after this long")
      ->capture_default_str();
  app.require_subcommand(1);
  app.fallthrough();  // --json and --socket may also follow the subcommand

  Message req;
  std::string file, wireOut, agentArg, filterArg, uuidArg;
  uint32_t vnic = 0;
  bool wire = false;
  int64_t maxRules = 1000;

  auto* hello = app.add_subcommand("hello", "check that the host answers");
  auto* stats = app.add_subcommand("stats", "heap, packets, timers and per-port traffic counters");
  auto* agent = app.add_subcommand("create-agent", "create an agent from its create text");
  std::string agentText;
  agent->add_option("text", agentText, "NAME[:default-action=ACTION_...]")->required();
  auto* addPort = app.add_subcommand("add-port", "open a port while the host runs");
  std::string portSettings;
  addPort
      ->add_option("settings", portSettings,
                   "name=FILTER,agent=AGENT,vm=IF,switch=IF[,uuid=U][,vnic=N][,endpoint=N]"
                   "[,failure=N]")
      ->required();
  auto* removePort = app.add_subcommand("remove-port", "destroy a port's filter and close it");
  std::string portName;
  removePort->add_option("name", portName, "port (filter) name")->required();

  auto* rs = app.add_subcommand("ruleset", "the filter's ruleset through the agent's property");
  rs->require_subcommand(1);
  auto* rsSet = rs->add_subcommand("set", "write a ruleset");
  rsSet->add_option("filter", filterArg, "port (filter) name")->required();
  rsSet->add_option("file", file, "ruleset file ('-': stdin)")->required();
  rsSet->add_flag("--wire", wire, "the file holds a wire ruleset");
  auto* rsGet = rs->add_subcommand("get", "read the ruleset in force");
  rsGet->add_option("filter", filterArg, "port (filter) name")->required();
  rsGet->add_option("--wire", wireOut, "write the wire bytes to this file instead of text");
  auto* rsPoll = rs->add_subcommand("poll", "ask whether a ruleset can be read and its size");
  rsPoll->add_option("filter", filterArg, "port (filter) name")->required();

  auto* dev = app.add_subcommand("dev", "requests on the agent's character device");
  dev->require_subcommand(1);
  auto addTarget = [&](CLI::App* sub) {
    sub->add_option("--filter", filterArg, "filter name");
    sub->add_option("--uuid", uuidArg, "VM UUID (with --vnic)");
    sub->add_option("--vnic", vnic, "vNIC index");
    sub->add_option("--agent", agentArg, "agent whose device to use (default: the port's)");
  };
  auto* devSet = dev->add_subcommand("set", "set a ruleset through the device");
  addTarget(devSet);
  devSet->add_option("file", file, "ruleset file ('-': stdin)")->required();
  devSet->add_flag("--wire", wire, "the file holds a wire ruleset");
  auto* devGet = dev->add_subcommand("get", "get the ruleset in force through the device");
  addTarget(devGet);
  devGet->add_option("--wire", wireOut, "write the wire bytes to this file instead of text");
  auto* devTest = dev->add_subcommand("test", "send a test ioctl to the filter's slow path");
  addTarget(devTest);

  auto* status = app.add_subcommand("status", "the status tree: agents, filters, rules, counters");
  status->add_option("--agent", agentArg, "only this agent");
  status->add_option("--max-rules", maxRules, "rules shown per filter")->capture_default_str();

  auto* migrate = app.add_subcommand(
      "migrate",
      "move a port's filter (rules, counters, slow path state) to another sluice-host");
  std::string migrateTo, migrateVm, migrateSwitch;
  migrate->add_option("port", portName, "port (filter) name")->required();
  migrate->add_option("--to", migrateTo, "the destination host's control socket")->required();
  migrate->add_option("--vm", migrateVm, "VM-side interface there (default: the same name)");
  migrate->add_option("--switch", migrateSwitch,
                      "switch-side interface there (default: the same name)");

  CLI11_PARSE(app, argc, argv);

  Message reply;
  int rc = 0;
  auto deviceTarget = [&](Type type) {
    req.type = type;
    if (!filterArg.empty()) {
      req.args["filter"] = filterArg;
    } else if (!uuidArg.empty()) {
      req.args["uuid"] = uuidArg;
      req.args["vnic"] = vnic;
    } else {
      std::fprintf(stderr, "sluice-ctl: say --filter NAME or --uuid UUID --vnic N\n");
      return false;
    }
    if (!agentArg.empty()) req.args["agent"] = agentArg;
    return true;
  };

  if (*hello) {
    req.type = Type::kHello;
  } else if (*stats) {
    req.type = Type::kStats;
  } else if (*agent) {
    req.type = Type::kCreateAgent;
    req.args["text"] = agentText;
  } else if (*addPort) {
    // The host checks the settings; here it is only split into fields.
    req.type = Type::kAddPort;
    nlohmann::json port = nlohmann::json::object();
    std::stringstream in(portSettings);
    std::string item;
    while (std::getline(in, item, ',')) {
      const size_t eq = item.find('=');
      if (eq == std::string::npos) {
        std::fprintf(stderr, "sluice-ctl: port field without '=': %s\n", item.c_str());
        return 2;
      }
      const std::string k = item.substr(0, eq), v = item.substr(eq + 1);
      if (k == "vnic" || k == "endpoint" || k == "failure") {
        char* end = nullptr;
        const unsigned long long n = std::strtoull(v.c_str(), &end, 0);
        if (v.empty() || *end != '\0') {
          std::fprintf(stderr, "sluice-ctl: bad number for %s: %s\n", k.c_str(), v.c_str());
          return 2;
        }
        port[k] = n;
      } else {
        port[k] = v;
      }
    }
    req.args["port"] = port;
  } else if (*removePort) {
    req.type = Type::kRemovePort;
    req.args["name"] = portName;
  } else if (*rsSet) {
    req.type = Type::kRulesetWrite;
    req.args["filter"] = filterArg;
    if (!LoadRuleset(file, wire, &req.blob)) return 2;
  } else if (*rsGet) {
    req.type = Type::kRulesetRead;
    req.args["filter"] = filterArg;
  } else if (*rsPoll) {
    req.type = Type::kRulesetPoll;
    req.args["filter"] = filterArg;
  } else if (*devSet) {
    if (!deviceTarget(Type::kDevSetRuleset)) return 2;
    if (!LoadRuleset(file, wire, &req.blob)) return 2;
  } else if (*devGet) {
    if (!deviceTarget(Type::kDevGetRuleset)) return 2;
  } else if (*devTest) {
    if (!deviceTarget(Type::kDevTestIoctl)) return 2;
  } else if (*status) {
    req.type = Type::kStatus;
    req.args["maxRules"] = maxRules;
    if (!agentArg.empty()) req.args["agent"] = agentArg;
  }

  if (*migrate) {
    req.type = Type::kMigrateOut;
    req.args["port"] = portName;
    req.args["to"] = migrateTo;
    if (!migrateVm.empty()) req.args["vm"] = migrateVm;
    if (!migrateSwitch.empty()) req.args["switch"] = migrateSwitch;
  }

  rc = Call(c, req, &reply);
  if (rc != 0) return rc;

  if (*rsGet || *devGet) return PrintRuleset(reply, wireOut);
  nlohmann::json body = reply.args;
  if (*status && body.value("inBlob", false)) {
    body = nlohmann::json::parse(reply.blob.begin(), reply.blob.end(), nullptr, false);
    if (body.is_discarded()) {
      std::fprintf(stderr, "sluice-ctl: the host sent a malformed status tree\n");
      return 3;
    }
  }
  if (c.json) {
    body.erase("ok");
    body.erase("inBlob");
    std::printf("%s\n", body.dump(2, ' ', false, nlohmann::json::error_handler_t::replace).c_str());
  } else if (*status) {
    std::fputs(ctl::RenderStatus(body).c_str(), stdout);
  } else if (*stats) {
    std::fputs(ctl::RenderStats(body).c_str(), stdout);
  } else if (*rsPoll) {
    std::printf("%s, %s bytes\n", body.value("ready", false) ? "ready" : "nothing to read",
                body["size"].dump().c_str());
  } else if (*hello) {
    std::printf("%s pid %s, protocol %s\n", body.value("host", std::string()).c_str(),
                body["pid"].dump().c_str(), body["protocol"].dump().c_str());
  } else if (*migrate) {
    const nlohmann::json dest = body.value("destination", nlohmann::json::object());
    std::printf("migrated %s: %s bytes saved (rules %s, slow path %s), slow path state %s\n",
                portName.c_str(), body["savedBytes"].dump().c_str(),
                body["fastPathBytes"].dump().c_str(), body["slowPathBytes"].dump().c_str(),
                dest.value("slowPathState", std::string("unknown")).c_str());
  } else if (*devSet || *devTest) {
    std::printf("done (result %s)\n", body["result"].dump().c_str());
  } else {
    std::printf("done\n");
  }
  return 0;
}
