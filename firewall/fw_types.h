// Wire formats of the firewall: rulesets, rule records, match tuples, and
// the action and direction enumerations.
//
// Everything is packed. The module's own integers (actions, flags, counts,
// counters, tags, lengths) are little-endian, which is this host's order, so
// they are read directly. Packet fields (MACs, ethertype, 802.1Q tag,
// addresses, ports, GRE address) are kept as bytes in network order and are
// compared byte for byte; FWNet16/FWNet32 convert them where a numeric
// comparison or a rendering needs host order.
#pragma once

#include <cstddef>
#include <cstdint>

enum SLCGenericDirectionEnum : uint8_t {
  SLCGenericDirectionInvalid = 0,
  SLCGenericDirectionFromSwitch = 1,
  SLCGenericDirectionToSwitch = 2,
  SLCGenericDirectionBidirectional = 3,
};

enum SLCGenericActionEnum : uint32_t {
  SLCGenericActionNone = 0,
  SLCGenericActionDrop = 1,
  SLCGenericActionAccept = 2,
  SLCGenericActionPunt = 3,
  SLCGenericActionCopy = 4,
  SLGenericActionL2Rewrite = 5,
  SLCGenericActionGRE = 6,
  SLCGenericActionLog = 7,
  SLCGenericActionResourcePoolTag = 8,
  SLCGenericActionDSCPMark = 9,
  SLCGenericActionEthDot1PMark = 10,
  SLCGenericActionDSCPMarkAndEthDot1PMark = 11,
};

// ruleFlags bits.
inline constexpr uint32_t FW_WC_DMAC = 1u << 0;
inline constexpr uint32_t FW_WC_SMAC = 1u << 1;
inline constexpr uint32_t FW_WC_ETHTYPE = 1u << 2;
inline constexpr uint32_t FW_WC_VLAN = 1u << 3;
inline constexpr uint32_t FW_WC_IPSA = 1u << 4;
inline constexpr uint32_t FW_WC_IPDA = 1u << 5;
inline constexpr uint32_t FW_WC_IPPROTO = 1u << 6;
inline constexpr uint32_t FW_WC_SPORT = 1u << 7;
inline constexpr uint32_t FW_WC_DPORT = 1u << 8;
inline constexpr uint32_t FW_WC_RPTAG = 1u << 9;
inline constexpr uint32_t FW_WC_FIELDS = 0x1ffu;         // bits 0-8
inline constexpr uint32_t FW_WC_ALL = 0x3ffu;            // bits 0-9
inline constexpr uint32_t FW_RANGE_IPSA = 1u << 16;
inline constexpr uint32_t FW_RANGE_IPDA = 1u << 17;
inline constexpr uint32_t FW_RANGE_SPORT = 1u << 18;
inline constexpr uint32_t FW_RANGE_DPORT = 1u << 19;
inline constexpr uint32_t FW_FLAG_IPV4 = 1u << 20;
inline constexpr uint32_t FW_MASK_DMAC = 1u << 21;
inline constexpr uint32_t FW_MASK_SMAC = 1u << 22;
// A rule with any of these bits is a general rule; with none, an exact rule.
inline constexpr uint32_t FW_GENERAL_RULE_MASK = 0x6f01ffu;

// negateFlags bits (destination before source for addresses and ports).
inline constexpr uint32_t FW_NEG_DMAC = 1u << 0;
inline constexpr uint32_t FW_NEG_SMAC = 1u << 1;
inline constexpr uint32_t FW_NEG_ETHTYPE = 1u << 2;
inline constexpr uint32_t FW_NEG_VLAN = 1u << 3;
inline constexpr uint32_t FW_NEG_IPDA = 1u << 4;
inline constexpr uint32_t FW_NEG_IPSA = 1u << 5;
inline constexpr uint32_t FW_NEG_IPPROTO = 1u << 6;
inline constexpr uint32_t FW_NEG_DPORT = 1u << 7;
inline constexpr uint32_t FW_NEG_SPORT = 1u << 8;

// fwFeatures bits.
inline constexpr uint32_t FW_FEATURE_DROP_BPDU = 1u << 0;
inline constexpr uint32_t FW_FEATURE_DROP_DHCP_SERVER = 1u << 1;

inline constexpr uint8_t FW_RULESET_VERSION_7 = 7;
inline constexpr uint8_t FW_RULESET_VERSION_8 = 8;
inline constexpr uint32_t FW_RULE_SIZE_V7 = 259;
inline constexpr uint32_t FW_RULE_SIZE_V8 = 281;
inline constexpr uint32_t FW_RULESET_HEADER_SIZE = 15;

#pragma pack(push, 1)

struct FWRulesetHeader {
  uint8_t version;
  uint8_t highestSupportedVersion;
  uint8_t lowestSupportedVersion;
  uint32_t numRules;
  uint32_t fwFeatures;
  uint32_t fragOverride;
};

