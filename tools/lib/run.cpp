#include "tools/lib/run.h"

#include <algorithm>
#include <cstring>

#include "control/control.h"
#include "firewall/fw_trace.h"
#include "host/control/control_host.h"
#include "host/core/host_core.h"
#include "host/net/packets.h"
#include "host/sluice/framework.h"
#include "module/module.h"
#include "tools/lib/filter_view.h"
#include "tools/lib/ruleset_builder.h"

namespace runner {

namespace {

using frames::Bytes;
using frames::CaptureRecord;

std::string AgentName(const std::string& createText) {
  return createText.substr(0, createText.find(':'));
}

std::vector<render::ByteChange> Diff(const Bytes& before, const Bytes& after) {
  std::vector<render::ByteChange> out;
  const size_t n = std::min(before.size(), after.size());
  for (size_t i = 0; i < n; i++) {
    if (before[i] != after[i]) out.push_back({i, before[i], after[i]});
  }
  return out;
}

CaptureRecord Out(const CaptureRecord& in, Bytes frame) {
  CaptureRecord r;
  r.direction = in.direction;
  r.origLen = static_cast<uint32_t>(frame.size());
  r.frame = std::move(frame);
  r.tsSec = in.tsSec;
  r.tsNsec = in.tsNsec;
  return r;
}

void TearDown(host::FilterId filter, Result* result) {
  if (filter != 0) {
    while (host::Sluice::DestroyFilter(filter) == ZEL_BUSY) {
      host::Sluice::ReleaseReplies(host::RequestKind::SetSlowPath);
    }
  }
  host::Loader::Unload();
  result->leftovers = host::Leftovers();
  host::Reset();
}

}  // namespace

Bytes GreDatagram(const frames::Ip4Addr& src, const uint8_t dst[4],
                  const std::vector<uint8_t>& payload, uint16_t id) {
  Bytes d(20, 0);
  const size_t total = std::min<size_t>(20 + payload.size(), 0xffff);
  d[0] = 0x45;
  d[2] = static_cast<uint8_t>(total >> 8);
  d[3] = static_cast<uint8_t>(total);
  d[4] = static_cast<uint8_t>(id >> 8);
  d[5] = static_cast<uint8_t>(id);
  d[8] = 64;
  d[9] = 47;
  std::copy(src.begin(), src.end(), d.begin() + 12);
  std::copy(dst, dst + 4, d.begin() + 16);
  const uint16_t sum = frames::InternetChecksum(d);
  d[10] = static_cast<uint8_t>(sum >> 8);
  d[11] = static_cast<uint8_t>(sum);
  d.insert(d.end(), payload.begin(), payload.begin() + static_cast<ptrdiff_t>(total - 20));
  return d;
}

Bytes TagFrame(const Bytes& frame, uint16_t vlanId, uint8_t priority) {
  if ((vlanId == 0 && priority == 0) || frame.size() < 14) return frame;
  Bytes f = frame;
  if (f[12] == 0x81 && f[13] == 0x00 && f.size() >= 16) {
    f[14] = static_cast<uint8_t>((f[14] & 0x1f) | (priority << 5));
    return f;
  }
  const uint16_t tci = static_cast<uint16_t>((priority << 13) | (vlanId & 0x0fff));
  const uint8_t tag[4] = {0x81, 0x00, static_cast<uint8_t>(tci >> 8), static_cast<uint8_t>(tci)};
  f.insert(f.begin() + 12, tag, tag + 4);
  return f;
}

Result Run(const Config& config) {
  Result result;
  host::Reset();
  host::Timers::SetMode(host::TimerMode::Manual);
  if (host::Loader::Load(&slcGenericModuleImage) != 0) {
    result.error = "the module did not start";
    TearDown(0, &result);
    return result;
  }

  const std::string agent = AgentName(config.agentText);
  host::FilterId filter = 0;
  ZelStatus status = host::ClientPorts::Write(kSLCGenericCreateAgentPropName, config.agentText);
  if (status != ZEL_OK || !host::Sluice::AgentRegistered(agent)) {
    result.error = "agent '" + agent + "' was not created (" + zel_StatusToString(status) + ")";
  } else {
    host::FilterConfig fc;
    fc.name = config.filterName;
    fc.vmUUID = "564d-demo-vm1";
    fc.failurePolicy = config.failurePolicy;
    status = host::Sluice::CreateFilter(agent, fc, &filter);
    if (status != ZEL_OK) {
      result.error = std::string("filter not created (") + zel_StatusToString(status) + ")";
      filter = 0;
    }
  }
  if (result.error.empty() && config.slowPath) {
    (void)host::Sluice::RegisterSlowPath(agent, 1);
    host::Timers::RunDue();
  }
  if (result.error.empty() && !config.ruleset.empty()) {
    status = host::Sluice::PropertyWrite(agent + ".ruleset", filter, config.ruleset);
    result.rulesetStatus = zel_StatusToString(status);
    result.rulesetRefused = status != ZEL_OK;
  }
  if (!result.error.empty()) {
    TearDown(filter, &result);
    return result;
  }

  auto* module = static_cast<SLCGenericFilter*>(host::Sluice::FilterPriv(filter));
  std::vector<std::string> ruleTexts;
  const std::vector<std::string> instances = filterview::FilterInstances(agent);
  const std::string instance = instances.empty() ? std::string() : instances[0];
  for (const SLCGeneric_RuleSummary& r : filterview::RuleSummaries(agent, instance)) {
    ruleTexts.push_back(render::RuleSummaryLine(r));
  }
  uint16_t greId = 0;
  render::CounterListing tallies;

  for (size_t i = 0; i < config.records.size(); i++) {
    const CaptureRecord& rec = config.records[i];
    render::PacketReport p;
    p.index = i + 1;
    p.direction = rec.direction == frames::kDirectionToSwitch ? 2 : 1;
    p.tsSec = rec.tsSec;
    p.tsNsec = rec.tsNsec;
    p.frame = rec.frame;
    p.origLen = rec.origLen;

    ZelPkt* pkt = host::Packets::Make(rec.frame);
    const uint64_t serial = host::Packets::Serial(pkt);
    p.traced = FWTracePacket(module, pkt, p.direction, &p.trace) == ZEL_OK;
    if (p.traced && (p.trace.decision == FWTraceExactRule ||
                     p.trace.decision == FWTraceGeneralRule) &&
        p.trace.position < ruleTexts.size()) {
      p.ruleText = ruleTexts[p.trace.position];
    }
    if (p.traced && p.trace.decision == FWTraceNoRule) {
      tallies.noMatchPackets++;
      tallies.noMatchBytes += rec.frame.size();
    }
    if (p.traced && p.trace.decision == FWTraceNoRuleset) {
      tallies.defaultPackets++;
      tallies.defaultBytes += rec.frame.size();
    }

    host::PacketList list;
    list.Append(pkt);
    const size_t sentBefore = host::Sockets::Sent().size();
    status = host::Sluice::Deliver(filter, list, p.direction);
    if (status != ZEL_OK) p.status = zel_StatusToString(status);

    // A frame leaving on the data path: its bytes against the input, and its
    // metadata, which a tagged link carries in an 802.1Q tag.
    auto leaving = [&](ZelPkt* out, render::Fate fate, std::vector<CaptureRecord>* sink) {
      p.fates.push_back(fate);
      const Bytes frame = host::Packets::Frame(out);
      p.changes = Diff(rec.frame, frame);
      const uint8_t prio = host::Packets::Priority(out);
      const uint16_t vlan = host::Packets::VlanId(out);
      const uint16_t tag = host::Packets::ResPoolTag(out);
      if (prio != 0) p.priority = prio;
      if (tag != 0) p.poolTag = tag;
      sink->push_back(Out(rec, TagFrame(frame, vlan, prio)));
    };
    for (ZelPkt* out : list.Packets()) {
      if (host::Packets::Serial(out) != serial) continue;
      if (p.direction == 1) {
        leaving(out, render::Fate::ToVm, &result.outputs.toVm);
      } else {
        leaving(out, render::Fate::ToSwitch, &result.outputs.toSwitch);
      }
    }
    for (host::Delivery& d : host::Sluice::TakeIssued(filter)) {
      for (ZelPkt* out : d.packets) {
        if (host::Packets::Serial(out) == serial) {
          leaving(out, render::Fate::TurnedBack, &result.outputs.toSwitch);
        }
        zel_PktRelease(out);
      }
    }
    for (host::Delivery& d : host::Sluice::TakeFaulted(filter)) {
      for (ZelPkt* out : d.packets) {
        if (host::Packets::Serial(out) == serial) {
          p.fates.push_back(render::Fate::SlowPath);
          result.outputs.slowPath.push_back(Out(rec, host::Packets::Frame(out)));
        }
        zel_PktRelease(out);
      }
    }
    const std::vector<host::SentDatagram> sent = host::Sockets::Sent();
    for (size_t s = sentBefore; s < sent.size(); s++) {
      const host::SentDatagram& g = sent[s];
      render::GreCopy copy;
      copy.destination =
          std::to_string(g.addr[0]) + "." + std::to_string(g.addr[1]) + "." +
          std::to_string(g.addr[2]) + "." + std::to_string(g.addr[3]);
      copy.bytes = g.bytes.size();
      copy.innerBytes = g.bytes.size() >= 4 ? g.bytes.size() - 4 : 0;
      p.gre.push_back(copy);
      result.outputs.gre.push_back(Out(rec, GreDatagram(config.greSource, g.addr, g.bytes, greId++)));
    }
    const bool leftAnywhere = std::any_of(p.fates.begin(), p.fates.end(), [](render::Fate f) {
      return f != render::Fate::Dropped;
    });
    if (!leftAnywhere) {
      p.fates.push_back(render::Fate::Dropped);
      result.outputs.dropped.push_back(Out(rec, rec.frame));
    }
    result.packets.push_back(std::move(p));
  }

  result.counters = filterview::ReadCounters(agent, instance, config.ruleset);
  result.counters.tallied = true;
  result.counters.noMatchPackets = tallies.noMatchPackets;
  result.counters.noMatchBytes = tallies.noMatchBytes;
  result.counters.defaultPackets = tallies.defaultPackets;
  result.counters.defaultBytes = tallies.defaultBytes;
  for (const host::LogRecord& r : host::Log::Records()) {
    result.log.push_back({r.urgency, r.object, r.text});
  }
  TearDown(filter, &result);
  return result;
}

}  // namespace runner
