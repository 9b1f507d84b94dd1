// The XML form of pdoc: reader and writer.
//
// Reading goes through expat with a handler that keeps a stack of open
// elements (one Frame each) and turns every closed element into a Value for
// its parent. expat does not recurse on nesting, and the handler stops at
// kMaxDepth open containers, so hostile nesting costs neither stack nor time.
//
// Writing is a recursive walk over the value (whose depth the caller chose),
// checking every string against what XML 1.0 can carry.
#include <expat.h>
#include <sodium.h>
#include <time.h>

#include <algorithm>
#include <charconv>
#include <climits>
#include <cmath>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "core/utf8.h"
#include "pdoc/internal.h"
#include "pdoc/pdoc.h"

namespace dr::pdoc {
namespace internal {
namespace {

void InitSodium() {
  static const int once = sodium_init();
  (void)once;
}

// Nothing when `text` is UTF-8 that XML 1.0 can carry; otherwise what is
// wrong with it.
std::optional<std::string> XmlTextProblem(std::string_view text) {
  size_t i = 0;
  // Printable ASCII, tab, LF and CR, nearly all of what drd writes, need no
  // decoding; the first other byte starts a character.
  while (i < text.size()) {
    const auto b = static_cast<unsigned char>(text[i]);
    if ((b < 0x20 && b != '\t' && b != '\n' && b != '\r') || b >= 0x80) break;
    ++i;
  }
  while (i < text.size()) {
    std::optional<char32_t> cp = DecodeUtf8(text, i);
    if (!cp) return "is not valid UTF-8";
    if ((*cp < 0x20 && *cp != '\t' && *cp != '\n' && *cp != '\r') || *cp == 0xFFFE ||
        *cp == 0xFFFF) {
      char hex[16];
      snprintf(hex, sizeof hex, "U+%04X", static_cast<unsigned>(*cp));
      return std::string("holds the character ") + hex + ", which XML cannot carry";
    }
  }
  return std::nullopt;
}

// --- Scalars in text form --------------------------------------------------

std::string_view Trim(std::string_view text) {
  size_t first = text.find_first_not_of(kWhiteSpace);
  if (first == std::string_view::npos) return {};
  size_t last = text.find_last_not_of(kWhiteSpace);
  return text.substr(first, last - first + 1);
}

std::optional<Value> ParseInteger(std::string_view text) {
  if (text.empty()) return std::nullopt;
  const char* end = text.data() + text.size();
  if (text[0] == '-') {
    int64_t i;
    auto [p, ec] = std::from_chars(text.data(), end, i);
    if (ec != std::errc() || p != end) return std::nullopt;
    return Value(i);
  }
  if (text[0] == '+') text.remove_prefix(1);
  if (text.empty() || text[0] == '-' || text[0] == '+') return std::nullopt;
  uint64_t u;
  auto [p, ec] = std::from_chars(text.data(), end, u);
  if (ec != std::errc() || p != end) return std::nullopt;
  if (u <= static_cast<uint64_t>(INT64_MAX)) return Value(static_cast<int64_t>(u));
  return Value(u);
}

std::optional<double> ParseReal(std::string_view text) {
  if (!text.empty() && text[0] == '+') text.remove_prefix(1);
  if (text.empty() || text[0] == '+') return std::nullopt;
  double d;
  const char* end = text.data() + text.size();
  auto [p, ec] = std::from_chars(text.data(), end, d, std::chars_format::general);
  if (ec != std::errc() || p != end) return std::nullopt;
  return d;
}

// Reads `count` decimal digits at text[pos], advancing pos.
bool Digits(std::string_view text, size_t& pos, size_t count, int& out) {
  if (text.size() - pos < count) return false;
  out = 0;
  for (size_t k = 0; k < count; ++k) {
    char c = text[pos + k];
    if (c < '0' || c > '9') return false;
    out = out * 10 + (c - '0');
  }
  pos += count;
  return true;
}

bool Expect(std::string_view text, size_t& pos, char c) {
  if (pos >= text.size() || text[pos] != c) return false;
  ++pos;
  return true;
}

// "YYYY-MM-DDTHH:MM:SS[.fraction]Z", UTC.
std::optional<Date> ParseDate(std::string_view text) {
  struct tm tm = {};
  int year, month, day, hour, minute, second;
  size_t pos = 0;
  if (!Digits(text, pos, 4, year) || !Expect(text, pos, '-') || !Digits(text, pos, 2, month) ||
      !Expect(text, pos, '-') || !Digits(text, pos, 2, day) || !Expect(text, pos, 'T') ||
      !Digits(text, pos, 2, hour) || !Expect(text, pos, ':') || !Digits(text, pos, 2, minute) ||
      !Expect(text, pos, ':') || !Digits(text, pos, 2, second)) {
    return std::nullopt;
  }
  double fraction = 0;
  if (pos < text.size() && text[pos] == '.') {
    size_t start = pos++;
    while (pos < text.size() && text[pos] >= '0' && text[pos] <= '9') ++pos;
    if (pos - start < 2) return std::nullopt;
    std::string digits = "0" + std::string(text.substr(start, pos - start));
    auto [p, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), fraction);
    if (ec != std::errc() || p != digits.data() + digits.size()) return std::nullopt;
  }
  if (!Expect(text, pos, 'Z') || pos != text.size()) return std::nullopt;
  if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 59) {
    return std::nullopt;
  }
  tm.tm_year = year - 1900;
  tm.tm_mon = month - 1;
  tm.tm_mday = day;
  tm.tm_hour = hour;
  tm.tm_min = minute;
  tm.tm_sec = second;
  time_t t = timegm(&tm);
  // timegm normalizes (February 30 becomes March 2); such a date is wrong.
  if (tm.tm_mday != day || tm.tm_mon != month - 1) return std::nullopt;
  return Date{static_cast<double>(t) + fraction};
}

// --- XML reading -------------------------------------------------------------
std::optional<Kind> KindOf(std::string_view name) {
  static constexpr std::pair<std::string_view, Kind> kNames[] = {
      {"dict", Kind::kDict},     {"array", Kind::kArray},     {"key", Kind::kKey},
      {"string", Kind::kString}, {"integer", Kind::kInteger}, {"real", Kind::kReal},
      {"true", Kind::kTrue},     {"false", Kind::kFalse},     {"date", Kind::kDate},
      {"data", Kind::kData},
  };
  for (const auto& [n, kind] : kNames) {
    if (n == name) return kind;
  }
  return std::nullopt;
}
// One expat parser per thread, reset between documents: making and freeing
// a parser costs about as much as reading a small information dictionary,
// and drd reads thousands of them when it starts. A parser that read a large
// document is freed rather than kept, so its buffers are not held on to.
class ThreadParser {
 public:
  static constexpr size_t kKeepBelow = 64 * 1024;

