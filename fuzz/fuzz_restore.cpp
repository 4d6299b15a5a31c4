// Saved state arriving on the destination host of a migration.

#include <cstring>

#include "fuzz/fuzz_support.h"
#include "migration/migration.h"

namespace {

std::vector<uint8_t> State(const std::vector<uint8_t>& fast, const std::vector<uint8_t>& slow) {
  SLCGenericStateHeader h;
  std::memcpy(h.magic, kSLCGenericSaveMagic, 8);
  h.version = 1;
  h.fastPathOffset = 48;
  h.fastPathLength = fast.size();
  h.slowPathOffset = 48 + fast.size();
  h.slowPathLength = slow.size();
  std::vector<uint8_t> out(reinterpret_cast<uint8_t*>(&h), reinterpret_cast<uint8_t*>(&h) + 48);
  out.insert(out.end(), fast.begin(), fast.end());
  out.insert(out.end(), slow.begin(), slow.end());
  return out;
}

}  // namespace

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  seeds->push_back(State(fuzz::SampleRuleset(8), {}));
  seeds->push_back(State(fuzz::SampleRuleset(7), {1, 2, 3, 4}));
  std::vector<uint8_t> empty(15, 0);
  empty[0] = 8;
  seeds->push_back(State(empty, {}));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // Failure policy 1 lets a slow path part without a slow path go on.
  host::FilterId id = fuzz::NewFilter(size % 2);
  void* priv = host::Sluice::FilterPriv(id);
  std::vector<uint8_t> copy(data, data + size);  // exactly `size` bytes for ASan
  (void)SLCGenericRestoreState(priv, copy.empty() ? nullptr : copy.data(), copy.size());
  fuzz::Finish(id);
  return 0;
}
