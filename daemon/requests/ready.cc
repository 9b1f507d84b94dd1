// Enabling plug-ins for the client.
#include <optional>
#include <set>
#include <vector>

#include "core/format.h"
#include "daemon/ipc_client.h"
#include "daemon/requests/requests.h"
#include "platform/probes.h"
#include "wire/protocol.h"

namespace dr::requests {
namespace {

using namespace message;

constexpr const char* kOnHoldReason = "the plug-in is on hold";

}  // namespace

void readyPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds) {
  std::vector<DRDPlugInPtr> toEnable;  // each plug-in once, in request order
  std::set<Uuid> seen;
  DRDIpcClient& client = *t.client();
  const pid_t pid = client.pid();
  bool checked = t.processUuidList(database, [&](const DRDPlugInPtr& p) {
    const std::string uuid = p->uuid() ? p->uuid()->string() : std::string();
    probes::PluginReady(uuid.c_str());
    if (holds.holdOnPlugIn(*p)) {
      t.debug("denied access to pid %d for plugin %@(%@): %@", pid, p->identifier(), uuid,
              kOnHoldReason);
      // A held plug-in is refused like any plug-in the host may not use.
      t.failMessage(kErrorNotPermitted,
                    Format("access to plugin %@ denied: %@", p->identifier(), kOnHoldReason));
      return false;
    }
    if (p->isData()) return true;  // nothing to enable
    if (std::optional<std::string> reason = p->allowForClient(client)) {
      t.debug("denied access to pid %d for plugin %@(%@): %@", pid, p->identifier(), uuid, *reason);
      t.failMessage(kErrorNotPermitted,
                    Format("access to plugin %@ denied: %@", p->identifier(), *reason));
      return false;
    }
    if (!p->uuid() || seen.insert(*p->uuid()).second) toEnable.push_back(p);
    return true;
  });
  if (!checked) return;
  // Every plug-in passed the checks; enable them all, even after a failure.
  Status firstFailure;
  for (const DRDPlugInPtr& p : toEnable) {
    Status enabled = p->enableForPid(pid);
    if (!enabled.ok() && firstFailure.ok()) firstFailure = std::move(enabled);
  }
  if (!firstFailure.ok()) {
    t.failError(kErrorMalformed, firstFailure.error());
  } else {
    t.done();
  }
}

}  // namespace dr::requests
