#include "service/protocol/protocol.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <stdexcept>

namespace slcproto {
namespace {

uint32_t Le32(const uint8_t* p) {
  return uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
}
uint16_t Le16(const uint8_t* p) { return static_cast<uint16_t>(p[0] | p[1] << 8); }
void Put32(uint8_t* p, uint32_t v) {
  for (int i = 0; i < 4; i++) p[i] = static_cast<uint8_t>(v >> (8 * i));
}
void Put16(uint8_t* p, uint16_t v) {
  p[0] = static_cast<uint8_t>(v);
  p[1] = static_cast<uint8_t>(v >> 8);
}

// Reads exactly `len` bytes before `deadline` (none when timeoutMs is 0).
// `started`: part of the message was read already, so an end of stream
// here truncates it.
bool ReadFull(int fd, uint8_t* buf, size_t len, int timeoutMs,
              std::chrono::steady_clock::time_point deadline, bool started, std::string* error) {
  size_t got = 0;
  while (got < len) {
    if (timeoutMs > 0) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                      deadline - std::chrono::steady_clock::now())
                      .count();
      if (left <= 0) {
        *error = "timed out waiting for a complete message";
        return false;
      }
      pollfd p{fd, POLLIN, 0};
      int r = poll(&p, 1, static_cast<int>(left));
      if (r < 0 && errno == EINTR) continue;
      if (r < 0) {
        *error = std::string("poll: ") + std::strerror(errno);
        return false;
      }
      if (r == 0) continue;
    }
    ssize_t n = read(fd, buf + got, len - got);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      *error = std::string("read: ") + std::strerror(errno);
      return false;
    }
    if (n == 0) {
      *error = got == 0 && !started ? "end of stream" : "truncated message";
      return false;
    }
    got += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

bool ParseHeader(std::span<const uint8_t> bytes, Header* header, std::string* error) {
  if (bytes.size() < kHeaderSize) {
    *error = "short header";
    return false;
  }
  if (Le32(bytes.data()) != kMagic) {
    *error = "not a control message (bad magic)";
    return false;
  }
  header->version = Le16(bytes.data() + 4);
  header->type = Le16(bytes.data() + 6);
  header->argsLen = Le32(bytes.data() + 8);
  header->blobLen = Le32(bytes.data() + 12);
  if (header->version != kVersion) {
    *error = "unsupported protocol version " + std::to_string(header->version);
    return false;
  }
  if (header->argsLen > kMaxArgs) {
    *error = "arguments of " + std::to_string(header->argsLen) + " bytes exceed " +
             std::to_string(kMaxArgs);
    return false;
  }
  if (header->blobLen > kMaxBlob) {
    *error =
        "data of " + std::to_string(header->blobLen) + " bytes exceeds " + std::to_string(kMaxBlob);
    return false;
  }
  return true;
}

bool ParseBody(const Header& header, std::span<const uint8_t> body, Message* out,
               std::string* error) {
  if (body.size() != size_t{header.argsLen} + header.blobLen) {
    *error = "body length does not match the header";
    return false;
  }
  out->type = static_cast<Type>(header.type);
  if (header.argsLen == 0) {
    out->args = nlohmann::json::object();
  } else {
    out->args = nlohmann::json::parse(body.begin(), body.begin() + header.argsLen, nullptr,
                                      /*allow_exceptions=*/false);
    if (out->args.is_discarded() || !out->args.is_object()) {
      *error = "arguments are not a JSON object";
      return false;
    }
  }
  out->blob.assign(body.begin() + header.argsLen, body.end());
  return true;
}

std::vector<uint8_t> Encode(const Message& msg) {
  // Text from the module is not promised to be UTF-8; bytes that are not go
  // out as U+FFFD rather than failing the message.
  const std::string args = msg.args.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  if (args.size() > kMaxArgs || msg.blob.size() > kMaxBlob) {
    throw std::length_error("control message over its bounds");
  }
  std::vector<uint8_t> out(kHeaderSize + args.size() + msg.blob.size());
  Put32(out.data(), kMagic);
  Put16(out.data() + 4, kVersion);
  Put16(out.data() + 6, static_cast<uint16_t>(msg.type));
  Put32(out.data() + 8, static_cast<uint32_t>(args.size()));
  Put32(out.data() + 12, static_cast<uint32_t>(msg.blob.size()));
  std::memcpy(out.data() + kHeaderSize, args.data(), args.size());
  if (!msg.blob.empty()) {
    std::memcpy(out.data() + kHeaderSize + args.size(), msg.blob.data(), msg.blob.size());
  }
  return out;
}

Message Reply(bool ok, const std::string& error) {
  Message m;
  m.type = Type::kReply;
  m.args["ok"] = ok;
  if (!ok) m.args["error"] = error;
  return m;
}

bool ReadMessage(int fd, Message* out, std::string* error, int timeoutMs) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  uint8_t head[kHeaderSize];
  if (!ReadFull(fd, head, sizeof head, timeoutMs, deadline, false, error)) return false;
  Header h;
  if (!ParseHeader(head, &h, error)) return false;
  std::vector<uint8_t> body(size_t{h.argsLen} + h.blobLen);
  if (!ReadFull(fd, body.data(), body.size(), timeoutMs, deadline, true, error)) return false;
  return ParseBody(h, body, out, error);
}

bool WriteMessage(int fd, const Message& msg, std::string* error) {
  std::vector<uint8_t> bytes;
  try {
    bytes = Encode(msg);
  } catch (const std::length_error& e) {
    *error = e.what();
    return false;
  }
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      *error = std::string("write: ") + std::strerror(errno);
      return false;
    }
    done += static_cast<size_t>(n);
  }
  return true;
}

int Connect(const std::string& path, std::string* error) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) {
    *error = "socket path too long: " + path;
    return -1;
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    *error = std::string("socket: ") + std::strerror(errno);
    return -1;
  }
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    *error = "cannot connect to " + path + ": " + std::strerror(errno);
    close(fd);
    return -1;
  }
  return fd;
}

bool Call(const std::string& path, const Message& request, Message* reply, std::string* error,
          int timeoutMs) {
  int fd = Connect(path, error);
  if (fd < 0) return false;
  // A host that refuses the peer answers at once and hangs up, possibly
  // before the request is written: its answer is still there to read.
  std::string writeError;
  const bool wrote = WriteMessage(fd, request, &writeError);
  bool ok = ReadMessage(fd, reply, error, timeoutMs);
  if (!ok && !wrote) *error = writeError;
  close(fd);
  if (ok && reply->type != Type::kReply) {
    *error = "the host answered with something other than a reply";
    ok = false;
  }
  return ok;
}

}  // namespace slcproto
