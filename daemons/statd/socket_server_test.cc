#include "statd/socket_server.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "test_support/test_root.h"

namespace statd {
namespace {

// A connected client of the socket at `path`, -1 when none could connect.
int Connect(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path.c_str(), path.size() + 1);
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// Sends `request`, ends the stream and reads until the server closes.
std::string Exchange(const std::string& path, const std::string& request) {
  const int fd = Connect(path);
  if (fd < 0) return "(no connection)";
  send(fd, request.data(), request.size(), MSG_NOSIGNAL);
  shutdown(fd, SHUT_WR);
  std::string reply;
  char buffer[4096];
  ssize_t got;
  while ((got = recv(fd, buffer, sizeof(buffer), 0)) > 0) reply.append(buffer, got);
  close(fd);
  return reply;
}

class SocketServerTest : public ::testing::Test {
 protected:
  kova_test::TestRoot root_;
  std::string path_ = root_.Path("/statd.sock");
};

TEST_F(SocketServerTest, AnswersOneLinePerConnection) {
  SocketServer server(path_, [](std::string_view line) { return "<" + std::string(line) + ">"; });
  std::string error;
  ASSERT_TRUE(server.Start(error)) << error;
  struct stat info;
  ASSERT_EQ(stat(path_.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0666u);
  EXPECT_EQ(Exchange(path_, "{\"a\":1}\nignored"), "<{\"a\":1}>\n");
  EXPECT_EQ(Exchange(path_, "no line feed, then the end"), "<no line feed, then the end>\n");
  const std::string answer = Exchange(path_, std::string(70 * 1024, 'x') + "\n");
  EXPECT_NE(answer.find("\"too_large\""), std::string::npos) << answer.substr(0, 200);
  server.Stop();
  EXPECT_NE(access(path_.c_str(), F_OK), 0);
}

// Whether the server closed `fd` without an answer within `limit`.
bool ClosedWithin(int fd, std::chrono::milliseconds limit) {
  timeval timeout{0, static_cast<suseconds_t>(limit.count() * 1000)};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof(timeout));
  char byte;
  return recv(fd, &byte, 1, 0) == 0;
}

TEST_F(SocketServerTest, SilentClientsHoldOnlyTheirOwnShareAndOnlyUntilTheirDeadline) {
  SocketLimits limits;
  limits.workers = 1;
  limits.per_user = 4;
  limits.request_time = std::chrono::milliseconds(500);
  SocketServer server(
      path_, [](std::string_view line) { return std::string(line); }, limits);
  std::string error;
  ASSERT_TRUE(server.Start(error)) << error;
  std::vector<int> silent;
  for (int i = 0; i < 3; ++i) silent.push_back(Connect(path_));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(Exchange(path_, "ping\n"), "ping\n");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(200));
  // The fourth silent one takes the user's last place; the fifth is turned away.
  silent.push_back(Connect(path_));
  const int turned_away = Connect(path_);
  EXPECT_TRUE(ClosedWithin(turned_away, std::chrono::milliseconds(200)));
  close(turned_away);
  // Past the request deadline the silent ones are closed, and places free again.
  for (int fd : silent) {
    EXPECT_TRUE(ClosedWithin(fd, std::chrono::milliseconds(1500)));
    close(fd);
  }
  EXPECT_EQ(Exchange(path_, "pong\n"), "pong\n");
}

TEST_F(SocketServerTest, ReplacesAStaleSocketButNotALiveOne) {
  std::ofstream(path_) << "left over";
  SocketServer first(path_, [](std::string_view) { return std::string("first"); });
  std::string error;
  ASSERT_TRUE(first.Start(error)) << error;
  SocketServer second(path_, [](std::string_view) { return std::string("second"); });
  EXPECT_FALSE(second.Start(error));
  EXPECT_NE(error.find("another process answers"), std::string::npos) << error;
  EXPECT_EQ(Exchange(path_, "?\n"), "first\n");
}

}  // namespace
}  // namespace statd
