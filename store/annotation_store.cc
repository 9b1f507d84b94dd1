#include "store/annotation_store.h"

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <utility>

#include "core/format.h"
#include "core/log.h"
#include "platform/pdoc_file.h"
#include "platform/probes.h"
#include "plugin/plugin.h"
#include "plugin/plugin_keys.h"
#include "store/usage_report.h"
#include "wire/protocol.h"

namespace dr {
namespace {

constexpr const char* kVersionKey = "version";
constexpr const char* kDataKey = "data";
constexpr const char* kFolderName = "com.corvel.dromon";
constexpr const char* kFileName = "Annotations";

// The "data" dictionary lies this many levels inside the document.
constexpr int kDataDepth = 2;

// The file's text before and after the entries of a non-empty "data"
// dictionary: the layout written with one stand-in entry, cut around that
// entry's text. The rest of the layout never changes, so this is made once.
struct FileFrame {
  std::string head, tail;
};

const FileFrame& FrameAroundEntries() {
  static const FileFrame frame = [] {
    const Value standIn(true);
    const std::string doc =
        *pdoc::WriteXml(Value{{kVersionKey, DRDAnnotationStore::kDatabaseVersion},
                              {kDataKey, Value(Dictionary{{"", standIn}})}});
    const std::string entry = *pdoc::WriteXmlEntry("", standIn, kDataDepth);
    const size_t at = doc.find(entry);
    return FileFrame{doc.substr(0, at), doc.substr(at + entry.size())};
  }();
  return frame;
}

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

DRDAnnotationStore::~DRDAnnotationStore() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
  }
  retryWake_.notify_all();
  if (retryThread_.joinable()) retryThread_.join();
}

