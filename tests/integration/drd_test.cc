// drd end to end: the real binary in a fresh temporary environment, spoken to
// over its real socket.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/integration/drkit_runner.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/process_fixtures.h"
#include "wire/drm1.h"

namespace dr {
namespace {

using testing::DrdProcess;
using testing::Drm1Peer;
using testing::TempFolder;

using namespace std::chrono_literals;

constexpr char kUsage[] = "Usage: drd [-S servicename] [-v]\n";

// Hand-made frames, for bytes the encoder refuses to produce.
std::string U32(uint32_t n) {
  std::string out;
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<char>((n >> (8 * i)) & 0xFF));
  return out;
}
std::string U64(uint64_t n) {
  return U32(static_cast<uint32_t>(n)) + U32(static_cast<uint32_t>(n >> 32));
}
std::string Key(const std::string& key) { return U32(static_cast<uint32_t>(key.size())) + key; }
// A request frame with serial 1 around `body` (encoded bytes).
std::string RawRequest(const std::string& body) {
  return std::string("DRM1", 4) + U32(static_cast<uint32_t>(body.size())) + U64(1) + U64(0) +
         U32(drm1::kFlagWantsReply) + U32(0) + body;
}
// A top dictionary { "a": [[[...]]] } whose innermost array is at `depth`.
std::string NestedBody(int depth) {
  std::string body = "\x0B" + U32(1) + Key("a");
  for (int level = 2; level <= depth; ++level) body += "\x0A" + U32(level < depth ? 1 : 0);
  return body;
}

class DrdTest : public ::testing::Test {
 protected:
  // Starts drd with `arguments` and waits until it serves `serviceName`.
  DrdProcess& Start(std::vector<std::string> arguments = {},
                    const std::string& serviceName = "com.corvel.dromon.drd") {
    drd_ = std::make_unique<DrdProcess>(root_.path(), std::move(arguments));
    EXPECT_TRUE(drd_->waitUntilServing(serviceName)) << drd_->standardError();
    return *drd_;
  }
  // Every test that started drd ends it as the service manager would: the
  // daemon must stop cleanly.
  void TearDown() override {
    if (!drd_) return;
    ASSERT_TRUE(drd_->signal(SIGTERM));
    EXPECT_EQ(drd_->waitForExit(), 0) << drd_->standardError();
  }

