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
// bytes beyond it. Nothing is allocated except what an action needs; the
// iterators and local lists live on the stack. Large exact tables switch the
// walk to a pipelined shape that overlaps their cache misses (see
// FWWalkList).

#include "firewall/fw_index.h"
#include "firewall/fw_packet.h"
#include "firewall/fw_rules.h"
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

// Byte views of the summary: ethType and vlan1QTag sit together, as do
// ipProto, sPort and dPort, so each group moves as one block between frame,
// summary and tuple.
static_assert(offsetof(FWPktSummary, vlan1QTag) == offsetof(FWPktSummary, ethType) + 2);
static_assert(offsetof(FWPktSummary, sPort) == offsetof(FWPktSummary, ipProto) + 1);
static_assert(offsetof(FWPktSummary, dPort) == offsetof(FWPktSummary, ipProto) + 3);
static_assert(FW_TUPLE_VLAN == FW_TUPLE_ETHTYPE + 2);
static_assert(FW_TUPLE_V4_IPDA == FW_TUPLE_IPSA + 4);
static_assert(FW_TUPLE_V6_IPDA == FW_TUPLE_IPSA + 16);
static_assert(FW_TUPLE_V4_SPORT == FW_TUPLE_V4_PROTO + 1 && FW_TUPLE_V4_DPORT == FW_TUPLE_V4_PROTO + 3);
static_assert(FW_TUPLE_V6_SPORT == FW_TUPLE_V6_PROTO + 1 && FW_TUPLE_V6_DPORT == FW_TUPLE_V6_PROTO + 3);

inline uint8_t* FWSummaryBytes(FWPktSummary* s, size_t member) {
  return reinterpret_cast<uint8_t*>(s) + member;
}
inline const uint8_t* FWSummaryBytes(const FWPktSummary* s, size_t member) {
  return reinterpret_cast<const uint8_t*>(s) + member;
}

