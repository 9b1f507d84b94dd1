#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/integration/drkit_runner.h"
#include "tests/integration/world.h"
#include "wire/drm1.h"

namespace dr::testing {
namespace {

using namespace std::chrono_literals;

class DrdTest : public ::testing::Test {
 protected:
  void Start(std::vector<std::string> arguments = {},
             const std::string& serviceName = "com.corvel.dromon.drd") {
    drd_ = std::make_unique<DrdProcess>(root_.path(), std::move(arguments));
    ASSERT_TRUE(drd_->waitUntilServing(serviceName)) << drd_->standardError();
  }
  void TearDown() override {
    if (!drd_) return;
    ASSERT_TRUE(drd_->signal(SIGTERM));
    EXPECT_EQ(drd_->waitForExit(), 0) << drd_->standardError();
  }

  TempFolder root_;
  std::unique_ptr<DrdProcess> drd_;
};

// --help and --version win over everything else on the line.
TEST_F(DrdTest, CommandLines) {
  const std::string usage = "Usage: drd [-S servicename] [-v]\n";
  const struct {
    std::vector<std::string> arguments;
    int status;
    std::string out, err;  // out: its start
  } rows[] = {
      {{"-x"}, 2, "", usage},
      {{"-d"}, 2, "", usage},
      {{"-S"}, 2, "", usage},
      {{"-v", "stray"}, 2, "", usage},
      {{"-d", "/tmp/a", "-v", "-q"}, 2, "", usage},
      {{"-v", "--version", "stray"}, 0, "drd 0.1.0\n", ""},
      {{"--help"}, 0, usage + "drd, the per-user plug-in registry daemon", ""},
      {{"-x", "--help"}, 0, usage, ""},
  };
  for (const auto& row : rows) {
    Child drd(DrdProcess::BinaryPath(), row.arguments, DrkitEnvironment(root_.path()));
    EXPECT_EQ(drd.wait(), row.status) << row.arguments[0];
    EXPECT_EQ(drd.out().rfind(row.out, 0), 0u) << drd.out();
    EXPECT_EQ(drd.err(), row.err);
  }
}

// drd logs where it serves and that it stopped, removes its socket, and a connection sees it
// close; a message wanting no reply leaves no reply behind for the next request.
TEST_F(DrdTest, LogsStartAndStopAndRemovesItsSocket) {
  Start();
  const std::string socket = drd_->socketPath();
  std::string log;
  for (int i = 0; i < 200 && (log = drd_->standardError()).find("listening") == std::string::npos;
       ++i) {
    std::this_thread::sleep_for(20ms);
  }
  if (size_t at = log.find("install folders: "); at != std::string::npos) {
    log.erase(at, log.find('\n', at) + 1 - at);
  }
  EXPECT_EQ(log, "drd 0.1.0 listening on " + socket + " (registry " + root_.path() +
                     "/registry/r.sqlite3)\n");
  Result<std::unique_ptr<client::Connection>> c =
      client::Connection::Open("com.corvel.dromon.drd", root_ / "sockets");
  ASSERT_TRUE(c.ok()) << c.error().description();
  ASSERT_TRUE((*c)->send(Request("frobnicate")).ok());
  Result<Value> reply = (*c)->request(Request("bulk"), 10s);
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_EQ(ErrorText(*reply), "");
  ASSERT_TRUE(drd_->signal(SIGTERM));
  EXPECT_EQ(drd_->waitForExit(), 0);
  log = drd_->standardError();
  EXPECT_EQ(log.substr(log.rfind('\n', log.size() - 2) + 1), "drd stopped\n");
  EXPECT_NE(::access(socket.c_str(), F_OK), 0) << "the socket file is left behind";
  drd_.reset();
  reply = (*c)->request(Request("bulk"), 10s);
  ASSERT_FALSE(reply.ok());
  EXPECT_EQ(reply.error().domain(), client::kClientErrorDomain);
  EXPECT_EQ(reply.error().code(), client::kConnectionClosed) << reply.error().description();
  EXPECT_FALSE((*c)->isOpen());
  EXPECT_FALSE(client::Connection::Open("com.corvel.dromon.drd", root_ / "sockets").ok());
}

// The last -S counts; priorities only when JOURNAL_STREAM names drd's standard error; a second
// drd on a taken name exits 1 and the first goes on serving.
TEST_F(DrdTest, JournalPrioritiesAndASecondDaemon) {
  Start({"-S", "com.example.zero", "-S", "com.example.first"}, "com.example.first");
  EXPECT_FALSE(Drm1Peer(drd_->socketPath("com.example.zero")).connected());
  const std::string ownStream = "$(stat -c %d:%i \"$0\")";
  const struct {
    std::string stream, service;
    int status;
    std::string first, last;  // first: its start
  } rows[] = {
      {ownStream, "com.example.second", 0, "<6>drd 0.1.0 listening on ", "<6>drd stopped"},
      {ownStream, "com.example.first", 1, "<5>unable to listen as ",
       "<3>unable to construct server"},
      {"0:0", "com.example.first", 1, "unable to listen as ", "unable to construct server"},
  };
  const std::string errorFile = root_.path() + "/journal.stderr";
  for (const auto& row : rows) {
    SCOPED_TRACE(row.stream + " " + row.service);
    Child drd("/bin/sh",
              {"-c", "exec 2>\"$0\"; JOURNAL_STREAM=" + row.stream + " exec \"$1\" -S \"$2\"",
               errorFile, DrdProcess::BinaryPath(), row.service},
              DrkitEnvironment(root_.path()));
    if (row.status == 0) {
      for (int i = 0; i < 200 && !Drm1Peer(drd_->socketPath(row.service)).connected(); ++i) {
        std::this_thread::sleep_for(50ms);
      }
      drd.signal(SIGTERM);
    }
    EXPECT_EQ(drd.wait(), row.status);
    std::ifstream in(errorFile);
    std::string first, last;
    for (std::string line; std::getline(in, line);) {
      if (line.find("install folders: ") != std::string::npos) continue;
      if (first.empty()) first = line;
      last = line;
    }
    EXPECT_EQ(first.rfind(row.first, 0), 0u) << first;
    EXPECT_EQ(last, row.last);
  }
  EXPECT_TRUE(Drm1Peer(drd_->socketPath("com.example.first")).connected());
}

// A broken frame closes its own connection only; frames at the limits and serial gaps are served.
TEST_F(DrdTest, BrokenFramesCloseOnlyTheirConnection) {
  std::vector<std::pair<std::string, std::string>> rows = BrokenFrames();
  const std::string match = *drm1::EncodeFrame(5, 0, drm1::kFlagWantsReply, Request("match"));
  for (uint64_t second : {5, 3}) {
    rows.emplace_back(
        "serial " + std::to_string(second) + " after 5",
        match + *drm1::EncodeFrame(second, 0, drm1::kFlagWantsReply, Request("match")));
  }
  std::string big = "\x0B" + RawU32(1) + RawKey("pad") + "\x08";
  const uint32_t padding = drm1::kMaxBodySize - static_cast<uint32_t>(big.size()) - 4;
  big += RawU32(padding) + std::string(padding, 'p');
  const struct {
    const char* what;
    std::string bytes;
    uint64_t last;  // the serial of the last reply
  } served[] = {
      {"nesting depth 64", RawRequest(NestedBody(64)), 1},
      {"body of 16 MiB", RawRequest(big), 1},
      {"serials with a gap",
       RawRequest(NestedBody(2)) +
           *drm1::EncodeFrame(9, 0, drm1::kFlagWantsReply, Value::EmptyDictionary()),
       9},
  };
  Start();
  Drm1Peer bystander(drd_->socketPath());
  uint64_t serial = 1;
  for (const auto& [what, bytes] : rows) {
    Drm1Peer peer(drd_->socketPath());
    peer.sendRaw(bytes);
    EXPECT_TRUE(peer.sawEndOfStream()) << what;
    ASSERT_TRUE(bystander.send(serial, Request("match"))) << what;
    std::optional<drm1::Frame> reply = bystander.receive();
    ASSERT_TRUE(reply) << what;
    EXPECT_EQ(reply->header.replyTo, serial++) << what;
  }
  EXPECT_NE(drd_->standardError().find("serial 3 not above the one before, 5"), std::string::npos);
  for (const auto& row : served) {
    Drm1Peer peer(drd_->socketPath());
    ASSERT_TRUE(peer.sendRaw(row.bytes)) << row.what;
    for (uint64_t replyTo : {uint64_t{1}, row.last}) {
      std::optional<drm1::Frame> reply = peer.receive(10s);
      ASSERT_TRUE(reply) << row.what;
      EXPECT_EQ(reply->header.replyTo, replyTo) << row.what;
      EXPECT_EQ(reply->body["error"], Value("unsupported protocol version 0 (need 2)")) << row.what;
      if (replyTo == row.last) break;
    }
  }
}

}  // namespace
}  // namespace dr::testing
