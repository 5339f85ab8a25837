#include "src/privilege.h"

#include <grp.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdlib>

namespace kova {

RootScope::RootScope() : euid_(geteuid()), egid_(getegid()) {
  if (euid_ == 0 && egid_ == 0) {
    root_ = true;
    return;
  }
  uid_t ruid, euid, suid;
  if (getresuid(&ruid, &euid, &suid) != 0 || (ruid != 0 && euid != 0 && suid != 0)) return;
  // The user id goes first: as root, the process may then take any group id.
  raised_ = true;
  if (setresuid(-1, 0, -1) != 0 || setresgid(-1, 0, -1) != 0) return;
  root_ = geteuid() == 0 && getegid() == 0;
}

RootScope::~RootScope() {
  if (!raised_) return;
  // The group id goes back while the user id is still root.
  const bool restored = setresgid(-1, egid_, -1) == 0 && setresuid(-1, euid_, -1) == 0 &&
                        geteuid() == euid_ && getegid() == egid_;
  if (!restored) {
    syslog(LOG_AUTH | LOG_CRIT, "kova: cannot restore effective ids %d:%d", static_cast<int>(euid_),
           static_cast<int>(egid_));
    abort();
  }
}

bool BecomeRootForGood() {
  if (geteuid() != 0) return true;
  if (setgroups(0, nullptr) != 0 || setresgid(0, 0, 0) != 0 || setresuid(0, 0, 0) != 0) {
    return false;
  }
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
  return getresuid(&ruid, &euid, &suid) == 0 && getresgid(&rgid, &egid, &sgid) == 0 &&
         (ruid | euid | suid) == 0 && (rgid | egid | sgid) == 0;
}

}  // namespace kova
