// The long-running host's control protocol: one message as a client would
// send it, header and body. What parses must encode back to the same
// message; requests for the module's channels (rulesets through the
// property and the device, the status tree, stats) then go through the
// host's dispatch with a filter of the module in place. Requests that
// would open interfaces, sockets or agents (ports, slow paths, migration,
// agent creation) are parsed only: a fuzzer must not touch the network,
// and agents outlive an input.

#include <cstdio>
#include <cstdlib>

#include "fuzz/fuzz_support.h"
#include "service/host/control_server.h"
#include "service/protocol/protocol.h"

namespace {

using slcproto::Message;
using slcproto::Type;

bool Dispatched(Type type) {
  switch (type) {
    case Type::kHello:
    case Type::kRemovePort:
    case Type::kListPorts:
    case Type::kStats:
    case Type::kRulesetWrite:
    case Type::kRulesetRead:
    case Type::kRulesetPoll:
    case Type::kDevSetRuleset:
    case Type::kDevGetRuleset:
    case Type::kDevTestIoctl:
    case Type::kStatus:
      return true;
    default:
      return false;
  }
}

Message Request(Type type, nlohmann::json args, std::vector<uint8_t> blob = {}) {
  Message m;
  m.type = type;
  m.args = std::move(args);
  m.blob = std::move(blob);
  return m;
}

}  // namespace

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  const std::string agent = fuzz::kAgent;
  for (const Message& m : {
           Request(Type::kHello, nlohmann::json::object()),
           Request(Type::kStatus, {{"agent", agent}, {"maxRules", 5}}),
           Request(Type::kDevSetRuleset, {{"agent", agent}, {"uuid", "fuzz-vm"}, {"vnic", 0}},
                   fuzz::SampleRuleset(8)),
           Request(Type::kDevGetRuleset, {{"agent", agent}, {"uuid", "fuzz-vm"}, {"vnic", 0}}),
           Request(Type::kDevTestIoctl,
                   {{"agent", agent}, {"uuid", "fuzz-vm"}, {"vnic", 0}, {"cookie", 7}}),
           Request(Type::kRulesetWrite, {{"agent", agent}, {"filter", "fuzz0"}},
                   fuzz::SampleRuleset(7)),
           Request(Type::kAddPort, {{"port", {{"name", "p"}, {"agent", agent}}}}),
       }) {
    seeds->push_back(slcproto::Encode(m));
  }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static service::ControlServer server;  // never started: no socket
  const std::span<const uint8_t> bytes(data, size);
  slcproto::Header header;
  std::string error;
  if (size < slcproto::kHeaderSize) return 0;
  if (!slcproto::ParseHeader(bytes.first(slcproto::kHeaderSize), &header, &error)) {
    if (error.empty()) {
      std::fprintf(stderr, "fuzz: header refused without a reason\n");
      std::abort();
    }
    return 0;
  }
  // Bytes past the message are the next message on a stream: left alone.
  std::span<const uint8_t> body = bytes.subspan(slcproto::kHeaderSize);
  const uint64_t bodyLen = uint64_t{header.argsLen} + header.blobLen;
  if (body.size() < bodyLen) return 0;
  body = body.first(bodyLen);
  Message req;
  if (!slcproto::ParseBody(header, body, &req, &error)) return 0;
  const std::vector<uint8_t> again = slcproto::Encode(req);
  Message back;
  slcproto::Header backHeader;
  if (!slcproto::ParseHeader(std::span(again).first(slcproto::kHeaderSize), &backHeader, &error) ||
      !slcproto::ParseBody(backHeader, std::span(again).subspan(slcproto::kHeaderSize), &back,
                           &error) ||
      back.type != req.type || back.args != req.args || back.blob != req.blob) {
    std::fprintf(stderr, "fuzz: a parsed message does not survive encoding: %s\n", error.c_str());
    std::abort();
  }
  if (!Dispatched(req.type)) return 0;
  host::FilterId id = fuzz::NewFilter();
  try {
    (void)server.Handle(req);
  } catch (const std::exception&) {
    // The server answers these as malformed requests.
  }
  fuzz::Finish(id);
  return 0;
}
