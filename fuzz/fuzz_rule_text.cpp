// Rule text from operators: parsed into a wire ruleset; what parses must
// render back to text that parses to the same bytes, and must be accepted
// by a filter (the text syntax cannot express a ruleset the module rejects
// as malformed, only ones it refuses for their content).

#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "fuzz/fuzz_support.h"
#include "tools/lib/ruleset_builder.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  for (const char* text : {
           "ruleset version=8 features=1\n"
           "action=accept dir=from ipv4 proto=tcp da=10.0.0.10 dport=80 sa=10.0.0.1 sport=40000 "
           "bidir\n"
           "action=accept ipv4 proto=tcp sa=192.168.1.0-192.168.1.255 dport=22\n"
           "action=drop ipv4 proto=tcp dport=!80\n"
           "action=gre gre=198.51.100.7 snaplen=128 ipv4 proto=tcp dport=80\n",
           "ruleset version=7\naction=punt ipv6 proto=udp da=2001:db8::-2001:db8::ff\n",
           "action=l2rewrite rewrite=02:00:00:00:00:99 dmac=02:00:00:00:00:01/ff:ff:ff:00:00:00 "
           "vlan=5 ethtype=0x0800\n",
           "action=dscp+dot1p dscp=46 dot1p=5 ipv4 sa=!10.0.0.0-10.0.0.255\n"
           "action=pooltag pool=7 ipv4 proto=udp dport=4789\n",
       }) {
    seeds->emplace_back(text, text + std::char_traits<char>::length(text));
  }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  std::vector<uint8_t> bytes;
  std::string error;
  if (!rules::TryParseRuleset(text, &bytes, &error)) {
    if (error.empty()) {
      std::fprintf(stderr, "fuzz: text refused without a reason\n");
      std::abort();
    }
    return 0;
  }
  // Names on the wire end at their first NUL, so text with a NUL inside a
  // name cannot come back byte for byte; the filter below still gets it.
  std::vector<uint8_t> again;
  const bool renders = text.find('\0') == std::string_view::npos;
  if (renders && (!rules::TryParseRuleset(rules::FormatRuleset(bytes), &again, &error) ||
                  again != bytes)) {
    std::fprintf(stderr, "fuzz: parsed text does not survive rendering: %s\n%.*s\n---\n%s\n",
                 error.c_str(), static_cast<int>(size), reinterpret_cast<const char*>(data),
                 rules::FormatRuleset(bytes).c_str());
    std::abort();
  }
  host::FilterId id = fuzz::NewFilter();
  (void)host::Sluice::PropertyWrite(std::string(fuzz::kAgent) + ".ruleset", id, bytes);
  fuzz::Finish(id);
  return 0;
}
