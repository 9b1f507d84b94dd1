// The verbs that work on the user's files rather than through drd: token
// consumption, the exclusions preference and change notifications.
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <chrono>

#include "client/drkit/commands.h"
#include "client/drkit/output.h"
#include "client/include/drd/extension.h"
#include "platform/file_system.h"
#include "platform/notifications.h"
#include "platform/pdoc_file.h"
#include "platform/preferences.h"
#include "store/user_prefs.h"

namespace dr::drkit {
namespace {

std::atomic<bool> gStop{false};

void OnStopSignal(int) { gStop.store(true); }

// SIGINT and SIGTERM end a waiting loop at its next turn.
void CatchStopSignals() {
  struct sigaction action = {};
  action.sa_handler = OnStopSignal;
  sigemptyset(&action.sa_mask);
  sigaction(SIGINT, &action, nullptr);
  sigaction(SIGTERM, &action, nullptr);
}

std::string ParentFolder(const std::string& path) { return path.substr(0, path.rfind('/')); }

}  // namespace

int RunExtension(const Invocation& inv, Io& io) {
  if (inv.operands[0] == "open") {
    Result<std::unique_ptr<client::Connection>> c =
        client::Connection::Open(inv.service, client::DefaultSocketDirectory());
    if (!c.ok()) return Fail(io, c.error().localizedDescription());
    Result<client::OpenedExtension> opened = client::openExtension(**c, inv.operands[1]);
    if (!opened.ok()) return Fail(io, opened.error().localizedDescription());
    const std::string file = inv.operands.size() > 2 ? inv.operands[2] : "";
    // A folder is listed, a file printed.
    if (Result<std::vector<std::string>> names = opened->listFolder(file); names.ok()) {
      if (inv.json) {
        Array list(names->begin(), names->end());
        io.out << Json(io, Value{{"path", opened->path()}, {"names", Value(std::move(list))}})
               << "\n";
        return 0;
      }
      for (const std::string& name : *names) io.out << name << "\n";
      return 0;
    }
    Result<std::string> bytes = opened->readFile(file);
    if (!bytes.ok()) {
      return Fail(
          io, (file.empty() ? opened->path() : file) + ": " + bytes.error().localizedDescription());
    }
    io.out << *bytes;
    return 0;
  }
  Result<std::string> path = client::consumeExtension(inv.operands[1]);
  if (!path.ok()) return Fail(io, path.error().localizedDescription());
  io.out << (inv.json ? Json(io, Value{{"path", *path}}) : *path) << "\n";
  return 0;
}

int RunExclude(const Invocation& inv, Io& io) {
  const PreferencesOptions options = PreferencesOptionsFromEnvironment();
  const std::string& action = inv.operands[0];
  if (action == "list") {
    // Read as drd reads it.
    std::unique_ptr<Preferences> preferences = MakeFilePreferences(options);
    const Value exclusions = DRDUserPrefs(preferences.get()).exclusions();
    if (exclusions.isPresent() && !exclusions.isArray()) {
      return Fail(io, "the stored exclusions are not a list; drd ignores them: " +
                          exclusions.description());
    }
    if (inv.json) {
      io.out << Json(io, Value(exclusions.array())) << "\n";
      return 0;
    }
    size_t n = 0;
    for (const Value& e : exclusions.array()) io.out << ++n << ": " << ToJson(e, false) << "\n";
    return 0;
  }

  // The file may hold other settings of the domain: they are kept, and a
  // file that cannot be read is left alone rather than replaced.
  const std::string file = CurrentHostPreferencesFile(options, DRDUserPrefs::kDomain);
  Result<Value> stored = pdoc::ReadFile(file);
  Value document = Value::EmptyDictionary();
  if (stored.ok()) {
    document = *stored;
  } else if (stored.error().code() != kFileReadNoSuchFileError) {
    return Fail(
        io, "cannot read " + file + " (left unchanged): " + stored.error().localizedDescription());
  }
  if (!document.isDictionary()) return Fail(io, file + " is not a dictionary (left unchanged)");
  const Value& current = document[DRDUserPrefs::kExclusionsKey];
  if (current.isPresent() && !current.isArray()) {
    return Fail(io, "the stored exclusions in " + file + " are not a list (left unchanged)");
  }
  Array exclusions = current.array();
  if (action == "add") {
    if (std::find(exclusions.begin(), exclusions.end(), inv.rules) != exclusions.end()) return 0;
    exclusions.push_back(inv.rules);
  } else if (inv.rules.isPresent()) {
    auto gone = std::remove(exclusions.begin(), exclusions.end(), inv.rules);
    if (gone == exclusions.end()) return Fail(io, "no such exclusion: " + ToJson(inv.rules, false));
    exclusions.erase(gone, exclusions.end());
  } else {
    const uint64_t n = std::stoull(inv.operands[1]);  // checked when parsed
    if (n > exclusions.size()) {
      return Fail(io, "no exclusion number " + std::to_string(n) + " (there are " +
                          std::to_string(exclusions.size()) + ")");
    }
    exclusions.erase(exclusions.begin() + static_cast<std::ptrdiff_t>(n - 1));
  }
  document = document.changing(DRDUserPrefs::kExclusionsKey, Value(std::move(exclusions)));
  if (Status s = FileSystem::Default()->makeDirectories(ParentFolder(file), 0700); !s.ok()) {
    return Fail(io, s.error().localizedDescription());
  }
  if (Status s = pdoc::WriteFile(file, document); !s.ok()) {
    return Fail(io, "cannot write " + file + ": " + s.error().localizedDescription());
  }
  return 0;
}

int RunWatch(const Invocation& inv, Io& io) {
  const std::string folder = NotificationOptionsFromEnvironment().directory;
  CatchStopSignals();
  Result<std::unique_ptr<NotificationObserver>> observer = NotificationObserver::Open(folder);
  if (!observer.ok()) return Fail(io, observer.error().localizedDescription());
  // Says when posts start to be seen, for people and for scripts that wait.
  io.err << "drkit: watching " << folder << std::endl;
  uint64_t printed = 0;
  while (!gStop.load() && (inv.count == 0 || printed < inv.count)) {
    // Short waits, so that a signal is noticed soon.
    Result<std::optional<Notification>> post =
        (*observer)->waitForPost(std::chrono::milliseconds(250));
    if (!post.ok()) return Fail(io, post.error().localizedDescription());
    if (!*post) continue;
    if (inv.json) {
      // One object a line, whatever standard output is: a stream of events.
      io.out << ToJson(Value{{"name", (*post)->name}, {"count", (*post)->count}}, false)
             << std::endl;
    } else {
      io.out << (*post)->name << " " << (*post)->count << std::endl;
    }
    ++printed;
  }
  return 0;
}

}  // namespace dr::drkit