  TempFolder root_;
  std::unique_ptr<DrdProcess> drd_;
};

TEST_F(DrdTest, BadCommandLinesPrintUsageAndExit2) {
  const std::vector<std::vector<std::string>> rows = {
      {"-x"}, {"-d"}, {"-S"}, {"stray"}, {"-v", "stray"}, {"-d", "/tmp/a", "-v", "-q"},
  };
  for (const auto& arguments : rows) {
    DrdProcess drd(root_.path(), arguments);
    EXPECT_EQ(drd.waitForExit(), 2) << arguments[0];
    EXPECT_EQ(drd.standardError(), kUsage) << arguments[0];
  }
}

// --help and --version win over everything else on the line; both go to
// standard output and end with status 0.
TEST_F(DrdTest, HelpAndVersionPrintToStandardOutput) {
  const std::vector<std::pair<std::vector<std::string>, std::string>> rows = {
      {{"--version"}, "drd 0.1.0\n"},
      {{"-v", "--version", "stray"}, "drd 0.1.0\n"},
      {{"--help"}, "Usage: drd [-S servicename] [-v]\ndrd, the per-user plug-in registry daemon"},
      {{"-x", "--help"}, "Usage: drd [-S servicename] [-v]\n"},
  };
  for (const auto& [arguments, start] : rows) {
    testing::Child drd(DrdProcess::BinaryPath(), arguments,
                       testing::DrkitEnvironment(root_.path()));
    EXPECT_EQ(drd.wait(), 0) << arguments[0];
    EXPECT_EQ(drd.out().rfind(start, 0), 0u) << drd.out();
    EXPECT_EQ(drd.err(), "");
  }
}

// drd says where it serves and which registry it opened, and that it
// stopped; the socket file it made goes with it.
TEST_F(DrdTest, LogsStartAndStopAndRemovesItsSocket) {
  Start();
  const std::string socket = drd_->socketPath();
  // The socket accepts as soon as it is bound, a moment before the line is
  // written; the install folders' reconcile reports itself on its own
  // thread, before or after.
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
  ASSERT_TRUE(drd_->signal(SIGTERM));
  EXPECT_EQ(drd_->waitForExit(), 0);
  EXPECT_EQ(drd_->standardError().substr(
                drd_->standardError().rfind('\n', drd_->standardError().size() - 2) + 1),
            "drd stopped\n");
  EXPECT_NE(::access(socket.c_str(), F_OK), 0) << "the socket file is left behind";
  drd_.reset();
}

// When JOURNAL_STREAM names drd's standard error, every line starts with
// its priority; when it names something else, no line does.
TEST_F(DrdTest, LinesCarryTheirPriorityOnlyOnTheJournalStream) {
  Start({"-S", "com.example.first"}, "com.example.first");
  const std::string kOwnStream = "$(stat -c %d:%i \"$0\")";
  struct Row {
    std::string stream;   // shell text for JOURNAL_STREAM
    std::string service;  // the second drd's service name
    int status;           // its exit status
    std::string first;    // the start of its first line of standard error
    std::string last;     // its last line
  };
  const std::vector<Row> rows = {
      {kOwnStream, "com.example.second", 0, "<6>drd 0.1.0 listening on ", "<6>drd stopped"},
      {kOwnStream, "com.example.first", 1, "<5>unable to listen as ",
       "<3>unable to construct server"},
      {"0:0", "com.example.first", 1, "unable to listen as ", "unable to construct server"},
  };
  const std::string errorFile = root_.path() + "/journal.stderr";
  for (const Row& row : rows) {
    SCOPED_TRACE(row.stream + " " + row.service);
    testing::Child drd(
        "/bin/sh",
        {"-c", "exec 2>\"$0\"; JOURNAL_STREAM=" + row.stream + " exec \"$1\" -S \"$2\"", errorFile,
         DrdProcess::BinaryPath(), row.service},
        testing::DrkitEnvironment(root_.path()));
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
      if (line.find("install folders: ") != std::string::npos) continue;  // on a thread of its own
      if (first.empty()) first = line;
      last = line;
    }
    EXPECT_EQ(first.rfind(row.first, 0), 0u) << first;
    EXPECT_EQ(last, row.last);
  }
}

TEST_F(DrdTest, SecondDaemonOnTheSameNameExits1) {
  Start();
  DrdProcess second(root_.path(), {});
  EXPECT_EQ(second.waitForExit(), 1);
  EXPECT_NE(second.standardError().find("unable to construct server\n"), std::string::npos)
      << second.standardError();
  Drm1Peer peer(drd_->socketPath());
  EXPECT_TRUE(peer.connected()) << "the first daemon must keep serving";
}

TEST_F(DrdTest, LastServiceNameCounts) {
  Start({"-S", "first.name", "-v", "-S", "second.name"}, "second.name");
  EXPECT_FALSE(Drm1Peer(drd_->socketPath("first.name")).connected());
}

