// DRDUserPrefs: the user's plug-in exclusions, a preference that programs
// other than drd set.
//
// Owned by the server for the life of the process; holds no state of its own
// and reads the preference afresh on every call, so a change made while drd
// runs counts from the next call. Safe from any thread. A missing or broken
// preferences file reads as no exclusions.
#pragma once

#include "core/value.h"
#include "platform/preferences.h"

namespace dr {

class DRDUserPrefs {
 public:
  static constexpr const char* kDomain = "com.corvel.dromon.userprefs";
  static constexpr const char* kExclusionsKey = "exclusions";

  // `preferences` must outlive this object.
  explicit DRDUserPrefs(Preferences* preferences) : preferences_(preferences) {}

  // The stored "exclusions" value of the current user on the current host,
  // as it is (expected: an array of rules dictionaries), or absent. The
  // same domain stored for any host is not consulted.
  Value exclusions() const;

 private:
  Preferences* preferences_;
};

}  // namespace dr
