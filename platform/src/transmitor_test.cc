#include "kova/transmitor.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <optional>
#include <string>
#include <thread>

#include "kova/error.h"
#include "src/system_root.h"
#include "test_support/host_call.h"
#include "test_support/test_root.h"

namespace {

// A statistics service that answers one connection with `reply` (nothing at
// all when it is null) and keeps the request line it got.
class Service {
 public:
  Service(const kova_test::TestRoot& root, std::optional<std::string> reply)
      : reply_(std::move(reply)) {
    kova::MakeDirectories(root.Path("/run/kova"), 0755);
    const std::string path = root.Path("/run/kova/statd.sock");
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    EXPECT_EQ(listen(listener_, 1), 0);
    thread_ = std::thread([this] {
      const int fd = accept(listener_, nullptr, nullptr);
      if (fd < 0) return;
      char buffer[256];
      ssize_t got;
      while (request_.find('\n') == std::string::npos &&
             (got = read(fd, buffer, sizeof(buffer))) > 0) {
        request_.append(buffer, static_cast<size_t>(got));
      }
      if (!reply_) sleep(4);  // longer than the client waits
      // A client that refuses a long reply closes before the end of it.
      for (size_t sent = 0; reply_ && sent < reply_->size();) {
        const ssize_t wrote = send(fd, reply_->data() + sent, reply_->size() - sent, MSG_NOSIGNAL);
        if (wrote <= 0) break;
        sent += static_cast<size_t>(wrote);
      }
      close(fd);
    });
  }
  ~Service() {
    thread_.join();
    close(listener_);
  }
  const std::string& request() const { return request_; }

 private:
  int listener_ = -1;
  std::optional<std::string> reply_;
  std::string request_;
  std::thread thread_;
};

TEST(TransmitorTest, SendsOneLineAndReadsOneLine) {
  const struct {
    const char* reply;
    int transmit;
    int transmit_error;
    int get;
    const char* data;
  } cases[] = {
      {"{\"success\": true}\n", 0, 0, 0, R"({"success":true})"},
      {"{\"success\": \"true\"}\nextra", 0, 0, 0, R"({"success":"true"})"},
      {"not json\n", 0, 0, -1, R"("untouched")"},
      {"{\"success\": true}", -1, KOVA_ERR_CONNECT, -1, R"("untouched")"},  // no whole line
      {nullptr, -1, KOVA_ERR_TIMEOUT, -1, R"("untouched")"},
  };
  for (const auto& c : cases) {
    kova_test::TestRoot root;
    Service service(root, c.reply ? std::optional<std::string>(c.reply) : std::nullopt);
    Transmitor transmitor("localhost");
    Json::Value request;
    request["request"] = "reload";
    EXPECT_EQ(transmitor.Transmit(request), c.transmit) << c.reply;
    if (c.transmit != 0) {
      EXPECT_EQ(QLIBCErrGet(), c.transmit_error) << c.reply;
    }
    Json::Value reply = "untouched";
    EXPECT_EQ(transmitor.GetDataJson(reply), c.get) << c.reply;
    EXPECT_EQ(reply, kova_test::ParseJson(c.data)) << c.reply;
    EXPECT_EQ(service.request(), "{\"request\":\"reload\"}\n");
  }
}

// The service may answer up to 16 MiB, newline left out; a longer line is refused.
TEST(TransmitorTest, TakesReplyLinesUpToTheServicesLimit) {
  constexpr size_t kLimit = size_t{16} << 20;
  const struct {
    size_t length;  // of the reply line, a JSON string, without its newline
    int transmit;
  } cases[] = {
      {(size_t{1} << 20) + 2, 0},
      {kLimit, 0},
      {kLimit + 1, -1},
  };
  for (const auto& c : cases) {
    kova_test::TestRoot root;
    Service service(root, "\"" + std::string(c.length - 2, 'x') + "\"\n");
    Transmitor transmitor("localhost");
    ASSERT_EQ(transmitor.Transmit(Json::Value("catalog")), c.transmit) << c.length;
    Json::Value reply;
    if (c.transmit != 0) {
      EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_FORMAT);
      EXPECT_EQ(transmitor.GetDataJson(reply), -1);
      continue;
    }
    ASSERT_EQ(transmitor.GetDataJson(reply), 0) << c.length;
    EXPECT_EQ(reply.asString().size(), c.length - 2);
  }
}

TEST(TransmitorTest, FailsWithoutTheService) {
  kova_test::TestRoot root;
  Transmitor transmitor("localhost");
  EXPECT_EQ(transmitor.Transmit(Json::Value()), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_CONNECT);
  Json::Value reply;
  EXPECT_EQ(transmitor.GetDataJson(reply), -1);

  Transmitor remote("stats.example");
  EXPECT_EQ(remote.Transmit(Json::Value()), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
}

}  // namespace
