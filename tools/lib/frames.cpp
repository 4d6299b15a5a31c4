#include "tools/lib/frames.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace frames {

namespace {

[[noreturn]] void BadLiteral(const char* what, std::string_view text) {
  std::fprintf(stderr, "frames: malformed %s literal '%.*s'\n", what,
               static_cast<int>(text.size()), text.data());
  std::abort();
}

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

void Put16(Bytes* out, uint16_t v) {
  out->push_back(static_cast<uint8_t>(v >> 8));
  out->push_back(static_cast<uint8_t>(v));
}

void Put32(Bytes* out, uint32_t v) {
  Put16(out, static_cast<uint16_t>(v >> 16));
  Put16(out, static_cast<uint16_t>(v));
}

void Set16(Bytes* out, size_t at, uint16_t v) {
  (*out)[at] = static_cast<uint8_t>(v >> 8);
  (*out)[at + 1] = static_cast<uint8_t>(v);
}

template <size_t N>
void PutArray(Bytes* out, const std::array<uint8_t, N>& a) {
  out->insert(out->end(), a.begin(), a.end());
}

Bytes PadTo4(const Bytes& b) {
  Bytes out = b;
  while (out.size() % 4 != 0) out.push_back(0);
  return out;
}

// Sum of big-endian 16-bit words, unfolded.
uint32_t WordSum(std::span<const uint8_t> data, uint32_t sum = 0) {
  size_t i = 0;
  for (; i + 1 < data.size(); i += 2) sum += (static_cast<uint32_t>(data[i]) << 8) | data[i + 1];
  if (i < data.size()) sum += static_cast<uint32_t>(data[i]) << 8;
  return sum;
}

uint16_t Fold(uint64_t sum) {
  while (sum >> 16) sum = (sum & 0xffff) + (sum >> 16);
  return static_cast<uint16_t>(sum);
}

// A header of 8 + 8 * extra8 bytes whose option area is one PadN option.
Bytes OptionsHeader(uint8_t extra8) {
  size_t total = 8 + 8 * static_cast<size_t>(extra8);
  Bytes h(total, 0);
  h[1] = extra8;
  h[2] = 1;  // PadN
  h[3] = static_cast<uint8_t>(total - 4);
  return h;
}

}  // namespace

MacAddr Mac(std::string_view text) {
  MacAddr mac{};
  if (text.size() != 17) BadLiteral("MAC", text);
  for (size_t i = 0; i < 6; ++i) {
    int hi = HexDigit(text[i * 3]);
    int lo = HexDigit(text[i * 3 + 1]);
    if (hi < 0 || lo < 0 || (i < 5 && text[i * 3 + 2] != ':')) BadLiteral("MAC", text);
    mac[i] = static_cast<uint8_t>(hi * 16 + lo);
  }
  return mac;
}

Ip4Addr Ip4(std::string_view text) {
  Ip4Addr a{};
  size_t pos = 0;
  for (size_t i = 0; i < 4; ++i) {
    uint32_t v = 0;
    size_t digits = 0;
    while (pos < text.size() && text[pos] >= '0' && text[pos] <= '9') {
      v = v * 10 + static_cast<uint32_t>(text[pos++] - '0');
      if (++digits > 3) BadLiteral("IPv4", text);
    }
    if (digits == 0 || v > 255) BadLiteral("IPv4", text);
    a[i] = static_cast<uint8_t>(v);
    if (i < 3) {
      if (pos >= text.size() || text[pos] != '.') BadLiteral("IPv4", text);
      ++pos;
    }
  }
  if (pos != text.size()) BadLiteral("IPv4", text);
  return a;
}

