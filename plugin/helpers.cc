#include "plugin/helpers.h"

#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>

#include <algorithm>
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

// Where a code point orders against one that is not a digit: a digit of any
// script stands where the ASCII digits do. Taking U+0662 (ARABIC-INDIC TWO)
// by its code point would put it after "Z" while "3" comes before "Z", and
// with U+0662 before "3" the order would not be transitive.
UChar32 OrderingKey(UChar32 c) {
  const int digit = DigitValue(c);
  return digit >= 0 ? '0' + digit : c;
}

bool IsAscii(std::string_view s) {
  for (char c : s)
    if (static_cast<unsigned char>(c) >= 0x80) return false;
  return true;
}

UChar32 At(const std::vector<UChar32>& s, size_t i) { return s[i]; }
UChar32 At(std::string_view s, size_t i) { return static_cast<unsigned char>(s[i]); }

// The ordering over two sequences of code points in canonical
// decomposition (a vector of code points, or ASCII text, which is its own).
template <typename X, typename Y>
int CompareCodePoints(const X& x, const Y& y) {
  size_t i = 0, j = 0;
  while (i < x.size() && j < y.size()) {
    if (DigitValue(At(x, i)) >= 0 && DigitValue(At(y, j)) >= 0) {
      // Compare the two maximal digit runs by value without converting to an
      // integer type, so runs of any length work: skip leading zeros, then
      // the longer run is larger, else the first differing digit decides.
      size_t ie = i, je = j;
      while (ie < x.size() && DigitValue(At(x, ie)) >= 0) ++ie;
      while (je < y.size() && DigitValue(At(y, je)) >= 0) ++je;
      size_t is = i, js = j;
      while (is + 1 < ie && DigitValue(At(x, is)) == 0) ++is;
      while (js + 1 < je && DigitValue(At(y, js)) == 0) ++js;
      if (ie - is != je - js) return ie - is < je - js ? -1 : 1;
      for (; is < ie; ++is, ++js) {
        int dx = DigitValue(At(x, is)), dy = DigitValue(At(y, js));
        if (dx != dy) return dx < dy ? -1 : 1;
      }
      i = ie;
      j = je;
      continue;
    }
    const UChar32 kx = OrderingKey(At(x, i)), ky = OrderingKey(At(y, j));
    if (kx != ky) return kx < ky ? -1 : 1;
    ++i;
    ++j;
  }
  if (i < x.size()) return 1;
  if (j < y.size()) return -1;
  return 0;
}

}  // namespace

Value dictionaryChangingTo(const Value& dictionary, std::string_view key, const Value& value) {
  return dictionary.changing(key, value);
}

int compareVersionString(std::string_view a, std::string_view b) {
  // Discovery compares every installed plug-in's values against the host's
  // rules, nearly always in ASCII: that needs neither conversion nor
  // normalisation, which cost several times the comparison itself.
  if (IsAscii(a) && IsAscii(b)) {
    // Equal leading characters order nothing, so start where the strings
    // part (rules mostly compare identifiers with a long shared prefix),
    // backed up to the start of a digit run that the difference falls in.
    size_t p = std::mismatch(a.begin(), a.begin() + std::min(a.size(), b.size()), b.begin()).first -
               a.begin();
    while (p > 0 && DigitValue(At(a, p - 1)) >= 0) --p;
    return CompareCodePoints(a.substr(p), b.substr(p));
  }
  return CompareCodePoints(Decomposed(a), Decomposed(b));
}

}  // namespace dr
