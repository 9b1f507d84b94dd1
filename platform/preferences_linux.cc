#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <map>
#include <mutex>
#include <string>
#include <tuple>

#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/preferences.h"

namespace dr {
namespace {

constexpr const char* kMachineIdFile = "/etc/machine-id";
constexpr const char* kPreferencesFolder = "/dromon";
constexpr const char* kHostFolder = "/ByHost/";
constexpr const char* kPdocSuffix = ".pdoc";
// A preferences file is small; a huge one is treated as unreadable.
constexpr size_t kMaxPreferencesBytes = size_t{4} << 20;

std::string Trimmed(std::string_view s) {
  constexpr std::string_view kSpace = " \t\r\n";
  size_t begin = s.find_first_not_of(kSpace);
  if (begin == std::string_view::npos) return std::string();
  return std::string(s.substr(begin, s.find_last_not_of(kSpace) - begin + 1));
}

// A domain names a file, so it must be one plain file name.
bool UsableDomain(std::string_view domain) {
  return !domain.empty() && domain != "." && domain != ".." &&
         domain.find('/') == std::string_view::npos && domain.find('\0') == std::string_view::npos;
}

// What identifies one version of a file, to log a broken file once.
using FileState = std::tuple<dev_t, ino_t, off_t, int64_t, int64_t>;

class FilePreferences final : public Preferences {
 public:
  FilePreferences(PreferencesOptions options, FileSystem* fs)
      : options_(std::move(options)), fs_(fs) {}

  // Every read goes to the file, so there is nothing to refresh.
  void synchronizeCurrentHost(std::string_view) override {}

  Value copyCurrentHostValue(std::string_view key, std::string_view domain) override {
    std::string path = CurrentHostPreferencesFile(options_, domain);
    if (path.empty()) return Value();
    Result<std::string> bytes = fs_->readFile(path, kMaxPreferencesBytes);
    if (!bytes.ok()) {
      if (bytes.error().code() != kFileReadNoSuchFileError) logBroken(path, bytes.error());
      return Value();
    }
    Result<Value> value = pdoc::Parse(*bytes);
    if (!value.ok()) {
      logBroken(path, value.error());
      return Value();
    }
    if (!value->isDictionary()) {
      logBroken(path, Error(kPdocErrorDomain, pdoc::kMalformed, "not a dictionary"));
      return Value();
    }
    return (*value)[key];
  }

 private:
  void logBroken(const std::string& path, const Error& error) {
    struct stat st {};
    ::stat(path.c_str(), &st);
    FileState state{st.st_dev, st.st_ino, st.st_size, st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
    std::lock_guard<std::mutex> lock(mu_);
    auto [it, inserted] = logged_.try_emplace(path, state);
    if (!inserted && it->second == state) return;
    it->second = state;
    SystemLog("ignoring unreadable preferences file %@: %@", path, error);
  }

  PreferencesOptions options_;
  FileSystem* fs_;
  std::mutex mu_;
  std::map<std::string, FileState> logged_;
};

}  // namespace

PreferencesOptions PreferencesOptionsFromEnvironment(const EnvironmentLookup& getenv) {
  PreferencesOptions options;
  options.directory = ConfigHome(getenv) + kPreferencesFolder;
  Result<std::string> machineId = FileSystem::Default()->readFile(kMachineIdFile, 4096);
  if (machineId.ok()) options.hostId = Trimmed(*machineId);
  if (options.hostId.empty() || !UsableDomain(options.hostId)) {
    char host[HOST_NAME_MAX + 1] = {};
    if (::gethostname(host, sizeof host - 1) == 0) options.hostId = host;
  }
  if (options.hostId.empty()) options.hostId = "localhost";
  return options;
}

std::string CurrentHostPreferencesFile(const PreferencesOptions& options, std::string_view domain) {
  if (!UsableDomain(domain)) return std::string();
  return options.directory + kHostFolder + std::string(domain) + "." + options.hostId + kPdocSuffix;
}

std::unique_ptr<Preferences> MakeFilePreferences(PreferencesOptions options, FileSystem* fs) {
  return std::make_unique<FilePreferences>(std::move(options), fs);
}

}  // namespace dr
