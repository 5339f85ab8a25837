// The service "pgsql" for real: PostgreSQL installed in a temporary system
// root, started and stopped through the platform, reached with libpq as the
// history's role; and what its program says when it can't run.

#include <gmock/gmock.h>
#include <grp.h>
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
#include "test_support/run_in_child.h"
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

// The account the service runs as by default: kovapgsql for root (made by
// scripts/setup), else the caller.
const passwd* DefaultAccount() {
  return geteuid() == 0 ? getpwnam("kovapgsql") : getpwuid(geteuid());
}

// Copies the program where `cmake --install` puts it and installs the service
// in `root` for the default account with `installer` and its `arguments`.
std::string Install(const std::string& root, const std::string& installer = KOVA_INSTALL_SERVICE,
                    const std::string& arguments = "") {
  std::filesystem::create_directories(root + "/usr/sbin");
  std::filesystem::copy_file(KOVA_PGSQL_PROGRAM, root + "/usr/sbin/kova-pgsql",
                             std::filesystem::copy_options::overwrite_existing);
  return RunShell(installer + " " + root + arguments);
}

class PgsqlServiceTest : public ::testing::Test {
 protected:
  void TearDown() override { QLIBServiceStop("pgsql", 0); }

  std::string Connection(const std::string& user = "kova",
                         const std::string& database = "kova_history") const {
    return "host=" + root_.Path("/run/pgsql") + " user=" + user + " dbname=" + database;
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
  const passwd* account = DefaultAccount();
  ASSERT_NE(account, nullptr) << "no account kovapgsql: run scripts/setup";
  ASSERT_THAT(Install(root_.path()), HasSubstr("exit 0"));
  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(QLIBServiceIsRunning("pgsql"), 1);
  char volume[4096] = "";
  EXPECT_EQ(KOVAShareServiceVolumeGetbyLink("pgsql", volume, sizeof(volume)), 1);
  EXPECT_EQ(volume, root_.Path("/volume1"));

  // The recorded process is the postmaster, with the account's ids.
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

  // A reboot empties /run: the platform makes the socket folder again.
  std::filesystem::remove_all(root_.Path("/run"));
  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  EXPECT_EQ(Query("SELECT count(*) FROM minutes"), "2");
  struct stat folder;
  ASSERT_EQ(stat(root_.Path("/run/pgsql").c_str(), &folder), 0);
  EXPECT_EQ(folder.st_mode & 07777, 0750u);
  EXPECT_EQ(folder.st_uid, account->pw_uid);
  EXPECT_EQ(folder.st_gid, account->pw_gid);
}

// Root and the account connect as "kova" to "kova_history", the account as
// itself too; no one reaches another database.
TEST_F(PgsqlServiceTest, LetsInOnlyRootAndTheAccountToTheHistory) {
  const passwd* account = DefaultAccount();
  ASSERT_NE(account, nullptr) << "no account kovapgsql: run scripts/setup";
  ASSERT_THAT(Install(root_.path()), HasSubstr("exit 0"));
  ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
  ASSERT_TRUE(AwaitServer()) << root_.Read("/var/log/kova/pgsql.log");
  const std::string name = account->pw_name;
  const struct {
    bool as_account;  // connects as the account, or as root
    std::string user;
    const char* database;
    bool admitted;
  } cases[] = {
      {false, "kova", "kova_history", true}, {false, name, "kova_history", false},
      {false, "kova", "postgres", false},    {true, "kova", "kova_history", true},
      {true, name, "kova_history", true},    {true, name, "postgres", false},
      {true, name, "template1", false},      {true, "kova", "postgres", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.as_account ? "the account" : "root") + " as " + c.user + " to " +
                 c.database);
    if (!c.as_account && geteuid() != 0) continue;  // only root can connect as root
    const bool passed = kova_test::RunInChild([&] {
      if (c.as_account && geteuid() == 0) {
        ASSERT_EQ(initgroups(account->pw_name, account->pw_gid), 0);
        ASSERT_EQ(setresgid(account->pw_gid, account->pw_gid, account->pw_gid), 0);
        ASSERT_EQ(setresuid(account->pw_uid, account->pw_uid, account->pw_uid), 0);
      }
      PGconn* connection = PQconnectdb(Connection(c.user, c.database).c_str());
      EXPECT_EQ(PQstatus(connection) == CONNECTION_OK, c.admitted) << PQerrorMessage(connection);
      PQfinish(connection);
    });
    EXPECT_TRUE(passed);
  }
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
      {[](const std::string& root) { mkdir((root + "/run/pgsql").c_str(), 0555); }, "",
       "can't make its socket in"},
      {[](const std::string&) {}, "--server-dir /nonexistent", "no PostgreSQL server"},
  };
  const std::string as_account =
      geteuid() == 0 ? "setpriv --reuid=kovapgsql --regid=kovapgsql --init-groups -- " : "";
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

// The generic installer hands "pgsql" to its own, which writes the description
// last: a root it refuses is left without the service.
TEST_F(PgsqlServiceTest, InstallsWholeOrNotAtAll) {
  const passwd* account = DefaultAccount();
  ASSERT_NE(account, nullptr) << "no account kovapgsql: run scripts/setup";
  const struct {
    const char* name;
    const char* installer;
    const char* arguments;
    std::function<void(const std::string& root)> prepare;
    const char* said;
    bool installed;
  } cases[] = {
      {"by the generic installer", KOVA_INSTALL_GENERIC, " pgsql", [](const std::string&) {},
       "exit 0", true},
      {"with options", KOVA_INSTALL_GENERIC, " pgsql '' --fast", [](const std::string&) {},
       "pgsql takes no options", false},
      {"a cluster of another account", KOVA_INSTALL_SERVICE, "",
       [](const std::string& root) {
         const std::string data = root + "/volume1/@database/pgsql/data";
         std::filesystem::create_directories(data);
         chown(data.c_str(), 65534, 65534);
       },
       "belongs to nobody", false},
  };
  for (size_t i = 0; i < std::size(cases); ++i) {
    const auto& c = cases[i];
    SCOPED_TRACE(c.name);
    if (!c.installed && *c.arguments == '\0' && geteuid() != 0) continue;  // needs chown
    const std::string root = root_.Path("/case" + std::to_string(i));
    std::filesystem::create_directories(root);
    c.prepare(root);
    const std::string said = Install(root, c.installer, c.arguments);
    EXPECT_THAT(said, HasSubstr(c.said));
    std::ifstream file(root + "/etc/kova/services/pgsql.conf");
    const std::string description(std::istreambuf_iterator<char>(file), {});
    EXPECT_EQ(std::filesystem::is_symlink(root + "/var/services/pgsql"), c.installed);
    if (!c.installed) {
      EXPECT_EQ(description, "");
      continue;
    }
    EXPECT_THAT(description, HasSubstr("command=\"" + root +
                                       "/usr/sbin/kova-pgsql --log /var/log/kova/pgsql.log\"\n"));
    EXPECT_THAT(description, HasSubstr(std::string("\nuser=\"") + account->pw_name + "\"\n"));
    struct stat folder;
    ASSERT_EQ(stat((root + "/volume1/@database/pgsql").c_str(), &folder), 0);
    EXPECT_EQ(folder.st_mode & 07777, 0700u);
    EXPECT_EQ(folder.st_uid, account->pw_uid);
  }
}

}  // namespace
