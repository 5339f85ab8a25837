// The statistics service's socket and the limits of its requests, shared by the
// service (kovastatd) and its clients (Transmitor, the Usage module), so that
// a request one side takes is never refused by the other.

#ifndef KOVA_STATISTICS_H_
#define KOVA_STATISTICS_H_

#include <cstddef>
#include <cstdint>
#include <string_view>

// The service's Unix socket, a system path under the system root.
inline constexpr char kStatisticsSocket[] = "/run/kova/statd.sock";

// A request line, and an answer line, at most (line feed left out).
inline constexpr size_t kStatisticsMaxRequest = size_t{64} << 10;
inline constexpr size_t kStatisticsMaxAnswer = size_t{16} << 20;

// Series ids in one request, and bytes in one id.
inline constexpr size_t kStatisticsMaxSeries = 64;
inline constexpr size_t kStatisticsMaxSeriesId = 256;

// Whether `id` can name a series: 1 to kStatisticsMaxSeriesId bytes of UTF-8
// without control characters, so that it can go back into any answer as it is.
inline bool IsSeriesId(std::string_view id) {
  if (id.empty() || id.size() > kStatisticsMaxSeriesId) return false;
  for (size_t i = 0; i < id.size();) {
    const auto byte = static_cast<unsigned char>(id[i]);
    if (byte < 0x20 || byte == 0x7f) return false;
    // A lead byte says how many continuation bytes follow; overlong forms,
    // surrogates and code points past U+10FFFF are refused.
    size_t more = 0;
    uint32_t point = byte;
    if (byte >= 0xf0 && byte <= 0xf4) {
      more = 3, point = byte & 0x07;
    } else if (byte >= 0xe0 && byte <= 0xef) {
      more = 2, point = byte & 0x0f;
    } else if (byte >= 0xc2 && byte <= 0xdf) {
      more = 1, point = byte & 0x1f;
    } else if (byte >= 0x80) {
      return false;
    }
    if (i + more >= id.size() && more > 0) return false;
    for (size_t k = 1; k <= more; ++k) {
      const auto next = static_cast<unsigned char>(id[i + k]);
      if ((next & 0xc0) != 0x80) return false;
      point = (point << 6) | (next & 0x3f);
    }
    if ((more == 2 && (point < 0x800 || (point >= 0xd800 && point <= 0xdfff))) ||
        (more == 3 && (point < 0x10000 || point > 0x10ffff))) {
      return false;
    }
    i += more + 1;
  }
  return true;
}

// Times are Unix seconds from 0 to this, far beyond any clock.
inline constexpr int64_t kStatisticsLatestTime = int64_t{1} << 40;

// Points a history answer may be reduced to, and the number when none is asked.
inline constexpr int64_t kStatisticsMaxPoints = 10000;
inline constexpr int64_t kStatisticsDefaultPoints = 600;

#endif  // KOVA_STATISTICS_H_
