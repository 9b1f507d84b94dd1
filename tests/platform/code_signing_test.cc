// Entitlements of real processes, found from the bundle their executable
// lies in, and sandbox detection built on them.
#include "platform/code_signing.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/pdoc.h"
#include "platform/sandbox.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::RunningProgram;
using testing::TempFolder;
using testing::WriteTestFile;

constexpr const char* kEntitlement = "com.example.test-entitlement";

// Makes <root>/<name>/Contents/{Exec/tool, Entitlements.pdoc}; `entitlements`
// is written as given (raw bytes) unless empty.
std::string MakeBundle(const TempFolder& root, const std::string& name,
                       const std::string& entitlementsBytes) {
  std::string bundle = root / name;
  if (!entitlementsBytes.empty()) {
    EXPECT_TRUE(WriteTestFile(bundle + "/Contents/Entitlements.pdoc", entitlementsBytes));
  }
  return bundle + "/Contents/Exec/tool";
}

std::string Pdoc(const Value& v) { return pdoc::WriteXml(v).value(); }

TEST(CodeSigningTest, ProcessGetsTheEntitlementsOfTheBundleItRunsFrom) {
  TempFolder root;
  struct Case {
    const char* what;
    std::string executable;
    bool readable;
    Value expected;
  } cases[] = {
      {"bundle with entitlements",
       MakeBundle(root, "A.appex", Pdoc(Value{{kEntitlement, Value("granted")}})), true,
       Value("granted")},
      {"bundle without an entitlements file", MakeBundle(root, "B.appex", ""), true, Value()},
      {"free-standing program", root / "bin/tool", true, Value()},
      {"program in an Exec folder that is no bundle's", root / "Exec/tool", true, Value()},
      {"broken entitlements file", MakeBundle(root, "C.appex", "<pdoc><dict><key>x"), false,
       Value()},
      {"entitlements that are not a dictionary",
       MakeBundle(root, "D.appex", Pdoc(Value(Array{Value(kEntitlement)}))), false, Value()},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    RunningProgram program(c.executable);
    ASSERT_GT(program.pid(), 0);
    auto task = CodeSigning::Default()->taskForPid(program.pid());
    EXPECT_EQ(task->pid(), program.pid());
    Result<Value> value = task->entitlementValue(kEntitlement);
    ASSERT_EQ(value.ok(), c.readable) << (value.ok() ? "" : value.error().description());
    if (value.ok()) {
      EXPECT_EQ(*value, c.expected) << value->description();
    }
  }
}

TEST(CodeSigningTest, EntitlementsAreReadWhenTheTaskIsMadeNotLater) {
  TempFolder root;
  std::string exe = MakeBundle(root, "A.appex", Pdoc(Value{{kEntitlement, Value(true)}}));
  RunningProgram program(exe);
  auto task = CodeSigning::Default()->taskForPid(program.pid());
  // Neither a changed file nor the process ending changes what was granted.
  ASSERT_TRUE(
      WriteTestFile(root / "A.appex/Contents/Entitlements.pdoc", Pdoc(Value::EmptyDictionary())));
  EXPECT_EQ(task->entitlementValue(kEntitlement).value(), Value(true));
}

TEST(CodeSigningTest, ProcessThatIsGoneHasNoReadableEntitlements) {
  pid_t pid = ::fork();
  if (pid == 0) ::_exit(0);
  ::waitpid(pid, nullptr, 0);
  EXPECT_FALSE(CodeSigning::Default()->taskForPid(pid)->entitlementValue(kEntitlement).ok());
}

TEST(CodeSigningTest, EntitlementIsHeldWhenPresentAndNotFalse) {
  struct Case {
    Value value;
    bool held;
  } cases[] = {
      {Value(), false},
      {Value(false), false},
      {Value(0), false},
      {Value(0.0), false},
      {Value(true), true},
      {Value(1), true},
      {Value(2), true},
      {Value("NO"), true},
      {Value(""), true},
      {Value::EmptyArray(), true},
      {Value::EmptyDictionary(), true},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(IsEntitlementHeld(c.value), c.held) << c.value.description();
  }
}

TEST(SandboxTest, ProcessIsSandboxedByEntitlementOrFlatpak) {
  TempFolder root;
  std::string confined =
      MakeBundle(root, "Confined.appex", Pdoc(Value{{kAppSandboxEntitlement, Value(true)}}));
  std::string stringValue =
      MakeBundle(root, "String.appex", Pdoc(Value{{kAppSandboxEntitlement, Value("no")}}));
  std::string refused =
      MakeBundle(root, "False.appex", Pdoc(Value{{kAppSandboxEntitlement, Value(false)}}));
  std::string broken = MakeBundle(root, "Broken.appex", "not a pdoc");
  struct Case {
    const char* what;
    std::string executable;
    bool flatpak;
    bool sandboxed;
  } cases[] = {
      {"entitlement true", confined, false, true},
      {"entitlement held as a string", stringValue, false, true},
      {"entitlement false", refused, false, false},
      {"free-standing program", root / "bin/plain", false, false},
      {"free-standing program in a Flatpak", root / "bin/flat", true, true},
      {"unreadable entitlements count as confined", broken, false, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    RunningProgram program(c.executable);
    ASSERT_GT(program.pid(), 0);
    // The Flatpak marker is looked up under a /proc of the test's making.
    SandboxOptions options;
    options.keyPath = root / "keys/sandbox.key";
    options.procRoot = root / "proc";
    ASSERT_TRUE(
        WriteTestFile(options.procRoot + "/" + std::to_string(program.pid()) + "/root/x", ""));
    if (c.flatpak) {
      ASSERT_TRUE(WriteTestFile(
          options.procRoot + "/" + std::to_string(program.pid()) + "/root/.flatpak-info", ""));
    }
    auto sandbox = MakeLinuxSandbox(options, CodeSigning::Default());
    EXPECT_EQ(sandbox->isSandboxed(program.pid()), c.sandboxed);
  }
}

}  // namespace
}  // namespace dr
