// drd under crashes, hostile peers, broken files and load: the real daemon in
// a private world, killed, attacked and flooded, and checked afterwards for
// lost acknowledged changes, leaks of rights, wrong replies and lost replies.
#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>
#include <sqlite3.h>

#include "core/utf8.h"
#include "platform/file_system.h"
#include "platform/pdoc_file.h"
#include "platform/preferences.h"
#include "platform/sandbox.h"
#include "tests/integration/world.h"
#include "wire/drm1.h"

namespace dr::testing {
namespace {

using registry_test::WriteBytes;

constexpr uint64_t kHoldPlugIn = 2;  // "lock" flags: hold the plug-ins named by path

std::mt19937 SeededRandom() {
  const unsigned seed = std::random_device{}();
  std::cout << "random seed " << seed << "\n";  // to replay a failing run
  return std::mt19937(seed);
}

std::string AnnotationFile(const World& w) { return w.path("state/com.corvel.dromon/Annotations"); }

mode_t ModeOf(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
}

// The resident set of `pid` in bytes, from /proc/<pid>/status (0 if unknown).
size_t ResidentBytes(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stoull(line.substr(6)) * 1024;
  }
  return 0;
}

// Running, not exited: an unreaped drd is a zombie ("Z") in /proc.
bool Alive(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string stat((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  const size_t end = stat.rfind(')');
  return end != std::string::npos && end + 2 < stat.size() && stat[end + 2] != 'Z';
}

// Plug-ins "com.example.<prefix><i>" on the system volume, made and registered.
struct PlugIns {
  std::vector<std::string> ids, paths;
  std::vector<Value> uuids;
};

PlugIns RegisterPlugIns(World& w, const std::string& prefix, int count) {
  PlugIns p;
  for (int i = 0; i < count; ++i) {
    p.ids.push_back("com.example." + prefix + std::to_string(i));
    p.paths.push_back(
        w.makePlugIn("system/" + prefix + std::to_string(i) + ".appex", p.ids.back()));
  }
  EXPECT_EQ(ErrorCode(w.add(p.paths)), 0u) << w.log();
  std::map<std::string, Value> byId;
  const Value forms = w.everything();
  for (const Value& form : forms.array()) {
    byId[form["identifier"].stringValue()] = Value(Uuid::parse(form["uuid"].stringValue()));
  }
  for (const std::string& id : p.ids) p.uuids.push_back(byId[id]);
  return p;
}

// ---------------------------------------------------------------- crashes

// Waits for a stream's first acknowledgement (or drd's end), lets the
// stream run for a random while of up to `maxMs`, then SIGKILLs drd and
// restarts it; false when that failed.
bool KillMidStream(World& w, const std::atomic<int>& acks, std::mt19937& random, int maxMs) {
  while (acks == 0 && Alive(w.drd().pid()))
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  std::this_thread::sleep_for(
      std::chrono::milliseconds(std::uniform_int_distribution<int>(0, maxMs)(random)));
  return w.kill9();
}

// Acknowledged "annotate" requests survive a SIGKILL at a random moment: a
// writer thread sets "extension" = {"n": k} on plug-in k % count with
// increasing k; after the crash each plug-in holds the last value drd
// acknowledged for it, or the one in flight when drd died.
TEST(ReliabilityTest, AcknowledgedAnnotationsSurviveKill9) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  constexpr int kPlugIns = 8;
  constexpr int kKills = 4;
  const PlugIns p = RegisterPlugIns(w, "ann", kPlugIns);
  std::mt19937 random = SeededRandom();
  std::vector<int64_t> acked(kPlugIns, -1), inFlight(kPlugIns, -1);
  int64_t next = 0;
  size_t acknowledged = 0;
  for (int kill = 0; kill < kKills; ++kill) {
    std::unique_ptr<client::Connection> c = w.connect();
    ASSERT_NE(c, nullptr);
    std::atomic<int> acks{0};
    std::thread writer([&] {
      for (;;) {
        const int k = static_cast<int>(next % kPlugIns);
        inFlight[k] = next;
        Value reply =
            w.call(Request("annotate", {{"annotations", Value{{"extension", Value{{"n", next}}}}},
                                        {"uuids", Value(Array{p.uuids[k]})}}),
                   c.get());
        if (ErrorCode(reply) != 0) return;  // drd is gone
        acked[k] = next++;
        ++acks;
      }
    });
    ASSERT_TRUE(KillMidStream(w, acks, random, 300)) << w.log();
    writer.join();
    acknowledged += static_cast<size_t>(acks);

    Result<Value> file = pdoc::ReadFile(AnnotationFile(w));
    ASSERT_TRUE(file.ok()) << "kill " << kill << ": " << file.error().description();
    EXPECT_EQ((*file)["version"].intValue(), 16);
    EXPECT_TRUE((*file)["data"].isDictionary());
    std::map<std::string, int64_t> stored;
    const Value matches = w.match();
    for (const Value& form : matches.array()) {
      const Value& n = form["annotations"]["extension"]["n"];
      stored[form["identifier"].stringValue()] = n.isPresent() ? n.intValue() : -1;
    }
    for (int k = 0; k < kPlugIns; ++k) {
      if (acked[k] < 0) continue;
      EXPECT_TRUE(stored[p.ids[k]] == acked[k] || stored[p.ids[k]] == inFlight[k])
          << "kill " << kill << ", " << p.ids[k] << ": stored " << stored[p.ids[k]]
          << ", acknowledged " << acked[k];
      acked[k] = stored[p.ids[k]];  // the in-flight change may have landed
    }
  }
  EXPECT_GT(acknowledged, static_cast<size_t>(kKills));
  // A kill between creating and renaming the temporary leaves it behind; drd
  // removes such leftovers when it starts (one is planted to be sure there
  // is one), and nothing else beside the file.
  const std::string folder = w.path("state/com.corvel.dromon");
  WriteBytes(folder + "/Annotations.tmp-" + Uuid::random().string(), "<?xml");
  WriteBytes(folder + "/Annotations.tmp-keep", "not a temporary drd makes");
  ASSERT_TRUE(w.restart()) << w.log();
  EXPECT_NE(w.log().find("leftover temporaries of"), std::string::npos) << w.log();
  std::vector<std::string> names;
  for (const auto& e : std::filesystem::directory_iterator(folder)) {
    names.push_back(e.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  std::erase(names, "sandbox.key");  // the key of the read tokens "access" made
  EXPECT_EQ(names, (std::vector<std::string>{"Annotations", "Annotations.tmp-keep"}));
  std::cout << kKills << " kills, " << acknowledged << " acknowledged annotations kept\n";
}

// Acknowledged "add" requests survive a SIGKILL at a random moment.
TEST(ReliabilityTest, AcknowledgedRegistrationsSurviveKill9) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  constexpr int kKills = 3;
  constexpr int kPerRound = 20;
  std::mt19937 random = SeededRandom();
  std::set<std::string> acked;
  for (int kill = 0; kill < kKills; ++kill) {
    std::vector<std::pair<std::string, std::string>> bundles;  // identifier, path
    for (int i = 0; i < kPerRound; ++i) {
      const std::string name = "reg" + std::to_string(kill) + "_" + std::to_string(i);
      bundles.emplace_back("com.example." + name,
                           w.makePlugIn("system/" + name + ".appex", "com.example." + name));
    }
    std::unique_ptr<client::Connection> c = w.connect();
    ASSERT_NE(c, nullptr);
    std::atomic<int> acks{0};
    std::thread adder([&] {
      for (const auto& [id, path] : bundles) {
        Value reply = w.call(Request("add", {{"paths", Value(Array{Value(path)})}}), c.get());
        if (ErrorCode(reply) != 0) return;
        acked.insert(id);
        ++acks;
      }
    });
    ASSERT_TRUE(KillMidStream(w, acks, random, 200)) << w.log();
    adder.join();

    std::set<std::string> present;
    const Value matches = w.match();
    for (const Value& form : matches.array()) present.insert(form["identifier"].stringValue());
    for (const std::string& id : acked)
      EXPECT_EQ(present.count(id), 1u) << "kill " << kill << ": " << id;
  }
  std::cout << kKills << " kills, " << acked.size() << " acknowledged registrations kept\n";
}

// ---------------------------------------------------------------- hostile peers

TEST(ReliabilityTest, PrivateFilesAreOwnerOnly) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "perm", 1);
  ASSERT_EQ(ErrorCode(w.call(Request("annotate", {{"annotations", Value{{"election", 1}}},
                                                  {"uuids", Value(Array{p.uuids[0]})}}))),
            0u);
  ASSERT_EQ(ErrorCode(w.call(Request("access", {{"uuids", Value(Array{p.uuids[0]})}}))), 0u);
  struct Row {
    std::string path;
    mode_t mode;
  } rows[] = {
      {w.path("sockets"), 0700},
      {w.path("state/com.corvel.dromon"), 0700},
      {AnnotationFile(w), 0600},
      {w.path("state/com.corvel.dromon/sandbox.key"), 0600},
  };
  for (const Row& row : rows) EXPECT_EQ(ModeOf(row.path), row.mode) << row.path;
}

TEST(ReliabilityTest, BadExtensionTokensAreRefused) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "tok", 2);
  Value reply = w.call(Request("access", {{"uuids", Value(Array{p.uuids[0], p.uuids[1]})}}));
  ASSERT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  const std::string a = reply["extensions"].at(0).stringValue();
  const std::string b = reply["extensions"].at(1).stringValue();
  const SandboxOptions options{.keyPath = w.path("state/com.corvel.dromon/sandbox.key")};
  ASSERT_TRUE(consumeExtension(a, options).ok());
  ASSERT_TRUE(consumeExtension(b, options).ok());

  // Fields: "drx1" ";" class ";" path-hex ";" mac-hex.
  const size_t macAt = a.rfind(';') + 1;
  const size_t pathAt = a.rfind(';', macAt - 2) + 1;
  auto flip = [](std::string t, size_t at) {
    t[at] = t[at] == '0' ? '1' : '0';
    return t;
  };
  const std::string bPathHex = b.substr(pathAt, b.rfind(';') - pathAt);
  struct Row {
    const char* what;
    std::string token;
  } rows[] = {
      {"empty", ""},
      {"forged signature", a.substr(0, macAt) + std::string(64, '0')},
      {"one character of the signature changed", flip(a, macAt + 7)},
      {"one character of the path changed", flip(a, pathAt + 1)},
      {"one character of the class changed", flip(a, 5)},
      {"last character cut", a.substr(0, a.size() - 1)},
      {"cut in the path", a.substr(0, pathAt + 4)},
      {"signature dropped", a.substr(0, macAt)},
      {"a's signature replayed for b's path",
       a.substr(0, pathAt) + bPathHex + ";" + a.substr(macAt)},
      {"trailing field", a + ";00"},
      {"another magic", "drx2" + a.substr(4)},
  };
  for (const Row& row : rows) {
    Result<std::string> granted = consumeExtension(row.token, options);
    EXPECT_FALSE(granted.ok()) << row.what << " granted " << (granted.ok() ? *granted : "");
  }
  // Without the key nothing is granted, not even a genuine token.
  std::filesystem::remove(w.path("state/com.corvel.dromon/sandbox.key"));
  EXPECT_FALSE(consumeExtension(a, options).ok());
}

