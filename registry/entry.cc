// Registry entries, their lazily parsed dictionaries, what may travel in a
// reply, and the registry's options from the environment.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <vector>

#include "core/format.h"
#include "core/utf8.h"
#include "platform/types.h"
#include "registry/parsed_copy.h"
#include "registry/registry.h"
#include "registry/scan.h"
#include "registry/types_linux.h"
#include "wire/locations.h"

namespace dr {
namespace {

// The first string or key of `value` that cannot travel, or nesting past
// `levelsLeft`; `value` itself takes one level when it is a collection.
std::optional<std::string> FirstUntravelable(const Value& value, size_t levelsLeft) {
  auto text = [](std::string_view t) -> std::optional<std::string> {
    if (TextCanTravel(t)) return std::nullopt;
    return Format("the text \"%@\" is not UTF-8 or holds NUL", EscapeInvalidUtf8(t));
  };
  if (value.isString()) return text(value.stringValue());
  if (!value.isArray() && !value.isDictionary()) return std::nullopt;
  if (levelsLeft == 0) {
    return Format("it nests deeper than the %@ levels a reply can carry", kMaxTravellingDepth);
  }
  if (value.isArray()) {
    for (const Value& element : value.array()) {
      if (auto why = FirstUntravelable(element, levelsLeft - 1)) return why;
    }
    return std::nullopt;
  }
  for (const auto& [key, element] : value.dictionary()) {
    if (auto why = text(key.view())) return why;
    if (auto why = FirstUntravelable(element, levelsLeft - 1)) return why;
  }
  return std::nullopt;
}

}  // namespace

bool TextCanTravel(std::string_view text) {
  if (std::memchr(text.data(), '\0', text.size()) != nullptr) return false;
  // Most text is ASCII: skip it eight bytes at a time.
  size_t i = 0;
  for (uint64_t word; i + 8 <= text.size(); i += 8) {
    std::memcpy(&word, text.data() + i, 8);
    if (word & 0x8080808080808080u) break;
  }
  return IsValidUtf8(text.substr(i));
}

std::optional<std::string> WhyCannotTravel(const Value& value) {
  return FirstUntravelable(value, kMaxTravellingDepth);
}

RegistryBundleFiles::RegistryBundleFiles(std::string infoBytes,
                                         std::optional<std::string> entitlementsBytes)
    : infoBytes_(std::move(infoBytes)), entitlementsBytes_(std::move(entitlementsBytes)) {}

RegistryBundleFiles::RegistryBundleFiles(Parsed, Value info, Value entitlements)
    : info_(std::move(info)), entitlements_(std::move(entitlements)) {
  std::call_once(parsed_, [] {});  // nothing left to parse
}

void RegistryBundleFiles::parse() const {
  std::call_once(parsed_, [this] {
    registry_internal::ParsedFiles parsed =
        registry_internal::ParseFiles(infoBytes_, entitlementsBytes_);
    info_ = std::move(parsed.info);
    entitlements_ = std::move(parsed.entitlements);
    // The parsed values are all that is read from now on.
    std::string().swap(infoBytes_);
    entitlementsBytes_.reset();
  });
}

const Value& RegistryBundleFiles::infoDictionary() const {
  parse();
  return info_;
}

const Value& RegistryBundleFiles::entitlements() const {
  parse();
  return entitlements_;
}

RegistryEntry::RegistryEntry(Fields fields, std::shared_ptr<const RegistryBundleFiles> files)
    : f_(std::move(fields)), files_(std::move(files)) {}

const Value& RegistryEntry::plugInDictionary() const {
  std::call_once(plugInOnce_, [this] {
    plugIn_ =
        registry_internal::PlugInDictionaryOf(infoDictionary(), f_.plugInIdentifier, f_.multiple);
  });
  return plugIn_;
}

std::string BundleFileStamp(const std::string& path) {
  std::string stamp;
  for (const char* file : {"/Contents/Info.pdoc", "/Contents/Entitlements.pdoc"}) {
    struct stat st {};
    if (::stat((path + file).c_str(), &st) != 0) {
      if (stamp.empty()) return "";  // no Info.pdoc: nothing to compare
      stamp += "-";
      continue;
    }
    for (long long n :
         {static_cast<long long>(st.st_size), static_cast<long long>(st.st_mtim.tv_sec),
          static_cast<long long>(st.st_mtim.tv_nsec), static_cast<long long>(st.st_ino),
          static_cast<long long>(st.st_dev)}) {
      stamp += std::to_string(n);
      stamp += ',';
    }
    stamp += ';';
  }
  return stamp;
}

std::string RegistryEntry::description() const {
  return Format("%@ %@ at %@", f_.plugInIdentifier, f_.uuid, f_.url);
}

Result<RegistryOptions> RegistryOptionsFromEnvironment(
    const std::function<const char*(const char*)>& getenv) {
  auto get = [&](const char* name) -> std::string {
    const char* value = getenv ? getenv(name) : std::getenv(name);
    return value ? value : "";
  };
  RegistryOptions options;
  if (std::string registry = get("DR_REGISTRY"); !registry.empty()) {
    options.databasePath = registry;
  } else {
    std::string dataHome = DataHome(getenv);
    if (dataHome.empty()) {
      return Error(kRegistryErrorDomain, kRegistryStorage,
                   "no location for the registry database: neither DR_REGISTRY, "
                   "XDG_DATA_HOME nor a home folder is known");
    }
    options.databasePath = dataHome + "/dromon/registry.sqlite3";
  }
  if (std::string roots = get("DR_SYSTEM_ROOTS"); !roots.empty()) {
    options.systemRoots = SplitFolderList(roots);
  }
  // Set but empty means no install folder at all.
  if (const char* path = getenv ? getenv("DR_PLUGIN_PATH") : std::getenv("DR_PLUGIN_PATH")) {
    options.installFolders = SplitFolderList(path);
  } else {
    for (const std::string& data : DataFoldersFromEnvironment(getenv)) {
      options.installFolders.push_back(data + "/dromon/PlugIns");
    }
  }
  for (std::string& folder : options.installFolders) {
    folder = registry_internal::LexicalPath(folder);
  }
  return options;
}

}  // namespace dr
