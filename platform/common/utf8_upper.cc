// Unicode upper-casing of UTF-8 texts, by ICU's full case mapping.

#include <unicode/casemap.h>
#include <unicode/utf8.h>

#include <climits>
#include <cstring>

#include "kova/text.h"

namespace {

bool IsValidUtf8(const char* text, int32_t length) {
  for (int32_t i = 0; i < length;) {
    UChar32 c;
    U8_NEXT(text, i, length, c);
    if (c < 0) return false;
  }
  return true;
}

}  // namespace

int QLIBCUnicodeUTF8StrUpper(const char* source, char* dest, size_t size) {
  if (source == nullptr || dest == nullptr || size == 0) return -1;
  const size_t length = strlen(source);
  if (length > INT32_MAX || !IsValidUtf8(source, static_cast<int32_t>(length))) return -1;
  const int32_t capacity = size > INT32_MAX ? INT32_MAX : static_cast<int32_t>(size);
  UErrorCode status = U_ZERO_ERROR;
  const int32_t written = icu::CaseMap::utf8ToUpper("", 0, source, static_cast<int32_t>(length),
                                                    dest, capacity, nullptr, status);
  // The result needs room for its NUL as well.
  if (U_FAILURE(status) || written >= capacity) return -1;
  dest[written] = '\0';
  return written;
}
