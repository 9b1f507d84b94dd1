// PlugInClient: what authorizing a host needs to know about it. The daemon's
// client connection (DRDIpcClient) implements it; it is declared here because
// plugin/ lies below daemon/. Implementations answer from data fixed when the
// connection was made and may be called from the service queue at any time.
#pragma once

#include <sys/types.h>

#include <string_view>

#include "core/value.h"

namespace dr {

class PlugInClient {
 public:
  virtual ~PlugInClient() = default;

  // The host's process.
  virtual pid_t pid() const = 0;
  // The value (any type) of the host's entitlement `key`; absent when the
  // host does not have it or its entitlements cannot be read.
  virtual Value entitlementValueForKey(std::string_view key) const = 0;
  // Held: present and not the boolean false.
  virtual bool hasEntitlement(std::string_view key) const = 0;
};

}  // namespace dr
