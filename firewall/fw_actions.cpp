// Packet-modifying actions of the firewall: L2 rewrite, GRE-encapsulated
// copy, DSCP mark with the IPv4 header checksum. (Pool tag and 802.1p mark
// are single host calls made by the walk itself.)
//
// A packet is written in place when it is writable and the bytes to change
// are mapped; otherwise a partial copy whose first bytes are mapped and
// writable takes its place. All of this runs under the walk's shared hold of
// configLock.

#include "firewall/fw_packet.h"

namespace {

constexpr uint32_t kEthHeaderLen = 14;
constexpr uint32_t kGreHeaderLen = 4;
// No flags, version 0, protocol 0x6558 (transparent Ethernet bridging).
constexpr uint8_t kGreHeader[kGreHeaderLen] = {0x00, 0x00, 0x65, 0x58};

// States of FWRuleEntry::greSocketOpen. Only walks, which share configLock,
// can see "opening"; the code that copies and frees entries (and so reads
// the flag elsewhere) holds configLock exclusively, when no walk runs.
constexpr uint8_t kGreSocketClosed = 0;
constexpr uint8_t kGreSocketOpen = 1;
constexpr uint8_t kGreSocketOpening = 2;  // one walk is creating it

// A 16-byte BSD IPv4 socket address.
struct FWSockAddrIn {
  uint8_t len;
  uint8_t family;
  uint8_t port[2];
  uint8_t addr[4];
  uint8_t zero[8];
};
static_assert(sizeof(FWSockAddrIn) == 16);

inline uint32_t FWUsableMappedLen(ZelPkt* pkt) {
  const uint32_t frameLen = zel_PktFrameLenGet(pkt);
  const uint32_t mapped = zel_PktFrameMappedLenGet(pkt);
  return mapped < frameLen ? mapped : frameLen;
}

inline void FWCpuRelax() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#endif
}

// Makes sure the entry's GRE socket is open, creating it at most once even
// when several walks meet a new entry together: the walk that moves the
// state from closed to opening creates the socket; the others wait for the
// outcome. A failed creation returns the state to closed, so the next packet
// tries again. Returns false when there is no socket to send on.
bool FWGREEnsureSocket(SLCGenericFilter* filter, FWRuleEntry* entry) {
  for (;;) {
    uint8_t state = __atomic_load_n(&entry->greSocketOpen, __ATOMIC_ACQUIRE);
    if (state == kGreSocketOpen) return true;
    if (state == kGreSocketOpening) {
      FWCpuRelax();
      continue;
    }
    if (__atomic_compare_exchange_n(&entry->greSocketOpen, &state, kGreSocketOpening, false,
                                    __ATOMIC_ACQUIRE, __ATOMIC_ACQUIRE)) {
      break;
    }
  }

  ZelSocket sock = 0;
  ZelStatus status = zel_SocketCreate(ZEL_AF_INET, ZEL_SOCK_RAW, ZEL_IPPROTO_GRE, &sock);
  if (status != ZEL_OK) {
    __atomic_store_n(&entry->greSocketOpen, kGreSocketClosed, __ATOMIC_RELEASE);
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Unable to create socket for GRE encapsulation");
    return false;
  }
  // The option is set before the socket is published, so no other walk
  // sends on a blocking socket; one whose option failed stays open and
  // flagged and is used as it is from the next packet on.
  const int32_t one = 1;
  const ZelStatus optStatus =
      zel_SocketSetSockOpt(sock, ZEL_SOL_SOCKET, ZEL_SO_NONBLOCKING, &one, sizeof(one));
  entry->greSocket = sock;
  __atomic_store_n(&entry->greSocketOpen, kGreSocketOpen, __ATOMIC_RELEASE);
  if (optStatus != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Non-blocking sockopt failed: %d",
                 static_cast<int32_t>(optStatus));
    return false;
  }
  return true;
}

}  // namespace

uint16_t FWIpv4HeaderChecksum(const uint8_t* header, uint32_t len) {
  uint32_t sum = 0;
  for (uint32_t i = 0; i + 1 < len; i += 2) sum += FWNet16(header + i);
  while (sum >> 16) sum = (sum & 0xffff) + (sum >> 16);
  return static_cast<uint16_t>(~sum);
}

bool FWActionL2Rewrite(FWWalk* walk, ZelPkt* pkt, const FWRule* rule) {
  ZelPkt* target = pkt;
  if (FWUsableMappedLen(pkt) < kEthHeaderLen || !zel_PktIsBufDescWritable(pkt)) {
    if (zel_PktPartialCopy(pkt, kEthHeaderLen, &target) != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, walk->filter->name, "copy error when forwarding pkt");
      return false;
    }
  }
  uint8_t* eth = zel_PktFrameMappedPointerGet(target);

  if (walk->direction == SLCGenericDirectionFromSwitch) {
    // Turned around: back toward the switch, from where it was going.
    __builtin_memcpy(eth + 6, eth, 6);
    __builtin_memcpy(eth, rule->rewriteMac, 6);
    ZelPkt* removed = nullptr;
    zel_PktListIterRemovePkt(walk->iter, &removed);
    if (target != pkt) zel_PktRelease(removed);
    zel_PktListAppendPkt(walk->reissueList, target);
    walk->reissueUsed = true;
    return true;
  }

  __builtin_memcpy(eth, rule->rewriteMac, 6);
  if (target != pkt) zel_PktListIterReplace(walk->iter, target);
  return false;
}

