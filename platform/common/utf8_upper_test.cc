#include <gtest/gtest.h>

#include "kova/text.h"

namespace {

TEST(Utf8UpperTest, MapsWholeTextsIncludingOnesThatGrow) {
  const struct {
    const char* text;
    size_t size;
    int length;  // -1: refused
    const char* upper;
  } cases[] = {
      {"warning", 8, 7, "WARNING"},
      {"Cr\xC3\xADtico \xC3\xA4", 16, 11, "CR\xC3\x8DTICO \xC3\x84"},
      {"stra\xC3\x9F"
       "e",
       8, 7, "STRASSE"},
      {"\xCE\x90", 7, 6, "\xCE\x99\xCC\x88\xCC\x81"},  // one letter becomes three
      {"\xCE\x90", 3, -1, ""},                         // ... and no longer fits
      {"abc", 3, -1, ""},                              // no room for the NUL
      {"", 1, 0, ""},
      {"ab\xC3", 8, -1, ""},        // cut short
      {"\xFF", 8, -1, ""},          // never valid
      {"\xC0\xAF", 8, -1, ""},      // overlong
      {"\xED\xA0\x80", 8, -1, ""},  // a surrogate
  };
  for (const auto& c : cases) {
    char buffer[32];
    const int length = QLIBCUnicodeUTF8StrUpper(c.text, buffer, c.size);
    EXPECT_EQ(length, c.length) << c.text;
    if (length >= 0) {
      EXPECT_STREQ(buffer, c.upper) << c.text;
    }
  }
}

}  // namespace
