// A fixture with the module loaded and one firewall filter, plus helpers to
// apply, read back and inspect its rules and to look packets up the way the
// packet path does.
#pragma once

#include <cstring>
#include <map>
#include <vector>

#include "firewall/firewall.h"
#include "module/locks.h"
#include "tests/support/fw_model.h"
#include "tests/support/module_fixture.h"

namespace testsupport {

class FirewallTest : public ModuleTest {
 protected:
  void SetUp() override;
  void TearDown() override;

  // FWApplyRuleset under the write lock, as the receivers call it.
  ZelStatus Apply(const std::vector<uint8_t>& ruleset, bool replace = true,
                  bool fromIoctl = true);
  // FWPopulateRuleset under the read lock; the buffer has 281 bytes per rule.
  std::vector<uint8_t> Populate();
  // FWClearRules under the write lock.
  void Clear();
  // Removes the rules of `ruleset` one by one through the ioctl channel
  // (replies dropped).
  void RemoveByIoctl(const std::vector<uint8_t>& ruleset);

  // Installed entries: the exact ones in table order (bucket by bucket,
  // oldest first), the general ones in ruleset order.
  std::vector<FWRuleEntry*> ExactEntries();
  std::vector<FWRuleEntry*> GeneralEntries();
  // The exact entry holding `rule`'s tuple, or null.
  FWRuleEntry* FindExact(const FWRule& rule);

  // The packet path's two-stage lookup under the read lock: the exact probe
  // for packets with ports, then the general scan. `poolTag` is the host
  // packet's resource-pool tag.
  FWRuleEntry* Lookup(const ModelPacket& pkt, uint32_t direction, uint16_t poolTag = 0);

  // Everything an application must leave untouched when it fails: context
  // fields, the ruleset read back (counters included), each entry's tag and
  // socket, heap blocks, outstanding pool tags and open sockets.
  struct Fingerprint {
    Hash_Table* ruleHash;
    uint32_t fragOverride, version, fwFeatures, numRules, ioctl;
    std::vector<uint8_t> populated;
    std::vector<std::vector<uint64_t>> entryOwnership;
    uint64_t heapBlocks;
    int64_t poolTags;
    uint64_t sockets;
    bool operator==(const Fingerprint&) const = default;
  };
  Fingerprint Capture();

  host::FilterId id_ = 0;
  SLCGenericFilter* filter_ = nullptr;
  FWFilterContext* ctx_ = nullptr;

 private:
  ZelPkt* PacketWithTag(uint16_t tag);
  std::map<uint16_t, ZelPkt*> tagPackets_;
};

// 281-byte record comparison (gtest prints the text form on failure).
bool SameRecord(const FWRule& a, const FWRule& b);

}  // namespace testsupport
