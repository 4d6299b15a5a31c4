// Captures from disk: pcap or pcapng decoded from memory; every record
// decoded is pushed through a filter in the direction it names, and what
// decodes must survive writing back as pcapng (directions and timestamps
// included) and reading again.

#include <cstdio>
#include <cstdlib>

#include "fuzz/fuzz_support.h"
#include "host/net/packets.h"
#include "tools/lib/capture.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  std::vector<frames::CaptureRecord> records;
  uint32_t direction = 0;
  for (const auto& f : fuzz::SampleFrames()) {
    records.push_back({direction++ % 3, f, 0, 1700000000, 5});
  }
  seeds->push_back(frames::EncodeCapture(records));
  seeds->push_back(frames::EncodePcapng(records));
  records.resize(1);
  records[0].origLen = 9000;  // cut short on capture
  seeds->push_back(frames::EncodeCapture(records));
  seeds->push_back(frames::EncodePcapng(records));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const frames::CaptureRead read = frames::DecodeCapture({data, size});
  if (read.error.empty() && read.badRecord) {
    std::fprintf(stderr, "fuzz: a bad record without a reason\n");
    std::abort();
  }
  const std::vector<frames::CaptureRecord>& records = read.records;
  if (records.empty()) return 0;
  const frames::CaptureRead again = frames::DecodeCapture(frames::EncodePcapng(records));
  bool same = again.ok() && again.records.size() == records.size();
  for (size_t i = 0; same && i < records.size(); i++) {
    same = again.records[i].frame == records[i].frame &&
           again.records[i].direction == records[i].direction;
  }
  if (!same) {
    std::fprintf(stderr, "fuzz: decoded records do not survive writing back: %s\n",
                 again.error.c_str());
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
