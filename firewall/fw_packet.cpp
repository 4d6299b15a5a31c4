// The firewall's data path: FWProcessPackets walks one packet list of one
// filter and direction, parses each frame into a packet summary, finds its
// verdict (feature checks, fragment override, rule lookup), counts the hit
// on the rule and carries out the action.
//
// Locking: configLock is held shared for the whole walk, so the rule tables,
// the entries and every context field stay as they are until the walk ends.
// It is released before the slow-path and re-issue lists go to the
// framework; no framework call is made under it.
//
// Cost: per packet the walk makes only the getter calls it needs (frame
// length, mapped length and pointer, VLAN ID and priority), reads headers in
// place from the mapped part, and asks the scatter-gather array only for
// bytes beyond it. Nothing is allocated except what an action needs.

#include "firewall/fw_packet.h"
#include "module/locks.h"

namespace {

inline size_t FWRound16(size_t n) { return (n + 15) & ~static_cast<size_t>(15); }

// Stack storage for a host object whose size the host tells at run time.
// Must expand in the function that uses the object (alloca).
#define FW_STACK_OBJECT(type, size) \
  static_cast<type*>(__builtin_alloca_with_align(FWRound16(size), 128))

constexpr uint8_t kProtoTcp = 6;
constexpr uint8_t kProtoUdp = 17;
constexpr uint8_t kProtoUnparsed = 255;

constexpr uint8_t kExtHopByHop = 0;
constexpr uint8_t kExtRouting = 43;
constexpr uint8_t kExtFragment = 44;
constexpr uint8_t kExtAh = 51;
constexpr uint8_t kExtDestOpts = 60;

constexpr uint8_t kBpduMac[6] = {0x01, 0x80, 0xc2, 0x00, 0x00, 0x00};
constexpr uint8_t kCdpMac[6] = {0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd};
constexpr uint16_t kDhcpServerPort = 67;
constexpr uint16_t kDhcp6ServerPort = 547;

// `need` frame bytes at `off`: in place when mapped, else from the
// scatter-gather element holding them; null when they pass the frame's end
// or straddle two elements.
inline const uint8_t* FWFrameBytes(ZelPkt* pkt, const uint8_t* frame, uint32_t frameLen,
                                   uint32_t mappedLen, uint64_t off, uint32_t need) {
  if (off + need > frameLen) return nullptr;
  if (off + need <= mappedLen) return frame + off;
  return SLCGenericFindSGEntry(pkt, static_cast<uint32_t>(off),
                               static_cast<uint32_t>(off + need));
}

// Walks the IPv6 extension headers from next header `nh` at frame offset
// `off`, bounded by the frame length. Sets the fragment bits it finds;
// returns the upper-layer protocol with its offset in *l4, or 255 when a
// header lies beyond the frame or cannot be fetched.
uint8_t FWWalkIpv6Extensions(ZelPkt* pkt, const uint8_t* frame, uint32_t frameLen,
                             uint32_t mappedLen, uint8_t nh, uint64_t off, uint64_t* l4,
                             uint32_t* presence) {
  for (;;) {
    if (off >= frameLen) return kProtoUnparsed;
    switch (nh) {
      case kExtHopByHop:
      case kExtRouting:
      case kExtDestOpts: {
        const uint8_t* h = FWFrameBytes(pkt, frame, frameLen, mappedLen, off, 2);
        if (h == nullptr) return kProtoUnparsed;
        nh = h[0];
        off += 8 + 8 * static_cast<uint64_t>(h[1]);
        break;
      }
      case kExtAh: {
        const uint8_t* h = FWFrameBytes(pkt, frame, frameLen, mappedLen, off, 2);
        if (h == nullptr) return kProtoUnparsed;
        nh = h[0];
        off += 8 + 4 * static_cast<uint64_t>(h[1]);
        break;
      }
      case kExtFragment: {
        const uint8_t* h = FWFrameBytes(pkt, frame, frameLen, mappedLen, off, 8);
        if (h == nullptr) return kProtoUnparsed;
        nh = h[0];
        // Offset in the top 13 bits, more-fragments in bit 0; the two
        // reserved bits between them are ignored.
        const uint16_t field = FWNet16(h + 2);
        const uint16_t fragOffset = field >> 3;
        if (fragOffset != 0 || (field & 1) != 0) {
          *presence |= fragOffset != 0 ? FW_PKT_LATER_FRAG : FW_PKT_FIRST_FRAG;
        }
        off += 8;
        break;
      }
      default:
        *l4 = off;
        return nh;
    }
  }
}

// Parses one frame into `s` (presence and vlan1QTag already reset by the
// caller). `frame` holds `mappedLen` readable bytes of a `frameLen`-byte
// frame.
__attribute__((always_inline)) inline void FWParseFrame(ZelPkt* pkt, const uint8_t* frame, uint32_t frameLen, uint32_t mappedLen,
                         uint32_t fragOverride, FWPktSummary* s) {
  if (mappedLen < FW_ETH_MIN_PARSED) return;
  s->presence |= FW_PKT_L2;
  s->dMac = frame;
  s->sMac = frame + 6;
  uint32_t l3;
  const uint8_t* ethType = FWEthernetParse(frame, &l3);
  s->ethType[0] = ethType[0];
  s->ethType[1] = ethType[1];

  // The tag comes from the packet's metadata; an 802.1Q header in the
  // frame was only skipped above.
  const uint16_t vlanId = zel_PktVlanIDGet(pkt);
  const uint8_t priority = zel_PktPriorityGet(pkt);
  if (vlanId != 0 || priority != 0) {
    s->vlan1QTag[0] = 0x81;
    s->vlan1QTag[1] = 0x00;
    s->vlan1QTag[2] = static_cast<uint8_t>((priority << 5) | (vlanId >> 8));
    s->vlan1QTag[3] = static_cast<uint8_t>(vlanId & 0xff);
  }

  const uint16_t type = FWNet16(ethType);
  uint64_t l4;
  if (type == FW_ETHTYPE_IPV4) {
    if (mappedLen < l3 + 20) return;
    const uint8_t* ip = frame + l3;
    s->presence |= FW_PKT_L3 | FW_PKT_IPV4;
    s->ipSa = ip + 12;
    s->ipDa = ip + 16;
    s->ipProto = ip[9];
    l4 = l3 + 4u * (ip[0] & 0x0f);  // IHL as it stands, even below 5
    const uint16_t frag = FWNet16(ip + 6);
    if ((frag & 0x3fff) != 0) {  // more-fragments or an offset
      s->presence |= (frag & 0x1fff) != 0 ? FW_PKT_LATER_FRAG : FW_PKT_FIRST_FRAG;
    }
  } else if (type == FW_ETHTYPE_IPV6) {
    if (mappedLen < l3 + 40) return;
    const uint8_t* ip = frame + l3;
    s->presence |= FW_PKT_L3 | FW_PKT_IPV6;
    s->ipSa = ip + 8;
    s->ipDa = ip + 24;
    const uint8_t nh = ip[6];
    l4 = l3 + 40;
    if (nh == kProtoTcp || nh == kProtoUdp) {
      s->ipProto = nh;
    } else {
      s->ipProto =
          FWWalkIpv6Extensions(pkt, frame, frameLen, mappedLen, nh, l4, &l4, &s->presence);
      if (s->ipProto == kProtoUnparsed) return;
    }
  } else {
    return;
  }

  // Ports: never for a later fragment, nor for a first fragment while a
  // fragment override decides fragments without looking at ports.
  const uint8_t proto = s->ipProto;
  if (proto != kProtoTcp && proto != kProtoUdp) return;
  if (s->presence & FW_PKT_LATER_FRAG) return;
  if ((s->presence & FW_PKT_FIRST_FRAG) && fragOverride != 0) return;
  // UDP needs its 8-byte header in the frame; TCP its minimal 20-byte
  // header, of which only the ports are read.
  const uint32_t headerLen = proto == kProtoUdp ? 8 : 20;
  if (l4 + headerLen > frameLen) return;
  const uint8_t* ports;
  if (l4 + headerLen <= mappedLen) {
    ports = frame + l4;
  } else {
    const uint32_t fetch = proto == kProtoUdp ? 8 : 4;
    ports = SLCGenericFindSGEntry(pkt, static_cast<uint32_t>(l4),
                                  static_cast<uint32_t>(l4 + fetch));
    if (ports == nullptr) return;
  }
  s->sPort[0] = ports[0];
  s->sPort[1] = ports[1];
  s->dPort[0] = ports[2];
  s->dPort[1] = ports[3];
  s->presence |= FW_PKT_PORTS | (proto == kProtoUdp ? FW_PKT_UDP : FW_PKT_TCP);
}

// The packet's match tuple, in the layout FWCreateTupleFromRule gives a
// rule, and its hash. Only for packets with ports (so with L2 and L3).
__attribute__((always_inline)) inline uint64_t FWTupleFromSummary(const FWPktSummary* s, FWRuleTuple* tuple) {
  uint8_t* t = tuple->bytes;
  __builtin_memcpy(t + FW_TUPLE_DMAC, s->dMac, 6);
  __builtin_memcpy(t + FW_TUPLE_SMAC, s->sMac, 6);
  __builtin_memcpy(t + FW_TUPLE_ETHTYPE, s->ethType, 2);
  __builtin_memcpy(t + FW_TUPLE_VLAN, s->vlan1QTag, 4);
  if (s->presence & FW_PKT_IPV4) {
    __builtin_memcpy(t + FW_TUPLE_IPSA, s->ipSa, 4);
    __builtin_memcpy(t + FW_TUPLE_V4_IPDA, s->ipDa, 4);
    t[FW_TUPLE_V4_PROTO] = s->ipProto;
    __builtin_memcpy(t + FW_TUPLE_V4_SPORT, s->sPort, 2);
    __builtin_memcpy(t + FW_TUPLE_V4_DPORT, s->dPort, 2);
    tuple->isIPv4 = 1;
    return HashFunc_HashBytes(t, FW_TUPLE_V4_HASHED);
  }
  __builtin_memcpy(t + FW_TUPLE_IPSA, s->ipSa, 16);
  __builtin_memcpy(t + FW_TUPLE_V6_IPDA, s->ipDa, 16);
  t[FW_TUPLE_V6_PROTO] = s->ipProto;
  __builtin_memcpy(t + FW_TUPLE_V6_SPORT, s->sPort, 2);
  __builtin_memcpy(t + FW_TUPLE_V6_DPORT, s->dPort, 2);
  tuple->isIPv4 = 0;
  return HashFunc_HashBytes(t, FW_TUPLE_V6_HASHED);
}

inline void FWDropCurrent(FWWalk* walk) {
  ZelPkt* removed = nullptr;
  zel_PktListIterRemovePkt(walk->iter, &removed);
  zel_PktRelease(removed);
}

// Carries out `action` on the walk's current packet and leaves the
// iterator on the next packet. `entry` is null for verdicts that come with
// no rule (features, fragment override); the caller has mapped actions that
// need rule parameters to a pass in that case.
void FWApplyAction(FWWalk* walk, ZelPkt* pkt, uint32_t action, FWRuleEntry* entry,
                   const FWPktSummary* summary) {
  switch (action) {
    case SLCGenericActionDrop:
      FWDropCurrent(walk);
      return;
    case SLCGenericActionPunt:
      if (walk->spAttachState == SLCGenericSpAttached) {
        ZelPkt* removed = nullptr;
        zel_PktListIterRemovePkt(walk->iter, &removed);
        zel_PktListAppendPkt(walk->slowPathList, removed);
        walk->slowPathUsed = true;
      } else if (walk->failurePolicy == 1) {
        zel_PktListIterMove(walk->iter);
      } else {
        FWDropCurrent(walk);
      }
      return;
    case SLCGenericActionCopy: {
      // The slow path's state is not checked; a failed clone only loses the
      // copy.
      ZelPkt* clone = nullptr;
      if (zel_PktClone(pkt, &clone) == ZEL_OK) {
        zel_PktListAppendPkt(walk->slowPathList, clone);
        walk->slowPathUsed = true;
      }
      zel_PktListIterMove(walk->iter);
      return;
    }
    case SLGenericActionL2Rewrite:
      if (!FWActionL2Rewrite(walk, pkt, &entry->rule)) zel_PktListIterMove(walk->iter);
      return;
    case SLCGenericActionGRE:
      FWGRESend(walk->filter, entry, pkt);
      break;
    case SLCGenericActionResourcePoolTag:
      (void)zel_PktResPoolTagSet(pkt, entry->poolTag);
      break;
    case SLCGenericActionDSCPMark:
      (void)FWActionDSCPMark(walk, pkt, summary, entry->rule.dscpTag);
      break;
    case SLCGenericActionEthDot1PMark:
      (void)zel_PktPrioritySet(pkt, static_cast<uint8_t>(entry->rule.ethDot1PTag));
      break;
    case SLCGenericActionDSCPMarkAndEthDot1PMark: {
      // The priority goes on whichever packet is in the list now, also when
      // the mark was skipped.
      ZelPkt* marked = FWActionDSCPMark(walk, pkt, summary, entry->rule.dscpTag);
      (void)zel_PktPrioritySet(marked, static_cast<uint8_t>(entry->rule.ethDot1PTag));
      break;
    }
    default:  // None, Accept, Log and unknown values pass
      break;
  }
  zel_PktListIterMove(walk->iter);
}

// The fragment override decides with no rule. Actions that take their
// parameters from a rule (L2 rewrite, GRE, pool tag, DSCP and 802.1p marks)
// have nothing to work with there, so an override naming one of them lets
// fragments pass unchanged, as Accept would.
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

// The walk proper; configLock held shared, ruleHash not null.
void FWWalkList(FWWalk* walk, ZelPktList* list) {
  FWFilterContext* ctx = walk->ctx;
  const uint32_t direction = walk->direction;
  const uint32_t fwFeatures = ctx->fwFeatures;
  const uint32_t fragOverride = ctx->fragOverride;
  const bool haveGeneralRules = !List_IsEmpty(&ctx->ruleList);
  ZelPktListIter* iter = walk->iter;

  FWPktSummary summary;
  FWRuleTuple tuple;
  for (zel_PktListIterStart(list, iter); !zel_PktListIterIsAtEnd(iter);) {
    ZelPkt* pkt = zel_PktListIterGetPkt(iter);
    const uint32_t frameLen = zel_PktFrameLenGet(pkt);
    uint32_t mappedLen = zel_PktFrameMappedLenGet(pkt);
    if (mappedLen > frameLen) mappedLen = frameLen;
    const uint8_t* frame = zel_PktFrameMappedPointerGet(pkt);

    summary.presence = FW_PKT_RPTAG;
    __builtin_memset(summary.vlan1QTag, 0, sizeof(summary.vlan1QTag));
    FWParseFrame(pkt, frame, frameLen, mappedLen, fragOverride, &summary);

    if (fwFeatures != 0 &&
        FWProcessFeatures(ctx, pkt, &summary, direction) == SLCGenericActionDrop) {
      FWDropCurrent(walk);
      continue;
    }
    if ((summary.presence & (FW_PKT_FIRST_FRAG | FW_PKT_LATER_FRAG)) && fragOverride != 0) {
      FWApplyAction(walk, pkt, FWOverrideAction(fragOverride), nullptr, &summary);
      continue;
    }

    FWRuleEntry* entry = nullptr;
    if (summary.presence & FW_PKT_PORTS) {
      const uint64_t hash = FWTupleFromSummary(&summary, &tuple);
      entry = FWFindExactRule(ctx, &tuple, hash, direction, pkt);
    }
    if (entry == nullptr && haveGeneralRules) {
      entry = FWFindRuleForPacket(walk->filter, pkt, direction, &summary);
    }
    if (entry == nullptr) {
      zel_PktListIterMove(iter);
      continue;
    }
    // Plain adds under the shared hold: concurrent walks on one rule may
    // lose an increment.
    entry->rule.pktCount += 1;
    entry->rule.byteCount += frameLen;
    FWApplyAction(walk, pkt, entry->rule.action, entry, &summary);
  }
}

}  // namespace

