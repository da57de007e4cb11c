#pragma once
// UTF-8 well-formedness, byte by byte: the one decoder that the JSON
// checks, the log and the stored-record reader share.
//
// Thread safety: pure functions.

#include <cstddef>

namespace utf8 {

// The length (2 to 4) of the well-formed multi-byte sequence that begins at
// p, before end; 0 when the bytes there are none (a lone continuation byte,
// an overlong form, a surrogate, a value past U+10FFFF, a cut sequence).
// *p must be 0x80 or above.
inline std::size_t sequenceLength(const unsigned char* p, const unsigned char* end) noexcept {
  const unsigned c = *p;
  std::size_t n = 0;
  // The second byte's range excludes overlong forms (E0, F0), surrogates
  // (ED) and values past U+10FFFF (F4).
  unsigned lo = 0x80, hi = 0xBF;
  if (c >= 0xC2 && c <= 0xDF) {
    n = 2;
  } else if (c >= 0xE0 && c <= 0xEF) {
    n = 3;
    if (c == 0xE0) lo = 0xA0;
    if (c == 0xED) hi = 0x9F;
  } else if (c >= 0xF0 && c <= 0xF4) {
    n = 4;
    if (c == 0xF0) lo = 0x90;
    if (c == 0xF4) hi = 0x8F;
  } else {
    return 0;
  }
  if (static_cast<std::size_t>(end - p) < n || p[1] < lo || p[1] > hi) return 0;
  for (std::size_t i = 2; i < n; ++i) {
    if ((p[i] & 0xC0) != 0x80) return 0;
  }
  return n;
}

}  // namespace utf8
