#include "store/discovery_services.h"

#include <string_view>
#include <utility>

namespace dr {

bool MayDiscoverAll(const PlugInClient& host, bool sandboxed) {
  return host.hasEntitlement(kManagerEntitlement) && !sandboxed;
}

DiscoveryServices MakeDiscoveryServices(std::function<Value(const DRDPlugIn&)> annotation,
                                        std::function<Policy::PlugInJudge()> makeJudge,
                                        std::function<void(const std::string&)> log,
                                        std::function<void(const std::string&)> debug) {
  DiscoveryServices hooks;
  hooks.annotations = [annotation = std::move(annotation)](const DRDPlugIn& p) {
    Value stored = annotation(p);
    return stored.isDictionary() ? stored : DRPlugInCore::NoAnnotations();
  };
  if (makeJudge) {
    hooks.mayUse = [makeJudge = std::move(makeJudge),
                    judge = Policy::PlugInJudge()](std::string_view identifier) mutable {
      if (!judge) judge = makeJudge();
      return judge(identifier);
    };
  }
  hooks.log = std::move(log);
  hooks.debug = std::move(debug);
  return hooks;
}

}  // namespace dr
