#include "kova/transmitor.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

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
  Service(const kova_test::TestRoot& root, const char* reply) {
    kova::MakeDirectories(root.Path("/run/kova"), 0755);
    const std::string path = root.Path("/run/kova/statd.sock");
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    EXPECT_EQ(listen(listener_, 1), 0);
    thread_ = std::thread([this, reply] {
      const int fd = accept(listener_, nullptr, nullptr);
      if (fd < 0) return;
      char buffer[256];
      ssize_t got;
      while (request_.find('\n') == std::string::npos &&
             (got = read(fd, buffer, sizeof(buffer))) > 0) {
        request_.append(buffer, static_cast<size_t>(got));
      }
      if (reply != nullptr) {
        EXPECT_EQ(write(fd, reply, strlen(reply)), static_cast<ssize_t>(strlen(reply)));
      } else {
        sleep(4);  // longer than the client waits
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
    Service service(root, c.reply);
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
