// The registry database file.
//
//   bundles(id, path UNIQUE, content_hash, info, entitlements, bundle_identifier,
//           bundle_version, display_name, short_name, registered, system_volume,
//           app_path, app_name, parsed)               one row per registered bundle
//   plugins(uuid PRIMARY KEY, bundle_id -> bundles.id, identifier, multiple)
//                                                     one row per plug-in
//   removed(path PRIMARY KEY, origin, stamp, identifiers, removed)
//                                                     installed bundles the
//                                                     user removed
//
// The information and entitlements dictionaries are stored as the bytes read
// from the bundle, not re-encoded: the same bytes are what the content hash
// covers, what the parser accepted at registration, and what an author wrote
// (JSON stays JSON). They live once per bundle, not once per plug-in.
// Everything lookups and the daemon's logs need (UUID, identifiers, paths,
// version, flags, date, names) is a column.
//
// "parsed" (since version 2) is a binary copy of what the bytes parse to
// (registry_cache.h), made at registration: opening decodes it, which is many
// times cheaper than parsing the XML of every bundle. It is only a cache. A
// copy that is missing (NULL), damaged or made from other bytes is ignored
// and the bytes are parsed when an entry's dictionaries are first used; the
// bytes stay the store of record.
//
// "origin" and "stamp" (since version 3) say which install folder a bundle
// came from (NULL: "add"-ed from elsewhere) and the size, modification time
// and inode of its files when registered, so that the install folders are
// reconciled at start with a few stat calls per bundle and no parse. A NULL
// stamp never matches, so rows of older versions are read once more.
// "removed" keeps the installed bundles the user removed, with the stamp of
// their files then: they stay away until the stamp changes or they leave.
// "identifiers" are their plug-ins', newline-separated, for explaining.
//
// The schema is versioned by PRAGMA user_version; kMigrations[v] takes a
// database from version v to v + 1, each step in its own transaction, so a
// later change adds a step and old files are brought forward at open.
#include "registry/registry_file.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <functional>
#include <map>
#include <system_error>
#include <thread>

#include "core/format.h"
#include "registry/parsed_copy.h"

namespace dr::registry_internal {
namespace {

struct Migration {
  const char* sql;
  // Then fills the parsed copies of the rows that have none.
  bool fillParsedCopies;
};

constexpr Migration kMigrations[] = {
    // 0 -> 1: the first schema.
    {R"sql(
CREATE TABLE bundles (
  id INTEGER PRIMARY KEY,
  path TEXT NOT NULL UNIQUE,
  content_hash BLOB NOT NULL,
  info BLOB NOT NULL,
  entitlements BLOB,
  bundle_identifier TEXT,
  bundle_version TEXT,
  display_name TEXT,
  short_name TEXT,
  registered REAL NOT NULL,
  system_volume INTEGER NOT NULL,
  app_path TEXT,
  app_name TEXT
);
CREATE TABLE plugins (
  uuid BLOB PRIMARY KEY CHECK (length(uuid) = 16),
  bundle_id INTEGER NOT NULL REFERENCES bundles(id),
  identifier TEXT NOT NULL,
  multiple INTEGER NOT NULL
);
CREATE INDEX plugins_by_bundle ON plugins(bundle_id);
)sql",
     false},
    // 1 -> 2: the parsed copy of each bundle's files, made for the rows there
    // are, so that the next open already decodes them.
    {"ALTER TABLE bundles ADD COLUMN parsed BLOB;", true},
    // 2 -> 3: install folders.
    {R"sql(
ALTER TABLE bundles ADD COLUMN origin TEXT;
ALTER TABLE bundles ADD COLUMN stamp TEXT;
CREATE TABLE removed (
  path TEXT PRIMARY KEY,
  origin TEXT NOT NULL,
  stamp TEXT NOT NULL,
  identifiers TEXT NOT NULL,
  removed REAL NOT NULL
);
)sql",
     false},
};
constexpr int kSchemaVersion = static_cast<int>(std::size(kMigrations));

