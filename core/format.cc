#include "core/format.h"

#include <cstdio>
#include <cstring>

namespace dr {
namespace {

// Renders one printf conversion with `spec` (flags, width, precision) and the
// conversion character `conv` through snprintf, whose argument type we pick.
template <typename T>
void AppendPrintf(std::string& out, const std::string& spec, const char* length, char conv,
                  T value) {
  std::string f = "%" + spec + length + conv;
  char small[128];
  int n = std::snprintf(small, sizeof small, f.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof small) {
    out.append(small, static_cast<size_t>(n));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), f.c_str(), value);
  big.resize(static_cast<size_t>(n));
  out += big;
}

std::string AsText(const FormatArg& a) {
  switch (a.kind) {
    case FormatArg::Kind::kInt:
      return std::to_string(a.i);
    case FormatArg::Kind::kUInt:
      return std::to_string(a.u);
    case FormatArg::Kind::kDouble: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "%g", a.d);
      return buf;
    }
    case FormatArg::Kind::kPointer: {
      char buf[32];
      std::snprintf(buf, sizeof buf, "%p", a.p);
      return buf;
    }
    case FormatArg::Kind::kText:
      return a.text;
  }
  return {};
}

}  // namespace

std::string FormatList(std::string_view format, std::span<const FormatArg> args) {
  std::string out;
  out.reserve(format.size() + 16 * args.size());
  size_t next = 0;
  size_t i = 0;
  while (i < format.size()) {
    char c = format[i];
    if (c != '%') {
      out += c;
      ++i;
      continue;
    }
    size_t start = ++i;
    if (i < format.size() && format[i] == '%') {
      out += '%';
      ++i;
      continue;
    }
    // flags, width, precision
    while (i < format.size() && std::strchr("-+ #0", format[i]) != nullptr) ++i;
    while (i < format.size() && format[i] >= '0' && format[i] <= '9') ++i;
    if (i < format.size() && format[i] == '.') {
      ++i;
      while (i < format.size() && format[i] >= '0' && format[i] <= '9') ++i;
    }
    std::string spec(format.substr(start, i - start));
    while (i < format.size() && std::strchr("hlqjzt", format[i]) != nullptr) ++i;
    if (i >= format.size()) {
      out += '%';
      out += spec;
      break;
    }
    char conv = format[i++];
    if (next >= args.size()) {
      out += "(missing)";
      continue;
    }
    const FormatArg& a = args[next++];
    switch (conv) {
      case 'd':
      case 'i':
      case 'u':
      case 'x':
      case 'X':
      case 'o':
      case 'c': {
        if (a.kind == FormatArg::Kind::kText || a.kind == FormatArg::Kind::kPointer) {
          out += AsText(a);
        } else if (conv == 'd' || conv == 'i') {
          long long v = a.kind == FormatArg::Kind::kInt    ? a.i
                        : a.kind == FormatArg::Kind::kUInt ? static_cast<long long>(a.u)
                                                           : static_cast<long long>(a.d);
          if (a.kind == FormatArg::Kind::kUInt) {
            AppendPrintf(out, spec, "ll", 'u', static_cast<unsigned long long>(a.u));
          } else {
            AppendPrintf(out, spec, "ll", 'd', v);
          }
        } else if (conv == 'c') {
          AppendPrintf(
              out, spec, "", 'c',
              static_cast<int>(a.kind == FormatArg::Kind::kInt ? a.i : static_cast<int64_t>(a.u)));
        } else {
          unsigned long long v = a.kind == FormatArg::Kind::kInt ? static_cast<uint64_t>(a.i)
                                 : a.kind == FormatArg::Kind::kUInt
                                     ? a.u
                                     : static_cast<unsigned long long>(a.d);
          AppendPrintf(out, spec, "ll", conv, v);
        }
        break;
      }
      case 'f':
      case 'F':
      case 'e':
      case 'E':
      case 'g':
      case 'G':
      case 'a':
      case 'A': {
        if (a.kind == FormatArg::Kind::kText || a.kind == FormatArg::Kind::kPointer) {
          out += AsText(a);
          break;
        }
        double v = a.kind == FormatArg::Kind::kDouble ? a.d
                   : a.kind == FormatArg::Kind::kInt  ? static_cast<double>(a.i)
                                                      : static_cast<double>(a.u);
        AppendPrintf(out, spec, "", conv, v);
        break;
      }
      case 'p':
        if (a.kind == FormatArg::Kind::kPointer) {
          AppendPrintf(out, spec, "", 'p', a.p);
        } else {
          out += AsText(a);
        }
        break;
      case 's':
      case '@':
      default:
        if (spec.empty()) {
          out += AsText(a);
        } else {
          AppendPrintf(out, spec, "", 's', AsText(a).c_str());
        }
        break;
    }
  }
  return out;
}

Error DRMakeError(int64_t code, std::optional<std::string> description) {
  return Error(DRErrorDomain, code, std::move(description));
}

}  // namespace dr
