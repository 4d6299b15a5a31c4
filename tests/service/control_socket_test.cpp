// The control protocol's framing and bounds, and a running sluice-host
// facing hostile clients: every malformed request gets an error reply, the
// host keeps serving and the module heap is what it was.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <random>
#include <string>

#include "service/protocol/protocol.h"
#include "tests/service/host_process.h"

namespace {

using slcproto::Message;
using slcproto::Type;
using Bytes = std::vector<uint8_t>;

Bytes Header(uint32_t magic, uint16_t version, uint16_t type, uint32_t argsLen, uint32_t blobLen) {
  Bytes b(16);
  std::memcpy(b.data(), &magic, 4);
  std::memcpy(b.data() + 4, &version, 2);
  std::memcpy(b.data() + 6, &type, 2);
  std::memcpy(b.data() + 8, &argsLen, 4);
  std::memcpy(b.data() + 12, &blobLen, 4);
  return b;
}

TEST(ServiceProtocol, RefusesHeadersOutsideTheBounds) {
  struct Case {
    const char* what;
    Bytes header;
  } cases[] = {
      {"short", Bytes(15, 0)},
      {"bad magic", Header(0x12345678, 1, 0x100, 0, 0)},
      {"future version", Header(slcproto::kMagic, 2, 0x100, 0, 0)},
      {"arguments too long", Header(slcproto::kMagic, 1, 0x100, slcproto::kMaxArgs + 1, 0)},
      {"blob too long", Header(slcproto::kMagic, 1, 0x100, 0, slcproto::kMaxBlob + 1)},
      {"blob length wraps", Header(slcproto::kMagic, 1, 0x100, 0, UINT32_MAX)},
  };
  for (const auto& c : cases) {
    slcproto::Header h;
    std::string error;
    EXPECT_FALSE(slcproto::ParseHeader(c.header, &h, &error)) << c.what;
    EXPECT_FALSE(error.empty()) << c.what;
  }
}

TEST(ServiceProtocol, RefusesBodiesThatAreNotAnObject) {
  // {body, blob length}: the last is well-formed text whose lengths do not add up.
  const std::pair<std::string, uint32_t> cases[] = {
      {"[1,2]", 0}, {"{\"a\":", 0}, {"\"text\"", 0}, {std::string("\xff\xfe", 2), 0}, {"{{{{", 3}};
  for (const auto& [args, blob] : cases) {
    slcproto::Header h{slcproto::kVersion, 0x100, static_cast<uint32_t>(args.size()), blob};
    Message out;
    std::string error;
    EXPECT_FALSE(slcproto::ParseBody(
        h, std::span(reinterpret_cast<const uint8_t*>(args.data()), args.size()), &out, &error))
        << args;
  }
}

// A sluice-host with one agent and no ports, on a socket in a fresh
// directory; killed on every path.
class ServiceHostTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(host_.Start("fw:default-action=ACTION_ACCEPT")) << "sluice-host did not come up";
  }

  Message Request(Type type, nlohmann::json args = nlohmann::json::object(), Bytes blob = {}) {
    return host_.Call(type, std::move(args), std::move(blob));
  }
  // Writes raw bytes, half-closes, and returns the reply (if one came).
  bool RawExchange(const Bytes& bytes, Message* reply) {
    std::string error;
    int fd = slcproto::Connect(host_.sock, &error);
    if (fd < 0) return false;
    (void)!write(fd, bytes.data(), bytes.size());
    shutdown(fd, SHUT_WR);
    bool ok = slcproto::ReadMessage(fd, reply, &error, 5000);
    close(fd);
    return ok;
  }

  HostProcess host_;
};

