// One control request as bytes: how far the bytes received so far hold a whole PStream value
// (without decoding it, so a request's size and nesting are bounded before any memory is spent
// on it), and decoding a whole one.
#ifndef S2S_SERVICE_MESSAGE_H
#define S2S_SERVICE_MESSAGE_H

#include <cstddef>
#include <string>

#include "s2s_pobject.h"

namespace s2sd {

enum class Scan { kComplete, kIncomplete, kMalformed, kTooDeep };

// Looks at `bytes` from the start. kComplete sets `length` to the bytes of the first value; a
// container nested deeper than `max_depth` gives kTooDeep as soon as it is seen.
Scan ScanMessage(const std::string& bytes, size_t max_depth, size_t& length);

// Decodes the first `length` bytes (a value ScanMessage found complete) with PStream. 0 or -1.
int DecodeMessage(const std::string& bytes, size_t length, S2S::PObject& value);

}  // namespace s2sd

#endif  // S2S_SERVICE_MESSAGE_H
