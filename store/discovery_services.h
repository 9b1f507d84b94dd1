// The hooks a Discovery asks of its surroundings, built one way for drd's
// "match" request and for drkit explain, so that both put the user's
// annotations into forms, judge forms by the administrator's policy and
// pass log lines on alike.
//
// The hooks are called on the Discovery's thread and hold what they are
// given; whatever the functions refer to must outlive the Discovery.
#pragma once

#include <functional>
#include <string>

#include "core/value.h"
#include "platform/policy.h"
#include "plugin/discovery.h"

namespace dr {

// Whether `host` may ask for message::kDiscoverAll: it must hold the manager
// entitlement and not be sandboxed. The refusal's text is
// kDiscoverAllRefused.
bool MayDiscoverAll(const PlugInClient& host, bool sandboxed);
inline constexpr const char* kDiscoverAllRefused = "unauthorized discovery flag (DRDiscoverAll)";

// `annotation` answers the user's stored annotation of a plug-in (anything
// but a dictionary counts as none: the form gets an empty dictionary).
// `makeJudge` makes the policy's judge of the host; it is called once, when
// the first form is judged, so the host and the policy file are looked at
// once per discovery, not once per form; unset: nothing is vetoed. `log` is
// always written, `debug` when verbose. No plug-in is held: the caller sets
// isHeld where holds exist.
DiscoveryServices MakeDiscoveryServices(std::function<Value(const DRDPlugIn&)> annotation,
                                        std::function<Policy::PlugInJudge()> makeJudge,
                                        std::function<void(const std::string&)> log,
                                        std::function<void(const std::string&)> debug);

}  // namespace dr
