#include "registry/scan.h"

#include <sodium.h>
#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>

#include "core/format.h"
#include "pdoc/pdoc.h"
#include "platform/file_system.h"

namespace dr::registry_internal {
namespace {

constexpr const char* kInfoFile = "Contents/Info.pdoc";
constexpr const char* kEntitlementsFile = "Contents/Entitlements.pdoc";
// Information and entitlements dictionaries are small; a larger file is
// refused rather than read, so a hostile bundle cannot exhaust memory.
constexpr size_t kMaxBundleFile = size_t{16} << 20;

Error Refused(const std::string& url, const std::string& reason) {
  return Error(kRegistryErrorDomain, kRegistryRefused,
               Format("cannot register \"%@\": %@", url, reason));
}

// A string value that is not empty.
std::optional<std::string> NonEmptyString(const Value& v) {
  if (auto s = v.string(); s && !s->empty()) return std::string(*s);
  return std::nullopt;
}

std::optional<std::string> DisplayNameOf(const Value& info) {
  if (auto name = NonEmptyString(info["BNBundleDisplayName"])) return name;
  return NonEmptyString(info["BNBundleName"]);
}

// A version is text; a JSON author may write a plain number, which reads as
// its decimal text.
std::optional<std::string> VersionOf(const Value& v) {
  if (v.isString()) return NonEmptyString(v);
  if (v.isInteger()) return v.description();
  return std::nullopt;
}

// The dictionary that declares the bundle's plug-ins: "UXExtension", else the
// old-style "Dromon"; absent when neither is a dictionary.
const Value& TopOf(const Value& info, bool* oldStyle) {
  *oldStyle = false;
  if (info["UXExtension"].isDictionary()) return info["UXExtension"];
  *oldStyle = true;
  if (info["Dromon"].isDictionary()) return info["Dromon"];
  return AbsentValue();
}

}  // namespace

std::string HashFiles(std::string_view info, std::optional<std::string_view> entitlements,
                      std::optional<std::string_view> more, size_t bytes) {
  static const int sodiumReady = sodium_init();  // thread-safe, once
  (void)sodiumReady;
  crypto_generichash_state state;
  crypto_generichash_init(&state, nullptr, 0, bytes);
  // Length-prefixed, so that no two pairs of files hash the same input.
  auto add = [&](std::string_view piece) {
    uint64_t size = piece.size();
    crypto_generichash_update(&state, reinterpret_cast<const unsigned char*>(&size), sizeof size);
    crypto_generichash_update(&state, reinterpret_cast<const unsigned char*>(piece.data()),
                              piece.size());
  };
  add(info);
  const unsigned char hasEntitlements = entitlements.has_value() ? 1 : 0;
  crypto_generichash_update(&state, &hasEntitlements, 1);
  if (entitlements) add(*entitlements);
  if (more) add(*more);
  std::string out(bytes, '\0');
  crypto_generichash_final(&state, reinterpret_cast<unsigned char*>(out.data()), out.size());
  return out;
}

namespace {

// The plug-ins a top dictionary declares, or the reason it declares none.
Result<std::vector<ScannedPlugIn>> PlugInsOf(const std::string& url, const Value& info,
                                             const Value& top, bool oldStyle) {
  std::vector<ScannedPlugIn> out;
  if (top.has("Multiple")) {
    const Value& multiple = top["Multiple"];
    if (!multiple.isDictionary() || multiple.size() == 0) {
      return Refused(url, "\"Multiple\" is not a dictionary of plug-ins");
    }
    for (const auto& [identifier, section] : multiple.dictionary()) {
      if (identifier.empty()) return Refused(url, "\"Multiple\" has an empty plug-in identifier");
      if (!section.isDictionary()) {
        return Refused(url,
                       Format("plug-in \"%@\" of \"Multiple\" is not a dictionary", identifier));
      }
      out.push_back({identifier.str(), true});
    }
    return out;
  }
  // One plug-in, named by its attributes, else by the bundle. An old-style
  // section names its attributes "Attributes" and the identifier in them
  // "com.corvel.identifier"; the model converts both to the new names later,
  // so they are read here under the old names to give the same identifier.
  std::optional<std::string> identifier =
      oldStyle ? NonEmptyString(top["Attributes"]["com.corvel.identifier"])
               : NonEmptyString(top["UXExtensionAttributes"]["UXExtensionIdentifier"]);
  if (!identifier) identifier = NonEmptyString(info["BNBundleIdentifier"]);
  if (!identifier) {
    return Refused(url,
                   "the plug-in has no identifier (no \"UXExtensionIdentifier\" "
                   "attribute and no \"BNBundleIdentifier\")");
  }
  out.push_back({std::move(*identifier), false});
  return out;
}

// The nearest enclosing "*.app" folder whose Contents/PlugIns/ holds `path`
// (at any depth), with its display name.
std::optional<RegistryApplication> ContainingApplicationOf(const std::string& path,
                                                           FileSystem* fs) {
  for (size_t slash = path.rfind('/'); slash != std::string::npos && slash > 0;
       slash = path.rfind('/', slash - 1)) {
    const std::string ancestor = path.substr(0, slash);
    const size_t nameStart = ancestor.rfind('/') + 1;
    if (ancestor.size() - nameStart <= 4 || !ancestor.ends_with(".app")) continue;
    const std::string plugIns = ancestor + "/Contents/PlugIns";
    if (path.size() <= plugIns.size() || !LiesUnder(path, plugIns)) continue;
    RegistryApplication app{ancestor, std::nullopt};
    // The application's own Info.pdoc only supplies its name; an application
    // without a readable one still contains the plug-in, without a name.
    if (auto bytes = fs->readFile(ancestor + "/" + kInfoFile, kMaxBundleFile); bytes.ok()) {
      if (auto info = pdoc::Parse(*bytes); info.ok()) app.displayName = DisplayNameOf(*info);
    }
    return app;
  }
  return std::nullopt;
}

// Reads a dictionary file of the bundle. `required` false: a missing file
// answers nothing.
Result<std::optional<std::string>> ReadDictionaryFile(const std::string& url,
                                                      const std::string& bundle, const char* name,
                                                      bool required, FileSystem* fs,
                                                      Value* parsed) {
  auto bytes = fs->readFile(bundle + "/" + name, kMaxBundleFile);
  if (!bytes.ok()) {
    if (bytes.error().domain() == kFileErrorDomain &&
        bytes.error().code() == kFileReadNoSuchFileError) {
      if (!required) return std::optional<std::string>();
      return Refused(url, Format("not a plug-in bundle (no %@)", name));
    }
    return Refused(url, Format("cannot read %@: %@", name, bytes.error().localizedDescription()));
  }
  auto value = pdoc::Parse(*bytes);
  if (!value.ok()) {
    return Refused(url, Format("%@ is not a valid pdoc document: %@", name,
                               value.error().localizedDescription()));
  }
  if (!value->isDictionary()) return Refused(url, Format("%@ does not hold a dictionary", name));
  *parsed = std::move(*value);
  return std::optional<std::string>(std::move(*bytes));
}

}  // namespace

std::string LexicalPath(std::string_view path) {
  if (path.empty() || path.front() != '/') return "";
  std::vector<std::string_view> parts;
  size_t pos = 0;
  while (pos < path.size()) {
    size_t next = path.find('/', pos);
    if (next == std::string_view::npos) next = path.size();
    std::string_view part = path.substr(pos, next - pos);
    if (part == "..") {
      if (!parts.empty()) parts.pop_back();
    } else if (!part.empty() && part != ".") {
      parts.push_back(part);
    }
    pos = next + 1;
  }
  if (parts.empty()) return "/";
  std::string out;
  for (std::string_view part : parts) {
    out += '/';
    out += part;
  }
  return out;
}

std::optional<std::string> CanonicalPath(const std::string& path) {
  Result<std::string> resolved = dr::CanonicalPath(path);
  if (!resolved.ok()) return std::nullopt;
  return std::move(resolved).value();
}

bool LiesUnder(std::string_view path, std::string_view root) {
  if (root == "/") return path.starts_with('/');
  return path.starts_with(root) && (path.size() == root.size() || path[root.size()] == '/');
}

Value PlugInDictionaryOf(const Value& info, const std::string& identifier, bool multiple) {
  bool oldStyle = false;
  const Value& top = TopOf(info, &oldStyle);
  return multiple ? top["Multiple"][identifier] : top;
}

Result<ScannedBundle> ScanBundle(const std::string& url,
                                 const std::vector<std::string>& systemRoots, FileSystem* fs) {
  if (url.empty() || url.front() != '/') return Refused(url, "not an absolute path");
  std::optional<std::string> path = CanonicalPath(url);
  if (!path) return Refused(url, PosixError(errno, "resolve").localizedDescription());
  struct stat st;
  if (::stat(path->c_str(), &st) != 0) {
    return Refused(url, PosixError(errno, "stat").localizedDescription());
  }
  if (!S_ISDIR(st.st_mode)) return Refused(url, "not a plug-in bundle (not a folder)");
  if (!TextCanTravel(*path)) return Refused(url, Format("its path \"%@\" is not UTF-8", *path));

  ScannedBundle out;
  out.path = *path;
  Value info;
  auto infoBytes = ReadDictionaryFile(url, out.path, kInfoFile, true, fs, &info);
  if (!infoBytes.ok()) return infoBytes.error();
  out.infoBytes = std::move(**infoBytes);
  Value entitlements;
  auto entitlementsBytes =
      ReadDictionaryFile(url, out.path, kEntitlementsFile, false, fs, &entitlements);
  if (!entitlementsBytes.ok()) return entitlementsBytes.error();
  out.entitlementsBytes = std::move(*entitlementsBytes);

  // Checked on the parsed values: a JSON file may spell a NUL as an escape.
  for (const auto& [name, dictionary] :
       {std::pair{kInfoFile, &info}, std::pair{kEntitlementsFile, &entitlements}}) {
    if (auto why = WhyCannotTravel(*dictionary)) {
      return Refused(url, Format("%@ cannot be carried in a reply: %@", name, *why));
    }
  }

  bool oldStyle = false;
  const Value& top = TopOf(info, &oldStyle);
  if (!top.isDictionary()) {
    return Refused(
        url, Format("%@ holds neither \"UXExtension\" nor \"Dromon\" as a dictionary", kInfoFile));
  }
  auto plugIns = PlugInsOf(url, info, top, oldStyle);
  if (!plugIns.ok()) return plugIns.error();
  out.plugIns = std::move(*plugIns);

  out.contentHash = HashFiles(out.infoBytes, out.entitlementsBytes);
  out.bundleIdentifier = NonEmptyString(info["BNBundleIdentifier"]);
  out.bundleVersion = VersionOf(info["BNBundleVersion"]);
  out.displayName = DisplayNameOf(info);
  out.shortName = NonEmptyString(info["BNBundleShortName"]);
  for (const std::string& root : systemRoots) {
    if (LiesUnder(out.path, root)) out.onSystemVolume = true;
  }
  out.containingApplication = ContainingApplicationOf(out.path, fs);
  if (const auto& app = out.containingApplication;
      app && app->displayName && !TextCanTravel(*app->displayName)) {
    return Refused(url,
                   Format("the name of its application %@ is not UTF-8 or holds NUL", app->url));
  }
  // What the files read as now is what their stored bytes read as later.
  if (!entitlements.isPresent()) entitlements = Value::EmptyDictionary();
  out.parsed = ParsedFiles{std::move(info), std::move(entitlements)};
  out.parsedCopy = EncodeParsedCopy(*out.parsed, out.infoBytes, out.entitlementsBytes);
  return out;
}

}  // namespace dr::registry_internal
