// DRD_EXPORT marks the symbols of drd's client library that hosts may use.
// Everything else stays hidden when the library is built with
// -fvisibility=hidden.
#pragma once

#if defined(__GNUC__) || defined(__clang__)
#define DRD_EXPORT __attribute__((visibility("default")))
#else
#define DRD_EXPORT
#endif
