// The service "pgsql" for real: PostgreSQL installed in a temporary system
// root, started and stopped through the platform, reached with libpq as the
// history's role; and the failures its program and installer say.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <libpq-fe.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

#include "kova/service.h"
#include "test_support/test_root.h"

namespace {

using ::testing::HasSubstr;
using ::testing::Not;

// The output (standard output and error) of `command` run by the shell, and
// whether it exited with `code`.
struct Outcome {
  std::string output;
  int code = -1;
};

Outcome RunShell(const std::string& command) {
  Outcome outcome;
  FILE* pipe = popen((command + " 2>&1").c_str(), "r");
  if (pipe == nullptr) return outcome;
  char buffer[4096];
  for (size_t got; (got = fread(buffer, 1, sizeof(buffer), pipe)) > 0;) {
    outcome.output.append(buffer, got);
  }
  const int status = pclose(pipe);
  outcome.code = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return outcome;
}

// The account the service runs as: install-service.sh's default.
std::string ServiceAccount() {
  if (geteuid() == 0) return "postgres";
  const passwd* entry = getpwuid(geteuid());
  return entry != nullptr ? entry->pw_name : "";
}

// Runs the program as the service's account, in the system root `root`.
std::string AsAccount(const std::string& root, const std::string& command) {
  const std::string ids = geteuid() == 0 ? "setpriv --reuid=postgres --regid=postgres "
                                           "--init-groups -- "
                                         : "";
  return "KOVA_ROOT=" + root + " " + ids + command;
}

// Copies the program where `cmake --install` puts it and installs the service
// in `root`.
Outcome Install(const std::string& root, const std::string& options = "") {
  std::filesystem::create_directories(root + "/usr/sbin");
  std::filesystem::copy_file(KOVA_PGSQL_PROGRAM, root + "/usr/sbin/kova-pgsql",
                             std::filesystem::copy_options::overwrite_existing);
  return RunShell(std::string(KOVA_INSTALL_SERVICE) + " " + root + " " + options);
}

class PgsqlServiceTest : public ::testing::Test {
 protected:
  void TearDown() override { QLIBServiceStop("pgsql", 0); }

  std::string Socket() const { return root_.Path("/run/pgsql"); }

  // Waits up to 20 s (a first start makes the cluster) for the server to answer.
  bool AwaitServer() const {
    const std::string ping =
        "host=" + Socket() + " user=kova dbname=kova_history connect_timeout=2";
    for (int i = 0; i < 200; ++i) {
      if (PQping(ping.c_str()) == PQPING_OK) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return false;
  }

  // Runs `sql` as "kova" in "kova_history"; the first value of the last result,
  // or the error.
  std::string Query(const std::string& sql) const {
    const std::string info = "host=" + Socket() + " user=kova dbname=kova_history";
    PGconn* connection = PQconnectdb(info.c_str());
    std::string answer = "(connection failed) ";
    if (PQstatus(connection) == CONNECTION_OK) {
      PGresult* result = PQexec(connection, sql.c_str());
      const ExecStatusType status = PQresultStatus(result);
      answer = status == PGRES_TUPLES_OK && PQntuples(result) > 0        ? PQgetvalue(result, 0, 0)
               : status == PGRES_COMMAND_OK || status == PGRES_TUPLES_OK ? ""
                                                                         : "(failed) ";
      PQclear(result);
    }
    if (answer.starts_with("(")) answer += PQerrorMessage(connection);
    PQfinish(connection);
    return answer;
  }

  // The ids of the recorded process, as /proc gives them ("Uid: r e s fs").
  std::string RecordedUids() const {
    const pid_t pid = std::atoi(root_.Read("/run/kova/pgsql.pid").c_str());
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.starts_with("Uid:")) return line;
    }
    return "(no process " + std::to_string(pid) + ")";
  }

  kova_test::TestRoot root_;
};