Ip6Addr Ip6(std::string_view text) {
  // Groups before and after "::".
  std::vector<uint16_t> head, tail;
  bool compressed = false;
  size_t pos = 0;
  if (text.substr(0, 2) == "::") {
    compressed = true;
    pos = 2;
  }
  while (pos < text.size()) {
    uint32_t v = 0;
    size_t digits = 0;
    while (pos < text.size() && HexDigit(text[pos]) >= 0) {
      v = v * 16 + static_cast<uint32_t>(HexDigit(text[pos++]));
      if (++digits > 4) BadLiteral("IPv6", text);
    }
    if (digits == 0) BadLiteral("IPv6", text);
    (compressed ? tail : head).push_back(static_cast<uint16_t>(v));
    if (pos == text.size()) break;
    if (text[pos] != ':') BadLiteral("IPv6", text);
    ++pos;
    if (pos < text.size() && text[pos] == ':') {
      if (compressed) BadLiteral("IPv6", text);
      compressed = true;
      ++pos;
    } else if (pos == text.size()) {
      BadLiteral("IPv6", text);
    }
  }
  size_t groups = head.size() + tail.size();
  if (groups > 8 || (!compressed && groups != 8) || (compressed && groups == 8)) {
    BadLiteral("IPv6", text);
  }
  std::vector<uint16_t> all = head;
  all.resize(8 - tail.size(), 0);
  all.insert(all.end(), tail.begin(), tail.end());
  Ip6Addr a{};
  for (size_t i = 0; i < 8; ++i) {
    a[2 * i] = static_cast<uint8_t>(all[i] >> 8);
    a[2 * i + 1] = static_cast<uint8_t>(all[i]);
  }
  return a;
}

uint16_t InternetChecksum(std::span<const uint8_t> data, uint32_t initial) {
  return static_cast<uint16_t>(~Fold(static_cast<uint64_t>(WordSum(data)) + initial));
}

bool Ipv4HeaderChecksumOk(std::span<const uint8_t> frame, size_t l3) {
  if (frame.size() < l3 + 20) return false;
  size_t len = 4u * (frame[l3] & 0x0f);
  if (len < 20 || frame.size() < l3 + len) return false;
  return Fold(WordSum(frame.subspan(l3, len))) == 0xffff;
}

// --- FrameBuilder: setters ----------------------------------------------------

FrameBuilder& FrameBuilder::Eth(const MacAddr& dst, const MacAddr& src) {
  eth_ = true;
  dst_ = dst;
  src_ = src;
  return *this;
}
FrameBuilder& FrameBuilder::Llc() {
  llc_ = true;
  return *this;
}
FrameBuilder& FrameBuilder::Vlan(uint16_t vid, uint8_t pcp, bool dei) {
  vlan_ = true;
  tci_ = static_cast<uint16_t>((pcp & 7) << 13 | (dei ? 1 << 12 : 0) | (vid & 0x0fff));
  return *this;
}
FrameBuilder& FrameBuilder::EtherType(uint16_t type) {
  etherType_ = type;
  return *this;
}
FrameBuilder& FrameBuilder::LlcLength(uint16_t length) {
  llcLength_ = length;
  return *this;
}

FrameBuilder& FrameBuilder::Ipv4(const Ip4Addr& src, const Ip4Addr& dst) {
  l3_ = L3Kind::Ipv4;
  src4_ = src;
  dst4_ = dst;
  return *this;
}
FrameBuilder& FrameBuilder::Tos(uint8_t tos) {
  tos_ = tos;
  return *this;
}
FrameBuilder& FrameBuilder::Ttl(uint8_t ttl) {
  ttl_ = ttl;
  return *this;
}
FrameBuilder& FrameBuilder::IpId(uint16_t id) {
  ipId_ = id;
  return *this;
}
FrameBuilder& FrameBuilder::DontFragment(bool df) {
  df_ = df;
  return *this;
}
FrameBuilder& FrameBuilder::Fragment(uint16_t offset8, bool moreFragments) {
  fragOffset_ = offset8 & 0x1fff;
  moreFrags_ = moreFragments;
  return *this;
}
FrameBuilder& FrameBuilder::Ipv4Options(const Bytes& options) {
  ipOptions_ = PadTo4(options);
  return *this;
}
FrameBuilder& FrameBuilder::Ihl(uint8_t ihl) {
  ihl_ = ihl & 0x0f;
  return *this;
}
FrameBuilder& FrameBuilder::Ipv4Checksum(uint16_t checksum) {
  ipChecksum_ = checksum;
  return *this;
}
FrameBuilder& FrameBuilder::Ipv4TotalLength(uint16_t length) {
  ipTotalLength_ = length;
  return *this;
}

