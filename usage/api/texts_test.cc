// The module's string tables over the platform's StringBundle: every error's
// key has its text in English and in German.

#include <gtest/gtest.h>

#include <string>

#include "kova/conf.h"
#include "kova/text.h"
#include "test_support/test_root.h"

namespace {

TEST(UsageTextsTest, EveryErrorHasItsTextInEachLanguage) {
  kova_test::TestRoot root;
  root.InstallTexts(KOVA_TEXTS_DIR);
  const char* const keys[] = {"collector_unavailable", "history_off", "database_unavailable",
                              "collector_failed"};
  for (const char* key : keys) {
    ASSERT_EQ(QLIBCINFOSetKeyValue("language", "enu"), 0);
    const StringBundle english("usage", nullptr, nullptr, nullptr, nullptr, nullptr);
    ASSERT_EQ(QLIBCINFOSetKeyValue("language", "ger"), 0);
    const StringBundle german("usage", nullptr, nullptr, nullptr, nullptr, nullptr);
    const std::string english_text = english.Text(key, "");
    EXPECT_FALSE(english_text.empty()) << key;
    // German falls back on English for a key it lacks: a text of its own differs.
    EXPECT_STRNE(german.Text(key, ""), english_text.c_str()) << key;
  }
}

}  // namespace