// The columns of each table, named once and in one order. A statement that
// reads rows selects all of its table's columns in this order, so a column's
// index is its place in the list; a statement that writes binds a column's
// value to the parameter Param(column). Statements are built from these lists
// (Select, Insert, Equals), and every index is looked up in them by name when
// compiling, so neither an index nor a parameter is counted by eye.
// clang-format off
constexpr std::string_view kBundles[] = {
    "id", "path", "content_hash", "info", "entitlements", "bundle_identifier", "bundle_version",
    "display_name", "short_name", "registered", "system_volume", "app_path", "app_name", "parsed",
    "origin", "stamp"};
// clang-format on
constexpr std::string_view kPlugIns[] = {"uuid", "bundle_id", "identifier", "multiple"};
constexpr std::string_view kRemoved[] = {"path", "origin", "stamp", "identifiers", "removed"};

// The index of the column `name` in `columns` (Bundle, PlugIn, Removed for
// the three tables); a name not there does not compile.
template <size_t N>
consteval int ColumnOf(const std::string_view (&columns)[N], std::string_view name) {
  for (size_t c = 0; c < N; ++c) {
    if (columns[c] == name) return static_cast<int>(c);
  }
  throw "no such column";
}
consteval int Bundle(std::string_view name) { return ColumnOf(kBundles, name); }
consteval int PlugIn(std::string_view name) { return ColumnOf(kPlugIns, name); }
consteval int Removed(std::string_view name) { return ColumnOf(kRemoved, name); }

// The parameter a column's value is bound to, in every statement.
constexpr int Param(int column) { return column + 1; }

// "SELECT <every column> FROM <table>", or only the first `count` columns
// (a migration reads a table before its later columns exist).
template <size_t N>
std::string Select(const std::string_view (&columns)[N], std::string_view table, size_t count = N) {
  std::string sql = "SELECT ";
  for (size_t c = 0; c < count; ++c) sql.append(c == 0 ? "" : ", ").append(columns[c]);
  return sql.append(" FROM ").append(table);
}

// "<verb> INTO <table> (<columns from first on>) VALUES (<their parameters>)".
template <size_t N>
std::string Insert(std::string_view verb, std::string_view table,
                   const std::string_view (&columns)[N], size_t first = 0) {
  std::string names;
  std::string values;
  for (size_t c = first; c < N; ++c) {
    names.append(c == first ? "" : ", ").append(columns[c]);
    values.append(c == first ? "?" : ", ?").append(std::to_string(Param(static_cast<int>(c))));
  }
  return std::string(verb) + " INTO " + std::string(table) + " (" + names + ") VALUES (" + values +
         ")";
}

// "<column> = ?<its parameter>".
template <size_t N>
std::string Equals(const std::string_view (&columns)[N], int column) {
  return std::string(columns[column]) + " = ?" + std::to_string(Param(column));
}

// Runs a query that answers one integer.
int ReadInt(sqlite3* db, const char* sql, int* out) {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db, sql, -1, &raw, nullptr);
  if (rc != SQLITE_OK) return rc;
  rc = sqlite3_step(raw);
  if (rc == SQLITE_ROW) {
    *out = sqlite3_column_int(raw, 0);
    rc = SQLITE_OK;
  }
  sqlite3_finalize(raw);
  return rc;
}

// Binds text the caller keeps alive until the statement has run.
void BindText(sqlite3_stmt* s, int index, std::string_view text) {
  sqlite3_bind_text(s, index, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
}

void BindOptionalText(sqlite3_stmt* s, int index, const std::optional<std::string>& text) {
  if (text) {
    BindText(s, index, *text);
  } else {
    sqlite3_bind_null(s, index);
  }
}

void BindBlob(sqlite3_stmt* s, int index, std::string_view bytes) {
  // A zero-length blob needs a non-null pointer to stay a blob, not NULL.
  sqlite3_bind_blob(s, index, bytes.empty() ? "" : bytes.data(), static_cast<int>(bytes.size()),
                    SQLITE_STATIC);
}

std::optional<std::string> ColumnText(sqlite3_stmt* s, int column) {
  if (sqlite3_column_type(s, column) == SQLITE_NULL) return std::nullopt;
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(s, column));
  return std::string(text ? text : "", static_cast<size_t>(sqlite3_column_bytes(s, column)));
}

// The blob or text in `column`, valid until the statement steps again.
std::string_view ColumnView(sqlite3_stmt* s, int column) {
  const auto* bytes = static_cast<const char*>(sqlite3_column_blob(s, column));
  const auto size = static_cast<size_t>(sqlite3_column_bytes(s, column));
  return bytes ? std::string_view(bytes, size) : std::string_view();
}

