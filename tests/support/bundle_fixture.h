// Real bundles in a fresh temporary folder (removed when destroyed), and
// environment variables set for the life of a test, for the plug-in model.
#pragma once

#include <optional>
#include <string>

#include "core/value.h"
#include "tests/support/process_fixtures.h"

namespace dr::test {

class BundleFixture {
 public:
  BundleFixture();
  ~BundleFixture();
  BundleFixture(const BundleFixture&) = delete;
  BundleFixture& operator=(const BundleFixture&) = delete;

  const std::string& root() const { return root_.path(); }
  // root()/relative
  std::string path(const std::string& relative) const;

  // Makes the bundle folder root()/relative with Contents/Info.pdoc holding
  // `info` (no file when absent); with `executable`, also an executable file
  // Contents/Exec/<executable>. Answers the bundle's path.
  std::string makeBundle(const std::string& relative, const Value& info,
                         const std::optional<std::string>& executable = std::nullopt);
  // Writes `value` as a pdoc file at root()/relative (parents made).
  std::string writePdoc(const std::string& relative, const Value& value);
  // Writes raw bytes at root()/relative (parents made).
  std::string writeFile(const std::string& relative, const std::string& bytes);
  // Makes the folder root()/relative and its parents.
  std::string makeFolder(const std::string& relative);

 private:
  testing::TempFolder root_;
};

class ScopedEnv {
 public:
  // Sets `name` to `value`, or clears it when `value` is absent.
  ScopedEnv(std::string name, const std::optional<std::string>& value);
  ~ScopedEnv();
  ScopedEnv(const ScopedEnv&) = delete;
  ScopedEnv& operator=(const ScopedEnv&) = delete;

 private:
  std::string name_;
  std::optional<std::string> previous_;
};

}  // namespace dr::test
