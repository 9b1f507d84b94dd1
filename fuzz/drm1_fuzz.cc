// Fuzzes the DRM1 codec with the bytes a peer could send.
//
// The input is read twice: as one body (DecodeBody) and as a byte stream
// (FrameDecoder), fed once whole and once in pieces whose size the last
// input byte picks. Besides never crashing, the decoder must
// - answer the same frames and the same error however the stream is cut;
// - keep answering its error once it has failed;
// - account for every byte (consumed by frames or still buffered);
// - refuse a body past a cap on its values exactly when it holds more, and
//   count the values of one it takes the same under any cap it fits;
// and whatever it accepts must encode again, decode to the same value, and
// encode to the same bytes a second time; its description stays on one line.
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/fuzz_support.h"
#include "wire/drm1.h"

namespace dr::fuzz {
namespace {

void CheckEncodesBack(const Value& body) {
  Result<std::string> bytes = drm1::EncodeValue(body);
  DRD_FUZZ_CHECK(bytes.ok(),
                 "a decoded body does not encode: " + bytes.error().localizedDescription());
  Result<Value> again = drm1::DecodeBody(*bytes);
  DRD_FUZZ_CHECK(again.ok(),
                 "an encoded body does not decode: " + again.error().localizedDescription());
  DRD_FUZZ_CHECK(SameValue(*again, body), "a body changed on its way through the encoder");
  Result<std::string> twice = drm1::EncodeValue(*again);
  DRD_FUZZ_CHECK(twice.ok() && *twice == *bytes, "encoding is not stable");
  std::string text = body.description();
  DRD_FUZZ_CHECK(text.find_first_of("\r\n") == std::string::npos, "a description spans lines");
}

void CheckFrameEncodesBack(const drm1::Frame& frame) {
  Result<std::string> bytes =
      drm1::EncodeFrame(frame.header.serial, frame.header.replyTo, frame.header.flags, frame.body);
  DRD_FUZZ_CHECK(bytes.ok(), "a decoded frame does not encode");
  Result<drm1::Header> header = drm1::DecodeHeader(*bytes);
  DRD_FUZZ_CHECK(header.ok(), "an encoded header does not decode");
  DRD_FUZZ_CHECK(header->serial == frame.header.serial && header->replyTo == frame.header.replyTo &&
                     header->flags == frame.header.flags &&
                     header->bodyLength + drm1::kHeaderSize == bytes->size(),
                 "a header changed on its way through the encoder");
}

struct Outcome {
  std::vector<drm1::Frame> frames;
  std::optional<Error> error;
};

// Feeds `in` to a new decoder `step` bytes at a time, taking every frame.
Outcome DecodeStream(std::string_view in, size_t step) {
  Outcome out;
  drm1::FrameDecoder decoder;
  size_t fed = 0, framed = 0;
  while (fed < in.size() && !out.error) {
    const size_t n = std::min(step, in.size() - fed);
    decoder.feed(in.substr(fed, n));
    fed += n;
    for (;;) {
      Result<std::optional<drm1::Frame>> next = decoder.next();
      if (!next.ok()) {
        out.error = next.error();
        Result<std::optional<drm1::Frame>> after = decoder.next();
        DRD_FUZZ_CHECK(!after.ok() && after.error().localizedDescription() ==
                                          out.error->localizedDescription(),
                       "the decoder recovered from an error");
        break;
      }
      if (!*next) break;
      framed += drm1::kHeaderSize + (*next)->header.bodyLength;
      DRD_FUZZ_CHECK((*next)->body.isDictionary(), "a frame body is not a dictionary");
      out.frames.push_back(std::move(**next));
    }
    if (!out.error) {
      DRD_FUZZ_CHECK(framed + decoder.buffered() == fed, "the decoder lost count of bytes");
    }
  }
  return out;
}

}  // namespace
}  // namespace dr::fuzz

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  dr::fuzz::SilenceLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace dr;
  using namespace dr::fuzz;
  const std::string_view in(reinterpret_cast<const char*>(data), size);

  size_t values = 0;
  Result<Value> body = drm1::DecodeBody(in, SIZE_MAX, &values);
  if (body.ok()) CheckEncodesBack(*body);
  // The first byte picks a small cap on the number of values.
  const size_t cap = size == 0 ? 1 : 1 + data[0] % 64;
  size_t cappedValues = 0;
  Result<Value> capped = drm1::DecodeBody(in, cap, &cappedValues);
  if (body.ok()) {
    DRD_FUZZ_CHECK(capped.ok() == (values <= cap), "the cap on values refused the wrong body");
    DRD_FUZZ_CHECK(!capped.ok() || (cappedValues == values && SameValue(*capped, *body)),
                   "a body under the cap on values decoded otherwise");
  } else if (capped.ok()) {
    DRD_FUZZ_CHECK(false, "a body decoded only under a cap on its values");
  }

  Outcome whole = DecodeStream(in, in.size() + 1);
  const size_t step = size == 0 ? 1 : 1 + data[size - 1] % 64;
  Outcome pieces = DecodeStream(in, step);
  DRD_FUZZ_CHECK(whole.frames.size() == pieces.frames.size(),
                 "cutting the stream changed the frames");
  for (size_t i = 0; i < whole.frames.size(); ++i) {
    const drm1::Frame &a = whole.frames[i], &b = pieces.frames[i];
    DRD_FUZZ_CHECK(a.header.serial == b.header.serial && a.header.replyTo == b.header.replyTo &&
                       a.header.flags == b.header.flags && SameValue(a.body, b.body),
                   "cutting the stream changed a frame");
    CheckFrameEncodesBack(a);
    CheckEncodesBack(a.body);
  }
  // A long-lived connection: a stream of whole frames sent over and over
  // (with serials going up), past the point where the decoder drops the
  // bytes it has consumed, gives the same frames every time. Some 70 KB of
  // decoding, so only for one input length in 32.
  if (size % 32 == 0 && !whole.error && !whole.frames.empty()) {
    size_t framed = 0;
    for (const drm1::Frame& f : whole.frames) framed += drm1::kHeaderSize + f.header.bodyLength;
    drm1::FrameDecoder decoder;
    size_t taken = 0;
    uint64_t serial = 0;
    const size_t copies = 2 + 70000 / framed;
    for (size_t copy = 0; copy < copies; ++copy) {
      std::string frames;
      for (const drm1::Frame& f : whole.frames) {
        frames += *drm1::EncodeFrame(++serial, f.header.replyTo, f.header.flags, f.body);
      }
      decoder.feed(frames);
      for (size_t i = 0; i < whole.frames.size(); ++i, ++taken) {
        Result<std::optional<drm1::Frame>> next = decoder.next();
        DRD_FUZZ_CHECK(
            next.ok() && next->has_value() && SameValue((*next)->body, whole.frames[i].body),
            "a repeated stream gave another frame");
      }
      DRD_FUZZ_CHECK(decoder.buffered() == 0, "a repeated stream left bytes behind");
    }
    DRD_FUZZ_CHECK(taken == copies * whole.frames.size(), "a repeated stream lost frames");
  }
  DRD_FUZZ_CHECK(whole.error.has_value() == pieces.error.has_value() &&
                     (!whole.error ||
                      whole.error->localizedDescription() == pieces.error->localizedDescription()),
                 "cutting the stream changed the error");
  return 0;
}
