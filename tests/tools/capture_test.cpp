// Captures through libpcap: both formats in, directions from pcapng flags
// or the caller's rule, timestamps kept, damaged files reported by record,
// and outputs that libpcap (and tshark, when installed) read back.
#include "tools/lib/capture.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>

#include "tests/support/tool_frames.h"

namespace {

using namespace toolframes;

std::vector<CaptureRecord> Mixed() {
  return {
      {1, FromSwitch().Tcp(1, 80).Build(), 0, 1700000000, 123456789},
      {2, ToSwitch().Udp(5, 6).Payload(100).Build(), 0, 1700000001, 1},
      {1, Bytes{1, 2, 3}, 1500, 1700000002, 999999999},
  };
}

void ExpectSame(const std::vector<CaptureRecord>& got, const std::vector<CaptureRecord>& want,
                bool directions) {
  ASSERT_EQ(got.size(), want.size());
  for (size_t i = 0; i < got.size(); i++) {
    SCOPED_TRACE(i);
    EXPECT_EQ(got[i].frame, want[i].frame);
    EXPECT_EQ(got[i].origLen, want[i].origLen != 0 ? want[i].origLen : want[i].frame.size());
    EXPECT_EQ(got[i].tsSec, want[i].tsSec);
    EXPECT_EQ(got[i].tsNsec, want[i].tsNsec);
    EXPECT_EQ(got[i].direction, directions ? want[i].direction : 0u);
  }
}

TEST(Capture, BothFormatsKeepFramesTimestampsAndPcapngDirections) {
  const auto in = Mixed();
  const frames::CaptureRead classic = frames::DecodeCapture(frames::EncodeCapture(in));
  ASSERT_TRUE(classic.ok()) << classic.error;
  EXPECT_FALSE(classic.pcapng);
  ExpectSame(classic.records, in, /*directions=*/false);

  const frames::CaptureRead ng = frames::DecodeCapture(frames::EncodePcapng(in));
  ASSERT_TRUE(ng.ok()) << ng.error;
  EXPECT_TRUE(ng.pcapng);
  ExpectSame(ng.records, in, /*directions=*/true);
}

TEST(Capture, TruncatedFinalRecordKeepsTheGoodOnesAndNamesTheBadOne) {
  const auto in = Mixed();
  for (bool ng : {false, true}) {
    SCOPED_TRACE(ng ? "pcapng" : "pcap");
    Bytes bytes = ng ? frames::EncodePcapng(in) : frames::EncodeCapture(in);
    bytes.resize(bytes.size() - 6);
    const frames::CaptureRead r = frames::DecodeCapture(bytes);
    EXPECT_FALSE(r.ok());
    ASSERT_TRUE(r.badRecord.has_value());
    EXPECT_EQ(*r.badRecord, 2u);
    EXPECT_NE(r.error.find("record 3"), std::string::npos) << r.error;
    ASSERT_EQ(r.records.size(), 2u);
    EXPECT_EQ(r.records[1].frame, in[1].frame);
  }
}

TEST(Capture, HostileFilesAreRefusedWithAReason) {
  Bytes hugeRecord = frames::EncodeCapture(Mixed());
  hugeRecord[24 + 8] = hugeRecord[24 + 9] = hugeRecord[24 + 10] = hugeRecord[24 + 11] = 0xff;
  const Bytes raw = frames::EncodeCapture(Mixed(), frames::LinkType::RawIpv4);
  const Bytes header = frames::EncodeCapture({});
  const Bytes cutHeader(header.begin(), header.begin() + 10);
  struct Case {
    const char* name;
    Bytes bytes;
    const char* says;
  };
  const Case cases[] = {
      {"empty", {}, "empty"},
      {"garbage", Bytes(100, 0x5a), "not a pcap"},
      {"header cut short", cutHeader, "not a pcap"},
      {"huge record length", hugeRecord, "record 1"},
      {"not Ethernet", raw, "not Ethernet"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const frames::CaptureRead r = frames::DecodeCapture(c.bytes);
    EXPECT_FALSE(r.ok());
    EXPECT_NE(r.error.find(c.says), std::string::npos) << r.error;
    EXPECT_EQ(r.error.find('\n'), std::string::npos);
  }
  const frames::CaptureRead dir = frames::ReadCapture(::testing::TempDir());
  EXPECT_NE(dir.error.find("directory"), std::string::npos);
  std::string error;
  EXPECT_FALSE(frames::WriteCapture(::testing::TempDir(), Mixed(), &error));
  EXPECT_NE(error.find("directory"), std::string::npos);
}

TEST(Capture, DirectionsComeFromTheRuleOnlyWhereTheFileHasNone) {
  auto records = Mixed();
  for (auto& r : records) r.direction = 0;
  records[2].direction = 2;  // as if from pcapng flags: kept
  frames::DirectionRule byMac;
  byMac.vmMac = kVm;
  auto a = records;
  EXPECT_EQ(frames::ResolveDirections(&a, byMac), std::nullopt);
  EXPECT_EQ(a[0].direction, 1u);  // addressed to the VM
  EXPECT_EQ(a[1].direction, 2u);  // sent by it
  EXPECT_EQ(a[2].direction, 2u);

  frames::DirectionRule byIp;
  byIp.vmIp4 = frames::Ip4("10.0.0.1");  // the peer, seen from the other side
  auto b = records;
  EXPECT_EQ(frames::ResolveDirections(&b, byIp), std::nullopt);
  EXPECT_EQ(b[0].direction, 2u);
  EXPECT_EQ(b[1].direction, 1u);

  frames::DirectionRule none;
  none.vmMac = frames::Mac("02:99:99:99:99:99");
  auto c = records;
  EXPECT_EQ(frames::ResolveDirections(&c, none), std::optional<size_t>(0));
  frames::DirectionRule fixed;
  fixed.fixed = 2;
  EXPECT_EQ(frames::ResolveDirections(&c, fixed), std::nullopt);
  EXPECT_EQ(c[0].direction, 2u);
}

// Written files read back through libpcap with the snap length applied, and
// through tshark when it is installed.
TEST(Capture, WrittenFilesReadCleanlyWithSnapLengthApplied) {
  const std::string path = ::testing::TempDir() + "/capture_test_out.pcap";
  std::string error;
  ASSERT_TRUE(frames::WriteCapture(path, Mixed(), &error, frames::LinkType::Ethernet, 60))
      << error;
  const frames::CaptureRead r = frames::ReadCapture(path);
  ASSERT_TRUE(r.ok()) << r.error;
  ASSERT_EQ(r.records.size(), 3u);
  EXPECT_EQ(r.records[1].frame.size(), 60u);
  EXPECT_EQ(r.records[1].origLen, Mixed()[1].frame.size());
  EXPECT_EQ(r.records[0].tsNsec, 123456789u);
  if (std::system("command -v tshark >/dev/null 2>&1") == 0) {
    const std::string cmd = "tshark -r " + path + " >/dev/null 2>&1";
    EXPECT_EQ(std::system(cmd.c_str()), 0);
  }
  std::remove(path.c_str());
}

}  // namespace
