#include "src/privilege.h"

#include <errno.h>
#include <grp.h>
#include <pwd.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdlib>

namespace kova {
namespace {

// Whether the real, effective and saved user ids are all `uid` and the group
// ids all `gid`.
bool IdsAre(uid_t uid, gid_t gid) {
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
  return getresuid(&ruid, &euid, &suid) == 0 && getresgid(&rgid, &egid, &sgid) == 0 &&
         ruid == uid && euid == uid && suid == uid && rgid == gid && egid == gid && sgid == gid;
}

}  // namespace

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
  if (!IdsAre(0, 0)) {
    errno = EPERM;
    return false;
  }
  return true;
}

bool LookUpAccount(const std::string& name, Account& account) {
  std::vector<char> buffer(4096);
  passwd entry{};
  passwd* found = nullptr;
  int error;
  while ((error = getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found)) ==
         ERANGE) {
    buffer.resize(buffer.size() * 2);
  }
  if (found == nullptr) {
    errno = error;
    return false;
  }
  std::vector<gid_t> groups(32);
  int count = static_cast<int>(groups.size());
  // A list too short is reported with the count it needs.
  while (getgrouplist(name.c_str(), entry.pw_gid, groups.data(), &count) < 0) {
    if (count <= static_cast<int>(groups.size())) {
      errno = EIO;
      return false;
    }
    groups.resize(count);
  }
  groups.resize(count);
  account = Account{entry.pw_uid, entry.pw_gid, groups};
  return true;
}

bool BecomeAccountForGood(const Account& account) {
  if (geteuid() != 0) return true;
  const uid_t uid = account.uid;
  const gid_t gid = account.gid;
  if (setgroups(account.groups.size(), account.groups.data()) != 0 ||
      setresgid(gid, gid, gid) != 0 || setresuid(uid, uid, uid) != 0) {
    return false;
  }
  const bool groups_set = getgroups(0, nullptr) == static_cast<int>(account.groups.size());
  // Unprivileged ids must not get root back by any way.
  const bool root_regained =
      uid != 0 && (setuid(0) == 0 || seteuid(0) == 0 || (gid != 0 && setegid(0) == 0));
  if (!IdsAre(uid, gid) || !groups_set || root_regained) {
    errno = EPERM;
    return false;
  }
  return true;
}

}  // namespace kova
