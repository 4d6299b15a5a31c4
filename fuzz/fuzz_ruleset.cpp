// Rulesets from outside: written through the ruleset property, then pushed
// through the filter ioctl in add mode, then frames through whatever got
// installed.

#include <cstring>

#include "fuzz/fuzz_support.h"
#include "host/net/packets.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  seeds->push_back(fuzz::SampleRuleset(8));
  seeds->push_back(fuzz::SampleRuleset(7));
  std::vector<uint8_t> empty(15, 0);
  empty[0] = 8;
  seeds->push_back(empty);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  host::FilterId id = fuzz::NewFilter();
  std::span<const uint8_t> bytes(data, size);
  (void)host::Sluice::PropertyWrite(std::string(fuzz::kAgent) + ".ruleset", id, bytes);

  std::vector<uint8_t> push(8 + size);
  const uint32_t type = 2, replace = 0;
  std::memcpy(push.data(), &type, 4);
  std::memcpy(push.data() + 4, &replace, 4);
  if (size > 0) std::memcpy(push.data() + 8, data, size);
  host::Sluice::SendIoctl(id, 1, push);

  for (uint32_t dir = 1; dir <= 2; dir++) {
    host::PacketList list;
    for (const auto& f : fuzz::SampleFrames()) list.Append(host::Packets::Make(f));
    (void)host::Sluice::Deliver(id, list, dir);
  }
  std::vector<uint8_t> out;
  ZelStatus status;
  (void)host::Sluice::PropertyRead(std::string(fuzz::kAgent) + ".ruleset", id, &out, &status);
  fuzz::Finish(id);
  return 0;
}
