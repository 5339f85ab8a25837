#include "statd/pg_connection.h"

#include <errno.h>
#include <poll.h>

#include <algorithm>
#include <climits>
#include <cstring>

namespace statd {
namespace {

constexpr size_t kCopyChunk = 64 * 1024;

// The first line of a libpq message, without its trailing blanks.
std::string OneLine(const char* text) {
  std::string line = text == nullptr ? "" : text;
  line = line.substr(0, line.find('\n'));
  while (!line.empty() && (line.back() == ' ' || line.back() == '\r')) line.pop_back();
  return line;
}

}  // namespace

bool PgConnection::Open(const std::string& conninfo, Deadline deadline, PgError& error) {
  Close();
  // Entries before the expanded "dbname" give way to the connection string's.
  const char* keys[] = {"application_name", "dbname", nullptr};
  const char* values[] = {"kovastatd", conninfo.c_str(), nullptr};
  conn_ = PQconnectStartParams(keys, values, 1);
  if (conn_ == nullptr) {
    error = {"out of memory for a connection", ""};
    return false;
  }
  if (PQstatus(conn_) == CONNECTION_BAD) return FailConnection(error);
  PQsetNoticeReceiver(
      conn_, [](void*, const PGresult*) {}, nullptr);
  PostgresPollingStatusType state = PGRES_POLLING_WRITING;
  while (state != PGRES_POLLING_OK) {
    if (state == PGRES_POLLING_FAILED) return FailConnection(error);
    const Wait wait = WaitFor(state == PGRES_POLLING_READING ? POLLIN : POLLOUT, deadline);
    if (wait != Wait::kReady) return FailWait(wait, error);
    state = PQconnectPoll(conn_);
  }
  if (PQsetnonblocking(conn_, 1) != 0) return FailConnection(error);
  return true;
}

void PgConnection::Close() {
  if (conn_ != nullptr) PQfinish(conn_);
  conn_ = nullptr;
}

bool PgConnection::Run(const std::string& sql, const std::vector<std::string>& params,
                       Deadline deadline, PgResult& result, PgError& error) {
  result.reset();
  if (conn_ == nullptr) {
    error = {"not connected", ""};
    return false;
  }
  int sent = 0;
  if (params.empty()) {
    sent = PQsendQuery(conn_, sql.c_str());
  } else {
    std::vector<const char*> values;
    for (const std::string& param : params) values.push_back(param.c_str());
    sent = PQsendQueryParams(conn_, sql.c_str(), static_cast<int>(values.size()), nullptr,
                             values.data(), nullptr, nullptr, 0);
  }
  if (sent == 0) return FailConnection(error);
  return Flush(deadline, error) && Collect(deadline, result, error);
}

bool PgConnection::Run(const std::string& sql, const std::vector<std::string>& params,
                       Deadline deadline, PgError& error) {
  PgResult ignored;
  return Run(sql, params, deadline, ignored, error);
}

bool PgConnection::CopyIn(const std::string& copy_sql, const std::string& data, Deadline deadline,
                          PgError& error) {
  PgResult result;
  if (!Run(copy_sql, {}, deadline, result, error)) return false;
  if (result == nullptr || PQresultStatus(result.get()) != PGRES_COPY_IN) {
    error = {"the server didn't start the COPY", ""};
    Close();
    return false;
  }
  for (size_t done = 0; done < data.size();) {
    const size_t size = std::min(kCopyChunk, data.size() - done);
    const int put = PQputCopyData(conn_, data.data() + done, static_cast<int>(size));
    if (put < 0) return FailConnection(error);
    if (put > 0) done += size;
    // Sends what is buffered; when the buffer was full this makes room.
    if (!Flush(deadline, error)) return false;
  }
  for (;;) {
    const int put = PQputCopyEnd(conn_, nullptr);
    if (put < 0) return FailConnection(error);
    if (!Flush(deadline, error)) return false;
    if (put > 0) break;
  }
  return Collect(deadline, result, error);
}

PgConnection::Wait PgConnection::WaitFor(short events, Deadline deadline) const {
  const int socket = PQsocket(conn_);
  if (socket < 0) return Wait::kFailed;
  pollfd fds[2] = {{socket, events, 0}, {stop_fd_, POLLIN, 0}};
  for (;;) {
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return Wait::kTimedOut;
    const int ready = poll(fds, 2, static_cast<int>(std::min<int64_t>(left.count(), INT_MAX)));
    if (ready < 0 && errno != EINTR) return Wait::kFailed;
    if (ready <= 0) continue;
    if (fds[1].revents != 0) return Wait::kStopped;
    if (fds[0].revents != 0) return Wait::kReady;  // errors too: libpq reads them next
  }
}

bool PgConnection::Flush(Deadline deadline, PgError& error) {
  for (;;) {
    const int left = PQflush(conn_);
    if (left == 0) return true;
    if (left < 0) return FailConnection(error);
    const Wait wait = WaitFor(POLLOUT | POLLIN, deadline);
    if (wait != Wait::kReady) return FailWait(wait, error);
    // The server may be sending while it waits for us to read.
    if (PQconsumeInput(conn_) == 0) return FailConnection(error);
  }
}

bool PgConnection::Collect(Deadline deadline, PgResult& result, PgError& error) {
  result.reset();
  bool ok = true;
  for (;;) {
    while (PQisBusy(conn_)) {
      const Wait wait = WaitFor(POLLIN, deadline);
      if (wait != Wait::kReady) return FailWait(wait, error);
      if (PQconsumeInput(conn_) == 0) return FailConnection(error);
    }
    PgResult next(PQgetResult(conn_));
    if (next == nullptr) break;
    const ExecStatusType status = PQresultStatus(next.get());
    if (status == PGRES_FATAL_ERROR || status == PGRES_BAD_RESPONSE) {
      if (ok) {
        const char* state = PQresultErrorField(next.get(), PG_DIAG_SQLSTATE);
        error = {OneLine(PQresultErrorMessage(next.get())), state == nullptr ? "" : state};
      }
      ok = false;
    }
    const bool copy_in = status == PGRES_COPY_IN;
    result = std::move(next);
    if (copy_in) break;  // the caller sends the rows first
  }
  if (PQstatus(conn_) == CONNECTION_BAD) {
    if (ok) error = {OneLine(PQerrorMessage(conn_)), ""};
    Close();
    return false;
  }
  if (!ok) result.reset();
  return ok;
}

bool PgConnection::FailWait(Wait wait, PgError& error) {
  switch (wait) {
    case Wait::kStopped:
      error = {"stopped", ""};
      break;
    case Wait::kTimedOut:
      error = {"the server didn't answer in time", ""};
      break;
    default:
      error = {std::string("can't wait for the server: ") + strerror(errno), ""};
      break;
  }
  Close();
  return false;
}

bool PgConnection::FailConnection(PgError& error) {
  error = {OneLine(PQerrorMessage(conn_)), ""};
  if (error.message.empty()) error.message = "the connection to the server was lost";
  Close();
  return false;
}

std::string TextArray(const std::vector<std::string>& values) {
  std::string text = "{";
  for (const std::string& value : values) {
    if (text.size() > 1) text += ',';
    text += '"';
    for (char c : value) {
      if (c == '"' || c == '\\') text += '\\';
      text += c;
    }
    text += '"';
  }
  return text + "}";
}

}  // namespace statd
