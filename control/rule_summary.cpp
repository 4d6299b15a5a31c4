// The ruleSummary leaf of the status tree: one rule of a filter rendered as
// text, field by field, with its wildcard, negation, range and mask state
// folded into each field's text.
//
// The rule is taken from a fresh serialisation of the filter's ruleset (the
// order in which FWPopulateRuleset writes rules is the order of positions).
// Only the rule's own record is read: it is copied into a zeroed version-8
// work record first.
//
// Choices the rendering makes:
//  - A version-7 rule is rendered as the version-8 rule the filter holds for
//    it: the fields a version-7 record lacks (rpTag, ethDot1PTag, dscpTag,
//    both MAC masks, negateFlags) are zero, and ruleFlags bit 9 is set,
//    because a version-7 rule never compares the resource-pool tag. So its
//    wildcard list ends in "rptag", rpTag shows "*", nothing is negated, a
//    MAC shows the all-zero mask as a version-8 rule with zero masks does,
//    and a marking action shows the tag 0 it marks with.
//  - The wildcard list shows no "direction" word: a rule has no direction
//    wildcard (a direction of 3 matches both ways and is shown in the
//    direction field), and tying such a word to the dPort bit would report a
//    wildcard that does not exist.
//  - A position within the filter's rule count that the serialised ruleset
//    no longer holds (single rules removed through the ioctl channel keep
//    the count) gives ZEL_NOT_FOUND, like any other position past the end.
#include "control/control.h"
#include "firewall/fw_ioctl.h"
#include "module/locks.h"

namespace {

// Appends formatted text to a fixed field, never past its end.
struct FieldText {
  char* buf;
  size_t size;
  size_t len = 0;

