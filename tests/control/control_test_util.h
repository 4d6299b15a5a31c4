// Helpers shared by the control-channel and ioctl tests: wire messages of
// the filter ioctl protocol and character device requests, little-endian
// field access, and a fixture with one filter "vnic0" on the default agent.
#pragma once

#include <cstring>

#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "tests/support/module_fixture.h"
#include "tools/lib/ruleset_builder.h"

namespace controltest {

using Bytes = std::vector<uint8_t>;
inline const std::string kAgent = testsupport::kDefaultAgent;
inline const std::string kProp = kAgent + ".ruleset";
inline const std::string kRuleA = "action=drop dir=both ipv4 proto=tcp dport=22";
inline const std::string kRuleB = "action=punt dir=to ipv4 proto=udp sa=10.0.0.1-10.0.0.9";
// Every field of flow F but its destination port: with one, an exact rule.
inline const std::string kFlowF = " dmac=02:00:00:00:00:02 smac=02:00:00:00:00:01 ethtype=0x0800 "
                                  "vlan=none proto=tcp sa=10.0.0.1 da=10.0.0.2 sport=1234";

inline void PutU32(Bytes* b, size_t off, uint32_t v) { std::memcpy(b->data() + off, &v, 4); }

// A little-endian field; 0 when the bytes do not reach it.
template <typename T = uint32_t>
T Get(const Bytes& b, size_t off) {
  T v{};
  if (b.size() >= off + sizeof(T)) std::memcpy(&v, b.data() + off, sizeof(T));
  return v;
}

// type, then a u32 (replace or method), then the ruleset bytes. Sized once:
// growing a vector trips GCC's bounds warnings at -O2.
inline Bytes Msg(uint32_t type, uint32_t word, const Bytes& ruleset = {}) {
  Bytes m(8 + ruleset.size());
  std::memcpy(m.data(), &type, 4);
  std::memcpy(m.data() + 4, &word, 4);
  std::copy(ruleset.begin(), ruleset.end(), m.begin() + 8);
  return m;
}
inline Bytes Push(const Bytes& ruleset) { return Msg(FWIoctlMsgRuleset, 1, ruleset); }
inline Bytes Clear(uint32_t how, const Bytes& rs = {}) { return Msg(FWIoctlMsgClear, how, rs); }
inline Bytes GetState() { return Bytes{FWIoctlMsgGetState, 0, 0, 0}; }

// A character device request as a tool lays it out, then `tail`. The
// strings (at most their field's size) are copied raw: one that fills its
// field has no NUL.
inline Bytes DevRequest(uint32_t type, const std::string& name, const Bytes& tail = {},
                        const std::string& uuid = "", uint32_t vnic = 0) {
  Bytes r(sizeof(FWCharDevRequest) + tail.size(), 0);
  PutU32(&r, 0, type);
  PutU32(&r, offsetof(FWCharDevRequest, vNicIndex), vnic);
  std::copy(name.begin(), name.end(), &r[offsetof(FWCharDevRequest, filterName)]);
  std::copy(uuid.begin(), uuid.end(), &r[offsetof(FWCharDevRequest, hqUUID)]);
  std::copy(tail.begin(), tail.end(), r.begin() + sizeof(FWCharDevRequest));
  return r;
}

// A wire ruleset from rule texts (a braced list) or a container of FWRules.
template <typename Rules = std::initializer_list<std::string>>
Bytes Ruleset(const Rules& rules, uint8_t version = 8) {
  rules::RulesetBuilder b(version);
  for (const auto& r : rules) b.Add(r);
  return b.Bytes();
}

// Sends a message on the filter ioctl channel and returns the replies.
inline auto Ioctl(host::FilterId id, const Bytes& msg, uint32_t code = 7) {
  return host::Sluice::SendIoctl(id, code, msg), host::Sluice::TakeIoctlReplies(id);
}

// The status of the one status reply the message drew, echoing its request
// code (-1 when the replies are anything else).
inline int64_t IoctlStatus(host::FilterId id, const Bytes& msg, uint32_t code = 7) {
  auto replies = Ioctl(id, msg, code);
  if (replies.size() != 1 || replies[0].requestCode != code) return -1;
  const Bytes& m = replies[0].message;
  return m.size() == 8 && Get(m, 0) == FWIoctlMsgStatus ? int64_t{Get(m, 4)} : -1;
}

class FilterTest : public testsupport::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    id_ = CreateFilter(kAgent, "vnic0");
    ASSERT_NE(ctx_ = Ctx(id_), nullptr);
  }
  ZelStatus PropWrite(const Bytes& data, host::FilterId id = 0) {
    return host::Sluice::PropertyWrite(kProp, id != 0 ? id : id_, data);
  }

  host::FilterId id_ = 0;
  FWFilterContext* ctx_ = nullptr;
};

}  // namespace controltest
