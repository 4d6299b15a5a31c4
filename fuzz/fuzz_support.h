// Shared pieces of the fuzz targets: one module load per process, a fresh
// filter per input, and a check that every input gives back what it took.
//
// Each target defines LLVMFuzzerTestOneInput and SluiceFuzzSeeds (inputs a
// mutation can start from). Built with a fuzzing engine they run under it;
// otherwise driver.cpp runs a fixed number of seeded mutations, which CTest
// runs under every sanitizer build.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "host/sluice/framework.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);
void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds);

namespace fuzz {

inline constexpr const char* kAgent = "sluice-generic-quelmar";

// Loads the module the first time; aborts if it does not start.
void EnsureModule();
// A new filter on the default agent.
host::FilterId NewFilter(uint32_t failurePolicy = 0);
// Destroys the filter, releases what the framework kept for it, and aborts
// if the module heap holds more blocks than before the input.
void Finish(host::FilterId id);
// A ruleset with exact and general rules and every action, for targets
// that need rules in force.
std::vector<uint8_t> SampleRuleset(uint8_t version = 8);
// A few frames of the kinds the sample ruleset matches.
std::vector<std::vector<uint8_t>> SampleFrames();

}  // namespace fuzz
