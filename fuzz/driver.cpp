// Runs a fuzz target without a fuzzing engine: each file named on the
// command line once, then --runs N seeded mutations of the target's seeds
// (default 2000). The seed of every run is its number, so a failure is
// replayed with --from N --runs 1.

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <random>
#include <string>
#include <vector>

#include "fuzz/fuzz_support.h"

namespace {

std::vector<uint8_t> Mutate(std::vector<uint8_t> in, std::mt19937_64& rng) {
  std::uniform_int_distribution<int> op(0, 7);
  int steps = 1 + static_cast<int>(rng() % 8);
  for (int s = 0; s < steps; s++) {
    size_t n = in.size();
    switch (op(rng)) {
      case 0:  // flip a bit
        if (n) in[rng() % n] ^= static_cast<uint8_t>(1u << (rng() % 8));
        break;
      case 1:  // random byte
        if (n) in[rng() % n] = static_cast<uint8_t>(rng());
        break;
      case 2:  // interesting value
        if (n) {
          static const uint8_t v[] = {0, 1, 2, 3, 7, 8, 9, 0x7f, 0x80, 0xfe, 0xff};
          in[rng() % n] = v[rng() % sizeof(v)];
        }
        break;
      case 3:  // truncate
        if (n) in.resize(rng() % n);
        break;
      case 4:  // insert random bytes
        in.insert(in.begin() + static_cast<long>(n ? rng() % n : 0), 1 + rng() % 16,
                  static_cast<uint8_t>(rng()));
        break;
      case 5:  // erase a run
        if (n > 1) {
          size_t at = rng() % n;
          size_t len = 1 + rng() % (n - at);
          in.erase(in.begin() + static_cast<long>(at), in.begin() + static_cast<long>(at + len));
        }
        break;
      case 6:  // 32-bit little-endian value somewhere
        if (n >= 4) {
          uint32_t v = static_cast<uint32_t>(rng() % 3 == 0 ? rng() : rng() % 300);
          std::memcpy(&in[rng() % (n - 3)], &v, 4);
        }
        break;
      default:  // append
        in.push_back(static_cast<uint8_t>(rng()));
        break;
    }
  }
  return in;
}

}  // namespace

int main(int argc, char** argv) {
  long runs = 2000;
  long from = 0;
  std::vector<std::string> files;
  for (int i = 1; i < argc; i++) {
    if (!std::strcmp(argv[i], "--runs") && i + 1 < argc) {
      runs = std::strtol(argv[++i], nullptr, 10);
    } else if (!std::strcmp(argv[i], "--from") && i + 1 < argc) {
      from = std::strtol(argv[++i], nullptr, 10);
    } else {
      files.push_back(argv[i]);
    }
  }
  for (const std::string& f : files) {
    std::ifstream in(f, std::ios::binary);
    std::vector<uint8_t> data((std::istreambuf_iterator<char>(in)), {});
    LLVMFuzzerTestOneInput(data.data(), data.size());
  }
  std::vector<std::vector<uint8_t>> seeds;
  SluiceFuzzSeeds(&seeds);
  seeds.emplace_back();
  for (const auto& s : seeds) LLVMFuzzerTestOneInput(s.data(), s.size());
  for (long r = from; r < from + runs; r++) {
    std::mt19937_64 rng(static_cast<uint64_t>(r));
    std::vector<uint8_t> input = Mutate(seeds[rng() % seeds.size()], rng);
    LLVMFuzzerTestOneInput(input.data(), input.size());
  }
  std::printf("%ld runs, %zu seeds: no fault\n", runs, seeds.size());
  return 0;
}
