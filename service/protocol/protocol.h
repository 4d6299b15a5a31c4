// The control protocol between sluice-host and its clients (sluice-ctl
// today; a slow-path process and a peer host for migration later).
//
// A message on the stream is a 16-byte header followed by a body:
//
//   u32 magic 'SLCP'   u16 version   u16 type   u32 argsLen   u32 blobLen
//   argsLen bytes of JSON (an object)   blobLen bytes of binary data
//
// Integers are little-endian. The JSON object carries the request's named
// arguments (agent, filter, ...) or a reply's outcome; the blob carries
// bytes that should not be re-encoded (wire rulesets, frames, saved state).
// Both parts are bounded before anything is allocated, so a peer that
// announces more than the bounds is refused without reading further.
//
// Every request gets exactly one reply (type kReply) with "ok" true or
// false and, when false, an "error" text. A reply is never sent for a reply.
#pragma once

#include <cstddef>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace slcproto {

inline constexpr uint32_t kMagic = 0x50434c53;  // "SLCP" as bytes on the wire
inline constexpr uint16_t kVersion = 1;
inline constexpr size_t kHeaderSize = 16;
// A ruleset of 100,000 version-8 rules is about 28 MB; the blob bound
// leaves room for that and no more.
inline constexpr uint32_t kMaxArgs = 64 * 1024;
inline constexpr uint32_t kMaxBlob = 32 * 1024 * 1024;

// Message types. Ranges leave room for the clients that come later:
// 0x01xx operator requests, 0x02xx slow-path traffic, 0x03xx host-to-host
// migration. Unknown types are answered with an error.
enum class Type : uint16_t {
  kReply = 0x0001,

  kHello = 0x0100,          // -> {host, version, pid}
  kCreateAgent = 0x0101,    // {text}
  kAddPort = 0x0102,        // {port: PortSettings as an object}
  kRemovePort = 0x0103,     // {name}
  kListPorts = 0x0104,      // -> {ports: [...]} with per-port traffic counters
  kRulesetWrite = 0x0105,   // {agent, filter} + ruleset blob (ruleset property)
  kRulesetRead = 0x0106,    // {agent, filter} -> ruleset blob
  kRulesetPoll = 0x0107,    // {agent, filter} -> {ready, size}
  kDevSetRuleset = 0x0108,  // {agent, filter | uuid+vnic} + ruleset blob
  kDevGetRuleset = 0x0109,  // {agent, filter | uuid+vnic} -> ruleset blob
  kDevTestIoctl = 0x010a,   // {agent, filter | uuid+vnic, cookie}
  kStatus = 0x010b,         // {path: [..]} -> {tree: ...}
  kStats = 0x010c,          // -> {heapBytes, heapBlocks, livePackets, timers}

  // The slow-path link (service/protocol/slowpath_link.h says who sends
  // which and which get no reply).
  kSlowPathFirst = 0x0200,
  kSpRegister = 0x0200,     // sp -> host, first on the link: {agent, name} -> {id}
  kSpAttach = 0x0201,       // host -> sp: {seq, filter, slowPath} -> {seq}
  kSpDetach = 0x0202,       // host -> sp: {filter}; no reply
  kSpFetchState = 0x0203,   // host -> sp: {seq, filter} -> {seq} + state blob
  kSpRestoreState = 0x0204, // host -> sp: {seq, filter} + state blob -> {seq}
  kSpPackets = 0x0205,      // host -> sp: {filter, direction, count} + frames; no reply
  kSpReissue = 0x0206,      // sp -> host: {seq, filter, direction} + frames -> {seq, sent}
  kSpIoctl = 0x0207,        // sp -> host: {seq, filter, code} + payload -> {seq, replies}
  kSlowPathLast = 0x02ff,

  // Host-to-host migration.
  kMigrationFirst = 0x0300,
  kMigrateOut = 0x0300,     // ctl -> source: {port, to[, vm, switch]} -> {savedBytes, ...}
  kMigrateIn = 0x0301,      // source -> destination: {port: PortSettings} + saved state
  kMigrationLast = 0x03ff,
};

struct Message {
  Type type = Type::kReply;
  nlohmann::json args = nlohmann::json::object();
  std::vector<uint8_t> blob;
};

// Header fields as read, before the body.
struct Header {
  uint16_t version = 0;
  uint16_t type = 0;
  uint32_t argsLen = 0;
  uint32_t blobLen = 0;
};

// Checks a header; false with a reason for a wrong magic or version, or
// lengths over the bounds.
bool ParseHeader(std::span<const uint8_t> bytes, Header* header, std::string* error);
// Parses a complete body against its header; false with a reason when the
// arguments are not a JSON object.
bool ParseBody(const Header& header, std::span<const uint8_t> body, Message* out,
               std::string* error);
// The message on the wire; throws std::length_error past the bounds.
std::vector<uint8_t> Encode(const Message& msg);

Message Reply(bool ok, const std::string& error = {});

// Blocking I/O on a stream socket. ReadMessage gives up after `timeoutMs`
// without a complete message (0 = wait forever); both return false with a
// reason on error, end of stream or a refused header.
bool ReadMessage(int fd, Message* out, std::string* error, int timeoutMs = 0);
bool WriteMessage(int fd, const Message& msg, std::string* error);

// Connects to a control socket; -1 with a reason on failure.
int Connect(const std::string& path, std::string* error);
// One request, one reply. False with a reason when the exchange failed (not
// when the reply says ok=false).
bool Call(const std::string& path, const Message& request, Message* reply, std::string* error,
          int timeoutMs = 30000);

}  // namespace slcproto
