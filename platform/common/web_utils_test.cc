#include <gtest/gtest.h>

#include <string>

#include "kova/text.h"

namespace {

TEST(WebUtilsTest, EncodesHtmlSpecialCharacters) {
  const std::string text = "<a href=\"x\">Tom & 'Jerry'</a>";
  EXPECT_EQ(WebUtils::EncodeHtml(text, true),
            "&lt;a href=&quot;x&quot;&gt;Tom &amp; &#39;Jerry&#39;&lt;/a&gt;");
  EXPECT_EQ(WebUtils::EncodeHtml(text, false), "&lt;a href=\"x\"&gt;Tom &amp; 'Jerry'&lt;/a&gt;");
  EXPECT_EQ(WebUtils::EncodeHtml("", true), "");
}

TEST(WebUtilsTest, PercentEncodesAllButUnreservedCharacters) {
  const struct {
    const char* text;
    const char* encoded;
  } cases[] = {
      {"ResourceMonitor-2024-05-01-13-07-09.csv", "ResourceMonitor-2024-05-01-13-07-09.csv"},
      {"a b/c?d=e&f", "a%20b%2Fc%3Fd%3De%26f"},
      {"~._-", "~._-"},
      {"\xC3\xBC\"%", "%C3%BC%22%25"},
      {"", ""},
  };
  for (const auto& c : cases) EXPECT_EQ(WebUtils::EncodeURL(c.text), c.encoded) << c.text;
}

}  // namespace
