// Read extensions for plug-in files, issued by the real sandbox.
#include "store/extension_issuing.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cerrno>

#include "platform/file_system.h"

#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::FakeCodeSigning;
using testing::TempFolder;
using testing::WriteTestFile;

TEST(ExtensionIssuingTest, IssuesReadTokensWithinTheRegisteredBundleOnly) {
  TempFolder folder;
  SandboxOptions options;
  options.keyPath = folder / "run/sandbox.key";
  FakeCodeSigning signing;
  auto sandbox = MakeLinuxSandbox(options, &signing);

  const std::string root = CanonicalPath(folder / ".").value_or("");
  const std::string bundle = root + "/Ünïcode Plug-in.appex";
  ASSERT_TRUE(WriteTestFile(bundle + "/Contents/Info.pdoc", "{}"));
  Result<std::string> token = issueReadExtensionForURL(sandbox.get(), bundle + "/", bundle);
  ASSERT_TRUE(token.ok());
  EXPECT_EQ(token->find('\0'), std::string::npos);
  EXPECT_EQ(consumeExtension(*token, options).value_or(""), bundle);

  // A bundle gone, or its folder swapped for a link to elsewhere: no token.
  const std::string gone = root + "/gone.appex";
  const std::string swapped = root + "/swapped.appex";
  ASSERT_EQ(::symlink(root.c_str(), swapped.c_str()), 0);
  const struct {
    std::string path, registered;
    int errnum;
  } refused[] = {
      {gone, gone, ENOENT},
      {swapped, swapped, EACCES},
      {bundle + "/..", bundle, EACCES},
  };
  for (const auto& row : refused) {
    Result<std::string> refusal = issueReadExtensionForURL(sandbox.get(), row.path, row.registered);
    ASSERT_FALSE(refusal.ok()) << row.path;
    EXPECT_EQ(refusal.error().code(), row.errnum) << row.path;
  }
}

}  // namespace
}  // namespace dr
