#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "wire/locations.h"

#include <vector>

namespace dr {

std::string EnvironmentValue(const EnvironmentLookup& getenv, const char* name) {
  const char* value = getenv ? getenv(name) : std::getenv(name);
  return value == nullptr ? std::string() : std::string(value);
}

std::string SocketDirectory(const EnvironmentLookup& getenv) {
  if (std::string dir = EnvironmentValue(getenv, "DR_SOCKET_DIR"); !dir.empty()) return dir;
  // Relative XDG folders are ignored, as the XDG base directory rules ask.
  if (std::string runtime = EnvironmentValue(getenv, "XDG_RUNTIME_DIR");
      !runtime.empty() && runtime[0] == '/') {
    return runtime + "/dromon";
  }
  return "/tmp/dromon-" + std::to_string(::getuid());
}

std::string ConfigHome(const EnvironmentLookup& getenv) {
  if (std::string config = EnvironmentValue(getenv, "XDG_CONFIG_HOME");
      !config.empty() && config[0] == '/') {
    return config;
  }
  if (std::string home = EnvironmentValue(getenv, "HOME"); !home.empty()) return home + "/.config";
  return std::string();
}

std::string HomeFolder(const EnvironmentLookup& getenv) {
  if (std::string home = EnvironmentValue(getenv, "HOME"); !home.empty()) return home;
  if (getenv) return std::string();
  // A daemon started without HOME still has an account.
  passwd pw;
  passwd* found = nullptr;
  std::vector<char> buffer(16384);
  if (::getpwuid_r(::getuid(), &pw, buffer.data(), buffer.size(), &found) == 0 && found &&
      found->pw_dir) {
    return found->pw_dir;
  }
  return std::string();
}

namespace {

// An XDG base folder: $variable when it is absolute, else <home>/fallback;
// "" when no absolute folder can be made.
std::string XdgFolder(const EnvironmentLookup& getenv, const char* variable, const char* fallback) {
  if (std::string folder = EnvironmentValue(getenv, variable);
      !folder.empty() && folder[0] == '/') {
    return folder;
  }
  std::string home = HomeFolder(getenv);
  return !home.empty() && home[0] == '/' ? home + "/" + fallback : std::string();
}

}  // namespace

std::string DataHome(const EnvironmentLookup& getenv) {
  return XdgFolder(getenv, "XDG_DATA_HOME", ".local/share");
}

std::string StateHome(const EnvironmentLookup& getenv) {
  return XdgFolder(getenv, "XDG_STATE_HOME", ".local/state");
}

std::string SandboxKeyPath(const EnvironmentLookup& getenv) {
  const std::string state = StateHome(getenv);
  return state.empty() ? std::string() : state + "/com.corvel.dromon/sandbox.key";
}

std::vector<std::string> SplitFolderList(std::string_view list) {
  std::vector<std::string> folders;
  size_t start = 0;
  while (start <= list.size()) {
    size_t colon = list.find(':', start);
    if (colon == std::string_view::npos) colon = list.size();
    std::string_view folder = list.substr(start, colon - start);
    if (!folder.empty() && folder[0] == '/') folders.emplace_back(folder);
    start = colon + 1;
  }
  return folders;
}

}  // namespace dr
