#include <gtest/gtest.h>

#include <fstream>
#include <string>

#include "kova/conf.h"
#include "kova/text.h"
#include "test_support/test_root.h"

namespace {

class TextsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.Write("/usr/share/kova/texts/enu/a.ini",
                "; comment\n[log]\nlog_time = \"Time\"\nlog_type=Level\n"
                "[tree]\nlog_time = \"Tree time\"\nonly_tree = \"Tree\"\n"
                "[error]\nfail = \"Failed\"\n");
    root_.Write("/usr/share/kova/texts/enu/b.ini", "[log]\nlog_action = \"Event\"\n");
    root_.Write("/usr/share/kova/texts/ger/a.ini", "[log]\nlog_time = \"Zeit\"\n");
  }
  kova_test::TestRoot root_;
};

TEST_F(TextsTest, LooksKeysUpInTheSystemLanguageWithEnglishBehind) {
  const struct {
    const char* language;  // nullptr: not configured
    const char* key;
    const char* text;
  } cases[] = {
      {nullptr, "log_time", "Time"},    {nullptr, "log_type", "Level"},
      {nullptr, "log_action", "Event"}, {nullptr, "only_tree", "Tree"},
      {nullptr, "fail", "missing"},  // a section not asked for
      {nullptr, "absent", "missing"},   {"ger", "log_time", "Zeit"},
      {"ger", "log_action", "Event"},   {"fre", "log_time", "Time"},  // no such language
      {"../enu", "log_time", "Time"},
  };
  for (const auto& c : cases) {
    if (c.language != nullptr) QLIBCINFOSetKeyValue("language", c.language);
    StringBundle bundle("common", "log", "tree", nullptr, nullptr, nullptr);
    EXPECT_STREQ(bundle.Text(c.key, "missing"), c.text) << c.language << " " << c.key;
  }
}

TEST_F(TextsTest, ShipsTheModulesKeysInEveryLanguage) {
  for (const char* language : {"enu", "ger"}) {
    kova_test::TestRoot root;
    const std::string source =
        std::string(KOVA_TEXTS_DIR) + "/" + language + "/resourcemonitor.ini";
    std::ifstream in(source);
    ASSERT_TRUE(in) << source;
    root.Write("/usr/share/kova/texts/" + std::string(language) + "/resourcemonitor.ini",
               std::string(std::istreambuf_iterator<char>(in), {}));
    QLIBCINFOSetKeyValue("language", language);
    StringBundle bundle("common", "log", "tree", nullptr, nullptr, nullptr);
    for (const char* key : {"log_time", "log_type", "log_action"}) {
      EXPECT_STRNE(bundle.Text(key, ""), "") << language << " " << key;
    }
    EXPECT_STREQ(bundle.Text("log_time", ""), std::string(language) == "enu" ? "Time" : "Zeit");
  }
}

}  // namespace