// A child process that takes uid/gid 65534 and connects to `socketPath`:
// the errno of connect (0 on success), then whether drd closed the
// connection without a byte (1) or not (0), through a pipe.
std::pair<int, int> ConnectAsNobody(const std::string& socketPath) {
  int out[2];
  if (::pipe(out) != 0) return {-1, -1};
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  const pid_t child = ::fork();
  if (child == 0) {
    // Only async-signal-safe calls from here on.
    int result[2] = {-1, 0};
    if (::setgroups(0, nullptr) == 0 && ::setresgid(65534, 65534, 65534) == 0 &&
        ::setresuid(65534, 65534, 65534) == 0) {
      const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
      result[0] =
          ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 ? 0 : errno;
      if (result[0] == 0) {
        pollfd in{fd, POLLIN, 0};
        char byte;
        result[1] = ::poll(&in, 1, 20000) == 1 && ::read(fd, &byte, 1) == 0 ? 1 : 0;
      }
    }
    (void)!::write(out[1], result, sizeof result);
    ::_exit(0);
  }
  ::close(out[1]);
  int result[2] = {-1, -1};
  (void)!::read(out[0], result, sizeof result);
  ::close(out[0]);
  ::waitpid(child, nullptr, 0);
  return {result[0], result[1]};
}

TEST(ReliabilityTest, PeerOfAnotherUserIsRefused) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const std::string socket = w.drd().socketPath();
  // The owner-only socket folder already keeps another user out.
  EXPECT_EQ(ConnectAsNobody(socket).first, EACCES);

  // Open the way on purpose: drd itself must still refuse the peer.
  const mode_t rootMode = ModeOf(w.root());
  ASSERT_EQ(::chmod(w.root().c_str(), 0711), 0);
  ASSERT_EQ(::chmod(w.path("sockets").c_str(), 0711), 0);
  ASSERT_EQ(::chmod(socket.c_str(), 0666), 0);
  const auto [error, closed] = ConnectAsNobody(socket);
  ::chmod(socket.c_str(), 0600);
  ::chmod(w.path("sockets").c_str(), 0700);
  ::chmod(w.root().c_str(), rootMode);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(closed, 1) << "drd kept a connection of uid 65534 open";
  EXPECT_NE(w.log().find("of uid 65534: drd serves uid 0 only"), std::string::npos) << w.log();
  // And it goes on serving its own user.
  EXPECT_EQ(ErrorCode(w.call(Request("match"))), 0u);
}