  char* Tail() const { return buf + len; }
  size_t Room() const { return size - len; }
  void Advance(int written) {
    if (written <= 0) return;
    len += static_cast<size_t>(written);
    if (len > size - 1) len = size - 1;
  }
  // Backs up over the last character (a closing parenthesis or a comma), so
  // that the next text overwrites it.
  void DropLast() {
    if (len == 0) return;
    --len;
    buf[len] = '\0';
  }
};

template <size_t N>
FieldText Field(char (&field)[N]) {
  field[0] = '\0';
  return FieldText{field, N};
}

#define SLCG_FIELD_ADD(text, fmt, ...) \
  (text).Advance(zel_Sprintf((text).Tail(), (text).Room(), fmt __VA_OPT__(, ) __VA_ARGS__))

template <size_t N>
void Wildcard(char (&field)[N]) {
  zel_Sprintf(field, N, "%s", "*");
}

struct FlagWord {
  uint32_t bit;
  const char* word;
};

constexpr FlagWord kWildcardWords[] = {
    {FW_WC_DMAC, "dMac,"},    {FW_WC_SMAC, "sMac,"},       {FW_WC_ETHTYPE, "ethType,"},
    {FW_WC_VLAN, "vlan.1Q,"}, {FW_WC_IPSA, "ipSa,"},       {FW_WC_IPDA, "ipDa,"},
    {FW_WC_IPPROTO, "ipProto,"}, {FW_WC_SPORT, "sPort,"},  {FW_WC_DPORT, "dPort,"},
    {FW_WC_RPTAG, "rptag,"},
};

constexpr FlagWord kRangeWords[] = {
    {FW_RANGE_IPSA, "ipSa,"},  {FW_RANGE_IPDA, "ipDa,"},  {FW_RANGE_SPORT, "sPort,"},
    {FW_RANGE_DPORT, "dPort,"}, {FW_MASK_DMAC, "ethDA,"}, {FW_MASK_SMAC, "ethSA,"},
};

// The words of the set bits with the last comma dropped, or "None".
template <size_t N, size_t M>
void FlagList(char (&field)[N], uint32_t flags, const FlagWord (&words)[M]) {
  FieldText text = Field(field);
  for (const FlagWord& w : words) {
    if (flags & w.bit) SLCG_FIELD_ADD(text, "%s", w.word);
  }
  if (text.len == 0) {
    SLCG_FIELD_ADD(text, "%s", "None");
  } else {
    text.DropLast();
  }
}

template <size_t N>
void Mac(char (&field)[N], bool wildcard, bool negate, const uint8_t* mac, const uint8_t* mask) {
  if (wildcard) return Wildcard(field);
  FieldText text = Field(field);
  if (negate) SLCG_FIELD_ADD(text, "%s", " !");
  if (zel_Memcmp(mac, mask, 6) != 0) {
    SLCG_FIELD_ADD(text,
                   " (%02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx/%02hhx:%02hhx:%02hhx:%02hhx:%02hhx:"
                   "%02hhx)",
                   mac[0], mac[1], mac[2], mac[3], mac[4], mac[5], mask[0], mask[1], mask[2],
                   mask[3], mask[4], mask[5]);
  } else {
    SLCG_FIELD_ADD(text, " (%02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx)", mac[0], mac[1], mac[2],
                   mac[3], mac[4], mac[5]);
  }
}

// A decimal value, or " !(value)" when negated.
template <size_t N>
void Number(char (&field)[N], bool wildcard, bool negate, uint32_t value) {
  if (wildcard) return Wildcard(field);
  if (negate) {
    zel_Sprintf(field, N, " !(%u)", value);
  } else {
    zel_Sprintf(field, N, "%u", value);
  }
}

template <size_t N>
void Address(char (&field)[N], bool wildcard, bool ipv4, bool negate, bool range,
             const uint8_t* low, const uint8_t* high) {
  if (wildcard) return Wildcard(field);
  FieldText text = Field(field);
  if (ipv4) {
    SLCG_FIELD_ADD(text, negate ? "(IPv4): !(%u.%u.%u.%u)" : "(IPv4): (%u.%u.%u.%u)", low[0],
                   low[1], low[2], low[3]);
    if (range) {
      text.DropLast();
      SLCG_FIELD_ADD(text, " - %u.%u.%u.%u)", high[0], high[1], high[2], high[3]);
    }
    return;
  }
  uint16_t lo[8];
  uint16_t hi[8];
  for (int i = 0; i < 8; ++i) {
    lo[i] = FWNet16(low + 2 * i);
    hi[i] = FWNet16(high + 2 * i);
  }
  SLCG_FIELD_ADD(text,
                 negate ? "(IPv6): !(%hx:%hx:%hx:%hx:%hx:%hx:%hx:%hx)"
                        : "(IPv6): (%hx:%hx:%hx:%hx:%hx:%hx:%hx:%hx)",
                 lo[0], lo[1], lo[2], lo[3], lo[4], lo[5], lo[6], lo[7]);
  if (range) {
    text.DropLast();
    SLCG_FIELD_ADD(text, " - %hx:%hx:%hx:%hx:%hx:%hx:%hx:%hx)", hi[0], hi[1], hi[2], hi[3], hi[4],
                   hi[5], hi[6], hi[7]);
  }
}

template <size_t N>
void Port(char (&field)[N], bool wildcard, bool negate, bool range, const uint8_t* low,
          const uint8_t* high) {
  if (wildcard) return Wildcard(field);
  FieldText text = Field(field);
  SLCG_FIELD_ADD(text, negate ? " !(%u)" : "(%u)", static_cast<unsigned>(FWNet16(low)));
  if (range) {
    text.DropLast();
    SLCG_FIELD_ADD(text, " - %u)", static_cast<unsigned>(FWNet16(high)));
  }
}

void Render(const FWRule& r, SLCGeneric_RuleSummary* out) {
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  const bool ipv4 = (f & FW_FLAG_IPV4) != 0;

  FlagList(out->wildcardsEnabled, f, kWildcardWords);
  FlagList(out->rangesEnabled, f, kRangeWords);
  Mac(out->dMac, f & FW_WC_DMAC, n & FW_NEG_DMAC, r.dMac, r.dMacMask);
  Mac(out->sMac, f & FW_WC_SMAC, n & FW_NEG_SMAC, r.sMac, r.sMacMask);

  if (f & FW_WC_ETHTYPE) {
    Wildcard(out->ethType);
  } else {
    const unsigned ethType = FWNet16(r.ethType);
    zel_Sprintf(out->ethType, sizeof(out->ethType), (n & FW_NEG_ETHTYPE) ? " !(0x%04x)" : "0x%04x",
                ethType);
  }

  uint32_t vlan;
  zel_Memcpy(&vlan, r.vlan1QTag, sizeof(vlan));
  Number(out->vlan1QTag, f & FW_WC_VLAN, n & FW_NEG_VLAN, vlan);

  Address(out->ipSa, f & FW_WC_IPSA, ipv4, n & FW_NEG_IPSA, f & FW_RANGE_IPSA, r.ipSa, r.ipSaHigh);
  Address(out->ipDa, f & FW_WC_IPDA, ipv4, n & FW_NEG_IPDA, f & FW_RANGE_IPDA, r.ipDa, r.ipDaHigh);
  Number(out->ipProto, f & FW_WC_IPPROTO, n & FW_NEG_IPPROTO, r.ipProto);
  Port(out->sPort, f & FW_WC_SPORT, n & FW_NEG_SPORT, f & FW_RANGE_SPORT, r.sPort, r.sPortHigh);
  Port(out->dPort, f & FW_WC_DPORT, n & FW_NEG_DPORT, f & FW_RANGE_DPORT, r.dPort, r.dPortHigh);

  zel_Sprintf(out->bidirectional, sizeof(out->bidirectional), "%s",
              r.bidirectional != 0 ? "True" : "False");
  out->direction = r.direction;
  out->action = r.action;

  // Fields that belong to one action are written for that action only.
  if (r.action == SLCGenericActionGRE) {
    zel_Sprintf(out->greIP, sizeof(out->greIP), "%u.%u.%u.%u", r.greIP[0], r.greIP[1], r.greIP[2],
                r.greIP[3]);
  }
  if (r.action == SLGenericActionL2Rewrite) {
    const uint8_t* m = r.rewriteMac;
    zel_Sprintf(out->rewriteMac, sizeof(out->rewriteMac),
                "%02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx", m[0], m[1], m[2], m[3], m[4], m[5]);
  }
  if (r.action == SLCGenericActionResourcePoolTag) {
    // The name need not be terminated within its field.
    zel_Sprintf(out->resourcePool, sizeof(out->resourcePool), "%.*s",
                static_cast<int>(zel_Strnlen(r.resourcePool, sizeof(r.resourcePool))),
                r.resourcePool);
  }
  if (f & FW_WC_RPTAG) {
    Wildcard(out->rpTag);
  } else {
    zel_Sprintf(out->rpTag, sizeof(out->rpTag), "%u", static_cast<unsigned>(r.rpTag));
  }
  if (r.action == SLCGenericActionEthDot1PMark ||
      r.action == SLCGenericActionDSCPMarkAndEthDot1PMark) {
    zel_Sprintf(out->ethDot1PTag, sizeof(out->ethDot1PTag), "%u",
                static_cast<unsigned>(r.ethDot1PTag));
  }
  if (r.action == SLCGenericActionDSCPMark ||
      r.action == SLCGenericActionDSCPMarkAndEthDot1PMark) {
    zel_Sprintf(out->dscpTag, sizeof(out->dscpTag), "%u", static_cast<unsigned>(r.dscpTag));
  }
  zel_Sprintf(out->pktCount, sizeof(out->pktCount), "%llu",
              static_cast<unsigned long long>(r.pktCount));
  zel_Sprintf(out->byteCount, sizeof(out->byteCount), "%llu",
              static_cast<unsigned long long>(r.byteCount));
}

#undef SLCG_FIELD_ADD

}  // namespace

