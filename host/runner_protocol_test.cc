#include "host/runner_protocol.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include "host/json_text.h"
#include "host/params.h"

namespace kova_host {
namespace {

class RunnerProtocolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds_), 0);
    reader_[0] = FrameReader(fds_[0]);
    reader_[1] = FrameReader(fds_[1]);
  }
  void TearDown() override {
    for (int fd : fds_) {
      if (fd >= 0) close(fd);
    }
  }
  int fds_[2] = {-1, -1};
  FrameReader reader_[2] = {FrameReader(-1), FrameReader(-1)};
};

TEST_F(RunnerProtocolTest, CallsAndAnswersCrossWhole) {
  Json::Value params;
  params["filter"]["loglevel"] = "Warning";
  params["values"].append(12.3);
  const RunnerCall sent{"KOVA.ResourceMonitor.Log", 1, "list", params, "admin", "ger"};
  ASSERT_EQ(SendCall(fds_[0], sent, kNoDeadline), IoResult::kOk);
  RunnerCall got;
  ASSERT_EQ(ReceiveCall(reader_[1], got), IoResult::kOk);
  EXPECT_EQ(ToJson(got.params), R"({"filter":{"loglevel":"Warning"},"values":[12.3]})");
  EXPECT_EQ(got.api + got.method + got.user + got.language, "KOVA.ResourceMonitor.Loglistadminger");

  // A raw answer larger than a socket buffer, with bytes that are no UTF-8.
  std::string output = "Content-Type: text/csv\r\n\r\n" + std::string(3 << 20, '\xff');
  std::thread writer([&] { EXPECT_EQ(SendAnswer(fds_[1], {true, 0, output}), IoResult::kOk); });
  RunnerAnswer answer;
  EXPECT_EQ(ReceiveAnswer(reader_[0], answer, Clock::now() + std::chrono::seconds(10)),
            IoResult::kOk);
  writer.join();
  EXPECT_TRUE(answer.raw);
  EXPECT_EQ(answer.body, output);
}

TEST_F(RunnerProtocolTest, OutputInAFileIsHandedOverWithItsDescriptor) {
  const std::string output = "Content-Type: text/csv\r\n\r\nTime,Level\r\n";
  RunnerAnswer sent{true, 0, ""};
  sent.output = UniqueFd(memfd_create("output", MFD_CLOEXEC));
  ASSERT_EQ(write(sent.output.get(), output.data(), output.size()), ssize_t(output.size()));
  sent.output_size = output.size() - 2;  // what the runner says counts
  // A second answer right behind the first: both may come with one read.
  ASSERT_EQ(SendAnswer(fds_[1], sent), IoResult::kOk);
  ASSERT_EQ(SendAnswer(fds_[1], {false, 0, "{}"}), IoResult::kOk);
  const auto deadline = Clock::now() + std::chrono::seconds(10);
  RunnerAnswer file, json;
  ASSERT_EQ(ReceiveAnswer(reader_[0], file, deadline), IoResult::kOk);
  ASSERT_EQ(ReceiveAnswer(reader_[0], json, deadline), IoResult::kOk);
  EXPECT_TRUE(file.raw);
  EXPECT_EQ(file.output_size, output.size() - 2);
  ASSERT_TRUE(file.output.valid());
  struct stat ours {
  }, theirs{};
  ASSERT_EQ(fstat(sent.output.get(), &ours), 0);
  ASSERT_EQ(fstat(file.output.get(), &theirs), 0);
  EXPECT_EQ(ours.st_ino, theirs.st_ino);  // the same file, not a copy
  EXPECT_FALSE(json.raw);
  EXPECT_FALSE(json.output.valid());
  EXPECT_EQ(json.body, "{}");

  // A file answer that came without its descriptor breaks the protocol.
  ASSERT_EQ(WriteFrame(fds_[1], R"({"kind": "file", "code": 0, "size": 5})", kNoDeadline),
            IoResult::kOk);
  EXPECT_EQ(ReceiveAnswer(reader_[0], file, deadline), IoResult::kError);
  EXPECT_FALSE(file.output.valid());
}

TEST_F(RunnerProtocolTest, ReportsTimeoutsClosedPeersAndMalformedFrames) {
  RunnerAnswer answer;
  EXPECT_EQ(ReceiveAnswer(reader_[0], answer, Clock::now() + std::chrono::milliseconds(50)),
            IoResult::kTimeout);

  ASSERT_EQ(WriteFrame(fds_[1], R"({"api": "x"})", kNoDeadline), IoResult::kOk);
  RunnerCall call;
  EXPECT_EQ(ReceiveCall(reader_[0], call), IoResult::kMalformed);  // not a whole call
  ASSERT_EQ(WriteFrame(fds_[1], "not json", kNoDeadline), IoResult::kOk);
  EXPECT_EQ(ReceiveCall(reader_[0], call), IoResult::kMalformed);
  // Calls nested to the parameters' limit, or a 1 MiB body of control bytes
  // escaped sixfold, still come through whole.
  const std::string deep =
      std::string(kMaxParamDepth - 1, '[') + "1" + std::string(kMaxParamDepth - 1, ']');
  Json::Value params;
  ASSERT_TRUE(ParamValue(deep, params["x"]));
  ASSERT_TRUE(ParamValue(std::string(1 << 20, '\x01'), params["y"]));
  const RunnerCall big{"KOVA.Test", 1, "echo", params, "admin", "enu"};
  std::thread sender([&] { EXPECT_EQ(SendCall(fds_[1], big, kNoDeadline), IoResult::kOk); });
  EXPECT_EQ(ReceiveCall(reader_[0], call), IoResult::kOk);
  sender.join();
  EXPECT_EQ(call.params, params);

  const char huge[4] = {'\x7f', '\x00', '\x00', '\x00'};  // 2 GiB announced
  ASSERT_EQ(write(fds_[1], huge, sizeof(huge)), 4);
  std::string payload;
  EXPECT_EQ(reader_[0].Read(payload, kMaxFrame, kNoDeadline), IoResult::kTooLarge);

  reader_[0] = FrameReader(fds_[0]);  // a reader past a frame too large is done with
  close(fds_[1]);
  fds_[1] = -1;
  EXPECT_EQ(ReceiveAnswer(reader_[0], answer, kNoDeadline), IoResult::kClosed);
  EXPECT_EQ(SendCall(fds_[0], call, kNoDeadline), IoResult::kClosed);
}

}  // namespace
}  // namespace kova_host
