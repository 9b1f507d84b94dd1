// Policy: the administrator's deny list of plug-ins (the configuration
// profile), from one pdoc dictionary file:
//
//   DeniedPlugIns         array of plug-in identifiers no host may use
//   DeniedPlugInsByHost   dictionary: host bundle identifier -> such an array
//
// A plug-in may be used unless the policy denies its identifier. No file:
// nothing is denied. The file is looked at (stat) on every question (once
// per judge of judgeForProcess) and read again when it changed. A broken file is logged once per
// version and the last policy read well stays in force (nothing denied if there was none).
// Thread-safe.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/file_system.h"
#include "platform/process_info.h"
#include "wire/locations.h"

namespace dr {

struct PolicyOptions {
  std::string path;
};

// DR_POLICY, else /etc/dromon/policy.pdoc.
PolicyOptions PolicyOptionsFromEnvironment(const EnvironmentLookup& getenv = nullptr);

class Policy {
 public:
  virtual ~Policy() = default;

  // Whether the host whose bundle identifier is `hostBundleIdentifier`
  // (empty for a host that lies in no bundle) may use the plug-in
  // `plugInIdentifier`.
  virtual bool mayHostUsePlugIn(std::string_view hostBundleIdentifier,
                                std::string_view plugInIdentifier) = 0;

  // The host identifier of the process `pid`: the "BNBundleIdentifier" of
  // the bundle its executable lies in, or empty when its executable or that
  // bundle cannot be found (such a process is judged by the list for every
  // host). A caller judging many plug-ins for one process asks this once.
  virtual std::string hostOfProcess(pid_t pid) = 0;

  // mayHostUsePlugIn for the host of the process `pid`.
  bool mayProcessUsePlugIn(pid_t pid, std::string_view plugInIdentifier) {
    return mayHostUsePlugIn(hostOfProcess(pid), plugInIdentifier);
  }

  // mayProcessUsePlugIn for many plug-ins at once (a discovery): the process's
  // host is found and the policy looked at once, when the judge is made, and
  // the judge answers by that version of the policy. The judge may outlive
  // the policy's next change but not the policy.
  using PlugInJudge = std::function<bool(std::string_view plugInIdentifier)>;
  virtual PlugInJudge judgeForProcess(pid_t pid) {
    return [this, host = hostOfProcess(pid)](std::string_view plugIn) {
      return mayHostUsePlugIn(host, plugIn);
    };
  }
};

// `processes` and `fs` must outlive the policy.
std::unique_ptr<Policy> MakeFilePolicy(PolicyOptions options,
                                       ProcessInfo* processes = ProcessInfo::Default(),
                                       FileSystem* fs = FileSystem::Default());

}  // namespace dr