  ~ThreadParser() {
    if (parser_ != nullptr) XML_ParserFree(parser_);
  }
  // A parser with no handlers, ready for a new document; null when none can
  // be made.
  XML_Parser acquire() {
    if (parser_ != nullptr && XML_ParserReset(parser_, nullptr) == XML_TRUE) return parser_;
    if (parser_ != nullptr) XML_ParserFree(parser_);
    parser_ = XML_ParserCreate(nullptr);
    return parser_;
  }
  // Ends the use of the parser that read `size` bytes.
  void release(size_t size) {
    if (size < kKeepBelow) return;
    XML_ParserFree(parser_);
    parser_ = nullptr;
  }

 private:
  XML_Parser parser_ = nullptr;
};

class XmlReader {
 public:
  XmlReader(size_t lineOffset) : lineOffset_(lineOffset) {}

  Result<Value> Read(std::string_view bytes) {
    thread_local ThreadParser parsers;
    const size_t size = bytes.size();
    parser_ = parsers.acquire();
    if (parser_ == nullptr) return Malformed("cannot create an XML parser");
    XML_SetUserData(parser_, this);
    XML_SetElementHandler(parser_, &XmlReader::OnStart, &XmlReader::OnEnd);
    XML_SetCharacterDataHandler(parser_, &XmlReader::OnText);
    XML_SetEntityDeclHandler(parser_, &XmlReader::OnEntityDecl);
    XML_SetSkippedEntityHandler(parser_, &XmlReader::OnSkippedEntity);
    XML_SetParamEntityParsing(parser_, XML_PARAM_ENTITY_PARSING_NEVER);

    bool ok = true;
    do {
      size_t chunk = std::min<size_t>(bytes.size(), INT_MAX / 2);
      bool last = chunk == bytes.size();
      ok = XML_Parse(parser_, bytes.data(), static_cast<int>(chunk), last) == XML_STATUS_OK;
      bytes.remove_prefix(chunk);
    } while (ok && !bytes.empty());

    Status status;
    if (error_) {
      status = Malformed(*error_);
    } else if (!ok) {
      status = Malformed(LinePrefix() + XML_ErrorString(XML_GetErrorCode(parser_)));
    }
    parsers.release(size);
    if (!status.ok()) return status;
    return std::move(result_);
  }

