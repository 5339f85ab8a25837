#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

#include "kova/error.h"
#include "kova/service.h"
#include "src/service_process.h"
#include "src/services.h"
#include "src/system_root.h"
#include "test_support/run_in_child.h"
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
  root_.Write("/etc/kova/services/kova.conf", "command=\"/bin/sleep 300\"\nuser=\"nobody\"\n");
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
      {"kova", KOVA_ERR_FORMAT},  // its runtime folder would hold the platform's records
  };
  for (const auto& c : cases) {
    EXPECT_LT(QLIBServiceStart(c.name, 0), 0) << c.name;
    EXPECT_EQ(QLIBCErrGet(), c.error) << c.name;
    EXPECT_EQ(QLIBServiceIsRunning(c.name), 0) << c.name;
  }
  EXPECT_LT(QLIBServiceStart(nullptr, 0), 0);
}

// The "Uid:", "Gid:" and "Groups:" lines of /proc/<pid>/status.
std::string StatusIds(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string out;
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("Uid:") || line.starts_with("Gid:") || line.starts_with("Groups:")) {
      out += line + "\n";
    }
  }
  return out;
}

// The status lines of a process whose ids are all `uid` and `gid`, in `groups`.
std::string StatusIdsOf(uid_t uid, gid_t gid, std::vector<gid_t> groups) {
  std::sort(groups.begin(), groups.end());  // the kernel keeps them sorted
  const std::string u = "\t" + std::to_string(uid);
  const std::string g = "\t" + std::to_string(gid);
  std::string out = "Uid:" + u + u + u + u + "\nGid:" + g + g + g + g + "\nGroups:\t";
  for (size_t i = 0; i < groups.size(); ++i) out += (i > 0 ? " " : "") + std::to_string(groups[i]);
  return out + " \n";
}

// A service that tries to get root back, writes whether it could and its real
// and effective uids, and stays.
constexpr char kRegainScript[] = R"pl(use POSIX ();
my $got = POSIX::setuid(0) ? "regained" : "refused";
my $file = "$ENV{KOVA_ROOT}/tmp/regain";
open(my $out, ">", "$file.new") or die;
print $out "$got $< $>\n";
close($out);
rename("$file.new", $file);
sleep 300;
)pl";

// Started by root, or by the web-API host's runner (effective ids nobody's,
// real and saved ids root's) raising root for the start, a service runs fully
// as root or with its account's uid, gid and groups as the user database has
// them, and can't get root back; started by anyone else, with the caller's ids.
TEST_F(ServicesTest, RunsWithTheIdsOfItsAccountWhoeverStartsIt) {
  // postgres has a supplementary group on Debian; nobody is there everywhere.
  const char* name = getpwnam("postgres") != nullptr ? "postgres" : "nobody";
  const passwd* entry = getpwnam(name);
  ASSERT_NE(entry, nullptr);
  std::vector<gid_t> groups(64);
  int count = static_cast<int>(groups.size());
  ASSERT_GE(getgrouplist(name, entry->pw_gid, groups.data(), &count), 0);
  groups.resize(count);
  const bool root = geteuid() == 0;
  root_.Write("/opt/regain.pl", kRegainScript, 0755);
  const struct {
    const char* caller;
    bool runner;  // the runner's ids, or this process's
    const char* user;
  } cases[] = {
      {"this process", false, name},
      {"this process", false, ""},
      {"runner", true, name},
      {"runner", true, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.caller) + " starting a service of user \"" + c.user + "\"");
    if (c.runner && !root) continue;  // only root can take the runner's ids
    unlink(root_.Path("/tmp/regain").c_str());
    root_.Write("/etc/kova/services/demo.conf", "command=\"/usr/bin/perl " +
                                                    root_.Path("/opt/regain.pl") + "\"\nuser=\"" +
                                                    c.user + "\"\n");
    const bool as_account = root && *c.user != '\0';
    const uid_t uid = as_account ? entry->pw_uid : root ? 0 : geteuid();
    const std::string expected = !root        ? StatusIds(getpid())
                                 : as_account ? StatusIdsOf(entry->pw_uid, entry->pw_gid, groups)
                                              : StatusIdsOf(0, 0, {});
    const std::string regain = std::string(root && !as_account ? "regained " : "refused ") +
                               std::to_string(uid) + " " + std::to_string(uid) + "\n";
    const bool passed = kova_test::RunInChild([&] {
      if (c.runner) {
        const gid_t nogroup = 65534;
        ASSERT_EQ(setgroups(1, &nogroup), 0);
        ASSERT_EQ(setresgid(0, nogroup, 0), 0);
        ASSERT_EQ(setresuid(0, 65534, 0), 0);
      }
      ASSERT_EQ(QLIBServiceStart("demo", 0), 0);
      EXPECT_EQ(StatusIds(Recorded().pid), expected);
      ASSERT_TRUE(Eventually([&] { return !root_.Read("/tmp/regain").empty(); }));
      EXPECT_EQ(root_.Read("/tmp/regain"), regain);
      EXPECT_EQ(QLIBServiceStop("demo", 0), 0);
    });
    EXPECT_TRUE(passed);
  }
}

