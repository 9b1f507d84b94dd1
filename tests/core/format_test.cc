#include "core/format.h"

#include <gtest/gtest.h>

#include "core/log.h"

#include <memory>
#include <optional>

namespace dr {
namespace {

struct Described {
  std::string description() const { return "described"; }
};

TEST(FormatTest, RendersEachConversion) {
  const Uuid u = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  std::shared_ptr<Described> none;
  struct Row {
    std::string got;
    std::string expected;
  };
  const Row rows[] = {
      {Format("plain"), "plain"},
      {Format("%d%%", 50), "50%"},
      {Format("%@ and %@", Value("s"), Value(3)), "s and 3"},
      {Format("%@", std::string("path/x")), "path/x"},
      {Format("%@", u), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427"},
      {Format("%@", Value(u)), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427"},
      {Format("%@", Value{{"a", 1}}), "{ \"a\": 1 }"},
      {Format("%@", Value()), "(null)"},
      {Format("%@", none), "(null)"},
      {Format("%@", std::make_shared<Described>()), "described"},
      {Format("%@", std::optional<std::string>()), "(null)"},
      {Format("%@", DRMakeError(7, "bad")), "Dromon error 7: bad"},
      {Format("%s", "text"), "text"},
      {Format("%s", static_cast<const char*>(nullptr)), "(null)"},
      {Format("%ld %lld %zu %u", 1L, -2LL, size_t{3}, 4u), "1 -2 3 4"},
      {Format("%d", uint64_t{18446744073709551615u}), "18446744073709551615"},
      {Format("%d", Value(5)), "5"},
      {Format("%d", true), "1"},
      {Format("%03d|%-3d|%x|%X", 7, 7, 255, 255), "007|7  |ff|FF"},
      {Format("%.2f", 1.005), "1.00"},
      {Format("%5s|", "ab"), "   ab|"},
      // Mismatches are bugs in the caller but never undefined behaviour.
      {Format("%d and %@"), "(missing) and (missing)"},
      {Format("%d", "word"), "word"},
      {Format("%s", 12), "12"},
      {Format("%@", 1, 2), "1"},
      {Format("trailing %"), "trailing %"},
  };
  for (const Row& r : rows) EXPECT_EQ(r.got, r.expected);
}

// Whatever bytes a message holds (a path of any bytes, say), the log gets
// one line of UTF-8.
TEST(FormatTest, LogLinesAreOneLineOfUtf8) {
  const struct {
    std::string text, line;
  } rows[] = {
      {"plain é ✓ 𝄞", "plain é ✓ 𝄞"},
      {"a\nb\rc", "a\\nb\\rc"},
      {"at /x\xff\xfe/y", "at /x\\xFF\\xFE/y"},
      {"cut \xc3", "cut \\xC3"},
      {"overlong \xc0\xaf", "overlong \\xC0\\xAF"},
      {"surrogate \xed\xa0\x80.", "surrogate \\xED\\xA0\\x80."},
      {"\xf4\x90\x80\x80\n\xff", "\\xF4\\x90\\x80\\x80\\n\\xFF"},
  };
  for (const auto& row : rows) {
    ScopedLogCapture log;
    SystemLogLine(row.text);
    EXPECT_EQ(log.lines(), std::vector<std::string>{row.line}) << row.line;
  }
}

}  // namespace
}  // namespace dr
