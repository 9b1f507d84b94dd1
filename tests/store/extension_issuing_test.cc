// Read extensions for plug-in files, issued by the real sandbox.
#include "store/extension_issuing.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cerrno>
#include <tuple>

#include "platform/file_system.h"

#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::FakeCodeSigning;
using testing::TempFolder;
using testing::WriteTestFile;

// A bundle gone, its folder swapped for a link to elsewhere, or a path that
// leaves the registered bundle: no token, and the error says why.
TEST(ExtensionIssuingTest, IssuesReadTokensWithinTheRegisteredBundleOnly) {
  TempFolder folder;
  SandboxOptions options{.keyPath = folder / "run/sandbox.key"};
  FakeCodeSigning signing;
  auto sandbox = MakeLinuxSandbox(options, &signing);
  const std::string root = CanonicalPath(folder / ".").value_or("");
  const std::string bundle = root + "/\u00dcn\u00efcode Plug-in.appex";
  ASSERT_TRUE(WriteTestFile(bundle + "/Contents/Info.pdoc", "{}"));
  Result<std::string> token = issueReadExtensionForURL(sandbox.get(), bundle + "/", bundle);
  ASSERT_TRUE(token.ok());
  EXPECT_EQ(consumeExtension(*token, options).value_or(""), bundle);
  EXPECT_EQ(token->find('\0'), std::string::npos);
  const std::string gone = root + "/gone.appex", swapped = root + "/swapped.appex";
  ASSERT_EQ(::symlink(root.c_str(), swapped.c_str()), 0);
  const std::tuple<std::string, std::string, int> refused[] = {
      {gone, gone, ENOENT}, {swapped, swapped, EACCES}, {bundle + "/..", bundle, EACCES}};
  for (const auto& [path, registered, errnum] : refused) {
    Result<std::string> refusal = issueReadExtensionForURL(sandbox.get(), path, registered);
    ASSERT_FALSE(refusal.ok()) << path;
    EXPECT_EQ(refusal.error().code(), errnum) << path;
  }
  EXPECT_EQ(issueReadExtensionForURL(nullptr, bundle, bundle).error().code(), ENOKEY);
}

}  // namespace
}  // namespace dr
