// Captures from disk: decoded from memory; every record decoded is pushed
// through a filter in the direction it names, and what decodes must encode
// and decode to the same records.

#include <cstdio>
#include <cstdlib>

#include "fuzz/fuzz_support.h"
#include "host/net/packets.h"
#include "tools/lib/frames.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  std::vector<frames::CaptureRecord> records;
  uint32_t direction = 0;
  for (const auto& f : fuzz::SampleFrames()) {
    records.push_back({direction++ % 3, f, 0});
  }
  seeds->push_back(frames::EncodeCapture(records));
  records.resize(1);
  records[0].origLen = 9000;  // cut short on capture
  seeds->push_back(frames::EncodeCapture(records));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::vector<frames::CaptureRecord> records;
  std::string error;
  const bool whole = frames::DecodeCapture({data, size}, &records, &error);
  if (!whole && error.empty()) {
    std::fprintf(stderr, "fuzz: capture refused without a reason\n");
    std::abort();
  }
  if (records.empty()) return 0;
  std::vector<frames::CaptureRecord> again;
  if (!frames::DecodeCapture(frames::EncodeCapture(records), &again, &error) ||
      again.size() != records.size()) {
    std::fprintf(stderr, "fuzz: decoded records do not survive encoding: %s\n", error.c_str());
    std::abort();
  }
  host::FilterId id = fuzz::NewFilter();
  (void)host::Sluice::PropertyWrite(std::string(fuzz::kAgent) + ".ruleset", id,
                                    fuzz::SampleRuleset(8));
  for (size_t i = 0; i < records.size() && i < 64; i++) {
    if (records[i].frame.empty()) continue;
    host::PacketList list;
    list.Append(host::Packets::Make(records[i].frame));
    (void)host::Sluice::Deliver(id, list, records[i].direction == 2 ? 2 : 1);
  }
  fuzz::Finish(id);
  return 0;
}
