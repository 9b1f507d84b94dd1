// Where drd keeps its per-user runtime and configuration files, from the
// environment: DR_SOCKET_DIR (else $XDG_RUNTIME_DIR/dromon, else
// /tmp/dromon-<uid>) and XDG_CONFIG_HOME (else $HOME/.config). Only the
// functions that build a service's options from the environment call these;
// the services themselves take paths in their options. Stateless; any thread.
#pragma once

#include <functional>
#include <string>

namespace dr {

// Looks up an environment variable; nullptr when unset. Tests pass their own.
using EnvironmentLookup = std::function<const char*(const char*)>;

// The folder of the listening sockets and the sandbox key.
std::string SocketDirectory(const EnvironmentLookup& getenv = nullptr);

// The user's configuration folder; empty when neither XDG_CONFIG_HOME nor
// HOME is set.
std::string ConfigHome(const EnvironmentLookup& getenv = nullptr);

// The value of `name` when set and not empty; otherwise "".
std::string EnvironmentValue(const EnvironmentLookup& getenv, const char* name);

}  // namespace dr
