#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <iterator>
#include <sstream>
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
  root_.Write("/etc/kova/services/ghost.conf",
              "command=\"/bin/sleep 300\"\nuser=\"kova-no-such-account\"\n");
  root_.Write("/etc/kova/services/kill.conf", "command=\"/bin/sleep 300\"\nstop_signal=KILL\n");
  root_.Write("/etc/kova/services/zero.conf", "command=\"/bin/sleep 300\"\nstop_timeout=0\n");
  root_.Write("/etc/kova/services/unit.conf", "command=\"/bin/sleep 300\"\nstop_timeout=5s\n");
  const struct {
    const char* name;
    int error;
  } cases[] = {
      {"unknown", KOVA_ERR_SERVICE_UNKNOWN},
      {"../demo", KOVA_ERR_INVALID},
      {"relative", KOVA_ERR_FORMAT},
      {"open", KOVA_ERR_FORMAT},
      {"missing", KOVA_ERR_SERVICE_FAILED},
      {"nocommand", KOVA_ERR_SERVICE_UNKNOWN},
      {"ghost", KOVA_ERR_NOT_FOUND},
      {"kill", KOVA_ERR_FORMAT},
      {"zero", KOVA_ERR_FORMAT},
      {"unit", KOVA_ERR_FORMAT},
  };
  for (const auto& c : cases) {
    EXPECT_LT(QLIBServiceStart(c.name, 0), 0) << c.name;
    EXPECT_EQ(QLIBCErrGet(), c.error) << c.name;
    EXPECT_EQ(QLIBServiceIsRunning(c.name), 0) << c.name;
  }
  EXPECT_LT(QLIBServiceStart(nullptr, 0), 0);
}

// The ids of a process as /proc/<pid>/status gives them: "Uid:", "Gid:" and
// "Groups:" lines, with the groups sorted.
std::string StatusIds(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string out;
  for (std::string line; std::getline(status, line);) {
    std::istringstream words(line);
    std::string key;
    words >> key;
    if (key != "Uid:" && key != "Gid:" && key != "Groups:") continue;
    std::vector<long> ids{std::istream_iterator<long>(words), {}};
    if (key == "Groups:") std::sort(ids.begin(), ids.end());
    out += key;
    for (long id : ids) out += " " + std::to_string(id);
    out += "\n";
  }
  return out;
}

// The lines of `text`, sorted.
std::string SortedLines(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) lines.push_back(line + "\n");
  std::sort(lines.begin(), lines.end());
  std::string out;
  for (const std::string& line : lines) out += line;
  return out;
}

// The same lines for account `name` holding every id, from the user database.
std::string AccountIds(const char* name) {
  const passwd* entry = getpwnam(name);
  if (entry == nullptr) return "(no account " + std::string(name) + ")";
  const std::string uid = std::to_string(entry->pw_uid);
  const std::string gid = std::to_string(entry->pw_gid);
  gid_t groups[256];
  int count = 256;
  getgrouplist(name, entry->pw_gid, groups, &count);
  std::sort(groups, groups + count);
  std::string out = "Uid: " + uid + " " + uid + " " + uid + " " + uid + "\nGid: " + gid + " " +
                    gid + " " + gid + " " + gid + "\nGroups:";
  for (int i = 0; i < count; ++i) out += " " + std::to_string(groups[i]);
  return out + "\n";
}

// Started by root, a service runs as its account; started by anyone else, with
// the caller's ids.
TEST_F(ServicesTest, RunsWithTheIdsOfItsAccount) {
  // postgres has a supplementary group on Debian; nobody is there everywhere.
  const char* account = getpwnam("postgres") != nullptr ? "postgres" : "nobody";
  root_.Write("/etc/kova/services/demo.conf",
              "command=\"/bin/sleep 300\"\nuser=\"" + std::string(account) + "\"\n");
  ASSERT_EQ(QLIBServiceStart("demo", 0), 0);
  const std::string expected = geteuid() == 0 ? AccountIds(account) : StatusIds(getpid());
  EXPECT_EQ(StatusIds(Recorded().pid), expected);
  EXPECT_NE(expected.find("Groups:"), std::string::npos);
  ASSERT_EQ(QLIBServiceStop("demo", 0), 0);
}

// The stop signal goes to the main process alone; its group gets SIGKILL once
// the main process has ended, or once the grace is over. (USR1 and not INT: a
// shell's background job can't catch SIGINT.)
TEST_F(ServicesTest, StopSignalReachesTheMainProcessOnly) {
  root_.Write("/opt/family.sh", R"sh(log="$KOVA_ROOT/signals"
(trap 'echo child USR1 >> "$log"' USR1; trap 'echo child TERM >> "$log"; exit 0' TERM
 : > "$KOVA_ROOT/child_ready"; while :; do sleep 0.05; done) &
echo $! > "$KOVA_ROOT/child"
trap 'echo main USR1 >> "$log"; [ "$1" = stay ] || exit 0' USR1
trap 'echo main TERM >> "$log"; exit 0' TERM
while :; do sleep 0.05; done
)sh");
  const struct {
    const char* keys;
    const char* main;  // "exit" or "stay" on the stop signal
    const char* signals;
    milliseconds least;
  } cases[] = {
      {"", "exit", "child TERM\nmain TERM\n", milliseconds(0)},
      {"stop_signal=\"USR1\"\n", "exit", "main USR1\n", milliseconds(0)},
      {"stop_signal=SIGUSR1\nstop_timeout=1\n", "stay", "main USR1\n", milliseconds(1000)},
  };
  for (const auto& c : cases) {
    for (const char* file : {"/signals", "/child", "/child_ready"})
      unlink(root_.Path(file).c_str());
    root_.Write(
        "/etc/kova/services/demo.conf",
        "command=\"/bin/sh " + root_.Path("/opt/family.sh") + " " + c.main + "\"\n" + c.keys);
    ASSERT_EQ(QLIBServiceStart("demo", 0), 0) << c.keys;
    const kova::ProcessIdentity main = Recorded();
    ASSERT_TRUE(Eventually([&] { return access(root_.Path("/child_ready").c_str(), F_OK) == 0; }));
    kova::ProcessIdentity child{std::stoi(root_.Read("/child")), 0};
    ASSERT_TRUE(kova::ReadProcessStart(child.pid, child.start_time));
    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(QLIBServiceStop("demo", 0), 0) << c.keys;
    EXPECT_GE(std::chrono::steady_clock::now() - start, c.least) << c.keys;
    EXPECT_FALSE(kova::IsAlive(main)) << c.keys;
    EXPECT_TRUE(Eventually([&] { return !kova::IsAlive(child); })) << c.keys;
    EXPECT_EQ(SortedLines(root_.Read("/signals")), c.signals) << c.keys;
  }
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

// A process that ignores SIGTERM is killed once the grace time is over.
TEST(ServiceProcessTest, TerminateKillsWhatIgnoresTerm) {
  TestRoot root;
  const std::string ready = root.Path("/ready");
  kova::ProcessIdentity process;
  ASSERT_TRUE(kova::LaunchDetached(
      {"/bin/sh", "-c", "trap '' TERM; : > \"$0\"; while :; do sleep 0.05; done", ready},
      {"PATH=/usr/bin:/bin"}, nullptr, process));
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
