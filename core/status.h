// Error records and the one failure vocabulary of drd.
//
// An Error is a domain, a signed code and an optional description. Status is
// "OK or one Error" (OK is a null pointer, so success costs nothing), and
// Result<T> is "a T or one Error". Their members are shaped like
// std::expected so they can become aliases of it later. Every fallible
// function of drd answers one of them, tested with `.ok()`: never an
// optional error, nor errno passed up through layers (the few adapters that
// keep a system call's shape at the OS boundary say why in their headers).
// No exception crosses a layer: where a library throws, the caller catches
// and converts at the call. All three types are plain values and may be
// used from any thread.
#pragma once

#include <cassert>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>

namespace dr {

// The daemon's own error domain. Its codes are the error codes of drd's
// replies (wire/protocol.h), so a reply carries such an error as it is.
inline constexpr const char* DRErrorDomain = "Dromon";
// Errors made from an errno value (the code is the errno).
inline constexpr const char* kPosixErrorDomain = "posix";
// Errors of reading and writing files (codes below).
inline constexpr const char* kFileErrorDomain = "file";
// Errors of the structured-data (pdoc) reader and writer.
inline constexpr const char* kPdocErrorDomain = "pdoc";

// Codes of kFileErrorDomain. A missing file is told apart from every other
// read failure because the annotation store stays silent about it.
inline constexpr int64_t kFileReadNoSuchFileError = 260;
inline constexpr int64_t kFileReadError = 256;
inline constexpr int64_t kFileWriteError = 512;

class Error {
 public:
  Error(std::string domain, int64_t code, std::optional<std::string> description = std::nullopt)
      : domain_(std::move(domain)), code_(code), description_(std::move(description)) {}

  const std::string& domain() const { return domain_; }
  int64_t code() const { return code_; }
  // The description given at creation, if any.
  const std::optional<std::string>& ownDescription() const { return description_; }
  // The text shown to people: the own description, else a generic
  // "<domain> error <code>".
  std::string localizedDescription() const;
  // One line for logs: "<domain> error <code>: <text>" (or without ": <text>"
  // when the error has no description of its own).
  std::string description() const;

  bool operator==(const Error&) const = default;

 private:
  std::string domain_;
  int64_t code_;
  std::optional<std::string> description_;
};

// The error of an errno value, with `what` (for instance "open /x/y") and the
// system's text: "open /x/y: No such file or directory".
Error PosixError(int errnum, const std::string& what);

class Status {
 public:
  Status() = default;  // OK
  Status(Error error) : error_(std::make_shared<const Error>(std::move(error))) {}

  static Status OK() { return Status(); }

  // Tested as `status.ok()` only: no conversion to bool, which would read
  // as "failed" to a reader used to a returned error.
  bool ok() const { return error_ == nullptr; }
  // REQUIRES: !ok().
  const Error& error() const {
    assert(error_);
    return *error_;
  }
  // "OK" or the error's description.
  std::string description() const { return ok() ? "OK" : error_->description(); }

 private:
  std::shared_ptr<const Error> error_;
};

// Tag for building a failed Result from an Error, as std::unexpected does.
struct Unexpected {
  Error error;
};
inline Unexpected unexpected(Error e) { return Unexpected{std::move(e)}; }

template <typename T>
class Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : v_(std::in_place_index<1>, std::move(error)) {}
  Result(Unexpected u) : v_(std::in_place_index<1>, std::move(u.error)) {}
  // REQUIRES: !s.ok().
  Result(const Status& s) : v_(std::in_place_index<1>, s.error()) {}

  bool has_value() const { return v_.index() == 0; }
  // Tested as `result.ok()`, as a Status is: no conversion to bool.
  bool ok() const { return has_value(); }

  // REQUIRES: has_value().
  T& value() & {
    assert(has_value());
    return std::get<0>(v_);
  }
  const T& value() const& {
    assert(has_value());
    return std::get<0>(v_);
  }
  T&& value() && {
    assert(has_value());
    return std::get<0>(std::move(v_));
  }
  T& operator*() & { return value(); }
  const T& operator*() const& { return value(); }
  T&& operator*() && { return std::move(*this).value(); }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }

  // REQUIRES: !has_value().
  const Error& error() const {
    assert(!has_value());
    return std::get<1>(v_);
  }
  Status status() const { return has_value() ? Status() : Status(error()); }

  template <typename U>
  T value_or(U&& fallback) const& {
    return has_value() ? std::get<0>(v_) : static_cast<T>(std::forward<U>(fallback));
  }

 private:
  std::variant<T, Error> v_;
};

}  // namespace dr
