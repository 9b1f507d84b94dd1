#include <signal.h>
#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "core/utf8.h"
#include "platform/file_system.h"
#include "platform/pdoc_file.h"
#include "tests/integration/world.h"
#include "wire/drm1.h"

namespace dr::testing {
namespace {

using namespace std::chrono_literals;
using registry_test::WriteBytes;

// A small ASan quarantine, so that resident memory measures what drd holds.
const std::vector<std::string> kSmallQuarantine = {
    "ASAN_OPTIONS=quarantine_size_mb=4:detect_leaks=0"};

std::string AnnotationFile(const World& w) { return w.path("state/com.corvel.dromon/Annotations"); }

// A /proc/<pid>/status field in bytes ("VmRSS") or as a count ("Threads"); 0 if unknown.
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

// Running, not exited: an unreaped drd is a zombie ("Z") in /proc.
bool Alive(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("State:", 0) == 0) return line.find('Z') == std::string::npos;
  }
  return false;
}

// Whether a fresh connection's "match" is answered within two seconds.
bool AnsweredPromptly(const std::string& socket) {
  Drm1Peer other(socket);
  return other.send(1, Request("match")) && other.receive(2s).has_value();
}

// Plug-ins "com.example.<prefix><i>" on the system volume, registered.
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
  for (const Value forms = w.everything(); const Value& form : forms.array()) {
    byId[form["identifier"].stringValue()] = Value(Uuid::parse(form["uuid"].stringValue()));
  }
  for (const std::string& id : p.ids) p.uuids.push_back(byId[id]);
  return p;
}

Value Annotate(const Value& annotations, const Value& uuid) {
  return Request("annotate", {{"annotations", annotations}, {"uuids", Value(Array{uuid})}});
}

// Acknowledged "annotate" (extension n = k on plug-in k % count) and "add" requests survive
// SIGKILL at random moments: each plug-in holds its last acknowledged (or in-flight) value.
TEST(ReliabilityTest, AcknowledgedChangesSurviveKill9) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  constexpr int kPlugIns = 8, kKills = 4, kPerRound = 20;
  const PlugIns p = RegisterPlugIns(w, "ann", kPlugIns);
  const unsigned seed = std::random_device{}();
  std::cout << "random seed " << seed << "\n";  // to replay a failing run
  std::mt19937 random(seed);
  std::vector<int64_t> acked(kPlugIns, -1), inFlight(kPlugIns, -1);
  int64_t next = 0;
  std::set<std::string> registered;
  for (int kill = 0; kill < kKills; ++kill) {
    std::vector<std::pair<std::string, std::string>> bundles;  // identifier, path
    for (int i = 0; i < kPerRound; ++i) {
      const std::string name = "reg" + std::to_string(kill) + "_" + std::to_string(i);
      bundles.emplace_back("com.example." + name,
                           w.makePlugIn("system/" + name + ".appex", "com.example." + name));
    }
    std::unique_ptr<client::Connection> c1 = w.connect(), c2 = w.connect();
    ASSERT_TRUE(c1 && c2);
    std::atomic<int> annotations{0}, registrations{0};
    std::thread annotator([&] {
      for (;;) {
        const int k = static_cast<int>(next % kPlugIns);
        inFlight[k] = next;
        if (ErrorCode(w.call(Annotate(Value{{"extension", Value{{"n", next}}}}, p.uuids[k]),
                             c1.get())) != 0) {
          return;  // drd is gone
        }
        acked[k] = next++;
        ++annotations;
      }
    });
    std::thread adder([&] {
      for (const auto& [id, path] : bundles) {
        if (ErrorCode(w.call(Request("add", {{"paths", Value(Array{Value(path)})}}), c2.get())) !=
            0) {
          return;
        }
        registered.insert(id);
        ++registrations;
      }
    });
    while ((annotations == 0 || registrations == 0) && Alive(w.drd().pid())) {
      std::this_thread::sleep_for(5ms);
    }
    std::this_thread::sleep_for(
        std::chrono::milliseconds(std::uniform_int_distribution<int>(0, 250)(random)));
    ASSERT_TRUE(w.kill9()) << w.log();
    annotator.join();
    adder.join();

    Result<Value> file = pdoc::ReadFile(AnnotationFile(w));
    ASSERT_TRUE(file.ok()) << "kill " << kill << ": " << file.error().description();
    EXPECT_EQ((*file)["version"].intValue(), 16);
    std::map<std::string, int64_t> stored;
    for (const Value forms = w.match(); const Value& form : forms.array()) {
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
    for (const std::string& id : registered) EXPECT_EQ(stored.count(id), 1u) << kill << id;
  }
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
  std::erase(names, "sandbox.key");
  EXPECT_EQ(names, (std::vector<std::string>{"Annotations", "Annotations.tmp-keep"}));
  ASSERT_EQ(ErrorCode(w.call(Request("access", {{"uuids", Value(Array{p.uuids[0]})}}))), 0u);
  const std::pair<std::string, mode_t> modes[] = {
      {w.path("sockets"), 0700},
      {folder, 0700},
      {AnnotationFile(w), 0600},
      {folder + "/sandbox.key", 0600},
  };
  for (const auto& [path, mode] : modes) {
    struct stat st {};
    EXPECT_EQ(::stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0, mode) << path;
  }
}