 private:
  std::string LinePrefix() const {
    return "line " + std::to_string(XML_GetCurrentLineNumber(parser_) + lineOffset_) + ": ";
  }

  void Fail(const std::string& message) {
    if (error_) return;
    error_ = LinePrefix() + message;
    XML_StopParser(parser_, XML_FALSE);
  }

  static void XMLCALL OnStart(void* data, const XML_Char* name, const XML_Char** attributes) {
    static_cast<XmlReader*>(data)->Start(name, attributes);
  }
  static void XMLCALL OnEnd(void* data, const XML_Char*) { static_cast<XmlReader*>(data)->End(); }
  static void XMLCALL OnText(void* data, const XML_Char* text, int length) {
    static_cast<XmlReader*>(data)->Text(std::string_view(text, static_cast<size_t>(length)));
  }
  static void XMLCALL OnEntityDecl(void* data, const XML_Char* name, int, const XML_Char*, int,
                                   const XML_Char*, const XML_Char*, const XML_Char*,
                                   const XML_Char*) {
    static_cast<XmlReader*>(data)->Fail("entity declarations are not allowed (entity \"" +
                                        Quote(name) + "\")");
  }
  static void XMLCALL OnSkippedEntity(void* data, const XML_Char* name, int) {
    static_cast<XmlReader*>(data)->Fail("reference to undeclared entity \"" + Quote(name) + "\"");
  }

  void Start(std::string_view name, const XML_Char** attributes) {
    if (error_) return;
    if (stack_.empty()) {
      if (done_ || name != "pdoc") {
        return Fail("the root element is <" + Quote(name) + ">, not <pdoc>");
      }
      for (const XML_Char** a = attributes; a[0] != nullptr; a += 2) {
        if (std::string_view(a[0]) == "version" && std::string_view(a[1]) != "1.0") {
          return Fail("unsupported pdoc version \"" + Quote(a[1]) + "\"");
        }
      }
      stack_.push_back(Frame{.kind = Kind::kRoot, .name = "pdoc"});
      return;
    }
    Frame& parent = stack_.back();
    std::optional<Kind> kind = KindOf(name);
    if (!kind) return Fail("unknown element <" + Quote(name) + ">");
    switch (parent.kind) {
      case Kind::kRoot:
        if (parent.value.isPresent()) return Fail("<pdoc> holds more than one value");
        break;
      case Kind::kDict:
        if (!parent.key && *kind != Kind::kKey) {
          return Fail("<" + Quote(name) + "> in <dict> where a <key> belongs");
        }
        if (parent.key && *kind == Kind::kKey) {
          return Fail("key \"" + Quote(*parent.key) + "\" has no value");
        }
        break;
      case Kind::kArray:
        if (*kind == Kind::kKey) return Fail("<key> outside a <dict>");
        break;
      default:
        return Fail("<" + parent.name + "> cannot hold elements");
    }
    if (*kind == Kind::kDict || *kind == Kind::kArray) {
      if (++containers_ > kMaxDepth) {
        return Fail("nesting deeper than " + std::to_string(kMaxDepth) + " levels");
      }
    }
    stack_.push_back(Frame{.kind = *kind, .name = std::string(name)});
  }

