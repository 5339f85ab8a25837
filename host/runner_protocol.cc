#include "host/runner_protocol.h"

#include "host/json_text.h"

namespace kova_host {
namespace {

// A call carries at most a 1 MiB body and a query; escaped as JSON, a control
// byte takes six ("\u0001"), so 8 MiB holds any call the front-end takes.
constexpr size_t kMaxMessage = size_t{8} << 20;

IoResult ReadJson(FrameReader& reader, Json::Value& value, Clock::time_point deadline) {
  std::string text;
  const IoResult got = reader.Read(text, kMaxMessage, deadline);
  if (got != IoResult::kOk) return got;
  return FromJson(text, value) && value.isObject() ? IoResult::kOk : IoResult::kMalformed;
}

bool IsText(const Json::Value& value) { return value.isString(); }

}  // namespace

IoResult SendReady(int fd, const Json::Value& methods) {
  Json::Value message;
  message["kind"] = "ready";
  message["methods"] = methods;
  return WriteFrame(fd, ToJson(message), kNoDeadline);
}

IoResult ReceiveReady(FrameReader& reader, Json::Value& methods, Clock::time_point deadline) {
  Json::Value message;
  const IoResult got = ReadJson(reader, message, deadline);
  if (got != IoResult::kOk) return got;
  if (message["kind"] != "ready" || !message["methods"].isArray()) return IoResult::kError;
  methods = message["methods"];
  return IoResult::kOk;
}

IoResult SendCall(int fd, const RunnerCall& call, Clock::time_point deadline) {
  return WriteFrame(fd, EncodeCall(call), deadline);
}

std::string EncodeCall(const RunnerCall& call) {
  Json::Value message;
  message["api"] = call.api;
  message["version"] = call.version;
  message["method"] = call.method;
  message["params"] = call.params;
  message["user"] = call.user;
  message["language"] = call.language;
  return ToJson(message);
}

IoResult ReceiveCall(FrameReader& reader, RunnerCall& call) {
  Json::Value message;
  const IoResult got = ReadJson(reader, message, kNoDeadline);
  if (got != IoResult::kOk) return got;
  if (!IsText(message["api"]) || !message["version"].isInt() || !IsText(message["method"]) ||
      !message["params"].isObject() || !IsText(message["user"]) || !IsText(message["language"])) {
    return IoResult::kMalformed;
  }
  call = {message["api"].asString(), message["version"].asInt(), message["method"].asString(),
          message["params"],         message["user"].asString(), message["language"].asString()};
  return IoResult::kOk;
}

IoResult SendAnswer(int fd, const RunnerAnswer& answer) {
  Json::Value header;
  header["code"] = answer.code;
  if (answer.output.valid()) {
    header["kind"] = "file";
    header["size"] = Json::UInt64(answer.output_size);
    return WriteFrame(fd, ToJson(header), kNoDeadline, answer.output.get());
  }
  header["kind"] = answer.raw ? "raw" : "json";
  return WriteFrames(fd, ToJson(header), answer.body, kNoDeadline);
}

IoResult ReceiveAnswer(FrameReader& reader, RunnerAnswer& answer, Clock::time_point deadline) {
  Json::Value header;
  const IoResult got = ReadJson(reader, header, deadline);
  if (got != IoResult::kOk) return got;
  const Json::Value& kind = header["kind"];
  if ((kind != "raw" && kind != "json" && kind != "file") || !header["code"].isInt()) {
    return IoResult::kError;
  }
  answer.raw = kind != "json";
  answer.code = header["code"].asInt();
  if (kind != "file") return reader.Read(answer.body, kMaxFrame, deadline);
  // The file came with the header's first byte.
  answer.output = reader.TakeDescriptor();
  if (!answer.output.valid() || !header["size"].isUInt64()) return IoResult::kError;
  answer.output_size = header["size"].asUInt64();
  return IoResult::kOk;
}

}  // namespace kova_host
