#include "model/helpers.h"

#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>

#include <string>
#include <vector>

namespace dr {
namespace {

// The code points of `s` in canonical decomposition (NFD). Bytes that are
// not UTF-8 come through as U+FFFD from ICU's conversion, which keeps the
// comparison total.
std::vector<UChar32> Decomposed(std::string_view s) {
  icu::UnicodeString text =
      icu::UnicodeString::fromUTF8(icu::StringPiece(s.data(), static_cast<int32_t>(s.size())));
  UErrorCode status = U_ZERO_ERROR;
  const icu::Normalizer2* nfd = icu::Normalizer2::getNFDInstance(status);
  if (U_SUCCESS(status)) {
    icu::UnicodeString normalized = nfd->normalize(text, status);
    if (U_SUCCESS(status)) text = normalized;
  }
  std::vector<UChar32> out;
  out.reserve(static_cast<size_t>(text.length()));
  for (int32_t i = 0; i < text.length();) {
    UChar32 c = text.char32At(i);
    out.push_back(c);
    i += U16_LENGTH(c);
  }
  return out;
}

// The decimal value of a digit code point, or -1. Any Unicode decimal digit
// counts, so runs of full-width or Arabic-Indic digits order by value too.
int DigitValue(UChar32 c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c < 0x80) return -1;
  return u_charType(c) == U_DECIMAL_DIGIT_NUMBER ? u_charDigitValue(c) : -1;
}

}  // namespace

Value dictionaryChangingTo(const Value& dictionary, std::string_view key, const Value& value) {
  return dictionary.changing(key, value);
}

int compareVersionString(std::string_view a, std::string_view b) {
  const std::vector<UChar32> x = Decomposed(a), y = Decomposed(b);
  size_t i = 0, j = 0;
  while (i < x.size() && j < y.size()) {
    if (DigitValue(x[i]) >= 0 && DigitValue(y[j]) >= 0) {
      // Compare the two maximal digit runs by value without converting to an
      // integer type, so runs of any length work: skip leading zeros, then
      // the longer run is larger, else the first differing digit decides.
      size_t ie = i, je = j;
      while (ie < x.size() && DigitValue(x[ie]) >= 0) ++ie;
      while (je < y.size() && DigitValue(y[je]) >= 0) ++je;
      size_t is = i, js = j;
      while (is + 1 < ie && DigitValue(x[is]) == 0) ++is;
      while (js + 1 < je && DigitValue(y[js]) == 0) ++js;
      if (ie - is != je - js) return ie - is < je - js ? -1 : 1;
      for (; is < ie; ++is, ++js) {
        int dx = DigitValue(x[is]), dy = DigitValue(y[js]);
        if (dx != dy) return dx < dy ? -1 : 1;
      }
      i = ie;
      j = je;
      continue;
    }
    if (x[i] != y[j]) return x[i] < y[j] ? -1 : 1;
    ++i;
    ++j;
  }
  if (i < x.size()) return 1;
  if (j < y.size()) return -1;
  return 0;
}

}  // namespace dr
