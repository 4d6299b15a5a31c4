// Capture files in and out, through libpcap.
//
// Reading takes classic pcap (either byte order, micro- or nanosecond
// timestamps) and pcapng, from a file, from standard input ("-") or from
// bytes in memory; only Ethernet captures are accepted. Timestamps are kept
// to the nanosecond. A pcapng record's direction comes from its
// enhanced-packet-block flags (inbound = from the switch, outbound = toward
// it); classic pcap has no direction, so its records come back with
// direction 0 and the caller decides (ResolveDirections).
//
// Writing produces classic pcap with nanosecond timestamps, for Ethernet
// frames or raw IPv4 datagrams, to a file or standard output ("-").
// EncodePcapng writes the pcapng form with direction flags, which libpcap
// cannot write; tests and the example captures use it.
//
// Every input is treated as hostile: a damaged capture yields the records
// before the damage and an error naming the first bad record, never a
// crash; nothing is read past the bytes given.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "tools/lib/frames.h"

namespace frames {

// Link types a writer can produce.
enum class LinkType { Ethernet, RawIpv4 };

// The outcome of reading a capture. When `error` is set, `records` holds the
// records before the fault and `badRecord` the 0-based index of the record
// that could not be read (records.size()), or nullopt when the file itself
// was refused (not a capture, wrong link type, unreadable).
struct CaptureRead {
  std::vector<CaptureRecord> records;
  std::string error;
  std::optional<size_t> badRecord;
  bool pcapng = false;
  bool ok() const { return error.empty(); }
};

// Largest capture read into memory.
inline constexpr size_t kMaxCaptureBytes = size_t{1} << 30;

// Decodes a capture held in memory (the entry point for fuzzing).
CaptureRead DecodeCapture(std::span<const uint8_t> data);
// Reads `path` ("-" = standard input); a directory or unreadable path is an
// error with no records.
CaptureRead ReadCapture(const std::string& path);

// How records without a recorded direction get one: a fixed direction, or
// by the VM side's MAC and/or IPv4/IPv6 address (a frame addressed to the
// VM comes from the switch; one sent by it goes toward the switch).
struct DirectionRule {
  uint32_t fixed = kDirectionUnknown;
  std::optional<MacAddr> vmMac;
  std::optional<Ip4Addr> vmIp4;
  std::optional<Ip6Addr> vmIp6;
};
// The rule the tools' --direction, --vm-mac and --vm-ip options give
// (direction "from", "to", or "auto"/empty; an empty address is none).
// False with a one-line reason naming the option when a text is malformed.
bool MakeDirectionRule(const std::string& direction, const std::string& vmMac,
                       const std::string& vmIp, DirectionRule* rule, std::string* error);
// Literals of the command line; false when the text is not exactly one.
bool TryParseMac(const std::string& text, MacAddr* mac);
bool TryParseIp4(const std::string& text, Ip4Addr* ip);
bool TryParseIp6(const std::string& text, Ip6Addr* ip);
// Gives every record of direction 0 one by `rule`; returns the index of
// the first record none applies to, or nullopt when all have one.
std::optional<size_t> ResolveDirections(std::vector<CaptureRecord>* records,
                                        const DirectionRule& rule);

// Classic pcap in memory, nanosecond timestamps. Frames longer than
// `snapLen` are cut to it, keeping their original length.
Bytes EncodeCapture(std::span<const CaptureRecord> records, LinkType link = LinkType::Ethernet,
                    uint32_t snapLen = 262144);
// pcapng in memory: one section, one Ethernet interface, one enhanced
// packet block per record with the direction in its flags when known.
Bytes EncodePcapng(std::span<const CaptureRecord> records);

// An open classic-pcap output. Open fails (with a reason) for a directory,
// an unwritable path or a snap length of 0.
class CaptureWriter {
 public:
  CaptureWriter() = default;
  ~CaptureWriter();
  CaptureWriter(const CaptureWriter&) = delete;
  CaptureWriter& operator=(const CaptureWriter&) = delete;

  bool Open(const std::string& path, LinkType link, uint32_t snapLen, std::string* error);
  // Writes one record, cut to the snap length.
  void Write(const CaptureRecord& record);
  // Flushes and closes; false (with a reason) when a write failed.
  bool Close(std::string* error);
  bool IsOpen() const { return dumper_ != nullptr; }
  uint64_t Written() const { return written_; }

 private:
  void* pcap_ = nullptr;    // pcap_t
  void* dumper_ = nullptr;  // pcap_dumper_t
  uint32_t snapLen_ = 0;
  uint64_t written_ = 0;
};

// Writes `records` to `path` in one go.
bool WriteCapture(const std::string& path, std::span<const CaptureRecord> records,
                  std::string* error, LinkType link = LinkType::Ethernet,
                  uint32_t snapLen = 262144);

}  // namespace frames
