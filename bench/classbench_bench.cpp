// General rules on the whole packet path, with ClassBench-like rulesets and
// packets from the shared generator (fixed seeds): every frame is parsed,
// looked up, counted and accepted through SLCGenericProcessPackets.
//
//   BM_ClassBench/<rules>        ns_per_pkt over 2^16 packets in lists of 64
//                                (half inside a random rule, half random)
//   BM_ClassBenchApply/<rules>   ms to apply the ruleset (classifier built),
//                                and the classifier's bytes per rule
//   BM_Mixed/<rules>             rules with negations, masked MACs, 802.1Q
//                                tags and IPv6 ranges in among ClassBench-
//                                like ones, same packet mix
//   BM_OrderedScan/<rules>, BM_MixedOrderedScan/<rules>
//                                the same without the classifier: the
//                                ordered scan of every rule up to the match
//
// Before timing, one pass over every packet is checked: the counters of
// every rule must equal the first-match histogram of the generator's own
// ordered scan (the run aborts otherwise).
//
// With libdpdk (an optional dependency of this benchmark only), the peer
// classifier runs on the same rules and packets, scalar and with the best
// method this processor offers, registered right after the project's run
// of the same size so that the runs interleave:
//   BM_PeerAclScalar/<rules>, BM_PeerAclBest/<rules>   ns_per_pkt over
//                                bursts of 64 prepared 5-tuples
// Its first match is checked against the ordered scan for every packet.
//
// The packet path's wait while a ruleset replaces another (configLock held
// exclusively), with packets flowing on another thread:
//   BM_ApplyHold/<rules>/<prepared>     10,000 ClassBench-like general
//                                 rules replace 10,000 others (and back);
//                                 prepared 1: the control channels' road
//                                 (FWReplaceRuleset: everything built
//                                 before the hold, the hold a swap);
//                                 prepared 0: the whole application under
//                                 the hold
//   BM_ExactApplyHold/<rules>     exact rules replace as many others
// and while rules are added to those in force (replace 0):
//   BM_AddHold/<rules>/<prepared> 10,000 other general rules added to
//                                 <rules> (the filter reset to those
//                                 before each round, outside the timing);
//                                 prepared 1: the ioctl road
//                                 (FWSetIoctlRuleset: built under the
//                                 shared hold, the exclusive hold a swap);
//                                 prepared 0: FWApplyRuleset under the hold
//   BM_ExactAddHold/<rules>/<prepared>   10,000 new exact rules added to
//                                 <rules> exact ones, the same two roads
// Counters: hold_ms, the longest exclusive hold of configLock (the host
// times every write hold); stall_ms, the longest call of the packet thread
// while rules were replaced (its list's own time included, a few
// microseconds, and any time the scheduler gave the other thread);
// apply_ms, the whole replacement as the caller sees it.
//
// Exact hits, 2^18 distinct frames (flows drawn at random among the
// rules, so at 1,000,000 rules frames and entries are cache-cold):
//   BM_ExactHits/<rules>          the whole path, every packet a hit
//   BM_PeerHashBulk/<rules>       the peer hash table's bulk lookup of the
//                                 same 5-tuples (16-byte keys), bursts of 64
//   BM_ExactTableFloor/<rules>    what any lookup in this table reads at
//                                 least: the bucket head and the first line
//                                 of the entry behind it, from hashes
//                                 computed beforehand, bursts of 64 in stages
// Both are checked: every rule's counter against its flow's packets, and
// every peer lookup against its flow.
//
// JSON for the plot script: --benchmark_out=<file> --benchmark_out_format=json
// (scripts/bench-plot.sh runs it and draws the figure).

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <atomic>
#include <memory>
#include <thread>
#include <string>
#include <vector>

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wunused-function"
#include "classbench_gen.h"
#pragma GCC diagnostic pop
#include "agent/agent.h"
#include "firewall/firewall.h"
#include "firewall/fw_index.h"
#include "firewall/fw_packet.h"
#include "firewall/fw_rules.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/locks.h"
#include "module/module.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

#ifdef SLC_HAVE_DPDK
#include <rte_acl.h>
#include <rte_eal.h>
#include <rte_hash.h>
#include <rte_hash_crc.h>
#endif

