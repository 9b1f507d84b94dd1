#include "registry/parsed_copy.h"

#include <cstring>

#include "pdoc/pdoc.h"
#include "registry/scan.h"
#include "wire/drm1.h"

namespace dr::registry_internal {
namespace {

constexpr char kMagic[4] = {'D', 'R', 'P', '1'};
// A checksum, not a signature: it ties the copy to the bytes it was made from
// and finds a damaged copy. Whoever can write the database can write the
// bytes too.
constexpr size_t kChecksumSize = 16;
constexpr size_t kHeaderSize = sizeof kMagic + kChecksumSize;
constexpr const char* kInfoKey = "info";
constexpr const char* kEntitlementsKey = "entitlements";

std::string ChecksumOf(std::string_view info, std::optional<std::string_view> entitlements,
                       std::string_view values) {
  return HashFiles(info, entitlements, values, kChecksumSize);
}

// The values of a copy's encoding (a DRM1 body, the message codec's), or
// nothing when they are not what EncodeParsedCopy writes.
std::optional<ParsedFiles> DecodeValues(std::string_view body) {
  Result<Value> top = drm1::DecodeBody(body);
  if (!top.ok()) return std::nullopt;
  ParsedFiles out{(*top)[kInfoKey], (*top)[kEntitlementsKey]};
  if (top->size() != (out.info.isPresent() ? 2u : 1u)) return std::nullopt;
  if (out.info.isPresent() && !out.info.isDictionary()) return std::nullopt;
  if (!out.entitlements.isDictionary()) return std::nullopt;
  return out;
}

}  // namespace

ParsedFiles ParseFiles(std::string_view infoBytes, std::optional<std::string_view> entitlements) {
  // The bytes were checked at registration; bytes that no longer read (a
  // changed parser, a tampered database) yield no information dictionary, and
  // the daemon then skips the plug-in.
  ParsedFiles out;
  if (auto info = pdoc::Parse(infoBytes); info.ok() && info->isDictionary()) out.info = *info;
  out.entitlements = Value::EmptyDictionary();
  if (entitlements) {
    if (auto e = pdoc::Parse(*entitlements); e.ok() && e->isDictionary()) out.entitlements = *e;
  }
  return out;
}

std::optional<std::string> EncodeParsedCopy(const ParsedFiles& parsed, std::string_view infoBytes,
                                            std::optional<std::string_view> entitlements) {
  // An absent information dictionary is left out (a dictionary holds no
  // absent value).
  Result<std::string> body =
      drm1::EncodeValue(Value{{kInfoKey, parsed.info}, {kEntitlementsKey, parsed.entitlements}});
  if (!body.ok()) return std::nullopt;
  // The message encoding nests less deeply than pdoc and carries no NUL in
  // text: a copy is kept only when it reads back as the very values parsed.
  std::optional<ParsedFiles> again = DecodeValues(*body);
  if (!again || !(again->info == parsed.info) || !(again->entitlements == parsed.entitlements)) {
    return std::nullopt;
  }
  std::string out(kMagic, sizeof kMagic);
  out += ChecksumOf(infoBytes, entitlements, *body);
  out += *body;
  return out;
}

std::optional<std::string_view> CheckedParsedValues(std::string_view copy,
                                                    std::string_view infoBytes,
                                                    std::optional<std::string_view> entitlements) {
  if (copy.size() < kHeaderSize || copy.substr(0, sizeof kMagic) != std::string_view(kMagic, 4)) {
    return std::nullopt;
  }
  const std::string_view body = copy.substr(kHeaderSize);
  if (copy.substr(sizeof kMagic, kChecksumSize) != ChecksumOf(infoBytes, entitlements, body)) {
    return std::nullopt;
  }
  return body;
}

std::optional<ParsedFiles> DecodeParsedValues(std::string_view values) {
  return DecodeValues(values);
}

std::optional<ParsedFiles> DecodeParsedCopy(std::string_view copy, std::string_view infoBytes,
                                            std::optional<std::string_view> entitlements) {
  std::optional<std::string_view> values = CheckedParsedValues(copy, infoBytes, entitlements);
  if (!values) return std::nullopt;
  return DecodeValues(*values);
}

}  // namespace dr::registry_internal