std::string ColumnBlob(sqlite3_stmt* s, int column) {
  const auto* bytes = static_cast<const char*>(sqlite3_column_blob(s, column));
  return std::string(bytes ? bytes : "", static_cast<size_t>(sqlite3_column_bytes(s, column)));
}

}  // namespace

class RegistryFile::Statement {
 public:
  explicit Statement(sqlite3_stmt* s) : s_(s) {}
  ~Statement() { sqlite3_finalize(s_); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  sqlite3_stmt* get() const { return s_; }

  // Runs the bound statement to its end and makes it ready for reuse.
  int run() {
    int rc = sqlite3_step(s_);
    while (rc == SQLITE_ROW) rc = sqlite3_step(s_);
    sqlite3_reset(s_);
    sqlite3_clear_bindings(s_);
    return rc;
  }

 private:
  sqlite3_stmt* s_;
};

RegistryFile::RegistryFile(std::string path, sqlite3* db) : path_(std::move(path)), db_(db) {}

RegistryFile::~RegistryFile() {
  for (auto* s : {&begin_, &commit_, &rollback_, &deletePlugIns_, &deleteBundle_, &insertBundle_,
                  &insertPlugIn_, &forgetRemoved_, &rememberRemoved_, &updateOrigin_}) {
    s->reset();
  }
  sqlite3_close_v2(db_);  // the last connection checkpoints and removes the WAL file
}

Error RegistryFile::errorOf(int rc, const std::string& what) const {
  const int primary = rc & 0xff;
  int64_t code = kRegistryStorage;
  const char* hint = "";
  if (primary == SQLITE_BUSY || primary == SQLITE_LOCKED) {
    code = kRegistryBusy;
    hint = " (the file is in use by another process)";
  } else if (primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB) {
    code = kRegistryCorrupt;
    hint = " (the file is damaged or is not a registry database; it was left as it is)";
  }
  const char* message = db_ != nullptr ? sqlite3_errmsg(db_) : sqlite3_errstr(rc);
  return Error(kRegistryErrorDomain, code,
               Format("registry database \"%@\": %@: %@%@", path_, what, message, hint));
}

Status RegistryFile::exec(const char* sql, const std::string& what) {
  int rc = sqlite3_exec(db_, sql, nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, what);
  return Status::OK();
}

Result<std::unique_ptr<RegistryFile>> RegistryFile::Open(const std::string& path,
                                                         std::chrono::milliseconds busyTimeout,
                                                         FileSystem* fs) {
  auto storageError = [&](const std::string& text) {
    return Error(kRegistryErrorDomain, kRegistryStorage,
                 Format("registry database \"%@\": %@", path, text));
  };
  if (path.empty() || path.front() != '/') return storageError("not an absolute path");
  const size_t slash = path.rfind('/');
  if (slash > 0) {
    if (Status s = fs->makeDirectories(path.substr(0, slash), 0700); !s.ok()) {
      return storageError("cannot create its folder: " + s.error().localizedDescription());
    }
  }
  // Made here rather than by SQLite so that it is 0600 whatever the umask;
  // SQLite gives its WAL and shared-memory files the same mode.
  int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (fd >= 0) {
    ::fchmod(fd, 0600);
    ::close(fd);
  } else if (errno != EEXIST) {
    return storageError(PosixError(errno, "create").localizedDescription());
  }

  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  std::unique_ptr<RegistryFile> out(new RegistryFile(path, db));
  if (rc != SQLITE_OK) return out->errorOf(rc, "cannot open");
  sqlite3_extended_result_codes(db, 1);
  sqlite3_busy_timeout(db, static_cast<int>(busyTimeout.count()));

  // Nothing is written before the file has proved to be a sound database.
  if (Status s = out->checkIntegrity(); !s.ok()) return s.error();
  if (Status s = out->exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;"
                           " PRAGMA foreign_keys=ON;",
                           "cannot configure");
      !s.ok()) {
    return s.error();
  }
  if (Status s = out->migrate(); !s.ok()) return s.error();
  if (Status s = out->prepareAll(); !s.ok()) return s.error();
  return out;
}

