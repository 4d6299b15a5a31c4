// Host packets, packet lists and scatter-gather elements.
//
// A packet is a ZelPkt record holding its frame as scatter-gather elements,
// each its own heap buffer. The packet getters are the module's fast path:
// they check the record's magic inline and touch nothing else. Everything
// that creates or ends a packet goes through the registry below, which
// knows every live packet and every element buffer (for zel_MA2VA).
//
// Released records are not freed at once: they sit in a bounded quarantine
// with a dead magic, so that a use or a second release of a recently
// released packet is reported instead of reading reused memory.
//
// Layout follows the fast path, as a kernel's packet head does: what the
// getters and list walks read fills the record's first cache line, and
// element 0 of a frame up to kInlineFrameMax bytes follows it in the same
// block (from the host's slab, slab.h), so the headers a filter parses sit
// in the next line. Everything else (serial, frozen hash, the element
// table) lives in a side record.
//
// Packet lists are doubly linked through the packets themselves, so every
// list operation is O(1) per packet, and a packet knows the list it is in.
// Lists and iterators are not locked: like the kernel's, a list belongs to
// one context at a time.
#include <algorithm>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <new>
#include <set>
#include <unordered_set>

#include "host/core/faults.h"
#include "host/core/host_core.h"
#include "host/core/slab.h"
#include "host/net/packets.h"

namespace host {
namespace {

constexpr uint64_t kPktMagic = 0x3074656b63617021ULL;     // "!packet0"
constexpr uint64_t kDeadPktMagic = ~kPktMagic;            // released
constexpr uint64_t kResetPktMagic = 0x2174657365722121ULL;  // freed by Reset
constexpr uint64_t kListMagic = 0x307473696c746b70ULL;    // "pktlist0"
constexpr uint64_t kIterMagic = 0x3072657469746b70ULL;    // "pktiter0"

// Machine addresses are buffer addresses XORed with this key: the result is
// a non-canonical address, so dereferencing one faults instead of working by
// accident.
constexpr uint64_t kMachineAddrKey = 0xa5c3000000000000ULL;

constexpr size_t kQuarantineSize = 4096;

// Element 0 of at most this many bytes lives in its packet's block.
constexpr uint32_t kInlineFrameMax = 2048;

}  // namespace

// An element buffer: its own allocation, or (element 0 of a small frame)
// the room behind its packet record, freed with the record.
struct SgFree {
  bool inRecord = false;
  void operator()(uint8_t* p) const {
    if (!inRecord) delete[] p;
  }
};

struct PktSgBuffer {
  std::unique_ptr<uint8_t[], SgFree> data;
  uint32_t length = 0;
  bool hidden = false;
};

struct PktCold {
  uint64_t serial = 0;
  uint64_t frozenHash = 0;  // frame hash of a read-only packet, checked on release
  std::vector<PktSgBuffer> sg;
};

}  // namespace host

struct alignas(64) ZelPkt {
  uint64_t magic;
  uint8_t* mapped;          // element 0's buffer
  uint32_t frameLen;
  uint32_t mappedLen;       // <= element 0's length
  uint16_t vlanId;
  uint16_t resPoolTag;
  uint8_t priority;
  bool writable;
  uint16_t blockBytes;      // the record's block: record and inline element 0
  ZelPkt* next;             // list links, valid while `list` is set
  ZelPkt* prev;
  ZelPktList* list;
  host::PktCold* cold;
};
static_assert(sizeof(ZelPkt) == 64, "the record is one cache line");

struct ZelPktList {
  uint64_t magic;
  ZelPkt* head;
  ZelPkt* tail;
  uint32_t count;
};

struct ZelPktListIter {
  uint64_t magic;
  ZelPktList* list;
  ZelPkt* cur;              // null at the end
};

