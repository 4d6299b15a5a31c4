#include "tests/support/fw_fixture.h"

#include "firewall/fw_ioctl.h"
#include "module/module.h"
#include "tests/support/migration_support.h"

namespace testsupport {

void FirewallTest::SetUp() {
  ModuleTest::SetUp();
  id_ = CreateFilter();
  filter_ = Filter(id_);
  ASSERT_NE(filter_, nullptr);
  ctx_ = Ctx(id_);
  ASSERT_NE(ctx_, nullptr);
}

void FirewallTest::TearDown() {
  for (auto& [tag, pkt] : tagPackets_) zel_PktRelease(pkt);
  tagPackets_.clear();
  ModuleTest::TearDown();
}

ZelStatus FirewallTest::Apply(const std::vector<uint8_t>& ruleset, bool replace, bool fromIoctl) {
  return migsupport::Install(filter_, ruleset, replace ? 1 : 0, fromIoctl ? 1 : 0);
}

std::vector<uint8_t> FirewallTest::Populate() { return migsupport::Rules(filter_); }

void FirewallTest::Clear() {
  SLCGenericWriteGuard guard(ctx_->configLock);
  FWClearRules(ctx_);
}

void FirewallTest::RemoveByIoctl(const std::vector<uint8_t>& ruleset) {
  std::vector<uint8_t> msg(8);
  const uint32_t head[2] = {FWIoctlMsgClear, FWClearMethodRemove};
  std::memcpy(msg.data(), head, sizeof(head));
  msg.insert(msg.end(), ruleset.begin(), ruleset.end());
  host::Sluice::SendIoctl(id_, 1, msg);
  (void)host::Sluice::TakeIoctlReplies(id_);
}

std::vector<FWRuleEntry*> FirewallTest::ExactEntries() {
  std::vector<FWRuleEntry*> out;
  Hash_Table* t = ctx_->ruleHash;
  if (t == nullptr) return out;
  for (uint32_t b = 0; b < t->numBuckets; b++) {
    ListLinks* head = &t->buckets[b];
    for (ListLinks* l = head->prev; l != head; l = l->prev) {
      out.push_back(reinterpret_cast<FWRuleEntry*>(l));
    }
  }
  return out;
}

std::vector<FWRuleEntry*> FirewallTest::GeneralEntries() {
  std::vector<FWRuleEntry*> out;
  for (ListLinks* l = ctx_->ruleList.prev; l != &ctx_->ruleList; l = l->prev) {
    out.push_back(reinterpret_cast<FWRuleEntry*>(l));
  }
  return out;
}

FWRuleEntry* FirewallTest::FindExact(const FWRule& rule) {
  for (FWRuleEntry* e : ExactEntries()) {
    if (FwModel::SameKey(e->rule, rule)) return e;
  }
  return nullptr;
}

ZelPkt* FirewallTest::PacketWithTag(uint16_t tag) {
  auto it = tagPackets_.find(tag);
  if (it != tagPackets_.end()) return it->second;
  host::PacketSpec layout;
  layout.frame.assign(64, 0);
  layout.resPoolTag = tag;
  ZelPkt* pkt = host::Packets::Make(layout);
  tagPackets_[tag] = pkt;
  return pkt;
}

FWRuleEntry* FirewallTest::Lookup(const ModelPacket& pkt, uint32_t direction, uint16_t poolTag) {
  ZelPkt* hostPkt = PacketWithTag(poolTag);
  const FWPktSummary summary = pkt.Summary();
  SLCGenericReadGuard guard(ctx_->configLock);
  if (summary.presence & FW_PKT_PORTS) {
    FWRuleTuple tuple;
    const uint64_t hash = pkt.Tuple(&tuple);
    if (FWRuleEntry* e = FWFindExactRule(ctx_, &tuple, hash, direction, hostPkt)) return e;
  }
  return FWFindRuleForPacket(filter_, hostPkt, direction, &summary);
}

FirewallTest::Fingerprint FirewallTest::Capture() {
  Fingerprint f{};
  f.ruleHash = ctx_->ruleHash;
  f.fragOverride = ctx_->fragOverride;
  f.version = ctx_->version;
  f.fwFeatures = ctx_->fwFeatures;
  f.numRules = ctx_->numRules;
  f.ioctl = ctx_->ioctl;
  f.populated = Populate();
  for (FWRuleEntry* e : ExactEntries()) {
    f.entryOwnership.push_back({reinterpret_cast<uintptr_t>(e), e->poolTag, e->greSocket,
                                e->greSocketOpen, e->hash});
  }
  for (FWRuleEntry* e : GeneralEntries()) {
    f.entryOwnership.push_back({reinterpret_cast<uintptr_t>(e), e->poolTag, e->greSocket,
                                e->greSocketOpen});
  }
  f.heapBlocks = host::Heaps::Stats(slcGenericHeapID).blocks;
  f.poolTags = host::ResPools::OutstandingTotal();
  f.sockets = host::Sockets::Open();
  return f;
}

bool SameRecord(const FWRule& a, const FWRule& b) {
  return std::memcmp(&a, &b, sizeof(FWRule)) == 0;
}

}  // namespace testsupport