Status RegistryFile::checkIntegrity() {
  // Reading the schema version reads the file header: a file that is not a
  // database fails here. quick_check then walks every page, so damage
  // anywhere (a truncated file, a torn page) is found now, at open.
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db_, "PRAGMA quick_check", -1, &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read");
  Statement check(raw);
  std::string problem;
  while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
    auto text = ColumnText(raw, 0).value_or("");
    if (text != "ok" && problem.empty()) problem = text;
  }
  if (rc != SQLITE_DONE) return errorOf(rc, "cannot read");
  if (!problem.empty()) {
    return Error(kRegistryErrorDomain, kRegistryCorrupt,
                 Format("registry database \"%@\": the file is damaged (%@); it was left as it is",
                        path_, problem));
  }
  // A database this program does not know is refused before anything (even
  // the switch to WAL) writes to it. migrate() checks again inside its
  // transaction, in case another process changed the file meanwhile.
  int version = 0;
  int objects = 0;
  if (int rc = ReadInt(db_, "PRAGMA user_version", &version); rc != SQLITE_OK) {
    return errorOf(rc, "cannot read the schema version");
  }
  if (int rc = ReadInt(db_, "SELECT count(*) FROM sqlite_schema", &objects); rc != SQLITE_OK) {
    return errorOf(rc, "cannot read the schema");
  }
  return checkVersion(version, objects);
}

Status RegistryFile::checkVersion(int version, int objects) const {
  if (version > kSchemaVersion) {
    return Error(kRegistryErrorDomain, kRegistryStorage,
                 Format("registry database \"%@\": schema version %d is newer than this program "
                        "knows (%d); it was left as it is",
                        path_, version, kSchemaVersion));
  }
  if (version == 0 && objects > 0) {
    // A fresh file is empty; a database of something else is not ours.
    return Error(kRegistryErrorDomain, kRegistryCorrupt,
                 Format("registry database \"%@\": the file holds another kind of database; it "
                        "was left as it is",
                        path_));
  }
  return Status::OK();
}

Status RegistryFile::migrate() {
  // An up-to-date file needs no write: opening then never waits for a
  // writer in another process.
  int current = 0;
  if (int rc = ReadInt(db_, "PRAGMA user_version", &current); rc != SQLITE_OK) {
    return errorOf(rc, "cannot read the schema version");
  }
  if (current == kSchemaVersion) return Status::OK();
  for (;;) {
    // Each step re-reads the version inside its transaction, so two
    // processes opening a new file at once do not both run a step.
    if (Status s = exec("BEGIN IMMEDIATE", "cannot update the schema"); !s.ok()) return s;
    auto fail = [&](Status s) {
      sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
      return s;
    };
    int version = 0;
    if (int rc = ReadInt(db_, "PRAGMA user_version", &version); rc != SQLITE_OK) {
      return fail(errorOf(rc, "cannot read the schema version"));
    }
    int objects = 0;
    if (int rc = ReadInt(db_, "SELECT count(*) FROM sqlite_schema", &objects); rc != SQLITE_OK) {
      return fail(errorOf(rc, "cannot read the schema"));
    }
    if (Status s = checkVersion(version, objects); !s.ok()) return fail(s);
    if (version == kSchemaVersion) return exec("COMMIT", "cannot update the schema");
    if (Status s = exec(kMigrations[version].sql,
                        Format("cannot update the schema to version %d", version + 1));
        !s.ok()) {
      return fail(s);
    }
    if (kMigrations[version].fillParsedCopies) {
      if (Status s = fillParsedCopies(); !s.ok()) return fail(s);
    }
    if (Status s = exec(Format("PRAGMA user_version = %d", version + 1).c_str(),
                        "cannot update the schema version");
        !s.ok()) {
      return fail(s);
    }
    if (Status s = exec("COMMIT", "cannot update the schema"); !s.ok()) return fail(s);
  }
}

