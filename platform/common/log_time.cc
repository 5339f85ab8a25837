// The time text of log records.

#include <time.h>

#include "kova/log.h"

std::string KOVALogConvertTime1(int64_t seconds) {
  const time_t when = static_cast<time_t>(seconds);
  struct tm local;
  char text[32] = "";
  if (localtime_r(&when, &local) != nullptr) {
    strftime(text, sizeof(text), "%Y/%m/%d %H:%M:%S", &local);
  }
  return text;
}