// ---------------------------------------------------------------- faults

// The annotation folder replaced by a regular file after start: saves fail,
// the requests succeed, memory keeps the changes, and the first save after
// the folder is back writes them all.
TEST(ReliabilityTest, UnwritableAnnotationFolderKeepsChangesInMemory) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "fault", 2);
  const std::string folder = w.path("state/com.corvel.dromon");
  std::filesystem::remove_all(folder);
  WriteBytes(folder, "not a folder");

  Value reply = w.call(Request(
      "annotate", {{"annotations", Value{{"election", 1}}}, {"uuids", Value(Array{p.uuids[0]})}}));
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  EXPECT_NE(w.log().find("unable to save annotations:" + AnnotationFile(w) + " error:"),
            std::string::npos)
      << w.log();
  Value matches = w.match();
  ASSERT_EQ(matches.size(), 2u);
  for (const Value& form : matches.array()) {
    EXPECT_EQ(form["annotations"]["election"].intValue(),
              form["identifier"].stringValue() == p.ids[0] ? 1 : 0);
  }

  std::filesystem::remove(folder);
  std::filesystem::create_directory(folder);
  reply = w.call(Request(
      "annotate", {{"annotations", Value{{"election", 2}}}, {"uuids", Value(Array{p.uuids[1]})}}));
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  ASSERT_TRUE(w.restart()) << w.log();
  matches = w.match();
  for (const Value& form : matches.array()) {
    EXPECT_EQ(form["annotations"]["election"].intValue(),
              form["identifier"].stringValue() == p.ids[0] ? 1 : 2)
        << form["identifier"].stringValue();
  }
}

// Another process holds the registry database: a registration waits for it,
// then gets a clear error reply, and drd goes on answering; once the database
// is free again the same registration goes through.
TEST(ReliabilityTest, LockedRegistryGivesAnErrorReplyAndDrdStaysUp) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "locked", 1);
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(w.path("registry/r.sqlite3").c_str(), &other), SQLITE_OK);
  std::unique_ptr<sqlite3, decltype(&sqlite3_close)> closer(other, &sqlite3_close);
  ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);

  const std::string path = w.makePlugIn("system/late.appex", "com.example.late");
  Value reply = w.add({path});
  EXPECT_EQ(ErrorCode(reply), 2u) << ErrorText(reply);
  EXPECT_FALSE(ErrorText(reply).empty());
  EXPECT_NE(w.log().find("database is locked"), std::string::npos) << w.log();
  reply = w.call(Request("remove", {{"paths", Value(Array{Value(p.paths[0])})}}));
  EXPECT_EQ(ErrorCode(reply), 9u) << ErrorText(reply);
  EXPECT_EQ(w.match().size(), 1u) << "what was registered is still offered";

  ASSERT_EQ(sqlite3_exec(other, "ROLLBACK", nullptr, nullptr, nullptr), SQLITE_OK);
  reply = w.add({path});
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  EXPECT_EQ(w.match().size(), 2u);
  ASSERT_TRUE(Alive(w.drd().pid()));
}

