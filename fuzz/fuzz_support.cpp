#include "fuzz/fuzz_support.h"

#include <cstdio>
#include <cstdlib>

#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "module/module.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace fuzz {

namespace {

bool loaded = false;
uint64_t baselineBlocks = 0;

}  // namespace

void EnsureModule() {
  if (loaded) return;
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  // A hostile count may make the module allocate up to its heap's maximum
  // (by default 1 GB), zeroed, for one request: the bound holds either way,
  // and a smaller one keeps every input fast.
  if (host::Loader::Load(&slcGenericModuleImage, {{"SLCGENERIC_HEAP_MAX_SIZE", 64 << 20}}) != 0) {
    std::fprintf(stderr, "fuzz: module did not start\n");
    std::abort();
  }
  host::ResPools::Define("gold", 7);
  loaded = true;
}

host::FilterId NewFilter(uint32_t failurePolicy) {
  EnsureModule();
  baselineBlocks = host::Heaps::Stats(slcGenericHeapID).blocks;
  host::FilterConfig config;
  config.name = "fuzz0";
  config.vmUUID = "fuzz-vm";
  config.failurePolicy = failurePolicy;
  host::FilterId id = 0;
  if (host::Sluice::CreateFilter(kAgent, config, &id) != ZEL_OK) {
    std::fprintf(stderr, "fuzz: filter not created\n");
    std::abort();
  }
  return id;
}

void Finish(host::FilterId id) {
  for (auto* take : {&host::Sluice::TakeFaulted, &host::Sluice::TakeIssued}) {
    for (host::Delivery& d : take(id)) {
      for (ZelPkt* p : d.packets) zel_PktRelease(p);
    }
  }
  host::Sluice::TakeIoctlReplies(id);
  while (host::Sluice::PendingReplies(host::RequestKind::RestoreState) > 0) {
    host::Sluice::ReleaseReplies(host::RequestKind::RestoreState);
  }
  if (host::Sluice::DestroyFilter(id) != ZEL_OK) {
    std::fprintf(stderr, "fuzz: filter could not be destroyed\n");
    std::abort();
  }
  // What the host records for tests to inspect (requests with their
  // payloads, datagrams sent, log lines) is history, not state: kept across
  // inputs it would grow the process by every input's size.
  host::Sluice::ClearRequests();
  host::Sockets::ClearSent();
  host::Log::Clear();
  uint64_t blocks = host::Heaps::Stats(slcGenericHeapID).blocks;
  if (blocks != baselineBlocks || host::Packets::Live() != 0) {
    std::fprintf(stderr, "fuzz: input leaked %llu heap blocks, %llu packets\n",
                 static_cast<unsigned long long>(blocks - baselineBlocks),
                 static_cast<unsigned long long>(host::Packets::Live()));
    std::abort();
  }
}

std::vector<uint8_t> SampleRuleset(uint8_t version) {
  rules::RulesetBuilder b(version);
  b.FragOverride(SLCGenericActionNone);
  b.Add("action=accept dir=both ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1000 dport=80 bidir");
  b.Add("action=drop dir=to ipv4 proto=udp sa=10.0.0.2 da=10.0.0.3 sport=53 dport=5353");
  b.Add("action=copy ipv4 proto=udp dport=53");
  b.Add("action=punt ipv6 proto=tcp dport=22");
  b.Add("action=l2rewrite rewrite=02:00:00:00:00:99 ipv4 proto=tcp dport=8080");
  b.Add("action=gre gre=198.51.100.7 snaplen=64 ipv4 proto=tcp dport=443");
  b.Add("action=pooltag pool=gold ipv4 proto=udp dport=4789");
  if (version == 8) {  // marks carry version-8 fields
    b.Add("action=dscp+dot1p dscp=46 dot1p=5 ipv4 sa=10.0.0.0-10.0.0.255");
    b.Add("action=dscp dscp=10 ipv6 da=2001:db8::-2001:db8::ff");
  }
  b.Add("action=drop ethtype=0x0806");
  return b.Bytes();
}

std::vector<std::vector<uint8_t>> SampleFrames() {
  using frames::FrameBuilder;
  using frames::Ip4;
  using frames::Ip6;
  using frames::Mac;
  const auto a = Mac("02:00:00:00:00:01");
  const auto b = Mac("02:00:00:00:00:02");
  return {
      FrameBuilder().Eth(b, a).Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.2")).Tcp(1000, 80).Build(),
      FrameBuilder().Eth(b, a).Vlan(5, 3).Ipv4(Ip4("10.0.0.7"), Ip4("10.0.0.9")).Udp(1, 53)
          .Build(),
      FrameBuilder().Eth(b, a).Ipv6(Ip6("2001:db8::1"), Ip6("2001:db8::2")).HopByHop()
          .Fragment6(0, false).Tcp(5, 22).Build(),
      FrameBuilder().Eth(b, a).Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.5")).Tcp(9, 443).Payload(100)
          .Build(),
      FrameBuilder().Eth(b, a).Llc().Ipv4(Ip4("10.0.0.8"), Ip4("10.0.0.5")).Fragment(0, true)
          .Udp(9, 4789).Build(),
  };
}

}  // namespace fuzz
