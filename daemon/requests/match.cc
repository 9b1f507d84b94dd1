// Discovery: the installed plug-ins one client is offered.
#include <memory>
#include <optional>
#include <vector>

#include "daemon/ipc_client.h"
#include "daemon/requests/requests.h"
#include "platform/probes.h"
#include "plugin/discovery.h"
#include "store/discovery_services.h"
#include "wire/protocol.h"

namespace dr::requests {

using namespace message;

void matchPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds, DRDUserPrefs& prefs,
                  Sandbox* sandbox, Policy* policy) {
  const Value& rules = t.request()[kRulesKey];
  if (rules.isPresent() && !rules.isDictionary()) {
    t.failMessage(kErrorMalformed, "invalid request format (bad rules dictionary)");
    return;
  }
  const Value& flagsValue = t.request()[kFlagsKey];
  const uint64_t flags = flagsValue.type() == Value::Type::kUInt ? flagsValue.uintValue() : 0;
  DRDIpcClient& client = *t.client();
  const pid_t pid = client.pid();
  if (flags & kDiscoverAll) {
    if (!MayDiscoverAll(client, !sandbox || sandbox->isSandboxed(pid))) {
      t.failMessage(kErrorNotPermitted, kDiscoverAllRefused);
      return;
    }
  }

  DiscoveryHost host;
  host.client = &client;
  if (const std::shared_ptr<DRBundle>& bundle = client.bundle()) {
    host.plugInsPath = bundle->plugInsPath();
    host.bundleIdentifier = bundle->bundleIdentifier().value_or("");
  }
  const bool needs17732150Workaround = client.needs17732150Workaround();
  host.needs17732150Workaround = needs17732150Workaround;
  // One judge per request: the host (its executable and Info file) and the
  // policy file are looked at once, not once per form.
  std::function<Policy::PlugInJudge()> makeJudge;
  if (policy) makeJudge = [policy, pid] { return policy->judgeForProcess(pid); };
  DiscoveryServices hooks = MakeDiscoveryServices(
      [&database](const DRDPlugIn& p) { return database.annotationForPlugIn(p); },
      std::move(makeJudge), [&t](const std::string& line) { t.log("%@", line); },
      [&t](const std::string& line) { t.debug("%@", line); });
  hooks.isHeld = [&holds](const DRDPlugIn& p) { return holds.holdOnPlugIn(p); };
  Discovery discovery(std::move(host), rules, flags, prefs.exclusions(), std::move(hooks));

  const std::shared_ptr<const PlugInSet> candidates = database.installedPlugIns();
  probes::DiscoverRaw(static_cast<uint32_t>(candidates->size()));
  const std::vector<DRDPlugInPtr>& records = candidates->records();
  // Only the candidates whose examination can tell are examined: the rest
  // would be skipped without a trace.
  if (std::optional<std::vector<uint32_t>> chosen =
          CandidatesToExamine(*candidates, rules, flags, needs17732150Workaround)) {
    for (uint32_t position : *chosen) discovery.examine(records[position]);
  } else {
    for (const DRDPlugInPtr& candidate : records) discovery.examine(candidate);
  }
  t.setReplyForms(kMatchesKey, discovery.finish());
  t.done();
}

}  // namespace dr::requests