// A service run as an account gets its runtime folder, made or put right, as
// the ids it runs with; a link or a file in its place fails the start.
TEST_F(ServicesTest, MakesTheRuntimeFolderOfAnAccount) {
  const bool root = geteuid() == 0;
  const passwd* entry = root ? getpwnam("nobody") : getpwuid(geteuid());
  ASSERT_NE(entry, nullptr);
  const uid_t uid = root ? entry->pw_uid : geteuid();
  const gid_t gid = root ? entry->pw_gid : getegid();
  root_.Write("/opt/ready.sh", ": > \"$KOVA_ROOT/run/demo/ready\"; exec sleep 300\n", 0755);
  root_.Write("/etc/kova/services/demo.conf", "command=\"/bin/sh " + root_.Path("/opt/ready.sh") +
                                                  "\"\nuser=\"" + entry->pw_name + "\"\n");
  const std::string folder = root_.Path("/run/demo");
  const std::string elsewhere = root_.Path("/elsewhere");
  const struct {
    const char* name;
    std::function<void()> make;  // what is at /run/demo before the start
    int error;
  } cases[] = {
      {"missing", [] {}, 0},
      {"wrong mode", [&] { mkdir(folder.c_str(), 0700) || chmod(folder.c_str(), 03777); }, 0},
      // Only root can give it to another owner first.
      {"wrong owner", [&] { mkdir(folder.c_str(), 0750) || chown(folder.c_str(), 0, 0); }, 0},
      {"symbolic link", [&] { symlink(elsewhere.c_str(), folder.c_str()); }, KOVA_ERR_FORMAT},
      {"file", [&] { root_.Write("/run/demo", ""); }, KOVA_ERR_FORMAT},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove_all(folder);
    mkdir(elsewhere.c_str(), 0755);
    c.make();
    if (c.error != 0) {
      EXPECT_EQ(QLIBServiceStart("demo", 0), -1);
      EXPECT_EQ(QLIBCErrGet(), c.error);
      EXPECT_EQ(QLIBServiceIsRunning("demo"), 0);
    } else {
      ASSERT_EQ(QLIBServiceStart("demo", 0), 0);
      EXPECT_TRUE(Eventually([&] { return access((folder + "/ready").c_str(), F_OK) == 0; }));
      ASSERT_EQ(QLIBServiceStop("demo", 0), 0);
    }
    struct stat info;
    ASSERT_EQ(lstat(folder.c_str(), &info), 0);
    EXPECT_EQ(S_ISDIR(info.st_mode), c.error == 0);  // a link or a file is left as it was
    if (c.error != 0) {
      ASSERT_EQ(stat(elsewhere.c_str(), &info), 0);
    }
    EXPECT_EQ(info.st_mode & 07777, c.error != 0 ? 0755u : 0750u);
    EXPECT_EQ(info.st_uid, c.error != 0 ? geteuid() : uid);
    EXPECT_EQ(info.st_gid, c.error != 0 ? getegid() : gid);
  }
}

