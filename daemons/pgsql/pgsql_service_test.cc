// The service "pgsql" for real: PostgreSQL installed in a temporary system
// root, started and stopped through the platform, reached with libpq as the
// history's role; and what its program says when it can't run.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <libpq-fe.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

#include "kova/service.h"
#include "test_support/test_root.h"

namespace {

using ::testing::HasSubstr;

// What `command` printed on standard output and error, then its exit status.
std::string RunShell(const std::string& command) {
  std::string output;
  FILE* pipe = popen((command + " 2>&1").c_str(), "r");
  if (pipe == nullptr) return "(no shell)";
  char buffer[4096];
  for (size_t got; (got = fread(buffer, 1, sizeof(buffer), pipe)) > 0;) output.append(buffer, got);
  return output + "exit " + std::to_string(WEXITSTATUS(pclose(pipe)));
}

// Copies the program where `cmake --install` puts it and installs the service
// in `root` for the default account: postgres for root, else the caller.
std::string Install(const std::string& root) {
  std::filesystem::create_directories(root + "/usr/sbin");
  std::filesystem::copy_file(KOVA_PGSQL_PROGRAM, root + "/usr/sbin/kova-pgsql",
                             std::filesystem::copy_options::overwrite_existing);
  return RunShell(std::string(KOVA_INSTALL_SERVICE) + " " + root);
}

class PgsqlServiceTest : public ::testing::Test {
 protected:
  void TearDown() override { QLIBServiceStop("pgsql", 0); }

  std::string Connection() const {
    return "host=" + root_.Path("/run/pgsql") + " user=kova dbname=kova_history";
  }

  // Waits up to 20 s (a first start makes the cluster) for the server to answer.
  bool AwaitServer() const {
    for (int i = 0; i < 200 && PQping(Connection().c_str()) != PQPING_OK; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return PQping(Connection().c_str()) == PQPING_OK;
  }

  // Runs `sql` as "kova"; the first value of its last result, or the error.
  std::string Query(const std::string& sql) const {
    PGconn* connection = PQconnectdb(Connection().c_str());
    PGresult* result = PQexec(connection, sql.c_str());
    const std::string answer = PQresultStatus(result) == PGRES_TUPLES_OK && PQntuples(result) > 0
                                   ? PQgetvalue(result, 0, 0)
                                   : std::string("(failed) ") + PQerrorMessage(connection);
    PQclear(result);
    PQfinish(connection);
    return answer;
  }

  kova_test::TestRoot root_;
};

TEST_F(PgsqlServiceTest, ServesKeepsItsDataAndShutsDownCleanly) {
  ASSERT_THAT(Install(root_.path()), HasSubstr("exit 0"));
  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(QLIBServiceIsRunning("pgsql"), 1);
  char volume[4096] = "";
  EXPECT_EQ(KOVAShareServiceVolumeGetbyLink("pgsql", volume, sizeof(volume)), 1);
  EXPECT_EQ(volume, root_.Path("/volume1"));

  // The recorded process is the postmaster, with the account's ids.
  const passwd* account = geteuid() == 0 ? getpwnam("postgres") : getpwuid(geteuid());
  ASSERT_NE(account, nullptr);
  const std::string pid = root_.Read("/run/kova/pgsql.pid");
  std::ifstream status("/proc/" + pid.substr(0, pid.find(' ')) + "/status");
  std::string line;
  while (std::getline(status, line) && !line.starts_with("Uid:")) {
  }
  const std::string uid = "\t" + std::to_string(account->pw_uid);
  EXPECT_EQ(line, "Uid:" + uid + uid + uid + uid);
  struct stat socket;
  ASSERT_EQ(stat(root_.Path("/run/pgsql/.s.PGSQL.5432").c_str(), &socket), 0);
  EXPECT_EQ(socket.st_mode & 07777, 0770u);

  EXPECT_EQ(Query("SELECT current_user || ' ' || current_setting('listen_addresses') || '|' || "
                  "current_setting('max_connections') || ' ' || pg_encoding_to_char(encoding) || "
                  "' ' || datcollate || ' ' || rolsuper FROM pg_database, pg_roles "
                  "WHERE datname = current_database() AND rolname = current_user"),
            "kova |20 UTF8 C.UTF-8 false");
  EXPECT_EQ(Query("CREATE TABLE minutes (minute int PRIMARY KEY, cpu real); "
                  "INSERT INTO minutes VALUES (1, 12.5), (2, 40); SELECT sum(cpu) FROM minutes"),
            "52.5");

  ASSERT_EQ(QLIBServiceStop("pgsql", 0), 0);
  EXPECT_EQ(QLIBServiceIsRunning("pgsql"), 0);
  const std::string data = root_.Path("/volume1/@database/pgsql/data");
  const std::string version = root_.Read("/volume1/@database/pgsql/data/PG_VERSION");
  EXPECT_THAT(RunShell("/usr/lib/postgresql/" + version.substr(0, version.find('\n')) +
                       "/bin/pg_controldata " + data),
              HasSubstr("Database cluster state:               shut down"));

  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(Query("SELECT count(*) FROM minutes"), "2");
}

// Each case spoils a freshly installed root of its own; the program, run as
// the account, then fails and says what is wrong.
TEST_F(PgsqlServiceTest, FailuresSayWhatIsWrong) {
  const struct {
    std::function<void(const std::string& root)> spoil;
    const char* options;
    const char* message;
  } cases[] = {
      {[](const std::string& root) { std::filesystem::remove(root + "/var/services/pgsql"); }, "",
       "is no share link"},
      {[](const std::string& root) { chmod((root + "/volume1").c_str(), 0600); }, "",
       "can't reach"},
      {[](const std::string&) {}, "--server-dir /nonexistent", "no PostgreSQL server"},
  };
  const std::string as_account =
      geteuid() == 0 ? "setpriv --reuid=postgres --regid=postgres --init-groups -- " : "";
  for (size_t i = 0; i < std::size(cases); ++i) {
    const std::string root = root_.Path("/case" + std::to_string(i));
    std::filesystem::create_directories(root);
    ASSERT_THAT(Install(root), HasSubstr("exit 0")) << i;
    cases[i].spoil(root);
    const std::string said = RunShell("KOVA_ROOT=" + root + " " + as_account + root +
                                      "/usr/sbin/kova-pgsql --check " + cases[i].options);
    EXPECT_THAT(said, HasSubstr(cases[i].message)) << i;
    EXPECT_THAT(said, HasSubstr("exit 1")) << i;
    chmod((root + "/volume1").c_str(), 0755);  // so that the root can be removed
  }
  // The installer runs the same checks: a root too deep for a socket's path.
  const std::string deep = root_.Path("/" + std::string(90, 'd'));
  std::filesystem::create_directories(deep);
  EXPECT_THAT(Install(deep), HasSubstr("a Unix socket's path holds at most 107"));
}

}  // namespace
