// The renderer: frames dissected as what they are (802.3, tagged, IPv6
// extension chains, fragments, runts, cut headers), never read past their
// end, and the JSON field names other tools rely on.
#include "tools/lib/render.h"

#include <gtest/gtest.h>

#include <random>

#include "control/control.h"

namespace {

using frames::Bytes;
using frames::FrameBuilder;

FrameBuilder Eth() {
  return FrameBuilder().Eth(frames::Mac("02:00:00:00:00:02"), frames::Mac("02:00:00:00:00:01"));
}

TEST(Render, FramesAreShownAsWhatTheyAre) {
  const Bytes v4 = Eth().Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.2")).Tcp(1, 2).Build();
  struct Case {
    const char* name;
    Bytes frame;
    std::string text;
  };
  const Case cases[] = {
      {"ipv4 tcp", v4,
       "02:00:00:00:00:01 > 02:00:00:00:00:02 IPv4 10.0.0.1:1 > 10.0.0.2:2 tcp, 54 bytes"},
      {"tagged, marked udp",
       Eth().Vlan(100, 5).Ipv4({}, {}).Tos(46 << 2).Udp(53, 9).Build(),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 vlan 100 pri 5 IPv4 0.0.0.0:53 > 0.0.0.0:9 udp "
       "dscp 46, 46 bytes"},
      {"802.3 with SNAP", Eth().Llc().Ipv4({}, {}).Udp(1, 2).Build(),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 802.3 length 36 snap IPv4 0.0.0.0:1 > 0.0.0.0:2 "
       "udp, 50 bytes"},
      {"802.3 without SNAP",
       Eth().EtherType(0x0026).Payload(Bytes{0x42, 0x42, 0x03, 0, 0, 0, 0, 0}).Build(),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 802.3 length 38 LLC, 22 bytes"},
      {"later fragment", Eth().Ipv4({}, {}).Fragment(10, false).Tcp(1, 2).Build(),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 IPv4 0.0.0.0 > 0.0.0.0 tcp non-first fragment "
       "(no ports), 54 bytes"},
      {"ipv6 first fragment behind options",
       Eth().Ipv6(frames::Ip6("2001:db8::1"), frames::Ip6("fe80::1:0:0:2"))
           .HopByHop()
           .Fragment6(0, true)
           .Udp(7, 8)
           .Build(),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 IPv6 [2001:db8::1]:7 > [fe80::1:0:0:2]:8 udp first "
       "fragment, 78 bytes"},
      {"ipv4 header cut", Bytes(v4.begin(), v4.begin() + 20),
       "02:00:00:00:00:01 > 02:00:00:00:00:02 IPv4 [truncated], 20 bytes"},
      {"runt", Bytes(10, 0), "runt frame of 10 bytes"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(render::DissectionText(render::Dissect(c.frame)), c.text) << c.name;
  }
}

TEST(Render, HostileFramesAreNeverReadPastTheirEnd) {
  std::mt19937 rng(7);
  const Bytes base = Eth().Ipv6({}, {}).HopByHop(2).Routing().Ah().Fragment6(0, true).Tcp(1, 2).Build();
  for (int i = 0; i < 5000; i++) {
    Bytes f(base.begin(), base.begin() + static_cast<ptrdiff_t>(rng() % (base.size() + 1)));
    for (int k = 0; k < 3 && !f.empty(); k++) f[rng() % f.size()] = static_cast<uint8_t>(rng());
    // A copy of exactly the frame's size, so a sanitizer sees any overread.
    std::vector<uint8_t> exact(f.begin(), f.end());
    const render::Dissection d = render::Dissect(exact);
    EXPECT_EQ(render::DissectionText(d).find('\n'), std::string::npos);
  }
}

TEST(Render, JsonFieldNamesAreStable) {
  render::PacketReport p;
  p.index = 4;
  p.direction = 2;
  p.frame = Eth().Ipv4({}, {}).Udp(1, 2).Build();
  p.traced = true;
  p.trace.decision = FWTraceGeneralRule;
  p.trace.action = SLCGenericActionGRE;
  p.trace.position = 3;
  p.trace.generalIndex = 1;
  p.ruleText = "ipProto=17 direction=both action=gre";
  p.fates = {render::Fate::ToSwitch};
  p.gre = {{"198.51.100.7", 46, 42}};
  const nlohmann::json j = render::PacketJson(p);
  EXPECT_EQ(j["direction"], "to-switch");
  EXPECT_EQ(j["trace"]["decision"], "general");
  EXPECT_EQ(j["trace"]["action"], "gre");
  EXPECT_EQ(j["trace"]["rule"]["position"], 3);
  EXPECT_EQ(j["fates"], nlohmann::json::array({"to-switch"}));
  EXPECT_EQ(j["gre"][0]["destination"], "198.51.100.7");
  EXPECT_EQ(j["frame"]["l3"], "ipv4");
  EXPECT_NE(render::PacketText(p, true).find("general rule 2 (position 3)"), std::string::npos);

  render::CounterListing c;
  c.haveRuleset = true;
  c.rules = {{2, 0, true, SLCGenericActionDrop, "x", 5, 500}};
  const nlohmann::json cj = render::CountersJson(c);
  EXPECT_EQ(cj["rules"][0]["table"], "exact");
  EXPECT_EQ(cj["rules"][0]["rulesetIndex"], 2);
  EXPECT_EQ(cj["rules"][0]["packets"], 5);
}

TEST(Render, RuleSummaryShowsOnlyWhatTheModuleWrote) {
  SLCGeneric_RuleSummary r;
  std::memset(&r, 0xbe, sizeof(r));  // fields the module did not write
  auto put = [](auto& field, const char* text) { std::snprintf(field, sizeof(field), "%s", text); };
  put(r.dMac, "*");
  put(r.ipDa, "(IPv4): (10.0.0.2)");
  put(r.dPort, " !(22)");
  put(r.rangesEnabled, "None");
  put(r.bidirectional, "False");
  const uint32_t dir = 1, action = SLCGenericActionDrop;
  std::memcpy(&r.direction, &dir, 4);
  std::memcpy(&r.action, &action, 4);
  EXPECT_EQ(render::RuleSummaryLine(r),
            "ipDa=(IPv4): (10.0.0.2) dPort=!(22) direction=from-switch action=drop");
}

}  // namespace