// Annotation folder replaced by a file: the request succeeds, memory keeps the change, and the
// save is retried once the folder is back, so the change survives a crash.
TEST(ReliabilityTest, UnwritableAnnotationFolderKeepsChangesAndRetries) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const PlugIns p = RegisterPlugIns(w, "fault", 2);
  const std::string folder = w.path("state/com.corvel.dromon");
  std::filesystem::remove_all(folder);
  WriteBytes(folder, "not a folder");
  Value reply = w.call(Annotate(Value{{"election", 1}}, p.uuids[0]));
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  EXPECT_NE(w.log().find("unable to save annotations:" + AnnotationFile(w) + " error:"),
            std::string::npos)
      << w.log();
  auto elected = [&] {
    std::string ids;
    for (const Value forms = w.match(); const Value& form : forms.array()) {
      if (form["annotations"]["election"].intValue() == 1) ids += form["identifier"].stringValue();
    }
    return ids;
  };
  EXPECT_EQ(elected(), p.ids[0]);

  std::filesystem::remove(folder);
  std::filesystem::create_directory(folder);
  const std::string saved = "saved annotations:" + AnnotationFile(w) + " after ";
  for (int i = 0; i < 300 && w.log().find(saved) == std::string::npos; ++i) {
    std::this_thread::sleep_for(100ms);  // a hang guard
  }
  EXPECT_NE(w.log().find(saved), std::string::npos) << w.log();
  ASSERT_TRUE(w.kill9()) << w.log();
  EXPECT_EQ(elected(), p.ids[0]);
}

// A registry database locked by another process: a clear error reply, drd stays up, then succeeds.
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
  EXPECT_EQ(ErrorCode(w.add({path})), 0u);
  EXPECT_EQ(w.match().size(), 2u);
}

// Garbage in SDK dictionaries, preferences and the annotation file: drd stays up.
TEST(ReliabilityTest, GarbageFilesDoNotStopDrd) {
  World w;
  const std::string rows[] = {
      std::string("\0\x01\x02\xff\xfe garbage", 14),
      "<?xml version=\"1.0\"?><pdoc><dict><key>UXExtension",
      std::string(100000, '['),
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
    SCOPED_TRACE(n);
    WriteBytes(w.path("data/dromon/SDKs/com.example.point.pdoc"), garbage);
    WriteBytes(w.prefsFile(), garbage);
    const std::string id = "com.example.garbage" + std::to_string(n);
    EXPECT_NE(ErrorCode(w.add({w.makePlugIn("system/g" + std::to_string(n++) + ".appex", id)})),
              99999u);
    EXPECT_EQ(ErrorCode(w.call(Request("match"))), 0u);
    ASSERT_TRUE(Alive(w.drd().pid())) << w.log();
  }
}

