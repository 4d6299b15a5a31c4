// Reading rule texts: tokens, checks, located diagnostics.

#include <algorithm>
#include <cctype>
#include <cstring>
#include <optional>

#include "tools/lib/rule_syntax.h"
#include "tools/lib/ruleset_builder.h"

namespace rules {

using namespace syntax;

namespace {

struct Token {
  std::string_view text, key, value;
  size_t col = 0;       // of the key
  size_t valueCol = 0;  // of the value (after '='), or of the key when bare
  bool hasValue = false;
};

std::vector<Token> Tokenize(std::string_view line) {
  std::vector<Token> out;
  size_t i = 0;
  while (i < line.size() && line[i] != '#') {
    if (std::isspace(static_cast<unsigned char>(line[i]))) {
      i++;
      continue;
    }
    size_t j = i;
    while (j < line.size() && !std::isspace(static_cast<unsigned char>(line[j])) && line[j] != '#') j++;
    Token t;
    t.text = line.substr(i, j - i);
    t.col = i + 1;
    const size_t eq = t.text.find('=');
    if (eq == std::string_view::npos) {
      t.key = t.text;
      t.valueCol = t.col;
    } else {
      t.key = t.text.substr(0, eq);
      t.value = t.text.substr(eq + 1);
      t.valueCol = t.col + eq + 1;
      t.hasValue = true;
    }
    out.push_back(t);
    i = j;
  }
  return out;
}

class Reporter {
 public:
  Reporter(std::vector<Diagnostic>* diags, std::string_view line, size_t lineNo)
      : diags_(diags), line_(line), lineNo_(lineNo) {}

  void Error(size_t col, size_t width, std::string message, std::string note = {}) {
    errors_++;
    if (diags_->size() >= kMaxDiagnostics) return;
    Diagnostic d;
    d.line = lineNo_;
    d.column = col;
    d.width = std::max<size_t>(1, std::min<size_t>(width, 80));
    d.message = std::move(message);
    d.note = std::move(note);
    constexpr size_t kWindow = 160;
    d.sourceColumn = std::min(col > kWindow / 2 ? col - kWindow / 2 : 1, line_.size() + 1);
    for (char c : line_.substr(d.sourceColumn - 1, kWindow)) {
      d.source += (std::isprint(static_cast<unsigned char>(c)) || c == '\t') ? c : '?';
    }
    diags_->push_back(std::move(d));
  }
  void At(const Token& t, std::string message, std::string note = {}) {
    Error(t.col, t.text.size(), std::move(message), std::move(note));
  }
  void AtValue(const Token& t, std::string message, std::string note = {}) {
    Error(t.valueCol, t.hasValue ? std::max<size_t>(1, t.value.size()) : t.key.size(),
          std::move(message), std::move(note));
  }
  size_t errors() const { return errors_; }

