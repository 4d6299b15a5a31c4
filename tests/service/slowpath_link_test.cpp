// The slow-path link as a hostile peer sees it: frame lists that lie about
// their lengths, registrations the host must refuse, requests about filters
// the peer was never given, garbage once registered. The host answers each
// with an error, drops a link it can no longer trust, unregisters its slow
// path, and keeps serving with its heap as it was. Needs no root: the host
// runs with no ports.
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "service/protocol/protocol.h"
#include "tests/service/host_process.h"
#include "service/protocol/slowpath_link.h"

namespace {

using slcproto::Message;
using slcproto::Type;
using Bytes = std::vector<uint8_t>;

Bytes Le32(uint32_t v) { return {uint8_t(v), uint8_t(v >> 8), uint8_t(v >> 16), uint8_t(v >> 24)}; }
Bytes Cat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const auto& p : parts) out.insert(out.end(), p.begin(), p.end());
  return out;
}

TEST(SlowPathLinkFrames, RoundTripAndHostileLengths) {
  Bytes blob;
  slcproto::AppendFrame(&blob, Bytes{1, 2, 3});
  slcproto::AppendFrame(&blob, Bytes{});
  slcproto::AppendFrame(&blob, Bytes(60, 9));
  std::vector<Bytes> frames;
  std::string error;
  ASSERT_TRUE(slcproto::SplitFrames(blob, &frames, &error)) << error;
  ASSERT_EQ(frames.size(), 3u);
  EXPECT_EQ(frames[0], (Bytes{1, 2, 3}));
  EXPECT_TRUE(frames[1].empty());
  EXPECT_EQ(frames[2], Bytes(60, 9));

  Bytes tooMany;
  for (uint32_t i = 0; i <= slcproto::kMaxLinkFrames; i++) slcproto::AppendFrame(&tooMany, {});
  const struct {
    const char* what;
    Bytes blob;
  } bad[] = {
      {"length cut short", Bytes{5, 0, 0}},
      {"frame past the end", Cat({Le32(10), Bytes(9, 0)})},
      {"length wraps", Cat({Le32(UINT32_MAX), Bytes(8, 0)})},
      {"frame over the bound", Cat({Le32(slcproto::kMaxLinkFrame + 1),
                                    Bytes(slcproto::kMaxLinkFrame + 1, 0)})},
      {"too many frames", tooMany},
  };
  for (const auto& c : bad) {
    EXPECT_FALSE(slcproto::SplitFrames(c.blob, &frames, &error)) << c.what;
    EXPECT_FALSE(error.empty()) << c.what;
  }
}

class SlowPathLinkTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(host_.Start("fw")) << "sluice-host did not come up"; }
  void TearDown() override {
    for (int fd : links_) close(fd);
  }
  int Stop() { return host_.Stop(); }
  Message Call(Type type, nlohmann::json args = nlohmann::json::object()) {
    return host_.Call(type, std::move(args));
  }
  // Opens a link and sends its registration; returns the fd and the answer.
  int Register(nlohmann::json args, Message* answer) {
    std::string error;
    int fd = slcproto::Connect(host_.sock, &error);
    EXPECT_GE(fd, 0) << error;
    links_.push_back(fd);
    Message reg;
    reg.type = Type::kSpRegister;
    reg.args = std::move(args);
    EXPECT_TRUE(slcproto::WriteMessage(fd, reg, &error)) << error;
    EXPECT_TRUE(slcproto::ReadMessage(fd, answer, &error, 5000)) << error;
    return fd;
  }
  Message Ask(int fd, Type type, nlohmann::json args, Bytes blob = {}) {
    Message m, reply;
    m.type = type;
    m.args = std::move(args);
    m.blob = std::move(blob);
    std::string error;
    EXPECT_TRUE(slcproto::WriteMessage(fd, m, &error)) << error;
    EXPECT_TRUE(slcproto::ReadMessage(fd, &reply, &error, 5000)) << error;
    return reply;
  }
  // The host's slow paths once there are `n` (within two seconds), else
  // however many there are then.
  size_t SlowPaths(size_t n) {
    size_t now = SIZE_MAX;
    for (int i = 0; i < 100 && now != n; i++) {
      if (i > 0) std::this_thread::sleep_for(std::chrono::milliseconds(20));
      const Message s = Call(Type::kStats);
      now = s.args.contains("slowPaths") ? s.args["slowPaths"].size() : SIZE_MAX;
    }
    return now;
  }

  HostProcess host_;
  std::vector<int> links_;
};