// Pipelined on one connection, every request gets one reply bound to its
// serial, in order, with the envelope's error.
TEST_F(DrdTest, EachRequestGetsOneBoundReply) {
  struct Row {
    Value body;
    uint64_t code;
    std::string error;
  };
  const char* kUnrecognized = "unrecognized request";
  std::vector<Row> rows = {
      {Value{{"request", "match"}}, 7, "unsupported protocol version 0 (need 2)"},
      {Value{{"request", "match"}, {"version", uint64_t{3}}}, 7,
       "unsupported protocol version 3 (need 2)"},
      {Value{{"request", "match"}, {"version", "2"}}, 7, "unsupported protocol version 0 (need 2)"},
      {Value{{"version", uint64_t{2}}}, 4, "invalid request format (missing type)"},
      {Value{{"request", uint64_t{1}}, {"version", uint64_t{2}}}, 4,
       "invalid request format (missing type)"},
      {Value{{"request", "Match"}, {"version", uint64_t{2}}}, 4, kUnrecognized},
      {Value{{"request", "frobnicate"}, {"version", uint64_t{2}}}, 4, kUnrecognized},
  };
  // Every request name reaches its own handler; bare, each one fails its own
  // way or succeeds with nothing to do.
  const struct {
    const char* name;
    uint64_t code;
    const char* error;
  } bare[] = {
      {"add", 4, "invalid request format"},
      {"remove", 4, "invalid request format"},
      {"bulk", 0, ""},
      {"match", 0, ""},
      {"ready", 4, "invalid request format (uuid)"},
      {"access", 4, "invalid request format (uuid)"},
      {"annotate", 4, "invalid request format (bad annotations dictionary)"},
      {"lock", 4, "invalid request format"},
  };
  for (const auto& b : bare) {
    rows.push_back({Value{{"request", b.name}, {"version", uint64_t{2}}}, b.code, b.error});
  }
  Start();
  Drm1Peer peer(drd_->socketPath());
  ASSERT_TRUE(peer.connected());
  // A message that wants no reply is processed without one.
  ASSERT_TRUE(peer.send(1, Value{{"request", "match"}, {"version", uint64_t{2}}}, false));
  for (size_t i = 0; i < rows.size(); ++i) ASSERT_TRUE(peer.send(10 + i, rows[i].body));
  for (size_t i = 0; i < rows.size(); ++i) {
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply) << "no reply to row " << i;
    EXPECT_TRUE(reply->header.isReply());
    EXPECT_EQ(reply->header.replyTo, 10 + i);
    EXPECT_EQ(reply->body["errorcode"].uintValue(), rows[i].code) << i;
    EXPECT_EQ(reply->body["error"].stringValue(), rows[i].error) << i;
    if (rows[i].code != 0) {
      EXPECT_EQ(reply->body.size(), 2u) << reply->body.description();
    }
  }
  EXPECT_FALSE(peer.receive(std::chrono::milliseconds(200))) << "one reply too many";
}

// Each kind of broken frame closes its own connection only; another client
// is served before and after.
TEST_F(DrdTest, BrokenFrameClosesOnlyItsConnection) {
  const std::string good =
      *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Value{{"request", "match"}});
  auto withByte = [&](size_t offset, char byte) {
    std::string frame = good;
    frame[offset] = byte;
    return frame;
  };
  auto withLength = [&](uint32_t length) {
    std::string frame = good;
    for (int i = 0; i < 4; ++i) frame[4 + i] = static_cast<char>((length >> (8 * i)) & 0xFF);
    return frame;
  };
  const std::string oversize = withLength(drm1::kMaxBodySize + 1);
  std::string oversizeWithBody = oversize;
  oversizeWithBody.resize(drm1::kHeaderSize + drm1::kMaxBodySize + 1, '\0');
  const std::vector<std::pair<const char*, std::string>> rows = {
      {"bad magic", withByte(0, 'X')},
      {"unknown flag", withByte(24, 0x05)},
      {"reply flag from a client", withByte(24, 0x03)},
      {"body length 16 MiB + 1, header only", oversize},
      {"body length 16 MiB + 1, body sent", oversizeWithBody},
      {"string not UTF-8",
       RawRequest("\x0B" + U32(1) + Key("request") + "\x07" + U32(2) + "\xC3\x28")},
      {"key not UTF-8", RawRequest("\x0B" + U32(1) + Key("\xFF") + "\x02")},
      {"duplicate key",
       RawRequest("\x0B" + U32(2) + Key("request") + "\x02" + Key("request") + "\x01")},
      {"nesting depth 65", RawRequest(NestedBody(65))},
      {"count larger than the body", RawRequest("\x0B" + U32(1000))},
      {"unknown tag", withByte(drm1::kHeaderSize, 0x0C)},
      {"top level not a dictionary", withByte(drm1::kHeaderSize, 0x0A)},
      {"trailing bytes", withLength(static_cast<uint32_t>(good.size() - drm1::kHeaderSize + 1)) +
                             std::string(1, '\0')},
      {"serial zero", withByte(8, 0)},
  };
  Start();
  Drm1Peer bystander(drd_->socketPath());
  ASSERT_TRUE(bystander.connected());
  uint64_t serial = 1;
  for (const auto& [what, bytes] : rows) {
    Drm1Peer peer(drd_->socketPath());
    ASSERT_TRUE(peer.connected());
    peer.sendRaw(bytes);
    EXPECT_TRUE(peer.sawEndOfStream()) << what;
    ASSERT_TRUE(bystander.send(serial, Value{{"version", uint64_t{2}}})) << what;
    std::optional<drm1::Frame> reply = bystander.receive();
    ASSERT_TRUE(reply) << what;
    EXPECT_EQ(reply->header.replyTo, serial++) << what;
  }
}