// A FIFO as a bundle file or entitlements: refused as missing, read as none; others answered.
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
    Drm1Peer peer(w.drd().socketPath());
    ASSERT_TRUE(peer.send(1, request));
    std::optional<drm1::Frame> reply = peer.receive(2s);
    ASSERT_TRUE(reply) << request.description() << " got no answer\n" << w.log();
    EXPECT_EQ(ErrorCode(reply->body), 0u) << ErrorText(reply->body);
  }
  std::optional<drm1::Frame> added = adder.receive(2s);
  ASSERT_TRUE(added) << "\"add\" got no answer\n" << w.log();
  EXPECT_EQ(ErrorCode(added->body), 2u) << ErrorText(added->body);
  EXPECT_NE(w.log().find("(no Contents/Info.pdoc)"), std::string::npos) << w.log();
  EXPECT_EQ(World::Identifiers(w.match(Value(), 0, host->connection())), "com.example.fifo0");
}

// A bundle whose canonical path is not UTF-8 is refused, so that every "match" can still be sent.
TEST(ReliabilityTest, PlugInThatCannotTravelNeverBreaksDiscovery) {
  World w;
  ASSERT_TRUE(w.start()) << w.log();
  const std::string odd = w.makePlugIn("system/odd\xff.appex", "com.example.odd");
  const std::string link = w.path("system/link.appex");
  ASSERT_EQ(::symlink(odd.c_str(), link.c_str()), 0);
  const std::string escaped = EscapeInvalidUtf8(*CanonicalPath(odd));
  EXPECT_EQ(ErrorText(w.add({link})), "unable to register plug-in at " + escaped);
  EXPECT_NE(w.log().find(escaped + "\" is not UTF-8"), std::string::npos) << w.log();
  EXPECT_EQ(ErrorCode(w.call(Request("match"))), 0u);
  EXPECT_TRUE(IsValidUtf8(w.log())) << w.log();
}

// `count` mixed requests pipelined 8 at a time; the replies matched to requests (0 if one is lost).
size_t RunClient(const std::string& socket, const PlugIns& p, int client, int count) {
  Drm1Peer peer(socket);
  std::mt19937 random(static_cast<unsigned>(client));
  Value hold;
  uint64_t serial = 0;
  size_t replies = 0;
  for (int i = 0; i < count;) {
    std::set<uint64_t> waiting;
    for (int b = 0; b < 8 && i < count; ++b, ++i) {
      const Value uuids(Array{p.uuids[random() % p.uuids.size()]});
      const Value requests[] = {
          Request("match"),
          Request("annotate",
                  {{"annotations", Value{{"extension", Value{{"c", client}}}}}, {"uuids", uuids}}),
          hold.isUuid()
              ? Request("lock", {{"uuids", Value(Array{hold})}})
              : Request("lock", {{"flags", 2}, {"paths", Value(Array{Value(p.paths[0])})}}),
          Request("access", {{"uuids", uuids}}),
          Request("ready", {{"uuids", uuids}}),
          Request("match"),
      };
      if (i % 6 == 2) hold = Value();
      if (!peer.send(++serial, requests[i % 6])) return 0;
      waiting.insert(serial);
    }
    while (!waiting.empty()) {
      std::optional<drm1::Frame> frame = peer.receive(60s);  // a hang guard
      if (!frame || !frame->header.isReply() || waiting.erase(frame->header.replyTo) != 1) {
        return 0;
      }
      ++replies;
      if (frame->body["uuids"].isUuid()) hold = frame->body["uuids"];
    }
  }
  return replies;
}

