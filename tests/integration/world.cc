#include "tests/integration/world.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "platform/preferences.h"
#include "wire/drm1.h"
#include "wire/protocol.h"

namespace dr::testing {
namespace {

constexpr const char* kServiceName = "com.corvel.dromon.drd";

}  // namespace

Value Request(const std::string& name, Dictionary fields) {
  fields["request"] = Value(name);
  fields["version"] = Value(uint64_t{2});
  return Value(std::move(fields));
}

uint64_t ErrorCode(const Value& reply) { return reply["errorcode"].uintValue(); }
std::string ErrorText(const Value& reply) { return reply["error"].stringValue(); }
Value Uuids(Array list) { return Value(std::move(list)); }
size_t Occurrences(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

std::string RawU32(uint32_t n) {
  std::string out;
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<char>((n >> (8 * i)) & 0xFF));
  return out;
}
std::string RawKey(const std::string& key) {
  return RawU32(static_cast<uint32_t>(key.size())) + key;
}
std::string RawRequest(const std::string& body) {
  return "DRM1" + RawU32(static_cast<uint32_t>(body.size())) + RawU32(1) + RawU32(0) + RawU32(0) +
         RawU32(0) + RawU32(drm1::kFlagWantsReply) + RawU32(0) + body;
}
std::string NestedBody(int depth) {
  std::string body = "\x0B" + RawU32(1) + RawKey("a");
  for (int level = 2; level <= depth; ++level) body += "\x0A" + RawU32(level < depth ? 1 : 0);
  return body;
}

std::vector<std::pair<std::string, std::string>> BrokenFrames() {
  const std::string good = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Request("match"));
  auto with = [&](size_t at, const std::string& bytes) {
    return good.substr(0, at) + bytes + good.substr(at + bytes.size());
  };
  const std::string over = RawU32(drm1::kMaxBodySize + 1);
  return {
      {"bad magic", with(0, "X")},
      {"unknown flag", with(24, "\x05")},
      {"reply flag from a client", with(24, "\x03")},
      {"body length 16 MiB + 1, header only", with(4, over)},
      {"body length 16 MiB + 1, body sent",
       with(4, over) + std::string(drm1::kMaxBodySize + 1 - (good.size() - drm1::kHeaderSize), 0)},
      {"duplicate key",
       RawRequest("\x0B" + RawU32(2) + RawKey("request") + "\x02" + RawKey("request") + "\x01")},
      {"nesting depth 65", RawRequest(NestedBody(65))},
      {"count larger than the body", RawRequest("\x0B" + RawU32(1000))},
      {"unknown tag", with(drm1::kHeaderSize, "\x0C")},
      {"top level not a dictionary", with(drm1::kHeaderSize, "\x0A")},
      {"trailing bytes",
       with(4, RawU32(static_cast<uint32_t>(good.size() - drm1::kHeaderSize + 1))) +
           std::string(1, '\0')},
      {"serial zero", with(8, std::string(1, '\0'))},
  };
}

HostApp::HostApp(const std::string& appPath, const std::string& drdSocket,
                 const std::string& relayFolder, std::vector<std::string> launcher) {
  const std::string drd = DrdProcess::BinaryPath();  // <build>/daemon/drd
  const std::string program = appPath + "/Contents/Exec/host";
  std::filesystem::create_directories(appPath + "/Contents/Exec");
  std::filesystem::create_directories(relayFolder);
  std::filesystem::copy_file(drd.substr(0, drd.rfind("/daemon/")) + "/tests/drd_relay_host",
                             program, std::filesystem::copy_options::overwrite_existing);
  launcher.insert(launcher.end(), {program, drdSocket, relayFolder + "/" + kServiceName});
  child_ = std::make_unique<Child>(launcher[0],
                                   std::vector<std::string>(launcher.begin() + 1, launcher.end()),
                                   std::vector<std::string>{});
  if (child_->readLine() != "ready") return;
  Result<std::unique_ptr<client::Connection>> c =
      client::Connection::Open(kServiceName, relayFolder);
  if (c.ok()) connection_ = std::move(*c);
}

World::World() { std::filesystem::create_directories(root_ / "system"); }
World::~World() {
  if (serving_) stop();
}

bool World::start(std::vector<std::string> environment) {
  environment_ = std::move(environment);
  drd_ = std::make_unique<DrdProcess>(root_.path(), std::vector<std::string>{"-v"}, environment_);
  return serving_ = drd_->waitUntilServing();
}

bool World::stop() {
  manager_.reset();
  serving_ = false;
  drd_->signal(SIGTERM);
  return drd_->waitForExit() == 0;
}

