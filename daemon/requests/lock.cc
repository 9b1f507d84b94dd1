// Holds: keeping plug-ins out of use while their bundles are replaced.
#include <optional>
#include <vector>

#include "core/format.h"
#include "daemon/requests/requests.h"
#include "wire/protocol.h"

namespace dr::requests {
namespace {

using namespace message;

// One entry of "conflicts": the running instance that makes a plug-in busy.
Value BusyDescription(const BusyInstance& instance) {
  return Value(Dictionary{
      {"pid", Value(static_cast<int64_t>(instance.pid))},
      {"path", Value(instance.bundlePath)},
      {"identifier", Value(instance.bundleIdentifier)},
      {"version", Value(instance.version)},
  });
}

}  // namespace

void lockDownPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds) {
  const Value tokens = Transaction::ArrayValue(t.request(), kUuidsKey);
  if (tokens.isPresent()) {
    for (const Value& token : tokens.array()) {
      if (std::optional<Uuid> uuid = token.uuid()) holds.unholdToken(*uuid);
    }
    t.done();
    return;
  }
  const uint64_t flags = t.request()[kFlagsKey].uintValue();
  std::vector<DRDPlugInPtr> plugIns;
  bool walked = t.marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      t.failMessage(kErrorBadPath, Format("invalid path: %@", path));
      return false;
    }
    if (flags == kHoldPlugIn) {
      DRDPlugInPtr p = database.findPlugInAtPath(path);
      if (!p) {
        t.failMessage(kErrorBadPath, Format("no plug-in at path:%@", path));
        return false;
      }
      plugIns.push_back(std::move(p));
      return true;
    }
    if (flags == kHoldApplication) {
      for (DRDPlugInPtr& p :
           database.plugInsWithinApplication(path).value_or(std::vector<DRDPlugInPtr>{})) {
        plugIns.push_back(std::move(p));
      }
      return true;
    }
    t.failMessage(kErrorMalformed, "invalid request format (unsupported hold flags)");
    return false;
  });
  if (!walked) return;

  // A single plug-in named by its path is held even while it runs: the
  // caller is replacing exactly that bundle.
  Array conflicts;
  Array busy;
  if (flags != kHoldPlugIn) {
    for (const DRDPlugInPtr& p : plugIns) {
      if (std::optional<BusyInstance> instance = p->checkBusy()) {
        conflicts.push_back(BusyDescription(*instance));
        busy.emplace_back(Format("%@(%@)", p->identifier(), p->uuid()));
      }
    }
  }
  if (!busy.empty()) {
    t.debug("hold rejected. Busy plug-ins:%@", Value(std::move(busy)));
    t.setReplyValue(kConflictsKey, Value(std::move(conflicts)));
    t.failMessage(kErrorBusy, "plug-ins are busy");
    return;
  }
  std::shared_ptr<DRDPlugInHold> hold =
      DRDPlugInHold::initWithPlugInsForClient(plugIns, t.client());
  holds.addHold(hold);
  t.setReplyValue(kUuidsKey, Value(hold->uuid()));
  t.debug("hold request granted uuid:%@", hold->uuid().string());
  t.done();
}

}  // namespace dr::requests
