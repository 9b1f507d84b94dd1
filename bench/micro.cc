// In-process micro-benchmarks of drd's hot paths: rule evaluation, version
// ordering, form export, resource tokens, DRM1 framing and pdoc reading and
// writing. Each input is shaped like what the daemon sees under the load
// program's workloads (bench/load.cc): plug-ins of 100 extension points in
// applications, replies of 100 and 1,000 forms, an annotation file of 1,000
// plug-ins.
//
//   micro [--benchmark_filter=REGEX] [--benchmark_min_time=SECONDS] ...
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/value.h"
#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "platform/process_info.h"
#include "platform/sandbox.h"
#include "plugin/helpers.h"
#include "plugin/plugin.h"
#include "registry/registry.h"
#include "wire/drm1.h"

namespace {

using dr::Array;
using dr::Dictionary;
using dr::Value;

constexpr int kPoints = 100;

std::string PointName(int point) { return "org.bench.point" + std::to_string(point); }

// The information dictionary of plug-in `index` of extension point `point`,
// as bench/load registers them (the point's name is given directly here, so
// no SDK lookup is involved).
Value PlugInInfo(int point, int index) {
  const std::string id = "org.bench.app" + std::to_string(index % 50) + ".p" +
                         std::to_string(point) + "." + std::to_string(index);
  return Value{
      {"BNBundleIdentifier", id},
      {"BNBundleVersion", "1." + std::to_string(index % 7) + "." + std::to_string(index)},
      {"BNBundleName", "Plug-in " + std::to_string(index)},
      {"BNBundleExecutable", "plugin"},
      {"UXExtension", Value{{"UXExtensionAttributes",
                             Value{{"UXExtensionPointName", PointName(point)},
                                   {"ActivationRule", Value{{"image/png", 4}, {"text/plain", 1}}},
                                   {"org.bench.tags", Value(Array{"fast", "color", "batch"})}}}}},
  };
}

std::shared_ptr<dr::DRDPlugIn> MakeRecord(int point, int index, const std::string& root = "/tmp",
                                          const dr::PlugInServices& services = {}) {
  Value info = PlugInInfo(point, index);
  dr::RegistryEntry::Fields f;
  f.uuid = dr::Uuid::random();
  f.url = root + "/App" + std::to_string(index % 50) + ".app/Contents/PlugIns/P" +
          std::to_string(point) + "_" + std::to_string(index) + ".appex";
  f.plugInIdentifier = info["BNBundleIdentifier"].stringValue();
  f.bundleIdentifier = f.plugInIdentifier;
  f.bundleVersion = info["BNBundleVersion"].stringValue();
  f.registrationDate = dr::Date{1.7e9};
  f.containingApplication =
      dr::RegistryApplication{root + "/App" + std::to_string(index % 50) + ".app", "App"};
  f.displayName = info["BNBundleName"].stringValue();
  auto files = std::make_shared<dr::RegistryBundleFiles>(
      *dr::pdoc::WriteXml(info),
      *dr::pdoc::WriteXml(Value{{"com.corvel.security.app-sandbox", true}}));
  auto entry = std::make_shared<dr::RegistryEntry>(std::move(f), std::move(files));
  return dr::DRDPlugIn::initWithRGData(entry, services);
}

const std::vector<std::shared_ptr<dr::DRDPlugIn>>& Records10k() {
  static const auto* records = [] {
    auto* v = new std::vector<std::shared_ptr<dr::DRDPlugIn>>;
    for (int p = 0; p < kPoints; ++p)
      for (int i = 0; i < 100; ++i) v->push_back(MakeRecord(p, i));
    return v;
  }();
  return *records;
}

// ---- Rule evaluation -------------------------------------------------------

void BM_MatchRule(benchmark::State& state, Value rules) {
  auto record = MakeRecord(42, 7);
  for (auto _ : state) benchmark::DoNotOptimize(record->match(rules));
}
BENCHMARK_CAPTURE(BM_MatchRule, point_name_hit, Value{{"UXExtensionPointName", PointName(42)}});
BENCHMARK_CAPTURE(BM_MatchRule, point_name_miss, Value{{"UXExtensionPointName", PointName(43)}});
BENCHMARK_CAPTURE(BM_MatchRule, identifier, Value{{"UXExtensionIdentifier", "org.bench.x"}});
BENCHMARK_CAPTURE(BM_MatchRule, version_range,
                  Value{{"UXExtensionPointName", PointName(42)},
                        {"BNBundleVersion", Value(Array{">=1.0", "<2"})}});
BENCHMARK_CAPTURE(BM_MatchRule, array_value, Value{{"org.bench.tags", "batch"}});
BENCHMARK_CAPTURE(BM_MatchRule, entitlement,
                  Value{{"ENTITLEMENT:com.corvel.security.app-sandbox", true}});
BENCHMARK_CAPTURE(BM_MatchRule, activation_rule,
                  Value{{"ActivationRule", Value{{"image/png", 2}}}});

// The rules test of a discovery over 10,000 plug-ins (100 points × 100):
// the floor of what one "match" for one extension point costs in rules.
void BM_MatchAcross10k(benchmark::State& state) {
  const auto& records = Records10k();
  Value rules{{"UXExtensionPointName", PointName(42)}};
  for (auto _ : state) {
    int hits = 0;
    for (const auto& r : records) hits += r->match(rules) ? 1 : 0;
    if (hits != 100) state.SkipWithError("wrong hit count");
    benchmark::DoNotOptimize(hits);
  }
  state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(records.size()));
}
BENCHMARK(BM_MatchAcross10k)->Unit(benchmark::kMicrosecond);

