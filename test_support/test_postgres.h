// A throw-away PostgreSQL for tests and benchmarks: a cluster made by initdb
// in a temporary directory, its server listening only on a Unix socket in that
// directory, stopped and removed with everything when the object goes. Run as
// root, initdb and the server run as the account "postgres" (PostgreSQL won't
// run as root), which then owns the directory; otherwise as the caller. The
// server binaries are the newest /usr/lib/postgresql/*/bin.

#ifndef KOVA_TEST_SUPPORT_TEST_POSTGRES_H_
#define KOVA_TEST_SUPPORT_TEST_POSTGRES_H_

#include <fcntl.h>
#include <glob.h>
#include <grp.h>
#include <libpq-fe.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "test_support/temp_root.h"

namespace kova_test {

class TestPostgres {
 public:
  // Makes the cluster and starts its server; ok() says whether both worked,
  // and standard error why not.
  TestPostgres() {
    char pattern[] = "/tmp/kova_pg.XXXXXX";
    if (mkdtemp(pattern) == nullptr) {
      perror("TestPostgres: no temporary directory");
      return;
    }
    dir_ = pattern;
    bin_ = NewestBinDir();
    if (bin_.empty()) {
      fprintf(stderr, "TestPostgres: no /usr/lib/postgresql/*/bin\n");
      return;
    }
    if (getuid() == 0) {
      const passwd* account = getpwnam("postgres");
      if (account == nullptr) {
        fprintf(stderr, "TestPostgres: no account \"postgres\" to run the server as root\n");
        return;
      }
      uid_ = account->pw_uid;
      gid_ = account->pw_gid;
      if (chown(dir_.c_str(), uid_, gid_) != 0) perror("TestPostgres: chown");
    }
    chmod(dir_.c_str(), 0700);
    if (!Run({bin_ + "/initdb", "-D", Data(), "-U", "kova", "-A", "trust", "--no-sync",
              "--no-locale", "-E", "UTF8"})) {
      fprintf(stderr, "TestPostgres: initdb failed:\n%s\n", ReadLog().c_str());
      return;
    }
    std::ofstream(Data() + "/postgresql.conf", std::ios::app)
        << "listen_addresses = ''\n"
        << "unix_socket_directories = '" << dir_ << "'\n"
        << "fsync = off\nsynchronous_commit = off\nfull_page_writes = off\n";
    ok_ = Start();
  }

  ~TestPostgres() {
    if (getpid() != owner_ || dir_.empty()) return;
    if (running_) Stop();
    RemoveTree(dir_);
  }
  TestPostgres(const TestPostgres&) = delete;
  TestPostgres& operator=(const TestPostgres&) = delete;

  bool ok() const { return ok_; }

  // Starts the cluster's server and waits until it takes connections.
  bool Start() {
    running_ = Run({bin_ + "/pg_ctl", "-D", Data(), "-l", dir_ + "/server.log", "-w", "-t", "60",
                    "-s", "start"});
    if (!running_)
      fprintf(stderr, "TestPostgres: the server didn't start:\n%s\n", ReadLog().c_str());
    return running_;
  }

  // Stops the server (fast: sessions are ended) and waits until it is gone.
  bool Stop() {
    const bool stopped =
        Run({bin_ + "/pg_ctl", "-D", Data(), "-m", "fast", "-w", "-t", "60", "-s", "stop"});
    running_ = !stopped;
    return stopped;
  }

  // libpq's connection string for the server's database "postgres" as the
  // superuser "kova".
  std::string conninfo() const { return "host=" + dir_ + " user=kova dbname=postgres"; }
  const std::string& dir() const { return dir_; }

  // The server's process id, 0 when it isn't running.
  pid_t ServerPid() const {
    std::ifstream in(Data() + "/postmaster.pid");
    pid_t pid = 0;
    in >> pid;
    return pid;
  }

