// Filter ioctl messages from the slow path, against a filter with rules.

#include <cstring>

#include "fuzz/fuzz_support.h"

namespace {

std::vector<uint8_t> Message(uint32_t type, uint32_t word, const std::vector<uint8_t>& tail) {
  std::vector<uint8_t> m(8 + tail.size());
  std::memcpy(m.data(), &type, 4);
  std::memcpy(m.data() + 4, &word, 4);
  if (!tail.empty()) std::memcpy(m.data() + 8, tail.data(), tail.size());
  return m;
}

}  // namespace

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  std::vector<uint8_t> rules = fuzz::SampleRuleset(8);
  seeds->push_back(Message(2, 1, rules));
  seeds->push_back(Message(4, 0, {}));
  seeds->push_back(Message(4, 1, rules));
  seeds->push_back(Message(4, 2, fuzz::SampleRuleset(7)));
  seeds->push_back(Message(6, 0, {}));
  seeds->push_back({1, 0, 0, 0, 'a', 'b', '1', 'z', 0});
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  host::FilterId id = fuzz::NewFilter();
  (void)host::Sluice::PropertyWrite(std::string(fuzz::kAgent) + ".ruleset", id,
                                    fuzz::SampleRuleset(8));
  host::Sluice::SendIoctl(id, size % 3, std::vector<uint8_t>(data, data + size));
  host::Sluice::SendIoctl(id, 7, Message(6, 0, {}));
  fuzz::Finish(id);
  return 0;
}
