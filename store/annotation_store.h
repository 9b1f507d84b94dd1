// DRDAnnotationStore: the user's annotations of plug-ins (an election and a
// settings dictionary per annotation key), kept in memory as one table and
// written back whole to the annotation file after every change.
//
// Owned by the plug-in database, which calls it only from its "DRDatabase"
// serial queue; the store has no lock of its own and must not be used from
// two threads at once. The file is read once, at construction; from then on
// memory is the truth. Failures never reach the caller: a file that cannot be
// loaded leaves an empty table (logged unless the file is simply missing), a
// save that fails is logged and the table in memory keeps the change; the
// save is then tried again at the next change and on a timer, on a thread of
// the store's own, until it succeeds, which is logged too (so a change made
// while the disk was full is not lost to a crash once there is room). Only
// the start-up errors of the default location (no user state folder, the
// annotation folder cannot be made) stop the process.
//
// File layout (XML pdoc, written through the atomic, durable file write, 0600):
//   <dict> "version" → 16, "data" → { annotation key → annotation dictionary }
// Writing the whole file on each change was chosen over an append log: the
// table holds one small entry per annotated plug-in identifier and changes
// only on user action, and a whole file replaced by rename is never half
// written. Serialising a table of a thousand entries costs more than the
// write itself, so the store keeps each entry's XML text beside the table and
// a change rewrites only the changed entry's text; the file is those texts
// joined, the same bytes as serialising the whole table.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include "core/status.h"
#include "core/value.h"
#include "platform/file_system.h"
#include "platform/usage_reports.h"
#include "wire/locations.h"

namespace dr {

class DRDPlugIn;

struct AnnotationStoreOptions {
  // Reads and writes the annotation file and makes its folder; never null.
  FileSystem* fileSystem = FileSystem::Default();
  // Receives election reports; null sends none.
  UsageReports* usageReports = nullptr;
  // Looks up XDG_STATE_HOME and HOME for the default location; null reads the
  // process environment.
  EnvironmentLookup getenv = nullptr;
  // Called with the message of a fatal start-up error after it has been
  // logged, in place of std::abort(). Must not return; if it does, the
  // process is aborted all the same.
  std::function<void(std::string_view message)> onFatal;
  // How long after a failed save it is tried again (and again, until it
  // succeeds) when no change comes first.
  std::chrono::milliseconds saveRetryInterval{std::chrono::seconds(5)};
};

class DRDAnnotationStore {
 public:
  // The version of the file layout this store reads and writes.
  static constexpr int64_t kDatabaseVersion = 16;
  // Permissions of the folder made for the default location and of the file.
  static constexpr mode_t kFolderMode = 0700;
  static constexpr mode_t kFileMode = 0600;

  static constexpr const char* kElectionKey = "election";
  static constexpr const char* kExtensionKey = "extension";

  // A store over the annotation file at `path` (taken as a file; no folder is
  // made for it), or at defaultDatabaseURL() when no path is given, loaded
  // from that file at once. A file that cannot be loaded gives an empty
  // table; it is not rewritten until the next change. Never empty.
  static std::unique_ptr<DRDAnnotationStore> initWithDatabase(
      const std::optional<std::string>& path, AnnotationStoreOptions options = {});

  // The default annotation file: "Annotations" in "com.corvel.dromon/" of the
  // user's state folder ($XDG_STATE_HOME, else $HOME/.local/state). The
  // folder is made with its missing parents, 0700. Stops the process with
  // "unable to locate user directory: errno %d" when there is no state folder
  // (or its path is too long), and with "unable to create plugin annotations
  // directory:%@ error:%@" when the folder cannot be made.
  static std::string defaultDatabaseURL(const AnnotationStoreOptions& options);

  ~DRDAnnotationStore();
  DRDAnnotationStore(const DRDAnnotationStore&) = delete;
  DRDAnnotationStore& operator=(const DRDAnnotationStore&) = delete;

  // The stored annotation of `plugIn`'s annotation key, or absent.
  Value annotationForPlugIn(const DRDPlugIn& plugIn) const;

  // Merges `annotation` into the stored annotation of `plugIn`'s annotation
  // key (its keys replace stored keys of the same name; the others stay),
  // or erases that annotation when `annotation` is absent, then saves the
  // whole table. A changed "election" is reported as "Enabled" (1) or
  // "Disabled" (any other value) when the plug-in names its extension point.
  // A failed save is logged and retried; the change stays in memory either
  // way.
  void setAnnotationForPlugIn(const Value& annotation, const DRDPlugIn& plugIn);

  // Replaces the table with the contents of the annotation file. On failure
  // the table is unchanged and the "db-load" probe fires with the error.
  Status loadDb();
  // Writes the whole table to the annotation file, atomically and durably.
  Status saveDb();

  // The table's readers (annotationForPlugIn, annotations) take no lock: the
  // retry thread only reads the table, and every change of it comes from
  // the store's one owner.

  const std::string& annotationsURL() const { return annotationsURL_; }
  void setAnnotationsURL(std::string url) { annotationsURL_ = std::move(url); }
  // The table: annotation key → annotation dictionary.
  const Dictionary& annotations() const { return annotations_; }
  void setAnnotations(Dictionary table);

 private:
  explicit DRDAnnotationStore(AnnotationStoreOptions options);

  // Brings the kept text of the entry under `key` in step with the table.
  void updateEntryXml(const std::string& key);
  // saveDb. REQUIRES: mu_ held.
  Status save();
  // Saves and keeps count: a failure is logged when `logFailure`, and arms
  // the retry; the first success after failures is logged. REQUIRES: mu_.
  void saveKeepingCount(bool logFailure);
  // The retry thread: saves again every saveRetryInterval while unsaved_.
  void retrySaves();

  AnnotationStoreOptions options_;
  std::string annotationsURL_;
  Dictionary annotations_;
  // The XML text of every entry of annotations_, by key, while entryXmlValid_;
  // after the table is replaced whole, or when an entry cannot be written,
  // the next save writes the whole table (and its errors) as before.
  std::map<std::string, std::string, std::less<>> entryXml_;
  bool entryXmlValid_ = false;

  // Guards the saves (entryXml_ and the state below) against the retry
  // thread; changes of the table hold it too.
  std::mutex mu_;
  std::condition_variable retryWake_;
  std::thread retryThread_;  // started at the first failed save
  bool unsaved_ = false;     // the file lags behind the table
  bool stopping_ = false;
  size_t failedSaves_ = 0;  // since the last successful save
  std::chrono::steady_clock::time_point lastFailure_;
};

}  // namespace dr
