// Where drd keeps its per-user runtime and configuration files, from the
// environment: DR_SOCKET_DIR (else $XDG_RUNTIME_DIR/dromon, else
// /tmp/dromon-<uid>) and XDG_CONFIG_HOME (else $HOME/.config). Only the
// functions that build a service's options from the environment call these;
// the services themselves take paths in their options. Stateless; any thread.
#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace dr {

// Looks up an environment variable; nullptr when unset. Tests pass their own.
using EnvironmentLookup = std::function<const char*(const char*)>;

// The folder of the listening sockets.
std::string SocketDirectory(const EnvironmentLookup& getenv = nullptr);

// The user's configuration folder; empty when neither XDG_CONFIG_HOME nor
// HOME is set.
std::string ConfigHome(const EnvironmentLookup& getenv = nullptr);

// The user's home folder: $HOME, else (for the process's own environment
// only: an injected one stands for a whole world) the account's home folder;
// "" when neither is known.
std::string HomeFolder(const EnvironmentLookup& getenv = nullptr);

// The user's data folder: $XDG_DATA_HOME when it is absolute, else
// <home>/.local/share; "" when no absolute folder can be made.
std::string DataHome(const EnvironmentLookup& getenv = nullptr);

// The user's state folder: $XDG_STATE_HOME when it is absolute, else
// <home>/.local/state; "" when no absolute folder can be made.
std::string StateHome(const EnvironmentLookup& getenv = nullptr);

// Where drd keeps the key of its read tokens:
// <StateHome>/com.corvel.dromon/sandbox.key; "" when there is no state
// folder.
std::string SandboxKeyPath(const EnvironmentLookup& getenv = nullptr);

// The absolute folders of a colon-separated list, in order. Empty and
// relative entries are dropped, as the XDG rules ask of their lists.
std::vector<std::string> SplitFolderList(std::string_view list);

// The value of `name` when set and not empty; otherwise "".
std::string EnvironmentValue(const EnvironmentLookup& getenv, const char* name);

}  // namespace dr
