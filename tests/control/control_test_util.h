// Helpers shared by the control-channel and ioctl tests: wire messages of
// the filter ioctl protocol, little-endian field access and rule shorthands.
#pragma once

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "firewall/fw_ioctl.h"
#include "host/core/host_core.h"
#include "host/sluice/framework.h"
#include "tools/lib/ruleset_builder.h"

namespace controltest {

using Bytes = std::vector<uint8_t>;

inline void PutU32(Bytes* b, size_t off, uint32_t v) {
  if (b->size() < off + 4) b->resize(off + 4);
  std::memcpy(b->data() + off, &v, 4);
}

inline uint32_t GetU32(const Bytes& b, size_t off) {
  uint32_t v = 0;
  EXPECT_GE(b.size(), off + 4);
  if (b.size() >= off + 4) std::memcpy(&v, b.data() + off, 4);
  return v;
}

inline uint64_t GetU64(const Bytes& b, size_t off) {
  uint64_t v = 0;
  if (b.size() >= off + 8) std::memcpy(&v, b.data() + off, 8);
  return v;
}

// type, then a u32 (replace or method), then the ruleset bytes.
inline Bytes Msg(uint32_t type, uint32_t word, const Bytes& ruleset) {
  // Sized once: growing a vector trips GCC's bounds warnings at -O2.
  Bytes m(8 + ruleset.size());
  std::memcpy(m.data(), &type, 4);
  std::memcpy(m.data() + 4, &word, 4);
  if (!ruleset.empty()) std::memcpy(m.data() + 8, ruleset.data(), ruleset.size());
  return m;
}

inline Bytes Push(const Bytes& ruleset, uint32_t replace = 1) {
  return Msg(FWIoctlMsgRuleset, replace, ruleset);
}

inline Bytes Clear(uint32_t method, const Bytes& ruleset = {}) {
  return Msg(FWIoctlMsgClear, method, ruleset);
}

inline Bytes GetState() {
  Bytes m;
  PutU32(&m, 0, FWIoctlMsgGetState);
  return m;
}

inline Bytes Ruleset(const std::vector<std::string>& lines, uint8_t version = 8) {
  rules::RulesetBuilder b(version);
  for (const std::string& l : lines) b.Add(l);
  return b.Bytes();
}

inline Bytes Ruleset(const std::vector<FWRule>& rules, uint8_t version = 8) {
  rules::RulesetBuilder b(version);
  for (const FWRule& r : rules) b.Add(r);
  return b.Bytes();
}

// Sends a message on the filter ioctl channel and returns the replies.
inline std::vector<host::IoctlReplyRecord> Ioctl(host::FilterId id, const Bytes& msg,
                                                 uint32_t code = 7) {
  host::Sluice::SendIoctl(id, code, msg);
  return host::Sluice::TakeIoctlReplies(id);
}

// The status of the one status reply the message drew (-1 when the
// replies are not exactly one status message).
inline int64_t IoctlStatus(host::FilterId id, const Bytes& msg, uint32_t code = 7) {
  auto replies = Ioctl(id, msg, code);
  if (replies.size() != 1) return -1;
  const Bytes& m = replies[0].message;
  if (replies[0].requestCode != code || m.size() != 8 || GetU32(m, 0) != FWIoctlMsgStatus) {
    return -1;
  }
  return GetU32(m, 4);
}

inline const char* kExactTcp =
    "action=drop dir=to ipv4 proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1234 dport=80";
inline const char* kExactUdp =
    "action=accept dir=from ipv4 proto=udp sa=10.0.0.3 da=10.0.0.4 sport=53 dport=5353";
inline const char* kGeneralDrop = "action=drop dir=both ipv4 proto=tcp dport=22";
inline const char* kGeneralPunt = "action=punt dir=both ipv4 da=192.168.0.0-192.168.0.255";

}  // namespace controltest