// Garbage in the files drd reads (an extension point's SDK dictionary, the
// per-host preferences, the annotation file at start): drd stays up and
// answers.
TEST(ReliabilityTest, GarbageFilesDoNotStopDrd) {
  World w;
  const std::string sdk = w.path("data/dromon/SDKs/com.example.point.pdoc");
  PreferencesOptions prefs =
      PreferencesOptionsFromEnvironment([&](const char* name) -> const char* {
        static std::string config;
        config = w.path("config");
        return std::string_view(name) == "XDG_CONFIG_HOME" ? config.c_str() : ::getenv(name);
      });
  const std::string byHost =
      prefs.directory + "/ByHost/com.corvel.dromon.userprefs." + prefs.hostId + ".pdoc";
  std::string nested;
  for (int i = 0; i < 100000; ++i) nested += '[';
  const std::string rows[] = {
      std::string("\0\x01\x02\xff\xfe garbage", 14),
      "<?xml version=\"1.0\"?><pdoc><dict><key>UXExtension",
      nested,
      "{\"exclusions\": {\"UXExtensionIdentifier\": 7}, \"a\": [1, 2",
      "<?xml version=\"1.0\"?><!DOCTYPE x [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b "
      "\"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\">]><dict><key>&b;</key><true/></dict>",
      std::string(1 << 20, '\x80'),
  };
  WriteBytes(AnnotationFile(w), rows[0]);
  ASSERT_TRUE(w.start()) << w.log();
  EXPECT_NE(w.log().find("unable to load annotation database:"), std::string::npos) << w.log();
  int n = 0;
  for (const std::string& garbage : rows) {
    WriteBytes(sdk, garbage);
    WriteBytes(byHost, garbage);
    const std::string id = "com.example.garbage" + std::to_string(n);
    Value reply = w.add({w.makePlugIn("system/g" + std::to_string(n++) + ".appex", id)});
    EXPECT_NE(ErrorCode(reply), 99999u) << "row " << n << ": " << ErrorText(reply);
    reply = w.call(Request("match"));
    EXPECT_EQ(ErrorCode(reply), 0u) << "row " << n << ": " << ErrorText(reply);
    ASSERT_TRUE(Alive(w.drd().pid())) << "row " << n << "\n" << w.log();
  }
}

// ---------------------------------------------------------------- hostile files

// The reply to `request` on a fresh connection, or nothing when none came
// within two seconds: a hang guard for requests stuck behind another's.
std::optional<Value> AnsweredPromptly(World& w, const Value& request) {
  Drm1Peer peer(w.drd().socketPath());
  if (!peer.send(1, request)) return std::nullopt;
  std::optional<drm1::Frame> frame = peer.receive(std::chrono::seconds(2));
  if (!frame) return std::nullopt;
  return frame->body;
}

// A FIFO where a bundle file belongs, which nobody ever opens for writing:
// registering it is refused as if the file were missing, a peer running
// from a bundle whose entitlements are one is served as one without, and
// meanwhile every other client is answered.
TEST(ReliabilityTest, FifoInPlaceOfABundleFileStallsNobody) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "fifo", 1);
  const std::string bundle = w.path("system/fifo.appex");
  std::filesystem::create_directories(bundle + "/Contents");
  ASSERT_EQ(::mkfifo((bundle + "/Contents/Info.pdoc").c_str(), 0600), 0);
  const std::string app = w.makeApp("Fifo.app", "com.example.fifohost");
  std::filesystem::remove(app + "/Contents/Entitlements.pdoc");
  ASSERT_EQ(::mkfifo((app + "/Contents/Entitlements.pdoc").c_str(), 0600), 0);

  Drm1Peer adder(w.drd().socketPath());
  ASSERT_TRUE(adder.send(1, Request("add", {{"paths", Value(Array{Value(bundle)})}})));
  const std::unique_ptr<HostApp> host = w.host("Fifo.app");
  for (const Value& request :
       {Request("match"), Request("access", {{"uuids", Value(Array{p.uuids[0]})}})}) {
    std::optional<Value> reply = AnsweredPromptly(w, request);
    ASSERT_TRUE(reply) << request.description() << " got no answer\n" << w.log();
    EXPECT_EQ(ErrorCode(*reply), 0u) << ErrorText(*reply);
  }
  std::optional<drm1::Frame> added = adder.receive(std::chrono::seconds(2));
  ASSERT_TRUE(added) << "\"add\" got no answer\n" << w.log();
  EXPECT_EQ(ErrorCode(added->body), 2u) << ErrorText(added->body);
  EXPECT_NE(w.log().find("(no Contents/Info.pdoc)"), std::string::npos) << w.log();
  EXPECT_EQ(World::Identifiers(w.match(Value(), 0, host->connection())), "com.example.fifo0");
}