  void Text(std::string_view text) {
    if (error_ || stack_.empty()) return;
    Frame& top = stack_.back();
    switch (top.kind) {
      case Kind::kRoot:
      case Kind::kDict:
      case Kind::kArray:
        if (text.find_first_not_of(kWhiteSpace) != std::string_view::npos) {
          Fail("unexpected text \"" + Quote(Trim(text)) + "\" in <" + top.name + ">");
        }
        return;
      case Kind::kTrue:
      case Kind::kFalse:
        return Fail("<" + top.name + "> must be empty");
      default:
        top.text.append(text);
    }
  }

  void End() {
    if (error_) return;
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    if (frame.kind == Kind::kDict || frame.kind == Kind::kArray) --containers_;

    Value value;
    switch (frame.kind) {
      case Kind::kRoot:
        if (frame.value.isAbsent()) return Fail("<pdoc> holds no value");
        result_ = std::move(frame.value);
        done_ = true;
        return;
      case Kind::kKey: {
        Frame& dict = stack_.back();
        if (dict.dict.contains(frame.text)) {
          return Fail("duplicate key \"" + Quote(frame.text) + "\"");
        }
        dict.key = std::move(frame.text);
        return;
      }
      case Kind::kDict:
        if (frame.key) return Fail("key \"" + Quote(*frame.key) + "\" has no value");
        value = Value(frame.dict.finish());
        break;
      case Kind::kArray:
        value = Value(std::move(frame.array));
        break;
      case Kind::kString:
        value = Value(std::move(frame.text));
        break;
      case Kind::kTrue:
        value = Value(true);
        break;
      case Kind::kFalse:
        value = Value(false);
        break;
      case Kind::kInteger: {
        std::optional<Value> i = ParseInteger(Trim(frame.text));
        if (!i) return Fail(BadValue(frame, "is not an integer"));
        value = std::move(*i);
        break;
      }
      case Kind::kReal: {
        std::optional<double> d = ParseReal(Trim(frame.text));
        if (!d) return Fail(BadValue(frame, "is not a real number"));
        value = Value(*d);
        break;
      }
      case Kind::kDate: {
        std::optional<Date> d = ParseDate(Trim(frame.text));
        if (!d) return Fail(BadValue(frame, "is not a date (YYYY-MM-DDTHH:MM:SSZ)"));
        value = Value(*d);
        break;
      }
      case Kind::kData: {
        std::optional<Data> d = DecodeBase64(frame.text);
        if (!d) return Fail(BadValue(frame, "is not base64"));
        value = Value(std::move(*d));
        break;
      }
    }
    Deliver(std::move(value));
  }

  static std::string BadValue(const Frame& frame, const char* what) {
    return "<" + frame.name + "> value \"" + Quote(Trim(frame.text)) + "\" " + what;
  }

  static std::optional<Data> DecodeBase64(const std::string& text) {
    InitSodium();
    Data out(text.size() / 4 * 3 + 3);
    size_t length = 0;
    if (sodium_base642bin(out.data(), out.size(), text.data(), text.size(), " \t\r\n", &length,
                          nullptr, sodium_base64_VARIANT_ORIGINAL) != 0) {
      return std::nullopt;
    }
    out.resize(length);
    return out;
  }

