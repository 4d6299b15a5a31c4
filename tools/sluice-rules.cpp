// sluice-rules: compiles rulesets between the rule text syntax and the wire
// format that the ruleset property, the filter ioctl and the character
// device carry.
//
//   sluice-rules compile web.rules web.bin     text -> wire (version from the
//                                              header line, default 8)
//   sluice-rules decode web.bin                wire -> text on stdout
//   sluice-rules check web.rules               parse only; prints rule kinds

#include <cstdio>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "tools/lib/ruleset_builder.h"

namespace {

bool ReadFile(const std::string& path, std::string* out) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::stringstream ss;
  ss << in.rdbuf();
  *out = ss.str();
  return true;
}

int Usage() {
  std::fprintf(stderr,
               "usage: sluice-rules compile TEXT_FILE WIRE_FILE\n"
               "       sluice-rules decode WIRE_FILE\n"
               "       sluice-rules check TEXT_FILE\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return Usage();
  const std::string cmd = argv[1];
  std::string input;
  if (!ReadFile(argv[2], &input)) {
    std::fprintf(stderr, "sluice-rules: cannot read %s\n", argv[2]);
    return 1;
  }
  try {
    if (cmd == "compile" && argc == 4) {
      std::vector<uint8_t> bytes = rules::RulesetBuilder().AddText(input).Bytes();
      std::ofstream out(argv[3], std::ios::binary);
      out.write(reinterpret_cast<const char*>(bytes.data()),
                static_cast<std::streamsize>(bytes.size()));
      if (!out) {
        std::fprintf(stderr, "sluice-rules: cannot write %s\n", argv[3]);
        return 1;
      }
      std::printf("%zu bytes\n", bytes.size());
      return 0;
    }
    if (cmd == "decode" && argc == 3) {
      std::vector<uint8_t> bytes(input.begin(), input.end());
      std::fputs(rules::FormatRuleset(bytes).c_str(), stdout);
      return 0;
    }
    if (cmd == "check" && argc == 3) {
      rules::RulesetBuilder builder;
      builder.AddText(input);
      size_t exact = 0;
      for (const FWRule& r : builder.Rules()) exact += rules::IsExactRule(r) ? 1 : 0;
      std::printf("%zu rules: %zu exact, %zu general\n", builder.Rules().size(), exact,
                  builder.Rules().size() - exact);
      return 0;
    }
  } catch (const rules::RuleError& e) {
    std::fprintf(stderr, "sluice-rules: %s: %s\n", argv[2], e.what());
    return 1;
  }
  return Usage();
}
