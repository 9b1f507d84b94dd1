// Registering and unregistering bundles.
#include "core/format.h"
#include "core/log.h"
#include "daemon/requests/requests.h"
#include "platform/probes.h"
#include "wire/protocol.h"

namespace dr::requests {

using namespace message;

void addPlugIns(Transaction& t, DRDatabase& database) {
  t.processPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      t.failMessage(kErrorBadPath, Format("invalid plugin path: %@", path));
      return false;
    }
    probes::PluginAdd(path.c_str());
    if (!database.addPlugIn(path).ok()) {
      SystemLog("failed to register plug-in at %@", path);
      t.failMessage(kErrorRegistration, Format("unable to register plug-in at %@", path));
      return false;
    }
    return true;
  });
}

void removePlugIns(Transaction& t, DRDatabase& database) {
  t.processPaths([&](const std::string& path, bool resolved) {
    probes::PluginRemove(path.c_str(), resolved);
    // A bundle deleted from disk is unregistered under the path as sent.
    if (!database.removePlugIn(path).ok()) {
      t.failMessage(kErrorBadPath, Format("no plugin at %@", path));
      return false;
    }
    return true;
  });
}

void bulkPlugIns(Transaction& t) {
  SystemLog("bulk options 0x%lx not supported", t.request()[kFlagsKey].uintValue());
  t.done();
}

}  // namespace dr::requests