Status RegistryFile::fillParsedCopies() {
  // Runs inside the migration that adds "parsed", before later columns exist:
  // reads only those of the first schema.
  constexpr size_t kFirstSchemaColumns = Bundle("entitlements") + 1;
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(
      db_, (Select(kBundles, "bundles", kFirstSchemaColumns) + " WHERE parsed IS NULL").c_str(), -1,
      &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the bundles");
  // The copies are all made before the first is written: the table is not
  // changed under the running query.
  std::vector<std::pair<int64_t, std::string>> copies;
  {
    Statement select(raw);
    while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
      const std::string_view info = ColumnView(raw, Bundle("info"));
      std::optional<std::string_view> entitlements;
      if (sqlite3_column_type(raw, Bundle("entitlements")) != SQLITE_NULL) {
        entitlements = ColumnView(raw, Bundle("entitlements"));
      }
      if (auto copy = EncodeParsedCopy(ParseFiles(info, entitlements), info, entitlements)) {
        copies.emplace_back(sqlite3_column_int64(raw, Bundle("id")), std::move(*copy));
      }
    }
    if (rc != SQLITE_DONE) return errorOf(rc, "cannot read the bundles");
  }
  const std::string update = "UPDATE bundles SET " + Equals(kBundles, Bundle("parsed")) +
                             " WHERE " + Equals(kBundles, Bundle("id"));
  rc = sqlite3_prepare_v2(db_, update.c_str(), -1, &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot prepare a statement");
  Statement statement(raw);
  for (const auto& [id, copy] : copies) {
    BindBlob(raw, Param(Bundle("parsed")), copy);
    sqlite3_bind_int64(raw, Param(Bundle("id")), id);
    if (rc = statement.run(); rc != SQLITE_DONE) return errorOf(rc, "cannot store a parsed copy");
  }
  return Status::OK();
}

Status RegistryFile::prepareAll() {
  struct {
    std::unique_ptr<Statement>* slot;
    std::string sql;
  } const statements[] = {
      {&begin_, "BEGIN IMMEDIATE"},
      {&commit_, "COMMIT"},
      {&rollback_, "ROLLBACK"},
      {&deletePlugIns_, "DELETE FROM plugins WHERE bundle_id IN (SELECT id FROM bundles WHERE " +
                            Equals(kBundles, Bundle("path")) + ")"},
      {&deleteBundle_, "DELETE FROM bundles WHERE " + Equals(kBundles, Bundle("path"))},
      // Every column but id, which SQLite assigns.
      {&insertBundle_, Insert("INSERT", "bundles", kBundles, Bundle("id") + 1)},
      {&insertPlugIn_, Insert("INSERT", "plugins", kPlugIns)},
      {&forgetRemoved_, "DELETE FROM removed WHERE " + Equals(kRemoved, Removed("path"))},
      {&rememberRemoved_, Insert("INSERT OR REPLACE", "removed", kRemoved)},
      {&updateOrigin_, "UPDATE bundles SET " + Equals(kBundles, Bundle("origin")) + ", " +
                           Equals(kBundles, Bundle("stamp")) + " WHERE " +
                           Equals(kBundles, Bundle("path"))},
  };
  for (const auto& [slot, sql] : statements) {
    sqlite3_stmt* raw = nullptr;
    int rc = sqlite3_prepare_v3(db_, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &raw, nullptr);
    if (rc != SQLITE_OK) return errorOf(rc, "cannot prepare a statement");
    *slot = std::make_unique<Statement>(raw);
  }
  return Status::OK();
}

Status RegistryFile::decodeParsedCopies(std::vector<PendingCopy>& pending,
                                        std::vector<BundleRow>& rows) {
  // Decoding is most of the work of loading; two threads share it (each row
  // is written by one of them only). A copy that fails to decode is rare
  // (its checksum matched): its row's bytes are read again and parsed later.
  std::vector<size_t> failed[2];
  auto decode = [&](size_t first, std::vector<size_t>& failures) {
    for (size_t i = first; i < pending.size(); i += 2) {
      BundleRow& row = rows[pending[i].row];
      row.bundle.parsed = DecodeParsedValues(pending[i].values);
      if (!row.bundle.parsed) failures.push_back(pending[i].row);
      std::string().swap(pending[i].values);
    }
  };
  std::thread helper;
  if (pending.size() >= 64) {
    try {
      helper = std::thread(decode, 1, std::ref(failed[1]));
    } catch (const std::system_error&) {
      // No thread to be had: this one decodes everything.
    }
  }
  decode(0, failed[0]);
  if (helper.joinable()) {
    helper.join();
  } else {
    decode(1, failed[1]);
  }
  pending.clear();
  if (failed[0].empty() && failed[1].empty()) return Status::OK();
  sqlite3_stmt* raw = nullptr;
  const std::string select =
      Select(kBundles, "bundles") + " WHERE " + Equals(kBundles, Bundle("id"));
  int rc = sqlite3_prepare_v2(db_, select.c_str(), -1, &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the bundles");
  Statement statement(raw);
  for (const auto& list : failed) {
    for (size_t index : list) {
      ScannedBundle& b = rows[index].bundle;
      sqlite3_bind_int64(raw, Param(Bundle("id")), rows[index].id);
      if ((rc = sqlite3_step(raw)) != SQLITE_ROW) return errorOf(rc, "cannot read the bundles");
      b.infoBytes = ColumnBlob(raw, Bundle("info"));
      if (sqlite3_column_type(raw, Bundle("entitlements")) != SQLITE_NULL) {
        b.entitlementsBytes = ColumnBlob(raw, Bundle("entitlements"));
      }
      sqlite3_reset(raw);
    }
  }
  return Status::OK();
}

Result<std::vector<BundleRow>> RegistryFile::loadAll() {
  std::vector<BundleRow> rows;
  std::vector<PendingCopy> pending;
  std::map<int64_t, size_t> indexOf;
  // Rows are large: growing the vector step by step moved every row about
  // fourteen times for 10,000 bundles.
  int count = 0;
  int rc = ReadInt(db_, "SELECT count(*) FROM bundles", &count);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the bundles");
  rows.reserve(static_cast<size_t>(count));
  pending.reserve(static_cast<size_t>(count));
  sqlite3_stmt* raw = nullptr;
  rc = sqlite3_prepare_v2(db_, (Select(kBundles, "bundles") + " ORDER BY id").c_str(), -1, &raw,
                          nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the bundles");
  {
    Statement bundles(raw);
    while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
      BundleRow row;
      row.id = sqlite3_column_int64(raw, Bundle("id"));
      ScannedBundle& b = row.bundle;
      b.path = ColumnText(raw, Bundle("path")).value_or("");
      b.contentHash = ColumnBlob(raw, Bundle("content_hash"));
      // A parsed copy made from these bytes stands for them, which are then
      // not kept: the entry needs only the dictionaries.
      const std::string_view info = ColumnView(raw, Bundle("info"));
      std::optional<std::string_view> entitlements;
      if (sqlite3_column_type(raw, Bundle("entitlements")) != SQLITE_NULL) {
        entitlements = ColumnView(raw, Bundle("entitlements"));
      }
      std::optional<std::string_view> values;
      if (sqlite3_column_type(raw, Bundle("parsed")) != SQLITE_NULL) {
        values = CheckedParsedValues(ColumnView(raw, Bundle("parsed")), info, entitlements);
      }
      if (values) {
        pending.push_back({rows.size(), std::string(*values)});
      } else {
        b.infoBytes = std::string(info);
        if (entitlements) b.entitlementsBytes = std::string(*entitlements);
      }
      b.bundleIdentifier = ColumnText(raw, Bundle("bundle_identifier"));
      b.bundleVersion = ColumnText(raw, Bundle("bundle_version"));
      b.displayName = ColumnText(raw, Bundle("display_name"));
      b.shortName = ColumnText(raw, Bundle("short_name"));
      row.registered = Date{sqlite3_column_double(raw, Bundle("registered"))};
      b.onSystemVolume = sqlite3_column_int(raw, Bundle("system_volume")) != 0;
      if (auto app = ColumnText(raw, Bundle("app_path"))) {
        b.containingApplication = RegistryApplication{*app, ColumnText(raw, Bundle("app_name"))};
      }
      row.origin = ColumnText(raw, Bundle("origin"));
      row.stamp = ColumnText(raw, Bundle("stamp")).value_or("");
      indexOf[row.id] = rows.size();
      rows.push_back(std::move(row));
    }
    if (rc != SQLITE_DONE) return errorOf(rc, "cannot read the bundles");
  }
  if (Status s = decodeParsedCopies(pending, rows); !s.ok()) return s.error();
  rc = sqlite3_prepare_v2(db_,
                          (Select(kPlugIns, "plugins") + " ORDER BY bundle_id, identifier").c_str(),
                          -1, &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the plug-ins");
  Statement plugIns(raw);
  while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
    auto it = indexOf.find(sqlite3_column_int64(raw, PlugIn("bundle_id")));
    std::string uuid = ColumnBlob(raw, PlugIn("uuid"));
    if (it == indexOf.end() || uuid.size() != Uuid().bytes.size()) {
      return Error(kRegistryErrorDomain, kRegistryCorrupt,
                   Format("registry database \"%@\": a plug-in row is inconsistent; the file "
                          "was left as it is",
                          path_));
    }
    BundleRow& row = rows[it->second];
    Uuid u;
    std::memcpy(u.bytes.data(), uuid.data(), u.bytes.size());
    row.uuids.push_back(u);
    row.bundle.plugIns.push_back({ColumnText(raw, PlugIn("identifier")).value_or(""),
                                  sqlite3_column_int(raw, PlugIn("multiple")) != 0});
  }
  if (rc != SQLITE_DONE) return errorOf(rc, "cannot read the plug-ins");
  // A bundle row without plug-ins has nothing to offer; it is never written
  // that way, so it is left out rather than failing the whole registry.
  std::erase_if(rows, [](const BundleRow& row) { return row.uuids.empty(); });
  return rows;
}

Status RegistryFile::runChange(const std::string& removePath, BundleRow* insert) {
  if (!removePath.empty()) {
    for (Statement* s : {deletePlugIns_.get(), deleteBundle_.get()}) {
      BindText(s->get(), Param(Bundle("path")), removePath);
      if (int rc = s->run(); rc != SQLITE_DONE) return errorOf(rc, "cannot remove a bundle");
    }
  }
  if (insert == nullptr) return Status::OK();
  const ScannedBundle& b = insert->bundle;
  sqlite3_stmt* s = insertBundle_->get();
  BindText(s, Param(Bundle("path")), b.path);
  BindBlob(s, Param(Bundle("content_hash")), b.contentHash);
  BindBlob(s, Param(Bundle("info")), b.infoBytes);
  if (b.entitlementsBytes) {
    BindBlob(s, Param(Bundle("entitlements")), *b.entitlementsBytes);
  } else {
    sqlite3_bind_null(s, Param(Bundle("entitlements")));
  }
  BindOptionalText(s, Param(Bundle("bundle_identifier")), b.bundleIdentifier);
  BindOptionalText(s, Param(Bundle("bundle_version")), b.bundleVersion);
  BindOptionalText(s, Param(Bundle("display_name")), b.displayName);
  BindOptionalText(s, Param(Bundle("short_name")), b.shortName);
  sqlite3_bind_double(s, Param(Bundle("registered")), insert->registered.seconds);
  sqlite3_bind_int(s, Param(Bundle("system_volume")), b.onSystemVolume ? 1 : 0);
  if (const auto& app = b.containingApplication) {
    BindText(s, Param(Bundle("app_path")), app->url);
    BindOptionalText(s, Param(Bundle("app_name")), app->displayName);
  } else {
    sqlite3_bind_null(s, Param(Bundle("app_path")));
    sqlite3_bind_null(s, Param(Bundle("app_name")));
  }
  if (b.parsedCopy) {
    BindBlob(s, Param(Bundle("parsed")), *b.parsedCopy);
  } else {
    sqlite3_bind_null(s, Param(Bundle("parsed")));
  }
  BindOptionalText(s, Param(Bundle("origin")), insert->origin);
  BindText(s, Param(Bundle("stamp")), insert->stamp);
  if (int rc = insertBundle_->run(); rc != SQLITE_DONE) {
    return errorOf(rc, "cannot store a bundle");
  }
  insert->id = sqlite3_last_insert_rowid(db_);
  for (size_t i = 0; i < b.plugIns.size(); ++i) {
    sqlite3_stmt* p = insertPlugIn_->get();
    sqlite3_bind_blob(p, Param(PlugIn("uuid")), insert->uuids[i].bytes.data(),
                      static_cast<int>(insert->uuids[i].bytes.size()), SQLITE_STATIC);
    sqlite3_bind_int64(p, Param(PlugIn("bundle_id")), insert->id);
    const std::string& identifier = b.plugIns[i].identifier;
    BindText(p, Param(PlugIn("identifier")), identifier);
    sqlite3_bind_int(p, Param(PlugIn("multiple")), b.plugIns[i].multiple ? 1 : 0);
    if (int rc = insertPlugIn_->run(); rc != SQLITE_DONE) {
      return errorOf(rc, "cannot store a plug-in");
    }
  }
  return Status::OK();
}

Status RegistryFile::runRemovedChange(const RemovedChange& removed) {
  if (!removed.forget.empty()) {
    sqlite3_stmt* s = forgetRemoved_->get();
    BindText(s, Param(Removed("path")), removed.forget);
    if (int rc = forgetRemoved_->run(); rc != SQLITE_DONE) {
      return errorOf(rc, "cannot forget a removed bundle");
    }
  }
  if (const RemovedBundle* r = removed.remember) {
    std::string identifiers;
    for (const std::string& id : r->plugInIdentifiers) {
      if (!identifiers.empty()) identifiers += '\n';
      identifiers += id;
    }
    sqlite3_stmt* s = rememberRemoved_->get();
    BindText(s, Param(Removed("path")), r->path);
    BindText(s, Param(Removed("origin")), r->installFolder);
    BindText(s, Param(Removed("stamp")), r->stamp);
    BindText(s, Param(Removed("identifiers")), identifiers);
    sqlite3_bind_double(s, Param(Removed("removed")), r->removed.seconds);
    if (int rc = rememberRemoved_->run(); rc != SQLITE_DONE) {
      return errorOf(rc, "cannot remember a removed bundle");
    }
  }
  return Status::OK();
}

Result<std::vector<RemovedBundle>> RegistryFile::loadRemoved() {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db_, Select(kRemoved, "removed").c_str(), -1, &raw, nullptr);
  if (rc != SQLITE_OK) return errorOf(rc, "cannot read the removed bundles");
  Statement select(raw);
  std::vector<RemovedBundle> out;
  while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
    RemovedBundle r;
    r.path = ColumnText(raw, Removed("path")).value_or("");
    r.installFolder = ColumnText(raw, Removed("origin")).value_or("");
    r.stamp = ColumnText(raw, Removed("stamp")).value_or("");
    const std::string identifiers = ColumnText(raw, Removed("identifiers")).value_or("");
    for (size_t pos = 0; pos < identifiers.size();) {
      size_t end = identifiers.find('\n', pos);
      if (end == std::string::npos) end = identifiers.size();
      r.plugInIdentifiers.push_back(identifiers.substr(pos, end - pos));
      pos = end + 1;
    }
    r.removed = Date{sqlite3_column_double(raw, Removed("removed"))};
    out.push_back(std::move(r));
  }
  if (rc != SQLITE_DONE) return errorOf(rc, "cannot read the removed bundles");
  return out;
}

