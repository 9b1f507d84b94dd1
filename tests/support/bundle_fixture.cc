#include "tests/support/bundle_fixture.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>

#include "pdoc/pdoc.h"
#include "tests/support/registry_bundles.h"

namespace dr::test {

BundleFixture::BundleFixture() = default;
BundleFixture::~BundleFixture() = default;

std::string BundleFixture::path(const std::string& relative) const { return root_ / relative; }

std::string BundleFixture::makeFolder(const std::string& relative) {
  std::filesystem::create_directories(path(relative));
  return path(relative);
}

std::string BundleFixture::writeFile(const std::string& relative, const std::string& bytes) {
  registry_test::WriteBytes(path(relative), bytes);
  return path(relative);
}

std::string BundleFixture::writePdoc(const std::string& relative, const Value& value) {
  Result<std::string> xml = pdoc::WriteXml(value);
  EXPECT_TRUE(xml.ok()) << relative;
  return writeFile(relative, xml.value_or(""));
}

std::string BundleFixture::makeBundle(const std::string& relative, const Value& info,
                                      const std::optional<std::string>& executable) {
  std::string bundle = makeFolder(relative);
  if (info.isPresent()) writePdoc(relative + "/Contents/Info.pdoc", info);
  if (executable) {
    ::chmod(writeFile(relative + "/Contents/Exec/" + *executable, "#!/bin/sh\n").c_str(), 0755);
  }
  return bundle;
}

ScopedEnv::ScopedEnv(std::string name, const std::optional<std::string>& value)
    : name_(std::move(name)) {
  if (const char* old = std::getenv(name_.c_str())) previous_ = old;
  if (value) {
    ::setenv(name_.c_str(), value->c_str(), 1);
  } else {
    ::unsetenv(name_.c_str());
  }
}

ScopedEnv::~ScopedEnv() {
  if (previous_) {
    ::setenv(name_.c_str(), previous_->c_str(), 1);
  } else {
    ::unsetenv(name_.c_str());
  }
}

}  // namespace dr::test