// Many clients get every reply among malformed frames and leaving peers; memory stays bounded.
TEST(ReliabilityTest, ConcurrentClientsGetEveryReplyWithoutLeaking) {
  World w;
  ASSERT_TRUE(w.start(kSmallQuarantine)) << w.log();
  const PlugIns p = RegisterPlugIns(w, "load", 6);
  const std::string socket = w.drd().socketPath();
  constexpr int kClients = 16;
  auto round = [&](int perClient) {
    std::atomic<bool> stop{false};
    std::atomic<size_t> unclosed{0};
    std::thread flooder([&] {
      const auto frames = BrokenFrames();
      for (size_t k = 0; !stop; ++k) {
        Drm1Peer bad(socket);
        if (bad.sendRaw(frames[k % frames.size()].second) && !bad.sawEndOfStream(30s)) ++unclosed;
      }
    });
    std::thread leaver([&] {
      for (uint64_t k = 1; !stop; ++k) {
        Drm1Peer brief(socket);
        for (uint64_t s = 1; s <= k % 20; ++s) brief.send(s, Request("match"));  // gone at once
        // Paced: unpaced, it queues thousands of connection events ahead of everyone else's.
        std::this_thread::sleep_for(2ms);
      }
    });
    std::vector<size_t> replies(kClients);
    std::vector<std::thread> clients;
    for (int c = 0; c < kClients; ++c) {
      clients.emplace_back([&, c] { replies[c] = RunClient(socket, p, c, perClient); });
    }
    for (std::thread& t : clients) t.join();
    stop = true;
    flooder.join();
    leaver.join();
    EXPECT_EQ(replies, std::vector<size_t>(kClients, perClient)) << "lost or stray replies";
    EXPECT_EQ(unclosed, 0u) << "malformed frames left connections open";
  };
  round(40);  // warm-up: caches, thread pools, allocator arenas
  const size_t warm = StatusField(w.drd().pid(), "VmRSS");
  round(300);
  ASSERT_TRUE(Alive(w.drd().pid())) << w.log();
  const size_t after = StatusField(w.drd().pid(), "VmRSS");
  EXPECT_EQ(ErrorCode(w.call(Request("match"))), 0u);
  // A leak guard, not a measurement.
  EXPECT_LE(after, 2 * warm + (16u << 20)) << "warm " << warm << ", after " << after;
}