FrameBuilder& FrameBuilder::Ipv6(const Ip6Addr& src, const Ip6Addr& dst) {
  l3_ = L3Kind::Ipv6;
  src6_ = src;
  dst6_ = dst;
  return *this;
}
FrameBuilder& FrameBuilder::TrafficClass(uint8_t tc) {
  trafficClass_ = tc;
  return *this;
}
FrameBuilder& FrameBuilder::FlowLabel(uint32_t label) {
  flowLabel_ = label & 0xfffff;
  return *this;
}
FrameBuilder& FrameBuilder::HopLimit(uint8_t hops) {
  hopLimit_ = hops;
  return *this;
}
FrameBuilder& FrameBuilder::HopByHop(uint8_t extra8) {
  exts_.push_back({kExtHopByHop, OptionsHeader(extra8)});
  return *this;
}
FrameBuilder& FrameBuilder::Routing(uint8_t extra8, uint8_t segmentsLeft) {
  Bytes h(8 + 8 * static_cast<size_t>(extra8), 0);
  h[1] = extra8;
  h[2] = 4;  // routing type
  h[3] = segmentsLeft;
  exts_.push_back({kExtRouting, h});
  return *this;
}
FrameBuilder& FrameBuilder::DestOpts(uint8_t extra8) {
  exts_.push_back({kExtDestOpts, OptionsHeader(extra8)});
  return *this;
}
FrameBuilder& FrameBuilder::Ah(uint32_t spi, uint8_t icvLen) {
  size_t total = 12 + static_cast<size_t>(icvLen);
  if (total % 4 != 0) {
    std::fprintf(stderr, "frames: AH ICV length %u is not a multiple of 4\n", icvLen);
    std::abort();
  }
  Bytes h;
  h.push_back(0);
  h.push_back(static_cast<uint8_t>(total / 4 - 2));
  Put16(&h, 0);
  Put32(&h, spi);
  Put32(&h, 1);  // sequence number
  h.resize(total, 0);
  exts_.push_back({kExtAh, h});
  return *this;
}
FrameBuilder& FrameBuilder::Fragment6(uint16_t offset8, bool moreFragments, uint32_t id) {
  Bytes h;
  h.push_back(0);
  h.push_back(0);
  Put16(&h, static_cast<uint16_t>((offset8 & 0x1fff) << 3 | (moreFragments ? 1 : 0)));
  Put32(&h, id);
  exts_.push_back({kExtFragment, h});
  return *this;
}
FrameBuilder& FrameBuilder::RawExt(uint8_t type, const Bytes& bytes) {
  exts_.push_back({type, bytes.empty() ? Bytes{0} : bytes});
  return *this;
}

FrameBuilder& FrameBuilder::Arp(uint16_t op, const MacAddr& sha, const Ip4Addr& spa,
                                const MacAddr& tha, const Ip4Addr& tpa) {
  l3_ = L3Kind::Arp;
  arp_.clear();
  Put16(&arp_, 1);  // Ethernet
  Put16(&arp_, kEthIpv4);
  arp_.push_back(6);
  arp_.push_back(4);
  Put16(&arp_, op);
  PutArray(&arp_, sha);
  PutArray(&arp_, spa);
  PutArray(&arp_, tha);
  PutArray(&arp_, tpa);
  return *this;
}

FrameBuilder& FrameBuilder::Tcp(uint16_t sport, uint16_t dport, uint8_t flags, uint32_t seq,
                                uint32_t ack) {
  l4_ = L4Kind::Tcp;
  sport_ = sport;
  dport_ = dport;
  tcpFlags_ = flags;
  seq_ = seq;
  ack_ = ack;
  return *this;
}
FrameBuilder& FrameBuilder::TcpOptions(const Bytes& options) {
  tcpOptions_ = PadTo4(options);
  return *this;
}
FrameBuilder& FrameBuilder::Udp(uint16_t sport, uint16_t dport) {
  l4_ = L4Kind::Udp;
  sport_ = sport;
  dport_ = dport;
  return *this;
}
FrameBuilder& FrameBuilder::Icmp(uint8_t type, uint8_t code, uint32_t rest) {
  l4_ = L4Kind::Icmp;
  icmpType_ = type;
  icmpCode_ = code;
  icmpRest_ = rest;
  return *this;
}
FrameBuilder& FrameBuilder::Icmp6(uint8_t type, uint8_t code, uint32_t rest) {
  l4_ = L4Kind::Icmp6;
  icmpType_ = type;
  icmpCode_ = code;
  icmpRest_ = rest;
  return *this;
}
FrameBuilder& FrameBuilder::IpProto(uint8_t proto) {
  proto_ = proto;
  return *this;
}
FrameBuilder& FrameBuilder::NoL4Checksum() {
  l4Checksum_ = false;
  return *this;
}

