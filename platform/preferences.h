// Preferences: per-user key/value settings, one pdoc dictionary per domain.
//
// Domain D of the current user on the current host lives in
//   <config home>/dromon/ByHost/D.<host id>.pdoc
// and the same domain for any host in <config home>/dromon/D.pdoc. Other
// programs write these files; every read goes to the file afresh, so their
// changes are seen at the next read. A missing file holds nothing; a file
// that is not a readable dictionary holds nothing and is logged once (until
// it changes). Thread-safe; drd only reads.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "core/value.h"
#include "platform/file_system.h"
#include "wire/locations.h"

namespace dr {

struct PreferencesOptions {
  std::string directory;  // <config home>/dromon
  std::string hostId;     // names the current host's files
};

// directory from XDG_CONFIG_HOME (else ~/.config); hostId is the content of
// /etc/machine-id without surrounding white space, else the host name.
PreferencesOptions PreferencesOptionsFromEnvironment(const EnvironmentLookup& getenv = nullptr);

// The file of `domain` for the current user and host (for the programs that
// write preferences); empty when `domain` cannot name a file.
std::string CurrentHostPreferencesFile(const PreferencesOptions& options, std::string_view domain);

class Preferences {
 public:
  virtual ~Preferences() = default;

  // Makes values other processes wrote visible to the next read of `domain`
  // for the current user and host.
  virtual void synchronizeCurrentHost(std::string_view domain) = 0;

  // The value of `key` in `domain` for the current user and host, as stored;
  // absent when there is none.
  virtual Value copyCurrentHostValue(std::string_view key, std::string_view domain) = 0;
};

std::unique_ptr<Preferences> MakeFilePreferences(PreferencesOptions options,
                                                 FileSystem* fs = FileSystem::Default());

}  // namespace dr
