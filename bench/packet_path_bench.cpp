// Packet-path benchmarks: lists of 64 frames through the framework's
// process-packets callback (SLCGenericProcessPackets) of one firewall filter.
//
//   BM_ExactTcpHits/<rules>     every packet hits one of <rules> exact TCP
//                               accept rules (10k: all flows in turn; 1M: a
//                               random 64k of them, so entries miss cache)
//   BM_GeneralMatchAtEnd/<n>    n general rules, only the last one matches
//   BM_Ipv6ExactHits/<rules>    IPv6 with a hop-by-hop header, exact hits
//   BM_NoRulesetAccept          no ruleset, default accept (per list)
//
// Counters: ns_per_pkt (or ns_per_list), ns_per_rule for the general scan
// (per packet time / rules tested, fixed costs included), and
// heap_allocs: module heap allocations made while timing (must be 0: the
// path allocates nothing per packet for these actions).
//
// Instruction counts: run one scenario for a fixed number of lists under
// callgrind, counting only inside the callback:
//   valgrind --tool=callgrind --toggle-collect='SLCGenericProcessPackets*'
//       ./packet_path_bench --fixed=exact:10000:2000
//   (Ir of the run / (2000 * 64) = instructions per packet)
// Scenarios for --fixed=<scenario>:<size>:<lists>: exact, general, ipv6,
// none.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "agent/agent.h"
#include "firewall/firewall.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/locks.h"
#include "module/module.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace {

constexpr size_t kListLen = 64;
constexpr const char* kAgent = "sluice-generic-quelmar";
const frames::MacAddr kDst = frames::Mac("02:00:00:00:00:02");
const frames::MacAddr kSrc = frames::Mac("02:00:00:00:00:01");

enum class Shape { Exact, General, Ipv6, None };

// Source address of flow i: 10.x.y.z (IPv4) or 2001:db8::x:y:z (IPv6).
void FlowAddress(uint32_t i, uint8_t* addr, bool v6) {
  uint8_t* last3 = addr + (v6 ? 13 : 1);
  last3[0] = static_cast<uint8_t>(i >> 16);
  last3[1] = static_cast<uint8_t>(i >> 8);
  last3[2] = static_cast<uint8_t>(i);
}

// A loaded module with one filter, a ruleset and packet lists ready to go
// round. The host is process-wide, so only one exists at a time; it is kept
// between the repeated calls Google Benchmark makes for one benchmark.
class Scenario {
 public:
  Scenario(Shape shape, uint32_t size) : shape_(shape), size_(size) {
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    if (host::Loader::Load(&slcGenericModuleImage, {{"SLCGENERIC_HEAP_MAX_SIZE", INT32_MAX}}) != 0) {
      std::fprintf(stderr, "module failed to load\n");
      std::abort();
    }
    if (host::Sluice::CreateFilter(kAgent, host::FilterConfig{}, &id_) != ZEL_OK) {
      std::fprintf(stderr, "filter creation failed\n");
      std::abort();
    }
    priv_ = host::Sluice::FilterPriv(id_);
    switch (shape) {
      case Shape::Exact: BuildExact(false); break;
      case Shape::Ipv6: BuildExact(true); break;
      case Shape::General: BuildGeneral(); break;
      case Shape::None: BuildNone(); break;
    }
  }

  ~Scenario() {
    lists_.clear();
    host::Loader::Unload();
    host::Reset();
  }

  bool Is(Shape shape, uint32_t size) const { return shape_ == shape && size_ == size; }

  // One list through the callback; the lists go round. With rekeying, the
  // list's packets first get the next flows of the random sequence.
  void RunOne() {
    const size_t index = next_;
    if (++next_ == lists_.size()) next_ = 0;
    if (!rekey_.empty()) Rekey(index);
    host::PacketList& list = *lists_[index];
    ZelStatus st = SLCGenericProcessPackets(priv_, list.get(), 1);
    benchmark::DoNotOptimize(st);
  }

  // Only the rekeying, to subtract its cost.
  void RekeyOne() {
    const size_t index = next_;
    if (++next_ == lists_.size()) next_ = 0;
    Rekey(index);
  }
  bool Rekeys() const { return !rekey_.empty(); }

  // Every list still holds its 64 packets (all accepted).
  bool AllPassed() {
    for (auto& l : lists_) {
      if (l->Count() != kListLen) return false;
    }
    return true;
  }

  uint64_t HeapAllocations() const {
    return host::Heaps::Stats(slcGenericHeapID).allocations;
  }

