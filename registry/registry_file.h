// RegistryFile: the SQLite file behind the registry. Internal to the
// registry (registry_*.cc). One connection, not thread-safe: the registry
// calls it under its write lock only. Every change is one transaction, durable
// when it returns OK (WAL, synchronous=FULL). Failures answer a Status of
// kRegistryErrorDomain naming the database file; a file that is damaged or not
// a registry is reported and never written.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/status.h"
#include "core/value.h"
#include "platform/file_system.h"
#include "registry/scan.h"

struct sqlite3;
struct sqlite3_stmt;

namespace dr::registry_internal {

// One registered bundle as stored: the scan it was registered from, when, and
// the UUIDs given to its plug-ins (uuids[i] names bundle.plugIns[i]).
struct BundleRow {
  int64_t id = 0;  // the database's key; set by load and by commit
  ScannedBundle bundle;
  Date registered;
  std::vector<Uuid> uuids;
  // The install folder it came from (nothing: "add"-ed from elsewhere) and
  // the stamp of its files when registered (BundleFileStamp).
  std::optional<std::string> origin;
  std::string stamp;
};

// What a change does to the bundles the user removed from install folders.
struct RemovedChange {
  std::string forget;                       // path whose removal is forgotten; empty: none
  const RemovedBundle* remember = nullptr;  // stored (replacing one at its path)
};

class RegistryFile {
 public:
  // Opens or creates the database at `path` (its folder made 0700 through
  // `fs`, a new file 0600), checks it, and brings its schema up to date.
  static Result<std::unique_ptr<RegistryFile>> Open(const std::string& path,
                                                    std::chrono::milliseconds busyTimeout,
                                                    FileSystem* fs);
  ~RegistryFile();
  RegistryFile(const RegistryFile&) = delete;
  RegistryFile& operator=(const RegistryFile&) = delete;

  // Every stored bundle, in registration order, plug-ins by identifier.
  Result<std::vector<BundleRow>> loadAll();

  // Every installed bundle the user removed.
  Result<std::vector<RemovedBundle>> loadRemoved();

  // In one transaction: removes the bundle stored at `removePath` (when not
  // empty) with its plug-ins, then stores `insert` (when not null) and sets
  // its id, then applies `removed`. On failure nothing changed.
  Status commit(const std::string& removePath, BundleRow* insert,
                const RemovedChange& removed = {});
  // Sets the origin and stamp of the bundle stored at `path` (files
  // unchanged), forgetting a removal of it by the user.
  Status updateOrigin(const std::string& path, const std::optional<std::string>& origin,
                      const std::string& stamp);

 private:
  class Statement;
  RegistryFile(std::string path, sqlite3* db);
  Error errorOf(int rc, const std::string& what) const;
  Status exec(const char* sql, const std::string& what);
  Status checkIntegrity();
  Status checkVersion(int version, int objects) const;
  Status migrate();
  Status fillParsedCopies();
  // The checked values of a row's parsed copy, still to be decoded.
  struct PendingCopy {
    size_t row;          // index in the rows being loaded
    std::string values;  // CheckedParsedValues of the copy
  };
  // Sets each pending row's parsed dictionaries; a row whose copy does not
  // decode gets its bytes instead.
  Status decodeParsedCopies(std::vector<PendingCopy>& pending, std::vector<BundleRow>& rows);
  Status prepareAll();
  Status runChange(const std::string& removePath, BundleRow* insert);
  Status runRemovedChange(const RemovedChange& removed);

  const std::string path_;
  sqlite3* db_;
  std::unique_ptr<Statement> begin_, commit_, rollback_, deletePlugIns_, deleteBundle_,
      insertBundle_, insertPlugIn_, forgetRemoved_, rememberRemoved_, updateOrigin_;
};

}  // namespace dr::registry_internal