Status RegistryFile::updateOrigin(const std::string& path, const std::optional<std::string>& origin,
                                  const std::string& stamp) {
  if (int rc = begin_->run(); rc != SQLITE_DONE) return errorOf(rc, "cannot begin a change");
  sqlite3_stmt* u = updateOrigin_->get();
  BindText(u, Param(Bundle("path")), path);
  BindOptionalText(u, Param(Bundle("origin")), origin);
  BindText(u, Param(Bundle("stamp")), stamp);
  Status s = Status::OK();
  if (int rc = updateOrigin_->run(); rc != SQLITE_DONE) s = errorOf(rc, "cannot update a bundle");
  if (s.ok()) s = runRemovedChange(RemovedChange{path, nullptr});
  if (s.ok()) {
    if (int rc = commit_->run(); rc != SQLITE_DONE) s = errorOf(rc, "cannot commit a change");
  }
  if (!s.ok()) rollback_->run();
  return s;
}

Status RegistryFile::commit(const std::string& removePath, BundleRow* insert,
                            const RemovedChange& removed) {
  if (int rc = begin_->run(); rc != SQLITE_DONE) return errorOf(rc, "cannot begin a change");
  Status s = runChange(removePath, insert);
  if (s.ok()) s = runRemovedChange(removed);
  if (s.ok()) {
    if (int rc = commit_->run(); rc != SQLITE_DONE) s = errorOf(rc, "cannot commit a change");
  }
  if (!s.ok()) {
    rollback_->run();
    if (insert != nullptr) insert->id = 0;
  }
  return s;
}

}  // namespace dr::registry_internal
