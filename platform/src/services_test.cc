#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include "kova/error.h"
#include "kova/service.h"
#include "src/service_process.h"
#include "src/services.h"
#include "src/system_root.h"
#include "test_support/test_root.h"

namespace {

using kova_test::TestRoot;
using std::chrono::milliseconds;

// A service that notes its root and user, counts reloads and ends on SIGTERM.
constexpr char kScript[] = R"sh(trap 'echo hup >> "$KOVA_ROOT/hup.log"' HUP
trap 'exit 0' TERM
echo "$KOVA_ROOT $(id -u)" > "$KOVA_ROOT/started"
while :; do sleep 0.05; done
)sh";

// Waits up to three seconds for `done` to hold.
template <typename Done>
bool Eventually(Done done) {
  for (int i = 0; i < 150 && !done(); ++i) std::this_thread::sleep_for(milliseconds(20));
  return done();
}

class ServicesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.Write("/opt/demo.sh", kScript, 0755);
    root_.Write("/etc/kova/services/demo.conf", "command=\"/bin/sh " + root_.Path("/opt/demo.sh") +
                                                    "\"\n" + "display_name=\"Demo service\"\n");
  }
  void TearDown() override { QLIBServiceStop("demo", 0); }

  kova::ProcessIdentity Recorded() {
    kova::ProcessIdentity process;
    sscanf(root_.Read("/run/kova/demo.pid").c_str(), "%d %llu", &process.pid, &process.start_time);
    return process;
  }

  TestRoot root_;
};

TEST_F(ServicesTest, StartsReloadsAndStopsARealProcess) {
  EXPECT_EQ(QLIBServiceIsRunning("demo"), 0);
  ASSERT_EQ(QLIBServiceStart("demo", 0), 0);
  EXPECT_EQ(QLIBServiceIsRunning("demo"), 1);
  const kova::ProcessIdentity process = Recorded();
  EXPECT_TRUE(kova::IsAlive(process));
  EXPECT_NE(getpgid(process.pid), getpgrp());  // detached into a session of its own
  ASSERT_TRUE(Eventually([&] { return !root_.Read("/started").empty(); }));
  EXPECT_EQ(root_.Read("/started"), root_.path() + " 0\n");

  ASSERT_EQ(QLIBServiceStart("demo", 0), 0);  // running: left as it is
  EXPECT_EQ(Recorded().pid, process.pid);

  ASSERT_EQ(QLIBServiceReload("demo"), 0);
  EXPECT_TRUE(Eventually([&] { return root_.Read("/hup.log") == "hup\n"; }));

  ASSERT_EQ(QLIBServiceStop("demo", 0), 0);
  EXPECT_EQ(QLIBServiceIsRunning("demo"), 0);
  EXPECT_FALSE(kova::IsAlive(process));
  EXPECT_EQ(access(root_.Path("/run/kova/demo.pid").c_str(), F_OK), -1);
  EXPECT_EQ(QLIBServiceStop("demo", 0), 0);  // stopped: left as it is
  EXPECT_EQ(QLIBServiceReload("demo"), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_SERVICE_FAILED);
}

// A recorded pid that now belongs to another process is not the service.
TEST_F(ServicesTest, StalePidIsNotTakenForTheService) {
  unsigned long long own_start = 0;
  ASSERT_TRUE(kova::ReadProcessStart(getpid(), own_start));
  for (const std::string& record : {std::to_string(getpid()) + " " + std::to_string(own_start + 1),
                                    std::string("999999999 1"), std::string("garbage")}) {
    root_.Write("/run/kova/demo.pid", record);
    EXPECT_EQ(QLIBServiceIsRunning("demo"), 0) << record;
    EXPECT_EQ(QLIBServiceReload("demo"), -1) << record;
    EXPECT_EQ(QLIBServiceStop("demo", 0), 0) << record;  // and this process lives on
    EXPECT_EQ(access(root_.Path("/run/kova/demo.pid").c_str(), F_OK), -1);
  }
  root_.Write("/run/kova/demo.pid", std::to_string(getpid()) + " " + std::to_string(own_start));
  EXPECT_EQ(QLIBServiceIsRunning("demo"), 1);  // the identity that was recorded
  unlink(root_.Path("/run/kova/demo.pid").c_str());
}

