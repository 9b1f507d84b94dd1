// Real bundles in a temporary folder, and environment variables set for a test's life.
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
  std::string path(const std::string& relative) const;

  // root()/relative with Contents/Info.pdoc holding `info` (none when absent) and, with
  // `executable`, Contents/Exec/<executable>; the bundle's path.
  std::string makeBundle(const std::string& relative, const Value& info,
                         const std::optional<std::string>& executable = std::nullopt);
  std::string writePdoc(const std::string& relative, const Value& value);
  std::string writeFile(const std::string& relative, const std::string& bytes);
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
