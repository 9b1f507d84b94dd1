#include "store/annotation_store.h"

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <utility>

#include "core/format.h"
#include "core/log.h"
#include "model/plugin_keys.h"
#include "platform/pdoc.h"
#include "platform/probes.h"
#include "plugin/plugin.h"
#include "store/usage_report.h"

namespace dr {
namespace {

constexpr const char* kVersionKey = "version";
constexpr const char* kDataKey = "data";
constexpr const char* kFolderName = "com.corvel.dromon";
constexpr const char* kFileName = "Annotations";

// The user's state folder is handed around in a buffer of this many bytes,
// terminator included; a longer path counts as no folder at all.
constexpr size_t kUserDirectoryBufferSize = 1024;

[[noreturn]] void Fatal(const AnnotationStoreOptions& options, const std::string& message) {
  SystemLogLine(message);
  if (options.onFatal) options.onFatal(message);
  std::abort();
}

// $XDG_STATE_HOME when it is an absolute path, else $HOME/.local/state; an
// errno value when there is neither or the path does not fit the buffer.
Result<std::string> UserStateDirectory(const EnvironmentLookup& getenv) {
  std::string dir = EnvironmentValue(getenv, "XDG_STATE_HOME");
  if (dir.empty() || dir[0] != '/') {  // relative XDG folders are ignored
    std::string home = EnvironmentValue(getenv, "HOME");
    if (home.empty()) return PosixError(ENOENT, "HOME");
    dir = home + "/.local/state";
  }
  while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
  if (dir.size() + 1 > kUserDirectoryBufferSize) return PosixError(ENAMETOOLONG, dir);
  return dir;
}

}  // namespace

DRDAnnotationStore::DRDAnnotationStore(AnnotationStoreOptions options)
    : options_(std::move(options)) {}

std::string DRDAnnotationStore::defaultDatabaseURL(const AnnotationStoreOptions& options) {
  Result<std::string> user = UserStateDirectory(options.getenv);
  if (!user) {
    Fatal(options, Format("unable to locate user directory: errno %d", user.error().code()));
  }
  std::string dir = *user + "/" + kFolderName;
  if (Status made = options.fileSystem->makeDirectories(dir, kFolderMode); !made.ok()) {
    Fatal(options,
          Format("unable to create plugin annotations directory:%@ error:%@", dir, made.error()));
  }
  return dir + "/" + kFileName;
}

std::unique_ptr<DRDAnnotationStore> DRDAnnotationStore::initWithDatabase(
    const std::optional<std::string>& path, AnnotationStoreOptions options) {
  std::unique_ptr<DRDAnnotationStore> store(new DRDAnnotationStore(std::move(options)));
  if (path) {
    std::error_code ec;
    std::filesystem::path absolute = std::filesystem::absolute(*path, ec);
    store->annotationsURL_ = ec ? *path : absolute.string();
  } else {
    store->annotationsURL_ = defaultDatabaseURL(store->options_);
  }
  if (Status loaded = store->loadDb(); !loaded.ok()) {
    // A missing file is the first run, not damage; its domain is not compared.
    if (loaded.error().code() != kFileReadNoSuchFileError) {
      SystemLog("unable to load annotation database:%@ error:%@ (resetting)",
                store->annotationsURL_, loaded.error());
    }
    store->annotations_ = Dictionary();
  }
  return store;
}

Status DRDAnnotationStore::loadDb() {
  auto fail = [](const Error& error) {
    probes::DbLoad(error.domain().c_str(), static_cast<uint64_t>(error.code()));
    return Status(error);
  };
  Result<std::string> bytes = options_.fileSystem->readFile(annotationsURL_);
  if (!bytes) return fail(bytes.error());
  Result<Value> doc = pdoc::Parse(*bytes);
  if (!doc) return fail(doc.error());
  int64_t version = (*doc)[kVersionKey].intValue();
  if (version != kDatabaseVersion) {
    return fail(DRMakeErrorWithFormat(
        kDRErrorVersion, "found database version %d needed version %d", version, kDatabaseVersion));
  }
  // A version-16 file without a "data" dictionary is damaged like an unreadable one.
  const Value& data = (*doc)[kDataKey];
  if (!data.isDictionary()) {
    return fail(DRMakeErrorWithFormat(
        kDRErrorVersion, "found database version %d without a data dictionary", version));
  }
  annotations_ = data.dictionary();
  return Status::OK();
}

Status DRDAnnotationStore::saveDb() {
  Value doc{{kVersionKey, kDatabaseVersion}, {kDataKey, Value(annotations_)}};
  return pdoc::WriteFile(annotationsURL_, doc, kFileMode, options_.fileSystem);
}

Value DRDAnnotationStore::annotationForPlugIn(const DRDPlugIn& plugIn) const {
  auto it = annotations_.find(plugIn.annotationKey());
  return it == annotations_.end() ? Value() : it->second;
}

void DRDAnnotationStore::setAnnotationForPlugIn(const Value& annotation, const DRDPlugIn& plugIn) {
  std::string key = plugIn.annotationKey();
  auto stored = annotations_.find(key);
  if (annotation.isAbsent()) {
    if (stored != annotations_.end()) annotations_.erase(stored);
  } else {
    const Value& oldAnnotation = stored == annotations_.end() ? AbsentValue() : stored->second;
    const Value& election = annotation[kElectionKey];
    if (election.isPresent()) {
      const Value& oldElection = oldAnnotation[kElectionKey];
      Value point = plugIn.attributes()[kUXExtensionPointNameKey];
      if (point.isPresent() && (oldElection.isAbsent() || !(oldElection == election)) &&
          options_.usageReports != nullptr) {
        std::optional<std::string> identifier = plugIn.identifier();
        std::optional<std::string> version = plugIn.version();
        sendUsageReport(options_.usageReports, identifier ? Value(*identifier) : Value(),
                        version ? Value(*version) : Value(), point,
                        election.intValue() == 1 ? kUsageEnabled : kUsageDisabled);
      }
    }
    Dictionary merged = oldAnnotation.dictionary();
    for (const auto& [name, value] : annotation.dictionary()) merged[name] = value;
    annotations_[key] = Value(std::move(merged));
  }
  if (Status saved = saveDb(); !saved.ok()) {
    SystemLog("unable to save annotations:%@ error:%@", annotationsURL_, saved.error());
  }
}

}  // namespace dr