TEST_F(SlowPathLinkTest, RegistrationNamesARegisteredAgent) {
  const uint64_t heap = host_.HeapBytes();
  const nlohmann::json refused[] = {
      nlohmann::json::object(),
      {{"agent", "no-such-agent"}},
      {{"agent", 7}},
      {{"agent", std::string(300, 'a')}},
      {{"agent", "fw"}, {"name", nlohmann::json::array()}},
  };
  for (const auto& args : refused) {
    Message answer;
    Register(args, &answer);
    EXPECT_FALSE(answer.args.value("ok", true)) << args.dump();
  }
  Message a, b;
  Register({{"agent", "fw"}, {"name", "one"}}, &a);
  Register({{"agent", "fw"}, {"name", "two"}}, &b);
  ASSERT_TRUE(a.args.value("ok", false)) << a.args.dump();
  ASSERT_TRUE(b.args.value("ok", false)) << b.args.dump();
  EXPECT_NE(a.args["id"], b.args["id"]) << "each slow path has its own number";
  EXPECT_EQ(SlowPaths(2), 2u);
  EXPECT_GT(host_.HeapBytes(), heap) << "the module keeps a record per slow path";

  // Closing the links unregisters both slow paths and frees their records.
  for (int fd : links_) close(fd);
  links_.clear();
  EXPECT_EQ(SlowPaths(0), 0u);
  EXPECT_EQ(host_.HeapBytes(), heap);
  EXPECT_EQ(Stop(), 0);
}

TEST_F(SlowPathLinkTest, RequestsAboutFiltersNotAttachedAreRefused) {
  const uint64_t heap = host_.HeapBytes();
  Message answer;
  const int fd = Register({{"agent", "fw"}}, &answer);
  ASSERT_TRUE(answer.args.value("ok", false)) << answer.args.dump();
  Bytes frames;
  slcproto::AppendFrame(&frames, Bytes(60, 1));
  const struct {
    Type type;
    nlohmann::json args;
    Bytes blob;
  } requests[] = {
      {Type::kSpReissue, {{"seq", 1}, {"filter", "vm1"}, {"direction", 2}}, frames},
      {Type::kSpReissue, {{"seq", 2}, {"filter", "vm1"}, {"direction", 3}}, frames},
      {Type::kSpReissue, {{"seq", 3}, {"filter", "vm1"}, {"direction", 2}}, Bytes{9, 9}},
      {Type::kSpIoctl, {{"seq", 4}, {"filter", "vm1"}, {"code", 1}}, Bytes{1, 0, 0, 0, 'a', 0}},
      {Type::kSpIoctl, {{"seq", 5}, {"filter", "vm1"}, {"code", -1}}, {}},
      {Type::kSpIoctl, {{"seq", 6}, {"filter", 12}}, {}},
      {Type::kHello, {{"seq", 7}}, {}},
      {Type::kSpRegister, {{"seq", 8}, {"agent", "fw"}}, {}},
  };
  for (const auto& r : requests) {
    Message reply = Ask(fd, r.type, r.args, r.blob);
    EXPECT_FALSE(reply.args.value("ok", true)) << r.args.dump();
    EXPECT_EQ(reply.args.value("seq", 0), r.args["seq"]) << "the answer names its request";
  }
  // An answer to nothing is ignored; the link stays.
  Message stray = slcproto::Reply(true);
  stray.args["seq"] = 99;
  std::string error;
  ASSERT_TRUE(slcproto::WriteMessage(fd, stray, &error));
  Message hello = Ask(fd, Type::kHello, {{"seq", 10}});
  EXPECT_EQ(hello.args.value("seq", 0), 10);
  EXPECT_EQ(SlowPaths(1), 1u);

  // Bytes that are not a message end the link; the host carries on.
  const Bytes garbage(64, 0xee);
  ASSERT_EQ(write(fd, garbage.data(), garbage.size()), 64);
  EXPECT_EQ(SlowPaths(0), 0u);
  EXPECT_TRUE(Call(Type::kHello).args.value("ok", false));
  EXPECT_EQ(host_.HeapBytes(), heap);
  EXPECT_EQ(Stop(), 0);
}

}  // namespace
