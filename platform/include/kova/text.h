// Texts of the web desktop: localised strings, HTML and URL encoding, and
// Unicode case mapping.

#ifndef KOVA_TEXT_H_
#define KOVA_TEXT_H_

#include <cstddef>
#include <string>

#include "kova/export.h"

// The localised strings of up to six sections of the web desktop's string
// tables, in the system's language.
class KOVA_API StringBundle {
 public:
  // Loads the named sections; null names are skipped. A section that doesn't
  // exist loads nothing. Never fails.
  StringBundle(const char* section1, const char* section2, const char* section3,
               const char* section4, const char* section5, const char* section6);
  ~StringBundle();
  StringBundle(const StringBundle&) = delete;
  StringBundle& operator=(const StringBundle&) = delete;

  // The text of `key` in the first section that has it, or `missing` when none
  // has. The text stays valid while the bundle lives.
  const char* Text(const char* key, const char* missing) const;

 private:
  struct Impl;
  Impl* impl_;
};

namespace WebUtils {

// `text` with &, < and > written as HTML character references, and " and ' as
// well when `quotes` is true.
KOVA_API std::string EncodeHtml(const std::string& text, bool quotes);

// `text` percent-encoded byte by byte, all but the unreserved characters
// A-Z a-z 0-9 - . _ ~ which stay as they are.
KOVA_API std::string EncodeURL(const std::string& text);

}  // namespace WebUtils

// Writes the Unicode upper-case form of the UTF-8 text `source`, NUL-terminated,
// into `dest` of `size` bytes; the result may be longer than the source. Returns
// its length in bytes. Returns -1 when `source` is not valid UTF-8 or the result
// and its NUL don't fit.
KOVA_API int QLIBCUnicodeUTF8StrUpper(const char* source, char* dest, size_t size);

#endif  // KOVA_TEXT_H_