// The stop signal goes to the main process alone; its group gets SIGKILL once
// the main process has ended, or once the grace is over. (USR1 and not INT: a
// shell's background job can't catch SIGINT.)
TEST_F(ServicesTest, StopSignalReachesTheMainProcessOnly) {
  root_.Write("/opt/family.sh", R"sh(log="$KOVA_ROOT/signals"
(trap 'echo child USR1 >> "$log"' USR1; : > "$KOVA_ROOT/child_ready"
 while :; do sleep 0.05; done) &
echo $! > "$KOVA_ROOT/child"
# The main process ends a little after the signal: time for the child to note one.
trap 'echo main USR1 >> "$log"; [ "$1" = stay ] || { sleep 0.3; exit 0; }' USR1
while :; do sleep 0.05; done
)sh");
  const struct {
    const char* keys;
    const char* main;  // "exit" or "stay" on the stop signal
    milliseconds least;
  } cases[] = {
      {"stop_signal=\"USR1\"\n", "exit", milliseconds(0)},
      {"stop_signal=SIGUSR1\nstop_timeout=1\n", "stay", milliseconds(1000)},
  };
  for (const auto& c : cases) {
    for (const char* file : {"/signals", "/child_ready", "/child"})
      unlink(root_.Path(file).c_str());
    root_.Write(
        "/etc/kova/services/demo.conf",
        "command=\"/bin/sh " + root_.Path("/opt/family.sh") + " " + c.main + "\"\n" + c.keys);
    ASSERT_EQ(QLIBServiceStart("demo", 0), 0) << c.keys;
    const kova::ProcessIdentity main = Recorded();
    // The child may be ready before the main process has written its pid.
    ASSERT_TRUE(Eventually([&] {
      const std::string pid = root_.Read("/child");
      return access(root_.Path("/child_ready").c_str(), F_OK) == 0 && !pid.empty() &&
             pid.back() == '\n';
    }));
    kova::ProcessIdentity child{std::stoi(root_.Read("/child")), 0};
    ASSERT_TRUE(kova::ReadProcessStart(child.pid, child.start_time));
    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(QLIBServiceStop("demo", 0), 0) << c.keys;
    const auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, c.least) << c.keys;
    EXPECT_LT(took, milliseconds(4000)) << c.keys;  // well before the default grace of 5 s
    EXPECT_FALSE(kova::IsAlive(main)) << c.keys;
    EXPECT_TRUE(Eventually([&] { return !kova::IsAlive(child); })) << c.keys;
    EXPECT_EQ(root_.Read("/signals"), "main USR1\n") << c.keys;
  }
}

// The platform's own call answers a service's description; the name users see
// comes from its package's INFO where the description names none of its own.
TEST_F(ServicesTest, KnownServicesWithPackagesAndTheNamesUsersSee) {
  root_.Write("/etc/kova/services/plain.conf", "command=\"/bin/true\"\n");
  root_.Write("/var/packages/Photos/INFO", "displayname=\"Photo Station\"\n");
  root_.Write("/var/packages/Media/INFO",
              "displayname=\"Media\"\ndisplayname_enu=\"Media Server\"\n");
  kova::MakeDirectories(root_.Path("/var/packages/Bare"), 0755);
  kova::MakeDirectories(root_.Path("/var/packages/.hidden"), 0755);
  root_.Write("/var/packages/file", "");
  root_.Write("/etc/kova/services/pkgctl-Media.conf", "package=\"Media\"\n");
  root_.Write("/etc/kova/services/pkgctl-Photos.conf",
              "package=\"Photos\"\ndisplay_name=\"Photos (own name)\"\n");
  EXPECT_EQ(kova::ListServices(),
            (std::vector<std::string>{"demo", "pkgctl-Media", "pkgctl-Photos", "plain"}));
  EXPECT_EQ(
      kova::ListKnownServices(),
      (std::vector<std::string>{"demo", "pkgctl-Bare", "pkgctl-Media", "pkgctl-Photos", "plain"}));
  const struct {
    const char* name;
    int result;           // of QLIBServicecfgDisplayNameGet
    const char* display;  // what it writes
    const char* shown;    // kova::ServiceDisplayName
  } cases[] = {
      {"demo", 0, "Demo service", "Demo service"},
      {"plain", 0, "plain", "plain"},
      {"pkgctl-Media", 0, "pkgctl-Media", "Media Server"},
      {"pkgctl-Photos", 0, "Photos (own name)", "Photos (own name)"},
      {"pkgctl-Bare", 0, "pkgctl-Bare", "pkgctl-Bare"},
      {"pkgctl-absent", -1, "", "pkgctl-absent"},
      {"pkgctl-", -1, "", "pkgctl-"},
      {"../demo", -1, "", "../demo"},
  };
  for (const auto& c : cases) {
    char display[64] = "";
    EXPECT_EQ(QLIBServicecfgDisplayNameGet(c.name, display, sizeof(display)), c.result) << c.name;
    EXPECT_STREQ(display, c.display) << c.name;
    EXPECT_EQ(kova::ServiceDisplayName(c.name), c.shown) << c.name;
  }
  char short_buffer[12] = "";  // one short of "Demo service" and its end
  EXPECT_EQ(QLIBServicecfgDisplayNameGet("demo", short_buffer, sizeof(short_buffer)), -1);
  EXPECT_STREQ(short_buffer, "");
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
