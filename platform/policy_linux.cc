#include <sys/stat.h>

#include <cerrno>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>

#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "platform/policy.h"

namespace dr {
namespace {

constexpr const char* kPolicyVariable = "DR_POLICY";
constexpr const char* kDefaultPolicyPath = "/etc/dromon/policy.pdoc";
constexpr const char* kDeniedPlugInsKey = "DeniedPlugIns";
constexpr const char* kDeniedPlugInsByHostKey = "DeniedPlugInsByHost";
constexpr const char* kInfoFile = "/Contents/Info.pdoc";
constexpr const char* kBundleIdentifierKey = "BNBundleIdentifier";
constexpr size_t kMaxPolicyBytes = size_t{16} << 20;
constexpr size_t kMaxInfoBytes = size_t{4} << 20;

// One version of the policy file; "no file" is the default value.
struct FileState {
  bool exists = false;
  dev_t dev = 0;
  ino_t ino = 0;
  off_t size = 0;
  int64_t mtimeSec = 0, mtimeNsec = 0;
  bool operator==(const FileState&) const = default;
};

// Whether `list` holds the string `identifier`; elements that are not
// strings are ignored. Asked once per plug-in of a discovery, so nothing is
// built.
bool ListHolds(const Value& list, std::string_view identifier) {
  for (const Value& v : list.array()) {
    if (v.isString() && v.stringValue() == identifier) return true;
  }
  return false;
}

class FilePolicy final : public Policy {
 public:
  FilePolicy(PolicyOptions options, ProcessInfo* processes, FileSystem* fs)
      : options_(std::move(options)), processes_(processes), fs_(fs) {}

  bool mayHostUsePlugIn(std::string_view host, std::string_view plugIn) override {
    return Allows(*current(), host, plugIn);
  }

  PlugInJudge judgeForProcess(pid_t pid) override {
    return [policy = current(), host = hostOfProcess(pid)](std::string_view plugIn) {
      return Allows(*policy, host, plugIn);
    };
  }

  std::string hostOfProcess(pid_t pid) override {
    std::string host;
    if (Result<std::string> exe = processes_->executablePath(pid); exe.ok()) {
      if (std::optional<std::string> bundle = BundleOfExecutable(*exe)) {
        Result<std::string> bytes = fs_->readFile(*bundle + kInfoFile, kMaxInfoBytes);
        Result<Value> info = bytes.ok() ? pdoc::Parse(*bytes) : Result<Value>(bytes.error());
        if (info.ok()) host = (*info)[kBundleIdentifierKey].stringValue();
      }
    }
    return host;
  }

 private:
  static bool Allows(const Value& policy, std::string_view host, std::string_view plugIn) {
    if (ListHolds(policy[kDeniedPlugInsKey], plugIn)) return false;
    if (host.empty()) return true;
    return !ListHolds(policy[kDeniedPlugInsByHostKey][host], plugIn);
  }

  // The policy in force now, kept by the caller while it judges: a new
  // version replaces the pointer, never the value under it.
  std::shared_ptr<const Value> current() {
    std::lock_guard<std::mutex> lock(mu_);
    refresh();
    return policy_;
  }

  // REQUIRES: mu_ held. Reads the file again when it is not the version
  // read last time.
  void refresh() {
    FileState state;
    struct stat st;
    if (::stat(options_.path.c_str(), &st) == 0) {
      state = {true, st.st_dev, st.st_ino, st.st_size, st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
    } else if (errno != ENOENT && errno != ENOTDIR) {
      // Cannot even look (EACCES, ...): an unreadable file, handled below.
      state.exists = true;
    }
    if (state == seen_ && read_) return;
    seen_ = state;
    read_ = true;
    if (!state.exists) {  // no file: the administrator set no policy
      policy_ = std::make_shared<const Value>();
      return;
    }
    Result<std::string> bytes = fs_->readFile(options_.path, kMaxPolicyBytes);
    Result<Value> value = bytes.ok() ? pdoc::Parse(*bytes) : Result<Value>(bytes.error());
    if (value.ok() && !value->isDictionary()) {
      value = Error(kPdocErrorDomain, pdoc::kMalformed, "not a dictionary");
    }
    if (!value.ok()) {
      // Keeping the last good policy rather than dropping it means an
      // administrator's half-written edit never lets denied plug-ins through;
      // denying everything instead would let one typo disable every plug-in
      // of every user, so a broken file read first denies nothing.
      SystemLog("ignoring broken plug-in policy file %@, keeping the policy read before: %@",
                options_.path, value.error());
      return;
    }
    policy_ = std::make_shared<const Value>(std::move(value).value());
  }

  PolicyOptions options_;
  ProcessInfo* processes_;
  FileSystem* fs_;
  std::mutex mu_;
  bool read_ = false;
  FileState seen_;
  std::shared_ptr<const Value> policy_ = std::make_shared<const Value>();  // absent: nothing denied
};

}  // namespace

PolicyOptions PolicyOptionsFromEnvironment(const EnvironmentLookup& getenv) {
  PolicyOptions options;
  options.path = EnvironmentValue(getenv, kPolicyVariable);
  if (options.path.empty()) options.path = kDefaultPolicyPath;
  return options;
}

std::unique_ptr<Policy> MakeFilePolicy(PolicyOptions options, ProcessInfo* processes,
                                       FileSystem* fs) {
  return std::make_unique<FilePolicy>(std::move(options), processes, fs);
}

}  // namespace dr