ZelStatus SLCGenericQryRuleSummaryGet(uint32_t /*nodeId*/, QRY_ParamList* instanceArgs,
                                      void* out) {
  SLCGenericAgent* agent = nullptr;
  SLCGenericFilter* filter = nullptr;
  if (ZelStatus s = SLCGenericQryPreprocess(instanceArgs, &agent, &filter)) return s;
  SLCGenericQryLocks locks(agent, filter);

  int32_t position = 0;
  if (ZelStatus s = QRY_ParamListGetInt32(instanceArgs, 2, &position)) return s;
  // Taken as unsigned, a negative position is past any rule count.
  const uint32_t index = static_cast<uint32_t>(position);

  FWFilterContext* ctx = FWContext(filter);
  if (ctx == nullptr) return ZEL_NOT_FOUND;

  FWRule rule;
  zel_Memset(&rule, 0, sizeof(rule));
  {
    SLCGenericReadGuard hold(ctx->configLock);
    if (index >= ctx->numRules) return ZEL_NOT_FOUND;
    // 281 bytes per rule fits either version.
    SLCGenericHeapBlock buf(FW_RULESET_HEADER_SIZE +
                            static_cast<uint64_t>(ctx->numRules) * FW_RULE_SIZE_V8);
    if (!buf) return ZEL_NO_MEMORY;
    auto* ruleset = reinterpret_cast<FWRuleset*>(buf.bytes());
    FWPopulateRuleset(ctx, ruleset);
    hold.Unlock();

    uint64_t ruleSize = 0;
    if (index >= ruleset->numRules || FWGetRuleSize(ruleset->version, &ruleSize) != ZEL_OK) {
      return ZEL_NOT_FOUND;
    }
    zel_Memcpy(&rule, buf.bytes() + FW_RULESET_HEADER_SIZE + index * ruleSize, ruleSize);
    if (ruleset->version == FW_RULESET_VERSION_7) rule.ruleFlags |= FW_WC_RPTAG;
  }
  Render(rule, static_cast<SLCGeneric_RuleSummary*>(out));
  return ZEL_OK;
}
