// The bytes the test module's "big" method writes as its body, which the tests
// compare a download with: byte i of the body, a sequence that repeats neither
// per kilobyte nor per part the server sends.

#ifndef KOVA_HOST_TESTDATA_PATTERN_H_
#define KOVA_HOST_TESTDATA_PATTERN_H_

#include <cstdint>

namespace kova_test {

inline char PatternByte(uint64_t i) { return static_cast<char>((i * 7 + i / 4093) & 0xff); }

}  // namespace kova_test

#endif  // KOVA_HOST_TESTDATA_PATTERN_H_
