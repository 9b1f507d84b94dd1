// The JSON form of pdoc: read through nlohmann-json's SAX interface with a
// handler that builds Values as the XML reader does. The parser does not
// recurse on nesting, and the handler stops at kMaxDepth open containers, so
// hostile nesting costs neither stack nor time.
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "pdoc/internal.h"

// GCC 12 at -O2, inlining a Value's move into this file's handlers, warns
// that the moved-from variant's string or bytes "may be used uninitialized";
// the variant's index guards every such read.
#if defined(__GNUC__) && !defined(__clang__)
#pragma GCC diagnostic ignored "-Wmaybe-uninitialized"
#endif
#include "pdoc/pdoc.h"

namespace dr::pdoc::internal {
namespace {

using json = nlohmann::json;

class JsonReader : public nlohmann::json_sax<json> {
 public:
  Result<Value> Read(std::string_view bytes) {
    bool ok = false;
    try {
      ok = json::sax_parse(bytes.begin(), bytes.end(), this, json::input_format_t::json, true);
    } catch (const std::exception& e) {
      if (!error_) error_ = std::string("JSON: ") + e.what();
    }
    if (error_) return Malformed(*error_);
    if (!ok || result_.isAbsent()) return Malformed("JSON: not a complete document");
    return std::move(result_);
  }

  bool null() override { return Fail("null is not allowed"); }
  bool boolean(bool b) override { return Deliver(Value(b)); }
  bool number_integer(number_integer_t i) override { return Deliver(Value(i)); }
  bool number_unsigned(number_unsigned_t u) override {
    if (u <= static_cast<uint64_t>(INT64_MAX)) return Deliver(Value(static_cast<int64_t>(u)));
    return Deliver(Value(u));
  }
  bool number_float(number_float_t d, const string_t& text) override {
    if (text.find_first_of(".eE") == std::string::npos) {
      return Fail("integer out of range: " + Quote(text));
    }
    return Deliver(Value(d));
  }
  bool string(string_t& s) override {
    if (s.find('\0') != std::string::npos) return Fail("strings must not contain NUL");
    return Deliver(Value(std::move(s)));
  }
  bool binary(binary_t&) override { return Fail("binary values are not allowed"); }
  bool start_object(std::size_t) override { return Open(true); }
  bool key(string_t& k) override {
    if (k.find('\0') != std::string::npos) return Fail("keys must not contain NUL");
    Frame& top = stack_.back();
    if (top.dict.contains(k)) return Fail("duplicate key \"" + Quote(k) + "\"");
    top.key = std::move(k);
    return true;
  }
  bool end_object() override { return Close(); }
  bool start_array(std::size_t) override { return Open(false); }
  bool end_array() override { return Close(); }
  bool parse_error(std::size_t, const std::string&, const nlohmann::detail::exception& e) override {
    // what() reads "[json.exception.parse_error.101] parse error at line 1, ...".
    std::string_view what = e.what();
    if (size_t bracket = what.find("] "); bracket != std::string_view::npos) {
      what.remove_prefix(bracket + 2);
    }
    return Fail(Quote(what, 512));
  }

 private:
  bool Fail(const std::string& message) {
    if (!error_) error_ = "JSON: " + message;
    return false;
  }

  bool Open(bool isDict) {
    if (stack_.size() >= static_cast<size_t>(kMaxDepth)) {
      return Fail("nesting deeper than " + std::to_string(kMaxDepth) + " levels");
    }
    stack_.push_back(Frame{.kind = isDict ? Kind::kDict : Kind::kArray});
    return true;
  }

  bool Close() {
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    if (frame.kind == Kind::kDict) return Deliver(Value(frame.dict.finish()));
    return Deliver(Value(std::move(frame.array)));
  }

  bool Deliver(Value value) {
    if (stack_.empty()) {
      result_ = std::move(value);
      return true;
    }
    Frame& top = stack_.back();
    if (top.kind == Kind::kArray) {
      top.array.push_back(std::move(value));
    } else {
      top.dict.add(Key(*top.key), std::move(value));
      top.key.reset();
    }
    return true;
  }

  std::vector<Frame> stack_;
  Value result_;
  std::optional<std::string> error_;
};

}  // namespace

Result<Value> ReadJson(std::string_view bytes) { return JsonReader().Read(bytes); }

}  // namespace dr::pdoc::internal
