// kovastatd's answers to the requests on its socket (protocol.md): one JSON
// object in, one JSON object out. A bad request gets an error answer; nothing
// here throws or ends the collector.

#ifndef KOVA_DAEMONS_STATD_PROTOCOL_H_
#define KOVA_DAEMONS_STATD_PROTOCOL_H_

#include <cstddef>
#include <string>
#include <string_view>

#include "kova/statistics.h"
#include "statd/collector.h"

namespace statd {

// The answer to the request line `line` (without its line feed), without a
// line feed: {"success":true[,"data":...]} or
// {"success":false,"error":{"code":CODE,"message":TEXT}}.
std::string Answer(std::string_view line, Collector& collector);

// An error answer with the protocol's `code` ("bad_request", "too_large",
// "history_off", "database_unavailable", "internal") and an English `message`.
std::string ErrorAnswer(const char* code, const std::string& message);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PROTOCOL_H_
