#include "host/cgi_output.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include "host/unique_fd.h"

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

TEST(CgiOutputTest, ReadsOnlyTheHeadersOfOutputInAFile) {
  const std::string big_body =
      "Content-Type: text/csv\r\nX-A: 1\r\n\r\n" + std::string(200000, 'x');
  const std::string long_head = "X-Long: " + std::string(kMaxCgiHead, 'a') + "\r\n\r\nbody";
  const std::string short_head = "X-Long: " + std::string(kMaxCgiHead - 20, 'a') + "\r\n\r\nbody";
  const struct {
    const char* what;
    std::string output;
    uint64_t size;        // as the runner says it
    uint64_t body_start;  // 0: refused
    const char* error;
  } cases[] = {
      {"a large body", big_body, big_body.size(), 34, ""},
      {"headers that end just within the limit", short_head, short_head.size(),
       short_head.size() - 4, ""},
      {"headers past the limit", long_head, long_head.size(), 0, "headers run past 64 KiB"},
      {"a file shorter than said", "X-A: 1\n\nab", 100, 0, "shorter than said"},
      {"a malformed header", "Status: 2000\n\n" + std::string(100000, 'x'), 100013, 0,
       "status is malformed"},
  };
  for (const auto& c : cases) {
    UniqueFd file(memfd_create("cgi", MFD_CLOEXEC));
    ASSERT_EQ(write(file.get(), c.output.data(), c.output.size()), ssize_t(c.output.size()));
    CgiReply reply;
    uint64_t body_start = 0;
    std::string error;
    EXPECT_EQ(ReadCgiHead(file.get(), c.size, reply, body_start, error), c.body_start != 0)
        << c.what;
    EXPECT_EQ(body_start, c.body_start) << c.what;
    EXPECT_NE(error.find(c.error), std::string::npos) << c.what << ": " << error;
    EXPECT_TRUE(reply.body.empty()) << c.what;
  }
}

}  // namespace
}  // namespace kova_host