std::string DRDAnnotationStore::defaultDatabaseURL(const AnnotationStoreOptions& options) {
  Result<std::string> user = UserStateDirectory(options.getenv);
  if (!user.ok()) {
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
  // A process killed while saving leaves its temporary beside the file; drd
  // is the file's only writer and nothing is being saved yet.
  Result<size_t> leftovers =
      store->options_.fileSystem->removeLeftoverTemporaries(store->annotationsURL_);
  if (!leftovers.ok()) {
    SystemLog("unable to remove leftover temporaries of %@: %@", store->annotationsURL_,
              leftovers.error());
  } else if (*leftovers > 0) {
    SystemLog("removed %u leftover temporaries of %@", *leftovers, store->annotationsURL_);
  }
  if (Status loaded = store->loadDb(); !loaded.ok()) {
    // A missing file is the first run, not damage; its domain is not compared.
    if (loaded.error().code() != kFileReadNoSuchFileError) {
      SystemLog("unable to load annotation database:%@ error:%@ (resetting)",
                store->annotationsURL_, loaded.error());
    }
    store->setAnnotations(Dictionary());
  }
  return store;
}

Status DRDAnnotationStore::loadDb() {
  auto fail = [](const Error& error) {
    probes::DbLoad(error.domain().c_str(), static_cast<uint64_t>(error.code()));
    return Status(error);
  };
  Result<std::string> bytes = options_.fileSystem->readFile(annotationsURL_);
  if (!bytes.ok()) return fail(bytes.error());
  Result<Value> doc = pdoc::Parse(*bytes);
  if (!doc.ok()) return fail(doc.error());
  int64_t version = (*doc)[kVersionKey].intValue();
  if (version != kDatabaseVersion) {
    return fail(DRMakeErrorWithFormat(message::kErrorVersion,
                                      "found database version %d needed version %d", version,
                                      kDatabaseVersion));
  }
  // A version-16 file without a "data" dictionary is damaged like an unreadable one.
  const Value& data = (*doc)[kDataKey];
  if (!data.isDictionary()) {
    return fail(DRMakeErrorWithFormat(
        message::kErrorVersion, "found database version %d without a data dictionary", version));
  }
  setAnnotations(data.dictionary());
  return Status::OK();
}

void DRDAnnotationStore::setAnnotations(Dictionary table) {
  std::lock_guard<std::mutex> lock(mu_);
  annotations_ = std::move(table);
  entryXml_.clear();
  entryXmlValid_ = false;
}

void DRDAnnotationStore::updateEntryXml(const std::string& key) {
  if (!entryXmlValid_) return;  // the next save writes every entry anyway
  auto entry = annotations_.find(key);
  if (entry == annotations_.end()) {
    entryXml_.erase(key);
    return;
  }
  Result<std::string> text = pdoc::WriteXmlEntry(key, entry->second, kDataDepth);
  if (!text.ok()) {
    entryXml_.clear();
    entryXmlValid_ = false;
    return;
  }
  entryXml_.insert_or_assign(key, std::move(*text));
}

Status DRDAnnotationStore::saveDb() {
  std::lock_guard<std::mutex> lock(mu_);
  return save();
}

Status DRDAnnotationStore::save() {
  if (!entryXmlValid_) {
    entryXml_.clear();
    bool written = true;
    for (const auto& [key, entry] : annotations_) {
      Result<std::string> text = pdoc::WriteXmlEntry(key, entry, kDataDepth);
      if (!text.ok()) {
        written = false;
        break;
      }
      entryXml_.emplace_hint(entryXml_.end(), key, std::move(*text));
    }
    if (!written) entryXml_.clear();
    entryXmlValid_ = written;
  }
  if (!entryXmlValid_ || annotations_.empty()) {
    // The whole table through the writer: an empty "data" has a form of its
    // own, and an entry that cannot be written fails the save with the
    // writer's own message.
    Value doc{{kVersionKey, kDatabaseVersion}, {kDataKey, Value(annotations_)}};
    return pdoc::WriteFile(annotationsURL_, doc, kFileMode, options_.fileSystem);
  }
  const FileFrame& frame = FrameAroundEntries();
  size_t size = frame.head.size() + frame.tail.size();
  for (const auto& [key, text] : entryXml_) size += text.size();
  std::string file;
  file.reserve(size);
  file += frame.head;
  for (const auto& [key, text] : entryXml_) file += text;
  file += frame.tail;
  return options_.fileSystem->writeFileAtomically(annotationsURL_, file, kFileMode);
}

Value DRDAnnotationStore::annotationForPlugIn(const DRDPlugIn& plugIn) const {
  auto it = annotations_.find(plugIn.annotationKey());
  return it == annotations_.end() ? Value() : it->second;
}

void DRDAnnotationStore::setAnnotationForPlugIn(const Value& annotation, const DRDPlugIn& plugIn) {
  std::lock_guard<std::mutex> lock(mu_);
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
  updateEntryXml(key);
  saveKeepingCount(/*logFailure=*/true);
}

void DRDAnnotationStore::saveKeepingCount(bool logFailure) {
  if (Status saved = save(); !saved.ok()) {
    if (logFailure) {
      SystemLog("unable to save annotations:%@ error:%@", annotationsURL_, saved.error());
    }
    ++failedSaves_;
    unsaved_ = true;
    lastFailure_ = std::chrono::steady_clock::now();
    if (!retryThread_.joinable()) retryThread_ = std::thread([this] { retrySaves(); });
    retryWake_.notify_all();
    return;
  }
  if (failedSaves_ > 0) {
    SystemLog("saved annotations:%@ after %u failed attempts", annotationsURL_, failedSaves_);
  }
  failedSaves_ = 0;
  unsaved_ = false;
}

void DRDAnnotationStore::retrySaves() {
  std::unique_lock<std::mutex> lock(mu_);
  while (!stopping_) {
    if (!unsaved_) {
      retryWake_.wait(lock);
      continue;
    }
    // A change meanwhile saves (or fails, and so restarts the wait) by itself.
    const auto due = lastFailure_ + options_.saveRetryInterval;
    if (std::chrono::steady_clock::now() < due) {
      retryWake_.wait_until(lock, due);
      continue;
    }
    // Retries fail quietly: the failure that armed them was logged, and a
    // full disk would otherwise fill the log too.
    saveKeepingCount(/*logFailure=*/false);
  }
}

}  // namespace dr