TEST_F(ServicesTest, ServicesThatCannotStartSayWhy) {
  root_.Write("/etc/kova/services/relative.conf", "command=\"bin/daemon\"\n");
  root_.Write("/etc/kova/services/missing.conf", "command=\"/nonexistent/daemon\"\n");
  root_.Write("/etc/kova/services/nocommand.conf", "display_name=\"Nothing to run\"\n");
  root_.Write("/etc/kova/services/open.conf", "command=/bin/sh \"-c\n");
  const struct {
    const char* name;
    int error;
  } cases[] = {
      {"unknown", KOVA_ERR_SERVICE_UNKNOWN}, {"../demo", KOVA_ERR_INVALID},
      {"relative", KOVA_ERR_FORMAT},         {"open", KOVA_ERR_FORMAT},
      {"missing", KOVA_ERR_SERVICE_FAILED},  {"nocommand", KOVA_ERR_SERVICE_UNKNOWN},
  };
  for (const auto& c : cases) {
    EXPECT_LT(QLIBServiceStart(c.name, 0), 0) << c.name;
    EXPECT_EQ(QLIBCErrGet(), c.error) << c.name;
    EXPECT_EQ(QLIBServiceIsRunning(c.name), 0) << c.name;
  }
  EXPECT_LT(QLIBServiceStart(nullptr, 0), 0);
}

TEST_F(ServicesTest, DisplayNames) {
  kova::MakeDirectories(root_.Path("/var/packages/photos"), 0755);
  root_.Write("/etc/kova/services/plain.conf", "command=\"/bin/true\"\n");
  const struct {
    const char* name;
    size_t size;
    int result;
    const char* display;
  } cases[] = {
      {"demo", 64, 0, "Demo service"},
      {"plain", 64, 0, "plain"},
      {"pkgctl-photos", 64, 0, "pkgctl-photos"},
      {"pkgctl-absent", 64, -1, ""},
      {"pkgctl-", 64, -1, ""},
      {"demo", 12, -1, ""},
  };
  for (const auto& c : cases) {
    char display[64] = "";
    EXPECT_EQ(QLIBServicecfgDisplayNameGet(c.name, display, c.size), c.result) << c.name;
    EXPECT_STREQ(display, c.display) << c.name;
  }
  EXPECT_EQ(kova::ListServices(), (std::vector<std::string>{"demo", "plain"}));
}

TEST_F(ServicesTest, KnownServicesWithPackagesAndTheNamesUsersSee) {
  root_.Write("/var/packages/Photos/INFO", "displayname=\"Photo Station\"\n");
  root_.Write("/var/packages/Media/INFO",
              "displayname=\"Media\"\ndisplayname_enu=\"Media Server\"\n");
  kova::MakeDirectories(root_.Path("/var/packages/Bare"), 0755);
  kova::MakeDirectories(root_.Path("/var/packages/.hidden"), 0755);
  root_.Write("/var/packages/file", "");
  root_.Write("/etc/kova/services/pkgctl-Media.conf", "package=\"Media\"\n");
  root_.Write("/etc/kova/services/pkgctl-Photos.conf",
              "package=\"Photos\"\ndisplay_name=\"Photos (own name)\"\n");
  EXPECT_EQ(kova::ListKnownServices(),
            (std::vector<std::string>{"demo", "pkgctl-Bare", "pkgctl-Media", "pkgctl-Photos"}));
  const struct {
    const char* name;
    const char* display;
  } cases[] = {
      {"demo", "Demo service"},
      {"pkgctl-Media", "Media Server"},
      {"pkgctl-Photos", "Photos (own name)"},
      {"pkgctl-Bare", "pkgctl-Bare"},
      {"unknown", "unknown"},
      {"../demo", "../demo"},
  };
  for (const auto& c : cases) EXPECT_EQ(kova::ServiceDisplayName(c.name), c.display) << c.name;
}

// A process that ignores SIGTERM is killed once the grace time is over.
TEST(ServiceProcessTest, TerminateKillsWhatIgnoresTerm) {
  TestRoot root;
  const std::string ready = root.Path("/ready");
  kova::ProcessIdentity process;
  ASSERT_TRUE(kova::LaunchDetached(
      {"/bin/sh", "-c", "trap '' TERM; : > \"$0\"; while :; do sleep 0.05; done", ready},
      {"PATH=/usr/bin:/bin"}, process));
  ASSERT_TRUE(Eventually([&] { return access(ready.c_str(), F_OK) == 0; }));  // TERM ignored now
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(kova::Terminate(process, milliseconds(300)));
  EXPECT_GE(std::chrono::steady_clock::now() - start, milliseconds(300));
  EXPECT_FALSE(kova::IsAlive(process));
}

TEST(ServiceProcessTest, SplitsCommandLines) {
  const struct {
    const char* line;
    bool ok;
    std::vector<std::string> words;
  } cases[] = {
      {"/bin/daemon -f", true, {"/bin/daemon", "-f"}},
      {"  /a  \"b c\"\t\"\" d\"e f\" ", true, {"/a", "b c", "", "de f"}},
      {"/a \"open", false, {}},
      {"   ", false, {}},
  };
  for (const auto& c : cases) {
    std::vector<std::string> words;
    EXPECT_EQ(kova::SplitCommand(c.line, words), c.ok) << c.line;
    if (c.ok) {
      EXPECT_EQ(words, c.words) << c.line;
    }
  }
}

}  // namespace