ZelPkt* FWActionDSCPMark(FWWalk* walk, ZelPkt* pkt, const FWPktSummary* summary,
                         uint16_t dscpTag) {
  if ((summary->presence & FW_PKT_L3) != FW_PKT_L3) return pkt;
  const uint16_t ethType = FWNet16(summary->ethType);
  if (ethType != FW_ETHTYPE_IPV4 && ethType != FW_ETHTYPE_IPV6) return pkt;

  const uint32_t frameLen = zel_PktFrameLenGet(pkt);
  const uint32_t mappedLen = FWUsableMappedLen(pkt);
  const uint8_t* frame = zel_PktFrameMappedPointerGet(pkt);
  if (mappedLen < FW_ETH_MIN_PARSED) return pkt;
  uint32_t l3;
  (void)FWEthernetParse(frame, &l3);
  if (l3 >= mappedLen) return pkt;

  const bool v4 = ethType == FW_ETHTYPE_IPV4;
  uint32_t headerLen = 40;
  if (v4) {
    headerLen = 4u * (frame[l3] & 0x0f);
    if (headerLen < 20) return pkt;
  }
  const uint32_t needed = l3 + headerLen;
  if (needed > frameLen) return pkt;

  ZelPkt* target = pkt;
  if (!zel_PktIsBufDescWritable(pkt) || needed > mappedLen) {
    if (zel_PktPartialCopy(pkt, needed, &target) != ZEL_OK) return pkt;
    zel_PktListIterReplace(walk->iter, target);
  }
  uint8_t* ip = zel_PktFrameMappedPointerGet(target) + l3;
  const uint8_t dscp = static_cast<uint8_t>(dscpTag & 0x3f);

  if (v4) {
    ip[1] = static_cast<uint8_t>((ip[1] & 0x03) | (dscp << 2));
    ip[10] = 0;
    ip[11] = 0;
    FWPutNet16(ip + 10, FWIpv4HeaderChecksum(ip, headerLen));
  } else {
    // Traffic class = DSCP and ECN across the low nibble of byte 0 and the
    // top nibble of byte 1; version, ECN and flow label stay.
    ip[0] = static_cast<uint8_t>((ip[0] & 0xf0) | (dscp >> 2));
    ip[1] = static_cast<uint8_t>((ip[1] & 0x3f) | ((dscp & 0x03) << 6));
  }
  return target;
}

void FWGRESend(SLCGenericFilter* filter, FWRuleEntry* entry, ZelPkt* pkt) {
  const FWRule& rule = entry->rule;
  const uint32_t snapLen = rule.snapLen;
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name,
               "Got packet for GRE encapsulation to IP %u.%u.%u.%u with snapLen %d",
               rule.greIP[0], rule.greIP[1], rule.greIP[2], rule.greIP[3],
               static_cast<int32_t>(snapLen));

  if (!FWGREEnsureSocket(filter, entry)) return;

  FWSockAddrIn dest = {};
  dest.len = sizeof(FWSockAddrIn);
  dest.family = static_cast<uint8_t>(ZEL_AF_INET);
  __builtin_memcpy(dest.addr, rule.greIP, 4);

  const uint32_t frameLen = zel_PktFrameLenGet(pkt);
  if (frameLen > UINT32_MAX - kGreHeaderLen) return;
  auto* buffer = static_cast<uint8_t*>(SLCGenericAlloc(frameLen + kGreHeaderLen));
  if (buffer == nullptr) return;
  __builtin_memcpy(buffer, kGreHeader, kGreHeaderLen);

  // The frame, element by element; with a snap length only its first
  // snapLen bytes. The buffer holds the frame length, whatever the elements
  // claim.
  const uint32_t limit = (snapLen != 0 && snapLen < frameLen) ? snapLen : frameLen;
  uint32_t copied = 0;
  const uint16_t count = zel_PktSgArrayGet(pkt);
  for (uint16_t i = 0; i < count && copied < limit; ++i) {
    ZelSgElem elem;
    void* va = nullptr;
    if (zel_PktSgElemGet(pkt, i, &elem) != ZEL_OK ||
        zel_MA2VA(elem.machineAddr, elem.length, &va) != ZEL_OK || va == nullptr) {
      SLCGenericFree(buffer);
      return;
    }
    uint32_t take = limit - copied;
    if (elem.length < take) take = elem.length;
    __builtin_memcpy(buffer + kGreHeaderLen + copied, va, take);
    copied += take;
  }

  size_t sent = 0;
  (void)zel_SocketSendTo(entry->greSocket, 0, &dest, buffer, kGreHeaderLen + copied, &sent);
  SLCGenericFree(buffer);
}
