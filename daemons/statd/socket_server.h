// kovastatd's Unix socket: a few threads take connections, read one request
// line each, answer it and close. A client that sends too slowly or too much
// is answered with an error or dropped; it never holds up the others for long.

#ifndef KOVA_DAEMONS_STATD_SOCKET_SERVER_H_
#define KOVA_DAEMONS_STATD_SOCKET_SERVER_H_

#include <atomic>
#include <functional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace statd {

// Turns a request line into its answer line (neither with a line feed).
using Answerer = std::function<std::string(std::string_view line)>;

class SocketServer {
 public:
  // Serves `answer` on the socket at the real path `path`, with `threads`
  // connections answered at once.
  SocketServer(std::string path, Answerer answer, int threads = 4);
  // Stops (see Stop).
  ~SocketServer();
  SocketServer(const SocketServer&) = delete;
  SocketServer& operator=(const SocketServer&) = delete;

  // Makes the socket (mode 0666: the web-API host's account must reach it) and
  // starts the threads. A stale socket file of an ended collector is replaced.
  // False with `error` when the socket can't be made, or another process
  // answers on it.
  bool Start(std::string& error);

  // Ends the threads once their current answers are sent, and removes the socket.
  void Stop();

 private:
  void Serve();
  void Handle(int connection);

  std::string path_;
  Answerer answer_;
  int thread_count_;
  int listener_ = -1;
  std::atomic<bool> stopping_{false};
  std::vector<std::thread> threads_;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SOCKET_SERVER_H_
