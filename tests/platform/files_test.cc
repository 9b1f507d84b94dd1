#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "platform/file_system.h"
#include "platform/notifications.h"
#include "platform/pdoc_file.h"
#include "platform/policy.h"
#include "platform/sandbox.h"
#include "platform/usage_reports.h"
#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/registry_bundles.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using namespace testing;
using registry_test::ReadBytes;
using registry_test::WriteBytes;
using Names = std::vector<std::string>;

Names NamesIn(const std::string& folder) {
  Names names;
  for (const auto& e : std::filesystem::directory_iterator(folder))
    names.push_back(e.path().filename());
  std::sort(names.begin(), names.end());
  return names;
}

int64_t CodeOf(const Status& s) { return s.ok() ? 0 : s.error().code(); }

TEST(FileSystemTest, RefusesWhatItCannotWriteOrReadWhole) {
  TempFolder dir;
  FileSystem* fs = FileSystem::Default();
  ASSERT_TRUE(fs->makeDirectories(dir / "a/b", 0700).ok() &&
              fs->writeFileAtomically(dir / "plain", "plain").ok());
  EXPECT_EQ(registry_test::ModeOf(dir / "a"), 0700u);
  for (const char* path : {"a", "plain/state"}) {  // a folder in the way; no temporary can be made
    EXPECT_EQ(CodeOf(fs->writeFileAtomically(dir / path, "x")), kFileWriteError) << path;
    EXPECT_EQ(CodeOf(fs->replaceFile(dir / path, "x")), kFileWriteError) << path;
  }
  for (const char* path : {"plain", "plain/d"})
    EXPECT_EQ(CodeOf(fs->makeDirectories(dir / path)), kFileWriteError);
  EXPECT_EQ(NamesIn(dir.path()), (Names{"a", "plain"}));
  EXPECT_EQ(NamesIn(dir / "a"), Names{"b"});
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);  // no writer: opening it may block
  const std::pair<const char*, int64_t> reads[] = {{"plain/below", kFileReadError},
                                                   {"missing/below", kFileReadNoSuchFileError},
                                                   {"a", kFileReadNoSuchFileError},
                                                   {"fifo", kFileReadNoSuchFileError},
                                                   {"plain", kFileReadError}};
  for (const auto& [name, code] : reads)
    EXPECT_EQ(CodeOf(fs->readFile(dir / name, 4).status()), code) << name;
  EXPECT_EQ(fs->readFile(dir / "plain", 5).value_or(""), "plain");
}

// Left by a crash between making a temporary and renaming it.
TEST(FileSystemTest, RemovesOnlyTheLeftoverTemporariesOfItsTarget) {
  TempFolder dir;
  const std::string tmp = "Annotations.tmp-", uuid = "0F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F9";
  const Names removed = {tmp + uuid, tmp + "0f1e2d3c-4b5a-4978-8695-a4b3c2d1e0f9"};
  for (const std::string& name : Names{removed[0], removed[1], "Annotations", tmp + uuid + "x", tmp,
                                       "Other.tmp-" + uuid, "X" + tmp + uuid})
    WriteBytes(dir / name, "partial");
  std::filesystem::create_directory(dir / (tmp + "1F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F9"));
  std::filesystem::create_symlink(dir / "Annotations",
                                  dir / (tmp + "2F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F9"));
  EXPECT_EQ(FileSystem::Default()->removeLeftoverTemporaries(dir / "Annotations").value_or(0), 2u);
  EXPECT_EQ(NamesIn(dir.path()).size(), 7u);
  for (const std::string& name : removed) EXPECT_FALSE(std::filesystem::exists(dir / name)) << name;
  EXPECT_EQ(
      FileSystem::Default()->removeLeftoverTemporaries(dir / "missing/Annotations").value_or(9),
      0u);
}

// Tokens grant, and the registry compares, canonical paths.
TEST(FileSystemTest, CanonicalPathResolvesAsRealpath) {
  TempFolder dir;
  WriteBytes(dir / "real/Plug.appex/Contents/Info.pdoc", "{}");
  std::filesystem::create_directory_symlink("real", dir / "link");
  ASSERT_EQ(::mkfifo((dir / "real/fifo").c_str(), 0600), 0);  // must not block
  const std::string plugIn = dir / "real/Plug.appex";
  const std::tuple<std::string, std::string, int> rows[] = {
      {dir / "link/Plug.appex/", plugIn, 0},
      {dir.path() + "//real/./Plug.appex/Contents/..", plugIn, 0},
      {dir / "real/fifo", dir / "real/fifo", 0},
      {"/", "/", 0},
      {dir / "real/missing", "", ENOENT},
      {dir / "real/Plug.appex/Contents/Info.pdoc/x", "", ENOTDIR},
      {"", "", ENOENT},
      {std::string("/tm\0p", 5), "", EINVAL},
  };
  for (const auto& [path, canonical, error] : rows) {
    Result<std::string> resolved = CanonicalPath(path);
    EXPECT_EQ(resolved.value_or(""), canonical) << path;
    EXPECT_EQ(CodeOf(resolved.status()), error) << path;
  }
}

