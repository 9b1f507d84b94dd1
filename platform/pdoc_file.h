// pdoc files on disk: read and parsed, or written atomically and durably,
// through a FileSystem. Stateless; any thread.
#pragma once

#include <sys/types.h>

#include <string>

#include "core/status.h"
#include "core/value.h"
#include "pdoc/pdoc.h"
#include "platform/file_system.h"

namespace dr::pdoc {

// Reads and parses the file at `path`; file errors as FileSystem::readFile.
Result<Value> ReadFile(const std::string& path, FileSystem* fs = FileSystem::Default());

// Writes `value` in the XML form to `path` atomically and durably.
Status WriteFile(const std::string& path, const Value& value, mode_t mode = 0600,
                 FileSystem* fs = FileSystem::Default());

}  // namespace dr::pdoc
