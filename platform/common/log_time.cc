// The time text of log records.

#include <time.h>

#include <algorithm>

#include "kova/log.h"

namespace {

// Times are kept within the four-digit years, so that every text has the same
// width and byte order stays time order.
constexpr int64_t kEarliest = -30610137600;  // 1000-01-02 00:00:00 UTC
constexpr int64_t kLatest = 253402128000;    // 9999-12-30 00:00:00 UTC

}  // namespace

std::string KOVALogConvertTime1(int64_t seconds) {
  const time_t when = static_cast<time_t>(std::clamp(seconds, kEarliest, kLatest));
  struct tm local;
  char text[32] = "";
  if (localtime_r(&when, &local) != nullptr) {
    strftime(text, sizeof(text), "%Y/%m/%d %H:%M:%S", &local);
  }
  return text;
}
