// kovastatd's Unix socket. One thread waits on every connection at once
// (epoll) and reads request lines; a few workers answer whole lines; the
// waiting thread writes the answers back. A client that sends slowly, sends
// too much or never reads holds only its own connection, until a deadline
// closes it; a local user can hold at most a share of the connections.

#ifndef KOVA_DAEMONS_STATD_SOCKET_SERVER_H_
#define KOVA_DAEMONS_STATD_SOCKET_SERVER_H_

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

namespace statd {

// Turns a request line into its answer line (neither with a line feed).
using Answerer = std::function<std::string(std::string_view line)>;

struct SocketLimits {
  int workers = 4;                               // answers made at once
  size_t connections = 256;                      // connections held at once
  size_t per_user = 32;                          // of which one local user may hold
  std::chrono::milliseconds request_time{2000};  // for the whole request line
  std::chrono::milliseconds answer_time{10000};  // for the client to take the answer
};

class SocketServer {
 public:
  // Serves `answer` on the socket at the real path `path`.
  SocketServer(std::string path, Answerer answer, SocketLimits limits = {});
  // Stops (see Stop).
  ~SocketServer();
  SocketServer(const SocketServer&) = delete;
  SocketServer& operator=(const SocketServer&) = delete;

  // Makes the socket (mode 0666: the web-API host's account must reach it) and
  // starts the threads. A stale socket file of an ended collector is replaced.
  // False with `error` when the socket can't be made, or another process
  // answers on it.
  bool Start(std::string& error);

  // Ends the threads once the answers being made are done, closes every
  // connection and removes the socket.
  void Stop();

 private:
  struct Connection {
    uid_t user = 0;
    std::string in;   // what came of the request line
    std::string out;  // the answer, once made
    size_t sent = 0;
    bool answering = false;  // a worker has its line
    std::chrono::steady_clock::time_point deadline;
  };
  struct Job {
    int fd;
    std::string line;
  };

  void Wait();  // the thread that waits on the connections
  void Work();  // a worker
  void Accept();
  void Read(int fd, Connection& connection);
  void Write(int fd, Connection& connection);
  void Answer(int fd, Connection& connection, std::string answer);
  void Close(int fd);
  // Takes the answers the workers made since the last call.
  void CollectAnswers();

  std::string path_;
  Answerer answer_;
  SocketLimits limits_;
  int listener_ = -1;
  int epoll_ = -1;
  int wake_ = -1;  // an eventfd: answers are ready, or the server stops
  std::atomic<bool> stopping_{false};
  std::thread waiter_;
  std::vector<std::thread> workers_;
  std::unordered_map<int, Connection> connections_;  // the waiting thread's alone
  std::unordered_map<uid_t, size_t> per_user_;
  std::mutex mutex_;  // guards what follows
  std::condition_variable work_;
  std::deque<Job> jobs_;
  std::vector<Job> answers_;  // a Job whose line is the answer
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SOCKET_SERVER_H_
