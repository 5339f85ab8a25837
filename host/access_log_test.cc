#include "host/access_log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace kova_host {
namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;

TEST(AccessLogTest, WritesEveryFieldAsPrintableAscii) {
  const struct {
    std::string path;
    std::string user;
    const char* shown_path;
    const char* shown_user;
  } cases[] = {
      {"/webapi/entry.cgi", "admin", "/webapi/entry.cgi", "admin"},
      {"/caf\xc3\xa9", "j\xc3\xb6rg", "/caf\\xC3\\xA9", "j\\xC3\\xB6rg"},
      {"/a b\t\"c\\", "x\ny\r\x7f", "/a\\x20b\\x09\\x22c\\x5C", "x\\x0Ay\\x0D\\x7F"},
      {std::string("/nul\0after", 10), "", "/nul\\x00after", "-"},
      {"/" + std::string(300, 'p'), std::string(200, 'u'), nullptr, nullptr},
  };
  for (const auto& c : cases) {
    AccessRecord record{"KOVA.API.Info", "query", c.user, 0};
    const std::string line =
        AccessLine("127.0.0.1", "GET", c.path, 200, record, std::chrono::milliseconds(2));
    EXPECT_THAT(line, MatchesRegex("[!-~ ]*")) << line;
    if (c.shown_path == nullptr) {
      // Long names are cut at 128 bytes.
      EXPECT_THAT(line, HasSubstr(" /" + std::string(127, 'p') + " 200 "));
      EXPECT_THAT(line, HasSubstr(" user=" + std::string(128, 'u') + " code="));
      continue;
    }
    EXPECT_THAT(line, HasSubstr(std::string(" GET ") + c.shown_path +
                                " 200 api=KOVA.API.Info "
                                "method=query user=" +
                                c.shown_user + " code=0 ms=2.000"));
  }
  AccessRecord unanswered;
  EXPECT_THAT(AccessLine("::1", "GET", "/", 404, unanswered, {}),
              EndsWith(" ::1 GET / 404 api=- method=- user=- code=- ms=0.000"));
}

}  // namespace
}  // namespace kova_host