 private:
  void Apply(const std::vector<uint8_t>& bytes) {
    std::vector<uint8_t> copy(bytes);
    SLCGenericFilter* filter = static_cast<SLCGenericFilter*>(priv_);
    SLCGenericWriteGuard guard(FWContext(filter)->configLock);
    if (FWApplyRuleset(filter, reinterpret_cast<FWRuleset*>(copy.data()), 1, 1) != ZEL_OK) {
      std::fprintf(stderr, "ruleset not applied\n");
      std::abort();
    }
  }

  frames::Bytes Frame(uint32_t flow, bool v6, uint16_t dport = 80) {
    frames::FrameBuilder b;
    b.Eth(kDst, kSrc);
    if (v6) {
      frames::Ip6Addr sa = frames::Ip6("2001:db8::"), da = frames::Ip6("2001:db8::ffff");
      FlowAddress(flow, sa.data(), true);
      b.Ipv6(sa, da).HopByHop();
    } else {
      frames::Ip4Addr sa = frames::Ip4("10.0.0.0"), da = frames::Ip4("192.168.0.1");
      FlowAddress(flow, sa.data(), false);
      b.Ipv4(sa, da);
    }
    return b.Tcp(1234, dport).Payload(6).Build();
  }

  void AddList(const std::vector<uint32_t>& flows, bool v6, size_t from) {
    auto list = std::make_unique<host::PacketList>();
    for (size_t k = 0; k < kListLen; k++) {
      list->Append(host::Packets::Make(Frame(flows[(from + k) % flows.size()], v6)));
    }
    members_.push_back(list->Packets());
    lists_.push_back(std::move(list));
  }

  void BuildExact(bool v6) {
    FWRule rule = rules::ParseRule(
        v6 ? "action=accept dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x86dd "
             "vlan=none sa=2001:db8:: da=2001:db8::ffff proto=tcp sport=1234 dport=80"
           : "action=accept dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
             "vlan=none sa=10.0.0.0 da=192.168.0.1 proto=tcp sport=1234 dport=80");
    rules::RulesetBuilder builder;
    for (uint32_t i = 0; i < size_; i++) {
      FlowAddress(i, rule.ipSa, v6);
      builder.Add(rule);
    }
    Apply(builder.Bytes());

    // Up to 64k rules: every flow in turn, one packet each, in lists that
    // go round. Larger tables: a few lists of packets that stay in cache
    // (as a list just handed over by the switch does) and are rekeyed to
    // the next flows of a random sequence before each call, so that every
    // packet meets a cold bucket and entry.
    std::vector<uint32_t> flows;
    if (size_ <= 65536) {
      for (uint32_t i = 0; i < size_; i++) flows.push_back(i);
      const size_t nLists = (flows.size() + kListLen - 1) / kListLen;
      for (size_t l = 0; l < nLists; l++) AddList(flows, v6, l * kListLen);
      return;
    }
    std::mt19937 rng(12345);
    std::uniform_int_distribution<uint32_t> pick(0, size_ - 1);
    for (uint32_t i = 0; i < (1u << 20); i++) rekey_.push_back(pick(rng));
    rekeyV6_ = v6;
    for (size_t l = 0; l < 4; l++) AddList(rekey_, v6, l * kListLen);
  }

  void Rekey(size_t index) {
    const size_t addrOffset = rekeyV6_ ? 14 + 8 : 14 + 12;
    for (ZelPkt* pkt : members_[index]) {
      FlowAddress(rekey_[rekeyNext_], zel_PktFrameMappedPointerGet(pkt) + addrOffset, rekeyV6_);
      if (++rekeyNext_ == rekey_.size()) rekeyNext_ = 0;
    }
  }

  void BuildGeneral() {
    // size_ - 1 rules that fail on the destination port, the last one matches
    // (ethtype=any: the port is the only field compared after the protocol).
    std::string text;
    for (uint32_t j = 0; j + 1 < size_; j++) {
      text += "action=drop ipv4 ethtype=any proto=tcp dport=" + std::to_string(1000 + j % 60000) + "\n";
    }
    text += "action=accept ipv4 ethtype=any proto=tcp dport=80\n";
    Apply(rules::ParseRuleset(text));
    std::vector<uint32_t> flows;
    for (uint32_t i = 0; i < kListLen; i++) flows.push_back(i);
    AddList(flows, false, 0);
  }

  void BuildNone() {
    std::vector<uint32_t> flows = {0};
    AddList(flows, false, 0);
  }