// The per-candidate reads discovery makes before the rules (hybrid, volume,
// containing application, dedicated), over 10,000 records.
void BM_CandidateReads10k(benchmark::State& state) {
  const auto& records = Records10k();
  for (auto _ : state) {
    int visible = 0;
    for (const auto& r : records) {
      if (r->isHybrid()) continue;
      if (!r->onSystemVolume() && !r->containingUrl()) continue;
      if (r->isDedicated()) continue;
      ++visible;
    }
    benchmark::DoNotOptimize(visible);
  }
  state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(records.size()));
}
BENCHMARK(BM_CandidateReads10k)->Unit(benchmark::kMicrosecond);

// ---- Version ordering ------------------------------------------------------

void BM_CompareVersion(benchmark::State& state, std::string a, std::string b) {
  for (auto _ : state) benchmark::DoNotOptimize(dr::compareVersionString(a, b));
}
BENCHMARK_CAPTURE(BM_CompareVersion, short_numeric, "1.2.9", "1.2.10");
BENCHMARK_CAPTURE(BM_CompareVersion, equal_identifiers, "org.bench.point42", "org.bench.point42");
BENCHMARK_CAPTURE(BM_CompareVersion, differ_at_end, "org.bench.point42", "org.bench.point43");
BENCHMARK_CAPTURE(BM_CompareVersion, differ_at_start, "org.bench.point42", "com.bench.point42");
BENCHMARK_CAPTURE(BM_CompareVersion, non_ascii, "caf\xC3\xA9 2", "cafe\xCC\x81 10");

// ---- Form export and resource tokens -----------------------------------------

void BM_ExportForm(benchmark::State& state) {
  auto record = MakeRecord(42, 7);
  for (auto _ : state) benchmark::DoNotOptimize(record->exportForm());
}
BENCHMARK(BM_ExportForm);

// A temporary folder with a sandbox key in it, and plug-in services that
// sign tokens with that key; removed when it goes.
struct SigningFolder {
  SigningFolder() {
    char pattern[] = "/tmp/drd-micro.XXXXXX";
    root = std::filesystem::canonical(::mkdtemp(pattern)).string();
    signing = dr::MakeLinuxCodeSigning(dr::ProcessInfo::Default(), dr::FileSystem::Default());
    sandbox =
        dr::MakeLinuxSandbox(dr::SandboxOptions{.keyPath = root + "/sandbox.key"}, signing.get());
    services.sandbox = sandbox.get();
  }
  ~SigningFolder() { std::filesystem::remove_all(root); }
  std::string root;
  std::unique_ptr<dr::CodeSigning> signing;
  std::unique_ptr<dr::Sandbox> sandbox;
  dr::PlugInServices services;
};

// One "extensions" entry of a discovered form: an app extension shares its
// bundle ("."), which costs a path check and a signed token.
void BM_AugmentForm(benchmark::State& state) {
  SigningFolder world;
  auto record = MakeRecord(42, 7, world.root, world.services);
  std::filesystem::create_directories(*record->url());
  for (auto _ : state) {
    Dictionary form;
    record->augmentForm(form);
    if (form["extensions"].size() != 1) state.SkipWithError("no token");
    benchmark::DoNotOptimize(form);
  }
}
BENCHMARK(BM_AugmentForm);

// ---- DRM1 ------------------------------------------------------------------

Value LockRelease() {
  return Value{{"request", "lock"}, {"version", uint64_t{2}}, {"uuids", Array{dr::Uuid::random()}}};
}

