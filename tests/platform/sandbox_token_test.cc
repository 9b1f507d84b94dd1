// File extension tokens: issued, consumed, and refused when tampered with;
// the key file made safely by racing processes.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/sandbox.h"
#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::FakeCodeSigning;
using testing::TempFolder;
using testing::WriteTestFile;

class SandboxTokenTest : public ::testing::Test {
 protected:
  SandboxTokenTest() {
    options_.keyPath = folder_ / "run/dromon/sandbox.key";
    sandbox_ = MakeLinuxSandbox(options_, &signing_);
  }

  std::string issue(const std::string& path, std::string_view cls = kReadOnlyFileExtensionClass) {
    Result<std::string> token = sandbox_->issueFileExtension(cls, path, kExtensionCanonicalPath);
    EXPECT_TRUE(token.ok()) << token.error().description();
    return token.value_or("");
  }

  // A token for the folder from a new issuer, as after drd restarted.
  Result<std::string> issueAnew() {
    return MakeLinuxSandbox(options_, &signing_)
        ->issueFileExtension(kReadOnlyFileExtensionClass, folder_.path(), kExtensionCanonicalPath);
  }

  TempFolder folder_;
  SandboxOptions options_;
  FakeCodeSigning signing_;
  std::unique_ptr<Sandbox> sandbox_;
};

TEST_F(SandboxTokenTest, TokenGrantsTheCanonicalPathEvenWhenNotAscii) {
  std::string file = folder_ / "Plüg-ins ☃/Wïdget;1.appex";
  ASSERT_TRUE(WriteTestFile(file + "/Contents/Info.pdoc", "{}"));
  ASSERT_EQ(::symlink((folder_ / "Plüg-ins ☃").c_str(), (folder_ / "link").c_str()), 0);
  const std::string canonical = std::filesystem::canonical(file);

  std::string token = issue(folder_ / "link/./Wïdget;1.appex");
  for (unsigned char c : token) EXPECT_TRUE(c >= 0x20 && c < 0x7f) << token;
  Result<std::string> granted = consumeExtension(token, options_);
  ASSERT_TRUE(granted.ok()) << granted.error().description();
  EXPECT_EQ(*granted, canonical);
}

// The bytes of a token under a known key, against HMAC-SHA256 worked out
// apart from drd: a key file outlives drd, so a token's spelling must not
// drift between versions.
TEST_F(SandboxTokenTest, TokenBytesUnderAKnownKey) {
  ASSERT_EQ(::mkdir((folder_ / "run").c_str(), 0700), 0);
  ASSERT_EQ(::mkdir((folder_ / "run/dromon").c_str(), 0700), 0);
  std::string key;
  for (char i = 0; i < 32; ++i) key += i;
  ASSERT_TRUE(WriteTestFile(options_.keyPath, key, 0600));
  struct Case {
    std::string path;
    std::string token;
  } cases[] = {
      {"/p/Plüg;in.appex",
       "drx1;file.read-only;2f702f506cc3bc673b696e2e6170706578;"
       "ad506c309b8fefaeec25a5e23c463f3d0851fa6d3cc8ef3e01389f3fb825d065"},
      {"/",
       "drx1;file.read-only;2f;78b04ba9b15eff5e5f912d099b321710477a26fc7dd1dce43bad6ac23661d540"},
  };
  for (const Case& c : cases) {
    Result<std::string> token =
        sandbox_->issueFileExtension(kReadOnlyFileExtensionClass, c.path, /*flags=*/0);
    ASSERT_TRUE(token.ok()) << token.error().description();
    EXPECT_EQ(*token, c.token);
    EXPECT_EQ(consumeExtension(*token, options_).value_or(""), c.path);
  }
}

TEST_F(SandboxTokenTest, AlteredAndReadWriteTokensAreRefused) {
  ASSERT_TRUE(WriteTestFile(folder_ / "a/file", "x"));
  ASSERT_TRUE(WriteTestFile(folder_ / "b/other", "x"));
  std::string token = issue(folder_ / "a/file");
  std::string other = issue(folder_ / "b/other");
  ASSERT_TRUE(consumeExtension(token, options_).ok());

  std::vector<std::string> refused;
  // Every single byte changed, to a hex digit and to a separator.
  for (size_t i = 0; i < token.size(); ++i) {
    for (char replacement : {'0', 'f', ';', 'A'}) {
      std::string t = token;
      if (t[i] == replacement) continue;
      t[i] = replacement;
      refused.push_back(t);
    }
  }
  // Every shortened form.
  for (size_t n = 0; n < token.size(); ++n) refused.push_back(token.substr(0, n));
  // One token's path with the other's signature.
  size_t tokenMac = token.rfind(';'), otherMac = other.rfind(';');
  refused.push_back(other.substr(0, otherMac) + token.substr(tokenMac));
  // Appended bytes, and things that are no token at all.
  refused.push_back(token + ";");
  refused.push_back(token + "00");
  refused.push_back("");
  refused.push_back("drx1;;;");
  refused.push_back(std::string(100000, 'a'));

  for (const std::string& t : refused) {
    EXPECT_FALSE(consumeExtension(t, options_).ok()) << "accepted: " << t;
  }
  // A genuine token of another class is refused as such.
  Result<std::string> granted =
      consumeExtension(issue(folder_ / "a/file", "file.read-write"), options_);
  ASSERT_FALSE(granted.ok());
  EXPECT_EQ(granted.error().domain(), kSandboxErrorDomain);
  EXPECT_EQ(granted.error().code(), kExtensionWrongClass);
}