TEST(NotificationsTest, CountsContinueAndOnlyPlainNamesArePosted) {
  TempFolder folder;
  WriteBytes(folder / "n", "41\n");
  WriteBytes(folder / "garbage", "not a number\n");
  auto center = MakeFileNotificationCenter(NotificationOptions{folder.path()});
  for (const auto& [name, count] : std::map<std::string, uint64_t>{{"garbage", 1}, {"n", 42}}) {
    ASSERT_TRUE(center->post(name).ok());
    EXPECT_EQ(ReadBytes(folder / name), std::to_string(count) + "\n");
  }
  for (const std::string& name :
       {std::string(), std::string("."), std::string(".."), std::string("a/b"),
        std::string("nul\0x", 5), std::string(300, 'n')})
    EXPECT_EQ(CodeOf(center->post(name)), EINVAL) << name;
}

// A FIFO in place of the file (read or not) is refused, not waited on.
TEST(UsageReportsTest, LinesStayWholeAndOnlyRegularFilesAreWritten) {
  TempFolder folder;
  UsageReportOptions options{folder / "usage.log"};
  std::vector<pid_t> children;
  for (int p = 0; p < 4; ++p) {
    if (children.emplace_back(::fork()) == 0) {
      auto reports = MakeUsageReports(options);
      for (int i = 0; i < 200; ++i)
        reports->sendReport("d", 5, {{"p", std::to_string(p)}, {"v", std::string(3000, 'v')}});
      ::_exit(0);
    }
  }
  for (pid_t pid : children) ::waitpid(pid, nullptr, 0);
  std::istringstream lines(ReadBytes(*options.logPath));
  int count = 0;
  for (std::string line; std::getline(lines, line); ++count)
    ASSERT_TRUE(nlohmann::json::accept(line)) << count;
  EXPECT_EQ(count, 800);
  ScopedLogCapture log;
  MakeUsageReports({})->sendReport("d", 5, {{"k", "bad \xff"}});
  EXPECT_EQ(log.lines(),
            Names{R"(usage report: {"domain": "d", "level": 5, "keys": {"k": "bad �"}})"});
  ASSERT_EQ(::unlink(options.logPath->c_str()) + ::mkfifo(options.logPath->c_str(), 0600), 0);
  for (bool reader : {false, true}) {
    const int fd = reader ? ::open(options.logPath->c_str(), O_RDONLY | O_NONBLOCK) : -1;
    MakeUsageReports(options)->sendReport("d", 5, {{"k", "v"}});
    EXPECT_TRUE(log.contains("cannot append usage report to " + *options.logPath)) << reader;
    if (fd >= 0) ::close(fd);
  }
}

TEST(PolicyTest, DeniesByIdentifierAndKeepsTheLastGoodPolicy) {
  TempFolder folder;
  PolicyOptions options{folder / "policy.pdoc"};
  auto policy = MakeFilePolicy(options);
  EXPECT_TRUE(policy->mayHostUsePlugIn("h", "com.example.bad"));  // no file
  ASSERT_TRUE(pdoc::WriteFile(
                  options.path,
                  Value{{"DeniedPlugIns", Value(Array{Value("com.example.bad"), Value(7)})},
                        {"DeniedPlugInsByHost",
                         Value{{"com.example.host", Value(Array{Value("com.example.private")})}}}})
                  .ok());
  const std::string bundle = folder / "Host.app";
  WriteBytes(bundle + "/Contents/Info.pdoc", R"({"BNBundleIdentifier": "com.example.host"})");
  testing::RunningProgram host(bundle + "/Contents/Exec/host"), loose(folder / "bin/loose");
  const std::tuple<pid_t, const char*, bool> rows[] = {{host.pid(), "com.example.private", false},
                                                       {loose.pid(), "com.example.private", true},
                                                       {loose.pid(), "com.example.bad", false}};
  for (const auto& [pid, plugIn, allowed] : rows)
    EXPECT_EQ(policy->mayProcessUsePlugIn(pid, plugIn), allowed) << pid << plugIn;
  ScopedLogCapture log;
  for (const std::string& broken :
       {std::string("<pdoc><dict><key>x"), pdoc::WriteXml(Value(Array{})).value()}) {
    WriteBytes(options.path, broken);
    EXPECT_FALSE(policy->mayHostUsePlugIn("h", "com.example.bad"));
    EXPECT_FALSE(policy->mayHostUsePlugIn("h", "com.example.bad"));
  }
  EXPECT_EQ(log.lines().size(), 2u);
  EXPECT_TRUE(log.contains(options.path));
  EXPECT_TRUE(MakeFilePolicy(options)->mayHostUsePlugIn("h", "com.example.bad"))
      << "starts out broken";
  ASSERT_EQ(::unlink(options.path.c_str()), 0);
  EXPECT_TRUE(policy->mayHostUsePlugIn("h", "com.example.bad"));
}