TEST_F(ServiceHostTest, SocketIsPrivateToItsOwner) {
  struct stat st {};
  ASSERT_EQ(stat(host_.sock.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(ServiceHostTest, MalformedRequestsGetAnErrorAndChangeNothing) {
  const uint64_t heap = host_.HeapBytes();
  ASSERT_NE(heap, UINT64_MAX);
  std::mt19937 rng(9);
  Bytes random(300);
  for (auto& b : random) b = static_cast<uint8_t>(rng());
  Message valid;
  valid.type = Type::kHello;
  Bytes truncated = slcproto::Encode(valid);
  truncated.resize(truncated.size() - 1);
  std::string badJson = "{\"filter\": ";
  Bytes badJsonMsg = Header(slcproto::kMagic, 1, 0x105, static_cast<uint32_t>(badJson.size()), 0);
  badJsonMsg.insert(badJsonMsg.end(), badJson.begin(), badJson.end());
  const struct {
    const char* what;
    Bytes bytes;
  } raw[] = {
      {"random bytes", random},
      {"truncated header", Bytes(truncated.begin(), truncated.begin() + 9)},
      {"truncated body", Header(slcproto::kMagic, 1, 0x100, 10, 0)},
      {"oversized blob", Header(slcproto::kMagic, 1, 0x105, 0, slcproto::kMaxBlob + 1)},
      {"arguments not JSON", badJsonMsg},
  };
  for (const auto& c : raw) {
    Message reply;
    ASSERT_TRUE(RawExchange(c.bytes, &reply)) << c.what;
    EXPECT_FALSE(reply.args.value("ok", true)) << c.what;
    EXPECT_FALSE(reply.args.value("error", std::string()).empty()) << c.what;
  }

  // Well-framed requests with wrong, missing or hostile arguments.
  const struct {
    Type type;
    nlohmann::json args;
    Bytes blob;
  } requests[] = {
      {static_cast<Type>(0x7777), {}, {}},
      {Type::kMigrationFirst, {}, {}},
      {Type::kRulesetWrite, {{"filter", 5}}, Bytes(20, 0)},
      {Type::kRulesetWrite, {{"filter", "no-such-port"}}, Bytes(20, 0)},
      {Type::kRulesetRead, {}, {}},
      {Type::kCreateAgent, {{"text", std::string(5000, 'a')}}, {}},
      {Type::kCreateAgent, {{"text", nlohmann::json::array()}}, {}},
      {Type::kAddPort,
       {{"port", {{"name", "p"}, {"agent", "fw"}, {"vm", "nope0"}, {"switch", "nope1"}}}},
       {}},
      {Type::kAddPort, {{"port", {{"name", "p"}, {"vnic", -1}}}}, {}},
      {Type::kRemovePort, {{"name", "p"}}, {}},
      {Type::kDevSetRuleset, {{"uuid", "u"}, {"vnic", 1}, {"agent", "fw"}}, Bytes(3, 0)},
      {Type::kDevGetRuleset, {{"filter", std::string(500, 'f')}}, {}},
      {Type::kDevTestIoctl, {{"filter", "none"}, {"agent", "no-such-agent"}}, {}},
      {Type::kStatus, {{"maxRules", "many"}}, {}},
  };
  for (const auto& r : requests) {
    const Message reply = Request(r.type, r.args, r.blob);
    EXPECT_FALSE(reply.args.value("ok", true)) << static_cast<int>(r.type) << r.args.dump();
    EXPECT_FALSE(reply.args.value("error", std::string()).empty()) << r.args.dump();
  }

  EXPECT_TRUE(Request(Type::kHello).args.value("ok", false));
  EXPECT_EQ(host_.HeapBytes(), heap);
  EXPECT_EQ(host_.Stop(), 0);
}

TEST_F(ServiceHostTest, ASilentClientCannotHoldOffOthers) {
  std::string error;
  const int silent = slcproto::Connect(host_.sock, &error);
  ASSERT_GE(silent, 0) << error;
  const auto start = std::chrono::steady_clock::now();
  Message hello, reply;
  hello.type = Type::kHello;
  ASSERT_TRUE(slcproto::Call(host_.sock, hello, &reply, &error, 15000)) << error;
  EXPECT_TRUE(reply.args.value("ok", false));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
  close(silent);
}

TEST_F(ServiceHostTest, AgentsAreCreatedThroughTheCreateAgentProperty) {
  Message reply = Request(Type::kCreateAgent, {{"text", "second:default-action=ACTION_DROP"}});
  EXPECT_TRUE(reply.args.value("ok", false)) << reply.args.dump();
  reply = Request(Type::kCreateAgent, {{"text", "second"}});
  EXPECT_FALSE(reply.args.value("ok", true)) << "a second agent of the same name";

  reply = Request(Type::kStatus, {{"agent", "second"}});
  ASSERT_TRUE(reply.args.value("ok", false)) << reply.args.dump();
  ASSERT_EQ(reply.args["agents"].size(), 1u);
  EXPECT_EQ(reply.args["agents"][0]["name"], "second");
  EXPECT_TRUE(reply.args["agents"][0]["filters"].empty());
  EXPECT_EQ(host_.Stop(), 0);
}

TEST_F(ServiceHostTest, PeersOfAnotherUserAreRefused) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to connect as another user";
  // Opening the file to everyone leaves the credential check as the only
  // guard.
  ASSERT_EQ(chmod(host_.sock.c_str(), 0666), 0);
  ASSERT_EQ(chmod(host_.dir.c_str(), 0755), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (setgid(65534) != 0 || setuid(65534) != 0) _exit(10);
    Message hello, reply;
    hello.type = Type::kHello;
    std::string error;
    if (!slcproto::Call(host_.sock, hello, &reply, &error, 5000)) {
      std::fprintf(stderr, "%s\n", error.c_str());
      _exit(11);
    }
    _exit(reply.args.value("ok", true) ? 12 : 0);
  }
  int status = 0;
  waitpid(child, &status, 0);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "10: setuid, 11: no reply, 12: accepted";
  EXPECT_TRUE(Request(Type::kHello).args.value("ok", false));
}

// Settings from a file: the host takes its socket and agents from it, and
// refuses a file with an unknown setting before loading anything.
TEST(ServiceHostConfig, ReadsSettingsFromAFileAndRefusesUnknownOnes) {
  HostProcess bad, good;
  ASSERT_TRUE(bad.MakeDir() && good.MakeDir());
  std::ofstream(bad.dir + "/c.conf") << "agent x\nbogus 1\n";
  ASSERT_TRUE(bad.Spawn({"--config", bad.dir + "/c.conf"}));
  EXPECT_EQ(bad.Wait(), 2);

  std::ofstream(good.dir + "/c.conf") << "# a host from a file\n"
                                      << "socket " << good.sock << "\n"
                                      << "agent cfg:default-action=ACTION_DROP   # comment\n"
                                      << "gre memory\n";
  ASSERT_TRUE(good.Spawn({"--config", good.dir + "/c.conf"}));
  ASSERT_TRUE(good.Answers());
  const Message status = good.Call(Type::kStatus, {{"agent", "cfg"}});
  ASSERT_EQ(status.args["agents"].size(), 1u);
  EXPECT_EQ(status.args["agents"][0]["name"], "cfg");
  EXPECT_EQ(good.Stop(), 0);
}

}  // namespace
