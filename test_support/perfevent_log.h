// For tests: the performance-event log read back through the platform.

#ifndef KOVA_TEST_SUPPORT_PERFEVENT_LOG_H_
#define KOVA_TEST_SUPPORT_PERFEVENT_LOG_H_

#include <fstream>
#include <string>
#include <vector>

#include "kova/log.h"

namespace kova_test {

// The performance-event log's records as KOVALogGet1 prints them, without
// their ids, fetched through the file `scratch`.
inline std::vector<std::string> LogLines(const std::string& scratch) {
  std::vector<std::string> lines;
  if (KOVALogGet1(kLogTypePerfEvent, scratch.c_str(), "enu") != 0) return {"(no log)"};
  std::ifstream in(scratch);
  for (std::string line; std::getline(in, line);) lines.push_back(line.substr(line.find('\t') + 1));
  return lines;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_PERFEVENT_LOG_H_