// A discovery reply of `count` forms, each with annotations and a token.
Value MatchReply(int count) {
  Array matches;
  for (int i = 0; i < count; ++i) {
    Dictionary form = MakeRecord(i % kPoints, i)->exportForm().dictionary();
    form["annotations"] = Value{{"election", 1}};
    form["extensions"] = Value{{".", std::string(160, 'a')}};
    matches.push_back(Value(std::move(form)));
  }
  return Value{{"matches", Value(std::move(matches))}};
}

void BM_Drm1Encode(benchmark::State& state, Value body) {
  size_t bytes = 0;
  for (auto _ : state) {
    auto frame = dr::drm1::EncodeFrame(1, 0, dr::drm1::kFlagWantsReply, body);
    bytes = frame->size();
    benchmark::DoNotOptimize(frame);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(bytes));
  state.counters["frame_bytes"] = static_cast<double>(bytes);
}
BENCHMARK_CAPTURE(BM_Drm1Encode, lock_release, LockRelease());
BENCHMARK_CAPTURE(BM_Drm1Encode, match_100, MatchReply(100))->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Drm1Encode, match_1000, MatchReply(1000))->Unit(benchmark::kMicrosecond);

// Decodes `frame` under serial `serial` (the serials of a connection rise)
// through `decoder`, fed in 64 KiB pieces as a socket delivers a large reply.
std::optional<dr::drm1::Frame> DecodeInPieces(dr::drm1::FrameDecoder& decoder, std::string& frame,
                                              uint64_t serial, benchmark::State& state) {
  std::memcpy(frame.data() + 8, &serial, sizeof serial);
  std::optional<dr::drm1::Frame> got;
  for (size_t at = 0; at < frame.size() && !got; at += 65536) {
    decoder.feed(std::string_view(frame).substr(at, 65536));
    auto next = decoder.next();
    if (!next.ok()) state.SkipWithError("decode failed");
    if (next.ok() && next->has_value()) got = std::move(**next);
  }
  return got;
}

// Decoding through the FrameDecoder, fed in 64 KiB pieces as a socket
// delivers a large reply.
void BM_Drm1Decode(benchmark::State& state, Value body) {
  std::string frame = *dr::drm1::EncodeFrame(1, 0, dr::drm1::kFlagWantsReply, body);
  // One decoder for every frame, as a connection keeps one; the serials
  // rise, as a connection's must.
  dr::drm1::FrameDecoder decoder;
  uint64_t serial = 0;
  for (auto _ : state) {
    std::optional<dr::drm1::Frame> got = DecodeInPieces(decoder, frame, ++serial, state);
    benchmark::DoNotOptimize(got);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(frame.size()));
}
BENCHMARK_CAPTURE(BM_Drm1Decode, lock_release, LockRelease());
BENCHMARK_CAPTURE(BM_Drm1Decode, match_100, MatchReply(100))->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Drm1Decode, match_1000, MatchReply(1000))->Unit(benchmark::kMicrosecond);

// What the client library does with W3's reply in bench/load (a "match"
// without rules listing 1,000 plug-ins of 10 extension points, each
// form with its signed "extensions" token): a FrameDecoder with the limits of
// frames from drd, fed in 64 KiB pieces as the socket delivers them. The
// reply is drd's own when bench/load has recorded one beside this program
// (w3-reply.body, written by a full load run), else one built the same way
// here.
std::string BuiltW3Reply() {
  SigningFolder world;
  Array matches;
  for (int p = 0; p < 10; ++p) {
    for (int i = 0; i < 100; ++i) {
      auto record = MakeRecord(p, i, world.root, world.services);
      std::filesystem::create_directories(*record->url());
      Dictionary form = record->exportForm().dictionary();
      record->augmentForm(form);
      matches.push_back(Value(std::move(form)));
    }
  }
  return *dr::drm1::EncodeFrame(1, 1, dr::drm1::kFlagIsReply,
                                Value{{"matches", Value(std::move(matches))}});
}

