// printf-style formatting with %@, through which every log line and message
// of drd goes.
//
// Format("unable to save annotations:%@ error:%@", path, status) renders each
// argument by its conversion: %@ takes any value's description (a dr::Value,
// a string, a number, a UUID, an error, anything with a description()
// member; a null pointer or empty optional is "(null)"), %d %i %u %x %X %o %c
// take integers, %f %e %g %a take doubles, %s takes text and %p pointers.
// Flags, width and precision work as in printf; length modifiers (l, ll, z,
// ...) are accepted and ignored, since every argument carries its own type.
// A conversion without an argument renders "(missing)" and surplus arguments
// are ignored: a mismatched format is a bug in the caller, never undefined
// behaviour. Safe to call from any thread.
#pragma once

#include <array>
#include <concepts>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>

#include "core/status.h"
#include "core/value.h"

namespace dr {

struct FormatArg {
  enum class Kind : uint8_t { kInt, kUInt, kDouble, kText, kPointer };
  Kind kind = Kind::kText;
  int64_t i = 0;
  uint64_t u = 0;
  double d = 0;
  std::string text;
  const void* p = nullptr;
};

std::string FormatList(std::string_view format, std::span<const FormatArg> args);

namespace format_internal {

template <typename T>
concept HasDescription = requires(const T& t) {
  { t.description() } -> std::convertible_to<std::string>;
};

inline FormatArg Text(std::string s) {
  FormatArg a;
  a.kind = FormatArg::Kind::kText;
  a.text = std::move(s);
  return a;
}

inline FormatArg CText(const char* s) { return Text(s ? std::string(s) : std::string("(null)")); }

template <typename T>
FormatArg Make(const T& v);

template <typename T>
FormatArg MakePointee(const T* p) {
  if (p == nullptr) return Text("(null)");
  return Make(*p);
}

template <typename T>
FormatArg Make(const T& v) {
  using D = std::decay_t<T>;
  if constexpr (std::is_same_v<D, bool>) {
    FormatArg a;
    a.kind = FormatArg::Kind::kInt;
    a.i = v ? 1 : 0;
    return a;
  } else if constexpr (std::is_same_v<D, char>) {
    FormatArg a;
    a.kind = FormatArg::Kind::kInt;
    a.i = v;
    return a;
  } else if constexpr (std::is_integral_v<D> && std::is_signed_v<D>) {
    FormatArg a;
    a.kind = FormatArg::Kind::kInt;
    a.i = static_cast<int64_t>(v);
    return a;
  } else if constexpr (std::is_integral_v<D>) {
    FormatArg a;
    a.kind = FormatArg::Kind::kUInt;
    a.u = static_cast<uint64_t>(v);
    return a;
  } else if constexpr (std::is_enum_v<D>) {
    return Make(static_cast<std::underlying_type_t<D>>(v));
  } else if constexpr (std::is_floating_point_v<D>) {
    FormatArg a;
    a.kind = FormatArg::Kind::kDouble;
    a.d = static_cast<double>(v);
    return a;
  } else if constexpr (std::is_same_v<D, const char*> || std::is_same_v<D, char*>) {
    return CText(v);
  } else if constexpr (std::is_convertible_v<const D&, std::string_view>) {
    return Text(std::string(std::string_view(v)));
  } else if constexpr (std::is_same_v<D, std::filesystem::path>) {
    return Text(v.string());
  } else if constexpr (std::is_same_v<D, Value>) {
    FormatArg a = Text(v.description());
    // %d of a number value prints the number.
    if (v.type() == Value::Type::kDouble) {
      a.kind = FormatArg::Kind::kDouble;
      a.d = v.doubleValue();
    } else if (v.type() == Value::Type::kUInt) {
      a.kind = FormatArg::Kind::kUInt;
      a.u = v.uintValue();
    } else if (v.isNumber()) {
      a.kind = FormatArg::Kind::kInt;
      a.i = v.intValue();
    }
    return a;
  } else if constexpr (std::is_same_v<D, Uuid>) {
    return Text(v.string());
  } else if constexpr (std::is_same_v<D, std::nullptr_t>) {
    return Text("(null)");
  } else if constexpr (HasDescription<D>) {
    return Text(std::string(v.description()));
  } else if constexpr (requires {
                         v.has_value();
                         *v;
                       }) {  // optional
    if (!v.has_value()) return Text("(null)");
    return Make(*v);
  } else if constexpr (requires { v.get(); }) {  // smart pointers
    return MakePointee(v.get());
  } else if constexpr (std::is_pointer_v<D>) {
    if constexpr (HasDescription<std::remove_cv_t<std::remove_pointer_t<D>>>) {
      return MakePointee(v);
    } else {
      FormatArg a;
      a.kind = FormatArg::Kind::kPointer;
      a.p = static_cast<const void*>(v);
      return a;
    }
  } else {
    static_assert(sizeof(D) == 0, "no way to format this type");
  }
}

}  // namespace format_internal

template <typename... Args>
std::string Format(std::string_view format, const Args&... args) {
  std::array<FormatArg, sizeof...(Args)> list{format_internal::Make(args)...};
  return FormatList(format, std::span<const FormatArg>(list.data(), list.size()));
}

// An error of the daemon's own domain. With a description, that text is the
// error's own description; without one the error carries none.
Error DRMakeError(int64_t code, std::optional<std::string> description = std::nullopt);

// An error of the daemon's own domain whose description is `format` with the
// arguments put in. Without a format (nullptr) the error has no description
// and the arguments are ignored.
template <typename... Args>
Error DRMakeErrorWithFormat(int64_t code, const char* format, const Args&... args) {
  if (format == nullptr) return DRMakeError(code);
  return DRMakeError(code, Format(format, args...));
}

}  // namespace dr
