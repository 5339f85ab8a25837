// The test platform's logs: the performance-event log as a list of lines, and
// syslog(3) captured in memory.

#include <stdarg.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>

#include "fake/fake_state.h"
#include "kova/error.h"
#include "kova/log.h"

namespace kova_fake {
namespace {

// A directory of this process for the log's file, removed when the process ends.
class LogDirectory {
 public:
  LogDirectory() {
    char pattern[] = "/tmp/kova_fake.XXXXXX";
    // Searchable by all, as a system log's directory is, so that an existence
    // test works with lowered effective ids.
    if (mkdtemp(pattern) != nullptr && chmod(pattern, 0755) == 0) path_ = pattern;
    file_ = path_ + "/perfevent.log";
  }
  ~LogDirectory() {
    if (getpid() != owner_) return;
    unlink(file_.c_str());
    rmdir(path_.c_str());
  }
  const std::string& file() const { return file_; }

 private:
  pid_t owner_ = getpid();
  std::string path_;
  std::string file_;
};

// Made when the library loads, so that a test's forked children, which end
// without destructors, share the directory of the process that removes it.
const LogDirectory gLogDirectory;

}  // namespace

const std::string& LogFilePath() { return gLogDirectory.file(); }

void SyncLogFile() {
  if (TheState().log_text) {
    std::ofstream(LogFilePath(), std::ios::app);
  } else {
    unlink(LogFilePath().c_str());
  }
}

void SetLogLines(const std::vector<std::string>& lines) {
  std::string& text = TheState().log_text.emplace();
  for (const std::string& line : lines) text.append(line).push_back('\n');
  TheState().log_records = static_cast<int>(lines.size());
  SyncLogFile();
}

void FailLogFetch(bool fail) { TheState().log_fetch_fails = fail; }

void FailLogPath(bool fail) { TheState().log_path_fails = fail; }

void FailLogClean(bool fail) { TheState().log_clean_fails = fail; }

namespace {

// Records a call on the log with the effective user id it ran under.
void RecordLogCall(const std::string& call) { Record(call + " euid=" + std::to_string(geteuid())); }

}  // namespace

}  // namespace kova_fake

using kova_fake::Record;
using kova_fake::TheState;

int KOVALogFilePathGet(int type, char* path, size_t size) {
  const std::string& file = kova_fake::LogFilePath();
  if (type != kLogTypePerfEvent || file.size() >= size || TheState().log_path_fails) return -1;
  snprintf(path, size, "%s", file.c_str());
  return 0;
}

int KOVALogGet1(int type, const char* out_path, const char* language) {
  kova_fake::RecordLogCall("KOVALogGet1 " + std::to_string(type) + " " + language);
  if (type != kLogTypePerfEvent || TheState().log_fetch_fails) return -1;
  FILE* out = fopen(out_path, "we");
  if (out == nullptr) return -1;
  const std::optional<std::string>& text = TheState().log_text;
  const size_t size = text ? text->size() : 0;
  const bool written = size == 0 || fwrite(text->data(), 1, size, out) == size;
  return fclose(out) == 0 && written ? 0 : -1;
}

int KOVALogClean(int type) {
  kova_fake::RecordLogCall("KOVALogClean " + std::to_string(type));
  if (type != kLogTypePerfEvent || TheState().log_clean_fails) return -1;
  if (TheState().log_text) TheState().log_text->clear();
  return 0;
}

int KOVALogWrite(int type, const char* level, const char* user, const char* source,
                 const char* event) {
  if (type != kLogTypePerfEvent) return -1;
  std::string& text = TheState().log_text ? *TheState().log_text : TheState().log_text.emplace();
  text += std::to_string(++TheState().log_records) + "\t" + level + "\t" +
          KOVALogConvertTime1(time(nullptr)) + "\t" + user + "\t" + source + "\t" + event + "\n";
  kova_fake::SyncLogFile();
  return 0;
}

namespace {

void CaptureSyslog(int priority, const char* format, va_list args) {
  char text[4096];
  vsnprintf(text, sizeof(text), format, args);
  TheState().syslog.push_back({priority, text});
}

}  // namespace

// syslog(3) and its fortified form, interposed on the C library's so that tests
// can read what was logged.
#pragma GCC visibility push(default)
extern "C" {

void syslog(int priority, const char* format, ...) {
  va_list args;
  va_start(args, format);
  CaptureSyslog(priority, format, args);
  va_end(args);
}

void __syslog_chk(int priority, int, const char* format, ...) {
  va_list args;
  va_start(args, format);
  CaptureSyslog(priority, format, args);
  va_end(args);
}

}  // extern "C"
#pragma GCC visibility pop