namespace host {
namespace {

struct ElemInfo {
  uint32_t length;
  ZelPkt* pkt;
};

struct Registry {
  std::mutex mu;
  std::unordered_set<ZelPkt*> live;
  std::map<uintptr_t, ElemInfo> elems;   // element buffer start -> element
  std::deque<ZelPkt*> quarantine;
  std::vector<ZelPkt*> resetGraveyard;   // freed by the last Reset
  std::set<PacketList*> testLists;
  uint64_t nextSerial = 1;
};

// Never destroyed: packets may still be released by other subsystems' static
// destructors.
Registry& Reg() {
  static Registry* reg = new Registry;
  return *reg;
}

[[noreturn]] __attribute__((noinline, cold)) void BadPacket(const ZelPkt* pkt, const char* call) {
  if (pkt == nullptr) Fatal("%s: null packet", call);
  if (pkt->magic == kDeadPktMagic) Fatal("%s: use of released packet %p", call, (const void*)pkt);
  if (pkt->magic == kResetPktMagic) {
    Fatal("%s: packet %p was freed by a host reset", call, (const void*)pkt);
  }
  Fatal("%s: %p is not a packet", call, (const void*)pkt);
}

inline ZelPkt* Checked(ZelPkt* pkt, const char* call) {
  if (__builtin_expect(pkt == nullptr || pkt->magic != kPktMagic, 0)) BadPacket(pkt, call);
  return pkt;
}

#define CHECK_PKT(pkt) Checked((pkt), __func__)

inline ZelPktList* CheckedList(ZelPktList* list, const char* call) {
  if (__builtin_expect(list == nullptr || list->magic != kListMagic, 0)) {
    Fatal("%s: %p is not an initialised packet list", call, (void*)list);
  }
  return list;
}

[[noreturn]] __attribute__((noinline, cold)) void BadIter(const ZelPktListIter* iter,
                                                       const char* call) {
  if (iter == nullptr || iter->magic != kIterMagic) {
    Fatal("%s: %p is not a started packet list iterator", call, (const void*)iter);
  }
  if (iter->cur == nullptr) Fatal("%s: iterator is at the end", call);
  Fatal("%s: the iterator's packet %p left its list", call, (const void*)iter->cur);
}

// The reads (at end, current packet) check the iterator only; every step
// and change also checks that its packet is still in the list: a packet
// taken out of the list behind the iterator's back leaves it dangling.
inline ZelPktListIter* StartedIter(ZelPktListIter* iter, const char* call) {
  if (__builtin_expect(iter == nullptr || iter->magic != kIterMagic, 0)) BadIter(iter, call);
  return iter;
}

inline ZelPktListIter* CheckedIter(ZelPktListIter* iter, const char* call) {
  StartedIter(iter, call);
  if (__builtin_expect(iter->cur != nullptr && iter->cur->list != iter->list, 0)) {
    BadIter(iter, call);
  }
  return iter;
}

// An iterator standing on a packet of its list, about to step or change it.
inline ZelPktListIter* CheckedIterOnPkt(ZelPktListIter* iter, const char* call) {
  if (__builtin_expect(iter == nullptr || iter->magic != kIterMagic || iter->cur == nullptr ||
                           iter->cur->list != iter->list,
                       0)) {
    BadIter(iter, call);
  }
  return iter;
}

uint64_t FrameHash(const ZelPkt* pkt) {
  uint64_t h = 0;
  for (const PktSgBuffer& b : pkt->cold->sg) h = h * 31 + HashFunc_HashBytes(b.data.get(), b.length);
  return h;
}

// A read-only packet whose bytes changed was written by someone who should
// have made a copy first.
void CheckNotWritten(const ZelPkt* pkt, const char* call) {
  if (!pkt->writable && FrameHash(pkt) != pkt->cold->frozenHash) {
    Fatal("%s: read-only packet %p (serial %llu) was written in place", call, (const void*)pkt,
          (unsigned long long)pkt->cold->serial);
  }
}

void FreeRecord(ZelPkt* pkt) {
  delete pkt->cold;
  const size_t bytes = pkt->blockBytes;
  pkt->~ZelPkt();
  SlabFree(pkt, bytes);
}

struct Meta {
  uint16_t vlanId;
  uint8_t priority;
  uint16_t resPoolTag;
  bool writable;
  uint64_t serial;   // 0 = a new one
};

// Builds and registers a packet from `frame` split into elements of
// `sizes` (which add up to the frame length), mapping `mappedLen` bytes of
// element 0.
ZelPkt* NewPacket(const uint8_t* frame, const std::vector<uint32_t>& sizes, uint32_t mappedLen,
                  const Meta& meta) {
  const uint32_t inlineLen = sizes[0] <= kInlineFrameMax ? std::max<uint32_t>(sizes[0], 1) : 0;
  const uint32_t bytes = static_cast<uint32_t>(sizeof(ZelPkt)) + inlineLen;
  void* block = SlabAlloc(bytes);
  if (block == nullptr) Fatal("packets: out of memory");
  ZelPkt* pkt = new (block) ZelPkt{};
  pkt->blockBytes = static_cast<uint16_t>(bytes);
  pkt->cold = new PktCold{};
  uint32_t off = 0;
  for (uint32_t size : sizes) {
    PktSgBuffer b;
    if (inlineLen != 0 && pkt->cold->sg.empty()) {
      b.data = std::unique_ptr<uint8_t[], SgFree>(reinterpret_cast<uint8_t*>(pkt + 1),
                                                  SgFree{true});
    } else {
      b.data.reset(new uint8_t[std::max<uint32_t>(size, 1)]);
    }
    b.length = size;
    if (size != 0) std::memcpy(b.data.get(), frame + off, size);
    off += size;
    pkt->cold->sg.push_back(std::move(b));
  }
  pkt->frameLen = off;
  pkt->mapped = pkt->cold->sg[0].data.get();
  pkt->mappedLen = mappedLen;
  pkt->vlanId = meta.vlanId;
  pkt->priority = meta.priority;
  pkt->resPoolTag = meta.resPoolTag;
  pkt->writable = meta.writable;
  if (!pkt->writable) pkt->cold->frozenHash = FrameHash(pkt);

  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  pkt->cold->serial = meta.serial != 0 ? meta.serial : reg.nextSerial++;
  for (const PktSgBuffer& b : pkt->cold->sg) {
    reg.elems[reinterpret_cast<uintptr_t>(b.data.get())] = ElemInfo{b.length, pkt};
  }
  reg.live.insert(pkt);
  pkt->magic = kPktMagic;
  return pkt;
}

std::vector<uint8_t> Gather(const ZelPkt* pkt) {
  std::vector<uint8_t> out;
  out.reserve(pkt->frameLen);
  for (const PktSgBuffer& b : pkt->cold->sg) out.insert(out.end(), b.data.get(), b.data.get() + b.length);
  return out;
}

std::vector<uint32_t> Sizes(const ZelPkt* pkt) {
  std::vector<uint32_t> sizes;
  for (const PktSgBuffer& b : pkt->cold->sg) sizes.push_back(b.length);
  return sizes;
}

Meta MetaOf(const ZelPkt* pkt) {
  return Meta{pkt->vlanId, pkt->priority, pkt->resPoolTag, pkt->writable, pkt->cold->serial};
}

void ReleaseLocked(Registry& reg, ZelPkt* pkt) {
  for (const PktSgBuffer& b : pkt->cold->sg) reg.elems.erase(reinterpret_cast<uintptr_t>(b.data.get()));
  pkt->cold->sg.clear();
  pkt->cold->sg.shrink_to_fit();
  pkt->mapped = nullptr;
  pkt->magic = kDeadPktMagic;
  reg.quarantine.push_back(pkt);
  if (reg.quarantine.size() > kQuarantineSize) {
    FreeRecord(reg.quarantine.front());
    reg.quarantine.pop_front();
  }
}

void ListUnlink(ZelPktList* list, ZelPkt* pkt) {
  (pkt->prev ? pkt->prev->next : list->head) = pkt->next;
  (pkt->next ? pkt->next->prev : list->tail) = pkt->prev;
  pkt->next = pkt->prev = nullptr;
  pkt->list = nullptr;
  list->count--;
}

void ListAppend(ZelPktList* list, ZelPkt* pkt, const char* call) {
  if (pkt->list != nullptr) {
    Fatal("%s: packet %p is already in list %p", call, (void*)pkt, (void*)pkt->list);
  }
  pkt->prev = list->tail;
  pkt->next = nullptr;
  (list->tail ? list->tail->next : list->head) = pkt;
  list->tail = pkt;
  pkt->list = list;
  list->count++;
}

void ResetPackets() {
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  // Lists of tests are emptied first so that none points at a freed packet.
  for (PacketList* l : reg.testLists) zel_PktListInit(l->get());
  for (ZelPkt* pkt : reg.resetGraveyard) FreeRecord(pkt);
  reg.resetGraveyard.clear();
  // Packets still live are freed, but their records are kept until the next
  // reset with a magic that makes a late zel_PktRelease (from a subsystem
  // reset that runs after this one) harmless.
  for (ZelPkt* pkt : reg.live) {
    pkt->cold->sg.clear();
    pkt->mapped = nullptr;
    pkt->list = nullptr;
    pkt->magic = kResetPktMagic;
    reg.resetGraveyard.push_back(pkt);
  }
  reg.live.clear();
  reg.elems.clear();
  for (ZelPkt* pkt : reg.quarantine) FreeRecord(pkt);
  reg.quarantine.clear();
}

void PacketLeftovers(std::vector<std::string>* out) {
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  if (reg.live.empty()) return;
  std::vector<uint64_t> serials;
  for (ZelPkt* pkt : reg.live) serials.push_back(pkt->cold->serial);
  std::sort(serials.begin(), serials.end());
  std::string text = std::to_string(serials.size()) + " live packet(s), serials";
  for (size_t i = 0; i < serials.size() && i < 16; i++) {
    text += ' ';
    text += std::to_string(serials[i]);
  }
  if (serials.size() > 16) text += " ...";
  out->push_back(text);
}

[[maybe_unused]] const bool kRegistered = RegisterSubsystem(Subsystem{"packets", ResetPackets, PacketLeftovers});

}  // namespace

// ---------------------------------------------------------------------------
// Test-facing packet access

ZelPkt* Packets::Make(const PacketSpec& layout) {
  std::vector<uint32_t> sizes = layout.sgSizes;
  if (sizes.empty()) sizes.push_back(static_cast<uint32_t>(layout.frame.size()));
  uint64_t total = 0;
  for (uint32_t s : sizes) total += s;
  if (total != layout.frame.size()) {
    Fatal("Packets::Make: element sizes add up to %llu, frame has %zu bytes",
          (unsigned long long)total, layout.frame.size());
  }
  if (sizes.size() > UINT16_MAX) Fatal("Packets::Make: too many elements");
  uint32_t mapped = layout.mappedLen == UINT32_MAX ? sizes[0] : layout.mappedLen;
  if (mapped > sizes[0]) Fatal("Packets::Make: mapped length %u > element 0 (%u)", mapped, sizes[0]);
  if (layout.vlanId > 4095 || layout.priority > 7) {
    Fatal("Packets::Make: VLAN ID %u / priority %u out of range", layout.vlanId, layout.priority);
  }
  return NewPacket(layout.frame.data(), sizes, mapped,
                   Meta{layout.vlanId, layout.priority, layout.resPoolTag, layout.writable, 0});
}

ZelPkt* Packets::Make(std::span<const uint8_t> frame) {
  PacketSpec layout;
  layout.frame.assign(frame.begin(), frame.end());
  return Make(layout);
}

std::vector<uint8_t> Packets::Frame(ZelPkt* pkt) {
  CHECK_PKT(pkt);
  CheckNotWritten(pkt, __func__);
  return Gather(pkt);
}

uint16_t Packets::VlanId(ZelPkt* pkt) { return CHECK_PKT(pkt)->vlanId; }
uint8_t Packets::Priority(ZelPkt* pkt) { return CHECK_PKT(pkt)->priority; }
uint16_t Packets::ResPoolTag(ZelPkt* pkt) { return CHECK_PKT(pkt)->resPoolTag; }
uint64_t Packets::Serial(ZelPkt* pkt) { return CHECK_PKT(pkt)->cold->serial; }

bool Packets::IsLive(ZelPkt* pkt) {
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  return reg.live.count(pkt) != 0;
}

uint64_t Packets::Live() {
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  return reg.live.size();
}

void Packets::HideSgElement(ZelPkt* pkt, uint16_t index) {
  CHECK_PKT(pkt);
  if (index >= pkt->cold->sg.size()) Fatal("Packets::HideSgElement: packet has no element %u", index);
  pkt->cold->sg[index].hidden = true;
}

bool Packets::InList(ZelPkt* pkt) { return CHECK_PKT(pkt)->list != nullptr; }

// ---------------------------------------------------------------------------
// PacketList

PacketList::PacketList() {
  size_t size = zel_PktListSizeInBytes();
  storage_.reset(new uint8_t[size + 15]);
  void* p = storage_.get();
  size_t space = size + 15;
  list_ = static_cast<ZelPktList*>(std::align(16, size, p, space));
  zel_PktListInit(list_);
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  reg.testLists.insert(this);
}

PacketList::~PacketList() {
  zel_PktListReleaseAllPkts(list_);
  Registry& reg = Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  reg.testLists.erase(this);
}

void PacketList::Append(ZelPkt* pkt) { zel_PktListAppendPkt(list_, pkt); }

uint32_t PacketList::Count() { return zel_PktListGetCount(list_); }

std::vector<ZelPkt*> PacketList::Packets() {
  std::vector<ZelPkt*> out;
  for (ZelPkt* p = CheckedList(list_, __func__)->head; p != nullptr; p = p->next) out.push_back(p);
  return out;
}

std::vector<ZelPkt*> PacketList::TakeAll() {
  std::vector<ZelPkt*> out;
  CheckedList(list_, __func__);
  while (list_->head != nullptr) {
    ZelPkt* p = list_->head;
    ListUnlink(list_, p);
    out.push_back(p);
  }
  return out;
}

}  // namespace host