ZelStatus FWProcessPackets(SLCGenericFilter* filter, ZelPktList* list, uint32_t direction) {
  FWFilterContext* ctx = FWContext(filter);
  SLCGenericReadGuard hold(ctx->configLock);
  if (ctx->ruleHash == nullptr) {
    hold.Dismiss();  // the no-ruleset path releases the hold itself
    return FWProcessDefaultAction(ctx, list, direction);
  }

  auto* iter = FW_STACK_OBJECT(ZelPktListIter, zel_PktListIterSizeOf());
  const size_t listSize = zel_PktListSizeInBytes();
  auto* slowPathList = FW_STACK_OBJECT(ZelPktList, listSize);
  auto* reissueList = FW_STACK_OBJECT(ZelPktList, listSize);
  zel_PktListInit(slowPathList);
  zel_PktListInit(reissueList);

  FWWalk walk = {};
  walk.filter = filter;
  walk.ctx = ctx;
  walk.iter = iter;
  walk.slowPathList = slowPathList;
  walk.reissueList = reissueList;
  walk.direction = direction;
  walk.spAttachState = ctx->spAttachState;
  walk.failurePolicy = filter->failurePolicy;
  FWWalkList(&walk, list);
  hold.Unlock();

  if (walk.slowPathUsed) {
    (void)zel_SluiceFaultPackets(filter->handle, slowPathList, direction, 0);
  }
  if (walk.reissueUsed) {
    (void)zel_SluiceIssuePackets(filter->handle, reissueList, SLCGenericDirectionToSwitch);
  }
  return ZEL_OK;
}

