#include "api/critical_section.h"

#include <errno.h>
#include <syslog.h>
#include <unistd.h>

#include <cstring>

namespace {

constexpr int kWarning = LOG_AUTH | LOG_INFO;
constexpr int kError = LOG_AUTH | LOG_ERR;

enum class Id { kUser, kGroup };

// Sets one effective id, leaving real and saved ids alone. Logs a warning when
// it raises the id to 0 and the error line when the call fails.
bool SetEffective(Id which, unsigned id, const char* source, int line) {
  const char* name = which == Id::kUser ? "resuid" : "resgid";
  const int result = which == Id::kUser ? setresuid(-1, id, -1) : setresgid(-1, id, -1);
  if (result != 0) {
    char text[1024];
    const char* reason = strerror_r(errno, text, sizeof(text));
    syslog(kError, "%s:%d ERROR: set%s(%d, %d, %d) [%s]", source, line, name, -1,
           static_cast<int>(id), -1, reason);
    return false;
  }
  if (id == 0) syslog(kWarning, "%s:%d WARNING: set%s(%d, %d, %d)", source, line, name, -1, 0, -1);
  return true;
}

void Failed(const char* what, const char* source, int line) {
  errno = 1;
  syslog(kError, "%s:%d ERROR: %s", source, line, what);
}

}  // namespace

void ENTERCriticalSection(CriticalSection& section, const char* source, int line) {
  section = {geteuid(), getegid()};
  const bool raised = (section.egid == 0 || SetEffective(Id::kGroup, 0, source, line)) &&
                      (section.euid == 0 || SetEffective(Id::kUser, 0, source, line));
  if (!raised) return Failed("ENTERCriticalSection", source, line);
  errno = 0;
}

void LEAVECriticalSection(const CriticalSection& section, const char* source, int line) {
  const uid_t euid = geteuid();
  const gid_t egid = getegid();
  const bool user_changed = euid != section.euid;
  if (!user_changed && egid == section.egid) {
    errno = 0;
    return;
  }
  // Changing the group id needs root, so the user id goes to 0 first.
  const bool restored =
      (!user_changed || SetEffective(Id::kUser, 0, source, line)) &&
      (egid == section.egid || SetEffective(Id::kGroup, section.egid, source, line)) &&
      (!user_changed || SetEffective(Id::kUser, section.euid, source, line));
  if (!restored) return Failed("LEAVECriticalSection", source, line);
  errno = 0;
}
