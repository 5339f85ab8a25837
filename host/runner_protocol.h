// What the front-end and the runner say to each other over their socket pair,
// each message a frame of JSON:
//   runner, once started:  {"kind": "ready", "methods": [{"api", "version", "method"}...]}
//   front-end, a call:     {"api", "version", "method", "params", "user", "language"}
//   runner, the answer:    {"kind": "json" | "raw", "code": CODE}, then one more frame:
//                          the answer's envelope as JSON text ("json"), or everything
//                          the handler wrote to standard output ("raw");
//                          or, for output too large to copy through the socket,
//                          {"kind": "file", "code": 0, "size": BYTES} alone, with the
//                          file that holds the output attached (SCM_RIGHTS): the
//                          front-end owns it from then on.

#ifndef KOVA_HOST_RUNNER_PROTOCOL_H_
#define KOVA_HOST_RUNNER_PROTOCOL_H_

#include <json/value.h>

#include <cstdint>
#include <string>

#include "host/frame.h"
#include "host/unique_fd.h"

namespace kova_host {

struct RunnerCall {
  std::string api;
  int version = 0;
  std::string method;
  Json::Value params;  // an object
  std::string user;
  std::string language;
};

struct RunnerAnswer {
  bool raw = false;  // the handler turned the envelope off
  int code = 0;      // the envelope's error code, 0 on success and for raw output
  std::string body;  // the envelope's JSON text, or the raw output sent inline
  // Raw output handed over as a file instead: its first `output_size` bytes.
  UniqueFd output{};
  uint64_t output_size = 0;
};

IoResult SendReady(int fd, const Json::Value& methods);
IoResult ReceiveReady(FrameReader& reader, Json::Value& methods, Clock::time_point deadline);

// The frame's payload of a call, as SendCall writes it.
std::string EncodeCall(const RunnerCall& call);
IoResult SendCall(int fd, const RunnerCall& call, Clock::time_point deadline);
// kMalformed for a whole frame that isn't a well-formed call; the next frame
// can still be read.
IoResult ReceiveCall(FrameReader& reader, RunnerCall& call);

IoResult SendAnswer(int fd, const RunnerAnswer& answer);
IoResult ReceiveAnswer(FrameReader& reader, RunnerAnswer& answer, Clock::time_point deadline);

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_PROTOCOL_H_