 private:
  std::vector<Diagnostic>* diags_;
  std::string_view line_;
  size_t lineNo_;
  size_t errors_ = 0;
};

constexpr std::array<const char*, 6> kParams = {"gre", "snaplen", "rewrite", "pool", "dscp", "dot1p"};
constexpr std::array<const char*, 2> kParamUsers[] = {
    {"gre", "gre"},         {"snaplen", "gre"},   {"rewrite", "l2rewrite"},
    {"pool", "pooltag"},    {"dscp", "dscp or dscp+dot1p"}, {"dot1p", "dot1p or dscp+dot1p"}};

bool RequiredParam(uint32_t action, std::string_view param) {
  return ActionUses(action, param) && param != "snaplen";
}

std::string ParamHint(std::string_view param) {
  if (param == "gre") return "gre=A.B.C.D, the IPv4 destination of the GRE copies";
  if (param == "rewrite") return "rewrite=MAC, the address written into the frames";
  if (param == "pool") return "pool=NAME, the resource pool (at most 127 characters)";
  if (param == "dscp") return "dscp=0-63, the DSCP value to write";
  return "dot1p=0-7, the 802.1p priority to write";
}

// One rule line, checked. Reports errors and returns nothing when any.
std::optional<TextRule> ReadRuleLine(const std::vector<Token>& tokens, uint8_t version,
                                     Reporter& rep) {
  const size_t before = rep.errors();
  const Token* seen[std::size(kRuleKeys)] = {};
  auto keyIndex = [](std::string_view k) -> int {
    for (size_t i = 0; i < kRuleKeys.size(); i++) {
      if (k == kRuleKeys[i]) return static_cast<int>(i);
    }
    return -1;
  };
  auto find = [&](std::string_view k) -> const Token* { return seen[keyIndex(k)]; };
  bool raw = false;
  for (const Token& t : tokens) raw = raw || t.text == "raw";
  const bool v7 = version == FW_RULESET_VERSION_7;

  RuleBuilder b;
  for (const Token& t : tokens) {
    const int k = keyIndex(t.key);
    if (k < 0) {
      rep.At(t, "unknown field " + Quote(t.key) + DidYouMean(t.key, kRuleKeys),
             "fields: " + NameList(kRuleKeys));
      continue;
    }
    if (seen[k]) {
      rep.At(t, "field '" + std::string(t.key) + "' given twice (first at column " +
                    std::to_string(seen[k]->col) + ")");
      continue;
    }
    seen[k] = &t;
    const std::string_view key = t.key, value = t.value;
    if ((key == "ipv4" || key == "ipv6" || key == "exact" || key == "raw") && t.hasValue) {
      rep.AtValue(t, std::string(key) + " takes no value");
      continue;
    }
    if (key != "ipv4" && key != "ipv6" && key != "exact" && key != "raw" && key != "bidir" &&
        (!t.hasValue || value.empty()) && !(raw && key == "pool" && t.hasValue)) {
      rep.At(t, std::string(key) + " needs a value (" + std::string(key) + "=...)");
      continue;
    }
    // Version-7 records have no bytes for these; `raw` leaves the refusal
    // to the builder, which accepts them only when they write zero bytes.
    if (key == "wire" && !raw) {
      rep.At(t, "wire= (a whole record in hex) is only read in a raw rule");
      continue;
    }
    if (v7 && !raw && (key == "rptag" || key == "dscp" || key == "dot1p")) {
      rep.At(t, std::string(key) + " is a version-8 field; this ruleset is version 7");
      continue;
    }
    if (v7 && !raw && !value.empty() && value[0] == '!') {
      rep.AtValue(t, "negation ('!') needs a version-8 ruleset; this one is version 7");
      continue;
    }
    if (v7 && !raw && (key == "dmac" || key == "smac") && value.find('/') != std::string_view::npos) {
      rep.AtValue(t, "MAC masks need a version-8 ruleset; this one is version 7");
      continue;
    }
    if (!raw) {
      auto byName = [&](const auto& names, const char* what, const char* plural) {
        for (const auto& n : names) {
          if (value == n) return true;
        }
        rep.AtValue(t, std::string("unknown ") + what + " " + Quote(value) + DidYouMean(value, names),
                    std::string(plural) + ": " + NameList(names));
        return false;
      };
      if (key == "action" && !byName(kActionNames, "action", "actions")) continue;
      if (key == "dir" && !byName(kDirectionNames, "direction", "directions")) continue;
      if (key == "proto" && !value.empty() && !std::isdigit(static_cast<unsigned char>(value[0])) &&
          value[0] != '!' && value != "*" &&
          !byName(std::array{"tcp", "udp", "icmp", "icmpv6"}, "protocol",
                  "protocols (or a number 0-255)")) {
        continue;
      }
      if (key == "bidir" && t.hasValue && value != "1" && value != "2") {
        rep.AtValue(t, "bidir is written bare (install the mirrored rule) or bidir=2 (a mirrored half)");
        continue;
      }
    }
    try {
      b.Set(key, value);
    } catch (const RuleError& e) {
      rep.AtValue(t, e.what());
      continue;
    }
    if (!raw) {
      const FWRule r = b.Build();
      if (key == "dscp" && r.dscpTag > 63) rep.AtValue(t, "dscp " + Quote(value) + " is out of range 0-63");
      if (key == "dot1p" && r.ethDot1PTag > 7) rep.AtValue(t, "dot1p " + Quote(value) + " is out of range 0-7");
    }
  }
  if (rep.errors() != before) return std::nullopt;

  TextRule out;
  out.rule = b.Build();
  out.exactAsked = find("exact") != nullptr;
  const FWRule& r = out.rule;
  const uint32_t f = r.ruleFlags;
  const Token* actionTok = find("action");
  auto atAction = [&](std::string msg) {
    if (actionTok) {
      rep.At(*actionTok, std::move(msg));
    } else {
      rep.Error(1, 1, std::move(msg));
    }
  };

  if (!raw) {
    for (const char* p : kParams) {
      const Token* t = find(p);
      if (t && !ActionUses(r.action, p)) {
        std::string users;
        for (const auto& u : kParamUsers) {
          if (std::string_view(u[0]) == p) users = u[1];
        }
        rep.At(*t, std::string(p) + " has no effect with action=" + ActionName(r.action) +
                       "; only action=" + users + " uses it");
      } else if (!t && RequiredParam(r.action, p)) {
        atAction("action=" + ActionName(r.action) + " needs " + ParamHint(p));
      }
    }
    if (r.action == SLCGenericActionGRE && find("gre") && FWNet32(r.greIP) == 0) {
      rep.AtValue(*find("gre"), "gre 0.0.0.0 is not a destination");
    }
    static constexpr uint8_t kZeroMac[6] = {};
    if (find("rewrite") && std::memcmp(r.rewriteMac, kZeroMac, 6) == 0) {
      rep.AtValue(*find("rewrite"), "rewrite 00:00:00:00:00:00 is not an address to write");
    }
    // Ranges whose low end is above the high end match nothing.
    auto portRange = [&](const char* key, uint32_t bit, const uint8_t* lo, const uint8_t* hi) {
      if ((f & bit) && FWNet16(lo) > FWNet16(hi)) {
        rep.AtValue(*find(key), std::string(key) + " range " + std::to_string(FWNet16(lo)) + "-" +
                                    std::to_string(FWNet16(hi)) + " is empty: the low end is above the high end");
      }
    };
    if (find("sport")) portRange("sport", FW_RANGE_SPORT, r.sPort, r.sPortHigh);
    if (find("dport")) portRange("dport", FW_RANGE_DPORT, r.dPort, r.dPortHigh);
    auto addrRange = [&](const char* key, uint32_t bit, const uint8_t* lo, const uint8_t* hi) {
      if (!(f & bit) || !find(key)) return;
      const bool v4 = (f & FW_FLAG_IPV4) != 0;
      const unsigned __int128 l = AddrValue(lo, v4 ? 4 : 16), h = AddrValue(hi, v4 ? 4 : 16);
      if (v4 ? l > h : l >= h) {
        rep.AtValue(*find(key), std::string(key) + " range is empty: the low end is above the high end");
      }
    };
    addrRange("sa", FW_RANGE_IPSA, r.ipSa, r.ipSaHigh);
    addrRange("da", FW_RANGE_IPDA, r.ipDa, r.ipDaHigh);
    const Token* fam = find("ipv4") ? find("ipv4") : find("ipv6");
    const Token* eth = find("ethtype");
    if (fam && eth && eth->value != "any" && eth->value != "*") {
      const uint16_t want = fam->key == "ipv4" ? 0x0800 : 0x86dd;
      if ((r.negateFlags & FW_NEG_ETHTYPE) || FWNet16(r.ethType) != want) {
        char buf[8];
        std::snprintf(buf, sizeof(buf), "0x%04x", want);
        rep.At(*eth, std::string(fam->key) + " already matches ethertype " + buf + "; ethtype=" +
                         std::string(eth->value) + " contradicts it",
               "write ethtype=any to match the address family alone");
      }
    }
    if (IsExactRule(r) && r.negateFlags != 0) {
      const Token* neg = nullptr;
      for (const Token& t : tokens) {
        if (!neg && !t.value.empty() && t.value[0] == '!') neg = &t;
      }
      const std::string msg =
          "negation has no effect on an exact rule: with every field given and no range or mask, "
          "the module matches the values alone";
      if (neg) {
        rep.AtValue(*neg, msg);
      } else {
        rep.Error(1, 1, msg);
      }
    }
  }
  if (const Token* ex = find("exact")) {
    const std::vector<std::string> why = GeneralReasons(r);
    if (!why.empty()) {
      std::string list;
      for (const std::string& w : why) {
        if (!list.empty()) list += ", ";
        list += w;
      }
      rep.At(*ex, "the rule cannot be exact: " + list,
             "an exact rule gives dmac smac ethtype vlan sa da proto sport dport, without ranges or masks");
    } else if (r.ipProto != 6 && r.ipProto != 17) {
      rep.At(*ex, "an exact rule only matches TCP and UDP packets; proto=" +
                      std::to_string(r.ipProto) + " would never match");
    }
  }
  if (rep.errors() != before) return std::nullopt;
  return out;
}

}  // namespace

std::vector<std::string> GeneralReasons(const FWRule& r) {
  std::vector<std::string> out;
  const uint32_t f = r.ruleFlags;
  static constexpr std::pair<uint32_t, const char*> kBits[] = {
      {FW_WC_DMAC, "dmac wildcard"},   {FW_WC_SMAC, "smac wildcard"},
      {FW_WC_ETHTYPE, "ethtype wildcard"}, {FW_WC_VLAN, "vlan wildcard"},
      {FW_WC_IPSA, "sa wildcard"},     {FW_WC_IPDA, "da wildcard"},
      {FW_WC_IPPROTO, "proto wildcard"}, {FW_WC_SPORT, "sport wildcard"},
      {FW_WC_DPORT, "dport wildcard"}, {FW_RANGE_IPSA, "sa range"},
      {FW_RANGE_IPDA, "da range"},     {FW_RANGE_SPORT, "sport range"},
      {FW_RANGE_DPORT, "dport range"}, {FW_MASK_DMAC, "dmac mask"},
      {FW_MASK_SMAC, "smac mask"}};
  for (const auto& [bit, name] : kBits) {
    if (f & bit) out.push_back(name);
  }
  return out;
}

std::string RenderDiagnostics(std::string_view file, const std::vector<Diagnostic>& diags) {
  std::string out;
  for (const Diagnostic& d : diags) {
    if (!file.empty()) out += std::string(file) + ":";
    out += std::to_string(d.line) + ":" + std::to_string(d.column) + ": error: " + d.message + "\n";
    if (d.line == 0) continue;
    const std::string num = std::to_string(d.line);
    out += " " + num + " | " + d.source + "\n";
    out += " " + std::string(num.size(), ' ') + " | ";
    const size_t pad = d.column - d.sourceColumn;
    for (size_t i = 0; i < pad && i < d.source.size(); i++) out += d.source[i] == '\t' ? '\t' : ' ';
    out += "^" + std::string(d.width - 1, '~') + "\n";
    if (!d.note.empty()) out += " " + std::string(num.size(), ' ') + " = " + d.note + "\n";
  }
  return out;
}

RulesetText ReadRulesetText(std::string_view text) {
  RulesetText out;
  bool sawRule = false, sawHeader = false;
  size_t defaultLine = 0;
  size_t lineNo = 0;
  size_t pos = 0;
  while (pos < text.size() && out.diagnostics.size() < kMaxDiagnostics) {
    size_t nl = text.find('\n', pos);
    if (nl == std::string_view::npos) nl = text.size();
    std::string_view line = text.substr(pos, nl - pos);
    pos = nl + 1;
    lineNo++;
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    Reporter rep(&out.diagnostics, line, lineNo);
    if (line.size() > kMaxLineLength) {
      rep.Error(kMaxLineLength + 1, 1,
                "line is longer than " + std::to_string(kMaxLineLength) + " bytes");
      continue;
    }
    const std::vector<Token> tokens = Tokenize(line);
    if (tokens.empty()) continue;
    if (defaultLine) {
      rep.At(tokens[0], "nothing may follow the default line (line " + std::to_string(defaultLine) +
                            "): it is the last rule");
      continue;
    }
    if (tokens[0].text == "ruleset") {
      if (sawRule || sawHeader) {
        rep.At(tokens[0], sawHeader ? "a second ruleset header line"
                                    : "the ruleset header line must come before the rules");
        continue;
      }
      sawHeader = true;
      bool raw = false;
      for (const Token& t : tokens) raw = raw || t.text == "raw";
      std::string_view seenKeys[4];
      for (size_t i = 1; i < tokens.size(); i++) {
        const Token& t = tokens[i];
        static constexpr std::array<const char*, 4> kHeaderKeys = {"version", "features", "frag", "raw"};
        if (std::find(kHeaderKeys.begin(), kHeaderKeys.end(), t.key) == kHeaderKeys.end()) {
          rep.At(t, "unknown header field " + Quote(t.key) + DidYouMean(t.key, kHeaderKeys),
                 "header fields: version features frag");
          continue;
        }
        const size_t k = static_cast<size_t>(std::find(kHeaderKeys.begin(), kHeaderKeys.end(), t.key) - kHeaderKeys.begin());
        if (!seenKeys[k].empty()) {
          rep.At(t, "field '" + std::string(t.key) + "' given twice");
          continue;
        }
        seenKeys[k] = t.key;
        if (t.key == "raw") continue;
        if (!t.hasValue || t.value.empty()) {
          rep.At(t, std::string(t.key) + " needs a value");
          continue;
        }
        try {
          if (t.key == "version") {
            if (t.value != "7" && t.value != "8") {
              rep.AtValue(t, "version " + Quote(t.value) + " is not 7 or 8");
            } else {
              out.version = static_cast<uint8_t>(t.value[0] - '0');
            }
          } else if (t.key == "features") {
            uint32_t bits = 0;
            std::string_view rest = t.value;
            bool ok = true;
            while (ok && !rest.empty()) {
              const size_t comma = rest.find(',');
              const std::string_view name = rest.substr(0, comma);
              rest = comma == std::string_view::npos ? std::string_view{} : rest.substr(comma + 1);
              bool found = name == "none";
              for (const FeatureName& fn : kFeatureNames) {
                if (name == fn.name) {
                  bits |= fn.bit;
                  found = true;
                }
              }
              if (!found && !name.empty() && std::isdigit(static_cast<unsigned char>(name[0]))) {
                // Numbers are read for the known bits; others need `raw`
                // because the module ignores them.
                const uint32_t n = static_cast<uint32_t>(ParseNumber("features", name, 0xffffffffu));
                const uint32_t known = FW_FEATURE_DROP_BPDU | FW_FEATURE_DROP_DHCP_SERVER;
                if ((n & ~known) && !raw) {
                  rep.AtValue(t, "features " + Quote(name) + " sets bits the module ignores (" +
                                     Hex(n & ~known) + ")",
                              "features: drop-bpdu (0x1) drop-dhcp-server (0x2); 'raw' in the header allows others");
                  ok = false;
                  break;
                }
                bits |= n;
                found = true;
              }
              if (!found) {
                std::array<const char*, 3> names = {"none", "drop-bpdu", "drop-dhcp-server"};
                rep.AtValue(t, "unknown feature " + Quote(name) + DidYouMean(name, names),
                            "features: drop-bpdu drop-dhcp-server, comma-separated, or none");
                ok = false;
              }
            }
            if (ok) out.features = bits;
          } else {  // frag
            bool found = false;
            for (size_t a = 0; a < kActionNames.size(); a++) {
              if (t.value == kActionNames[a]) {
                out.fragOverride = static_cast<uint32_t>(a);
                found = true;
              }
            }
            if (!found && raw && std::isdigit(static_cast<unsigned char>(t.value[0]))) {
              out.fragOverride = static_cast<uint32_t>(ParseNumber("frag", t.value, 0xffffffffu));
              found = true;
            }
            if (!found) {
              rep.AtValue(t, "unknown fragment action " + Quote(t.value) + DidYouMean(t.value, kActionNames),
                          "actions: " + NameList(kActionNames) + " (none: fragments are looked up like other packets)");
            }
          }
        } catch (const RuleError& e) {
          rep.AtValue(t, e.what());
        }
      }
      continue;
    }
    if (tokens[0].key == "default") {
      defaultLine = lineNo;
      static constexpr std::array<const char*, 3> kDefaults = {"accept", "drop", "punt"};
      uint32_t action = 0;
      for (size_t a = 0; a < kActionNames.size(); a++) {
        if (tokens[0].value == kActionNames[a]) action = static_cast<uint32_t>(a);
      }
      if (std::find(kDefaults.begin(), kDefaults.end(), tokens[0].value) == kDefaults.end()) {
        rep.AtValue(tokens[0], "unknown default action " + Quote(tokens[0].value) +
                                   DidYouMean(tokens[0].value, kDefaults),
                    "default=accept, default=drop or default=punt");
      } else if (tokens.size() > 1) {
        rep.At(tokens[1], "the default line takes nothing else");
      } else if (out.rules.size() >= kMaxRules) {
        rep.At(tokens[0], "more than " + std::to_string(kMaxRules) + " rules");
      } else {
        TextRule tr;
        tr.rule = DefaultRule(action);
        tr.line = lineNo;
        tr.isDefault = true;
        out.rules.push_back(tr);
      }
      continue;
    }
    sawRule = true;
    if (out.rules.size() >= kMaxRules) {
      rep.At(tokens[0], "more than " + std::to_string(kMaxRules) + " rules");
      break;
    }
    std::optional<TextRule> tr = ReadRuleLine(tokens, out.version, rep);
    if (tr && out.version == FW_RULESET_VERSION_7) {
      // Reached only by raw rules: the checked ones refuse these fields.
      const uint8_t* bytes = reinterpret_cast<const uint8_t*>(&tr->rule);
      for (uint32_t b = FW_RULE_SIZE_V7; b < FW_RULE_SIZE_V8; b++) {
        if (bytes[b] != 0) {
          rep.At(tokens[0], "the rule sets version-8 bytes (rptag, marks, masks or negation) in a "
                            "version-7 ruleset");
          tr.reset();
          break;
        }
      }
    }
    if (tr) {
      tr->line = lineNo;
      out.rules.push_back(*tr);
    }
  }
  if (out.diagnostics.size() >= kMaxDiagnostics) {
    Diagnostic d;
    d.line = 0;
    d.message = "too many errors; stopped at line " + std::to_string(lineNo);
    out.diagnostics.push_back(d);
  }
  if (!out.diagnostics.empty()) out.rules.clear();
  return out;
}

std::vector<uint8_t> RulesetBytes(const RulesetText& text) {
  RulesetBuilder b(text.version);
  b.Features(text.features).FragOverride(text.fragOverride);
  for (const TextRule& r : text.rules) b.Add(r.rule);
  return b.Bytes();
}

FWRule ParseRule(std::string_view line) {
  std::vector<Diagnostic> diags;
  if (line.find('\n') != std::string_view::npos) line = line.substr(0, line.find('\n'));
  Reporter rep(&diags, line, 1);
  const std::vector<Token> tokens = Tokenize(line);
  if (tokens.empty()) return RuleBuilder().Build();
  std::optional<TextRule> r = ReadRuleLine(tokens, FW_RULESET_VERSION_8, rep);
  if (!r) throw RuleError(RenderDiagnostics("", diags));
  return r->rule;
}

bool TryParseRule(std::string_view line, FWRule* rule, std::string* error) {
  try {
    *rule = ParseRule(line);
    return true;
  } catch (const RuleError& e) {
    if (error) *error = e.what();
    return false;
  }
}

FWRule syntax::DefaultRule(uint32_t action) {
  RuleBuilder b;
  b.Action(action);
  return b.Build();
}

std::optional<FWRule> syntax::ReadRuleText(std::string_view line, uint8_t version) {
  std::vector<Diagnostic> diags;
  Reporter rep(&diags, line, 1);
  std::optional<TextRule> r = ReadRuleLine(Tokenize(line), version, rep);
  if (!r) return std::nullopt;
  return r->rule;
}

}  // namespace rules
