// Packets, packet lists and scatter-gather elements of the virtual switch,
// resource-pool tags, and raw sockets.
//
// A packet's frame is stored in one or more scatter-gather elements. Its
// first `mapped length` bytes are contiguous and directly readable at the
// mapped pointer; bytes beyond that are reached by looking the element up and
// mapping its machine address.
//
// Packet lists and iterators are host objects whose size is known only at
// run time; callers place them in storage of zel_PktListSizeInBytes() and
// zel_PktListIterSizeOf() bytes (aligned to 16). Several iterators may walk
// one list: removing or replacing the packet under one iterator leaves the
// others valid as long as none of them stands on that packet.
#pragma once

#include "platform/zel_status.h"

struct ZelPkt;
struct ZelPktList;
struct ZelPktListIter;

size_t zel_PktListSizeInBytes();
size_t zel_PktListIterSizeOf();

void zel_PktListInit(ZelPktList* list);
void zel_PktListIterStart(ZelPktList* list, ZelPktListIter* iter);
bool zel_PktListIterIsAtEnd(ZelPktListIter* iter);
ZelPkt* zel_PktListIterGetPkt(ZelPktListIter* iter);
void zel_PktListIterMove(ZelPktListIter* iter);
// Removes the current packet and hands it out; the iterator moves to the next.
void zel_PktListIterRemovePkt(ZelPktListIter* iter, ZelPkt** pkt);
// `pkt` takes the current packet's place; the host releases the replaced one.
void zel_PktListIterReplace(ZelPktListIter* iter, ZelPkt* pkt);
void zel_PktListAppendPkt(ZelPktList* list, ZelPkt* pkt);
// Moves every packet of `src`, in order, to the front of `dst`.
void zel_PktListPrepend(ZelPktList* dst, ZelPktList* src);
uint32_t zel_PktListGetCount(ZelPktList* list);
void zel_PktListReleaseAllPkts(ZelPktList* list);

uint32_t zel_PktFrameLenGet(ZelPkt* pkt);
uint32_t zel_PktFrameMappedLenGet(ZelPkt* pkt);
uint8_t* zel_PktFrameMappedPointerGet(ZelPkt* pkt);
uint16_t zel_PktVlanIDGet(ZelPkt* pkt);
uint8_t zel_PktPriorityGet(ZelPkt* pkt);
[[nodiscard]] ZelStatus zel_PktPrioritySet(ZelPkt* pkt, uint8_t priority);
[[nodiscard]] ZelStatus zel_PktResPoolTagGet(ZelPkt* pkt, uint16_t* tag);
[[nodiscard]] ZelStatus zel_PktResPoolTagSet(ZelPkt* pkt, uint16_t tag);
bool zel_PktIsBufDescWritable(ZelPkt* pkt);

[[nodiscard]] ZelStatus zel_PktClone(ZelPkt* pkt, ZelPkt** clone);
// Copies the packet so that the copy's first `len` bytes are mapped and
// writable.
[[nodiscard]] ZelStatus zel_PktPartialCopy(ZelPkt* pkt, uint32_t len, ZelPkt** copy);
void zel_PktRelease(ZelPkt* pkt);

struct ZelSgElem {
  uint64_t machineAddr;
  uint32_t length;
};

// Number of scatter-gather elements of the packet's frame.
uint16_t zel_PktSgArrayGet(ZelPkt* pkt);
[[nodiscard]] ZelStatus zel_PktSgElemGet(ZelPkt* pkt, uint16_t index, ZelSgElem* elem);
// Maps `len` bytes at machine address `ma` to a readable address.
[[nodiscard]] ZelStatus zel_MA2VA(uint64_t ma, uint32_t len, void** va);

// ---------------------------------------------------------------------------
// Resource pools of the virtual switch

inline constexpr uint16_t ZEL_INVALID_RES_POOL_TAG = 0xffff;

// The tag of the pool named `name`, or ZEL_INVALID_RES_POOL_TAG. Every tag
// obtained is handed back once with zel_PortsetPutResPoolTag.
uint16_t zel_PortsetGetResPoolTag(const char* name);
void zel_PortsetPutResPoolTag(uint16_t tag);

// ---------------------------------------------------------------------------
// Sockets (BSD-style)

using ZelSocket = uint64_t;

inline constexpr int32_t ZEL_AF_INET = 2;
inline constexpr int32_t ZEL_SOCK_RAW = 3;
inline constexpr int32_t ZEL_IPPROTO_GRE = 47;
inline constexpr int32_t ZEL_SOL_SOCKET = 0xffff;
inline constexpr int32_t ZEL_SO_NONBLOCKING = 0x1015;

[[nodiscard]] ZelStatus zel_SocketCreate(int32_t family, int32_t type, int32_t protocol,
                                         ZelSocket* sock);
[[nodiscard]] ZelStatus zel_SocketSetSockOpt(ZelSocket sock, int32_t level, int32_t option,
                                             const void* value, uint32_t len);
// `addr` is a 16-byte BSD socket address (length, family, port, address).
[[nodiscard]] ZelStatus zel_SocketSendTo(ZelSocket sock, int32_t flags, const void* addr,
                                         const void* buf, size_t len, size_t* sent);
void zel_SocketClose(ZelSocket sock);
