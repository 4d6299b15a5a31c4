// A reference model of the firewall's installed rules and of rule lookup,
// written from the rule semantics with plain containers and value
// comparisons (no tuples, no hashing, no word tricks), for comparison with
// the module in randomized tests.
//
// The model installs rulesets as the module does when nothing fails:
// replace or add; version-7 records widened with the rpTag wildcard; exact
// rules merged by their match fields (a repeat widens the direction and
// copies a non-zero bidirectional value, nothing else); an exact rule with
// bidirectional 1 also installs its mirror; general rules appended in
// ruleset order.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "firewall/firewall.h"

namespace testsupport {

// A packet's fields by value, and a summary pointing into it.
struct ModelPacket {
  uint32_t presence = FW_PKT_RPTAG;
  uint8_t dMac[6] = {};
  uint8_t sMac[6] = {};
  uint8_t ethType[2] = {};
  uint8_t vlan1QTag[4] = {};
  uint8_t ipSa[16] = {};
  uint8_t ipDa[16] = {};
  uint8_t ipProto = 0;
  uint8_t sPort[2] = {};
  uint8_t dPort[2] = {};

  // Valid while this object lives and does not move.
  FWPktSummary Summary() const;
  // The packet's exact-match tuple and hash (31 or 55 hashed bytes), as
  // the packet path builds them for TCP and UDP packets.
  uint64_t Tuple(FWRuleTuple* tuple) const;
};

class FwModel {
 public:
  // Applies a complete wire ruleset; a version other than 7 or 8 changes
  // nothing.
  void Apply(std::span<const uint8_t> ruleset, bool replace);
  void Clear();

  // The installed rule that governs the packet: the exact rule for a packet
  // with ports when it accepts the packet's direction and pool tag, else
  // the first general rule in ruleset order that matches; none otherwise.
  std::optional<FWRule> Match(const FWPktSummary& pkt, uint32_t direction,
                              uint16_t poolTag) const;

  const std::vector<FWRule>& Exact() const { return exact_; }      // installation order
  const std::vector<FWRule>& General() const { return general_; }  // ruleset order
  size_t NumRules() const { return exact_.size() + general_.size(); }

  // Whether two rules are the same exact-match key.
  static bool SameKey(const FWRule& a, const FWRule& b);
  static bool GeneralMatches(const FWRule& rule, const FWPktSummary& pkt, uint32_t direction,
                             uint16_t poolTag);

 private:
  void InsertExact(const FWRule& rule);

  std::vector<FWRule> exact_;
  std::vector<FWRule> general_;
};

}  // namespace testsupport
