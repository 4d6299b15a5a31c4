// Frames of any shape through a filter with every kind of rule. The first
// input byte chooses the scatter-gather split, the mapped length and the
// metadata; the rest is the frame.

#include <algorithm>

#include "fuzz/fuzz_support.h"
#include "host/net/packets.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  uint8_t control = 0;
  for (const auto& f : fuzz::SampleFrames()) {
    std::vector<uint8_t> s{control++};
    s.insert(s.end(), f.begin(), f.end());
    seeds->push_back(s);
  }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) return 0;
  const uint8_t control = data[0];
  std::vector<uint8_t> frame(data + 1, data + size);
  host::FilterId id = fuzz::NewFilter(control >> 7);
  (void)host::Sluice::PropertyWrite(std::string(fuzz::kAgent) + ".ruleset", id,
                                    fuzz::SampleRuleset((control & 0x40) ? 7 : 8));
  for (uint32_t dir = 1; dir <= 2; dir++) {
    host::PacketSpec layout;
    layout.frame = frame;
    const uint32_t n = static_cast<uint32_t>(frame.size());
    // Split into up to four elements at points picked from the control byte.
    uint32_t cut = (control & 0x7) * 9;
    if (cut > 0 && cut < n) {
      layout.sgSizes = {cut, n - cut};
      uint32_t cut2 = ((control >> 3) & 0x3) * 7;
      if (cut2 > 0 && cut2 < n - cut) layout.sgSizes = {cut, cut2, n - cut - cut2};
    }
    const uint32_t elem0 = layout.sgSizes.empty() ? n : layout.sgSizes[0];
    layout.mappedLen = (control & 0x20) ? std::min<uint32_t>(20, elem0) : UINT32_MAX;
    layout.writable = (control & 0x10) == 0;
    layout.vlanId = control & 0x3;
    layout.priority = (control >> 2) & 0x7;
    layout.resPoolTag = control & 0x1;
    host::PacketList list;
    list.Append(host::Packets::Make(layout));
    list.Append(host::Packets::Make(layout));
    (void)host::Sluice::Deliver(id, list, dir);
  }
  fuzz::Finish(id);
  return 0;
}