TEST_F(PgsqlServiceTest, ServesKeepsItsDataAndShutsDownCleanly) {
  const Outcome installed = Install(root_.path());
  ASSERT_EQ(installed.code, 0) << installed.output;
  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(QLIBServiceIsRunning("pgsql"), 1);
  char volume[4096] = "";
  EXPECT_EQ(KOVAShareServiceVolumeGetbyLink("pgsql", volume, sizeof(volume)), 1);
  EXPECT_EQ(volume, root_.Path("/volume1"));

  // The postmaster itself is the recorded process, with the account's ids.
  const passwd* account = getpwnam(ServiceAccount().c_str());
  ASSERT_NE(account, nullptr);
  const std::string uid = std::to_string(account->pw_uid);
  EXPECT_EQ(RecordedUids(), "Uid:\t" + uid + "\t" + uid + "\t" + uid + "\t" + uid);
  struct stat socket;
  ASSERT_EQ(stat((Socket() + "/.s.PGSQL.5432").c_str(), &socket), 0);
  EXPECT_EQ(socket.st_mode & 07777, 0770u);

  EXPECT_EQ(Query("SELECT current_user || ' ' || current_setting('listen_addresses') || '|' || "
                  "current_setting('max_connections') || ' ' || "
                  "pg_encoding_to_char(encoding) || ' ' || datcollate FROM pg_database "
                  "WHERE datname = current_database()"),
            "kova |20 UTF8 C.UTF-8");
  EXPECT_EQ(Query("SELECT rolsuper FROM pg_roles WHERE rolname = 'kova'"), "f");
  EXPECT_EQ(Query("CREATE TABLE minutes (minute int PRIMARY KEY, cpu real); "
                  "INSERT INTO minutes VALUES (1, 12.5), (2, 40); SELECT sum(cpu) FROM minutes"),
            "52.5");

  ASSERT_EQ(QLIBServiceStop("pgsql", 0), 0);
  EXPECT_EQ(QLIBServiceIsRunning("pgsql"), 0);
  const std::string data = root_.Path("/volume1/@database/pgsql/data");
  std::string version = root_.Read("/volume1/@database/pgsql/data/PG_VERSION");
  version.erase(version.find_last_not_of('\n') + 1);
  const Outcome control =
      RunShell("/usr/lib/postgresql/" + version + "/bin/pg_controldata " + data);
  EXPECT_THAT(control.output, HasSubstr("Database cluster state:               shut down"));

  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(Query("SELECT count(*) FROM minutes"), "2");
  EXPECT_THAT(root_.Read("/var/log/kova/pgsql.log"), Not(HasSubstr("not properly shut down")));
}

// Each case breaks a freshly installed root of its own; the program (or the
// installer) then fails with status 1 and says what is wrong.
TEST_F(PgsqlServiceTest, FailuresSayWhatIsWrong) {
  const std::string program = "usr/sbin/kova-pgsql --check";
  const std::string long_root = root_.Path("/" + std::string(90, 'r'));
  const struct {
    const char* name;
    std::function<void(const std::string& root)> spoil;
    std::string command;  // run in the case's root, as the account
    const char* message;
  } cases[] = {
      {"no share link",
       [](const std::string& root) { unlink((root + "/var/services/pgsql").c_str()); }, program,
       "is no share link"},
      {"link to nowhere",
       [](const std::string& root) {
         unlink((root + "/var/services/pgsql").c_str());
         symlink("/volume2/gone", (root + "/var/services/pgsql").c_str());
       },
       program, "/volume2 does not exist"},
      {"folder closed", [](const std::string& root) { chmod((root + "/volume1").c_str(), 0600); },
       program, "/volume1 (drw-------"},
      {"no server", nullptr, program + " --server-dir /nonexistent", "no PostgreSQL server"},
      {"bad log", nullptr, program + " --log var/log", "must be a system path"},
  };
  for (size_t i = 0; i < std::size(cases); ++i) {
    const auto& c = cases[i];
    const std::string root = root_.Path("/case" + std::to_string(i));
    std::filesystem::create_directories(root);
    const Outcome installed = Install(root);
    ASSERT_EQ(installed.code, 0) << c.name << ": " << installed.output;
    if (c.spoil) c.spoil(root);
    const Outcome outcome = RunShell(AsAccount(root, root + "/" + c.command));
    EXPECT_EQ(outcome.code, 1) << c.name;
    EXPECT_THAT(outcome.output, HasSubstr(c.message)) << c.name;
    chmod((root + "/volume1").c_str(), 0755);  // so that the root can be removed
  }

  std::filesystem::create_directories(long_root);
  const Outcome too_long = Install(long_root);
  EXPECT_EQ(too_long.code, 1);
  EXPECT_THAT(too_long.output, HasSubstr("a Unix socket's path holds at most 107"));
  const Outcome unknown = Install(root_.Path("/case0"), "--user kova-no-such-account");
  EXPECT_EQ(unknown.code, 1);
  EXPECT_THAT(unknown.output, HasSubstr(geteuid() == 0 ? "no account kova-no-such-account"
                                                       : "only root can install the service"));
  if (geteuid() == 0) {
    const Outcome as_root =
        RunShell("KOVA_ROOT=" + root_.Path("/case4") + " " + KOVA_PGSQL_PROGRAM);
    EXPECT_EQ(as_root.code, 1);
    EXPECT_THAT(as_root.output, HasSubstr("PostgreSQL does not run as root"));
  }
}

}  // namespace