namespace {

constexpr size_t kListLen = 64;
constexpr size_t kPackets = 1 << 16;
constexpr const char* kAgent = "sluice-generic-quelmar";

// The counters of a timed run that handled kListLen packets an iteration
// with a ruleset of state.range(0) rules.
void ReportPerPacket(benchmark::State& state) {
  const double items = static_cast<double>(state.iterations()) * kListLen;
  state.SetItemsProcessed(static_cast<int64_t>(items));
  state.counters["ns_per_pkt"] =
      benchmark::Counter(items, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
  state.counters["rules"] = static_cast<double>(state.range(0));
}

void PutNet32(uint8_t* p, uint32_t v) {
  p[0] = static_cast<uint8_t>(v >> 24);
  p[1] = static_cast<uint8_t>(v >> 16);
  p[2] = static_cast<uint8_t>(v >> 8);
  p[3] = static_cast<uint8_t>(v);
}

// The generator's rule as a general rule record: prefixes as ranges (or
// equality for /32), wildcards for /0, 0-65535 and protocol mask 0.
FWRule RecordOf(const Rule4& x) {
  FWRule r;
  std::memset(&r, 0, sizeof(r));
  r.action = SLCGenericActionAccept;
  r.direction = SLCGenericDirectionBidirectional;
  r.ruleFlags = FW_FLAG_IPV4 | FW_WC_DMAC | FW_WC_SMAC | FW_WC_ETHTYPE | FW_WC_VLAN | FW_WC_RPTAG;
  auto addr = [&](uint32_t lo, uint32_t hi, uint8_t len, uint32_t wc, uint32_t range,
                  uint8_t* rlo, uint8_t* rhi) {
    if (len == 0) {
      r.ruleFlags |= wc;
      return;
    }
    PutNet32(rlo, lo);
    if (lo != hi) {
      r.ruleFlags |= range;
      PutNet32(rhi, hi);
    }
  };
  addr(x.src_lo, x.src_hi, x.src_len, FW_WC_IPSA, FW_RANGE_IPSA, r.ipSa, r.ipSaHigh);
  addr(x.dst_lo, x.dst_hi, x.dst_len, FW_WC_IPDA, FW_RANGE_IPDA, r.ipDa, r.ipDaHigh);
  auto port = [&](uint16_t lo, uint16_t hi, uint32_t wc, uint32_t range, uint8_t* rlo,
                  uint8_t* rhi) {
    if (lo == 0 && hi == 65535) {
      r.ruleFlags |= wc;
      return;
    }
    FWPutNet16(rlo, lo);
    if (lo != hi) {
      r.ruleFlags |= range;
      FWPutNet16(rhi, hi);
    }
  };
  port(x.sp_lo, x.sp_hi, FW_WC_SPORT, FW_RANGE_SPORT, r.sPort, r.sPortHigh);
  port(x.dp_lo, x.dp_hi, FW_WC_DPORT, FW_RANGE_DPORT, r.dPort, r.dPortHigh);
  if (x.proto_mask == 0) {
    r.ruleFlags |= FW_WC_IPPROTO;
  } else {
    r.ipProto = x.proto;
  }
  return r;
}

// One rule in four made one no peer classifier expresses: a negated
// ethertype, a masked source MAC, an 802.1Q tag, or an IPv6 range. The
// reference match of the packets (all IPv4, untagged, from one MAC) is
// kept by construction: the negation is of an ethertype no packet has,
// the MAC mask admits the packets' MAC, and the tag and IPv6 rules match
// no packet.
FWRule MixedRecordOf(const Rule4& x, uint32_t i, bool* matchesNothing) {
  FWRule r = RecordOf(x);
  *matchesNothing = false;
  switch (i % 16) {
    case 3:  // ethertype other than IPv6
      r.ruleFlags &= ~FW_WC_ETHTYPE;
      FWPutNet16(r.ethType, 0x86dd);
      r.negateFlags |= FW_NEG_ETHTYPE;
      break;
    case 7: {  // source MAC 02:00:00:xx:xx:xx
      const uint8_t mac[6] = {2, 0, 0, 0, 0, 1}, mask[6] = {0xff, 0xff, 0xff, 0, 0, 0};
      r.ruleFlags &= ~FW_WC_SMAC;
      r.ruleFlags |= FW_MASK_SMAC;
      std::memcpy(r.sMac, mac, 6);
      std::memcpy(r.sMacMask, mask, 6);
      break;
    }
    case 11:  // a VLAN the packets lack
      r.ruleFlags &= ~FW_WC_VLAN;
      PutNet32(r.vlan1QTag, 0x81000000u | i);
      *matchesNothing = true;
      break;
    case 15: {  // an IPv6 range
      r.ruleFlags &= ~(FW_FLAG_IPV4 | FW_WC_IPSA);
      r.ruleFlags |= FW_RANGE_IPSA;
      std::memset(r.ipSa, 0, 16);
      std::memset(r.ipSaHigh, 0, 16);
      r.ipSa[0] = 0x20, r.ipSa[1] = 0x01, r.ipSa[4] = static_cast<uint8_t>(i >> 8);
      r.ipSaHigh[0] = 0x20, r.ipSaHigh[1] = 0x01, r.ipSaHigh[4] = static_cast<uint8_t>(i >> 8);
      r.ipSaHigh[5] = 0xff;
      if (!(r.ruleFlags & FW_WC_IPDA)) {  // both addresses must be IPv6
        r.ruleFlags |= FW_WC_IPDA;
        r.ruleFlags &= ~FW_RANGE_IPDA;
      }
      *matchesNothing = true;
      break;
    }
    default: break;
  }
  return r;
}

// The longest packet call, in ms, and the mean change, in ms, while rules
// change under packets, and the longest exclusive hold of configLock.
struct HoldResult {
  double stallMs, applyMs, holdMs;
};

// Sends `lists` through the packet path of `priv` on a thread of its own
// until destroyed, and keeps the longest call made while a change is under
// way (between Begin and End).
class PacketFlow {
 public:
  PacketFlow(void* priv, std::vector<std::unique_ptr<host::PacketList>>& lists)
      : thread_([this, priv, &lists] {
          size_t next = 0;
          while (!stop_.load(std::memory_order_relaxed)) {
            const bool during = changing_.load(std::memory_order_acquire);
            const double t0 = now_ns();
            (void)SLCGenericProcessPackets(priv, lists[next]->get(), 1);
            const double took = now_ns() - t0;
            if ((during || changing_.load(std::memory_order_acquire)) && took > worst_.load()) {
              worst_.store(took);
            }
            if (++next == lists.size()) next = 0;
          }
        }) {}
  ~PacketFlow() {
    stop_.store(true);
    thread_.join();
  }
  void Begin() { changing_.store(true, std::memory_order_release); }
  void End() {
    std::this_thread::sleep_for(std::chrono::milliseconds(2));  // the stalled call ends
    changing_.store(false, std::memory_order_release);
  }
  double WorstMs() const { return worst_.load() / 1e6; }

 private:
  std::atomic<bool> stop_{false}, changing_{false};
  std::atomic<double> worst_{0};
  std::thread thread_;
};

// `rs` in place of the rules of `filter` (replace 1) or beside them (0):
// through the filter-ioctl road when `prepared`, else whole under the
// exclusive hold.
ZelStatus ChangeRules(SLCGenericFilter* filter, std::vector<uint8_t> bytes, uint32_t replace,
                      bool prepared) {
  auto* rs = reinterpret_cast<FWRuleset*>(bytes.data());
  if (prepared) return FWSetIoctlRuleset(filter, rs, replace);
  SLCGenericWriteGuard guard(FWContext(filter)->configLock);
  return FWApplyRuleset(filter, rs, replace, 1);
}

// Replaces the rules of `priv` with `a` and `b` in turn, `rounds` times,
// while packets flow.
HoldResult MeasureHold(void* priv, std::vector<std::unique_ptr<host::PacketList>>& lists,
                       const std::vector<uint8_t>& a, const std::vector<uint8_t>& b,
                       bool prepared, int rounds) {
  auto* filter = static_cast<SLCGenericFilter*>(priv);
  double total = 0;
  PacketFlow flow(priv, lists);
  host::Locks::ResetWriteHolds("slcg.fw.config");
  for (int r = 0; r < rounds; r++) {
    flow.Begin();
    const double t0 = now_ns();
    const ZelStatus st = ChangeRules(filter, r % 2 == 0 ? a : b, 1, prepared);
    total += now_ns() - t0;
    flow.End();
    if (st != ZEL_OK) {
      std::fprintf(stderr, "replacement failed\n");
      std::abort();
    }
  }
  return {flow.WorstMs(), total / rounds / 1e6,
          static_cast<double>(host::Locks::LongestWriteHoldNs("slcg.fw.config")) / 1e6};
}

// Resets the rules of `priv` to `base`, then adds `extra` to them, `rounds`
// times, while packets flow. Only the additions are measured.
HoldResult MeasureAddHold(void* priv, std::vector<std::unique_ptr<host::PacketList>>& lists,
                          const std::vector<uint8_t>& base, const std::vector<uint8_t>& extra,
                          bool prepared, int rounds) {
  auto* filter = static_cast<SLCGenericFilter*>(priv);
  double total = 0;
  uint64_t longest = 0;
  PacketFlow flow(priv, lists);
  for (int r = 0; r < rounds; r++) {
    if (ChangeRules(filter, base, 1, true) != ZEL_OK) {
      std::fprintf(stderr, "reset failed\n");
      std::abort();
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    host::Locks::ResetWriteHolds("slcg.fw.config");
    flow.Begin();
    const double t0 = now_ns();
    const ZelStatus st = ChangeRules(filter, extra, 0, prepared);
    total += now_ns() - t0;
    flow.End();
    longest = std::max(longest, host::Locks::LongestWriteHoldNs("slcg.fw.config"));
    if (st != ZEL_OK) {
      std::fprintf(stderr, "addition failed\n");
      std::abort();
    }
  }
  return {flow.WorstMs(), total / rounds / 1e6, static_cast<double>(longest) / 1e6};
}

class Bench {
 public:
  Bench(uint32_t n, bool mixed, bool scanOnly) : n_(n), mixed_(mixed), scanOnly_(scanOnly) {
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    if (host::Loader::Load(&slcGenericModuleImage, {{"SLCGENERIC_HEAP_MAX_SIZE", INT32_MAX}}) !=
            0 ||
        host::Sluice::CreateFilter(kAgent, host::FilterConfig{}, &id_) != ZEL_OK) {
      std::fprintf(stderr, "module or filter failed\n");
      std::abort();
    }
    priv_ = host::Sluice::FilterPriv(id_);
    rules_ = gen_rules(static_cast<int>(n), 0x5eed0000ull + n);
    std::vector<Key> keys = gen_packets(rules_, kPackets, 0xfeed0000ull + n);

    rules::RulesetBuilder builder(8);
    std::vector<Rule4> reference;  // the rules a packet can match, in order
    std::vector<uint32_t> position;  // their record numbers
    for (uint32_t i = 0; i < n; i++) {
      bool nothing = false;
      builder.Add(mixed ? MixedRecordOf(rules_[i], i, &nothing) : RecordOf(rules_[i]));
      if (!nothing) {
        reference.push_back(rules_[i]);
        position.push_back(i);
      }
    }
    ruleset_ = builder.Bytes();
    if (scanOnly) g_fwClassifierTuning.minRules = UINT32_MAX;
    applyMs_ = Apply();
    g_fwClassifierTuning = kFWClassifierDefaults;

    for (size_t p = 0; p < kPackets; p += kListLen) {
      auto list = std::make_unique<host::PacketList>();
      for (size_t k = 0; k < kListLen; k++) list->Append(host::Packets::Make(Frame(keys[p + k])));
      lists_.push_back(std::move(list));
    }

    // One checked pass: per-rule counters against the ordered scan.
    for (size_t l = 0; l < lists_.size(); l++) RunOne();
    std::vector<uint64_t> want(n, 0);
    const size_t checked = n >= 100000 ? kPackets / 8 : kPackets;
    for (size_t p = 0; p < checked; p++) {
      const int m = scan_naive(reference.data(), static_cast<int>(reference.size()), keys[p]);
      if (m >= 0) want[position[static_cast<size_t>(m)]]++;
    }
    if (checked == kPackets) {
      const auto general = Entries();
      for (uint32_t i = 0; i < n; i++) {
        if (general[i]->rule.pktCount != want[i]) {
          std::fprintf(stderr, "rule %u counted %llu packets, the reference %llu\n", i,
                       static_cast<unsigned long long>(general[i]->rule.pktCount),
                       static_cast<unsigned long long>(want[i]));
          std::abort();
        }
      }
    }
  }

  ~Bench() {
    lists_.clear();
    host::Loader::Unload();
    host::Reset();
  }

  bool Is(uint32_t n, bool mixed, bool scanOnly) const {
    return n_ == n && mixed_ == mixed && scanOnly_ == scanOnly;
  }

  void RunOne() {
    host::PacketList& list = *lists_[next_];
    if (++next_ == lists_.size()) next_ = 0;
    ZelStatus st = SLCGenericProcessPackets(priv_, list.get(), 1);
    benchmark::DoNotOptimize(st);
  }

  // Replaces the ruleset with itself; milliseconds.
  double Apply() {
    std::vector<uint8_t> copy(ruleset_);
    auto* filter = static_cast<SLCGenericFilter*>(priv_);
    SLCGenericWriteGuard guard(FWContext(filter)->configLock);
    const double t0 = now_ns();
    if (FWApplyRuleset(filter, reinterpret_cast<FWRuleset*>(copy.data()), 1, 1) != ZEL_OK) {
      std::fprintf(stderr, "ruleset not applied\n");
      std::abort();
    }
    return (now_ns() - t0) / 1e6;
  }

  double ClassifierBytes() const {
    const FWScanIndex* index = FWContext(static_cast<SLCGenericFilter*>(priv_))->scanIndex;
    return index && index->classifier ? index->classifier->bytes : 0;
  }
  double ResidualRules() const {
    const FWScanIndex* index = FWContext(static_cast<SLCGenericFilter*>(priv_))->scanIndex;
    return index && index->classifier ? index->classifier->numResidual : 0;
  }
  // The longest leaf of the classifier.
  double LongestLeaf() const {
    const FWScanIndex* index = FWContext(static_cast<SLCGenericFilter*>(priv_))->scanIndex;
    if (!index || !index->classifier) return 0;
    uint32_t most = 0;
    const FWClassifier* c = index->classifier;
    for (uint32_t i = 0; i < c->numNodes; i++) {
      if (c->nodes[i].word == FW_CLS_LEAF) most = std::max(most, FWClsLeafCount(c->nodes[i]));
    }
    return most;
  }
  double applyMs_ = 0;

  HoldResult Hold(bool prepared) {
    if (other_.empty()) {
      const std::vector<Rule4> rules = gen_rules(static_cast<int>(n_), 0x0dd50000ull + n_);
      rules::RulesetBuilder builder(8);
      for (const Rule4& x : rules) builder.Add(RecordOf(x));
      other_ = builder.Bytes();
    }
    return MeasureHold(priv_, lists_, other_, ruleset_, prepared, 10);
  }

  // 10,000 other general rules added to this bench's own.
  HoldResult AddHold(bool prepared) {
    if (added_.empty()) {
      const std::vector<Rule4> rules = gen_rules(10000, 0xadd50000ull + n_);
      rules::RulesetBuilder builder(8);
      for (const Rule4& x : rules) builder.Add(RecordOf(x));
      added_ = builder.Bytes();
    }
    return MeasureAddHold(priv_, lists_, ruleset_, added_, prepared, 4);
  }

 private:
  std::vector<uint8_t> other_, added_;
  std::vector<FWRuleEntry*> Entries() {
    std::vector<FWRuleEntry*> v;
    FWFilterContext* ctx = FWContext(static_cast<SLCGenericFilter*>(priv_));
    for (ListLinks* l = ctx->ruleList.prev; l != &ctx->ruleList; l = l->prev) {
      v.push_back(LIST_CONTAINER(l, FWRuleEntry, link));
    }
    return v;
  }

  static frames::Bytes Frame(const Key& k) {
    frames::FrameBuilder b;
    b.Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"));
    frames::Ip4Addr sa, da;
    PutNet32(sa.data(), k.src);
    PutNet32(da.data(), k.dst);
    b.Ipv4(sa, da);
    if (k.proto == 17) {
      b.Udp(k.sport, k.dport);
    } else {
      b.Tcp(k.sport, k.dport);
    }
    return b.Payload(6).Build();
  }

  uint32_t n_;
  bool mixed_;
  bool scanOnly_;
  host::FilterId id_ = 0;
  void* priv_ = nullptr;
  std::vector<Rule4> rules_;
  std::vector<uint8_t> ruleset_;
  std::vector<std::unique_ptr<host::PacketList>> lists_;
  size_t next_ = 0;
};


std::unique_ptr<Bench> current;
class ExactBench;
// The host is process-wide: one scenario exists at a time.
void DropExactBench();

Bench& Use(uint32_t n, bool mixed, bool scanOnly = false) {
  if (!current || !current->Is(n, mixed, scanOnly)) {
    current.reset();
    DropExactBench();
    current = std::make_unique<Bench>(n, mixed, scanOnly);
  }
  return *current;
}

void Timed(benchmark::State& state, bool mixed, bool scanOnly = false) {
  Bench& b = Use(static_cast<uint32_t>(state.range(0)), mixed, scanOnly);
  for (auto _ : state) b.RunOne();
  ReportPerPacket(state);
  state.counters["residual"] = b.ResidualRules();
  state.counters["longest_leaf"] = b.LongestLeaf();
}

void BM_ClassBench(benchmark::State& state) { Timed(state, false); }
// Registered in main, size by size, with the peer's runs of each size.

void BM_Mixed(benchmark::State& state) { Timed(state, true); }
BENCHMARK(BM_Mixed)->Arg(1000)->Arg(10000);
void BM_MixedOrderedScan(benchmark::State& state) { Timed(state, true, true); }
BENCHMARK(BM_MixedOrderedScan)->Arg(1000)->Arg(10000);
void BM_OrderedScan(benchmark::State& state) { Timed(state, false, true); }
BENCHMARK(BM_OrderedScan)->Arg(1000)->Arg(10000);

void BM_ClassBenchApply(benchmark::State& state) {
  Bench& b = Use(static_cast<uint32_t>(state.range(0)), false);
  double total = 0;
  for (auto _ : state) total += b.Apply();
  state.counters["apply_ms"] = total / static_cast<double>(state.iterations());
  state.counters["classifier_bytes_per_rule"] =
      b.ClassifierBytes() / static_cast<double>(state.range(0));
}
BENCHMARK(BM_ClassBenchApply)->Arg(1000)->Arg(10000)->Arg(100000)->Iterations(3)->Unit(benchmark::kMillisecond);


// Exact rules: flow i is 10.x.y.z (i) -> 192.168.0.1, TCP 1234 -> 80.
constexpr size_t kExactFrames = 1 << 18;

Key FlowKey(uint32_t i) {
  Key k;
  std::memset(&k, 0, sizeof(k));
  k.proto = 6;
  k.src = 0x0a000000u + i;
  k.dst = 0xc0a80001u;
  k.sport = 1234;
  k.dport = 80;
  return k;
}

// The flow of frame f.
uint32_t FlowOfFrame(size_t f, uint32_t n) { return static_cast<uint32_t>(mix64(f + 1) % n); }

class ExactBench {
 public:
  explicit ExactBench(uint32_t n) : n_(n) {
    host::Reset();
    host::Timers::SetMode(host::TimerMode::Manual);
    if (host::Loader::Load(&slcGenericModuleImage, {{"SLCGENERIC_HEAP_MAX_SIZE", INT32_MAX}}) !=
            0 ||
        host::Sluice::CreateFilter(kAgent, host::FilterConfig{}, &id_) != ZEL_OK) {
      std::fprintf(stderr, "module or filter failed\n");
      std::abort();
    }
    priv_ = host::Sluice::FilterPriv(id_);
    FWRule rule = rules::ParseRule(
        "action=accept dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
        "vlan=none sa=10.0.0.0 da=192.168.0.1 proto=tcp sport=1234 dport=80");
    rules::RulesetBuilder builder(8);
    for (uint32_t i = 0; i < n; i++) {
      PutNet32(rule.ipSa, FlowKey(i).src);
      builder.Add(rule);
    }
    std::vector<uint8_t> bytes = builder.Bytes();
    auto* filter = static_cast<SLCGenericFilter*>(priv_);
    {
      SLCGenericWriteGuard guard(FWContext(filter)->configLock);
      if (FWApplyRuleset(filter, reinterpret_cast<FWRuleset*>(bytes.data()), 1, 1) != ZEL_OK) {
        std::fprintf(stderr, "ruleset not applied\n");
        std::abort();
      }
    }
    for (size_t f = 0; f < kExactFrames; f += kListLen) {
      auto list = std::make_unique<host::PacketList>();
      for (size_t k = 0; k < kListLen; k++) {
        const uint32_t flow = FlowOfFrame(f + k, n);
        frames::FrameBuilder b;
        b.Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"));
        frames::Ip4Addr sa, da;
        PutNet32(sa.data(), FlowKey(flow).src);
        PutNet32(da.data(), FlowKey(flow).dst);
        list->Append(host::Packets::Make(b.Ipv4(sa, da).Tcp(1234, 80).Payload(6).Build()));
      }
      lists_.push_back(std::move(list));
    }
    for (size_t l = 0; l < lists_.size(); l++) RunOne();
    FWFilterContext* ctx = FWContext(filter);
    // Every packet hit its rule: the counters add up to the frames.
    uint64_t counted = 0;
    Hash_Iterate(ctx->ruleHash, CountHits, &counted);
    if (counted != kExactFrames) {
      std::fprintf(stderr, "exact rules counted %llu of %zu frames\n",
                   static_cast<unsigned long long>(counted), kExactFrames);
      std::abort();
    }
  }
  ~ExactBench() {
    lists_.clear();
    host::Loader::Unload();
    host::Reset();
  }
  bool Is(uint32_t n) const { return n_ == n; }

  // Exact rulesets of the same size: the installed flows and the next n.
  HoldResult Hold() {
    FWRule rule = rules::ParseRule(
        "action=accept dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
        "vlan=none sa=10.0.0.0 da=192.168.0.1 proto=tcp sport=1234 dport=80");
    rules::RulesetBuilder mine(8), other(8);
    for (uint32_t i = 0; i < n_; i++) {
      PutNet32(rule.ipSa, FlowKey(i).src);
      mine.Add(rule);
      PutNet32(rule.ipSa, FlowKey(n_ + i).src);
      other.Add(rule);
    }
    return MeasureHold(priv_, lists_, other.Bytes(), mine.Bytes(), true, 4);
  }

  // `added` flows beyond the installed ones added to them.
  HoldResult AddHold(uint32_t added, bool prepared) {
    FWRule rule = rules::ParseRule(
        "action=accept dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
        "vlan=none sa=10.0.0.0 da=192.168.0.1 proto=tcp sport=1234 dport=80");
    rules::RulesetBuilder mine(8), extra(8);
    for (uint32_t i = 0; i < n_; i++) {
      PutNet32(rule.ipSa, FlowKey(i).src);
      mine.Add(rule);
    }
    for (uint32_t i = 0; i < added; i++) {
      PutNet32(rule.ipSa, FlowKey(n_ + i).src);
      extra.Add(rule);
    }
    return MeasureAddHold(priv_, lists_, mine.Bytes(), extra.Bytes(), prepared, 3);
  }

  void RunOne() {
    host::PacketList& list = *lists_[next_];
    if (++next_ == lists_.size()) next_ = 0;
    ZelStatus st = SLCGenericProcessPackets(priv_, list.get(), 1);
    benchmark::DoNotOptimize(st);
  }

  // The least any lookup in this table reads, for the same frames in the
  // same order: the bucket head the frame's hash selects and the first line
  // of the entry it leads to. Hashes are computed beforehand (4 bytes a
  // frame); frames, tuples and counters are not touched. A burst of 64 is
  // done in stages, as the peer's bulk lookup does: every bucket requested,
  // then every entry, then each entry's hash compared.
  void FloorOne() {
    if (hashes_.empty()) PrepareFloor();
    const Hash_Table* table = FWContext(static_cast<SLCGenericFilter*>(priv_))->ruleHash;
    const uint32_t mask = table->numBuckets - 1;
    const uint32_t* h = hashes_.data() + floorNext_;
    const ListLinks* heads[kListLen];
    for (size_t k = 0; k < kListLen; k++) {
      heads[k] = &table->buckets[h[k] & mask];
      __builtin_prefetch(heads[k]);
    }
    const ListLinks* oldest[kListLen];
    for (size_t k = 0; k < kListLen; k++) {
      oldest[k] = heads[k]->prev;
      __builtin_prefetch(oldest[k]);
    }
    uint32_t found = 0;
    for (size_t k = 0; k < kListLen; k++) {
      found += FWEntryFromLink(const_cast<ListLinks*>(oldest[k]))->hash == h[k] ? 1 : 0;
    }
    benchmark::DoNotOptimize(found);
    floorNext_ += kListLen;
    if (floorNext_ == hashes_.size()) floorNext_ = 0;
  }

 private:
  // Each frame's tuple hash, in walk order. Every frame hits, so its
  // bucket is never empty.
  void PrepareFloor() {
    const Hash_Table* table = FWContext(static_cast<SLCGenericFilter*>(priv_))->ruleHash;
    for (auto& list : lists_) {
      for (ZelPkt* pkt : list->Packets()) {
        FWPktSummary summary;
        FWRuleTuple tuple;
        FWParsePacket(pkt, 0, &summary);
        const uint32_t h = static_cast<uint32_t>(FWPacketTuple(&summary, &tuple));
        const ListLinks* head = &table->buckets[h & (table->numBuckets - 1)];
        if (head->prev == head) {
          std::fprintf(stderr, "floor: a frame's bucket is empty\n");
          std::abort();
        }
        hashes_.push_back(h);
      }
    }
  }
  static bool CountHits(void* elem, void* arg) {
    *static_cast<uint64_t*>(arg) += static_cast<FWRuleEntry*>(elem)->rule.pktCount;
    return true;
  }
  uint32_t n_;
  host::FilterId id_ = 0;
  void* priv_ = nullptr;
  std::vector<std::unique_ptr<host::PacketList>> lists_;
  size_t next_ = 0;
  std::vector<uint32_t> hashes_;
  size_t floorNext_ = 0;
};

std::unique_ptr<ExactBench> exactBench;
void DropExactBench() { exactBench.reset(); }

// The exact-rule bench of `n` rules, made when another is current.
ExactBench& UseExact(uint32_t n) {
  current.reset();
  if (!exactBench || !exactBench->Is(n)) {
    exactBench.reset();
    exactBench = std::make_unique<ExactBench>(n);
  }
  return *exactBench;
}

// `run` of the exact bench of state.range(0) rules, timed.
void ExactTimed(benchmark::State& state, void (ExactBench::*run)()) {
  ExactBench& b = UseExact(static_cast<uint32_t>(state.range(0)));
  for (auto _ : state) (b.*run)();
  ReportPerPacket(state);
}

void BM_ExactHits(benchmark::State& state) { ExactTimed(state, &ExactBench::RunOne); }
void BM_ExactTableFloor(benchmark::State& state) { ExactTimed(state, &ExactBench::FloorOne); }

void ReportHold(benchmark::State& state, const HoldResult& r) {
  state.counters["stall_ms"] = r.stallMs;
  state.counters["hold_ms"] = r.holdMs;
  state.counters["apply_ms"] = r.applyMs;
}

void BM_ApplyHold(benchmark::State& state) {
  Bench& b = Use(static_cast<uint32_t>(state.range(0)), false);
  HoldResult r{};
  for (auto _ : state) r = b.Hold(state.range(1) != 0);
  ReportHold(state, r);
}
BENCHMARK(BM_ApplyHold)->Args({10000, 0})->Args({10000, 1})->Iterations(1)->UseRealTime();

void BM_ExactApplyHold(benchmark::State& state) {
  ExactBench& b = UseExact(static_cast<uint32_t>(state.range(0)));
  HoldResult r{};
  for (auto _ : state) r = b.Hold();
  ReportHold(state, r);
}
BENCHMARK(BM_ExactApplyHold)->Arg(100000)->Iterations(1)->UseRealTime();

void BM_AddHold(benchmark::State& state) {
  Bench& b = Use(static_cast<uint32_t>(state.range(0)), false);
  HoldResult r{};
  for (auto _ : state) r = b.AddHold(state.range(1) != 0);
  ReportHold(state, r);
}
BENCHMARK(BM_AddHold)->Args({10000, 0})->Args({10000, 1})->Iterations(1)->UseRealTime();

void BM_ExactAddHold(benchmark::State& state) {
  ExactBench& b = UseExact(static_cast<uint32_t>(state.range(0)));
  HoldResult r{};
  for (auto _ : state) r = b.AddHold(10000, state.range(1) != 0);
  ReportHold(state, r);
}
BENCHMARK(BM_ExactAddHold)->Args({100000, 0})->Args({100000, 1})->Iterations(1)->UseRealTime();

#ifdef SLC_HAVE_DPDK
// The peer classifier on the generator's rules: five fields (protocol as a
// bitmask, addresses as prefixes, ports as ranges), higher priority for
// earlier rules, packets as the generator's network-order keys.
RTE_ACL_RULE_DEF(PeerRule, 5);

class Peer {
 public:
  explicit Peer(uint32_t n) : n_(n) {
    const std::vector<Rule4> rules = gen_rules(static_cast<int>(n), 0x5eed0000ull + n);
    const std::vector<Key> keys = gen_packets(rules, kPackets, 0xfeed0000ull + n);
    char name[RTE_ACL_NAMESIZE];
    std::snprintf(name, sizeof(name), "cb%u", n);
    rte_acl_param param{};
    param.name = name;
    param.socket_id = SOCKET_ID_ANY;
    param.rule_size = RTE_ACL_RULE_SZ(5);
    param.max_rule_num = n;
    ctx_ = rte_acl_create(&param);
    if (ctx_ == nullptr) Die("rte_acl_create");
    std::vector<PeerRule> acl(n);
    for (uint32_t i = 0; i < n; i++) {
      const Rule4& x = rules[i];
      PeerRule& r = acl[i];
      std::memset(&r, 0, sizeof(r));
      r.data.category_mask = 1;
      r.data.priority = RTE_ACL_MAX_PRIORITY - static_cast<int32_t>(i);
      r.data.userdata = i + 1;
      r.field[0].value.u8 = x.proto;
      r.field[0].mask_range.u8 = x.proto_mask;
      r.field[1].value.u32 = x.src_lo;
      r.field[1].mask_range.u32 = x.src_len;
      r.field[2].value.u32 = x.dst_lo;
      r.field[2].mask_range.u32 = x.dst_len;
      r.field[3].value.u16 = x.sp_lo;
      r.field[3].mask_range.u16 = x.sp_hi;
      r.field[4].value.u16 = x.dp_lo;
      r.field[4].mask_range.u16 = x.dp_hi;
    }
    if (rte_acl_add_rules(ctx_, reinterpret_cast<const rte_acl_rule*>(acl.data()), n) != 0) {
      Die("rte_acl_add_rules");
    }
    rte_acl_config cfg{};
    cfg.num_categories = 1;
    cfg.num_fields = 5;
    const rte_acl_field_def defs[5] = {
        {RTE_ACL_FIELD_TYPE_BITMASK, 1, 0, 0, offsetof(NKey, proto)},
        {RTE_ACL_FIELD_TYPE_MASK, 4, 1, 1, offsetof(NKey, src)},
        {RTE_ACL_FIELD_TYPE_MASK, 4, 2, 2, offsetof(NKey, dst)},
        {RTE_ACL_FIELD_TYPE_RANGE, 2, 3, 3, offsetof(NKey, sport)},
        {RTE_ACL_FIELD_TYPE_RANGE, 2, 4, 3, offsetof(NKey, dport)},
    };
    std::memcpy(cfg.defs, defs, sizeof(defs));
    const double t0 = now_ns();
    if (rte_acl_build(ctx_, &cfg) != 0) Die("rte_acl_build");
    buildMs_ = (now_ns() - t0) / 1e6;

    keys_.resize(kPackets);
    data_.resize(kPackets);
    want_.resize(kPackets);
    for (size_t p = 0; p < kPackets; p++) {
      NKey& k = keys_[p];
      std::memset(&k, 0, sizeof(k));
      k.proto = keys[p].proto;
      k.src = __builtin_bswap32(keys[p].src);
      k.dst = __builtin_bswap32(keys[p].dst);
      k.sport = __builtin_bswap16(keys[p].sport);
      k.dport = __builtin_bswap16(keys[p].dport);
      data_[p] = reinterpret_cast<const uint8_t*>(&k);
      want_[p] = static_cast<uint32_t>(scan_naive(rules.data(), static_cast<int>(n), keys[p]) + 1);
    }
  }
  ~Peer() { rte_acl_free(ctx_); }

  bool Is(uint32_t n) const { return n_ == n; }

  // Every packet classified by `method` gets the ordered scan's rule.
  bool Use(enum rte_acl_classify_alg method) {
    if (rte_acl_set_ctx_classify(ctx_, method) != 0) return false;
    std::vector<uint32_t> got(kPackets);
    if (rte_acl_classify(ctx_, data_.data(), got.data(), kPackets, 1) != 0) Die("classify");
    for (size_t p = 0; p < kPackets; p++) {
      if (got[p] != want_[p]) {
        std::fprintf(stderr, "peer: packet %zu got rule %u, the ordered scan %u\n", p, got[p],
                     want_[p]);
        std::abort();
      }
    }
    return true;
  }

  void RunOne() {
    rte_acl_classify(ctx_, data_.data() + next_, results_, kListLen, 1);
    benchmark::DoNotOptimize(results_[0]);
    next_ += kListLen;
    if (next_ == kPackets) next_ = 0;
  }

  double buildMs_ = 0;

 private:
  [[noreturn]] static void Die(const char* what) {
    std::fprintf(stderr, "peer classifier: %s failed\n", what);
    std::abort();
  }

  uint32_t n_;
  rte_acl_ctx* ctx_ = nullptr;
  std::vector<NKey> keys_;
  std::vector<const uint8_t*> data_;
  std::vector<uint32_t> want_;
  uint32_t results_[kListLen];
  size_t next_ = 0;
};

std::unique_ptr<Peer> peer;

void PeerTimed(benchmark::State& state, enum rte_acl_classify_alg method) {
  const uint32_t n = static_cast<uint32_t>(state.range(0));
  if (!peer || !peer->Is(n)) {
    peer.reset();
    peer = std::make_unique<Peer>(n);
  }
  if (!peer->Use(method)) {
    state.SkipWithError("method not available");
    return;
  }
  for (auto _ : state) peer->RunOne();
  ReportPerPacket(state);
  state.counters["build_ms"] = peer->buildMs_;
}

void BM_PeerAclScalar(benchmark::State& state) { PeerTimed(state, RTE_ACL_CLASSIFY_SCALAR); }
void BM_PeerAclBest(benchmark::State& state) { PeerTimed(state, RTE_ACL_CLASSIFY_DEFAULT); }


// The peer hash table on the same flows: 16-byte keys (the generator's
// Key), the rule number as data, bulk lookups of 64.
void BM_PeerHashBulk(benchmark::State& state) {
  const uint32_t n = static_cast<uint32_t>(state.range(0));
  char name[32];
  std::snprintf(name, sizeof(name), "exact%u", n);
  rte_hash_parameters params{};
  params.name = name;
  params.entries = n < 1024 ? 1024 : n;
  params.key_len = sizeof(Key);
  params.hash_func = rte_hash_crc;
  params.socket_id = SOCKET_ID_ANY;
  rte_hash* h = rte_hash_create(&params);
  if (h == nullptr) {
    state.SkipWithError("rte_hash_create failed");
    return;
  }
  for (uint32_t i = 0; i < n; i++) {
    const Key k = FlowKey(i);
    if (rte_hash_add_key_data(h, &k, reinterpret_cast<void*>(uintptr_t{i} + 1)) != 0) {
      state.SkipWithError("rte_hash_add_key_data failed");
      rte_hash_free(h);
      return;
    }
  }
  std::vector<Key> keys(kExactFrames);
  std::vector<const void*> ptrs(kExactFrames);
  for (size_t f = 0; f < kExactFrames; f++) {
    keys[f] = FlowKey(FlowOfFrame(f, n));
    ptrs[f] = &keys[f];
  }
  void* data[kListLen];
  uint64_t hits = 0;
  // One checked pass.
  for (size_t f = 0; f < kExactFrames; f += kListLen) {
    if (rte_hash_lookup_bulk_data(h, ptrs.data() + f, kListLen, &hits, data) != kListLen) {
      state.SkipWithError("a peer lookup missed");
      rte_hash_free(h);
      return;
    }
    for (size_t k = 0; k < kListLen; k++) {
      if (reinterpret_cast<uintptr_t>(data[k]) != FlowOfFrame(f + k, n) + 1u) {
        std::fprintf(stderr, "peer hash: frame %zu found the wrong rule\n", f + k);
        std::abort();
      }
    }
  }
  size_t next = 0;
  for (auto _ : state) {
    rte_hash_lookup_bulk_data(h, ptrs.data() + next, kListLen, &hits, data);
    benchmark::DoNotOptimize(data[0]);
    next += kListLen;
    if (next == kExactFrames) next = 0;
  }
  ReportPerPacket(state);
  rte_hash_free(h);
}

bool InitPeer(const char* argv0) {
  const char* args[] = {argv0, "--no-huge", "--no-pci", "--no-shconf", "-m", "1024", "-l", "0",
                        "--log-level=3"};
  int argc = static_cast<int>(sizeof(args) / sizeof(args[0]));
  if (rte_eal_init(argc, const_cast<char**>(args)) < 0) {
    std::fprintf(stderr, "peer classifier skipped: its environment did not initialise\n");
    return false;
  }
  return true;
}
#endif

}  // namespace

int main(int argc, char** argv) {
  // --peer_max_rules=N (ours, taken out before the library reads the rest):
  // the largest general ruleset the peer classifier is built for. Its build
  // of 100,000 rules takes about 15 s and 3 GB.
  int peerMaxRules = 100000;
  int kept = 1;
  for (int i = 1; i < argc; i++) {
    if (std::strncmp(argv[i], "--peer_max_rules=", 17) == 0) {
      peerMaxRules = std::atoi(argv[i] + 17);
    } else {
      argv[kept++] = argv[i];
    }
  }
  argc = kept;
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  bool peerReady = false;
#ifdef SLC_HAVE_DPDK
  peerReady = InitPeer(argv[0]);
#endif
  // Size by size: the project's run, then the peer's runs on the same work.
  for (int n : {100, 1000, 10000, 100000}) {
    benchmark::RegisterBenchmark("BM_ClassBench", BM_ClassBench)->Arg(n);
#ifdef SLC_HAVE_DPDK
    if (peerReady && n <= peerMaxRules) {
      benchmark::RegisterBenchmark("BM_PeerAclScalar", BM_PeerAclScalar)->Arg(n);
      benchmark::RegisterBenchmark("BM_PeerAclBest", BM_PeerAclBest)->Arg(n);
    }
#endif
  }
  for (int n : {10000, 1000000}) {
    benchmark::RegisterBenchmark("BM_ExactHits", BM_ExactHits)->Arg(n);
#ifdef SLC_HAVE_DPDK
    if (peerReady) benchmark::RegisterBenchmark("BM_PeerHashBulk", BM_PeerHashBulk)->Arg(n);
#endif
    benchmark::RegisterBenchmark("BM_ExactTableFloor", BM_ExactTableFloor)->Arg(n);
  }
  (void)peerReady;
  (void)peerMaxRules;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  current.reset();
  exactBench.reset();
#ifdef SLC_HAVE_DPDK
  peer.reset();
#endif
  return 0;
}
