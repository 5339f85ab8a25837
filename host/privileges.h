// The host's user and group ids. Started as root, the front-end gives root up
// for good once its port is bound, and the runner keeps real and saved ids 0
// under the unprivileged account's effective ids, so that privileged sections
// can raise them and put them back.

#ifndef KOVA_HOST_PRIVILEGES_H_
#define KOVA_HOST_PRIVILEGES_H_

#include <sys/types.h>

#include <string>
#include <vector>

namespace kova_host {

// An account's ids and supplementary groups.
struct Identity {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
};

// The account `name` from the user database. False with `error` when there is
// none or it is root's.
bool LookUpIdentity(const std::string& name, Identity& identity, std::string& error);

// Sets groups, then real, effective and saved group ids, then user ids to the
// account's, verifies them, and verifies that root can't be regained.
bool DropForGood(const Identity& identity, std::string& error);

// Sets groups and the effective group and user ids to the account's; real and
// saved ids stay 0. For a process that is root.
bool TakeEffectiveIds(const Identity& identity, std::string& error);

// The ids a process has now, to compare against after a call.
struct IdSnapshot {
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
  std::vector<gid_t> groups;
  bool operator==(const IdSnapshot&) const = default;
};
IdSnapshot SnapshotIds();

// Puts effective ids and groups back to `wanted` when they differ from it;
// `changed` tells whether they did. False with `error` when they can't be put
// back or the real or saved ids changed: the process must not run another call.
bool RestoreIds(const IdSnapshot& wanted, bool& changed, std::string& error);

}  // namespace kova_host

#endif  // KOVA_HOST_PRIVILEGES_H_