using host::Checked;
using host::CheckedIter;
using host::CheckedList;
using host::Fatal;
using host::Faults;

// ---------------------------------------------------------------------------
// Packet lists

size_t zel_PktListSizeInBytes() { return sizeof(ZelPktList); }
size_t zel_PktListIterSizeOf() { return sizeof(ZelPktListIter); }

void zel_PktListInit(ZelPktList* list) {
  if (list == nullptr) Fatal("zel_PktListInit: null list");
  *list = ZelPktList{host::kListMagic, nullptr, nullptr, 0};
}

void zel_PktListIterStart(ZelPktList* list, ZelPktListIter* iter) {
  CheckedList(list, __func__);
  if (iter == nullptr) Fatal("zel_PktListIterStart: null iterator");
  *iter = ZelPktListIter{host::kIterMagic, list, list->head};
}

bool zel_PktListIterIsAtEnd(ZelPktListIter* iter) {
  return host::StartedIter(iter, __func__)->cur == nullptr;
}

ZelPkt* zel_PktListIterGetPkt(ZelPktListIter* iter) {
  return host::StartedIter(iter, __func__)->cur;
}

void zel_PktListIterMove(ZelPktListIter* iter) {
  host::CheckedIterOnPkt(iter, __func__);
  iter->cur = iter->cur->next;
}