// Flatpak markers are looked up under a /proc of the test's making.
TEST(CodeSigningTest, ProcessGetsTheEntitlementsOfItsBundleAndIsSandboxedByThem) {
  TempFolder root;
  auto pdoc = [](const Value& v) {
    return pdoc::WriteXml(Value{{kAppSandboxEntitlement, v}}).value();
  };
  const std::tuple<const char*, std::string, bool, bool, Value, bool> rows[] = {
      {"A.appex", pdoc(Value(true)), false, true, Value(true), true},
      {"C.appex", pdoc(Value(false)), false, true, Value(false), false},
      {"D.appex", "", true, true, Value(), true},
      {"F.appex", "<pdoc><dict><key>x", false, false, Value(), true},  // unreadable: confined
      {"G.appex", pdoc::WriteXml(Value(Array{})).value(), false, false, Value(), true},
  };
  for (const auto& [bundle, bytes, flatpak, readable, held, sandboxed] : rows) {
    SCOPED_TRACE(bundle);
    ASSERT_TRUE(bytes.empty() ||
                WriteTestFile(root / bundle + "/Contents/Entitlements.pdoc", bytes));
    RunningProgram program(root / bundle + "/Contents/Exec/tool");
    ASSERT_GT(program.pid(), 0);
    auto task = CodeSigning::Default()->taskForPid(program.pid());
    EXPECT_EQ(task->pid(), program.pid());
    Result<Value> value = task->entitlementValue(kAppSandboxEntitlement);
    ASSERT_EQ(value.ok(), readable);
    EXPECT_EQ(value.value_or(Value()), held);
    SandboxOptions options{root / "keys/sandbox.key", "", root / "proc"};
    const std::string procRoot = options.procRoot + "/" + std::to_string(program.pid()) + "/root/";
    ASSERT_TRUE(WriteTestFile(procRoot + (flatpak ? ".flatpak-info" : "x"), ""));
    EXPECT_EQ(MakeLinuxSandbox(options, CodeSigning::Default())->isSandboxed(program.pid()),
              sandboxed);
  }
}

class SandboxTokenTest : public ::testing::Test {
 protected:
  // A token for `path` from a new issuer (as after drd restarted).
  Result<std::string> issueAnew(const std::string& path,
                                std::string_view cls = kReadOnlyFileExtensionClass,
                                uint32_t flags = kExtensionCanonicalPath) {
    return MakeLinuxSandbox(options_, &signing_)->issueFileExtension(cls, path, flags);
  }
  std::string issue(const std::string& path, std::string_view cls = kReadOnlyFileExtensionClass) {
    return issueAnew(path, cls).value_or("");
  }

  TempFolder folder_;
  SandboxOptions options_{folder_ / "run/dromon/sandbox.key"};
  testing::FakeCodeSigning signing_;
};

// Against HMAC-SHA256 worked out apart from drd: a key outlives drd.
TEST_F(SandboxTokenTest, TokenBytesUnderAKnownKey) {
  std::string key;
  for (char i = 0; i < 32; ++i) key += i;
  ASSERT_TRUE(WriteTestFile(options_.keyPath, key, 0600));
  const std::pair<std::string, std::string> rows[] = {
      {"/p/Plüg;in.appex",
       "drx1;file.read-only;2f702f506cc3bc673b696e2e6170706578;"
       "ad506c309b8fefaeec25a5e23c463f3d0851fa6d3cc8ef3e01389f3fb825d065"},
      {"/",
       "drx1;file.read-only;2f;78b04ba9b15eff5e5f912d099b321710477a26fc7dd1dce43bad6ac23661d540"},
  };
  for (const auto& [path, token] : rows) {
    EXPECT_EQ(issueAnew(path, kReadOnlyFileExtensionClass, 0).value_or(""), token);
    EXPECT_EQ(consumeExtension(token, options_).value_or(""), path);
  }
}