  // Hands a finished value to the element that holds it.
  void Deliver(Value value) {
    Frame& parent = stack_.back();
    switch (parent.kind) {
      case Kind::kRoot:
        parent.value = std::move(value);
        break;
      case Kind::kDict:
        parent.dict.add(Key(*parent.key), std::move(value));
        parent.key.reset();
        break;
      case Kind::kArray:
        parent.array.push_back(std::move(value));
        break;
      default:
        break;  // Start() lets no element into another kind
    }
  }

  XML_Parser parser_ = nullptr;
  size_t lineOffset_;
  std::vector<Frame> stack_;
  int containers_ = 0;
  bool done_ = false;
  Value result_;
  std::optional<std::string> error_;
};
// --- XML writing -------------------------------------------------------------

class XmlWriter {
 public:
  Status Write(const Value& value, int level) {
    switch (value.type()) {
      case Value::Type::kAbsent:
        return Unwritable(Where() + "an absent value cannot be written");
      case Value::Type::kUuid:
        return Unwritable(Where() + "a UUID cannot be written");
      case Value::Type::kBool:
        out_ += value.boolValue() ? "<true/>\n" : "<false/>\n";
        return Status::OK();
      case Value::Type::kInt:
        Scalar("integer", Number(value.intValue()));
        return Status::OK();
      case Value::Type::kUInt:
        Scalar("integer", Number(value.uintValue()));
        return Status::OK();
      case Value::Type::kDouble:
        Scalar("real", Real(value.doubleValue()));
        return Status::OK();
      case Value::Type::kDate: {
        std::optional<std::string> text = DateText(value.date()->seconds);
        if (!text) return Unwritable(Where() + "the date is out of range");
        Scalar("date", *text);
        return Status::OK();
      }
      case Value::Type::kString: {
        if (auto problem = XmlTextProblem(value.stringValue())) {
          return Unwritable(Where() + "the string " + *problem);
        }
        out_ += "<string>";
        Escape(value.stringValue());
        out_ += "</string>\n";
        return Status::OK();
      }
      case Value::Type::kData:
        Scalar("data", Base64(value.dataValue()));
        return Status::OK();
      case Value::Type::kArray: {
        const Array& array = value.array();
        if (array.empty()) {
          out_ += "<array/>\n";
          return Status::OK();
        }
        out_ += "<array>\n";
        for (size_t i = 0; i < array.size(); ++i) {
          path_.push_back({{}, i, true});
          Indent(level + 1);
          if (Status s = Write(array[i], level + 1); !s.ok()) return s;
          path_.pop_back();
        }
        Indent(level);
        out_ += "</array>\n";
        return Status::OK();
      }
      case Value::Type::kDictionary: {
        const Dictionary& dict = value.dictionary();
        if (dict.empty()) {
          out_ += "<dict/>\n";
          return Status::OK();
        }
        out_ += "<dict>\n";
        for (const auto& [key, element] : dict) {
          if (Status s = WriteEntry(key, element, level + 1); !s.ok()) return s;
        }
        Indent(level);
        out_ += "</dict>\n";
        return Status::OK();
      }
    }
    return Unwritable("unknown value type");
  }

  // One dictionary entry on lines indented `level` steps: the key element,
  // then the value's elements.
  Status WriteEntry(std::string_view key, const Value& element, int level) {
    path_.push_back({key, 0, false});
    if (auto problem = XmlTextProblem(key)) {
      path_.pop_back();
      return Unwritable(Where() + "a key " + *problem);
    }
    Indent(level);
    out_ += "<key>";
    Escape(key);
    out_ += "</key>";
    if (Status s = Write(element, level); !s.ok()) return s;
    path_.pop_back();
    return Status::OK();
  }

  std::string& out() { return out_; }

 private:
  // Where the value being written lies, as "at /key/0: ", for messages.
  std::string Where() const {
    if (path_.empty()) return "";
    std::string where = "at ";
    for (const PathPart& part : path_) {
      where += "/" + (part.isIndex ? std::to_string(part.index) : Quote(part.key));
    }
    return where + ": ";
  }

  void Indent(int level) { out_.append(static_cast<size_t>(level) * 2, ' '); }

