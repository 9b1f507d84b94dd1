// Fuzzes compareVersionString with three strings cut from the input.
//
// Rule matching and duplicate resolution sort and compare versions, so the
// comparison must be a total preorder on any text at all: it answers -1, 0
// or +1, every string equals itself, swapping the arguments negates the
// answer, the order is transitive, and strings that compare equal compare
// alike against every third string.
#include <fuzzer/FuzzedDataProvider.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <string>

#include "fuzz/fuzz_support.h"
#include "plugin/helpers.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  dr::fuzz::SilenceLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using dr::compareVersionString;
  FuzzedDataProvider provider(data, size);
  const std::string s[3] = {provider.ConsumeRandomLengthString(64),
                            provider.ConsumeRandomLengthString(64),
                            provider.ConsumeRemainingBytesAsString()};
  // The strings in C escapes, for the report of a broken property.
  auto shown = [&s]() {
    std::string out;
    for (const std::string& x : s) {
      out += "\n  \"";
      for (unsigned char ch : x) {
        char buf[8];
        std::snprintf(buf, sizeof buf,
                      ch < 0x20 || ch >= 0x7f || ch == '"' || ch == '\\' ? "\\x%02x" : "%c", ch);
        out += buf;
      }
      out += "\"";
    }
    return out;
  };
  int c[3][3];
  for (int i = 0; i < 3; ++i) {
    for (int j = 0; j < 3; ++j) {
      c[i][j] = compareVersionString(s[i], s[j]);
      DRD_FUZZ_CHECK(c[i][j] >= -1 && c[i][j] <= 1, "an answer other than -1, 0 or +1" + shown());
    }
  }
  for (int i = 0; i < 3; ++i) {
    DRD_FUZZ_CHECK(c[i][i] == 0, "a string does not equal itself" + shown());
    for (int j = 0; j < 3; ++j) {
      DRD_FUZZ_CHECK(c[i][j] == -c[j][i], "not antisymmetric" + shown());
      for (int k = 0; k < 3; ++k) {
        if (c[i][j] <= 0 && c[j][k] <= 0) {
          DRD_FUZZ_CHECK(c[i][k] <= 0, "not transitive" + shown());
          if (c[i][j] < 0 || c[j][k] < 0)
            DRD_FUZZ_CHECK(c[i][k] < 0, "not transitive (strict)" + shown());
        }
        if (c[i][j] == 0)
          DRD_FUZZ_CHECK(c[i][k] == c[j][k], "equal strings order differently" + shown());
      }
    }
  }
  return 0;
}