  // Runs `sql` (statements without parameters) and returns the last result's
  // rows, each as its fields in text. A failure gives one row: "ERROR: " and
  // the reason.
  std::vector<std::vector<std::string>> Sql(const std::string& sql) const {
    PGconn* conn = PQconnectdb(conninfo().c_str());
    PGresult* result = PQstatus(conn) == CONNECTION_OK ? PQexec(conn, sql.c_str()) : nullptr;
    std::vector<std::vector<std::string>> rows;
    const ExecStatusType status = PQresultStatus(result);
    if (result == nullptr || (status != PGRES_TUPLES_OK && status != PGRES_COMMAND_OK)) {
      rows.push_back({std::string("ERROR: ") + PQerrorMessage(conn)});
    } else {
      for (int row = 0; row < PQntuples(result); ++row) {
        rows.emplace_back();
        for (int field = 0; field < PQnfields(result); ++field) {
          rows.back().push_back(PQgetvalue(result, row, field));
        }
      }
    }
    PQclear(result);
    PQfinish(conn);
    return rows;
  }

  // Runs `copy_sql` ("COPY ... FROM STDIN") with `data` in COPY's text format.
  // False, and why on standard error, when the server refused it.
  bool Copy(const std::string& copy_sql, const std::string& data) const {
    PGconn* conn = PQconnectdb(conninfo().c_str());
    PGresult* started = PQexec(conn, copy_sql.c_str());
    bool ok = PQresultStatus(started) == PGRES_COPY_IN &&
              PQputCopyData(conn, data.data(), static_cast<int>(data.size())) == 1 &&
              PQputCopyEnd(conn, nullptr) == 1;
    PQclear(started);
    while (PGresult* result = PQgetResult(conn)) {
      ok = ok && PQresultStatus(result) == PGRES_COMMAND_OK;
      PQclear(result);
    }
    if (!ok) fprintf(stderr, "TestPostgres: COPY failed: %s\n", PQerrorMessage(conn));
    PQfinish(conn);
    return ok;
  }

 private:
  std::string Data() const { return dir_ + "/data"; }
  std::string ReadLog() const {
    std::ifstream in(dir_ + "/tools.log");
    return std::string(std::istreambuf_iterator<char>(in), {});
  }

  // The newest installed server's bin directory, by major version.
  static std::string NewestBinDir() {
    glob_t found;
    std::string newest;
    int newest_version = -1;
    if (glob("/usr/lib/postgresql/*/bin", 0, nullptr, &found) == 0) {
      for (size_t i = 0; i < found.gl_pathc; ++i) {
        const std::string path = found.gl_pathv[i];
        const int version = atoi(path.c_str() + sizeof("/usr/lib/postgresql/") - 1);
        if (version > newest_version) {
          newest_version = version;
          newest = path;
        }
      }
      globfree(&found);
    }
    return newest;
  }

  // Runs `argv` as the server's account in the directory, its output appended
  // to tools.log there. True when it exited with 0.
  bool Run(const std::vector<std::string>& argv) const {
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    const std::string log = dir_ + "/tools.log";
    fflush(stdout);
    fflush(stderr);
    const pid_t pid = fork();
    if (pid == 0) {
      if (getuid() == 0 && (setgroups(0, nullptr) != 0 || setgid(gid_) != 0 || setuid(uid_) != 0)) {
        _exit(126);
      }
      const int out = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
      if (out < 0 || chdir(dir_.c_str()) != 0) _exit(126);
      dup2(out, 1);
      dup2(out, 2);
      const int null = open("/dev/null", O_RDONLY);
      dup2(null, 0);
      close_range(3, ~0U, 0);  // the server keeps nothing of the test's
      execv(args[0], args.data());
      _exit(127);
    }
    int status = 0;
    return pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status) &&
           WEXITSTATUS(status) == 0;
  }

  pid_t owner_ = getpid();
  std::string dir_;
  std::string bin_;
  uid_t uid_ = getuid();
  gid_t gid_ = getgid();
  bool ok_ = false;
  bool running_ = false;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_TEST_POSTGRES_H_