// A client that hangs up with many requests still queued gets nothing and
// breaks nothing.
TEST_F(DrdTest, ClientGoneWithQueuedRequestsLeavesDaemonServing) {
  Start({"-v"});
  {
    Drm1Peer leaver(drd_->socketPath());
    ASSERT_TRUE(leaver.connected());
    for (uint64_t serial = 1; serial <= 500; ++serial) {
      leaver.send(serial, Value{{"request", "match"}, {"version", uint64_t{2}}});
    }
  }
  Drm1Peer peer(drd_->socketPath());
  ASSERT_TRUE(peer.send(7, Value{{"request", "lock"}, {"version", uint64_t{2}}}));
  std::optional<drm1::Frame> reply = peer.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->header.replyTo, 7u);
}

// With -v, a client's every thousandth request is counted in the log, and
// the count includes requests that failed.
TEST_F(DrdTest, VerboseLogCountsEachThousandRequests) {
  Start({"-v"});
  Drm1Peer peer(drd_->socketPath());
  for (uint64_t serial = 1; serial <= 1001; ++serial) {
    ASSERT_TRUE(peer.send(serial, Value{{"request", "match"}, {"version", uint64_t{2}}}));
  }
  for (uint64_t serial = 1; serial <= 1001; ++serial) ASSERT_TRUE(peer.receive()) << serial;
  const std::string log = drd_->standardError();
  const std::string line = "used 1000 requests so far\n";
  size_t at = log.find(line);
  ASSERT_NE(at, std::string::npos) << log.substr(0, 2000);
  EXPECT_EQ(log.find(line, at + 1), std::string::npos);
  EXPECT_EQ(log.find("used 999 "), std::string::npos);
  EXPECT_EQ(log.find("used 1001 "), std::string::npos);
  EXPECT_NE(log.find("request match\n"), std::string::npos);
}

// Each -v adds detail: none logs no request, one logs each request's name,
// two also the full text of every message and reply.
TEST_F(DrdTest, VerbosityDecidesWhatIsLogged) {
  struct Row {
    std::vector<std::string> arguments;
    bool names, messages;
  } rows[] = {{{}, false, false}, {{"-v"}, true, false}, {{"-v", "-v"}, true, true}};
  for (const Row& row : rows) {
    TempFolder root;
    DrdProcess drd(root.path(), row.arguments);
    ASSERT_TRUE(drd.waitUntilServing());
    Drm1Peer peer(drd.socketPath());
    ASSERT_TRUE(peer.send(1, Value{{"request", "bulk"}, {"version", uint64_t{2}}}));
    ASSERT_TRUE(peer.receive());
    ASSERT_TRUE(drd.signal(SIGTERM));
    ASSERT_EQ(drd.waitForExit(), 0);
    const std::string log = drd.standardError();
    const size_t n = row.arguments.size();
    EXPECT_EQ(log.find("request bulk\n") != std::string::npos, row.names) << n;
    EXPECT_EQ(log.find("incoming request { \"request\": \"bulk\", \"version\": 2 }\n") !=
                  std::string::npos,
              row.messages)
        << n << log;
    EXPECT_EQ(log.find("Replying { }\n") != std::string::npos, row.messages) << n;
  }
}

