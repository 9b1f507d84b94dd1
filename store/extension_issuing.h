// Issuing read-only sandbox extension tokens for plug-in files, for the
// access request and the resource tokens sent with a plug-in's form.
//
// Stateless apart from the sandbox it is handed; called on the service
// queue. A failure is an error of kPosixErrorDomain whose code says why.
#pragma once

#include <string>

#include "core/status.h"
#include "platform/sandbox.h"

namespace dr {

// A token that grants reading the canonical form of `path` (the path of a
// file URL, UTF-8), which must be the bundle at `bundle` (its canonical path
// as registered) or lie inside it; or a POSIX error: ENOENT for a path that
// does not exist, EACCES for one that resolves outside the bundle, as every
// path of a bundle does once its folder is swapped for a symbolic link, and
// EINVAL for a failure that has no system error number, ENOKEY without a
// sandbox (null). The token names the path that was checked, resolved once.
Result<std::string> issueReadExtensionForURL(Sandbox* sandbox, const std::string& path,
                                             const std::string& bundle);

}  // namespace dr