void zel_PktListIterRemovePkt(ZelPktListIter* iter, ZelPkt** pkt) {
  CheckedIter(iter, __func__);
  if (iter->cur == nullptr) Fatal("zel_PktListIterRemovePkt: iterator is at the end");
  if (pkt == nullptr) Fatal("zel_PktListIterRemovePkt: null out parameter");
  ZelPkt* cur = iter->cur;
  iter->cur = cur->next;
  host::ListUnlink(iter->list, cur);
  *pkt = cur;
}

void zel_PktListIterReplace(ZelPktListIter* iter, ZelPkt* pkt) {
  CheckedIter(iter, __func__);
  Checked(pkt, __func__);
  ZelPkt* old = iter->cur;
  if (old == nullptr) Fatal("zel_PktListIterReplace: iterator is at the end");
  if (pkt->list != nullptr) {
    Fatal("zel_PktListIterReplace: new packet %p is already in list %p", (void*)pkt,
          (void*)pkt->list);
  }
  ZelPktList* list = iter->list;
  pkt->prev = old->prev;
  pkt->next = old->next;
  (old->prev ? old->prev->next : list->head) = pkt;
  (old->next ? old->next->prev : list->tail) = pkt;
  pkt->list = list;
  old->next = old->prev = nullptr;
  old->list = nullptr;
  iter->cur = pkt;
  zel_PktRelease(old);
}