FrameBuilder& FrameBuilder::Payload(const Bytes& bytes) {
  payload_ = bytes;
  return *this;
}
FrameBuilder& FrameBuilder::Payload(size_t size, uint8_t first) {
  payload_.resize(size);
  for (size_t i = 0; i < size; ++i) payload_[i] = static_cast<uint8_t>(first + i);
  return *this;
}
FrameBuilder& FrameBuilder::PadTo(size_t size) {
  padTo_ = size;
  return *this;
}

// --- FrameBuilder: assembly -----------------------------------------------------

uint8_t FrameBuilder::UpperProto() const {
  if (proto_) return *proto_;
  switch (l4_) {
    case L4Kind::Tcp: return kProtoTcp;
    case L4Kind::Udp: return kProtoUdp;
    case L4Kind::Icmp: return kProtoIcmp;
    case L4Kind::Icmp6: return kProtoIcmp6;
    case L4Kind::None: break;
  }
  return l3_ == L3Kind::Ipv6 ? kNoNextHeader : 253;  // 253: experimentation
}

uint16_t FrameBuilder::L3EtherType() const {
  if (etherType_) return *etherType_;
  switch (l3_) {
    case L3Kind::Ipv4: return kEthIpv4;
    case L3Kind::Ipv6: return kEthIpv6;
    case L3Kind::Arp: return kEthArp;
    case L3Kind::None: break;
  }
  return 0x88b5;  // local experimental EtherType
}

size_t FrameBuilder::L3Offset() const {
  if (!eth_) return 0;
  return 14 + (vlan_ ? 4 : 0) + (llc_ ? 8 : 0);
}

size_t FrameBuilder::L4Offset() const {
  size_t off = L3Offset();
  switch (l3_) {
    case L3Kind::Ipv4: return off + 20 + ipOptions_.size();
    case L3Kind::Ipv6:
      off += 40;
      for (const Ext& e : exts_) off += e.bytes.size();
      return off;
    case L3Kind::Arp: return off + arp_.size();
    case L3Kind::None: break;
  }
  return off;
}

uint32_t FrameBuilder::PseudoHeaderSum(size_t l4Len, uint8_t proto) const {
  Bytes ph;
  if (l3_ == L3Kind::Ipv4) {
    PutArray(&ph, src4_);
    PutArray(&ph, dst4_);
    ph.push_back(0);
    ph.push_back(proto);
    Put16(&ph, static_cast<uint16_t>(l4Len));
  } else if (l3_ == L3Kind::Ipv6) {
    PutArray(&ph, src6_);
    PutArray(&ph, dst6_);
    Put32(&ph, static_cast<uint32_t>(l4Len));
    Put32(&ph, proto);
  } else {
    return 0;
  }
  return WordSum(ph);
}

Bytes FrameBuilder::BuildL4() const {
  Bytes l4;
  size_t checksumAt = 0;
  bool pseudo = true;
  switch (l4_) {
    case L4Kind::None:
      return payload_;
    case L4Kind::Tcp:
      Put16(&l4, sport_);
      Put16(&l4, dport_);
      Put32(&l4, seq_);
      Put32(&l4, ack_);
      l4.push_back(static_cast<uint8_t>(((20 + tcpOptions_.size()) / 4) << 4));
      l4.push_back(tcpFlags_);
      Put16(&l4, 65535);  // window
      Put16(&l4, 0);      // checksum
      Put16(&l4, 0);      // urgent pointer
      l4.insert(l4.end(), tcpOptions_.begin(), tcpOptions_.end());
      checksumAt = 16;
      break;
    case L4Kind::Udp:
      Put16(&l4, sport_);
      Put16(&l4, dport_);
      Put16(&l4, static_cast<uint16_t>(8 + payload_.size()));
      Put16(&l4, 0);
      checksumAt = 6;
      break;
    case L4Kind::Icmp:
    case L4Kind::Icmp6:
      l4.push_back(icmpType_);
      l4.push_back(icmpCode_);
      Put16(&l4, 0);
      Put32(&l4, icmpRest_);
      checksumAt = 2;
      pseudo = l4_ == L4Kind::Icmp6;
      break;
  }
  l4.insert(l4.end(), payload_.begin(), payload_.end());
  if (l4Checksum_) {
    uint32_t initial = pseudo ? PseudoHeaderSum(l4.size(), UpperProto()) : 0;
    uint16_t sum = InternetChecksum(l4, initial);
    // A computed UDP checksum of zero is sent as all ones.
    if (l4_ == L4Kind::Udp && sum == 0) sum = 0xffff;
    Set16(&l4, checksumAt, sum);
  }
  return l4;
}