void FWParsePacket(ZelPkt* pkt, uint32_t fragOverride, FWPktSummary* summary) {
  const uint32_t frameLen = zel_PktFrameLenGet(pkt);
  uint32_t mappedLen = zel_PktFrameMappedLenGet(pkt);
  if (mappedLen > frameLen) mappedLen = frameLen;
  summary->presence = FW_PKT_RPTAG;
  __builtin_memset(summary->vlan1QTag, 0, sizeof(summary->vlan1QTag));
  FWParseFrame(pkt, zel_PktFrameMappedPointerGet(pkt), frameLen, mappedLen, fragOverride, summary);
}

uint64_t FWPacketTuple(const FWPktSummary* summary, FWRuleTuple* tuple) {
  return FWTupleFromSummary(summary, tuple);
}

ZelStatus FWProcessDefaultAction(FWFilterContext* ctx, ZelPktList* list, uint32_t direction) {
  SLCGenericReadGuard hold(ctx->configLock, SLCGenericReadGuard::Adopt{});
  SLCGenericFilter* filter = ctx->filter;
  const uint32_t spAttachState = ctx->spAttachState;
  const uint32_t defaultAction = ctx->defaultAction;
  const uint32_t failurePolicy = filter->failurePolicy;
  hold.Unlock();

  if (spAttachState == SLCGenericSpDetached && defaultAction == SLCGenericActionPunt) {
    if (failurePolicy != 1) zel_PktListReleaseAllPkts(list);
    return ZEL_OK;
  }
  switch (defaultAction) {
    case SLCGenericActionAccept:
      return ZEL_OK;
    case SLCGenericActionPunt: {
      // A punt needs only a slow path that is not detached: the framework
      // queues for it while it attaches or detaches.
      auto* punted = FW_STACK_OBJECT(ZelPktList, zel_PktListSizeInBytes());
      zel_PktListInit(punted);
      zel_PktListPrepend(punted, list);
      (void)zel_SluiceFaultPackets(filter->handle, punted, direction, 0);
      return ZEL_OK;
    }
    case SLCGenericActionDrop:
      zel_PktListReleaseAllPkts(list);
      return ZEL_OK;
    default:
      return ZEL_FAILURE;
  }
}