TEST_F(SandboxTokenTest, IssuingFailsWithTheErrnoOfResolvingThePath) {
  struct Case {
    std::string path;
    std::string_view cls;
    uint32_t flags;
    int error;
  } cases[] = {
      {folder_ / "missing", kReadOnlyFileExtensionClass, kExtensionCanonicalPath, ENOENT},
      {"", kReadOnlyFileExtensionClass, kExtensionCanonicalPath, ENOENT},
      {"relative/path", kReadOnlyFileExtensionClass, 0, EINVAL},
      {folder_.path(), "bad;class", kExtensionCanonicalPath, EINVAL},
      {folder_.path(), "", kExtensionCanonicalPath, EINVAL},
  };
  for (const Case& c : cases) {
    Result<std::string> token = sandbox_->issueFileExtension(c.cls, c.path, c.flags);
    ASSERT_FALSE(token.ok()) << c.path;
    EXPECT_EQ(token.error().domain(), kPosixErrorDomain);
    EXPECT_EQ(token.error().code(), c.error) << c.path;
  }
}

TEST_F(SandboxTokenTest, KeyFileIsPrivateOutlivesTheIssuerAndIsRefusedOnceExposed) {
  std::string token = issue(folder_.path());
  struct stat st;
  ASSERT_EQ(::stat(options_.keyPath.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
  EXPECT_EQ(st.st_size, 32);
  ASSERT_EQ(::stat((folder_ / "run/dromon").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  // A new issuer reads the same key...
  EXPECT_EQ(issueAnew().value_or(""), token);
  // ...but not once others could read it, nor after it is gone.
  ASSERT_EQ(::chmod(options_.keyPath.c_str(), 0644), 0);
  EXPECT_FALSE(consumeExtension(token, options_).ok());
  EXPECT_FALSE(issueAnew().ok());
  ASSERT_EQ(::unlink(options_.keyPath.c_str()), 0);
  EXPECT_FALSE(consumeExtension(token, options_).ok());
}

TEST_F(SandboxTokenTest, AKeyAtTheFormerPlaceIsMovedOnceAndOnlyWhenSafe) {
  // Tokens issued with a key at the former place stay valid after the move.
  SandboxOptions former = options_;
  former.keyPath = folder_ / "sockets/sandbox.key";
  const std::string token =
      MakeLinuxSandbox(former, &signing_)
          ->issueFileExtension(kReadOnlyFileExtensionClass, folder_.path(), kExtensionCanonicalPath)
          .value_or("");
  ASSERT_FALSE(token.empty());
  options_.formerKeyPath = former.keyPath;
  EXPECT_EQ(issueAnew().value_or(""), token);
  EXPECT_TRUE(consumeExtension(token, options_).ok());
  EXPECT_FALSE(std::filesystem::exists(former.keyPath));

  // A former key others could read is not trusted: a new key is made.
  ASSERT_EQ(::unlink(options_.keyPath.c_str()), 0);
  ASSERT_TRUE(WriteTestFile(former.keyPath, std::string(32, 'k')));
  ASSERT_EQ(::chmod(former.keyPath.c_str(), 0644), 0);
  EXPECT_NE(issueAnew().value_or(token), token);
  EXPECT_TRUE(std::filesystem::exists(former.keyPath));
}

TEST_F(SandboxTokenTest, ProcessesMakingTheKeyAtOnceAgreeOnIt) {
  constexpr int kProcesses = 8;
  int start[2], results[2];
  ASSERT_EQ(::pipe(start), 0);
  ASSERT_EQ(::pipe(results), 0);
  std::vector<pid_t> children;
  for (int i = 0; i < kProcesses; ++i) {
    pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      ::close(start[1]);
      char go;
      if (::read(start[0], &go, 1) != 0) ::_exit(2);  // wait until the parent lets all go
      const std::string line = issueAnew().value_or("") + "\n";
      const bool ok = line.size() > 1 && ::write(results[1], line.data(), line.size()) ==
                                             static_cast<ssize_t>(line.size());
      ::_exit(ok ? 0 : 1);
    }
    children.push_back(pid);
  }
  ::close(start[0]);
  ::close(start[1]);  // releases every child at once
  ::close(results[1]);
  for (pid_t pid : children) {
    int status;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  std::string all;
  char buf[4096];
  for (ssize_t n; (n = ::read(results[0], buf, sizeof buf)) > 0;) all.append(buf, n);
  ::close(results[0]);
  std::string first = all.substr(0, all.find('\n'));
  std::string expected;
  for (int i = 0; i < kProcesses; ++i) expected += first + "\n";
  EXPECT_EQ(all, expected);
  EXPECT_TRUE(consumeExtension(first, options_).ok());
}

}  // namespace
}  // namespace dr
