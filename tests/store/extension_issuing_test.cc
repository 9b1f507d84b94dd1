// Read extensions for plug-in files, issued by the real sandbox.
#include "store/extension_issuing.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::FakeCodeSigning;
using testing::TempFolder;
using testing::WriteTestFile;

TEST(ExtensionIssuingTest, IssuesReadTokensForExistingPathsOnly) {
  TempFolder folder;
  SandboxOptions options;
  options.keyPath = folder / "run/sandbox.key";
  FakeCodeSigning signing;
  auto sandbox = MakeLinuxSandbox(options, &signing);

  std::string bundle = folder / "Ünïcode Plug-in.appex";
  ASSERT_TRUE(WriteTestFile(bundle + "/Contents/Info.pdoc", "{}"));
  std::optional<std::string> token = issueReadExtensionForURL(sandbox.get(), bundle + "/");
  ASSERT_TRUE(token.has_value());
  EXPECT_EQ(token->find('\0'), std::string::npos);
  EXPECT_EQ(consumeExtension(*token, options).value_or(""), bundle);

  errno = 0;
  EXPECT_FALSE(issueReadExtensionForURL(sandbox.get(), folder / "gone.appex").has_value());
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace
}  // namespace dr
