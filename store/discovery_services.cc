#include "store/discovery_services.h"

#include <utility>

#include "plugin/plugin_keys.h"
#include "wire/protocol.h"

namespace dr {

bool MayDiscoverAll(const PlugInClient& host, bool sandboxed) {
  return host.hasEntitlement(kManagerEntitlement) && !sandboxed;
}

DiscoveryServices MakeDiscoveryServices(std::function<Value(const DRDPlugIn&)> annotation,
                                        std::function<Policy::PlugInJudge()> makeJudge,
                                        std::function<void(const std::string&)> log,
                                        std::function<void(const std::string&)> debug) {
  DiscoveryServices hooks;
  hooks.addAnnotation = [annotation = std::move(annotation)](const DRDPlugIn& p, Dictionary& form) {
    Value stored = annotation(p);
    form[message::kAnnotationsKey] =
        stored.isDictionary() ? std::move(stored) : DRPlugInCore::NoAnnotations();
  };
  if (makeJudge) {
    hooks.mayUse = [makeJudge = std::move(makeJudge),
                    judge = Policy::PlugInJudge()](const Value& form) mutable {
      if (!judge) judge = makeJudge();
      return judge(form[kFormIdentifierKey].stringValue());
    };
  }
  hooks.log = std::move(log);
  hooks.debug = std::move(debug);
  return hooks;
}

}  // namespace dr