// The recorded reply framed as drd sends it, or nothing.
std::optional<std::string> RecordedW3Reply() {
  char self[4096] = {};
  ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  if (n <= 0) return std::nullopt;
  std::ifstream in(std::filesystem::path(std::string(self, static_cast<size_t>(n))).parent_path() /
                       "w3-reply.body",
                   std::ios::binary);
  std::string body{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  if (body.empty()) return std::nullopt;
  std::string frame(dr::drm1::kHeaderSize, '\0');
  std::memcpy(frame.data(), dr::drm1::kMagic, 4);
  const uint32_t length = static_cast<uint32_t>(body.size());
  const uint64_t replyTo = 1;
  const uint32_t flags = dr::drm1::kFlagIsReply;
  std::memcpy(frame.data() + 4, &length, 4);  // little-endian, as on every drd host
  std::memcpy(frame.data() + 16, &replyTo, 8);
  std::memcpy(frame.data() + 24, &flags, 4);
  return frame + body;
}

void BM_ClientDecodeW3(benchmark::State& state) {
  static const std::optional<std::string> recorded = RecordedW3Reply();
  std::string frame = recorded ? *recorded : BuiltW3Reply();
  dr::drm1::FrameDecoder decoder(dr::drm1::kFromDaemon);
  uint64_t serial = 0;
  for (auto _ : state) {
    std::optional<dr::drm1::Frame> got = DecodeInPieces(decoder, frame, ++serial, state);
    if (!got || got->body["matches"].size() != 1000) state.SkipWithError("not 1,000 forms");
    benchmark::DoNotOptimize(got);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(frame.size()));
  state.counters["frame_bytes"] = static_cast<double>(frame.size());
  state.counters["drd_recorded"] = recorded ? 1 : 0;
}
BENCHMARK(BM_ClientDecodeW3)->Unit(benchmark::kMicrosecond);

// A body of one dictionary of `count` keys written in ascending or descending
// order: drd's encoders write the first, a peer may send the second.
std::string KeyOrderBody(int count, bool descending) {
  auto u32 = [](std::string& out, uint32_t v) { out.append(reinterpret_cast<const char*>(&v), 4); };
  std::string body(1, static_cast<char>(dr::drm1::kTagDictionary));
  u32(body, static_cast<uint32_t>(count));
  for (int i = 0; i < count; ++i) {
    char key[16];
    std::snprintf(key, sizeof key, "key%08d", descending ? count - 1 - i : i);
    u32(body, 11);
    body.append(key, 11);
    body += static_cast<char>(dr::drm1::kTagTrue);
  }
  return body;
}

void BM_Drm1DecodeKeyOrder(benchmark::State& state, bool descending) {
  const std::string body = KeyOrderBody(static_cast<int>(state.range(0)), descending);
  for (auto _ : state) {
    auto value = dr::drm1::DecodeBody(body);
    if (!value.ok() || value->size() != static_cast<size_t>(state.range(0)))
      state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK_CAPTURE(BM_Drm1DecodeKeyOrder, ascending, false)
    ->Arg(100000)
    ->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Drm1DecodeKeyOrder, descending, true)
    ->Arg(100000)
    ->Unit(benchmark::kMicrosecond);

// ---- pdoc --------------------------------------------------------------------

std::string JsonInfo() {
  return R"({
  "BNBundleIdentifier": "org.bench.app7.p42.7",
  "BNBundleVersion": "1.0.7",
  "BNBundleName": "Plug-in 7",
  "BNBundleExecutable": "plugin",
  "UXExtension": {
    "UXExtensionPointIdentifier": "org.bench.point42",
    "UXExtensionAttributes": {
      "ActivationRule": {"image/png": 4, "text/plain": 1},
      "org.bench.tags": ["fast", "color", "batch"],
      "org.bench.ratio": 1.5
    }
  }
})";
}

void BM_PdocParse(benchmark::State& state, std::string bytes) {
  for (auto _ : state) {
    auto value = dr::pdoc::Parse(bytes);
    if (!value.ok()) state.SkipWithError("parse failed");
    benchmark::DoNotOptimize(value);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(bytes.size()));
}
BENCHMARK_CAPTURE(BM_PdocParse, info_xml, *dr::pdoc::WriteXml(*dr::pdoc::Parse(JsonInfo())));
BENCHMARK_CAPTURE(BM_PdocParse, info_json, JsonInfo());

// The annotation file with 1,000 annotated plug-ins (what "annotate" rewrites).
Value AnnotationFile(int count) {
  Dictionary data;
  for (int i = 0; i < count; ++i) {
    data["org.bench.app" + std::to_string(i % 50) + ".p" + std::to_string(i % kPoints) + "." +
         std::to_string(i)] = Value{{"election", 1}, {"extension", Value{{"mode", "fast"}}}};
  }
  return Value{{"version", 16}, {"data", Value(std::move(data))}};
}

BENCHMARK_CAPTURE(BM_PdocParse, annotations_1000, *dr::pdoc::WriteXml(AnnotationFile(1000)))
    ->Unit(benchmark::kMicrosecond);

void BM_PdocWriteAnnotations(benchmark::State& state) {
  Value file = AnnotationFile(static_cast<int>(state.range(0)));
  size_t bytes = 0;
  for (auto _ : state) {
    auto xml = dr::pdoc::WriteXml(file);
    bytes = xml->size();
    benchmark::DoNotOptimize(xml);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(bytes));
}
BENCHMARK(BM_PdocWriteAnnotations)->Arg(1000)->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
