// Frame builder and capture files for tools, tests and benchmarks.
//
// FrameBuilder assembles an Ethernet frame layer by layer with a small
// fluent API and fills in what follows from the layers chosen: EtherType,
// IPv4 total length and header checksum, IPv6 payload length and next-header
// chain, UDP length, and TCP/UDP/ICMP checksums. Every derived field can be
// overridden so tests can build malformed frames on purpose.
//
//   auto frame = frames::FrameBuilder()
//                    .Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"))
//                    .Vlan(100, 5)
//                    .Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2"))
//                    .Tcp(1234, 80)
//                    .Payload(16)
//                    .Build();
//
// Layers:
//   L2: Eth (Ethernet II), optionally Llc (802.3 length + LLC/SNAP) and Vlan
//       (one 802.1Q tag). Without Eth the frame starts at L3 (raw payloads).
//   L3: Ipv4 (options, fragment fields, IHL override) or Ipv6 with extension
//       headers in the order added (HopByHop, Routing, DestOpts, Ah,
//       Fragment6, RawExt), or Arp, or EtherType + Payload for anything else.
//   L4: Tcp, Udp, Icmp, Icmp6, or IpProto for a bare protocol number.
//
// Captures are read and written by tools/lib/capture.h.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace frames {

using Bytes = std::vector<uint8_t>;
using MacAddr = std::array<uint8_t, 6>;
using Ip4Addr = std::array<uint8_t, 4>;
using Ip6Addr = std::array<uint8_t, 16>;

// Parsers for literals in tests; malformed text aborts (a test bug).
MacAddr Mac(std::string_view text);      // "02:00:00:00:00:01"
Ip4Addr Ip4(std::string_view text);      // "10.0.0.1"
Ip6Addr Ip6(std::string_view text);      // "fe80::1", "2001:db8::10:1"

// RFC 1071 ones'-complement checksum of `data` (odd length padded with a
// zero byte), starting from the partial sum `initial`. Returns the value to
// store (already complemented), in host order.
uint16_t InternetChecksum(std::span<const uint8_t> data, uint32_t initial = 0);
// True when the IPv4 header at `l3` of `frame` has a valid checksum.
bool Ipv4HeaderChecksumOk(std::span<const uint8_t> frame, size_t l3);

// Well-known values.
inline constexpr uint16_t kEthIpv4 = 0x0800;
inline constexpr uint16_t kEthIpv6 = 0x86dd;
inline constexpr uint16_t kEthArp = 0x0806;
inline constexpr uint16_t kEthVlan = 0x8100;
inline constexpr uint8_t kProtoTcp = 6;
inline constexpr uint8_t kProtoUdp = 17;
inline constexpr uint8_t kProtoIcmp = 1;
inline constexpr uint8_t kProtoIcmp6 = 58;
inline constexpr uint8_t kExtHopByHop = 0;
inline constexpr uint8_t kExtRouting = 43;
inline constexpr uint8_t kExtFragment = 44;
inline constexpr uint8_t kExtAh = 51;
inline constexpr uint8_t kExtDestOpts = 60;
inline constexpr uint8_t kNoNextHeader = 59;

// TCP flags.
inline constexpr uint8_t kTcpFin = 0x01;
inline constexpr uint8_t kTcpSyn = 0x02;
inline constexpr uint8_t kTcpRst = 0x04;
inline constexpr uint8_t kTcpPsh = 0x08;
inline constexpr uint8_t kTcpAck = 0x10;

class FrameBuilder {
 public:
  // --- L2 ---
  FrameBuilder& Eth(const MacAddr& dst, const MacAddr& src);
  // 802.3 framing: a length field and an 8-byte LLC/SNAP header
  // (AA AA 03 00 00 00 + EtherType) instead of the Ethernet II type.
  FrameBuilder& Llc();
  // One 802.1Q tag (TPID 0x8100) after the source MAC.
  FrameBuilder& Vlan(uint16_t vid, uint8_t pcp = 0, bool dei = false);
  // Overrides the EtherType (or the SNAP type under Llc).
  FrameBuilder& EtherType(uint16_t type);
  // Overrides the 802.3 length field (default: the bytes that follow it).
  FrameBuilder& LlcLength(uint16_t length);

  // --- IPv4 ---
  FrameBuilder& Ipv4(const Ip4Addr& src, const Ip4Addr& dst);
  FrameBuilder& Tos(uint8_t tos);
  FrameBuilder& Ttl(uint8_t ttl);
  FrameBuilder& IpId(uint16_t id);
  FrameBuilder& DontFragment(bool df = true);
  // Fragment fields: offset in 8-byte units and the more-fragments bit.
  FrameBuilder& Fragment(uint16_t offset8, bool moreFragments);
  // Options, zero-padded to a multiple of 4 bytes (IHL grows to match).
  FrameBuilder& Ipv4Options(const Bytes& options);
  // Writes this IHL instead of the computed one (the header still has its
  // real size); for malformed headers.
  FrameBuilder& Ihl(uint8_t ihl);
  FrameBuilder& Ipv4Checksum(uint16_t checksum);
  FrameBuilder& Ipv4TotalLength(uint16_t length);

