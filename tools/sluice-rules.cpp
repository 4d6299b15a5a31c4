// sluice-rules: the rule text language's compiler and its checks.
//
//   sluice-rules compile web.rules web.bin     text -> wire
//   sluice-rules decode web.bin                wire -> text on stdout
//   sluice-rules check web.rules               errors, and each rule's kind
//   sluice-rules lint web.rules                rules that never match and
//                                              flags without effect
//   sluice-rules diff old.rules new.rules [--capture c.pcap]
//
// Every command reads the same language through ReadRulesetText, so check
// and compile accept exactly the same texts.

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include <cstdio>
#include <fstream>
#include <string>
#include <vector>

#include "firewall/fw_trace.h"
#include "tools/lib/capture.h"
#include "tools/lib/render.h"
#include "tools/lib/frames.h"
#include "tools/lib/rule_analysis.h"
#include "tools/lib/ruleset_builder.h"
#include "tools/lib/verdict_diff.h"

namespace {

// Rule texts and wire rulesets larger than this are refused before they are
// read, so a hostile file cannot make the tool allocate without bound.
constexpr uint64_t kMaxFileBytes = 256ull << 20;

// With --json, check, lint and diff print one document on standard output
// instead of text (schema 1, as every tool's JSON; see the README).
bool gJson = false;
nlohmann::json gDoc;

void PrintJson() { std::printf("%s\n", gDoc.dump(2).c_str()); }

bool ReadBounded(const std::string& path, std::string* out) {
  std::ifstream in(path, std::ios::binary | std::ios::ate);
  if (!in) {
    std::fprintf(stderr, "sluice-rules: cannot read %s\n", path.c_str());
    return false;
  }
  const std::streamoff size = in.tellg();
  if (size < 0 || static_cast<uint64_t>(size) > kMaxFileBytes) {
    std::fprintf(stderr, "sluice-rules: %s: larger than %llu MiB\n", path.c_str(),
                 static_cast<unsigned long long>(kMaxFileBytes >> 20));
    return false;
  }
  out->resize(static_cast<size_t>(size));
  in.seekg(0);
  in.read(out->data(), size);
  if (!in) {
    std::fprintf(stderr, "sluice-rules: cannot read %s\n", path.c_str());
    return false;
  }
  return true;
}

// A rules file: text, or a wire ruleset (first byte 7 or 8) read as the
// text decode prints. Prints the errors and returns false when it has any.
bool Load(const std::string& path, rules::RulesetText* out) {
  std::string data;
  if (!ReadBounded(path, &data)) return false;
  if (!data.empty() && (data[0] == 7 || data[0] == 8)) {
    try {
      data = rules::FormatRuleset(std::span(reinterpret_cast<const uint8_t*>(data.data()), data.size()));
    } catch (const rules::RuleError& e) {
      std::fprintf(stderr, "sluice-rules: %s: %s\n", path.c_str(), e.what());
      return false;
    }
  }
  *out = rules::ReadRulesetText(data);
  if (!out->Ok()) {
    if (gJson) {
      for (const rules::Diagnostic& d : out->diagnostics) {
        gDoc["errors"].push_back({{"file", path},
                                  {"line", d.line},
                                  {"column", d.column},
                                  {"message", d.message},
                                  {"note", d.note}});
      }
      PrintJson();
    } else {
      std::fputs(rules::RenderDiagnostics(path, out->diagnostics).c_str(), stderr);
    }
    return false;
  }
  return true;
}

int Compile(const std::string& in, const std::string& outPath) {
  rules::RulesetText text;
  if (!Load(in, &text)) return 1;
  std::vector<uint8_t> bytes;
  try {
    bytes = rules::RulesetBytes(text);
  } catch (const rules::RuleError& e) {
    std::fprintf(stderr, "sluice-rules: %s: %s\n", in.c_str(), e.what());
    return 1;
  }
  std::ofstream out(outPath, std::ios::binary);
  out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  if (!out) {
    std::fprintf(stderr, "sluice-rules: cannot write %s\n", outPath.c_str());
    return 1;
  }
  std::printf("%zu rules, %zu bytes\n", text.rules.size(), bytes.size());
  return 0;
}

int Decode(const std::string& in) {
  std::string data;
  if (!ReadBounded(in, &data)) return 1;
  try {
    std::fputs(rules::FormatRuleset(std::span(reinterpret_cast<const uint8_t*>(data.data()), data.size())).c_str(),
               stdout);
  } catch (const rules::RuleError& e) {
    std::fprintf(stderr, "sluice-rules: %s: %s\n", in.c_str(), e.what());
    return 1;
  }
  return 0;
}

int Check(const std::string& in, bool quiet) {
  rules::RulesetText text;
  if (!Load(in, &text)) return 1;
  size_t exact = 0, mirrors = 0;
  for (const rules::TextRule& r : text.rules) {
    const std::vector<std::string> why = rules::GeneralReasons(r.rule);
    if (why.empty()) {
      exact++;
      if (r.rule.bidirectional == 1) mirrors++;
    }
    if (gJson) {
      nlohmann::json e = {{"line", r.line},
                          {"table", why.empty() && !r.isDefault ? "exact" : "general"},
                          {"action", rules::ActionName(r.rule.action)}};
      if (!why.empty()) e["generalBecause"] = why;
      if (why.empty() && r.rule.bidirectional == 1) e["mirrored"] = true;
      if (r.isDefault) e["default"] = true;
      gDoc["rules"].push_back(std::move(e));
      continue;
    }
    if (quiet) continue;
    std::string kind;
    if (r.isDefault) {
      kind = "general (default: catches every packet no other rule took)";
    } else if (why.empty()) {
      kind = "exact   (hash table, probed before every general rule)";
      if (r.rule.bidirectional == 1) kind += " + mirrored half";
    } else {
      std::string list;
      for (const std::string& w : why) {
        if (!list.empty()) list += ", ";
        list += w;
      }
      kind = "general (ordered list: " + list + ")";
    }
    std::printf("%s:%zu: %s\n", in.c_str(), r.line, kind.c_str());
  }
  if (gJson) {
    gDoc["file"] = in;
    gDoc["version"] = text.version;
    gDoc["counts"] = {{"rules", text.rules.size()},
                      {"exact", exact},
                      {"mirrored", mirrors},
                      {"general", text.rules.size() - exact}};
    PrintJson();
    return 0;
  }
  std::printf("%s: version %u, %zu rules: %zu exact (%zu mirrored), %zu general\n", in.c_str(),
              text.version, text.rules.size(), exact, mirrors, text.rules.size() - exact);
  return 0;
}

int Lint(const std::string& in) {
  rules::RulesetText text;
  if (!Load(in, &text)) return 1;
  const std::vector<rules::Finding> findings = rules::Lint(text);
  if (gJson) {
    gDoc["file"] = in;
    gDoc["findings"] = nlohmann::json::array();
    for (const rules::Finding& f : findings) {
      nlohmann::json e = {{"line", f.line}, {"message", f.message}};
      if (f.otherLine != 0) e["otherLine"] = f.otherLine;
      gDoc["findings"].push_back(std::move(e));
    }
    PrintJson();
    return findings.empty() ? 0 : 1;
  }
  for (const rules::Finding& f : findings) {
    std::printf("%s:%zu: %s\n", in.c_str(), f.line, f.message.c_str());
  }
  if (findings.empty()) std::printf("%s: no findings\n", in.c_str());
  return findings.empty() ? 0 : 1;
}

int Diff(const std::string& a, const std::string& b, const std::string& capture,
         const frames::DirectionRule& directionRule) {
  rules::RulesetText oldText, newText;
  if (!Load(a, &oldText) || !Load(b, &newText)) return 2;
  const std::vector<rules::RuleChange> changes = rules::DiffRules(oldText, newText);
  if (gJson) {
    gDoc["old"] = a;
    gDoc["new"] = b;
    gDoc["rules"] = nlohmann::json::array();
    for (const rules::RuleChange& c : changes) {
      nlohmann::json e = {{"change", c.kind == rules::RuleChange::kAdded     ? "added"
                                     : c.kind == rules::RuleChange::kRemoved ? "removed"
                                                                            : "changed"}};
      if (c.oldLine != 0 || c.kind == rules::RuleChange::kRemoved) e["oldLine"] = c.oldLine;
      if (c.newLine != 0 || c.kind == rules::RuleChange::kAdded) e["newLine"] = c.newLine;
      if (c.kind != rules::RuleChange::kAdded) e["oldText"] = c.oldText;
      if (c.kind != rules::RuleChange::kRemoved) e["newText"] = c.newText;
      gDoc["rules"].push_back(std::move(e));
    }
  }
  for (const rules::RuleChange& c : gJson ? std::vector<rules::RuleChange>{} : changes) {
    switch (c.kind) {
      case rules::RuleChange::kRemoved:
        std::printf("- %s:%zu: %s\n", a.c_str(), c.oldLine, c.oldText.c_str());
        break;
      case rules::RuleChange::kAdded:
        std::printf("+ %s:%zu: %s\n", b.c_str(), c.newLine, c.newText.c_str());
        break;
      case rules::RuleChange::kChanged:
        if (c.oldLine == 0) {
          std::printf("~ header: %s\n       -> %s\n", c.oldText.c_str(), c.newText.c_str());
        } else {
          std::printf("~ %s:%zu -> %s:%zu: %s\n       -> %s\n", a.c_str(), c.oldLine, b.c_str(),
                      c.newLine, c.oldText.c_str(), c.newText.c_str());
        }
        break;
    }
  }
  size_t verdicts = 0;
  if (!capture.empty()) {
    frames::CaptureRead read = frames::ReadCapture(capture);
    if (!read.ok()) {
      std::fprintf(stderr, "sluice-rules: %s: %s\n", capture.c_str(), read.error.c_str());
      return 2;
    }
    std::vector<frames::CaptureRecord> records = std::move(read.records);
    if (std::optional<size_t> bad = frames::ResolveDirections(&records, directionRule)) {
      std::fprintf(stderr,
                   "sluice-rules: %s: record %zu has no direction (the capture records none; "
                   "give --direction, --vm-mac or --vm-ip)\n",
                   capture.c_str(), *bad + 1);
      return 2;
    }
    std::string error;
    std::vector<rules::VerdictChange> vc;
    if (!rules::DiffVerdicts(oldText, newText, records, &vc, &error)) {
      std::fprintf(stderr, "sluice-rules: %s\n", error.c_str());
      return 2;
    }
    auto verdictJson = [](const rules::PacketVerdict& v) {
      nlohmann::json j = {{"decision", render::DecisionName(v.decision)},
                          {"action", rules::ActionName(v.action)}};
      if (v.line != 0) j["line"] = v.line;
      if (!v.params.empty()) j["params"] = v.params;
      return j;
    };
    if (gJson) {
      gDoc["packets"] = {{"capture", capture}, {"count", records.size()},
                         {"changed", nlohmann::json::array()}};
      for (const rules::VerdictChange& v : vc) {
        gDoc["packets"]["changed"].push_back(
            {{"index", v.packet},
             {"direction", v.direction == 2 ? "to-switch" : "from-switch"},
             {"before", verdictJson(v.before)},
             {"after", verdictJson(v.after)}});
      }
    }
    for (const rules::VerdictChange& v : gJson ? std::vector<rules::VerdictChange>{} : vc) {
      std::printf("packet %zu (%s): %s -> %s\n", v.packet, v.direction == 2 ? "to switch" : "from switch",
                  v.before.Describe().c_str(), v.after.Describe().c_str());
    }
    if (!gJson) std::printf("%zu of %zu packets change verdict\n", vc.size(), records.size());
    verdicts = vc.size();
  }
  if (gJson) {
    PrintJson();
  } else if (changes.empty() && verdicts == 0) {
    std::printf("no differences\n");
  }
  return changes.empty() && verdicts == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Compiles, checks, lints and compares firewall rulesets.", "sluice-rules"};
  app.require_subcommand(1);
  app.fallthrough();  // --json may follow the command
  app.footer(std::string("\n") + rules::kRuleSyntaxHelp);
  std::string in, out, other, capture;
  bool quiet = false;
  app.add_flag("--json", gJson, "check, lint, diff: one JSON document on standard output");

  CLI::App* compile = app.add_subcommand("compile", "rule text -> wire ruleset");
  compile->add_option("TEXT", in, "rule text file")->required();
  compile->add_option("WIRE", out, "wire ruleset to write")->required();
  CLI::App* decode = app.add_subcommand("decode", "wire ruleset -> rule text on stdout");
  decode->add_option("WIRE", in, "wire ruleset")->required();
  CLI::App* check = app.add_subcommand(
      "check", "report every error; say for each rule whether it is exact or general and why");
  check->add_option("TEXT", in, "rule text file")->required();
  check->add_flag("-q,--quiet", quiet, "only the summary line");
  CLI::App* lint = app.add_subcommand(
      "lint", "rules that never match, merge into another or carry flags without effect "
              "(exit 1 when there are findings)");
  lint->add_option("TEXT", in, "rule text file")->required();
  CLI::App* diff = app.add_subcommand(
      "diff", "rules added, removed and changed; with --capture, the packets whose verdict "
              "changes (exit 1 when anything differs)");
  diff->add_option("OLD", in, "old ruleset (text or wire)")->required();
  diff->add_option("NEW", other, "new ruleset (text or wire)")->required();
  diff->add_option("--capture", capture,
                   "pcap or pcapng capture whose packets are traced through both");
  std::string direction = "auto", vmMac, vmIp;
  diff->add_option("--direction", direction,
                   "direction of records whose capture does not give one: from (the switch), "
                   "to (the switch) or auto (by --vm-mac/--vm-ip)")
      ->check(CLI::IsMember({"from", "to", "auto"}))
      ->capture_default_str();
  diff->add_option("--vm-mac", vmMac, "MAC address of the VM side, for --direction auto");
  diff->add_option("--vm-ip", vmIp, "IPv4 or IPv6 address of the VM side, for --direction auto");

  CLI11_PARSE(app, argc, argv);
  gDoc = {{"schema", 1}, {"tool", "sluice-rules"}, {"command", app.get_subcommands()[0]->get_name()}};
  if (*compile) return Compile(in, out);
  if (*decode) return Decode(in);
  if (*check) return Check(in, quiet);
  if (*lint) return Lint(in);
  frames::DirectionRule directionRule;
  std::string error;
  if (!frames::MakeDirectionRule(direction, vmMac, vmIp, &directionRule, &error)) {
    std::fprintf(stderr, "sluice-rules: %s\n", error.c_str());
    return 2;
  }
  return Diff(in, other, capture, directionRule);
}