// Bundles that could not travel in a reply (a path that is not UTF-8,
// dictionaries nested too deep, one stored so by an older drd): "add"
// refuses them with the path escaped, the log stays UTF-8, and every host's
// discovery goes on with the other plug-ins, also after a restart.
TEST(ReliabilityTest, PlugInThatCannotTravelNeverBreaksDiscovery) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "travel", 2);
  const std::string odd = w.makePlugIn("system/odd\xff.appex", "com.example.odd");
  const std::string link = w.path("system/link.appex");
  ASSERT_EQ(::symlink(odd.c_str(), link.c_str()), 0);
  Value deep = Value(Array{});
  for (int i = 1; i < 60; ++i) deep = Value(Array{deep});  // 62 levels with the two above it
  const std::string tooDeep =
      w.makePlugIn("system/deep.appex", "com.example.deep", "1.0", {{"Deep", deep}});
  const std::string escaped = EscapeInvalidUtf8(*CanonicalPath(odd));
  const struct {
    std::string path, reply, log;
  } rows[] = {
      {link, "unable to register plug-in at " + escaped, escaped + "\" is not UTF-8"},
      {tooDeep, "unable to register plug-in at " + *CanonicalPath(tooDeep),
       "nests deeper than the 61 levels a reply can carry"},
  };
  for (const auto& row : rows) {
    Value reply = w.add({row.path});
    EXPECT_EQ(ErrorCode(reply), 2u) << row.path;
    EXPECT_EQ(ErrorText(reply), row.reply);
    EXPECT_NE(w.log().find(row.log), std::string::npos) << w.log();
  }
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.travel0 com.example.travel1");

  // An entry an older drd stored under such a path is left out, with a line.
  w.drd().signal(SIGTERM);
  ASSERT_EQ(w.drd().waitForExit(), 0);
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(w.path("registry/r.sqlite3").c_str(), &db), SQLITE_OK);
  std::unique_ptr<sqlite3, decltype(&sqlite3_close)> closer(db, &sqlite3_close);
  sqlite3_stmt* update = nullptr;
  ASSERT_EQ(
      sqlite3_prepare_v2(db, "UPDATE bundles SET path = ? WHERE path = ?", -1, &update, nullptr),
      SQLITE_OK);
  const std::string stored = *CanonicalPath(p.paths[1]);
  const std::string renamed = stored + "\xfe";
  sqlite3_bind_text(update, 1, renamed.data(), static_cast<int>(renamed.size()), SQLITE_STATIC);
  sqlite3_bind_text(update, 2, stored.data(), static_cast<int>(stored.size()), SQLITE_STATIC);
  EXPECT_EQ(sqlite3_step(update), SQLITE_DONE);
  EXPECT_EQ(sqlite3_changes(db), 1);
  sqlite3_finalize(update);
  ASSERT_TRUE(w.start()) << w.log();
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.travel0") << w.log();
  EXPECT_NE(w.log().find("ignoring mis-configured plug-in at " + stored + "\\xFE"),
            std::string::npos)
      << w.log();
  EXPECT_TRUE(IsValidUtf8(w.log())) << w.log();
}

// The folder of a registered bundle swapped for a link to /etc: "access"
// refuses it (EACCES) rather than sign /etc, and forms carry no token for it.
TEST(ReliabilityTest, AccessRefusesABundleFolderSwappedForALink) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "swap", 1);
  const std::string registered = w.everything().at(0)["path"].stringValue();
  std::filesystem::rename(registered, registered + ".moved");
  ASSERT_EQ(::symlink("/etc", registered.c_str()), 0);

  Value reply = w.call(Request("access", {{"uuids", Value(Array{p.uuids[0]})}}));
  EXPECT_EQ(ErrorCode(reply), 4u);
  EXPECT_EQ(ErrorText(reply), "cannot create extension to " + registered + ": 13");
  const Value forms = w.everything();
  ASSERT_EQ(forms.size(), 1u);
  EXPECT_EQ(forms.at(0)["extensions"].size(), 0u) << forms.description();
}

// A full disk when an annotation is saved: the request is answered and the
// change kept in memory, and once there is room again the save is retried
// without any further change, so the change survives a crash. The state
// folder is a 64 KiB tmpfs in a mount namespace of this test process (and so
// of the drd it starts); the mount goes with the process.
TEST(ReliabilityTest, AnnotationSavedOnceTheFullDiskHasRoom) {
  World w;
  const std::string state = w.path("state");
  std::filesystem::create_directories(state);
  if (::unshare(CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", state.c_str(), "tmpfs", 0, "size=64k,mode=0700") != 0) {
    GTEST_SKIP() << "no private tmpfs (unshare or mount not permitted): " << std::strerror(errno);
  }
  struct Unmount {
    std::string path;
    ~Unmount() { ::umount2(path.c_str(), MNT_DETACH); }
  } unmount{state};
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "full", 1);  // also makes the sandbox key
  const std::string filler = state + "/filler";
  {
    std::ofstream out(filler, std::ios::binary);
    const std::string block(4096, 'x');
    for (int i = 0; i < 64 && out.write(block.data(), block.size()); ++i) out.flush();
  }
  Value reply = w.call(Request(
      "annotate", {{"annotations", Value{{"election", 1}}}, {"uuids", Value(Array{p.uuids[0]})}}));
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  EXPECT_NE(w.log().find("unable to save annotations:"), std::string::npos) << w.log();
  EXPECT_EQ(w.match().at(0)["annotations"]["election"].intValue(), 1);

  std::filesystem::remove(filler);
  const std::string saved = "saved annotations:" + AnnotationFile(w) + " after ";
  for (int i = 0; i < 300 && w.log().find(saved) == std::string::npos; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));  // a hang guard
  }
  EXPECT_NE(w.log().find(saved), std::string::npos) << w.log();
  ASSERT_TRUE(w.kill9()) << w.log();
  EXPECT_EQ(w.match().at(0)["annotations"]["election"].intValue(), 1) << w.log();
}

// ---------------------------------------------------------------- load

struct Tally {
  size_t sent = 0, replies = 0, strays = 0;
  bool lost = false;
};

