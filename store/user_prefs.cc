#include "store/user_prefs.h"

namespace dr {

Value DRDUserPrefs::exclusions() const {
  preferences_->synchronizeCurrentHost(kDomain);
  return preferences_->copyCurrentHostValue(kExclusionsKey, kDomain);
}

}  // namespace dr
