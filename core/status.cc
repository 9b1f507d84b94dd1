#include "core/status.h"

#include <cstring>

namespace dr {

std::string Error::localizedDescription() const {
  if (description_) return *description_;
  return domain_ + " error " + std::to_string(code_);
}

std::string Error::description() const {
  std::string s = domain_ + " error " + std::to_string(code_);
  if (description_) s += ": " + *description_;
  return s;
}

Error PosixError(int errnum, const std::string& what) {
  char buf[256];
  // The GNU strerror_r answers a pointer that may or may not be buf.
  const char* text = strerror_r(errnum, buf, sizeof buf);
  return Error(kPosixErrorDomain, errnum, what + ": " + text);
}

}  // namespace dr
