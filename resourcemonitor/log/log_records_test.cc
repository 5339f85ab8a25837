#include "log/log_records.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

namespace {

// The texts of `records` sorted by `field`, and what sorting the texts
// themselves byte by byte gives.
void ExpectSortedLikeStrings(const std::vector<std::string>& texts, const std::string& field,
                             bool ascending) {
  LogRecords records;
  for (const std::string& text : texts) records.AddLine("Info", text, "event of " + text);
  records.Sort(LogCompare(field, ascending));
  std::vector<std::string> expected = texts;
  std::sort(expected.begin(), expected.end());
  if (!ascending) std::reverse(expected.begin(), expected.end());
  std::vector<std::string> sorted;
  for (size_t i = 0; i < records.size(); ++i) {
    const LogFields fields = records.Fields(i);
    sorted.emplace_back(field == "time" ? fields.time : fields.event.substr(9));
    EXPECT_EQ(fields.event, "event of " + std::string(fields.time));
  }
  EXPECT_EQ(sorted, expected) << field << (ascending ? " ascending" : " descending");
}

TEST(LogRecordsTest, SortsByteWiseWhateverTheInputOrder) {
  // Times in the log's shape sort as numbers, others as texts, mixed too.
  const std::vector<std::vector<std::string>> inputs = {
      {},
      {"2026/11/01 10:00:00", "2026/11/02 09:00:00", "2026/11/03 08:00:00"},  // log order
      {"2026/11/03 08:00:00", "2026/11/02 09:00:00", "2026/11/01 10:00:00"},
      {"2026/11/01 10:00:09", "2026/11/01 10:00:10", "2026/11/01 09:59:59", "2026/11/01 10:00:10"},
      {"b", "a", "ab", "a", "\xff", "B"},
      {"2026/11/01 10:00:00", "2026/11/01 10:00:0", "2026/11/01 10:00:00x", "2026-11-01 10:00:00",
       "2026/11/01 1:00:00", "2026/11/01 10:00:01", "2026/11/01 10:00:0:", "9"},
  };
  for (const auto& input : inputs) {
    for (bool ascending : {true, false}) {
      ExpectSortedLikeStrings(input, "time", ascending);
      ExpectSortedLikeStrings(input, "event", ascending);
    }
  }
  std::mt19937 random(7);
  std::vector<std::string> texts;
  for (int i = 0; i < 2000; ++i) {
    std::string text = "2026/11/01 10:00:00";
    for (char& c : text) c = random() % 4 == 0 ? "19/\xfe"[random() % 4] : c;
    texts.push_back(text);
  }
  ExpectSortedLikeStrings(texts, "time", false);
  ExpectSortedLikeStrings(texts, "time", true);
}

TEST(LogRecordsTest, CompareAndEntryAgreeOnMembers) {
  LogRecords records;
  records.AddLine("Warning", "2026/11/01 10:00:00", "cpu\thigh");
  Json::Value entry = records.Entry(0);
  EXPECT_EQ(entry.getMemberNames(), (std::vector<std::string>{"event", "level", "time"}));
  EXPECT_EQ(entry["event"], "cpu\thigh");
  for (const char* field : {"level", "time", "event", "other"}) {
    const LogCompare compare(field, true);
    EXPECT_EQ(compare.Text(records.Fields(0)), compare.Text(entry)) << field;
  }
  EXPECT_TRUE(LogCompare("time", true)(Json::Value(), entry));  // a missing text is empty
  EXPECT_FALSE(LogCompare("time", true)(entry, 5));
}

}  // namespace
