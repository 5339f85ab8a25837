#include "host/privileges.h"

#include <errno.h>
#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

namespace kova_host {
namespace {

bool Failed(const char* call, std::string& error) {
  error = std::string(call) + ": " + strerror(errno);
  return false;
}

std::vector<gid_t> Groups() {
  gid_t some[64];
  const int few = getgroups(64, some);
  if (few >= 0) {
    std::vector<gid_t> groups(some, some + few);
    std::sort(groups.begin(), groups.end());
    return groups;
  }
  const int count = getgroups(0, nullptr);
  std::vector<gid_t> groups(count > 0 ? count : 0);
  if (count > 0 && getgroups(count, groups.data()) != count) groups.clear();
  std::sort(groups.begin(), groups.end());
  return groups;
}

std::vector<gid_t> Sorted(std::vector<gid_t> groups) {
  std::sort(groups.begin(), groups.end());
  return groups;
}

}  // namespace

bool LookUpIdentity(const std::string& name, Identity& identity, std::string& error) {
  std::vector<char> buffer(16384);
  passwd entry{};
  passwd* found = nullptr;
  errno = getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
  if (found == nullptr) {
    error = "no account " + name + " in the user database";
    return false;
  }
  if (entry.pw_uid == 0 || entry.pw_gid == 0) {
    error = "account " + name + " is root's: it can't be the unprivileged one";
    return false;
  }
  identity = {name, entry.pw_uid, entry.pw_gid, {}};
  int count = 64;
  std::vector<gid_t> groups(count);
  while (getgrouplist(name.c_str(), entry.pw_gid, groups.data(), &count) < 0) groups.resize(count);
  groups.resize(count);
  // Root's group stays out even if the database lists the account in it.
  groups.erase(std::remove(groups.begin(), groups.end(), 0), groups.end());
  identity.groups = groups;
  return true;
}

bool DropForGood(const Identity& identity, std::string& error) {
  const uid_t uid = identity.uid;
  const gid_t gid = identity.gid;
  if (setgroups(identity.groups.size(), identity.groups.data()) != 0) {
    return Failed("setgroups", error);
  }
  if (setresgid(gid, gid, gid) != 0) return Failed("setresgid", error);
  if (setresuid(uid, uid, uid) != 0) return Failed("setresuid", error);
  const IdSnapshot now = SnapshotIds();
  if (now.ruid != uid || now.euid != uid || now.suid != uid || now.rgid != gid || now.egid != gid ||
      now.sgid != gid || now.groups != Sorted(identity.groups)) {
    error = "the ids did not change as asked";
    return false;
  }
  if (setresuid(-1, 0, -1) == 0 || setresgid(-1, 0, -1) == 0 || setuid(0) == 0) {
    error = "root could be regained after dropping it";
    return false;
  }
  return true;
}

bool TakeEffectiveIds(const Identity& identity, std::string& error) {
  if (setgroups(identity.groups.size(), identity.groups.data()) != 0) {
    return Failed("setgroups", error);
  }
  if (setresgid(0, identity.gid, 0) != 0) return Failed("setresgid", error);
  if (setresuid(0, identity.uid, 0) != 0) return Failed("setresuid", error);
  const IdSnapshot now = SnapshotIds();
  if (now.ruid != 0 || now.euid != identity.uid || now.suid != 0 || now.rgid != 0 ||
      now.egid != identity.gid || now.sgid != 0 || now.groups != Sorted(identity.groups)) {
    error = "the ids did not change as asked";
    return false;
  }
  return true;
}

IdSnapshot SnapshotIds() {
  IdSnapshot ids{};
  getresuid(&ids.ruid, &ids.euid, &ids.suid);
  getresgid(&ids.rgid, &ids.egid, &ids.sgid);
  ids.groups = Groups();
  return ids;
}

bool RestoreIds(const IdSnapshot& wanted, bool& changed, std::string& error) {
  const IdSnapshot now = SnapshotIds();
  changed = !(now == wanted);
  if (!changed) return true;
  if (now.ruid != wanted.ruid || now.suid != wanted.suid || now.rgid != wanted.rgid ||
      now.sgid != wanted.sgid) {
    error = "the real or saved ids changed";
    return false;
  }
  // Root's user id first: it is what lets the group ids change.
  if (now.euid != 0 && setresuid(-1, 0, -1) != 0) return Failed("setresuid", error);
  if (now.groups != wanted.groups && setgroups(wanted.groups.size(), wanted.groups.data()) != 0) {
    return Failed("setgroups", error);
  }
  if (setresgid(-1, wanted.egid, -1) != 0) return Failed("setresgid", error);
  if (setresuid(-1, wanted.euid, -1) != 0) return Failed("setresuid", error);
  if (!(SnapshotIds() == wanted)) {
    error = "the ids did not change as asked";
    return false;
  }
  return true;
}

}  // namespace kova_host
