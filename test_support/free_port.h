// For tests and benchmarks: a loopback TCP port that is free at this moment,
// for a program that must be told its port before it starts.

#ifndef KOVA_TEST_SUPPORT_FREE_PORT_H_
#define KOVA_TEST_SUPPORT_FREE_PORT_H_

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

namespace kova_test {

// A port of 127.0.0.1 that the system just handed out and took back; 0 when
// none could be had.
inline int FreePort() {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return 0;
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  const bool bound = bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0 &&
                     getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) == 0;
  close(fd);
  return bound ? ntohs(address.sin_port) : 0;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_FREE_PORT_H_