struct FWRule {
  uint32_t action;
  uint32_t ruleFlags;
  uint8_t dMac[6];
  uint8_t sMac[6];
  uint8_t ethType[2];
  uint8_t vlan1QTag[4];
  uint8_t ipSa[16];
  uint8_t ipDa[16];
  uint8_t ipProto;
  uint8_t sPort[2];
  uint8_t dPort[2];
  uint64_t pktCount;
  uint64_t byteCount;
  uint8_t ipSaHigh[16];
  uint8_t ipDaHigh[16];
  uint8_t sPortHigh[2];
  uint8_t dPortHigh[2];
  uint8_t bidirectional;
  uint8_t direction;
  uint8_t rewriteMac[6];
  uint8_t greIP[4];
  uint32_t snapLen;
  char resourcePool[128];
  // Version 8 only from here.
  uint16_t rpTag;
  uint16_t ethDot1PTag;
  uint16_t dscpTag;
  uint8_t dMacMask[6];
  uint8_t sMacMask[6];
  uint32_t negateFlags;
};

// The hashed match key of a rule or a packet. For IPv4 the addresses take 4
// bytes each and the protocol and ports follow at once (bytes 26-30); bytes
// 31-54 are then unused. isIPv4 is never hashed.
struct FWRuleTuple {
  uint8_t bytes[55];
  uint8_t isIPv4;
};

#pragma pack(pop)

// A ruleset is a header followed by numRules records.
using FWRuleset = FWRulesetHeader;

static_assert(sizeof(FWRulesetHeader) == 15);
static_assert(offsetof(FWRulesetHeader, numRules) == 3);
static_assert(offsetof(FWRulesetHeader, fwFeatures) == 7);
static_assert(offsetof(FWRulesetHeader, fragOverride) == 11);

static_assert(sizeof(FWRule) == FW_RULE_SIZE_V8);
static_assert(offsetof(FWRule, ruleFlags) == 4);
static_assert(offsetof(FWRule, dMac) == 8);
static_assert(offsetof(FWRule, sMac) == 14);
static_assert(offsetof(FWRule, ethType) == 20);
static_assert(offsetof(FWRule, vlan1QTag) == 22);
static_assert(offsetof(FWRule, ipSa) == 26);
static_assert(offsetof(FWRule, ipDa) == 42);
static_assert(offsetof(FWRule, ipProto) == 58);
static_assert(offsetof(FWRule, sPort) == 59);
static_assert(offsetof(FWRule, dPort) == 61);
static_assert(offsetof(FWRule, pktCount) == 63);
static_assert(offsetof(FWRule, byteCount) == 71);
static_assert(offsetof(FWRule, ipSaHigh) == 79);
static_assert(offsetof(FWRule, ipDaHigh) == 95);
static_assert(offsetof(FWRule, sPortHigh) == 111);
static_assert(offsetof(FWRule, dPortHigh) == 113);
static_assert(offsetof(FWRule, bidirectional) == 115);
static_assert(offsetof(FWRule, direction) == 116);
static_assert(offsetof(FWRule, rewriteMac) == 117);
static_assert(offsetof(FWRule, greIP) == 123);
static_assert(offsetof(FWRule, snapLen) == 127);
static_assert(offsetof(FWRule, resourcePool) == 131);
static_assert(offsetof(FWRule, rpTag) == FW_RULE_SIZE_V7);
static_assert(offsetof(FWRule, ethDot1PTag) == 261);
static_assert(offsetof(FWRule, dscpTag) == 263);
static_assert(offsetof(FWRule, dMacMask) == 265);
static_assert(offsetof(FWRule, sMacMask) == 271);
static_assert(offsetof(FWRule, negateFlags) == 277);

static_assert(sizeof(FWRuleTuple) == 56);
static_assert(offsetof(FWRuleTuple, isIPv4) == 55);

// Tuple layout offsets.
inline constexpr uint32_t FW_TUPLE_DMAC = 0;
inline constexpr uint32_t FW_TUPLE_SMAC = 6;
inline constexpr uint32_t FW_TUPLE_ETHTYPE = 12;
inline constexpr uint32_t FW_TUPLE_VLAN = 14;
inline constexpr uint32_t FW_TUPLE_IPSA = 18;
inline constexpr uint32_t FW_TUPLE_V4_IPDA = 22;
inline constexpr uint32_t FW_TUPLE_V4_PROTO = 26;
inline constexpr uint32_t FW_TUPLE_V4_SPORT = 27;
inline constexpr uint32_t FW_TUPLE_V4_DPORT = 29;
inline constexpr uint32_t FW_TUPLE_V4_HASHED = 31;
inline constexpr uint32_t FW_TUPLE_V6_IPDA = 34;
inline constexpr uint32_t FW_TUPLE_V6_PROTO = 50;
inline constexpr uint32_t FW_TUPLE_V6_SPORT = 51;
inline constexpr uint32_t FW_TUPLE_V6_DPORT = 53;
inline constexpr uint32_t FW_TUPLE_V6_HASHED = 55;

// Network-order helpers.
inline uint16_t FWNet16(const uint8_t* p) {
  return static_cast<uint16_t>((static_cast<uint16_t>(p[0]) << 8) | p[1]);
}
inline uint32_t FWNet32(const uint8_t* p) {
  return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
         (static_cast<uint32_t>(p[2]) << 8) | p[3];
}
inline void FWPutNet16(uint8_t* p, uint16_t v) {
  p[0] = static_cast<uint8_t>(v >> 8);
  p[1] = static_cast<uint8_t>(v);
}