// One client: `count` requests in pipelined batches of 8, mixing "match",
// "annotate", "lock" and its release, "access" and "ready"; every reply is
// matched to its request.
void RunClient(const std::string& socket, const PlugIns& p, int client, int count, Tally* tally) {
  Drm1Peer peer(socket);
  if (!peer.connected()) {
    tally->lost = true;
    return;
  }
  std::mt19937 random(static_cast<unsigned>(client));
  auto any = [&] { return std::uniform_int_distribution<size_t>(0, p.ids.size() - 1)(random); };
  std::optional<Value> hold;
  uint64_t serial = 0;
  for (int i = 0; i < count;) {
    std::set<uint64_t> waiting;
    for (int b = 0; b < 8 && i < count; ++b, ++i) {
      Value request;
      switch (i % 6) {
        case 0:
        case 5:
          request = Request("match");
          break;
        case 1:
          request =
              Request("annotate", {{"annotations", Value{{"extension", Value{{"c", client}}}}},
                                   {"uuids", Value(Array{p.uuids[any()]})}});
          break;
        case 2:
          if (hold) {
            request = Request("lock", {{"uuids", Value(Array{*hold})}});
            hold.reset();
          } else {
            request = Request(
                "lock", {{"flags", kHoldPlugIn}, {"paths", Value(Array{Value(p.paths[any()])})}});
          }
          break;
        case 3:
          request = Request("access", {{"uuids", Value(Array{p.uuids[any()]})}});
          break;
        case 4:
          request = Request("ready", {{"uuids", Value(Array{p.uuids[any()]})}});
          break;
      }
      if (!peer.send(++serial, request)) {
        tally->lost = true;
        return;
      }
      waiting.insert(serial);
      ++tally->sent;
    }
    while (!waiting.empty()) {
      // A hang guard, not a speed check.
      std::optional<drm1::Frame> frame = peer.receive(std::chrono::seconds(60));
      if (!frame) {
        tally->lost = true;
        return;
      }
      if (!frame->header.isReply() || waiting.erase(frame->header.replyTo) != 1) {
        ++tally->strays;
        continue;
      }
      ++tally->replies;
      if (frame->body["uuids"].isUuid()) hold = frame->body["uuids"];
    }
  }
}

// Complete frames that break the protocol, each closing its connection.
std::vector<std::string> MalformedFrames() {
  const std::string good = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Request("match"));
  auto patched = [&](size_t at, char byte) {
    std::string f = good;
    f[at] = byte;
    return f;
  };
  std::string arrayBody = good.substr(0, drm1::kHeaderSize);
  arrayBody[4] = 5;
  arrayBody[5] = arrayBody[6] = arrayBody[7] = 0;
  arrayBody += std::string("\x0a\x00\x00\x00\x00", 5);
  return {
      patched(0, 'X'),                     // bad magic
      patched(7, '\x7f'),                  // body longer than the limit
      patched(24, '\x04'),                 // unknown flag
      patched(drm1::kHeaderSize, '\x7f'),  // unknown tag
      patched(8, '\0'),                    // serial 0 (with the next bytes zero)
      arrayBody,                           // top level not a dictionary
      good.substr(0, drm1::kHeaderSize) + std::string(good.size() - drm1::kHeaderSize, '\xff'),
  };
}

TEST(ReliabilityTest, ConcurrentClientsGetEveryReplyWithoutLeaking) {
  World w;
  // ASan holds freed memory back in a quarantine (256 MiB by default), which
  // would look like growth; keep it small so the RSS figures mean something.
  ASSERT_TRUE(w.start({"ASAN_OPTIONS=quarantine_size_mb=4:detect_leaks=0"})) << w.log();
  const PlugIns p = RegisterPlugIns(w, "load", 6);
  const std::string socket = w.drd().socketPath();
  constexpr int kClients = 16;

  auto round = [&](int perClient, size_t* flooded, size_t* cycled) {
    std::atomic<bool> stop{false};
    std::atomic<size_t> floods{0}, cycles{0}, unclosed{0};
    std::thread flooder([&] {
      const std::vector<std::string> frames = MalformedFrames();
      for (size_t k = 0; !stop; ++k) {
        Drm1Peer bad(socket);
        if (!bad.connected() || !bad.sendRaw(frames[k % frames.size()])) continue;
        if (!bad.sawEndOfStream(std::chrono::seconds(30))) ++unclosed;
        ++floods;
      }
    });
    std::thread cycler([&] {
      for (uint64_t k = 1; !stop; ++k) {
        Drm1Peer brief(socket);
        if (k % 2) brief.send(k, Request("match"));  // gone before the reply
        ++cycles;
        // Paced: an unpaced loop queues thousands of connection events ahead
        // of everyone else's (see docs/reliability.md, "Load").
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
      }
    });
    std::vector<Tally> tallies(kClients);
    std::vector<std::thread> clients;
    for (int c = 0; c < kClients; ++c) {
      clients.emplace_back(RunClient, socket, std::cref(p), c, perClient, &tallies[c]);
    }
    for (std::thread& t : clients) t.join();
    stop = true;
    flooder.join();
    cycler.join();
    for (int c = 0; c < kClients; ++c) {
      EXPECT_FALSE(tallies[c].lost) << "client " << c << " lost its connection or a reply";
      EXPECT_EQ(tallies[c].replies, static_cast<size_t>(perClient)) << "client " << c;
      EXPECT_EQ(tallies[c].strays, 0u) << "client " << c;
    }
    EXPECT_EQ(unclosed, 0u) << "malformed frames left connections open";
    if (flooded) *flooded = floods;
    if (cycled) *cycled = cycles;
  };

  round(40, nullptr, nullptr);  // warm-up: caches, thread pools, allocator arenas
  const size_t warm = ResidentBytes(w.drd().pid());
  size_t flooded = 0, cycled = 0;
  round(300, &flooded, &cycled);
  ASSERT_TRUE(Alive(w.drd().pid())) << w.log();
  const size_t after = ResidentBytes(w.drd().pid());
  EXPECT_EQ(ErrorCode(w.call(Request("match"))), 0u);
  // A leak guard, not a measurement: the load must not leave the resident
  // set far above the warmed-up level (twice that, plus 16 MiB of slack).
  EXPECT_LE(after, 2 * warm + (16u << 20)) << "warm " << warm << ", after " << after;
  std::cout << kClients * 300 << " requests served; " << flooded << " malformed frames, " << cycled
            << " connect/disconnect cycles; VmRSS warm " << (warm >> 10) << " KiB, after "
            << (after >> 10) << " KiB\n";
}

