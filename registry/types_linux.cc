// The Linux type service. Conformance is a search over a graph whose nodes
// are type identifiers and whose edges are "conforms directly to": the
// shared-mime-info subclass lines, the implicit text/plain and
// application/octet-stream parents, and the bundles' type declarations. The
// search keeps the set of nodes it has seen, so cycles in the data end it.
//
// Media types are kept in ASCII lower case (they are case-insensitive, and
// shared-mime-info writes them in lower case); reverse-domain identifiers are
// kept as they are. Aliases are replaced by their canonical type wherever a
// type enters the search.
//
// The mime files are read once per service, at the first question: they
// change only when packages are installed, and a daemon restart picks that
// up. The declarations are read from the registry's entries and kept until
// the registry's entries change (the entries are immutable, so an unchanged
// list of entry pointers means unchanged declarations).
#include <cstdlib>
#include <deque>
#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/file_system.h"
#include "platform/types.h"
#include "registry/registry.h"
#include "registry/types_linux.h"
#include "wire/locations.h"

namespace dr {
namespace {

constexpr const char* kMimeSubclassesFile = "/mime/subclasses";
constexpr const char* kMimeAliasesFile = "/mime/aliases";
// The mime files are a few hundred kilobytes; anything far larger is not one.
constexpr size_t kMaxMimeFileBytes = size_t{16} << 20;
constexpr std::string_view kTextMajor = "text";
constexpr std::string_view kInodeMajor = "inode";
constexpr std::string_view kTextPlain = "text/plain";
constexpr std::string_view kOctetStream = "application/octet-stream";
constexpr std::string_view kAnySubtype = "/*";
constexpr const char* kTypeDeclarationsKey = "TypeDeclarations";
constexpr const char* kTypeIdentifierKey = "TypeIdentifier";
constexpr const char* kConformsToKey = "ConformsTo";
constexpr const char* kDefaultDataDirs = "/usr/local/share:/usr/share";

bool IsMediaType(std::string_view type) { return type.find('/') != std::string_view::npos; }

std::string_view MajorOf(std::string_view mediaType) {
  return mediaType.substr(0, mediaType.find('/'));
}

// The form a type identifier is compared in (see the top of this file).
std::string Normalized(std::string_view type) {
  std::string out(type);
  if (IsMediaType(out)) {
    for (char& c : out) {
      if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    }
  }
  return out;
}

using Parents = std::unordered_map<std::string, std::vector<std::string>>;

void AddParent(Parents& parents, const std::string& type, std::string parent) {
  std::vector<std::string>& list = parents[type];
  for (const std::string& p : list) {
    if (p == parent) return;
  }
  list.push_back(std::move(parent));
}

struct MimeData {
  Parents parents;
  std::unordered_map<std::string, std::string> aliases;  // alias → canonical
};

// Calls `line` with the two fields of each "first second" line of the file at
// `path`; a missing or unreadable file has no lines.
template <typename F>
void ForEachPair(const std::string& path, F line) {
  Result<std::string> bytes = FileSystem::Default()->readFile(path, kMaxMimeFileBytes);
  if (!bytes.ok()) return;
  std::string_view rest = *bytes;
  while (!rest.empty()) {
    size_t end = rest.find('\n');
    std::string_view l = rest.substr(0, end);
    rest = end == std::string_view::npos ? std::string_view() : rest.substr(end + 1);
    size_t space = l.find(' ');
    if (l.empty() || l[0] == '#' || space == std::string_view::npos) continue;
    std::string_view first = l.substr(0, space), second = l.substr(space + 1);
    while (!second.empty() && (second.back() == '\r' || second.back() == ' ')) {
      second.remove_suffix(1);
    }
    if (first.empty() || second.empty() || second.find(' ') != std::string_view::npos) continue;
    line(Normalized(first), Normalized(second));
  }
}

MimeData LoadMimeData(const std::vector<std::string>& folders) {
  MimeData data;
  for (const std::string& folder : folders) {
    // The more important folder's alias wins; subclass lines add up.
    ForEachPair(folder + kMimeAliasesFile, [&](std::string alias, std::string canonical) {
      data.aliases.emplace(std::move(alias), std::move(canonical));
    });
    ForEachPair(folder + kMimeSubclassesFile, [&](std::string type, std::string parent) {
      AddParent(data.parents, type, std::move(parent));
    });
  }
  return data;
}

// The "TypeDeclarations" of the bundles of `entries`, each bundle once.
Parents LoadDeclarations(const RegistryEntries& entries) {
  Parents declared;
  std::set<std::string> seen;
  for (const RegistryEntryPtr& entry : entries) {
    if (!seen.insert(entry->url()).second) continue;
    for (const Value& declaration : entry->infoDictionary()[kTypeDeclarationsKey].array()) {
      std::optional<std::string_view> type = declaration[kTypeIdentifierKey].string();
      if (!type || type->empty()) continue;
      const std::string from = Normalized(*type);
      const Value& to = declaration[kConformsToKey];
      auto add = [&](const Value& parent) {
        std::optional<std::string_view> p = parent.string();
        if (p && !p->empty()) AddParent(declared, from, Normalized(*p));
      };
      if (to.isArray()) {
        for (const Value& parent : to.array()) add(parent);
      } else {
        add(to);
      }
    }
  }
  return declared;
}

class LinuxTypeService final : public TypeService {
 public:
  explicit LinuxTypeService(TypeServiceOptions options) : options_(std::move(options)) {}

