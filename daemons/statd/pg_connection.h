// One libpq connection whose every wait can be cut short: each call has a
// deadline, and a "stop" descriptor that becomes readable when the owner ends
// ends any wait at once. Statements run through libpq's asynchronous calls, so
// that a hung server or a hung connect never holds a thread longer than that.

#ifndef KOVA_DAEMONS_STATD_PG_CONNECTION_H_
#define KOVA_DAEMONS_STATD_PG_CONNECTION_H_

#include <libpq-fe.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

namespace statd {

using Deadline = std::chrono::steady_clock::time_point;

struct PgResultFree {
  void operator()(PGresult* result) const { PQclear(result); }
};
using PgResult = std::unique_ptr<PGresult, PgResultFree>;

// Why a call failed.
struct PgError {
  std::string message;   // libpq's or the server's reason, on one line
  std::string sqlstate;  // the server's error code ("57014"), empty when the server gave none
};

class PgConnection {
 public:
  // `stop_fd`: a descriptor that becomes readable when waits should end, or -1.
  explicit PgConnection(int stop_fd) : stop_fd_(stop_fd) {}
  ~PgConnection() { Close(); }
  PgConnection(const PgConnection&) = delete;
  PgConnection& operator=(const PgConnection&) = delete;

  // Connects with the libpq connection string `conninfo` (key=value pairs or
  // a URI). True when connected; false with `error` when the server can't be
  // reached, refuses, or `deadline` or the stop came first.
  bool Open(const std::string& conninfo, Deadline deadline, PgError& error);

  // Ends the connection, if any; the server rolls back an open transaction.
  void Close();
  bool is_open() const { return conn_ != nullptr; }

  // Runs `sql`: with `params` ($1, $2... as text) one statement, without them
  // one or more. True with the last statement's result in `result` (may be
  // null); false with `error` when a statement failed. A failure of the
  // connection itself, the deadline or the stop also closes the connection.
  bool Run(const std::string& sql, const std::vector<std::string>& params, Deadline deadline,
           PgResult& result, PgError& error);
  // Run for a statement whose result doesn't matter.
  bool Run(const std::string& sql, const std::vector<std::string>& params, Deadline deadline,
           PgError& error);

  // Runs `copy_sql`, a "COPY ... FROM STDIN", and sends `data` as its rows in
  // COPY's text format. True when the server took them all; false with `error`
  // as Run.
  bool CopyIn(const std::string& copy_sql, const std::string& data, Deadline deadline,
              PgError& error);

 private:
  enum class Wait { kReady, kStopped, kTimedOut, kFailed };

  // Waits until the connection's socket is ready for `events` (poll's bits).
  Wait WaitFor(short events, Deadline deadline) const;
  // Sends what libpq holds back. False (the connection closed) on failure.
  bool Flush(Deadline deadline, PgError& error);
  // Collects the results of the statement sent last, keeping the last one.
  // Stops early at a COPY IN result, which it keeps too.
  bool Collect(Deadline deadline, PgResult& result, PgError& error);
  // Fills `error` for a wait that ended without the socket being ready, and
  // closes the connection.
  bool FailWait(Wait wait, PgError& error);
  // Fills `error` with libpq's reason and closes the connection.
  bool FailConnection(PgError& error);

  int stop_fd_;
  PGconn* conn_ = nullptr;
};

// `values` as a PostgreSQL array literal of text, for a text[] parameter.
std::string TextArray(const std::vector<std::string>& values);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PG_CONNECTION_H_