// ---------------------------------------------------------------- hostile connections
//
// Peers of the user's own uid that try to stop drd for everyone else: floods
// of messages that want no reply, frames that decode to far more than their
// bytes, replayed serials, idle and half-sent connections, and descriptors
// run out. Each checks that drd's memory stays bounded or that another
// client is still answered within two seconds.

// A line of /proc/<pid>/status in bytes ("VmHWM", "VmRSS") or as a count
// ("Threads"); 0 if unknown.
size_t StatusField(pid_t pid, const std::string& field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind(field + ":", 0) == 0) {
      const size_t n = std::stoull(line.substr(field.size() + 1));
      return line.find("kB") != std::string::npos ? n * 1024 : n;
    }
  }
  return 0;
}

// Whether a fresh connection's "match" is answered within two seconds.
bool AnsweredPromptly(const std::string& socket) {
  Drm1Peer other(socket);
  return other.connected() && other.send(1, Request("match")) &&
         other.receive(std::chrono::seconds(2)).has_value();
}

size_t Occurrences(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

// ASan's quarantine of freed memory cut small, so that resident memory
// measures what drd holds.
const std::vector<std::string> kSmallQuarantine = {
    "ASAN_OPTIONS=quarantine_size_mb=4:detect_leaks=0"};

// Messages that want no reply count toward their connection's budget like
// requests: a peer sending them without pause is read only as fast as drd
// works them off, so drd's memory stays bounded.
TEST(ReliabilityTest, FloodsOfMessagesWithoutReplyStayWithinBudget) {
  World w;
  ASSERT_TRUE(w.start(kSmallQuarantine)) << w.log();
  const PlugIns p = RegisterPlugIns(w, "flood", 1);
  const std::string socket = w.drd().socketPath();
  const struct {
    const char* what;
    Value message;
  } rows[] = {
      {"1 MiB annotate",
       Request("annotate",
               {{"annotations", Value{{"extension", Value{{"blob", std::string(1 << 20, 'x')}}}}},
                {"uuids", Value(Array{p.uuids[0]})}})},
      {"small match", Request("match")},
  };
  for (const auto& row : rows) {
    const size_t before = StatusField(w.drd().pid(), "VmRSS");
    std::atomic<bool> stop{false};
    std::atomic<size_t> sent{0};
    Drm1Peer hog(socket);
    std::thread flood([&] {
      for (uint64_t serial = 1; !stop; ++sent) {
        if (!hog.sendRaw(*drm1::EncodeFrame(serial++, 0, 0, row.message))) return;
      }
    });
    size_t peak = before;
    for (int i = 0; i < 6; ++i) {
      std::this_thread::sleep_for(std::chrono::seconds(1));
      EXPECT_TRUE(AnsweredPromptly(socket)) << row.what << ", second " << i;
      peak = std::max(peak, StatusField(w.drd().pid(), "VmRSS"));
    }
    stop = true;
    ::shutdown(hog.fd(), SHUT_RDWR);  // unblocks a send drd does not take
    flood.join();
    // One connection holds at most 64 messages or 16 MiB of them, which
    // drd works off; before that bound the resident set grew by hundreds of
    // MiB within these seconds.
    EXPECT_LT(peak, before + (128u << 20));
    std::cout << row.what << ": " << sent << " sent in 6 s, VmRSS " << (before >> 20) << " -> "
              << (peak >> 20) << " MiB\n";
  }
  ASSERT_TRUE(Alive(w.drd().pid())) << w.log();
}

// A frame decodes to a bounded multiple of its bytes: past 1,048,576 values
// it is refused before the rest is made, and all connections together bring
// in a bounded amount at a time. Three peers each send a 16 MiB frame of
// nulls, which used to decode to about 680 MiB each.
TEST(ReliabilityTest, FramesOfMillionsOfValuesAreRefusedWithinBound) {
  World w;
  ASSERT_TRUE(w.start(kSmallQuarantine)) << w.log();
  const std::string socket = w.drd().socketPath();
  auto u32 = [](uint32_t v) { return std::string(reinterpret_cast<const char*>(&v), 4); };
  // {"k": [null, null, ...]}, 16 MiB in all.
  const uint32_t nulls = drm1::kMaxBodySize - 15;
  std::string frame = "DRM1" + u32(drm1::kMaxBodySize) + u32(1) + u32(0) + u32(0) + u32(0) +
                      u32(drm1::kFlagWantsReply) + u32(0);
  frame += "\x0b" + u32(1) + u32(1) + "k" + "\x0a" + u32(nulls) + std::string(nulls, '\0');
  ASSERT_EQ(frame.size(), drm1::kHeaderSize + drm1::kMaxBodySize);
  const size_t before = StatusField(w.drd().pid(), "VmRSS");
  constexpr int kPeers = 3;
  std::atomic<int> closed{0}, done{0};
  std::vector<std::thread> peers;
  for (int i = 0; i < kPeers; ++i) {
    peers.emplace_back([&] {
      Drm1Peer peer(socket);
      if (peer.sendRaw(frame) && peer.sawEndOfStream(std::chrono::seconds(60))) ++closed;
      ++done;
    });
  }
  while (done < kPeers) {
    EXPECT_TRUE(AnsweredPromptly(socket)) << done << " of the peers done";
    std::this_thread::sleep_for(std::chrono::milliseconds(250));
  }
  for (std::thread& t : peers) t.join();
  EXPECT_EQ(closed, kPeers);
  EXPECT_EQ(Occurrences(w.log(), "more than 1048576 values"), size_t{kPeers}) << w.log();
  const size_t peak = StatusField(w.drd().pid(), "VmHWM");
  EXPECT_LT(peak, before + (384u << 20));
  std::cout << "VmRSS before " << (before >> 20) << " MiB, VmHWM after " << (peak >> 20)
            << " MiB\n";
}

// A serial not above the one before breaks the protocol; gaps are allowed.
TEST(ReliabilityTest, SerialsThatDoNotIncreaseCloseTheConnection) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const struct {
    uint64_t first, second;
    bool closes;
  } rows[] = {{5, 5, true}, {5, 3, true}, {5, 9, false}};
  for (const auto& row : rows) {
    Drm1Peer peer(w.drd().socketPath());
    ASSERT_TRUE(peer.send(row.first, Request("match")));
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->header.replyTo, row.first);
    ASSERT_TRUE(peer.send(row.second, Request("match")));
    if (row.closes) {
      EXPECT_TRUE(peer.sawEndOfStream()) << row.second << " after " << row.first;
    } else {
      reply = peer.receive();
      ASSERT_TRUE(reply);
      EXPECT_EQ(reply->header.replyTo, row.second);
    }
  }
  EXPECT_TRUE(w.log().find("serial 3 not above the one before, 5") != std::string::npos) << w.log();
}

