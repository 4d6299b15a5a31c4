#include "service/protocol/slowpath_link.h"

namespace slcproto {

void AppendFrame(std::vector<uint8_t>* blob, std::span<const uint8_t> frame) {
  const uint32_t n = static_cast<uint32_t>(frame.size());
  for (int i = 0; i < 4; i++) blob->push_back(static_cast<uint8_t>(n >> (8 * i)));
  blob->insert(blob->end(), frame.begin(), frame.end());
}

bool SplitFrames(std::span<const uint8_t> blob, std::vector<std::vector<uint8_t>>* frames,
                 std::string* error) {
  frames->clear();
  size_t at = 0;
  while (at < blob.size()) {
    if (blob.size() - at < 4) {
      *error = "frame length cut short";
      return false;
    }
    const uint32_t n = uint32_t{blob[at]} | uint32_t{blob[at + 1]} << 8 |
                       uint32_t{blob[at + 2]} << 16 | uint32_t{blob[at + 3]} << 24;
    at += 4;
    if (n > kMaxLinkFrame || n > blob.size() - at) {
      *error = "frame of " + std::to_string(n) + " bytes does not fit";
      return false;
    }
    if (frames->size() == kMaxLinkFrames) {
      *error = "more than " + std::to_string(kMaxLinkFrames) + " frames";
      return false;
    }
    frames->emplace_back(blob.begin() + at, blob.begin() + at + n);
    at += n;
  }
  return true;
}

}  // namespace slcproto