std::string World::prefsFile() const {
  const std::string config = path("config");
  return CurrentHostPreferencesFile(
      PreferencesOptionsFromEnvironment([&](const char* name) -> const char* {
        return std::string_view(name) == "XDG_CONFIG_HOME" ? config.c_str() : ::getenv(name);
      }),
      "com.corvel.dromon.userprefs");
}

bool World::restart() { return stop() && start(environment_); }

bool World::kill9() {
  manager_.reset();
  drd_->signal(SIGKILL);
  drd_->waitForExit();
  return start(environment_);
}

std::unique_ptr<client::Connection> World::connect() const {
  Result<std::unique_ptr<client::Connection>> c =
      client::Connection::Open(kServiceName, root_ / "sockets");
  return c.ok() ? std::move(*c) : nullptr;
}

Value World::call(const Value& request, client::Connection* connection) const {
  std::unique_ptr<client::Connection> own;
  if (!connection) {
    own = connect();
    connection = own.get();
  }
  const Value failed{{"errorcode", Value(uint64_t{99999})}};
  if (!connection) return failed;
  Result<Value> reply = connection->request(request, std::chrono::seconds(20));
  return reply.ok() ? *reply : failed;
}

std::string World::makeApp(const std::string& path, const std::string& id,
                           const Value& entitlements) const {
  return registry_test::MakeBundle(root_ / path,
                                   Value{{"BNBundleIdentifier", Value(id)},
                                         {"BNBundleVersion", "1.0"},
                                         {"BNBundleExecutable", "host"},
                                         {"BNBundleName", Value(id)}},
                                   entitlements);
}

std::string World::makePlugIn(const std::string& path, const std::string& id,
                              const std::string& version, const Dictionary& extra,
                              const Value& entitlements) const {
  Dictionary granted = entitlements.dictionary();
  granted["com.corvel.security.app-sandbox"] = Value(true);
  Dictionary plugIn = extra;
  Value& point = plugIn["UXExtensionPointIdentifier"];
  if (!point.isPresent()) point = Value("com.example.point");
  Dictionary attributes = plugIn["UXExtensionAttributes"].dictionary();
  attributes["UXExtensionIdentifier"] = Value(id);
  attributes["UXExtensionPointName"] = plugIn["UXExtensionPointIdentifier"];
  plugIn["UXExtensionAttributes"] = Value(std::move(attributes));
  const std::string bundle =
      registry_test::MakeBundle(root_ / path,
                                Value{{"BNBundleIdentifier", Value(id + ".bundle")},
                                      {"BNBundleVersion", Value(version)},
                                      {"BNBundleExecutable", "run"},
                                      {"UXExtension", Value(std::move(plugIn))}},
                                Value(std::move(granted)));
  WriteTestFile(bundle + "/Contents/Exec/run", "#!/bin/sh\nexec sleep 60\n", 0755);
  return bundle;
}

Value World::add(const std::vector<std::string>& paths) const {
  Array list;
  for (const std::string& p : paths) list.emplace_back(p);
  return call(Request("add", {{"paths", Value(std::move(list))}}));
}

Value World::match(const Value& rules, uint64_t flags, client::Connection* connection) const {
  Dictionary fields{{"flags", Value(flags)}};
  if (rules.isPresent()) fields["rules"] = rules;
  Value reply = call(Request("match", std::move(fields)), connection);
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  return reply["matches"];
}

std::string World::Identifiers(const Value& matches) {
  std::vector<std::string> ids;
  for (const Value& form : matches.array()) ids.push_back(form["identifier"].stringValue());
  std::sort(ids.begin(), ids.end());
  std::string text;
  for (const std::string& id : ids) text += (text.empty() ? "" : " ") + id;
  return text;
}

Value World::everything() const {
  if (!manager_) {
    makeApp("Manager.app", "com.example.manager",
            Value{{"com.corvel.private.dromon.manager", true}});
    manager_ = host("Manager.app");
  }
  return match(Value(), message::kDiscoverAll, manager_->connection());
}

Value World::uuidOf(const std::string& id) const {
  const Value forms = everything();
  for (const Value& form : forms.array()) {
    if (form["identifier"].stringValue() == id) {
      return Value(Uuid::parse(form["uuid"].stringValue()));
    }
  }
  ADD_FAILURE() << "no plug-in " << id << " registered";
  return Value();
}

std::unique_ptr<HostApp> World::host(const std::string& app,
                                     std::vector<std::string> launcher) const {
  static int count = 0;
  auto h =
      std::make_unique<HostApp>(root_ / app, drd_->socketPath(),
                                root_ / ("relays/" + std::to_string(++count)), std::move(launcher));
  EXPECT_NE(h->connection(), nullptr) << "host " << app << " did not connect";
  return h;
}

}  // namespace dr::testing
