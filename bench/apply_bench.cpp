// Applying rulesets: exact rules installed with replace, per ruleset size.
//
//   BM_ApplyExactReplace/<rules>   FWApplyRuleset(replace) of <rules> exact
//                                  TCP rules over a filter that already holds
//                                  a ruleset of the same size
//
// Time is per application (ms); heap_bytes_per_rule is the module heap held
// per installed rule (entries and the table's share) once applied.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "firewall/firewall.h"
#include "host/core/host_core.h"
#include "host/sluice/framework.h"
#include "module/module.h"

namespace {

constexpr const char* kAgent = "sluice-generic-quelmar";

// A version-8 ruleset of `n` distinct exact TCP accept rules.
std::vector<uint8_t> ExactRuleset(uint32_t n) {
  std::vector<uint8_t> bytes(FW_RULESET_HEADER_SIZE + size_t{n} * FW_RULE_SIZE_V8);
  FWRulesetHeader header{};
  header.version = 8;
  header.highestSupportedVersion = 8;
  header.lowestSupportedVersion = 7;
  header.numRules = n;
  std::memcpy(bytes.data(), &header, sizeof(header));
  for (uint32_t i = 0; i < n; i++) {
    FWRule r{};
    r.action = SLCGenericActionAccept;
    r.ruleFlags = FW_FLAG_IPV4;
    r.direction = SLCGenericDirectionBidirectional;
    const uint8_t dmac[6] = {2, 0, 0, 0, 0, 2}, smac[6] = {2, 0, 0, 0, 0, 1};
    std::memcpy(r.dMac, dmac, 6);
    std::memcpy(r.sMac, smac, 6);
    r.ethType[0] = 0x08;
    const uint8_t sa[4] = {10, static_cast<uint8_t>(i >> 16), static_cast<uint8_t>(i >> 8),
                           static_cast<uint8_t>(i)};
    const uint8_t da[4] = {192, 168, 0, 1};
    std::memcpy(r.ipSa, sa, 4);
    std::memcpy(r.ipDa, da, 4);
    r.ipProto = 6;
    FWPutNet16(r.sPort, static_cast<uint16_t>(1024 + (i & 0x3fff)));
    FWPutNet16(r.dPort, 80);
    std::memcpy(bytes.data() + FW_RULESET_HEADER_SIZE + size_t{i} * FW_RULE_SIZE_V8, &r,
                sizeof(r));
  }
  return bytes;
}

void BM_ApplyExactReplace(benchmark::State& state) {
  const uint32_t n = static_cast<uint32_t>(state.range(0));
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  if (host::Loader::Load(&slcGenericModuleImage) != 0) std::abort();
  host::FilterId id = 0;
  if (host::Sluice::CreateFilter(kAgent, {}, &id) != ZEL_OK) std::abort();
  auto* filter = static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(id));
  FWFilterContext* ctx = FWContext(filter);

  std::vector<uint8_t> ruleset = ExactRuleset(n);
  auto* rs = reinterpret_cast<FWRuleset*>(ruleset.data());
  const uint64_t before = host::Heaps::Stats(slcGenericHeapID).bytes;
  uint64_t held = 0;
  for (auto _ : state) {
    ZelStatus status;
    {
      SLCGenericWriteGuard guard(ctx->configLock);
      status = FWApplyRuleset(filter, rs, 1, 0);
    }
    if (status != ZEL_OK || ctx->numRules != n) state.SkipWithError("apply failed");
    held = host::Heaps::Stats(slcGenericHeapID).bytes - before;
  }
  state.counters["heap_bytes_per_rule"] = static_cast<double>(held) / n;
  state.SetItemsProcessed(static_cast<int64_t>(state.iterations()) * n);

  if (host::Sluice::DestroyFilter(id) != ZEL_OK) std::abort();
  host::Loader::Unload();
  host::Reset();
}
BENCHMARK(BM_ApplyExactReplace)->Arg(1000)->Arg(10000)->Arg(100000)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