ZelStatus FWProcessSlowPathPackets(SLCGenericFilter* filter, ZelPktList* list,
                                   uint32_t direction) {
  (void)zel_SluiceIssuePackets(filter->handle, list, direction);
  return ZEL_OK;
}

uint32_t FWProcessFeatures(FWFilterContext* ctx, ZelPkt* /*pkt*/, const FWPktSummary* summary,
                           uint32_t direction) {
  const uint32_t features = ctx->fwFeatures;
  if ((features & FW_FEATURE_DROP_BPDU) && (summary->presence & FW_PKT_L2)) {
    if (__builtin_memcmp(summary->dMac, kBpduMac, 6) == 0 ||
        __builtin_memcmp(summary->dMac, kCdpMac, 6) == 0) {
      return SLCGenericActionDrop;
    }
  }
  if ((features & FW_FEATURE_DROP_DHCP_SERVER) && direction == SLCGenericDirectionToSwitch &&
      (summary->presence & FW_PKT_UDP)) {
    const uint16_t serverPort =
        (summary->presence & FW_PKT_IPV4) ? kDhcpServerPort : kDhcp6ServerPort;
    if (FWNet16(summary->sPort) == serverPort) return SLCGenericActionDrop;
  }
  return SLCGenericActionAccept;
}

const uint8_t* SLCGenericFindSGEntry(ZelPkt* pkt, uint32_t start, uint32_t end) {
  const uint16_t count = zel_PktSgArrayGet(pkt);
  uint64_t elemStart = 0;
  for (uint16_t i = 0; i < count; ++i) {
    ZelSgElem elem;
    if (zel_PktSgElemGet(pkt, i, &elem) != ZEL_OK) return nullptr;
    const uint64_t elemEnd = elemStart + elem.length;
    if (elemEnd > start) {
      // Headers that straddle two elements are not assembled.
      if (end > elemEnd) return nullptr;
      void* va = nullptr;
      if (zel_MA2VA(elem.machineAddr, elem.length, &va) != ZEL_OK || va == nullptr) {
        return nullptr;
      }
      return static_cast<const uint8_t*>(va) + (start - elemStart);
    }
    elemStart = elemEnd;
  }
  return nullptr;
}
