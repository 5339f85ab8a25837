#include "host/cgi_output.h"

#include <gtest/gtest.h>

namespace kova_host {
namespace {

using Headers = std::vector<std::pair<std::string, std::string>>;

TEST(CgiOutputTest, SplitsHeadersFromTheBody) {
  const struct {
    const char* output;
    int status;
    const char* type;
    Headers headers;
    const char* body;
  } cases[] = {
      {"Content-Type: text/csv\r\nContent-Disposition:attachment; filename=\"a.csv\"\r\n\r\n"
       "Time,Level\r\n",
       200,
       "text/csv",
       {{"Content-Disposition", "attachment; filename=\"a.csv\""}},
       "Time,Level\r\n"},
      {"Status: 404 Not Found\nContent-type: text/plain\n\nmissing",
       404,
       "text/plain",
       {},
       "missing"},
      {"X-A: 1\r\nContent-Length: 99\r\nConnection: close\r\n\r\n",
       200,
       "application/octet-stream",
       {{"X-A", "1"}},
       ""},
      {"\r\nbody\r\n\r\nmore", 200, "application/octet-stream", {}, "body\r\n\r\nmore"},
  };
  for (const auto& c : cases) {
    CgiReply reply;
    std::string error;
    ASSERT_TRUE(ParseCgiOutput(c.output, reply, error)) << c.output << ": " << error;
    EXPECT_EQ(reply.status, c.status) << c.output;
    EXPECT_EQ(reply.content_type, c.type) << c.output;
    EXPECT_EQ(reply.headers, c.headers) << c.output;
    EXPECT_EQ(reply.body, c.body) << c.output;
  }
}

TEST(CgiOutputTest, RefusesMalformedOutput) {
  for (const char* output :
       {"", "Content-Type: text/plain\r\n", "no headers here", "Bad Name: x\r\n\r\n", ": x\n\n",
        "Status: 99\n\n", "Status: abc\n\n", "Status: 2000 Big\n\n"}) {
    CgiReply reply;
    std::string error;
    EXPECT_FALSE(ParseCgiOutput(output, reply, error)) << output;
    EXPECT_FALSE(error.empty()) << output;
  }
}

}  // namespace
}  // namespace kova_host
