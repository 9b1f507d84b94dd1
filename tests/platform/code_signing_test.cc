// Entitlements of real processes, found from the bundle their executable
// lies in, and sandbox detection built on them.
#include "platform/code_signing.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include "pdoc/pdoc.h"
#include "platform/sandbox.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::RunningProgram;
using testing::TempFolder;
using testing::WriteTestFile;

constexpr const char* kEntitlement = "com.example.test-entitlement";

// The executable of bundle <root>/<name>, whose Contents/Entitlements.pdoc
// holds `bytes` (no file when empty).
std::string MakeBundle(const TempFolder& root, const std::string& name, const std::string& bytes) {
  if (!bytes.empty()) {
    EXPECT_TRUE(WriteTestFile(root / name + "/Contents/Entitlements.pdoc", bytes));
  }
  return root / name + "/Contents/Exec/tool";
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
    EXPECT_EQ(value.value_or(Value()), c.expected);
  }

  // What was granted is read when the task is made: a later change of the
  // file does not alter it.
  RunningProgram program(cases[0].executable);
  auto task = CodeSigning::Default()->taskForPid(program.pid());
  ASSERT_TRUE(
      WriteTestFile(root / "A.appex/Contents/Entitlements.pdoc", Pdoc(Value::EmptyDictionary())));
  EXPECT_EQ(task->entitlementValue(kEntitlement).value(), Value("granted"));

  // A process that is gone has no readable entitlements.
  pid_t gone = ::fork();
  if (gone == 0) ::_exit(0);
  ::waitpid(gone, nullptr, 0);
  EXPECT_FALSE(CodeSigning::Default()->taskForPid(gone)->entitlementValue(kEntitlement).ok());
}

TEST(CodeSigningTest, EntitlementIsHeldWhenPresentAndNotFalse) {
  struct Case {
    Value value;
    bool held;
  } cases[] = {{Value(), false},    {Value(false), false}, {Value(0), false},
               {Value(0.0), false}, {Value(true), true},   {Value(2), true},
               {Value("NO"), true}, {Value(""), true},     {Value::EmptyArray(), true}};
  for (const Case& c : cases) {
    EXPECT_EQ(IsEntitlementHeld(c.value), c.held) << c.value.description();
  }
}

TEST(SandboxTest, ProcessIsSandboxedByEntitlementOrFlatpak) {
  TempFolder root;
  auto bundle = [&](const char* name, const Value& held) {
    return MakeBundle(root, name, Pdoc(Value{{kAppSandboxEntitlement, held}}));
  };
  struct Case {
    const char* what;
    std::string executable;
    bool flatpak;
    bool sandboxed;
  } cases[] = {
      {"entitlement true", bundle("Confined.appex", Value(true)), false, true},
      {"entitlement held as a string", bundle("String.appex", Value("no")), false, true},
      {"entitlement false", bundle("False.appex", Value(false)), false, false},
      {"free-standing program", root / "bin/plain", false, false},
      {"free-standing program in a Flatpak", root / "bin/flat", true, true},
      {"unreadable entitlements count as confined", MakeBundle(root, "Broken.appex", "not a pdoc"),
       false, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    RunningProgram program(c.executable);
    ASSERT_GT(program.pid(), 0);
    // The Flatpak marker is looked up under a /proc of the test's making.
    SandboxOptions options;
    options.keyPath = root / "keys/sandbox.key";
    options.procRoot = root / "proc";
    const std::string procRoot = options.procRoot + "/" + std::to_string(program.pid()) + "/root/";
    ASSERT_TRUE(WriteTestFile(procRoot + (c.flatpak ? ".flatpak-info" : "x"), ""));
    EXPECT_EQ(MakeLinuxSandbox(options, CodeSigning::Default())->isSandboxed(program.pid()),
              c.sandboxed);
  }
}

}  // namespace
}  // namespace dr
