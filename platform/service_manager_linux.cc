#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "platform/pdoc.h"
#include "platform/service_manager.h"

namespace dr {
namespace {

constexpr const char* kSdkPathVariable = "DR_SDK_PATH";
constexpr const char* kSystemSdkFolder = "/usr/share/dromon/SDKs";
constexpr const char* kSdkFileSuffix = ".pdoc";
// An SDK file, like every other pdoc file drd reads, is small.
constexpr size_t kMaxSdkFileBytes = size_t{16} << 20;

std::string NonEmptyEnv(const char* name) {
  const char* v = std::getenv(name);
  return v ? std::string(v) : std::string();
}

std::string HomeFolder() {
  std::string home = NonEmptyEnv("HOME");
  if (!home.empty()) return home;
  struct passwd* pw = ::getpwuid(::getuid());
  return pw && pw->pw_dir ? std::string(pw->pw_dir) : std::string();
}

std::vector<std::string> SdkFolders() {
  std::string list = NonEmptyEnv(kSdkPathVariable);
  if (list.empty()) {
    std::string data = NonEmptyEnv("XDG_DATA_HOME");
    if (data.empty()) data = HomeFolder() + "/.local/share";
    list = data + "/dromon/SDKs:" + kSystemSdkFolder;
  }
  std::vector<std::string> folders;
  size_t start = 0;
  while (start <= list.size()) {
    size_t colon = list.find(':', start);
    if (colon == std::string::npos) colon = list.size();
    if (colon > start) folders.push_back(list.substr(start, colon - start));
    start = colon + 1;
  }
  return folders;
}

class LinuxServiceManager final : public ServiceManager {
 public:
  Result<Value> sdkDictionary(const std::string& identifier) override {
    // An identifier names one file inside a folder, never a path elsewhere.
    if (identifier.empty() || identifier.find('/') != std::string::npos ||
        identifier.find('\0') != std::string::npos) {
      return Value();
    }
    for (const std::string& folder : SdkFolders()) {
      std::string path = folder + "/" + identifier + kSdkFileSuffix;
      struct stat st;
      if (::stat(path.c_str(), &st) != 0) continue;
      Result<std::string> bytes = FileSystem::Default()->readFile(path, kMaxSdkFileBytes);
      if (!bytes.ok()) return bytes.error();
      Result<Value> sdk = pdoc::Parse(*bytes);
      if (!sdk.ok())
        return Error(sdk.error().domain(), sdk.error().code(),
                     path + ": " + sdk.error().localizedDescription());
      if (!sdk->isDictionary()) {
        return Error(kPdocErrorDomain, pdoc::kMalformed, path + ": not a dictionary");
      }
      return *sdk;
    }
    return Value();
  }
};

}  // namespace

ServiceManager* ServiceManager::Default() {
  static LinuxServiceManager* manager = new LinuxServiceManager();
  return manager;
}

}  // namespace dr