  // --- IPv6 ---
  FrameBuilder& Ipv6(const Ip6Addr& src, const Ip6Addr& dst);
  FrameBuilder& TrafficClass(uint8_t tc);
  FrameBuilder& FlowLabel(uint32_t label);
  FrameBuilder& HopLimit(uint8_t hops);
  // Extension headers, in the order added. `extra8` adds 8-byte units of
  // padding options (the header is 8 + 8 * extra8 bytes).
  FrameBuilder& HopByHop(uint8_t extra8 = 0);
  FrameBuilder& Routing(uint8_t extra8 = 0, uint8_t segmentsLeft = 0);
  FrameBuilder& DestOpts(uint8_t extra8 = 0);
  // Authentication header with an ICV of `icvLen` bytes (multiple of 4);
  // the header is 12 + icvLen bytes.
  FrameBuilder& Ah(uint32_t spi = 0x100, uint8_t icvLen = 12);
  FrameBuilder& Fragment6(uint16_t offset8, bool moreFragments, uint32_t id = 1);
  // Any header: `bytes` as given, byte 0 replaced by the next header.
  FrameBuilder& RawExt(uint8_t type, const Bytes& bytes);

  // --- ARP ---
  FrameBuilder& Arp(uint16_t op, const MacAddr& sha, const Ip4Addr& spa, const MacAddr& tha,
                    const Ip4Addr& tpa);

  // --- L4 ---
  FrameBuilder& Tcp(uint16_t sport, uint16_t dport, uint8_t flags = kTcpAck, uint32_t seq = 1,
                    uint32_t ack = 0);
  FrameBuilder& TcpOptions(const Bytes& options);  // zero-padded to 4 bytes
  FrameBuilder& Udp(uint16_t sport, uint16_t dport);
  FrameBuilder& Icmp(uint8_t type, uint8_t code, uint32_t rest = 0);
  FrameBuilder& Icmp6(uint8_t type, uint8_t code, uint32_t rest = 0);
  // The IP protocol / last next header, with no L4 header built (or
  // overriding the one implied by Tcp/Udp/Icmp).
  FrameBuilder& IpProto(uint8_t proto);
  // Leaves L4 checksums zero.
  FrameBuilder& NoL4Checksum();

  // --- payload and size ---
  FrameBuilder& Payload(const Bytes& bytes);
  // `size` bytes counting up from `first` (wrapping at 256).
  FrameBuilder& Payload(size_t size, uint8_t first = 0);
  // Pads the finished frame with zeros to at least `size` bytes.
  FrameBuilder& PadTo(size_t size);

  Bytes Build() const;

  // Offsets of the layers in the frame Build() returns (L3 when there is
  // none: the L2 header end; L4: the end of the IP header and extension
  // headers).
  size_t L3Offset() const;
  size_t L4Offset() const;

 private:
  enum class L3Kind { None, Ipv4, Ipv6, Arp };
  enum class L4Kind { None, Tcp, Udp, Icmp, Icmp6 };
  struct Ext {
    uint8_t type;
    Bytes bytes;
  };

  Bytes BuildL2Header(size_t rest) const;
  Bytes BuildL3(const Bytes& l4) const;
  Bytes BuildL4() const;
  uint32_t PseudoHeaderSum(size_t l4Len, uint8_t proto) const;
  uint8_t UpperProto() const;
  uint16_t L3EtherType() const;

  // L2
  bool eth_ = false;
  MacAddr dst_{};
  MacAddr src_{};
  bool llc_ = false;
  std::optional<uint16_t> llcLength_;
  bool vlan_ = false;
  uint16_t tci_ = 0;
  std::optional<uint16_t> etherType_;
  // L3
  L3Kind l3_ = L3Kind::None;
  Ip4Addr src4_{}, dst4_{};
  uint8_t tos_ = 0;
  uint8_t ttl_ = 64;
  uint16_t ipId_ = 1;
  bool df_ = false;
  uint16_t fragOffset_ = 0;
  bool moreFrags_ = false;
  Bytes ipOptions_;
  std::optional<uint8_t> ihl_;
  std::optional<uint16_t> ipChecksum_;
  std::optional<uint16_t> ipTotalLength_;
  Ip6Addr src6_{}, dst6_{};
  uint8_t trafficClass_ = 0;
  uint32_t flowLabel_ = 0;
  uint8_t hopLimit_ = 64;
  std::vector<Ext> exts_;
  Bytes arp_;
  // L4
  L4Kind l4_ = L4Kind::None;
  uint16_t sport_ = 0, dport_ = 0;
  uint8_t tcpFlags_ = 0;
  uint32_t seq_ = 0, ack_ = 0;
  Bytes tcpOptions_;
  uint8_t icmpType_ = 0, icmpCode_ = 0;
  uint32_t icmpRest_ = 0;
  std::optional<uint8_t> proto_;
  bool l4Checksum_ = true;
  // Payload
  Bytes payload_;
  size_t padTo_ = 0;
};

// One captured frame (tools/lib/capture.h reads and writes them).
inline constexpr uint32_t kDirectionUnknown = 0;
inline constexpr uint32_t kDirectionFromSwitch = 1;
inline constexpr uint32_t kDirectionToSwitch = 2;

struct CaptureRecord {
  uint32_t direction = kDirectionUnknown;
  Bytes frame;              // the bytes captured
  uint32_t origLen = 0;     // length on the wire; 0 = frame.size()
  int64_t tsSec = 0;        // timestamp, seconds since the epoch
  uint32_t tsNsec = 0;      // and nanoseconds
};

// "00 11 22 ..." for test messages.
std::string Hex(std::span<const uint8_t> bytes);

}  // namespace frames