// Own-uid peers try to stall drd while another client must be answered within 2 s: 100 idle
// connections hold no thread; a frame stalled mid-header or mid-body is closed after 30 s; floods
// of no-reply messages are read only as fast as worked off (memory bounded), unread replies stall
// nobody; 16 MiB frames of nulls are refused past 1,048,576 values.
TEST(ReliabilityTest, HostileConnectionsStallNobody) {
  World w;
  ASSERT_TRUE(w.start(kSmallQuarantine)) << w.log();
  const PlugIns p = RegisterPlugIns(w, "flood", 1);
  const std::string socket = w.drd().socketPath();
  const pid_t drd = w.drd().pid();
  const size_t threads = StatusField(drd, "Threads");
  std::vector<std::unique_ptr<Drm1Peer>> idle;
  for (int i = 0; i < 100; ++i) {
    idle.push_back(std::make_unique<Drm1Peer>(socket));
    ASSERT_TRUE(idle.back()->send(1, Request("match")));
    ASSERT_TRUE(idle.back()->receive()) << i;
  }
  EXPECT_LE(StatusField(drd, "Threads"), threads + 4);
  const std::string match = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Request("match"));
  Drm1Peer inHeader(socket), inBody(socket);
  ASSERT_TRUE(inHeader.sendRaw(match.substr(0, 10)));
  ASSERT_TRUE(inBody.sendRaw(match.substr(0, match.size() - 1)));
  const auto stalled = std::chrono::steady_clock::now();

  const struct {
    const char* what;
    Value message;
    uint32_t flags;
    bool bounded;  // queued replies may hold up to 64 MiB
  } rows[] = {
      {"1 MiB annotate",
       Annotate(Value{{"extension", Value{{"blob", std::string(1 << 20, 'x')}}}}, p.uuids[0]), 0,
       true},
      {"small match", Request("match"), 0, true},
      {"replies never read", Request("frobnicate"), drm1::kFlagWantsReply, false},
  };
  for (const auto& row : rows) {
    const size_t before = StatusField(drd, "VmRSS");
    std::atomic<bool> stop{false};
    std::atomic<size_t> sent{0};
    Drm1Peer hog(socket);
    std::thread flood([&] {
      for (uint64_t serial = 1; !stop; ++sent) {
        if (!hog.sendRaw(*drm1::EncodeFrame(serial++, 0, row.flags, row.message))) return;
      }
    });
    size_t peak = before;
    for (int i = 0; i < 6; ++i) {
      std::this_thread::sleep_for(1s);
      EXPECT_TRUE(AnsweredPromptly(socket)) << row.what << ", second " << i;
      peak = std::max(peak, StatusField(drd, "VmRSS"));
    }
    stop = true;
    ::shutdown(hog.fd(), SHUT_RDWR);  // unblocks a send drd does not take
    flood.join();
    EXPECT_GT(sent, 0u) << row.what;
    if (row.bounded) {
      EXPECT_LT(peak, before + (128u << 20)) << row.what;
    }
  }

  const uint32_t nulls = drm1::kMaxBodySize - 15;  // {"k": [null, ...]}, 16 MiB in all
  const std::string frame = RawRequest("\x0b" + RawU32(1) + RawKey("k") + "\x0a" + RawU32(nulls) +
                                       std::string(nulls, '\0'));
  const size_t before = StatusField(drd, "VmRSS");
  std::atomic<int> closed{0}, done{0};
  std::vector<std::thread> peers;
  for (int i = 0; i < 3; ++i) {
    peers.emplace_back([&] {
      Drm1Peer peer(socket);
      if (peer.sendRaw(frame) && peer.sawEndOfStream(60s)) ++closed;
      ++done;
    });
  }
  while (done < 3) {
    EXPECT_TRUE(AnsweredPromptly(socket)) << done << " of the peers done";
    std::this_thread::sleep_for(250ms);
  }
  for (std::thread& t : peers) t.join();
  EXPECT_EQ(closed, 3);
  EXPECT_EQ(Occurrences(w.log(), "more than 1048576 values"), 3u) << w.log();
  EXPECT_LT(StatusField(drd, "VmHWM"), before + (384u << 20));

  EXPECT_TRUE(inHeader.sawEndOfStream(40s));
  EXPECT_TRUE(inBody.sawEndOfStream(5s));
  EXPECT_GE(std::chrono::steady_clock::now() - stalled, 29s);
  EXPECT_EQ(Occurrences(w.log(), "no byte for 30 s in the middle of a frame"), 2u) << w.log();
  for (size_t i = 0; i < idle.size(); i += 33) {
    ASSERT_TRUE(idle[i]->send(2, Request("match")));
    EXPECT_TRUE(idle[i]->receive(2s)) << "idle connection " << i;
  }
}

// Out of descriptors (after raising its soft limit), drd serves its connections, logs once, waits
// instead of spinning on accept, and takes new peers once descriptors are free.
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
  const std::string pid = std::to_string(w.drd().pid());
  Child limits("/usr/bin/prlimit",
               {"--pid", pid, "--nofile", "--output", "SOFT,HARD", "--noheadings"}, {});
  limits.wait();
  std::istringstream fields(limits.out());
  std::string soft, hard;
  fields >> soft >> hard;
  EXPECT_EQ(soft, hard) << limits.out();

  const std::string socket = w.drd().socketPath();
  Drm1Peer early(socket);
  ASSERT_TRUE(early.send(1, Request("match")));
  ASSERT_TRUE(early.receive());
  ASSERT_EQ(std::system(("prlimit --pid " + pid + " --nofile=64:64").c_str()), 0);
  std::vector<std::unique_ptr<Drm1Peer>> crowd;
  for (int i = 0; i < 80; ++i) crowd.push_back(std::make_unique<Drm1Peer>(socket));
  std::this_thread::sleep_for(3s);
  ASSERT_TRUE(early.send(2, Request("match")));
  EXPECT_TRUE(early.receive(2s)) << "an established client was not served";
  EXPECT_EQ(Occurrences(w.log(), "accept failed"), 1u) << w.log();
  crowd.clear();
  EXPECT_TRUE(Eventually([&] { return AnsweredPromptly(socket); }))
      << "no new peer was taken once descriptors were free";
  EXPECT_NE(w.log().find("accepting again"), std::string::npos) << w.log();
}

}  // namespace
}  // namespace dr::testing