// Parses one frame into `s`. `frame` holds `mappedLen` readable bytes of a
// `frameLen`-byte frame. Every presence bit and vlan1QTag are set afresh;
// other fields only where their bit is set.
__attribute__((always_inline)) inline void FWParseFrame(ZelPkt* pkt,
                                                        const uint8_t* __restrict frame,
                                                        uint32_t frameLen, uint32_t mappedLen,
                                                        uint32_t fragOverride,
                                                        FWPktSummary* __restrict s) {
  uint32_t presence = FW_PKT_RPTAG;
  uint32_t vlanTag = 0;
  if (mappedLen < FW_ETH_MIN_PARSED) {
    s->presence = presence;
    __builtin_memcpy(s->vlan1QTag, &vlanTag, 4);
    return;
  }
  // The tag comes from the packet's metadata; an 802.1Q header in the frame
  // is only skipped by the Ethernet parse.
  const uint16_t vlanId = zel_PktVlanIDGet(pkt);
  const uint8_t priority = zel_PktPriorityGet(pkt);
  if (vlanId != 0 || priority != 0) {
    const uint8_t tag[4] = {0x81, 0x00, static_cast<uint8_t>((priority << 5) | (vlanId >> 8)),
                            static_cast<uint8_t>(vlanId & 0xff)};
    __builtin_memcpy(&vlanTag, tag, 4);
  }
  __builtin_memcpy(s->vlan1QTag, &vlanTag, 4);

  presence |= FW_PKT_L2;
  s->dMac = frame;
  s->sMac = frame + 6;
  uint32_t l3;
  const uint8_t* ethType = FWEthernetParse(frame, &l3);
  __builtin_memcpy(s->ethType, ethType, 2);

  const uint16_t type = FWNet16(ethType);
  uint64_t l4;
  uint8_t proto;
  if (type == FW_ETHTYPE_IPV4) {
    if (mappedLen < l3 + 20) {
      s->presence = presence;
      return;
    }
    const uint8_t* ip = frame + l3;
    presence |= FW_PKT_L3 | FW_PKT_IPV4;
    s->ipSa = ip + 12;
    s->ipDa = ip + 16;
    proto = ip[9];
    l4 = l3 + 4u * (ip[0] & 0x0f);  // IHL as it stands, even below 5
    const uint16_t frag = FWNet16(ip + 6);
    if (__builtin_expect((frag & 0x3fff) != 0, 0)) {  // more-fragments or an offset
      presence |= (frag & 0x1fff) != 0 ? FW_PKT_LATER_FRAG : FW_PKT_FIRST_FRAG;
    }
  } else if (type == FW_ETHTYPE_IPV6) {
    if (mappedLen < l3 + 40) {
      s->presence = presence;
      return;
    }
    const uint8_t* ip = frame + l3;
    presence |= FW_PKT_L3 | FW_PKT_IPV6;
    s->ipSa = ip + 8;
    s->ipDa = ip + 24;
    proto = ip[6];
    l4 = l3 + 40;
    if (proto != kProtoTcp && proto != kProtoUdp) {
      proto = FWWalkIpv6Extensions(pkt, frame, frameLen, mappedLen, proto, l4, &l4, &presence);
    }
  } else {
    s->presence = presence;
    return;
  }
  s->ipProto = proto;

  // Ports: never for a later fragment, nor for a first fragment while a
  // fragment override decides fragments without looking at ports. UDP
  // needs its 8-byte header in the frame; TCP its minimal 20-byte header,
  // of which only the ports are read.
  const bool udp = proto == kProtoUdp;
  if ((proto == kProtoTcp || udp) && !(presence & FW_PKT_LATER_FRAG) &&
      !((presence & FW_PKT_FIRST_FRAG) && fragOverride != 0)) {
    const uint32_t headerLen = udp ? 8 : 20;
    if (l4 + headerLen <= frameLen) {
      const uint8_t* ports;
      if (__builtin_expect(l4 + headerLen <= mappedLen, 1)) {
        ports = frame + l4;
      } else {
        ports = SLCGenericFindSGEntry(pkt, static_cast<uint32_t>(l4),
                                      static_cast<uint32_t>(l4 + (udp ? 8 : 4)));
      }
      if (ports != nullptr) {
        __builtin_memcpy(FWSummaryBytes(s, offsetof(FWPktSummary, sPort)), ports, 4);
        presence |= FW_PKT_PORTS | (udp ? FW_PKT_UDP : FW_PKT_TCP);
      }
    }
  }
  s->presence = presence;
}

// The packet's match tuple, in the layout FWCreateTupleFromRule gives a
// rule. Only for packets with ports (so with L2 and L3).
__attribute__((always_inline)) inline void FWFillTupleFromSummary(
    const FWPktSummary* __restrict s, FWRuleTuple* __restrict tuple) {
  uint8_t* t = tuple->bytes;
  const uint8_t* macs = s->dMac;  // sMac follows in the frame
  const uint8_t* sa = s->ipSa;    // ipDa follows in the frame
  __builtin_memcpy(t + FW_TUPLE_DMAC, macs, 12);
  __builtin_memcpy(t + FW_TUPLE_ETHTYPE, FWSummaryBytes(s, offsetof(FWPktSummary, ethType)), 6);
  if (s->presence & FW_PKT_IPV4) {
    __builtin_memcpy(t + FW_TUPLE_IPSA, sa, 8);
    __builtin_memcpy(t + FW_TUPLE_V4_PROTO, FWSummaryBytes(s, offsetof(FWPktSummary, ipProto)), 5);
    tuple->isIPv4 = 1;
  } else {
    __builtin_memcpy(t + FW_TUPLE_IPSA, sa, 32);
    __builtin_memcpy(t + FW_TUPLE_V6_PROTO, FWSummaryBytes(s, offsetof(FWPktSummary, ipProto)),
                     5);
    tuple->isIPv4 = 0;
  }
}