void zel_PktListAppendPkt(ZelPktList* list, ZelPkt* pkt) {
  host::ListAppend(CheckedList(list, __func__), Checked(pkt, __func__), __func__);
}

void zel_PktListPrepend(ZelPktList* dst, ZelPktList* src) {
  CheckedList(dst, __func__);
  CheckedList(src, __func__);
  if (dst == src) Fatal("zel_PktListPrepend: a list prepended to itself");
  if (src->head == nullptr) return;
  for (ZelPkt* p = src->head; p != nullptr; p = p->next) p->list = dst;
  src->tail->next = dst->head;
  (dst->head ? dst->head->prev : dst->tail) = src->tail;
  dst->head = src->head;
  dst->count += src->count;
  src->head = src->tail = nullptr;
  src->count = 0;
}

uint32_t zel_PktListGetCount(ZelPktList* list) { return CheckedList(list, __func__)->count; }

void zel_PktListReleaseAllPkts(ZelPktList* list) {
  CheckedList(list, __func__);
  while (list->head != nullptr) {
    ZelPkt* p = list->head;
    host::ListUnlink(list, p);
    zel_PktRelease(p);
  }
}

// ---------------------------------------------------------------------------
// Packet getters and setters (fast path: magic check only)

uint32_t zel_PktFrameLenGet(ZelPkt* pkt) { return Checked(pkt, __func__)->frameLen; }
uint32_t zel_PktFrameMappedLenGet(ZelPkt* pkt) { return Checked(pkt, __func__)->mappedLen; }
uint8_t* zel_PktFrameMappedPointerGet(ZelPkt* pkt) { return Checked(pkt, __func__)->mapped; }
uint16_t zel_PktVlanIDGet(ZelPkt* pkt) { return Checked(pkt, __func__)->vlanId; }
uint8_t zel_PktPriorityGet(ZelPkt* pkt) { return Checked(pkt, __func__)->priority; }
bool zel_PktIsBufDescWritable(ZelPkt* pkt) { return Checked(pkt, __func__)->writable; }

