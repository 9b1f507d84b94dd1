#include "platform/pdoc_file.h"

namespace dr::pdoc {

Result<Value> ReadFile(const std::string& path, FileSystem* fs) {
  Result<std::string> bytes = fs->readFile(path);
  if (!bytes.ok()) return bytes.error();
  Result<Value> value = Parse(*bytes);
  if (!value.ok()) {
    const Error& e = value.error();
    return Error(e.domain(), e.code(), path + ": " + e.localizedDescription());
  }
  return value;
}

Status WriteFile(const std::string& path, const Value& value, mode_t mode, FileSystem* fs) {
  Result<std::string> xml = WriteXml(value);
  if (!xml.ok()) return xml.error();
  return fs->writeFileAtomically(path, *xml, mode);
}

}  // namespace dr::pdoc
