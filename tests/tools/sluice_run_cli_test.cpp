// sluice-run as an operator meets it: its command line, hostile inputs (one
// line on stderr and a non-zero status, never an abort), damaged captures
// replayed up to the damage, standard input and output, JSON that parses,
// and output captures that tcpdump and tshark read (when installed).
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>

#include "tools/lib/capture.h"

namespace {

struct Outcome {
  int status = -1;
  std::string out, err;
};

std::string Slurp(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

// Per process: CTest runs these tests in parallel processes.
std::string Temp(const std::string& name) {
  return ::testing::TempDir() + "/sluice_cli_" + std::to_string(getpid()) + "_" + name;
}

Outcome RunTool(const std::string& args, const std::string& stdinPath = "/dev/null") {
  const std::string out = Temp("stdout"), err = Temp("stderr");
  const std::string cmd = std::string(SLUICE_RUN_BIN) + " " + args + " <" + stdinPath + " >" +
                          out + " 2>" + err;
  const int raw = std::system(cmd.c_str());
  Outcome o;
  o.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
  o.out = Slurp(out);
  o.err = Slurp(err);
  return o;
}

void WriteFile(const std::string& path, const frames::Bytes& bytes) {
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
}

bool Have(const char* tool) {
  return std::system((std::string("command -v ") + tool + " >/dev/null 2>&1").c_str()) == 0;
}

const std::string kDemo = std::string(SLUICE_SOURCE_DIR) + "/examples/demo.pcapng";

TEST(SluiceRunCli, RefusesBadCommandLinesAndHostileInputsWithOneLine) {
  const std::string dir = ::testing::TempDir();
  const std::string garbage = Temp("garbage.pcap"), empty = Temp("empty.pcap");
  WriteFile(garbage, frames::Bytes(300, 0x42));
  WriteFile(empty, {});
  frames::Bytes hugeSnap = frames::EncodeCapture({});
  hugeSnap[16] = hugeSnap[17] = hugeSnap[18] = hugeSnap[19] = 0xff;
  const std::string huge = Temp("hugesnap.pcap");
  WriteFile(huge, hugeSnap);
  struct Case {
    std::string args;
    int status;
    std::string says;
  };
  const Case cases[] = {
      {"--bogus", 2, "bogus"},
      {"--failure-policy abc", 2, "failure-policy"},
      {"--direction sideways", 2, "direction"},
      {"--snap-len 4294967296", 2, "snap-len"},
      {"--vm-mac 02:00", 2, "vm-mac"},
      {"--capture " + dir, 1, "is a directory"},
      {"--rules " + dir, 1, "is a directory"},
      {"--capture " + garbage, 1, "not a pcap"},
      {"--capture " + empty, 1, "empty"},
      {"--capture /nonexistent/x.pcap", 1, "cannot open"},
      {"--capture " + huge + " --direction from", 0, ""},
      {"--rules " + garbage, 1, garbage},
      {"--out-vm " + dir, 1, "is a directory"},
      {"--json --out-vm -", 2, "standard output"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.args);
    const Outcome o = RunTool(c.args + " --quiet-log");
    EXPECT_EQ(o.status, c.status) << o.err;
    if (c.status != 0) {
      EXPECT_NE(o.err.find(c.says), std::string::npos) << o.err;
      // Rule text errors are located (line, caret, names); the rest are one line.
      if (c.args.rfind("--rules " + garbage, 0) == 0) {
        EXPECT_EQ(o.err.rfind(garbage + ":1:1: error:", 0), 0u) << o.err;
      } else {
        EXPECT_EQ(std::count(o.err.begin(), o.err.end(), '\n'), 1) << o.err;
      }
    }
  }
  EXPECT_EQ(RunTool("--help").status, 0);
}

TEST(SluiceRunCli, DamagedPcapngReplaysTheGoodRecordsAndSaysWhichFailed) {
  // Mixed directions from the packet flags; the last record is cut short.
  const frames::CaptureRead demo = frames::ReadCapture(kDemo);
  ASSERT_TRUE(demo.ok()) << demo.error;
  frames::Bytes bytes = frames::EncodePcapng(demo.records);
  bytes.resize(bytes.size() - 10);
  const std::string path = Temp("cut.pcapng");
  WriteFile(path, bytes);
  const Outcome o = RunTool("--capture " + path + " --json --quiet-log");
  EXPECT_EQ(o.status, 3);
  EXPECT_NE(o.err.find("record 9"), std::string::npos) << o.err;
  const nlohmann::json doc = nlohmann::json::parse(o.out);
  ASSERT_EQ(doc["packets"].size(), 8u);
  EXPECT_EQ(doc["packets"][0]["direction"], "from-switch");
  EXPECT_EQ(doc["packets"][1]["direction"], "to-switch");
}

TEST(SluiceRunCli, StandardInputAndOutputCapturesReadCleanly) {
  const std::string vm = Temp("vm.pcap"), gre = Temp("gre.pcap"), dropped = Temp("dropped.pcap");
  const std::string rules = Temp("gre.rules");
  std::ofstream(rules) << "action=gre ipv4 proto=tcp gre=198.51.100.7 snaplen=30\n"
                          "action=drop ipv4 proto=udp\n";
  const Outcome o = RunTool("--capture - --rules " + rules + " --out-vm " + vm + " --out-gre " +
                                gre + " --out-dropped " + dropped + " --out-switch - --trace",
                            kDemo);
  ASSERT_EQ(o.status, 0) << o.err;
  EXPECT_NE(o.err.find("GRE copy to 198.51.100.7"), std::string::npos) << o.err;  // text moved to stderr
  const frames::CaptureRead toSwitch =
      frames::DecodeCapture(std::span(reinterpret_cast<const uint8_t*>(o.out.data()), o.out.size()));
  ASSERT_TRUE(toSwitch.ok()) << toSwitch.error;
  EXPECT_EQ(toSwitch.records.size(), 4u);
  const frames::CaptureRead vmOut = frames::ReadCapture(vm);
  ASSERT_TRUE(vmOut.ok()) << vmOut.error;
  // Five from the switch; `ipv4` takes the family, so only the IPv4 UDP
  // datagram is dropped and the IPv6 one passes.
  EXPECT_EQ(vmOut.records.size(), 4u);
  EXPECT_EQ(frames::ReadCapture(dropped).records.size(), 1u);
  // GRE output is raw IPv4, which the Ethernet-only reader refuses.
  EXPECT_NE(frames::ReadCapture(gre).error.find("not Ethernet"), std::string::npos);
  for (const char* tool : {"tcpdump", "tshark"}) {
    if (!Have(tool)) continue;
    for (const std::string& f : {vm, gre, dropped}) {
      SCOPED_TRACE(std::string(tool) + " " + f);
      EXPECT_EQ(std::system((std::string(tool) + " -r " + f + " >/dev/null 2>&1").c_str()), 0);
    }
  }
  if (Have("tshark")) {
    const std::string fields = Temp("gre.txt");
    const std::string cmd = "tshark -r " + gre + " -T fields -e ip.dst -e gre.proto -e eth.dst >" +
                            fields + " 2>/dev/null";
    ASSERT_EQ(std::system(cmd.c_str()), 0);
    EXPECT_NE(Slurp(fields).find("198.51.100.7\t0x6558\t02:00:00:00:00:10"), std::string::npos)
        << Slurp(fields);
  }
}

}  // namespace
