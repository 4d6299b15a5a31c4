#include "tools/lib/capture.h"

#include <pcap/pcap.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>

#include "tools/lib/ruleset_builder.h"

namespace frames {

namespace {

constexpr uint32_t kPcapngSectionHeader = 0x0a0d0d0a;
constexpr uint32_t kPcapngByteOrderMagic = 0x1a2b3c4d;
constexpr uint32_t kPcapngInterface = 1;
constexpr uint32_t kPcapngEnhancedPacket = 6;
constexpr uint16_t kPcapngOptEnd = 0;
constexpr uint16_t kPcapngOptEpbFlags = 2;
constexpr uint32_t kEpbInbound = 1;
constexpr uint32_t kEpbOutbound = 2;

uint32_t Load32(const uint8_t* p, bool swap) {
  uint32_t v;
  std::memcpy(&v, p, 4);
  return swap ? __builtin_bswap32(v) : v;
}
uint16_t Load16(const uint8_t* p, bool swap) {
  uint16_t v;
  std::memcpy(&v, p, 2);
  return swap ? __builtin_bswap16(v) : v;
}

bool IsPcapng(std::span<const uint8_t> data) {
  return data.size() >= 4 && Load32(data.data(), false) == kPcapngSectionHeader;
}

// The direction of every packet-carrying block of a pcapng file, in file
// order: libpcap reads the packets but not their flags. Only enhanced
// packet blocks carry flags; simple and obsolete packet blocks get 0. The
// walk stops quietly at the first block that does not fit; libpcap reports
// the damage.
std::vector<uint32_t> PcapngDirections(std::span<const uint8_t> data) {
  std::vector<uint32_t> out;
  size_t pos = 0;
  bool swap = false;
  while (data.size() - pos >= 12) {
    const uint8_t* b = data.data() + pos;
    const uint32_t rawType = Load32(b, false);
    if (rawType == kPcapngSectionHeader) {
      const uint32_t magic = Load32(b + 8, false);
      if (magic == kPcapngByteOrderMagic) {
        swap = false;
      } else if (magic == __builtin_bswap32(kPcapngByteOrderMagic)) {
        swap = true;
      } else {
        break;
      }
    }
    const uint32_t type = Load32(b, swap);
    const uint32_t len = Load32(b + 4, swap);
    if (len < 12 || len % 4 != 0 || len > data.size() - pos) break;
    if (type == kPcapngEnhancedPacket) {
      uint32_t dir = kDirectionUnknown;
      if (len >= 32) {
        const uint32_t capLen = Load32(b + 20, swap);
        const uint64_t padded = (static_cast<uint64_t>(capLen) + 3) & ~uint64_t{3};
        uint64_t opt = 28 + padded;
        const uint64_t end = len - 4;
        while (opt + 4 <= end) {
          const uint16_t code = Load16(b + opt, swap);
          const uint16_t optLen = Load16(b + opt + 2, swap);
          if (code == kPcapngOptEnd) break;
          const uint64_t next = opt + 4 + ((static_cast<uint64_t>(optLen) + 3) & ~uint64_t{3});
          if (next > end) break;
          if (code == kPcapngOptEpbFlags && optLen == 4) {
            const uint32_t flags = Load32(b + opt + 4, swap) & 3;
            if (flags == kEpbInbound) dir = kDirectionFromSwitch;
            if (flags == kEpbOutbound) dir = kDirectionToSwitch;
          }
          opt = next;
        }
      }
      out.push_back(dir);
    } else if (type == 2 || type == 3) {  // obsolete and simple packet blocks
      out.push_back(kDirectionUnknown);
    }
    pos += len;
  }
  return out;
}

std::string LinkTypeName(int dlt) {
  const char* name = pcap_datalink_val_to_name(dlt);
  return name != nullptr ? std::string(name) : "unknown";
}

}  // namespace

CaptureRead DecodeCapture(std::span<const uint8_t> data) {
  CaptureRead out;
  if (data.empty()) {
    out.error = "empty file, not a capture";
    return out;
  }
  if (data.size() > kMaxCaptureBytes) {
    out.error = "capture larger than 1 GiB";
    return out;
  }
  // libpcap reads from a stream; fmemopen gives it one over the caller's
  // bytes without a copy. pcap_close closes the stream.
  FILE* stream = fmemopen(const_cast<uint8_t*>(data.data()), data.size(), "rb");
  if (stream == nullptr) {
    out.error = std::string("cannot open the capture bytes: ") + std::strerror(errno);
    return out;
  }
  char errbuf[PCAP_ERRBUF_SIZE] = {};
  pcap_t* p = pcap_fopen_offline_with_tstamp_precision(stream, PCAP_TSTAMP_PRECISION_NANO, errbuf);
  if (p == nullptr) {
    std::fclose(stream);
    out.error = std::string("not a pcap or pcapng capture (") + errbuf + ")";
    return out;
  }
  const int dlt = pcap_datalink(p);
  if (dlt != DLT_EN10MB) {
    pcap_close(p);
    out.error = "link type " + std::to_string(dlt) + " (" + LinkTypeName(dlt) +
                ") is not Ethernet";
    return out;
  }
  out.pcapng = IsPcapng(data);
  const std::vector<uint32_t> directions =
      out.pcapng ? PcapngDirections(data) : std::vector<uint32_t>{};

  for (;;) {
    pcap_pkthdr* header = nullptr;
    const u_char* bytes = nullptr;
    const int rc = pcap_next_ex(p, &header, &bytes);
    if (rc == PCAP_ERROR_BREAK) break;
    if (rc != 1) {
      out.badRecord = out.records.size();
      out.error = "record " + std::to_string(out.records.size() + 1) +
                  " cannot be read: " + pcap_geterr(p);
      break;
    }
    CaptureRecord r;
    r.frame.assign(bytes, bytes + header->caplen);
    r.origLen = header->len;
    r.tsSec = header->ts.tv_sec;
    r.tsNsec = static_cast<uint32_t>(header->ts.tv_usec);  // nanoseconds at this precision
    const size_t i = out.records.size();
    if (i < directions.size()) r.direction = directions[i];
    out.records.push_back(std::move(r));
  }
  pcap_close(p);
  return out;
}

CaptureRead ReadCapture(const std::string& path) {
  CaptureRead out;
  Bytes bytes;
  if (path == "-") {
    bytes.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
  } else {
    std::error_code ec;
    if (std::filesystem::is_directory(path, ec)) {
      out.error = "is a directory, not a capture file";
      return out;
    }
    std::ifstream in(path, std::ios::binary);
    if (!in) {
      out.error = std::string("cannot open: ") + std::strerror(errno);
      return out;
    }
    const auto size = std::filesystem::file_size(path, ec);
    if (!ec && size > kMaxCaptureBytes) {
      out.error = "capture larger than 1 GiB";
      return out;
    }
    bytes.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    if (in.bad()) {
      out.error = "read error";
      return out;
    }
  }
  return DecodeCapture(bytes);
}

namespace {

bool MatchMac(const Bytes& f, size_t at, const MacAddr& mac) {
  return f.size() >= at + 6 && std::equal(mac.begin(), mac.end(), f.begin() + at);
}

template <size_t N>
bool MatchAt(const Bytes& f, size_t at, const std::array<uint8_t, N>& addr) {
  return f.size() >= at + N && std::equal(addr.begin(), addr.end(), f.begin() + at);
}

uint32_t DirectionOf(const Bytes& f, const DirectionRule& rule) {
  if (rule.vmMac) {
    if (MatchMac(f, 0, *rule.vmMac)) return kDirectionFromSwitch;
    if (MatchMac(f, 6, *rule.vmMac)) return kDirectionToSwitch;
  }
  if (f.size() < 14) return kDirectionUnknown;
  size_t l3 = 14;
  uint16_t type = static_cast<uint16_t>(f[12] << 8 | f[13]);
  if (type == kEthVlan && f.size() >= 18) {
    type = static_cast<uint16_t>(f[16] << 8 | f[17]);
    l3 = 18;
  }
  if (type == kEthIpv4 && rule.vmIp4) {
    if (MatchAt(f, l3 + 16, *rule.vmIp4)) return kDirectionFromSwitch;
    if (MatchAt(f, l3 + 12, *rule.vmIp4)) return kDirectionToSwitch;
  }
  if (type == kEthIpv6 && rule.vmIp6) {
    if (MatchAt(f, l3 + 24, *rule.vmIp6)) return kDirectionFromSwitch;
    if (MatchAt(f, l3 + 8, *rule.vmIp6)) return kDirectionToSwitch;
  }
  return kDirectionUnknown;
}

int Dlt(LinkType link) { return link == LinkType::Ethernet ? DLT_EN10MB : DLT_RAW; }

void PutLe(Bytes* out, uint64_t v, int bytes) {
  for (int i = 0; i < bytes; i++) out->push_back(static_cast<uint8_t>(v >> (8 * i)));
}

// One pcapng block: type, length, body padded to 4 bytes, length again.
void PutBlock(Bytes* out, uint32_t type, const Bytes& body) {
  const uint32_t len = static_cast<uint32_t>(12 + ((body.size() + 3) & ~size_t{3}));
  PutLe(out, type, 4);
  PutLe(out, len, 4);
  out->insert(out->end(), body.begin(), body.end());
  out->resize(out->size() + (len - 12 - body.size()), 0);
  PutLe(out, len, 4);
}

}  // namespace

bool TryParseMac(const std::string& text, MacAddr* mac) {
  unsigned b[6];
  char tail;
  if (std::sscanf(text.c_str(), "%x:%x:%x:%x:%x:%x%c", &b[0], &b[1], &b[2], &b[3], &b[4], &b[5],
                  &tail) != 6) {
    return false;
  }
  for (int i = 0; i < 6; i++) {
    if (b[i] > 0xff) return false;
    (*mac)[i] = static_cast<uint8_t>(b[i]);
  }
  return true;
}

bool TryParseIp4(const std::string& text, Ip4Addr* ip) {
  unsigned b[4];
  char tail;
  if (std::sscanf(text.c_str(), "%u.%u.%u.%u%c", &b[0], &b[1], &b[2], &b[3], &tail) != 4) {
    return false;
  }
  for (int i = 0; i < 4; i++) {
    if (b[i] > 0xff) return false;
    (*ip)[i] = static_cast<uint8_t>(b[i]);
  }
  return true;
}

// An IPv6 literal through the rule syntax's own parser, so both accept the
// same text.
bool TryParseIp6(const std::string& text, Ip6Addr* ip) {
  FWRule rule;
  std::string error;
  if (!rules::TryParseRule("ipv6 sa=" + text, &rule, &error)) return false;
  std::copy(rule.ipSa, rule.ipSa + 16, ip->begin());
  return true;
}

bool MakeDirectionRule(const std::string& direction, const std::string& vmMac,
                       const std::string& vmIp, DirectionRule* rule, std::string* error) {
  *rule = DirectionRule{};
  if (direction == "from") {
    rule->fixed = kDirectionFromSwitch;
  } else if (direction == "to") {
    rule->fixed = kDirectionToSwitch;
  } else if (!direction.empty() && direction != "auto") {
    *error = "--direction: not from, to or auto: " + direction;
    return false;
  }
  if (!vmMac.empty()) {
    MacAddr mac;
    if (!TryParseMac(vmMac, &mac)) {
      *error = "--vm-mac: not a MAC address: " + vmMac;
      return false;
    }
    rule->vmMac = mac;
  }
  if (!vmIp.empty()) {
    Ip4Addr ip4;
    Ip6Addr ip6;
    if (TryParseIp4(vmIp, &ip4)) {
      rule->vmIp4 = ip4;
    } else if (vmIp.find(':') != std::string::npos && TryParseIp6(vmIp, &ip6)) {
      rule->vmIp6 = ip6;
    } else {
      *error = "--vm-ip: not an IPv4 or IPv6 address: " + vmIp;
      return false;
    }
  }
  return true;
}

std::optional<size_t> ResolveDirections(std::vector<CaptureRecord>* records,
                                        const DirectionRule& rule) {
  for (size_t i = 0; i < records->size(); i++) {
    CaptureRecord& r = (*records)[i];
    if (r.direction != kDirectionUnknown) continue;
    r.direction = rule.fixed != kDirectionUnknown ? rule.fixed : DirectionOf(r.frame, rule);
    if (r.direction == kDirectionUnknown) return i;
  }
  return std::nullopt;
}

Bytes EncodeCapture(std::span<const CaptureRecord> records, LinkType link, uint32_t snapLen) {
  char* buf = nullptr;
  size_t size = 0;
  FILE* stream = open_memstream(&buf, &size);
  if (stream == nullptr) return {};
  pcap_t* p = pcap_open_dead_with_tstamp_precision(Dlt(link), static_cast<int>(snapLen),
                                                   PCAP_TSTAMP_PRECISION_NANO);
  pcap_dumper_t* d = p != nullptr ? pcap_dump_fopen(p, stream) : nullptr;
  if (d == nullptr) {
    std::fclose(stream);
    std::free(buf);
    if (p != nullptr) pcap_close(p);
    return {};
  }
  for (const CaptureRecord& r : records) {
    pcap_pkthdr h{};
    h.ts.tv_sec = r.tsSec;
    h.ts.tv_usec = r.tsNsec;
    h.caplen = static_cast<uint32_t>(std::min<size_t>(r.frame.size(), snapLen));
    h.len = r.origLen != 0 ? r.origLen : static_cast<uint32_t>(r.frame.size());
    pcap_dump(reinterpret_cast<u_char*>(d), &h, r.frame.data());
  }
  pcap_dump_close(d);  // closes the stream, which publishes buf and size
  pcap_close(p);
  Bytes out(buf, buf + size);
  std::free(buf);
  return out;
}

Bytes EncodePcapng(std::span<const CaptureRecord> records) {
  Bytes out;
  Bytes shb;
  PutLe(&shb, kPcapngByteOrderMagic, 4);
  PutLe(&shb, 1, 2);  // version 1.0
  PutLe(&shb, 0, 2);
  PutLe(&shb, ~uint64_t{0}, 8);  // section length not given
  PutBlock(&out, kPcapngSectionHeader, shb);
  Bytes idb;
  PutLe(&idb, 1, 2);  // LINKTYPE_ETHERNET
  PutLe(&idb, 0, 2);
  PutLe(&idb, 262144, 4);
  PutLe(&idb, 9, 2);  // if_tsresol: 10^-9
  PutLe(&idb, 1, 2);
  idb.insert(idb.end(), {9, 0, 0, 0});
  PutLe(&idb, kPcapngOptEnd, 4);
  PutBlock(&out, kPcapngInterface, idb);
  for (const CaptureRecord& r : records) {
    Bytes epb;
    const uint64_t ts = static_cast<uint64_t>(r.tsSec) * 1000000000u + r.tsNsec;
    PutLe(&epb, 0, 4);
    PutLe(&epb, ts >> 32, 4);
    PutLe(&epb, ts & 0xffffffffu, 4);
    PutLe(&epb, r.frame.size(), 4);
    PutLe(&epb, r.origLen != 0 ? r.origLen : r.frame.size(), 4);
    epb.insert(epb.end(), r.frame.begin(), r.frame.end());
    epb.resize((epb.size() + 3) & ~size_t{3}, 0);
    if (r.direction == kDirectionFromSwitch || r.direction == kDirectionToSwitch) {
      PutLe(&epb, kPcapngOptEpbFlags, 2);
      PutLe(&epb, 4, 2);
      PutLe(&epb, r.direction == kDirectionFromSwitch ? kEpbInbound : kEpbOutbound, 4);
      PutLe(&epb, kPcapngOptEnd, 4);
    }
    PutBlock(&out, kPcapngEnhancedPacket, epb);
  }
  return out;
}

CaptureWriter::~CaptureWriter() {
  std::string ignored;
  (void)Close(&ignored);
}

bool CaptureWriter::Open(const std::string& path, LinkType link, uint32_t snapLen,
                         std::string* error) {
  if (snapLen == 0) {
    *error = "snap length 0";
    return false;
  }
  std::error_code ec;
  if (path != "-" && std::filesystem::is_directory(path, ec)) {
    *error = "is a directory, not a capture file";
    return false;
  }
  pcap_t* p = pcap_open_dead_with_tstamp_precision(
      Dlt(link), static_cast<int>(std::min<uint32_t>(snapLen, INT32_MAX)),
      PCAP_TSTAMP_PRECISION_NANO);
  if (p == nullptr) {
    *error = "cannot set up a capture writer";
    return false;
  }
  pcap_dumper_t* d = pcap_dump_open(p, path.c_str());
  if (d == nullptr) {
    *error = pcap_geterr(p);
    pcap_close(p);
    return false;
  }
  pcap_ = p;
  dumper_ = d;
  snapLen_ = snapLen;
  return true;
}

void CaptureWriter::Write(const CaptureRecord& r) {
  if (dumper_ == nullptr) return;
  pcap_pkthdr h{};
  h.ts.tv_sec = r.tsSec;
  h.ts.tv_usec = r.tsNsec;
  h.caplen = static_cast<uint32_t>(std::min<size_t>(r.frame.size(), snapLen_));
  h.len = r.origLen != 0 ? r.origLen : static_cast<uint32_t>(r.frame.size());
  pcap_dump(static_cast<u_char*>(dumper_), &h, r.frame.data());
  written_++;
}

bool CaptureWriter::Close(std::string* error) {
  if (dumper_ == nullptr) return true;
  auto* d = static_cast<pcap_dumper_t*>(dumper_);
  bool ok = pcap_dump_flush(d) == 0 && std::ferror(pcap_dump_file(d)) == 0;
  pcap_dump_close(d);
  pcap_close(static_cast<pcap_t*>(pcap_));
  dumper_ = nullptr;
  pcap_ = nullptr;
  if (!ok) *error = "write failed";
  return ok;
}

bool WriteCapture(const std::string& path, std::span<const CaptureRecord> records,
                  std::string* error, LinkType link, uint32_t snapLen) {
  CaptureWriter w;
  if (!w.Open(path, link, snapLen, error)) return false;
  for (const CaptureRecord& r : records) w.Write(r);
  return w.Close(error);
}

}  // namespace frames