inline void FWDropCurrent(FWWalk* walk) {
  FWIterCatchUp(walk);
  ZelPkt* removed = nullptr;
  zel_PktListIterRemovePkt(walk->iter, &removed);
  zel_PktRelease(removed);
}

// Carries out `action` on the walk's current packet (the iterator caught
// up first) and leaves the iterator on the next packet. `entry` is null for verdicts that come with
// no rule (features, fragment override); the caller has mapped actions that
// need rule parameters to a pass in that case.
void FWApplyAction(FWWalk* walk, ZelPkt* pkt, uint32_t action, FWRuleEntry* entry,
                   const FWPktSummary* summary) {
  FWIterCatchUp(walk);
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

// Two shapes of the walk share the parse and the verdict below. Both take
// their packets from a read-only iterator that runs ahead of the one that
// carries out verdicts (FWLookahead): the packet object and the frame of
// the packets to come are requested from memory while the current one is
// decided, since a frame that just arrived is rarely in the caches.
//
// Direct: each packet is parsed and decided in turn. Used while the exact
// table is small enough to stay in the caches, where the fewest
// instructions win.
//
// Staged: for large tables, whose bucket and entry loads miss the caches,
// the list goes in bursts, and each burst in stages over all its packets:
//   1. eight packets (kHashChunk) are taken and parsed into slots, with
//      their tuples; then their tuples are hashed and each bucket head
//      requested at once; and so on to the end of the burst;
//   2. the entries the bucket heads lead to are requested
//      (FWPrefetchEntry);
//   3. each packet is decided, with the main iterator on it.
// A stage's misses are all in flight before the next stage waits for the
// first of them. The list is walked with at most bucket requests in
// flight: each step of the walk reads the packet object the step before
// found, and heavier table traffic during the walk slowed those steps down
// more than it gained. At 1,000,000 exact rules, a ring that parsed
// packets ahead and requested buckets and entries a few packets before
// their verdict took 41 ns a packet; these stages overlapped from one
// burst to the next, 43; entries requested and packets decided between
// the parse's chunks, 41-43; the stages as they are, 30-31.
// Where the bucket requests go: hashing is a pass of its own, whose steps
// are short and read only the slot, so the requests overlap it (with each
// burst still parsed whole, 31-32 ns against 32-35 when the requests had a
// pass of their own after the hashing). A tuple hashed right after it is
// written would be read back through the smaller stores that just wrote it,
// which the processor cannot forward to the hash's wider loads. And the
// parse goes by eight: a whole burst of 64 parsed before any hashing outran
// the processor's own prefetch of the packet blocks (timed packet by
// packet, the parse ran at its cache-hit pace for the first 16 packets,
// then waited for memory); a hash pass after every eight lets that prefetch
// catch up (parse and hash 50 timestamp cycles a packet against 54; the
// walk 30.0-31.1 ns against 31.2-32.5).
// Bursts are 64 packets (a common list length) for tables far beyond the
// shared cache, where each burst waits twice for memory; 16 below, where
// the waits are short and longer bursts lose their frames and entries
// from the first-level cache.
// Only the current packet is ever removed or replaced, and nothing is
// inserted, so the iterator ahead and the parsed slots stay valid and the
// main iterator reaches each slot's packet in order. Parsing a packet early
// changes nothing: packets ahead are not touched by the current verdict.
// A burst takes kBurst * 137 bytes of the walk's stack (slot, tuple,
// bucket and a flag): 8.6 KiB for the longer one. Filling the tuple again
// for the verdict, from the summary, would save 3.5 KiB at 2 ns a packet.
constexpr uint32_t kNearBurst = 16;
constexpr uint32_t kHashChunk = 8;
constexpr uint32_t kFarBurst = 64;
// Tables with at least this many buckets (a few thousand exact rules) take
// the staged walk: their bucket heads and the entries behind them no
// longer sit in the per-core caches, and a walk that waits for each miss in
// turn costs several times one that has them in flight.
constexpr uint32_t kStagedMinBuckets = 16384;
// Tables with at least this many buckets (a quarter of a million exact
// rules) take the longer bursts.
constexpr uint32_t kFarMinBuckets = 1u << 20;

// The packets of a list in order, each handed out after its object and
// the head of its frame were requested from memory. A list is linked
// through its packet objects, so an object can only be requested once the
// one before it is read: the iterator stands on the packet whose object
// was requested one step earlier; a step reads that object, requests its
// frame and the next object, and queues the packet, which is handed out
// kLookahead steps later.
constexpr uint32_t kLookahead = 2;

struct FWLookahead {
  ZelPktListIter* iter;
  ZelPkt* ahead;              // the iterator's packet, its object requested; null at the end
  ZelPkt* queue[kLookahead];  // oldest first; null past the end
};

__attribute__((always_inline)) inline void FWLookaheadStep(FWLookahead* la) {
  for (uint32_t i = 0; i + 1 < kLookahead; i++) la->queue[i] = la->queue[i + 1];
  ZelPkt* pkt = la->ahead;
  la->queue[kLookahead - 1] = pkt;
  if (pkt == nullptr) return;
  __builtin_prefetch(zel_PktFrameMappedPointerGet(pkt));
  ZelPktListIter* iter = la->iter;
  zel_PktListIterMove(iter);
  la->ahead = zel_PktListIterIsAtEnd(iter) ? nullptr : zel_PktListIterGetPkt(iter);
  __builtin_prefetch(la->ahead);
}

inline void FWLookaheadStart(FWLookahead* la, ZelPktList* list, ZelPktListIter* iter) {
  zel_PktListIterStart(list, iter);
  la->iter = iter;
  la->ahead = zel_PktListIterIsAtEnd(iter) ? nullptr : zel_PktListIterGetPkt(iter);
  for (uint32_t i = 0; i < kLookahead; i++) la->queue[i] = nullptr;
  for (uint32_t i = 0; i < kLookahead; i++) FWLookaheadStep(la);
}

// The next packet, or null at the end of the list.
__attribute__((always_inline)) inline ZelPkt* FWLookaheadTake(FWLookahead* la) {
  ZelPkt* pkt = la->queue[0];
  if (pkt != nullptr) FWLookaheadStep(la);
  return pkt;
}

struct FWParsedPkt {
  ZelPkt* pkt;
  uint32_t hash;      // low 32 bits of the tuple hash, when it has a bucket
  uint32_t frameLen;
  FWPktSummary summary;
};
static_assert(sizeof(FWParsedPkt) == 72);

// The exact-rule table as the walk reads it; fixed for the walk. `probe`
// is false when the table holds no entry: packets then get no tuple.
struct FWTableView {
  const ListLinks* buckets;
  uint32_t mask;
  bool probe;
};

// Parses `pkt` into `slot`. Returns whether the packet probes the exact
// table (only packets with ports can equal an exact rule); such a packet
// also gets its tuple, in `tuple`.
__attribute__((always_inline)) inline bool FWParseInto(ZelPkt* pkt, FWParsedPkt* slot,
                                                       FWRuleTuple* tuple, uint32_t fragOverride,
                                                       FWTableView table) {
  const uint32_t frameLen = zel_PktFrameLenGet(pkt);
  uint32_t mappedLen = zel_PktFrameMappedLenGet(pkt);
  if (mappedLen > frameLen) mappedLen = frameLen;
  FWParseFrame(pkt, zel_PktFrameMappedPointerGet(pkt), frameLen, mappedLen, fragOverride,
               &slot->summary);
  slot->pkt = pkt;
  slot->frameLen = frameLen;
  if (!table.probe || (slot->summary.presence & FW_PKT_PORTS) == 0) return false;
  FWFillTupleFromSummary(&slot->summary, tuple);
  return true;
}

// Hashes the tuple FWParseInto made for `slot`, keeps the hash there and
// returns the bucket to probe.
__attribute__((always_inline)) inline const ListLinks* FWHashInto(FWParsedPkt* slot,
                                                                  const FWRuleTuple* tuple,
                                                                  FWTableView table) {
  const uint32_t hash = static_cast<uint32_t>(FWTupleHash(tuple));
  slot->hash = hash;
  return table.buckets + (hash & table.mask);
}

// The two cache lines of a rule entry the exact probe reads: links, hash,
// direction and action; match fields and counters.
__attribute__((always_inline)) inline void FWPrefetchLines(const ListLinks* link) {
  const char* e = reinterpret_cast<const char*>(link);
  __builtin_prefetch(e);
  __builtin_prefetch(e + 64);
}

// The entries the exact probe may compare, as far as the bucket head tells
// them: the oldest, where the probe starts, and the newest. At a quarter
// load about one hit in eight is not its bucket's oldest entry, and almost
// always the bucket's second of two, the newest; reaching it through the
// oldest would cost a second miss after the first.
__attribute__((always_inline)) inline void FWPrefetchEntry(const ListLinks* bucket) {
  const ListLinks* oldest = bucket->prev;
  if (oldest == bucket) return;
  FWPrefetchLines(oldest);
  const ListLinks* newest = bucket->next;
  if (newest != oldest) FWPrefetchLines(newest);
}

// Rule counters are plain adds under the shared hold: walks on other
// processors may count on the same rule at once and lose an increment, which
// statistics can afford (an atomic add per packet would cost more than the
// rest of the lookup). The race is intended, so it is kept out of the thread
// sanitizer's reports.
__attribute__((no_sanitize("thread"))) inline void FWCountHit(FWRuleEntry* entry,
                                                              uint32_t frameLen) {
  entry->rule.pktCount += 1;
  entry->rule.byteCount += frameLen;
}

// Decides the packet of `cur`, with its bucket and tuple from FWParseInto
// (no exact probe when `bucket` is null). The main iterator stands on it
// once caught up (FWWalk::lag); afterwards it stands on the next packet, or
// lags behind it. `early` tells that the ruleset has feature bits or a
// fragment override, which may decide before the lookup.
__attribute__((always_inline)) inline void FWDecide(FWWalk* walk, const FWParsedPkt* cur,
                                                    const ListLinks* bucket,
                                                    const FWRuleTuple* tuple, bool early,
                                                    bool haveGeneralRules) {
  FWFilterContext* ctx = walk->ctx;
  ZelPkt* pkt = cur->pkt;
  const FWPktSummary* summary = &cur->summary;
  const uint32_t direction = walk->direction;

  if (__builtin_expect(early, 0)) {
    if (ctx->fwFeatures != 0 &&
        FWProcessFeatures(ctx, pkt, summary, direction) == SLCGenericActionDrop) {
      FWDropCurrent(walk);
      return;
    }
    if ((summary->presence & (FW_PKT_FIRST_FRAG | FW_PKT_LATER_FRAG)) != 0 &&
        ctx->fragOverride != 0) {
      FWApplyAction(walk, pkt, FWOverrideAction(ctx->fragOverride), nullptr, summary);
      return;
    }
  }

  FWRuleEntry* entry = nullptr;
  if (bucket != nullptr) {
    // FWFindExactRule, with the bucket found at parse time.
    entry = FWExactAccepts(FWBucketFindEntry(bucket, tuple, cur->hash), direction, pkt);
  }
  if (entry == nullptr && haveGeneralRules) {
    entry = FWFindRuleForPacket(walk->filter, pkt, direction, summary);
  }
  if (entry == nullptr) {
    walk->lag++;
    return;
  }
  FWCountHit(entry, cur->frameLen);
  const uint32_t action = entry->rule.action;
  if (action == SLCGenericActionAccept) {  // the common verdict, without the dispatch
    walk->lag++;
    return;
  }
  FWApplyAction(walk, pkt, action, entry, summary);
}

// The staged walk (see above), in bursts of kBurst packets. Slot i's
// tuple and bucket are tuples[i] and buckets[i].
template <uint32_t kBurst>
void FWWalkStaged(FWWalk* walk, FWLookahead* la, FWTableView table, uint32_t fragOverride,
                  bool early, bool haveGeneralRules) {
  FWParsedPkt burst[kBurst];
  FWRuleTuple tuples[kBurst];
  const ListLinks* buckets[kBurst];
  bool probes[kBurst];
  uint32_t n;
  static_assert(kBurst % kHashChunk == 0);
  do {
    n = 0;
    while (n < kBurst) {
      const uint32_t first = n;
      while (n < first + kHashChunk) {
        ZelPkt* pkt = FWLookaheadTake(la);
        if (pkt == nullptr) break;
        probes[n] = FWParseInto(pkt, &burst[n], &tuples[n], fragOverride, table);
        n++;
      }
      for (uint32_t i = first; i < n; i++) {
        buckets[i] = probes[i] ? FWHashInto(&burst[i], &tuples[i], table) : nullptr;
        if (buckets[i] != nullptr) __builtin_prefetch(buckets[i]);
      }
      if (n < first + kHashChunk) break;  // the list ended
    }
    for (uint32_t i = 0; i < n; i++) {
      if (buckets[i] != nullptr) FWPrefetchEntry(buckets[i]);
    }
    for (uint32_t i = 0; i < n; i++) {
      FWDecide(walk, &burst[i], buckets[i], &tuples[i], early, haveGeneralRules);
    }
  } while (n == kBurst);
}

// The walk proper; configLock held shared, ruleHash not null. `ahead` is
// storage for the iterator that runs ahead.
void FWWalkList(FWWalk* walk, ZelPktList* list, ZelPktListIter* ahead) {
  FWFilterContext* ctx = walk->ctx;
  // Every entry created since the rules were last cleared or replaced
  // counts in numRules, which single removals do not lower; the scan index
  // holds at most the general entries alive when it was built, all counted
  // there. So when the two are equal, no exact entry is alive.
  const uint32_t general = ctx->scanIndex != nullptr ? ctx->scanIndex->count : 0;
  const FWTableView table = {ctx->ruleHash->buckets, ctx->ruleHash->numBuckets - 1,
                             ctx->numRules != general};
  const uint32_t fragOverride = ctx->fragOverride;
  const bool haveGeneralRules = !List_IsEmpty(&ctx->ruleList);
  const bool early = ctx->fwFeatures != 0 || fragOverride != 0;
  zel_PktListIterStart(list, walk->iter);
  FWLookahead la;
  FWLookaheadStart(&la, list, ahead);

  if (!table.probe || ctx->ruleHash->numBuckets < kStagedMinBuckets) {
    FWParsedPkt cur;
    FWRuleTuple tuple;
    while (ZelPkt* pkt = FWLookaheadTake(&la)) {
      const ListLinks* bucket = FWParseInto(pkt, &cur, &tuple, fragOverride, table)
                                    ? FWHashInto(&cur, &tuple, table)
                                    : nullptr;
      FWDecide(walk, &cur, bucket, &tuple, early, haveGeneralRules);
    }
    return;
  }

  if (ctx->ruleHash->numBuckets < kFarMinBuckets) {
    FWWalkStaged<kNearBurst>(walk, &la, table, fragOverride, early, haveGeneralRules);
  } else {
    FWWalkStaged<kFarBurst>(walk, &la, table, fragOverride, early, haveGeneralRules);
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

  const size_t iterSize = zel_PktListIterSizeOf();
  auto* iter = FW_STACK_OBJECT(ZelPktListIter, iterSize);
  auto* ahead = FW_STACK_OBJECT(ZelPktListIter, iterSize);
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
  FWWalkList(&walk, list, ahead);
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
  FWParseFrame(pkt, zel_PktFrameMappedPointerGet(pkt), frameLen, mappedLen, fragOverride, summary);
}

uint64_t FWPacketTuple(const FWPktSummary* summary, FWRuleTuple* tuple) {
  FWFillTupleFromSummary(summary, tuple);
  return FWTupleHash(tuple);
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
