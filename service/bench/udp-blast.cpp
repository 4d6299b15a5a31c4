// udp-blast: sends 64-byte UDP frames as fast as an interface takes them,
// for measuring sluice-host's packet rate. Frames cycle over `flows`
// source ports starting at 10000 (so exact rules can match each flow).
//
//   udp-blast IFACE SRC_MAC DST_MAC SRC_IP DST_IP DPORT FLOWS SECONDS
// Prints the frames sent.
#include <arpa/inet.h>
#include <linux/if_packet.h>
#include <net/ethernet.h>
#include <net/if.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace {

bool ParseMac(const char* s, uint8_t* out) {
  unsigned v[6];
  if (std::sscanf(s, "%x:%x:%x:%x:%x:%x", &v[0], &v[1], &v[2], &v[3], &v[4], &v[5]) != 6) {
    return false;
  }
  for (int i = 0; i < 6; i++) out[i] = static_cast<uint8_t>(v[i]);
  return true;
}

uint16_t Checksum(const uint8_t* p, size_t len) {
  uint32_t sum = 0;
  for (size_t i = 0; i + 1 < len; i += 2) sum += (p[i] << 8) | p[i + 1];
  while (sum >> 16) sum = (sum & 0xffff) + (sum >> 16);
  return static_cast<uint16_t>(~sum);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 9) {
    std::fprintf(stderr,
                 "usage: udp-blast IFACE SRC_MAC DST_MAC SRC_IP DST_IP DPORT FLOWS SECONDS\n");
    return 2;
  }
  uint8_t smac[6], dmac[6];
  in_addr sa{}, da{};
  if (!ParseMac(argv[2], smac) || !ParseMac(argv[3], dmac) ||
      inet_pton(AF_INET, argv[4], &sa) != 1 || inet_pton(AF_INET, argv[5], &da) != 1) {
    std::fprintf(stderr, "udp-blast: bad address\n");
    return 2;
  }
  const int dport = std::atoi(argv[6]);
  const int flows = std::max(1, std::atoi(argv[7]));
  const double seconds = std::atof(argv[8]);
  const unsigned index = if_nametoindex(argv[1]);
  int fd = socket(AF_PACKET, SOCK_RAW, htons(ETH_P_ALL));
  if (index == 0 || fd < 0) {
    std::perror("udp-blast");
    return 1;
  }
  sockaddr_ll sll{};
  sll.sll_family = AF_PACKET;
  sll.sll_ifindex = static_cast<int>(index);
  sll.sll_protocol = htons(ETH_P_ALL);
  if (bind(fd, reinterpret_cast<sockaddr*>(&sll), sizeof sll) != 0) {
    std::perror("udp-blast: bind");
    return 1;
  }
  // One 64-byte frame (60 without the FCS the wire adds) per flow.
  constexpr size_t kLen = 60;
  std::vector<uint8_t> frames(static_cast<size_t>(flows) * kLen, 0);
  for (int f = 0; f < flows; f++) {
    uint8_t* p = frames.data() + static_cast<size_t>(f) * kLen;
    std::memcpy(p, dmac, 6);
    std::memcpy(p + 6, smac, 6);
    p[12] = 0x08;
    uint8_t* ip = p + 14;
    ip[0] = 0x45;
    ip[3] = 46;  // 20 + 8 + 18 bytes of payload
    ip[8] = 64;
    ip[9] = 17;
    std::memcpy(ip + 12, &sa, 4);
    std::memcpy(ip + 16, &da, 4);
    const uint16_t c = Checksum(ip, 20);
    ip[10] = static_cast<uint8_t>(c >> 8);
    ip[11] = static_cast<uint8_t>(c);
    uint8_t* udp = ip + 20;
    const int sport = 10000 + f;
    udp[0] = static_cast<uint8_t>(sport >> 8);
    udp[1] = static_cast<uint8_t>(sport);
    udp[2] = static_cast<uint8_t>(dport >> 8);
    udp[3] = static_cast<uint8_t>(dport);
    udp[5] = 26;  // length; checksum 0 = none
  }
  constexpr int kBatch = 64;
  std::vector<iovec> iov(kBatch);
  std::vector<mmsghdr> msgs(kBatch);
  uint64_t sent = 0;
  int next = 0;
  const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  while (std::chrono::steady_clock::now() < end) {
    for (int i = 0; i < kBatch; i++) {
      iov[i] = {frames.data() + static_cast<size_t>(next) * kLen, kLen};
      msgs[i] = {};
      msgs[i].msg_hdr.msg_iov = &iov[i];
      msgs[i].msg_hdr.msg_iovlen = 1;
      next = (next + 1) % flows;
    }
    int n = sendmmsg(fd, msgs.data(), kBatch, 0);
    if (n > 0) sent += static_cast<uint64_t>(n);
  }
  std::printf("%llu\n", static_cast<unsigned long long>(sent));
  close(fd);
  return 0;
}