TEST_F(SandboxTokenTest, AlteredAndReadWriteTokensAreRefusedAndBadPathsNotIssued) {
  ASSERT_TRUE(WriteTestFile(folder_ / "a/file", "x") && WriteTestFile(folder_ / "b/other", "x"));
  const std::string token = issue(folder_ / "a/file"), other = issue(folder_ / "b/other");
  ASSERT_TRUE(consumeExtension(token, options_).ok());
  // Each byte changed, shortened forms, one's path with the other's signature.
  std::vector<std::string> refused = {
      other.substr(0, other.rfind(';')) + token.substr(token.rfind(';')),
      token + ";",
      token + "00",
      "",
      "drx1;;;",
      std::string(100000, 'a')};
  for (size_t i = 0; i < token.size(); ++i) {
    refused.push_back(token.substr(0, i));
    for (char replacement : {'0', 'f', ';', 'A'}) {
      if (token[i] != replacement)
        refused.push_back(token.substr(0, i) + replacement + token.substr(i + 1));
    }
  }
  for (const std::string& t : refused)
    EXPECT_FALSE(consumeExtension(t, options_).ok()) << "accepted: " << t;
  Result<std::string> granted =
      consumeExtension(issue(folder_ / "a/file", "file.read-write"), options_);
  ASSERT_FALSE(granted.ok());
  EXPECT_EQ(granted.error().domain() + std::to_string(granted.error().code()),
            kSandboxErrorDomain + std::to_string(kExtensionWrongClass));
  // Issuing fails with the errno of resolving the path.
  const std::tuple<std::string, std::string_view, uint32_t, int> rows[] = {
      {folder_ / "missing", kReadOnlyFileExtensionClass, kExtensionCanonicalPath, ENOENT},
      {"", kReadOnlyFileExtensionClass, kExtensionCanonicalPath, ENOENT},
      {"relative/path", kReadOnlyFileExtensionClass, 0, EINVAL},
      {folder_.path(), "bad;class", kExtensionCanonicalPath, EINVAL},
      {folder_.path(), "", kExtensionCanonicalPath, EINVAL},
  };
  for (const auto& [path, cls, flags, error] : rows) {
    Result<std::string> token = issueAnew(path, cls, flags);
    EXPECT_EQ(token.ok() ? 0 : token.error().code(), error) << path;
  }
}

TEST_F(SandboxTokenTest, KeyFileIsPrivateAndAFormerOneMovesOnlyWhenSafe) {
  SandboxOptions former = options_;
  former.keyPath = folder_ / "sockets/sandbox.key";
  const std::string token =
      MakeLinuxSandbox(former, &signing_)
          ->issueFileExtension(kReadOnlyFileExtensionClass, folder_.path(), kExtensionCanonicalPath)
          .value_or("");
  ASSERT_FALSE(token.empty());
  options_.formerKeyPath = former.keyPath;
  EXPECT_EQ(issue(folder_.path()), token);
  EXPECT_FALSE(std::filesystem::exists(former.keyPath));
  EXPECT_EQ(ReadBytes(options_.keyPath).size(), 32u);
  EXPECT_EQ(registry_test::ModeOf(options_.keyPath) + registry_test::ModeOf(folder_ / "run/dromon"),
            0600u + 0700u);
  ASSERT_EQ(::chmod(options_.keyPath.c_str(), 0644), 0);
  EXPECT_FALSE(consumeExtension(token, options_).ok());
  EXPECT_FALSE(issueAnew(folder_.path()).ok());
  ASSERT_EQ(::unlink(options_.keyPath.c_str()), 0);
  EXPECT_FALSE(consumeExtension(token, options_).ok());
  // A former key others could read is not trusted: a new key is made.
  ASSERT_TRUE(WriteTestFile(former.keyPath, std::string(32, 'k')));
  ASSERT_EQ(::chmod(former.keyPath.c_str(), 0644), 0);
  EXPECT_NE(issue(folder_.path()), token);
  EXPECT_TRUE(std::filesystem::exists(former.keyPath));
}

TEST_F(SandboxTokenTest, ProcessesMakingTheKeyAtOnceAgreeOnIt) {
  int start[2];
  ASSERT_EQ(::pipe(start), 0);
  std::vector<pid_t> children;
  for (int i = 0; i < 8; ++i) {
    if (children.emplace_back(::fork()) == 0) {
      char go;
      ::close(start[1]);
      ::_exit(::read(start[0], &go, 1) == 0 &&
                      WriteTestFile(folder_ / std::to_string(i), issue(folder_.path()))
                  ? 0
                  : 1);
    }
  }
  ::close(start[0]);
  ::close(start[1]);  // releases every child at once
  const std::string first = issue(folder_.path());
  for (int i = 0; i < 8; ++i) {
    int status = -1;
    ::waitpid(children[i], &status, 0);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(ReadBytes(folder_ / std::to_string(i)), first) << i;
  }
  EXPECT_TRUE(consumeExtension(first, options_).ok());
}

}  // namespace
}  // namespace dr