// A peer that stops in the middle of a frame is closed after 30 s, whether
// it stopped in the header or in the body; one idle between frames is kept
// as long as it likes and holds no thread of drd's.
TEST(ReliabilityTest, StalledFramesEndWhileIdleConnectionsStay) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const std::string socket = w.drd().socketPath();
  const size_t threads = StatusField(w.drd().pid(), "Threads");
  std::vector<std::unique_ptr<Drm1Peer>> idle;
  for (int i = 0; i < 100; ++i) {
    idle.push_back(std::make_unique<Drm1Peer>(socket));
    ASSERT_TRUE(idle.back()->send(1, Request("match")));
    ASSERT_TRUE(idle.back()->receive()) << i;
  }
  EXPECT_LE(StatusField(w.drd().pid(), "Threads"), threads + 4);
  const std::string frame = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Request("match"));
  Drm1Peer inHeader(socket), inBody(socket);
  ASSERT_TRUE(inHeader.sendRaw(frame.substr(0, 10)));
  ASSERT_TRUE(inBody.sendRaw(frame.substr(0, frame.size() - 1)));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(AnsweredPromptly(socket));
  EXPECT_TRUE(inHeader.sawEndOfStream(std::chrono::seconds(40)));
  EXPECT_TRUE(inBody.sawEndOfStream(std::chrono::seconds(5)));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(29));
  EXPECT_EQ(Occurrences(w.log(), "no byte for 30 s in the middle of a frame"), 2u) << w.log();
  for (size_t i = 0; i < idle.size(); i += 33) {
    ASSERT_TRUE(idle[i]->send(2, Request("match")));
    EXPECT_TRUE(idle[i]->receive(std::chrono::seconds(2))) << "idle connection " << i;
  }
}

// Soft limit of descriptors and hard limit of `pid`, from /proc.
std::pair<std::string, std::string> DescriptorLimits(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/limits");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("Max open files", 0) != 0) continue;
    std::istringstream fields(line.substr(14));
    std::string soft, hard;
    fields >> soft >> hard;
    return {soft, hard};
  }
  return {};
}

// drd raises its soft limit of descriptors to the hard one. Out of them all
// the same, it goes on serving the connections it has, says so once, waits
// instead of trying to accept again and again, and takes new peers again
// once descriptors are free.
TEST(ReliabilityTest, OutOfDescriptorsDrdServesItsConnectionsAndResumes) {
  struct rlimit mine {};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &mine), 0);
  if (mine.rlim_max <= 256) GTEST_SKIP() << "the hard limit of descriptors is too low";
  World w;
  struct rlimit low = mine;
  low.rlim_cur = 256;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &low), 0);
  const bool started = w.start();
  ::setrlimit(RLIMIT_NOFILE, &mine);
  ASSERT_TRUE(started) << w.log();
  const auto [soft, hard] = DescriptorLimits(w.drd().pid());
  EXPECT_EQ(soft, hard);

  const std::string socket = w.drd().socketPath();
  Drm1Peer early(socket);
  ASSERT_TRUE(early.send(1, Request("match")));
  ASSERT_TRUE(early.receive());
  const std::string limit = "prlimit --pid " + std::to_string(w.drd().pid()) + " --nofile=64:64";
  ASSERT_EQ(std::system(limit.c_str()), 0);
  std::vector<std::unique_ptr<Drm1Peer>> crowd;
  for (int i = 0; i < 80; ++i) crowd.push_back(std::make_unique<Drm1Peer>(socket));
  std::this_thread::sleep_for(std::chrono::seconds(3));
  ASSERT_TRUE(early.send(2, Request("match")));
  EXPECT_TRUE(early.receive(std::chrono::seconds(2))) << "an established client was not served";
  EXPECT_EQ(Occurrences(w.log(), "accept failed"), 1u) << w.log();
  crowd.clear();
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  bool served = false;
  while (!served && std::chrono::steady_clock::now() < deadline) served = AnsweredPromptly(socket);
  EXPECT_TRUE(served) << "no new peer was taken once descriptors were free";
  EXPECT_NE(w.log().find("accepting again"), std::string::npos) << w.log();
}

}  // namespace
}  // namespace dr::testing
