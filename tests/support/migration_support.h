// Helpers for the migration and whole-module tests: exact rules in the
// ruleset builder's text, a ruleset with every action and frames that meet
// each, saved-state buffers and their header fields, and a fixture for the
// module-side steps a test repeats (filters, slow paths, request policies).
#pragma once

#include <cstdlib>
#include <cstring>

#include "firewall/firewall.h"
#include "migration/migration.h"
#include "module/locks.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/frames.h"
#include "tools/lib/ruleset_builder.h"

namespace migsupport {

using Bytes = std::vector<uint8_t>;

inline constexpr const char* kVmMac = "02:00:00:00:00:01";
inline constexpr const char* kGwMac = "02:00:00:00:00:02";

// An exact IPv4 rule for traffic leaving the VM (kVmMac to kGwMac, untagged).
inline std::string ExactRule(const char* action, const char* proto, const char* sa, int sport,
                             const char* da, int dport) {
  return std::string("action=") + action + " dir=to ipv4 dmac=" + kGwMac + " smac=" + kVmMac +
         " ethtype=0x0800 vlan=none proto=" + proto + " sa=" + sa + " da=" + da +
         " sport=" + std::to_string(sport) + " dport=" + std::to_string(dport);
}

// One exact and one general rule: 15 + 2 * 281 = 577 bytes in version 8.
inline Bytes SampleRules(uint8_t version = 8) {
  return rules::RulesetBuilder(version)
      .Add(ExactRule("drop", "tcp", "10.0.0.1", 1000, "10.0.0.2", 80))
      .Add("action=punt ipv4 ethtype=0x0800 proto=udp da=10.9.0.0-10.9.0.255")
      .Bytes();
}

// Every action, exact and general rules; version 8 adds the QoS marks and
// a resource-pool tag match (tag 7).
inline Bytes EveryAction(uint8_t version = 8) {
  rules::RulesetBuilder b(version);
  b.Add("action=accept dir=both ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1000 dport=80 bidir");
  b.Add("action=drop dir=to ipv4 proto=udp sa=10.0.0.2 da=10.0.0.3 sport=53 dport=5353");
  b.Add("action=copy ipv4 proto=udp dport=53");
  b.Add("action=punt ipv6 proto=tcp dport=22");
  b.Add("action=l2rewrite rewrite=02:00:00:00:00:99 ipv4 proto=tcp dport=8080");
  b.Add("action=gre gre=198.51.100.7 snaplen=64 ipv4 proto=tcp dport=443");
  b.Add("action=pooltag pool=gold ipv4 proto=udp dport=4789");
  b.Add("action=log ipv4 proto=tcp dport=25");
  if (version == 8) {
    b.Add("action=accept rptag=7 ipv4 proto=tcp dport=9");
    // An exact rule comparing the tag reads it on the exact lookup.
    b.Add("action=accept rptag=7 exact dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 vlan=none "
          "ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1000 dport=7");
    b.Add("action=dot1p dot1p=2 ipv4 proto=udp dport=7777");
    b.Add("action=dscp+dot1p dscp=46 dot1p=5 ipv4 sa=10.0.0.0-10.0.0.255");
  }
  b.Add("action=drop ethtype=0x0806");
  return b.Bytes();
}
// One frame for each rule of EveryAction() that a frame can meet.
inline std::vector<Bytes> FramesForEveryAction() {
  using frames::FrameBuilder, frames::Ip4, frames::Ip6, frames::Mac;
  const auto a = Mac(kVmMac), b = Mac(kGwMac);
  std::vector<Bytes> out;
  for (uint16_t dport : {80, 443, 8080, 25, 9, 7}) {
    out.push_back(FrameBuilder().Eth(b, a).Ipv4(Ip4("10.0.0.1"), Ip4("10.0.0.2")).Tcp(1000, dport)
                      .Payload(20).Build());
  }
  for (uint16_t dport : {53, 5353, 4789, 7777}) {
    out.push_back(FrameBuilder().Eth(b, a).Ipv4(Ip4("10.0.0.2"), Ip4("10.0.0.3")).Udp(53, dport)
                      .Build());
  }
  out.push_back(FrameBuilder().Eth(b, a).Ipv6(Ip6("2001:db8::1"), Ip6("2001:db8::2")).Tcp(5, 22)
                    .Build());
  return out;
}
inline Bytes Pattern(size_t n, uint8_t first = 1) {
  Bytes b(n);
  for (size_t i = 0; i < n; i++) b[i] = static_cast<uint8_t>(first + i * 7);
  return b;
}

// Header field offsets in the saved-state buffer.
inline constexpr size_t kVersionAt = 8, kFastOffsetAt = 16, kFastLengthAt = 24, kSlowOffsetAt = 32,
                        kSlowLengthAt = 40;

inline void PutU64(Bytes* b, size_t at, uint64_t v) { std::memcpy(b->data() + at, &v, sizeof(v)); }

// A well-formed saved state: header, `fast`, then `slow`, no gaps.
inline Bytes SavedState(const Bytes& fast, const Bytes& slow = {}) {
  Bytes out(kSLCGenericSaveMagic, kSLCGenericSaveMagic + 8);
  out.resize(sizeof(SLCGenericStateHeader));
  const uint64_t fields[] = {kSLCGenericStateVersion, 48, fast.size(), 48 + fast.size(),
                             slow.size()};
  for (size_t i = 0; i < std::size(fields); i++) PutU64(&out, kVersionAt + 8 * i, fields[i]);
  out.insert(out.end(), fast.begin(), fast.end());
  out.insert(out.end(), slow.begin(), slow.end());
  return out;
}

// Installs `ruleset` as a property write (or an ioctl push) would, holding
// configLock. The module reads the header through a pointer to FWRuleset:
// the private copy lets a read past the records show up under ASan.
inline ZelStatus Install(SLCGenericFilter* filter, Bytes ruleset, uint32_t replace = 1,
                         uint32_t fromIoctl = 0) {
  SLCGenericWriteGuard config(FWContext(filter)->configLock);
  return FWApplyRuleset(filter, reinterpret_cast<FWRuleset*>(ruleset.data()), replace, fromIoctl);
}

// The filter's ruleset as FWPopulateRuleset writes it, records of its version's size.
inline Bytes Rules(SLCGenericFilter* filter) {
  FWFilterContext* ctx = FWContext(filter);
  SLCGenericReadGuard config(ctx->configLock);
  Bytes out(FW_RULESET_HEADER_SIZE + size_t{FW_RULE_SIZE_V8} * ctx->numRules);
  FWPopulateRuleset(ctx, reinterpret_cast<FWRuleset*>(out.data()));
  const size_t size = ctx->version == FW_RULESET_VERSION_7 ? FW_RULE_SIZE_V7 : FW_RULE_SIZE_V8;
  out.resize(FW_RULESET_HEADER_SIZE + size * ctx->numRules);
  return out;
}

// Length request, then a save into a buffer of exactly that size; empty on failure.
inline Bytes Save(SLCGenericFilter* filter) {
  uint64_t len = 0;
  if (SLCGenericGetSavedStateLen(filter, &len) != ZEL_OK) return {};
  Bytes out(len, 0xA5);
  if (SLCGenericSaveState(filter, out.data(), &len) != ZEL_OK) return {};
  out.resize(len);
  return out;
}

// A filter's reference count and migration state, read under its lock.
struct RefsAndState {
  uint32_t refs, state;
  bool operator==(const RefsAndState&) const = default;
};
inline RefsAndState Of(SLCGenericFilter* filter) {
  SLCGenericSpinGuard guard(filter->lock);
  return {filter->refCount, filter->migrationState};
}
// Nothing in flight: the framework's reference only.
inline constexpr RefsAndState kIdle{1, SLCGenericStateIdle};

inline uint64_t EnvOr(const char* name, uint64_t fallback) {
  const char* v = std::getenv(name);
  return v != nullptr ? std::strtoull(v, nullptr, 0) : fallback;
}

class MigrationTest : public testsupport::ModuleTest {
 protected:
  host::FilterId NewFilter(const std::string& name, uint32_t failurePolicy = 0) {
    host::FilterConfig config;
    config.name = name;
    config.failurePolicy = failurePolicy;
    return CreateFilter(testsupport::kDefaultAgent, config);
  }
  // Registers a slow path and runs the attach timer.
  void AttachSlowPath(uint32_t slowPathId) {
    ASSERT_EQ(host::Sluice::RegisterSlowPath(testsupport::kDefaultAgent, slowPathId), ZEL_OK);
    host::Timers::RunDue();
  }
  static void SetPolicy(host::RequestKind kind, host::ReplyMode mode, Bytes data = {},
                        ZelStatus replyStatus = ZEL_OK, ZelStatus refuse = ZEL_OK) {
    host::Sluice::SetPolicy(kind, {refuse, mode, replyStatus, std::move(data)});
  }
};

}  // namespace migsupport
