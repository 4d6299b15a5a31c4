// Character device requests of any content: the first bytes are the request
// in user memory, the rest a ruleset behind it.

#include <cstring>

#include "control/control.h"
#include "fuzz/fuzz_support.h"
#include "host/control/control_host.h"

void SluiceFuzzSeeds(std::vector<std::vector<uint8_t>>* seeds) {
  for (uint32_t type : {FWCharDevReqSetRuleset, FWCharDevReqGetRuleset, FWCharDevReqSendIoctl}) {
    FWCharDevRequest req{};
    req.type = type;
    std::strcpy(req.filterName, "fuzz0");
    std::vector<uint8_t> s(reinterpret_cast<uint8_t*>(&req),
                           reinterpret_cast<uint8_t*>(&req) + sizeof(req));
    std::vector<uint8_t> rules = fuzz::SampleRuleset(8);
    s.insert(s.end(), rules.begin(), rules.end());
    s.resize(s.size() + 281 * 4);  // room for the get reply
    seeds->push_back(s);
  }
  FWCharDevRequest byUuid{};
  byUuid.type = FWCharDevReqGetRuleset;
  std::strcpy(byUuid.hqUUID, "fuzz-vm");
  std::vector<uint8_t> s(reinterpret_cast<uint8_t*>(&byUuid),
                         reinterpret_cast<uint8_t*>(&byUuid) + sizeof(byUuid));
  s.resize(s.size() + 400);
  seeds->push_back(s);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  host::FilterId id = fuzz::NewFilter();
  uint64_t user = host::UserMemory::Map(std::vector<uint8_t>(data, data + size));
  int32_t result = 0;
  (void)host::CharDevs::Ioctl(fuzz::kAgent, size % 5 == 4 ? 1 : 0, user, &result);
  host::UserMemory::Unmap(user);
  while (host::Sluice::PendingReplies(host::RequestKind::IoctlRequest) > 0) {
    host::Sluice::ReleaseReplies(host::RequestKind::IoctlRequest);
  }
  fuzz::Finish(id);
  return 0;
}