  void Scalar(const char* tag, const std::string& text) {
    out_.append("<").append(tag).append(">").append(text).append("</").append(tag).append(">\n");
  }

  // &, < and > as entities; CR as a character reference, since XML readers
  // turn a literal CR into LF.
  void Escape(std::string_view text) {
    size_t plain = 0;  // the start of the characters not yet copied
    for (size_t i = 0; i < text.size(); ++i) {
      const char* entity = nullptr;
      switch (text[i]) {
        case '&':
          entity = "&amp;";
          break;
        case '<':
          entity = "&lt;";
          break;
        case '>':
          entity = "&gt;";
          break;
        case '\r':
          entity = "&#13;";
          break;
        default:
          continue;
      }
      out_.append(text.substr(plain, i - plain)).append(entity);
      plain = i + 1;
    }
    out_.append(text.substr(plain));
  }

  template <typename T>
  static std::string Number(T n) {
    char buf[32];
    auto [p, ec] = std::to_chars(buf, buf + sizeof buf, n);
    return std::string(buf, p);
  }

  // The shortest text that reads back as the same double; an integral value
  // gets ".0" so that it still looks like a real.
  static std::string Real(double d) {
    char buf[64];
    auto [p, ec] = std::to_chars(buf, buf + sizeof buf, d);
    std::string text(buf, p);
    if (text.find_first_of(".eEni") == std::string::npos) text += ".0";
    return text;
  }

  static std::optional<std::string> DateText(double seconds) {
    // Years 0 to 9999 only: the form has four year digits.
    if (!std::isfinite(seconds) || seconds < -62167219200.0 || seconds >= 253402300800.0) {
      return std::nullopt;
    }
    double whole = std::floor(seconds);
    double fraction = seconds - whole;  // exact: both lie within one binade of seconds
    time_t t = static_cast<time_t>(whole);
    struct tm tm;
    if (gmtime_r(&t, &tm) == nullptr) return std::nullopt;
    char buf[64];
    snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d", tm.tm_year + 1900, tm.tm_mon + 1,
             tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
    std::string text = buf;
    if (fraction > 0) {
      // Fixed notation, shortest round trip: "0.25" gives ".25". A fraction
      // as small as 1e-300 takes some 320 digits.
      char digits[512];
      auto [p, ec] =
          std::to_chars(digits, digits + sizeof digits, fraction, std::chars_format::fixed);
      if (ec != std::errc()) return std::nullopt;
      text.append(digits + 1, p);
    }
    return text + "Z";
  }

  static std::string Base64(const Data& data) {
    InitSodium();
    std::string out(sodium_base64_ENCODED_LEN(data.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(out.data(), out.size(), data.data(), data.size(),
                      sodium_base64_VARIANT_ORIGINAL);
    out.resize(std::strlen(out.c_str()));
    return out;
  }

  std::string out_;
  // One step of the path to the value being written: a dictionary key (a
  // view of the key in the value written, which outlives the writer's use of
  // it) or an array index. Text is made of it only for an error message.
  struct PathPart {
    std::string_view key;
    size_t index;
    bool isIndex;
  };
  std::vector<PathPart> path_;
};

}  // namespace

Result<Value> ReadXml(std::string_view bytes, size_t lineOffset) {
  return XmlReader(lineOffset).Read(bytes);
}

}  // namespace internal

Result<std::string> WriteXml(const Value& value) {
  internal::XmlWriter writer;
  writer.out() = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<pdoc version=\"1.0\">\n  ";
  if (Status s = writer.Write(value, 1); !s.ok()) return s;
  writer.out() += "</pdoc>\n";
  return std::move(writer.out());
}

Result<std::string> WriteXmlEntry(std::string_view key, const Value& value, int depth) {
  internal::XmlWriter writer;
  if (Status s = writer.WriteEntry(key, value, depth + 1); !s.ok()) return s;
  return std::move(writer.out());
}

}  // namespace dr::pdoc
