// Ports: a filter on a vNIC between two Linux interfaces. Frames read on the
// VM-side interface go to the filter as "to switch" (direction 2), frames
// read on the switch side as "from switch" (direction 1), in lists of up to
// kBatch; what the filter leaves in a list goes out on the other interface,
// lists the filter turns back go out on the side their direction leads to,
// and lists for the slow path go to the slow path the filter is attached to
// (or, with none, are counted and released).
//
// Interfaces are read through TPACKET_V3 receive rings on AF_PACKET sockets
// in promiscuous mode (or recvmmsg where a ring cannot be set up) and
// written with sendmmsg. Senders must not leave checksums or segmentation to
// offload: a frame longer than kFrameMax is counted as oversize and dropped.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <nlohmann/json.hpp>
#include <span>
#include <string>
#include <thread>

#include "host/sluice/framework.h"

namespace service {

struct PortSettings {
  std::string name;  // the filter's name
  std::string agent;
  std::string vmIf;      // VM-side interface
  std::string switchIf;  // switch-side interface
  std::string vmUUID;
  uint32_t vnicIndex = 0;
  uint32_t endPointType = 0;
  uint32_t failurePolicy = 0;
};

// "name=N,agent=A,vm=IF,switch=IF[,uuid=U][,vnic=I][,endpoint=E][,failure=P]"
bool ParsePortSettings(const std::string& text, PortSettings* out, std::string* error);
nlohmann::json PortSettingsToJson(const PortSettings& settings);
bool PortSettingsFromJson(const nlohmann::json& j, PortSettings* out, std::string* error);

struct PortCounters {
  std::atomic<uint64_t> rx[3]{};          // by direction (1, 2)
  std::atomic<uint64_t> tx[3]{};          // by direction of travel
  std::atomic<uint64_t> turnedBack{0};    // issued toward the switch
  std::atomic<uint64_t> slowPath{0};      // faulted with no slow path, released
  std::atomic<uint64_t> fromSlowPath{0};  // handed back by a slow path
  std::atomic<uint64_t> oversize{0};
  std::atomic<uint64_t> txErrors{0};
  std::atomic<uint64_t> batches{0};
  // Time spent handling batches (from receive to transmit) and, of that,
  // inside the filter's packet callback.
  std::atomic<uint64_t> busyNs{0};
  std::atomic<uint64_t> moduleNs{0};
  std::atomic<uint64_t> txNs{0};  // of that, in sending what passed
};

class Port {
 public:
  static constexpr unsigned kBatch = 64;
  // An MTU-sized frame with a VLAN tag and room to spare; anything longer
  // came from segmentation offload.
  static constexpr uint32_t kFrameMax = 9216 + 18;

  // Opens both interfaces, creates the filter through the framework and
  // (unless `start` is false) starts one reader per side. Null with a reason
  // on failure (nothing left behind).
  static std::unique_ptr<Port> Open(const PortSettings& settings, std::string* error, bool start = true);
  // Starts or stops the readers; the filter stays. A stopped port takes no
  // frames (a migrating VM is paused).
  void StartReaders();
  void StopReaders();
  // Frames a slow path sends back: through the filter's slow-path packet
  // callback, then out on the side `direction` leads to. Returns how many
  // were handed to the filter.
  size_t FromSlowPath(const std::vector<std::vector<uint8_t>>& frames, uint32_t direction);
  // Stops the readers, then destroys the filter, waiting out busy answers
  // (at most `waitMs`). False when the filter would not go.
  bool Close(int waitMs = 5000);
  ~Port();

  const PortSettings& settings() const { return settings_; }
  host::FilterId filter() const { return filter_; }
  nlohmann::json Stats() const;

 private:
  Port() = default;
  struct RxFrame {
    const uint8_t* data;
    uint32_t len;      // bytes at data
    uint32_t wireLen;  // length on the wire
  };
  struct Ring {
    uint8_t* map = nullptr;
    size_t mapLen = 0;
    uint32_t blockSize = 0;
    uint32_t blocks = 0;
    uint32_t next = 0;   // the block to read next; kept while readers are stopped
  };
  void Reader(int side);
  void RingReader(int side);
  // Hands `frames` read on `side` to the filter and sends what it leaves.
  void Process(int side, std::span<const RxFrame> frames);
  void Transmit(int fd, host::PacketList& list, uint32_t direction);
  // Sends each delivery out on the side its direction leads to.
  void TransmitDeliveries(std::vector<host::Delivery> deliveries);

  PortSettings settings_;
  host::FilterId filter_ = 0;
  int fd_[3] = {-1, -1, -1};  // [1] switch side, [2] VM side
  Ring ring_[3];
  std::atomic<bool> stop_{false};
  std::thread readers_[3];
  PortCounters counters_;
};

}  // namespace service
