#include "tests/support/registry_bundles.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "pdoc/pdoc.h"

namespace dr::registry_test {

void WriteBytes(const std::string& path, std::string_view bytes) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  ASSERT_TRUE(out.good()) << path;
}

std::string ReadBytes(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

mode_t ModeOf(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

std::string MakeBundle(const std::string& path, const Value& info, const Value& entitlements) {
  auto xml = pdoc::WriteXml(info);
  EXPECT_TRUE(xml.ok()) << path;
  WriteBytes(path + "/Contents/Info.pdoc", xml.value_or(""));
  if (entitlements.isPresent()) {
    auto ent = pdoc::WriteXml(entitlements);
    EXPECT_TRUE(ent.ok()) << path;
    WriteBytes(path + "/Contents/Entitlements.pdoc", ent.value_or(""));
  }
  return path;
}

Value PlugInInfo(const std::string& name) {
  return Value{
      {"BNBundleIdentifier", "com.example." + name},
      {"BNBundleVersion", "1.0"},
      {"UXExtension", Value{{"UXExtensionPointIdentifier", "com.example.point"},
                            {"UXExtensionAttributes",
                             Value{{"UXExtensionIdentifier", "com.example." + name + ".ext"}}}}},
  };
}

}  // namespace dr::registry_test
