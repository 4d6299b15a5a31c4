// The firewall's packet path, shared between the walk (fw_packet.cpp) and
// the packet-modifying actions (fw_actions.cpp).
//
// Everything here runs inside FWProcessPackets with the filter's configLock
// held shared: rule entries stay alive and unchanged for the whole call,
// except for the counters and the GRE socket fields, which concurrent walks
// may touch on the same entry (see FWGRESend).
#pragma once

#include "firewall/firewall.h"

// The state of one FWProcessPackets call that the actions need. Lives on
// the walk's stack; the lists are the call's local slow-path and re-issue
// lists, handed to the framework after configLock is released.
struct FWWalk {
  SLCGenericFilter* filter;
  FWFilterContext* ctx;
  ZelPktListIter* iter;
  ZelPktList* slowPathList;
  ZelPktList* reissueList;
  uint32_t direction;
  uint32_t spAttachState;   // ctx->spAttachState, read once under the hold
  uint32_t failurePolicy;   // filter->failurePolicy
  // Packets the iterator still has to step over: those that stay in the
  // list unchanged (no rule, Accept) are passed lazily, so that the common
  // verdict costs no step; FWIterCatchUp brings the iterator onto the
  // current packet before anything uses it.
  uint32_t lag;
  bool slowPathUsed;        // something was appended to slowPathList
  bool reissueUsed;         // something was appended to reissueList
};

// Steps the walk's iterator onto the packet being decided.
inline void FWIterCatchUp(FWWalk* walk) {
  for (; walk->lag != 0; walk->lag--) zel_PktListIterMove(walk->iter);
}

inline constexpr uint32_t FW_ETH_MIN_PARSED = 26;  // shortest frame the parse reads
inline constexpr uint16_t FW_ETHTYPE_IPV4 = 0x0800;
inline constexpr uint16_t FW_ETHTYPE_IPV6 = 0x86dd;
inline constexpr uint16_t FW_ETHTYPE_VLAN = 0x8100;
inline constexpr uint16_t FW_ETH_8023_MAX_LEN = 1500;

// The Ethernet parse: where the EtherType sits and where L3 starts, for
// Ethernet II, 802.3 with LLC/SNAP, and one 802.1Q tag over either. The
// LLC bytes are not checked. Reads frame bytes 12-17 only; the caller
// guarantees FW_ETH_MIN_PARSED readable bytes.
inline const uint8_t* FWEthernetParse(const uint8_t* frame, uint32_t* l3) {
  const uint16_t type = FWNet16(frame + 12);
  if (type <= FW_ETH_8023_MAX_LEN) {
    *l3 = 22;
    return frame + 20;
  }
  if (type == FW_ETHTYPE_VLAN) {
    if (FWNet16(frame + 16) > FW_ETH_8023_MAX_LEN) {
      *l3 = 18;
      return frame + 16;
    }
    *l3 = 26;
    return frame + 24;
  }
  *l3 = 14;
  return frame + 12;
}

// The action a fragment override carries out. The override decides with no
// rule, so actions that take their parameters from a rule (L2 rewrite, GRE,
// pool tag, DSCP and 802.1p marks) have nothing to work with there: an
// override naming one of them lets fragments pass unchanged, as Accept
// would.
inline uint32_t FWOverrideAction(uint32_t fragOverride) {
  switch (fragOverride) {
    case SLGenericActionL2Rewrite:
    case SLCGenericActionGRE:
    case SLCGenericActionResourcePoolTag:
    case SLCGenericActionDSCPMark:
    case SLCGenericActionEthDot1PMark:
    case SLCGenericActionDSCPMarkAndEthDot1PMark:
      return SLCGenericActionAccept;
    default:
      return fragOverride;
  }
}

// Parses one packet into `summary` as the walk does (presence, fields and
// vlan1QTag all set afresh). `fragOverride` is the context's: a first
// fragment gets no ports while it is not 0.
void FWParsePacket(ZelPkt* pkt, uint32_t fragOverride, FWPktSummary* summary);

// The match tuple of a parsed packet that has ports, in the layout
// FWCreateTupleFromRule gives a rule, and its hash (31 or 55 bytes).
uint64_t FWPacketTuple(const FWPktSummary* summary, FWRuleTuple* tuple);

// RFC 1071 checksum of an IPv4 header of `len` bytes (a multiple of 4)
// whose checksum field is zero: the value to store, in host order.
uint16_t FWIpv4HeaderChecksum(const uint8_t* header, uint32_t len);

// L2 rewrite (action 5) of the walk's current packet `pkt`. Returns true
// when the packet left the list (the iterator already stands on the next
// one), false when it stays at the iterator (rewritten, replaced by its
// rewritten copy, or unchanged after a failed copy).
bool FWActionL2Rewrite(FWWalk* walk, ZelPkt* pkt, const FWRule* rule);

// DSCP mark (action 9, first half of 11) of the walk's current packet. The
// packet stays in the list; returns the packet now at the iterator (`pkt`
// itself or the copy that replaced it).
ZelPkt* FWActionDSCPMark(FWWalk* walk, ZelPkt* pkt, const FWPktSummary* summary,
                         uint16_t dscpTag);

// GRE-encapsulated copy (action 6) of `pkt` to the rule's greIP; opens the
// entry's socket on first use. The packet itself is not changed.
void FWGRESend(SLCGenericFilter* filter, FWRuleEntry* entry, ZelPkt* pkt);
