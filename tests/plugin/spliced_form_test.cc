// A "match" reply is spliced from each record's encoded form and what the
// request adds; for random registries it must be, byte for byte, the reply
// encoded from forms built afresh, and decode to them.
#include <random>

#include "platform/sandbox.h"
#include "plugin/discovery.h"
#include "plugin/plugin_keys.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/fake_services.h"

namespace dr::test {
namespace {

struct AnyHost : PlugInClient {
  pid_t pid() const override { return 42; }
  Value entitlementValueForKey(std::string_view) const override { return Value(); }
  bool hasEntitlement(std::string_view) const override { return false; }
};

const std::string kWords[] = {"a", "extensions", "overrider", "zeta", "é", "Ω-ω"};

// A scalar, or above the third level sometimes an array or dictionary of two.
Value RandomValue(std::mt19937& rng, int depth) {
  const std::string& word = kWords[rng() % std::size(kWords)];
  const uint32_t kind = rng() % (depth > 2 ? 4 : 6);
  const Value scalars[] = {Value(rng() % 2 == 0), Value(static_cast<int64_t>(rng()) - (1l << 31)),
                           Value(word), Value(rng() / 7.0)};
  if (kind < 4) return scalars[kind];
  Value a = RandomValue(rng, depth + 1), b = RandomValue(rng, depth + 1);
  return kind == 4 ? Value(Array{a, b}) : Value{{word, a}, {"b", b}};
}

using SplicedFormTest = PlugInFixture;

TEST_F(SplicedFormTest, SplicedReplyIsTheReplyEncodedAfresh) {
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> sandbox = MakeLinuxSandbox({.keyPath = folder / "key"}, &signing);
  PlugInServices s = services();
  s.sandbox = sandbox.get();
  const std::string names[] = {"a", "b", "c", "d"};
  AnyHost host;
  for (uint32_t seed = 1; seed <= 16; ++seed) {
    SCOPED_TRACE(seed);
    std::mt19937 rng(seed);
    std::vector<DRDPlugInPtr> records;
    std::map<const DRDPlugIn*, Value> annotations;
    for (int i = 0; i < 8; ++i) {
      const std::string& name = names[rng() % std::size(names)];
      Dictionary pd{{"Extra", RandomValue(rng, 1)}};
      if (rng() % 2) pd.insert_or_assign("Shared", rng() % 2 ? Value(".") : Value("missing"));
      RegistryEntry::Fields f;
      f.onSystemVolume = rng() % 3 == 0;
      f.registrationDate = Date{static_cast<double>(rng() % 3)};
      if (!f.onSystemVolume) f.containingApplication = RegistryApplication{folder / "A.app", "A"};
      if (rng() % 2) f.displayName = "Name é";
      if (rng() % 2) f.shortName = name;
      const Value replaced("com.example." + names[rng() % std::size(names)] + ".ext");
      const Value entitlements =
          rng() % 3 ? Sandboxed() : Sandboxed().changing(kReplacePluginEntitlement, replaced);
      Value info = PlugInInfo(name, Value(std::move(pd)))
                       .changing("BNBundleVersion", Value(std::to_string(rng() % 3)));
      records.push_back(DRDPlugIn::initWithRGData(entry(info, entitlements, std::move(f)), s));
      ASSERT_TRUE(records.back());
      if (rng() % 2) annotations[records.back().get()] = Value{{"election", RandomValue(rng, 2)}};
    }
    DiscoveryServices hooks;
    hooks.annotations = [&](const DRDPlugIn& p) {
      return annotations.contains(&p) ? annotations[&p] : DRPlugInCore::NoAnnotations();
    };
    Discovery discovery(DiscoveryHost{&host, {}, "", false}, Value(), rng() % 2, Value(), hooks);
    for (const DRDPlugInPtr& record : records) discovery.examine(record);
    const DiscoveredForms forms = discovery.finish();

    drm1::Splice spliced(drm1::kMaxReplyBodySize);
    spliced.container(drm1::kTagDictionary, 1, 1);
    spliced.key("matches");
    forms.splice(spliced);
    ASSERT_TRUE(spliced.seal(9, 4, drm1::kFlagIsReply).ok());
    const size_t from = rng() % spliced.size();  // where a write resumes
    std::vector<iovec> parts(spliced.size());
    parts.resize(spliced.gather(from, parts.data(), parts.size()));
    std::string tail;  // what the parts hold
    for (const iovec& p : parts) tail.append(static_cast<char*>(p.iov_base), p.iov_len);
    const std::string bytes = std::move(spliced).flatten();
    const Value afresh{{"matches", forms.value()}};
    EXPECT_EQ(bytes, *drm1::EncodeFrame(9, 4, drm1::kFlagIsReply, afresh));
    EXPECT_EQ(*drm1::DecodeBody(std::string_view(bytes).substr(drm1::kHeaderSize)), afresh);
    EXPECT_EQ(tail, bytes.substr(from));
  }
}

}  // namespace
}  // namespace dr::test
