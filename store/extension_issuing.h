// Issuing read-only sandbox extension tokens for plug-in files, for the
// access request and the resource tokens sent with a plug-in's form.
//
// Stateless apart from the sandbox it is handed; called on the service
// queue. A failure answers nothing and leaves errno saying why.
#pragma once

#include <optional>
#include <string>

#include "platform/sandbox.h"

namespace dr {

// A token that grants reading the canonical form of `path` (the path of a
// file URL, UTF-8), or nothing with errno set: a path that does not exist
// fails with ENOENT, as resolving it does.
std::optional<std::string> issueReadExtensionForURL(Sandbox* sandbox, const std::string& path);

}  // namespace dr
