// Runs a fuzz target without a fuzzing engine: each file named on the
// command line once, each file of every --dir DIR (a kept corpus) once,
// then --runs N seeded mutations of the target's seeds and the corpus
// (default 2000). The seed of every run is its number, so a failure is
// replayed with --from N --runs 1.
//
// --write-seeds DIR writes the target's built-in seeds there (seed-0, ...)
// and exits: the start of a kept corpus.
//
// --rss-growth-kb K fails the run when the resident size after the last
// mutation exceeds the size after the first tenth of them by more than K:
// an input must give back what it took, host bookkeeping included.

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <string>
#include <vector>

#include <malloc.h>
#include <unistd.h>

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

// Resident set size now, in KB (0 when /proc is not there). Free memory the
// allocator keeps for reuse goes back to the system first: after a large
// block is freed, glibc raises its trim threshold and would otherwise keep
// tens of megabytes that no input holds.
long ResidentKb() {
  malloc_trim(0);
  long pages = 0, resident = 0;
  FILE* f = std::fopen("/proc/self/statm", "r");
  if (f == nullptr) return 0;
  if (std::fscanf(f, "%ld %ld", &pages, &resident) != 2) resident = 0;
  std::fclose(f);
  return resident * (sysconf(_SC_PAGESIZE) / 1024);
}

}  // namespace

int main(int argc, char** argv) {
  long runs = 2000;
  long from = 0;
  long growthLimitKb = -1;
  std::vector<std::string> files;
  std::vector<std::string> dirs;
  const char* writeSeeds = nullptr;
  for (int i = 1; i < argc; i++) {
    if (!std::strcmp(argv[i], "--runs") && i + 1 < argc) {
      runs = std::strtol(argv[++i], nullptr, 10);
    } else if (!std::strcmp(argv[i], "--from") && i + 1 < argc) {
      from = std::strtol(argv[++i], nullptr, 10);
    } else if (!std::strcmp(argv[i], "--write-seeds") && i + 1 < argc) {
      writeSeeds = argv[++i];
    } else if (!std::strcmp(argv[i], "--dir") && i + 1 < argc) {
      dirs.push_back(argv[++i]);
    } else if (!std::strcmp(argv[i], "--rss-growth-kb") && i + 1 < argc) {
      growthLimitKb = std::strtol(argv[++i], nullptr, 10);
    } else {
      files.push_back(argv[i]);
    }
  }
  std::vector<std::vector<uint8_t>> seeds;
  SluiceFuzzSeeds(&seeds);
  if (writeSeeds != nullptr) {
    for (size_t i = 0; i < seeds.size(); i++) {
      std::ofstream out(std::string(writeSeeds) + "/seed-" + std::to_string(i), std::ios::binary);
      out.write(reinterpret_cast<const char*>(seeds[i].data()),
                static_cast<std::streamsize>(seeds[i].size()));
      if (!out) {
        std::fprintf(stderr, "cannot write seeds into %s\n", writeSeeds);
        return 1;
      }
    }
    return 0;
  }
  seeds.emplace_back();
  for (const std::string& d : dirs) {
    std::error_code ec;
    std::vector<std::string> entries;
    for (const auto& e : std::filesystem::directory_iterator(d, ec)) {
      if (e.is_regular_file()) entries.push_back(e.path().string());
    }
    std::sort(entries.begin(), entries.end());  // the same run order everywhere
    files.insert(files.end(), entries.begin(), entries.end());
  }
  for (const std::string& f : files) {
    std::ifstream in(f, std::ios::binary);
    std::vector<uint8_t> data((std::istreambuf_iterator<char>(in)), {});
    LLVMFuzzerTestOneInput(data.data(), data.size());
    if (!dirs.empty()) seeds.push_back(std::move(data));
  }
  for (const auto& s : seeds) LLVMFuzzerTestOneInput(s.data(), s.size());
  long warmKb = ResidentKb();
  for (long r = from; r < from + runs; r++) {
    if (r == from + runs / 10) warmKb = ResidentKb();
    std::mt19937_64 rng(static_cast<uint64_t>(r));
    std::vector<uint8_t> input = Mutate(seeds[rng() % seeds.size()], rng);
    LLVMFuzzerTestOneInput(input.data(), input.size());
  }
  const long endKb = ResidentKb();
  std::printf("%zu files, %ld runs, %zu seeds: no fault; resident %ld KB after a tenth, %ld KB at the end\n",
              files.size(), runs, seeds.size(), warmKb, endKb);
  if (growthLimitKb >= 0 && endKb - warmKb > growthLimitKb) {
    std::fprintf(stderr, "resident size grew by %ld KB (limit %ld KB): inputs keep memory\n",
                 endKb - warmKb, growthLimitKb);
    return 1;
  }
  return 0;
}
