#include <unistd.h>

#include <cstdlib>
#include <string>

#include "platform/locations.h"

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

}  // namespace dr
