#include "client/drkit/output.h"

#include <sodium.h>
#include <time.h>

#include <cmath>
#include <nlohmann/json.hpp>

namespace dr::drkit {
namespace {

using json = nlohmann::ordered_json;

constexpr const char* kUuidTag = "$uuid";
constexpr const char* kDataTag = "$data";
constexpr const char* kDateTag = "$date";
// Deeper input is refused rather than risking the stack (drd refuses
// anything deeper than 64 levels anyway).
constexpr int kMaxDepth = 64;

json ToJsonValue(const Value& v) {
  switch (v.type()) {
    case Value::Type::kAbsent:
      return nullptr;
    case Value::Type::kBool:
      return v.boolValue();
    case Value::Type::kInt:
      return v.intValue();
    case Value::Type::kUInt:
      return v.uintValue();
    case Value::Type::kDouble:
      return v.doubleValue();
    case Value::Type::kDate:
      return json::object({{kDateTag, v.date()->seconds}});
    case Value::Type::kString:
      return v.stringValue();
    case Value::Type::kData: {
      const Data& d = v.dataValue();
      if (d.empty()) return json::object({{kDataTag, ""}});  // libsodium wants real buffers
      std::string out(sodium_base64_ENCODED_LEN(d.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
      sodium_bin2base64(out.data(), out.size(), d.data(), d.size(), sodium_base64_VARIANT_ORIGINAL);
      out.resize(out.find('\0'));
      return json::object({{kDataTag, out}});
    }
    case Value::Type::kUuid:
      return json::object({{kUuidTag, v.uuid()->string()}});
    case Value::Type::kArray: {
      json out = json::array();
      for (const Value& e : v.array()) out.push_back(ToJsonValue(e));
      return out;
    }
    case Value::Type::kDictionary: {
      json out = json::object();
      for (const auto& [key, e] : v.dictionary()) out[key] = ToJsonValue(e);
      return out;
    }
  }
  return nullptr;
}

Result<Value> Tagged(const json& object) {
  const std::string& tag = object.begin().key();
  const json& inner = object.begin().value();
  if (tag == kUuidTag && inner.is_string()) {
    if (std::optional<Uuid> u = Uuid::parse(inner.get<std::string>())) return Value(*u);
    return Error(kPdocErrorDomain, 1, "not a UUID: " + inner.dump());
  }
  if (tag == kDataTag && inner.is_string()) {
    const std::string text = inner.get<std::string>();
    if (text.empty()) return Value(Data{});  // libsodium wants real buffers
    Data out(text.size());
    size_t length = 0;
    if (sodium_base642bin(out.data(), out.size(), text.data(), text.size(), " \t\r\n", &length,
                          nullptr, sodium_base64_VARIANT_ORIGINAL) != 0) {
      return Error(kPdocErrorDomain, 1, "not base64: " + inner.dump());
    }
    out.resize(length);
    return Value(std::move(out));
  }
  if (tag == kDateTag && inner.is_number()) return Value(Date{inner.get<double>()});
  return Error(kPdocErrorDomain, 1, "bad value of \"" + tag + "\": " + inner.dump());
}

Result<Value> FromJsonValue(const json& j, int depth) {
  if (depth > kMaxDepth) return Error(kPdocErrorDomain, 1, "nested too deeply");
  switch (j.type()) {
    case json::value_t::null:
      return Error(kPdocErrorDomain, 1, "null is not a value drd knows");
    case json::value_t::boolean:
      return Value(j.get<bool>());
    case json::value_t::number_unsigned:
      return Value(j.get<uint64_t>());
    case json::value_t::number_integer:
      return Value(j.get<int64_t>());
    case json::value_t::number_float:
      return Value(j.get<double>());
    case json::value_t::string:
      return Value(j.get<std::string>());
    case json::value_t::array: {
      Array out;
      for (const json& e : j) {
        Result<Value> v = FromJsonValue(e, depth + 1);
        if (!v.ok()) return v;
        out.push_back(std::move(*v));
      }
      return Value(std::move(out));
    }
    case json::value_t::object: {
      if (j.size() == 1 && j.begin().key().rfind('$', 0) == 0) {
        return Tagged(j);
      }
      Dictionary out;
      for (const auto& [key, e] : j.items()) {
        Result<Value> v = FromJsonValue(e, depth + 1);
        if (!v.ok()) return v;
        out[key] = std::move(*v);
      }
      return Value(std::move(out));
    }
    default:
      return Error(kPdocErrorDomain, 1, "unsupported JSON value");
  }
}

}  // namespace

std::string ToJson(const Value& value, bool pretty) {
  // Text drd sent that is not UTF-8 is shown with replacement characters
  // rather than failing the whole output.
  return ToJsonValue(value).dump(pretty ? 2 : -1, ' ', false, json::error_handler_t::replace);
}

Result<Value> FromJson(std::string_view text) {
  json j = json::parse(text, nullptr, /*allow_exceptions=*/false);
  if (j.is_discarded()) return Error(kPdocErrorDomain, 1, "not valid JSON");
  return FromJsonValue(j, 1);
}

char ElectionMark(client::Election election) {
  switch (election) {
    case client::Election::kElected:
      return '+';
    case client::Election::kIgnored:
      return '-';
    case client::Election::kDefault:
      break;
  }
  return ' ';
}

std::string FormatTime(int64_t secondsSince1970) {
  time_t t = static_cast<time_t>(secondsSince1970);
  struct tm utc {};
  char text[64];
  if (!::gmtime_r(&t, &utc) || ::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S UTC", &utc) == 0) {
    return std::to_string(secondsSince1970);
  }
  return text;
}

std::string PlugInLines(const client::PlugIn& p, bool verbose) {
  std::string out;
  out += ElectionMark(p.election());
  out += " " + p.identifier + " (" + p.version + ")\n";
  if (verbose) {
    out += "    uuid: " + p.uuid.string() + "\n";
    out += "    path: " + p.path + "\n";
    out += "    registered: " + FormatTime(p.registered) + "\n";
  }
  return out;
}

std::string DescribeError(const Error& error) {
  std::string text = error.localizedDescription();
  if (error.domain() == client::kDaemonErrorDomain) {
    const char* name = client::ErrorCodeName(error.code());
    text += std::string(" (") + (name ? name : "drd error") + ", code " +
            std::to_string(error.code()) + ")";
  }
  return text;
}

}  // namespace dr::drkit