  bool conformsTo(std::string_view type, std::string_view to) override {
    return conforms(type, to, mimeData(), *declarations());
  }

  bool evaluateActivationRule(const Value& rule, const Value& pattern) override {
    // One look at the registry for the whole rule.
    const MimeData& mime = mimeData();
    std::shared_ptr<const Parents> declared = declarations();
    return EvaluateActivationRule(rule, pattern, [&](std::string_view a, std::string_view b) {
      return conforms(a, b, mime, *declared);
    });
  }

 private:
  static bool conforms(std::string_view type, std::string_view to, const MimeData& mime,
                       const Parents& declared) {
    if (type.empty() || to.empty()) return false;
    auto canonical = [&](std::string t) {
      auto it = mime.aliases.find(t);
      return it == mime.aliases.end() ? t : it->second;
    };
    const std::string target = canonical(Normalized(to));
    // "MAJOR/*" takes every media type of that major part.
    std::string_view anyOf;
    if (IsMediaType(target) && std::string_view(target).ends_with(kAnySubtype)) {
      anyOf = std::string_view(target).substr(0, target.size() - kAnySubtype.size());
    }

    std::deque<std::string> pending{canonical(Normalized(type))};
    std::unordered_set<std::string> seen{pending.front()};
    auto visit = [&](const std::string& parent) {
      std::string p = canonical(parent);
      if (seen.insert(p).second) pending.push_back(std::move(p));
    };
    auto visitAll = [&](const Parents& parents, const std::string& t) {
      auto it = parents.find(t);
      if (it == parents.end()) return;
      for (const std::string& p : it->second) visit(p);
    };
    while (!pending.empty()) {
      const std::string t = std::move(pending.front());
      pending.pop_front();
      if (t == target) return true;
      const bool media = IsMediaType(t);
      if (!anyOf.empty() && media && MajorOf(t) == anyOf) return true;
      visitAll(mime.parents, t);
      visitAll(declared, t);
      if (media && MajorOf(t) == kTextMajor) visit(std::string(kTextPlain));
      if (!media || MajorOf(t) != kInodeMajor) visit(std::string(kOctetStream));
    }
    return false;
  }

  const MimeData& mimeData() {
    std::call_once(mimeOnce_, [this] { mime_ = LoadMimeData(options_.dataFolders); });
    return mime_;
  }

  std::shared_ptr<const Parents> declarations() {
    RegistryEntries entries;
    if (options_.registry) entries = options_.registry->allEntries();
    std::lock_guard lock(mu_);
    bool same = declared_ && entries.size() == declaredFrom_.size();
    for (size_t i = 0; same && i < entries.size(); ++i) same = entries[i] == declaredFrom_[i];
    if (!same) {
      declared_ = std::make_shared<const Parents>(LoadDeclarations(entries));
      declaredFrom_ = std::move(entries);
    }
    return declared_;
  }

  const TypeServiceOptions options_;
  std::once_flag mimeOnce_;
  MimeData mime_;  // written once under mimeOnce_

  std::mutex mu_;
  RegistryEntries declaredFrom_;             // guarded by mu_
  std::shared_ptr<const Parents> declared_;  // guarded by mu_
};

}  // namespace

std::vector<std::string> DataFoldersFromEnvironment(
    const std::function<const char*(const char*)>& getenv) {
  auto get = [&](const char* name) -> std::string {
    const char* v = getenv ? getenv(name) : std::getenv(name);
    return v ? std::string(v) : std::string();
  };
  std::vector<std::string> folders;
  if (std::string home = DataHome(getenv); !home.empty()) folders.push_back(home);
  std::string dirs = get("XDG_DATA_DIRS");
  if (dirs.empty()) dirs = kDefaultDataDirs;
  for (std::string& folder : SplitFolderList(dirs)) folders.push_back(std::move(folder));
  return folders;
}

std::unique_ptr<TypeService> NewTypeService(TypeServiceOptions options) {
  return std::make_unique<LinuxTypeService>(std::move(options));
}

}  // namespace dr