ZelStatus zel_PktPrioritySet(ZelPkt* pkt, uint8_t priority) {
  if (ZelStatus s = Faults::Check("zel_PktPrioritySet")) return s;
  Checked(pkt, __func__);
  if (priority > 7) return ZEL_BAD_PARAM;  // 802.1p priorities are 3 bits
  pkt->priority = priority;
  return ZEL_OK;
}

ZelStatus zel_PktResPoolTagGet(ZelPkt* pkt, uint16_t* tag) {
  if (ZelStatus s = Faults::Check("zel_PktResPoolTagGet")) return s;
  Checked(pkt, __func__);
  if (tag == nullptr) return ZEL_BAD_PARAM;
  *tag = pkt->resPoolTag;
  return ZEL_OK;
}

ZelStatus zel_PktResPoolTagSet(ZelPkt* pkt, uint16_t tag) {
  if (ZelStatus s = Faults::Check("zel_PktResPoolTagSet")) return s;
  Checked(pkt, __func__)->resPoolTag = tag;
  return ZEL_OK;
}

// ---------------------------------------------------------------------------
// Clones, copies, release

ZelStatus zel_PktClone(ZelPkt* pkt, ZelPkt** clone) {
  if (ZelStatus s = Faults::Check("zel_PktClone")) return s;
  Checked(pkt, __func__);
  if (clone == nullptr) return ZEL_BAD_PARAM;
  host::CheckNotWritten(pkt, __func__);
  std::vector<uint8_t> frame = host::Gather(pkt);
  *clone = host::NewPacket(frame.data(), host::Sizes(pkt), pkt->mappedLen, host::MetaOf(pkt));
  return ZEL_OK;
}

