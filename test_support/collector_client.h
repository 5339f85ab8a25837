// For tests and benchmarks: one exchange with kovastatd on the socket of the
// system root that KOVA_ROOT names, through the platform's client.

#ifndef KOVA_TEST_SUPPORT_COLLECTOR_CLIENT_H_
#define KOVA_TEST_SUPPORT_COLLECTOR_CLIENT_H_

#include <chrono>
#include <functional>
#include <string>
#include <thread>

#include "kova/transmitor.h"
#include "test_support/host_call.h"

namespace kova_test {

// The collector's reply to the request written in `request`; null when there
// was none.
inline Json::Value AskCollector(const std::string& request) {
  Transmitor client("localhost");
  Json::Value reply;
  if (client.Transmit(ParseJson(request)) != 0 || client.GetDataJson(reply) != 0) {
    return Json::Value();
  }
  return reply;
}

// Asks `request` every 100 ms until `done` holds of the reply, for up to
// `limit`; the last reply.
inline Json::Value AskCollectorUntil(const std::string& request,
                                     const std::function<bool(const Json::Value&)>& done,
                                     std::chrono::seconds limit = std::chrono::seconds(10)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Json::Value reply = AskCollector(request);
  while (!done(reply) && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    reply = AskCollector(request);
  }
  return reply;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_COLLECTOR_CLIENT_H_