  Shape shape_;
  uint32_t size_;
  host::FilterId id_ = 0;
  void* priv_ = nullptr;
  std::vector<std::unique_ptr<host::PacketList>> lists_;
  size_t next_ = 0;
  std::vector<uint32_t> rekey_;
  size_t rekeyNext_ = 0;
  bool rekeyV6_ = false;
  // The packets of each list, for rekeying without walking the host list.
  std::vector<std::vector<ZelPkt*>> members_;
};

std::unique_ptr<Scenario> current;

Scenario& Use(Shape shape, uint32_t size) {
  if (!current || !current->Is(shape, size)) {
    current.reset();
    current = std::make_unique<Scenario>(shape, size);
  }
  return *current;
}

void RunTimed(benchmark::State& state, Scenario& s, bool perList) {
  const uint64_t allocsBefore = s.HeapAllocations();
  for (auto _ : state) s.RunOne();
  if (!s.AllPassed()) state.SkipWithError("a packet left its list");
  state.counters["heap_allocs"] = static_cast<double>(s.HeapAllocations() - allocsBefore);
  const double items = static_cast<double>(state.iterations()) * (perList ? 1 : kListLen);
  state.SetItemsProcessed(static_cast<int64_t>(items));
  // Seconds per item, shown in ns by the report.
  state.counters[perList ? "ns_per_list" : "ns_per_pkt"] =
      benchmark::Counter(items, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}

void BM_ExactTcpHits(benchmark::State& state) {
  Scenario& s = Use(Shape::Exact, static_cast<uint32_t>(state.range(0)));
  RunTimed(state, s, false);
}
BENCHMARK(BM_ExactTcpHits)->Arg(10000)->Arg(1000000);

// The rekeying alone that BM_ExactTcpHits/1000000 includes.
void BM_RekeyOnly(benchmark::State& state) {
  Scenario& s = Use(Shape::Exact, static_cast<uint32_t>(state.range(0)));
  for (auto _ : state) s.RekeyOne();
  const double items = static_cast<double>(state.iterations()) * kListLen;
  state.counters["ns_per_pkt"] =
      benchmark::Counter(items, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_RekeyOnly)->Arg(1000000);

void BM_Ipv6ExactHits(benchmark::State& state) {
  Scenario& s = Use(Shape::Ipv6, static_cast<uint32_t>(state.range(0)));
  RunTimed(state, s, false);
}
BENCHMARK(BM_Ipv6ExactHits)->Arg(10000);

void BM_GeneralMatchAtEnd(benchmark::State& state) {
  const uint32_t n = static_cast<uint32_t>(state.range(0));
  Scenario& s = Use(Shape::General, n);
  RunTimed(state, s, false);
  const double tested = static_cast<double>(state.iterations()) * kListLen * n;
  state.counters["ns_per_rule"] =
      benchmark::Counter(tested, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_GeneralMatchAtEnd)->Arg(1)->Arg(10)->Arg(100)->Arg(1000);

void BM_NoRulesetAccept(benchmark::State& state) {
  Scenario& s = Use(Shape::None, 0);
  RunTimed(state, s, true);
}
BENCHMARK(BM_NoRulesetAccept);

// --fixed=<scenario>:<size>:<lists>: a fixed amount of work for callgrind.
bool RunFixed(const char* scenario) {
  char name[16] = {};
  unsigned size = 0, lists = 0;
  if (std::sscanf(scenario, "%15[a-z0-9]:%u:%u", name, &size, &lists) != 3) return false;
  Shape shape;
  if (std::strcmp(name, "exact") == 0) shape = Shape::Exact;
  else if (std::strcmp(name, "general") == 0) shape = Shape::General;
  else if (std::strcmp(name, "ipv6") == 0) shape = Shape::Ipv6;
  else if (std::strcmp(name, "none") == 0) shape = Shape::None;
  else return false;
  Scenario& s = Use(shape, size);
  for (unsigned i = 0; i < lists; i++) s.RunOne();
  std::printf("%s: %u lists of %zu packets processed\n", scenario, lists, kListLen);
  current.reset();
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  for (int i = 1; i < argc; i++) {
    if (std::strncmp(argv[i], "--fixed=", 8) == 0) {
      if (!RunFixed(argv[i] + 8)) {
        std::fprintf(stderr, "usage: --fixed=exact|general|ipv6|none:<size>:<lists>\n");
        return 2;
      }
      return 0;
    }
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  current.reset();
  return 0;
}