ZelStatus zel_PktPartialCopy(ZelPkt* pkt, uint32_t len, ZelPkt** copy) {
  if (ZelStatus s = Faults::Check("zel_PktPartialCopy")) return s;
  Checked(pkt, __func__);
  if (copy == nullptr || len > pkt->frameLen) return ZEL_BAD_PARAM;
  host::CheckNotWritten(pkt, __func__);
  std::vector<uint8_t> frame = host::Gather(pkt);
  host::Meta meta = host::MetaOf(pkt);
  meta.writable = true;
  if (len == 0) {
    *copy = host::NewPacket(frame.data(), host::Sizes(pkt), pkt->mappedLen, meta);
    return ZEL_OK;
  }
  // Element 0 holds exactly the requested bytes; the rest keeps the
  // original element boundaries.
  std::vector<uint32_t> sizes{len};
  uint32_t start = 0;
  for (const host::PktSgBuffer& b : pkt->cold->sg) {
    uint32_t end = start + b.length;
    if (end > len) sizes.push_back(end - std::max(start, len));
    start = end;
  }
  *copy = host::NewPacket(frame.data(), sizes, len, meta);
  return ZEL_OK;
}

void zel_PktRelease(ZelPkt* pkt) {
  host::Registry& reg = host::Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  if (reg.live.count(pkt) == 0) {
    if (pkt != nullptr && pkt->magic == host::kResetPktMagic) return;  // already freed by Reset
    if (pkt != nullptr && pkt->magic == host::kDeadPktMagic) {
      Fatal("zel_PktRelease: packet released twice (%p, serial %llu)", (void*)pkt,
            (unsigned long long)pkt->cold->serial);
    }
    Fatal("zel_PktRelease: %p is not a live packet", (void*)pkt);
  }
  if (pkt->list != nullptr) {
    Fatal("zel_PktRelease: packet %p is still in list %p", (void*)pkt, (void*)pkt->list);
  }
  host::CheckNotWritten(pkt, __func__);
  reg.live.erase(pkt);
  host::ReleaseLocked(reg, pkt);
}

// ---------------------------------------------------------------------------
// Scatter-gather elements

uint16_t zel_PktSgArrayGet(ZelPkt* pkt) {
  return static_cast<uint16_t>(Checked(pkt, __func__)->cold->sg.size());
}

ZelStatus zel_PktSgElemGet(ZelPkt* pkt, uint16_t index, ZelSgElem* elem) {
  if (ZelStatus s = Faults::Check("zel_PktSgElemGet")) return s;
  Checked(pkt, __func__);
  if (elem == nullptr) return ZEL_BAD_PARAM;
  if (index >= pkt->cold->sg.size() || pkt->cold->sg[index].hidden) return ZEL_NOT_FOUND;
  const host::PktSgBuffer& b = pkt->cold->sg[index];
  elem->machineAddr = reinterpret_cast<uintptr_t>(b.data.get()) ^ host::kMachineAddrKey;
  elem->length = b.length;
  return ZEL_OK;
}

ZelStatus zel_MA2VA(uint64_t ma, uint32_t len, void** va) {
  if (ZelStatus s = Faults::Check("zel_MA2VA")) return s;
  if (va == nullptr) return ZEL_BAD_PARAM;
  uintptr_t addr = static_cast<uintptr_t>(ma ^ host::kMachineAddrKey);
  host::Registry& reg = host::Reg();
  std::lock_guard<std::mutex> g(reg.mu);
  auto it = reg.elems.upper_bound(addr);
  if (it == reg.elems.begin()) return ZEL_BAD_PARAM;
  --it;
  uint64_t offset = addr - it->first;
  if (offset + len > it->second.length) return ZEL_BAD_PARAM;
  *va = reinterpret_cast<void*>(addr);
  return ZEL_OK;
}
