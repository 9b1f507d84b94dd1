// Fuzzes the pdoc reader (both forms) with the bytes of a hostile file:
// information dictionaries, entitlements, SDK files and the annotation file
// all come through it.
//
// Besides never crashing, hanging or leaking, the reader must answer a value
// or an error whose text is UTF-8, the same the second time; a value read
// from the XML form must write again; and whatever the writer writes must
// read back as the same value and write the same bytes again.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "core/utf8.h"
#include "fuzz/fuzz_support.h"
#include "pdoc/pdoc.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  dr::fuzz::SilenceLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace dr;
  using namespace dr::fuzz;
  const std::string_view in(reinterpret_cast<const char*>(data), size);

  Result<Value> value = pdoc::Parse(in);
  // Parsers are reused from one document to the next: nothing of this one
  // may change how the same bytes read again.
  Result<Value> again = pdoc::Parse(in);
  DRD_FUZZ_CHECK(
      value.ok() == again.ok() && (value.ok() ? SameValue(*value, *again)
                                              : value.error().localizedDescription() ==
                                                    again.error().localizedDescription()),
      "the same bytes read differently the second time");
  if (!value.ok()) {
    const Error& e = value.error();
    DRD_FUZZ_CHECK(e.domain() == kPdocErrorDomain && e.code() == pdoc::kMalformed,
                   "a parse error outside the pdoc domain");
    DRD_FUZZ_CHECK(IsValidUtf8(e.localizedDescription()), "an error text is not UTF-8");
    return 0;
  }
  DRD_FUZZ_CHECK(value->isPresent(), "a parse answered an absent value");

  Result<std::string> xml = pdoc::WriteXml(*value);
  if (!xml.ok()) {
    // JSON may carry text XML cannot ("\u0001"); what XML carried in, it
    // carries out.
    const size_t first = in.find_first_not_of(" \t\r\n\xEF\xBB\xBF");
    DRD_FUZZ_CHECK(first == std::string_view::npos || in[first] != '<',
                   "a value read from XML does not write: " + xml.error().localizedDescription());
    return 0;
  }
  Result<Value> back = pdoc::Parse(*xml);
  DRD_FUZZ_CHECK(back.ok(), "written XML does not read: " +
                                (back.ok() ? std::string() : back.error().localizedDescription()));
  DRD_FUZZ_CHECK(SameValue(*back, *value), "a value changed on its way through XML");
  Result<std::string> rewritten = pdoc::WriteXml(*back);
  DRD_FUZZ_CHECK(rewritten.ok() && *rewritten == *xml, "writing is not stable");
  return 0;
}
