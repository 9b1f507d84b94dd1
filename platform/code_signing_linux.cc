#include <string>
#include <utility>

#include "pdoc/pdoc.h"
#include "platform/code_signing.h"

namespace dr {
namespace {

// The layout of a bundle around its executable and entitlements.
constexpr std::string_view kExecFolder = "/Contents/Exec/";
constexpr const char* kEntitlementsFile = "/Contents/Entitlements.pdoc";
// An entitlements file is a small dictionary; anything far larger is refused
// rather than read.
constexpr size_t kMaxEntitlementsBytes = size_t{1} << 20;

class LinuxCodeSigning final : public CodeSigning {
 public:
  LinuxCodeSigning(ProcessInfo* processes, FileSystem* fs) : processes_(processes), fs_(fs) {}

  std::shared_ptr<const SigningTask> taskForPid(pid_t pid) override {
    return taskForPidWithExecutable(pid, processes_->executablePath(pid));
  }

  std::shared_ptr<const SigningTask> taskForPidWithExecutable(
      pid_t pid, const Result<std::string>& exe) override {
    if (!exe.ok()) return std::make_shared<ReadSigningTask>(pid, exe.error());
    return std::make_shared<ReadSigningTask>(pid, entitlementsForExecutable(*exe));
  }

  Result<Value> entitlementsForExecutable(const std::string& executablePath) override {
    std::optional<std::string> bundle = BundleOfExecutable(executablePath);
    if (!bundle) return Value::EmptyDictionary();
    std::string file = *bundle + kEntitlementsFile;
    Result<std::string> bytes = fs_->readFile(file, kMaxEntitlementsBytes);
    if (!bytes.ok()) {
      if (bytes.error().domain() == kFileErrorDomain &&
          bytes.error().code() == kFileReadNoSuchFileError) {
        return Value::EmptyDictionary();
      }
      return bytes.error();
    }
    Result<Value> value = pdoc::Parse(*bytes);
    if (!value.ok()) {
      return Error(value.error().domain(), value.error().code(),
                   file + ": " + value.error().localizedDescription());
    }
    if (!value->isDictionary()) {
      return Error(kPdocErrorDomain, pdoc::kMalformed, file + ": not a dictionary");
    }
    return std::move(value).value();
  }

 private:
  ProcessInfo* processes_;
  FileSystem* fs_;
};

}  // namespace

std::optional<std::string> BundleOfExecutable(const std::string& executablePath) {
  size_t slash = executablePath.rfind('/');
  if (slash == std::string::npos || slash + 1 == executablePath.size()) return std::nullopt;
  // "<bundle>/Contents/Exec/<name>": the folder part must end in the Exec
  // folder, and something must come before it.
  std::string_view folder = std::string_view(executablePath).substr(0, slash + 1);
  if (folder.size() <= kExecFolder.size() || !folder.ends_with(kExecFolder)) return std::nullopt;
  return std::string(folder.substr(0, folder.size() - kExecFolder.size()));
}

bool IsEntitlementHeld(const Value& value) { return value.isPresent() && !(value == Value(false)); }

std::unique_ptr<CodeSigning> MakeLinuxCodeSigning(ProcessInfo* processes, FileSystem* fs) {
  return std::make_unique<LinuxCodeSigning>(processes, fs);
}

CodeSigning* CodeSigning::Default() {
  static CodeSigning* signing =
      MakeLinuxCodeSigning(ProcessInfo::Default(), FileSystem::Default()).release();
  return signing;
}

}  // namespace dr