// The limits themselves are allowed: nesting depth 64 and a body of exactly
// 16 MiB are requests like any other.
TEST_F(DrdTest, FramesAtTheLimitsAreServed) {
  std::string big = "\x0B" + U32(1) + Key("pad") + "\x08";
  const uint32_t padding = drm1::kMaxBodySize - static_cast<uint32_t>(big.size()) - 4;
  big += U32(padding) + std::string(padding, 'p');
  ASSERT_EQ(big.size(), drm1::kMaxBodySize);
  const std::vector<std::pair<const char*, std::string>> rows = {
      {"nesting depth 64", RawRequest(NestedBody(64))},
      {"body of 16 MiB", RawRequest(big)},
  };
  Start();
  for (const auto& [what, bytes] : rows) {
    Drm1Peer peer(drd_->socketPath());
    ASSERT_TRUE(peer.sendRaw(bytes)) << what;
    std::optional<drm1::Frame> reply = peer.receive(10s);
    ASSERT_TRUE(reply) << what;
    EXPECT_EQ(reply->header.replyTo, 1u) << what;
    EXPECT_EQ(reply->body["error"], Value("unsupported protocol version 0 (need 2)")) << what;
  }
}

// A peer that pipelines requests without ever reading its replies must not
// stall anybody else: another client is answered promptly while the flood
// goes on, and the daemon keeps serving after the flooder leaves. (Its cut-off
// at the reply queue limit takes tens of seconds of flooding here, so it is
// checked at the message service level instead.)
TEST_F(DrdTest, PeerThatNeverReadsDoesNotStallOthers) {
  Start();
  auto hog = std::make_unique<Drm1Peer>(drd_->socketPath());
  ASSERT_TRUE(hog->connected());
  std::atomic<bool> stop{false};
  std::atomic<uint64_t> sent{0};
  std::thread flood([&] {
    const Value request{{"request", "frobnicate"}, {"version", uint64_t{2}}};
    std::string batch;
    uint64_t serial = 1;
    while (!stop) {
      batch.clear();
      for (int i = 0; i < 1000; ++i) {
        batch += *drm1::EncodeFrame(serial++, 0, drm1::kFlagWantsReply, request);
      }
      if (!hog->sendRaw(batch)) return;  // cut off
      sent += 1000;
    }
  });
  Drm1Peer other(drd_->socketPath());
  ASSERT_TRUE(other.connected());
  uint64_t serial = 1;
  for (int round = 0; round < 5; ++round, ++serial) {
    std::this_thread::sleep_for(200ms);
    const auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(other.send(serial, Value{{"request", "lock"}, {"version", uint64_t{2}}}));
    std::optional<drm1::Frame> reply = other.receive(5s);
    ASSERT_TRUE(reply) << "round " << round << " after " << sent << " flooding requests";
    EXPECT_EQ(reply->header.replyTo, serial);
    EXPECT_LT(std::chrono::steady_clock::now() - start, 3s) << "round " << round;
  }
  EXPECT_GT(sent, 0u) << "the flood never got going";
  stop = true;
  ::shutdown(hog->fd(), SHUT_RDWR);  // unblocks a send waiting on a full socket
  flood.join();
  hog.reset();
  ASSERT_TRUE(other.send(serial, Value{{"request", "lock"}, {"version", uint64_t{2}}}));
  std::optional<drm1::Frame> after = other.receive(30s);
  ASSERT_TRUE(after) << "the daemon stopped serving after the flood";
  EXPECT_EQ(after->header.replyTo, serial);
}

}  // namespace
}  // namespace dr