Bytes FrameBuilder::BuildL3(const Bytes& l4) const {
  Bytes l3;
  switch (l3_) {
    case L3Kind::None:
      return l4;
    case L3Kind::Arp:
      l3 = arp_;
      l3.insert(l3.end(), l4.begin(), l4.end());
      return l3;
    case L3Kind::Ipv4: {
      size_t hlen = 20 + ipOptions_.size();
      uint8_t ihl = ihl_ ? *ihl_ : static_cast<uint8_t>(hlen / 4);
      l3.push_back(static_cast<uint8_t>(0x40 | (ihl & 0x0f)));
      l3.push_back(tos_);
      Put16(&l3, ipTotalLength_ ? *ipTotalLength_ : static_cast<uint16_t>(hlen + l4.size()));
      Put16(&l3, ipId_);
      Put16(&l3, static_cast<uint16_t>((df_ ? 0x4000 : 0) | (moreFrags_ ? 0x2000 : 0) |
                                       fragOffset_));
      l3.push_back(ttl_);
      l3.push_back(UpperProto());
      Put16(&l3, 0);
      PutArray(&l3, src4_);
      PutArray(&l3, dst4_);
      l3.insert(l3.end(), ipOptions_.begin(), ipOptions_.end());
      Set16(&l3, 10, ipChecksum_ ? *ipChecksum_ : InternetChecksum(l3));
      l3.insert(l3.end(), l4.begin(), l4.end());
      return l3;
    }
    case L3Kind::Ipv6: {
      Bytes exts;
      for (size_t i = 0; i < exts_.size(); ++i) {
        Bytes h = exts_[i].bytes;
        h[0] = i + 1 < exts_.size() ? exts_[i + 1].type : UpperProto();
        exts.insert(exts.end(), h.begin(), h.end());
      }
      Put32(&l3, 0x60000000u | static_cast<uint32_t>(trafficClass_) << 20 | flowLabel_);
      Put16(&l3, static_cast<uint16_t>(exts.size() + l4.size()));
      l3.push_back(exts_.empty() ? UpperProto() : exts_[0].type);
      l3.push_back(hopLimit_);
      PutArray(&l3, src6_);
      PutArray(&l3, dst6_);
      l3.insert(l3.end(), exts.begin(), exts.end());
      l3.insert(l3.end(), l4.begin(), l4.end());
      return l3;
    }
  }
  return l3;
}

Bytes FrameBuilder::BuildL2Header(size_t rest) const {
  Bytes h;
  if (!eth_) return h;
  PutArray(&h, dst_);
  PutArray(&h, src_);
  if (vlan_) {
    Put16(&h, kEthVlan);
    Put16(&h, tci_);
  }
  if (llc_) {
    Put16(&h, llcLength_ ? *llcLength_ : static_cast<uint16_t>(8 + rest));
    h.insert(h.end(), {0xaa, 0xaa, 0x03, 0x00, 0x00, 0x00});
  }
  Put16(&h, L3EtherType());
  return h;
}

Bytes FrameBuilder::Build() const {
  Bytes l3 = BuildL3(BuildL4());
  Bytes frame = BuildL2Header(l3.size());
  frame.insert(frame.end(), l3.begin(), l3.end());
  if (frame.size() < padTo_) frame.resize(padTo_, 0);
  return frame;
}

std::string Hex(std::span<const uint8_t> bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string s;
  s.reserve(bytes.size() * 3);
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i != 0) s.push_back(' ');
    s.push_back(kDigits[bytes[i] >> 4]);
    s.push_back(kDigits[bytes[i] & 0xf]);
  }
  return s;
}

}  // namespace frames
