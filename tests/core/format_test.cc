#include "core/format.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>

#include "core/log.h"

namespace dr {
namespace {

struct Described {
  std::string description() const { return "described"; }
};

TEST(FormatTest, RendersEachConversion) {
  const Uuid u = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  const std::pair<std::string, std::string> rows[] = {
      {Format("%d%%", 50), "50%"},
      {Format("%@ and %@", Value("s"), Value(3)), "s and 3"},
      {Format("%@", Value(u)), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427"},
      {Format("%@", std::shared_ptr<Described>()), "(null)"},
      {Format("%@", std::make_shared<Described>()), "described"},
      {Format("%@", std::optional<std::string>()), "(null)"},
      {Format("%@", DRMakeError(7, "bad")), "Dromon error 7: bad"},
      {Format("%s", static_cast<const char*>(nullptr)), "(null)"},
      {Format("%ld %lld %zu %u", 1L, -2LL, size_t{3}, 4u), "1 -2 3 4"},
      {Format("%d", uint64_t{18446744073709551615u}), "18446744073709551615"},
      {Format("%d %d", Value(5), true), "5 1"},
      {Format("%03d|%-3d|%x|%X", 7, 7, 255, 255), "007|7  |ff|FF"},
      {Format("%.2f|%f", 1.005, 2), "1.00|2.000000"},
      {Format("%5s|", "ab"), "   ab|"},
      {Format("%d and %@"), "(missing) and (missing)"},
      {Format("%d %f", "word", "text"), "word text"},
      {Format("%s", 12), "12"},
      {Format("%@", 1, 2), "1"},
      {Format("trailing %5"), "trailing %5"},
      {Format("trailing %"), "trailing %"}};
  for (const auto& [got, expected] : rows) EXPECT_EQ(got, expected);
}

TEST(FormatTest, LogLinesAreOneLineOfUtf8) {
  const std::pair<std::string, std::string> rows[] = {
      {"plain é ✓ 𝄞\nb\rc", "plain é ✓ 𝄞\\nb\\rc"},
      {"at /x\xff\xfe/y cut \xc3", "at /x\\xFF\\xFE/y cut \\xC3"},
      {"overlong \xc0\xaf surrogate \xed\xa0\x80.",
       "overlong \\xC0\\xAF surrogate \\xED\\xA0\\x80."},
      {"\xf4\x90\x80\x80\n\xff", "\\xF4\\x90\\x80\\x80\\n\\xFF"},
  };
  for (const auto& [text, line] : rows) {
    ScopedLogCapture log;
    SystemLogLine(text);
    EXPECT_EQ(log.lines(), std::vector<std::string>{line}) << line;
  }
}

}  // namespace
}  // namespace dr
