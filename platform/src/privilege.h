// Raising the effective ids to root around work that changes system state, and
// the ids a service's process takes for good between fork and exec.
//
// The host runs modules with unprivileged effective ids and saved ids 0. A
// platform call that writes system files or controls services raises the
// effective ids to root for just that work, when the process may, and puts the
// previous ids back before it returns, whatever happens.

#ifndef KOVA_PLATFORM_SRC_PRIVILEGE_H_
#define KOVA_PLATFORM_SRC_PRIVILEGE_H_

#include <sys/types.h>

#include <string>
#include <vector>

namespace kova {

// Raises the effective user and group ids to 0 for the life of the object. A
// process that is root already keeps its ids; one whose real and saved user ids
// are not 0 runs the work with the ids it has. The destructor restores the ids
// saved at construction and aborts the process rather than go on with ids it
// could not restore.
class RootScope {
 public:
  RootScope();
  ~RootScope();
  RootScope(const RootScope&) = delete;
  RootScope& operator=(const RootScope&) = delete;

  // Whether the work runs with effective ids 0.
  bool root() const { return root_; }

 private:
  uid_t euid_;
  gid_t egid_;
  bool raised_ = false;
  bool root_ = false;
};

// Makes the real, effective and saved ids all 0 and drops supplementary groups,
// for a child that is to run a service fully as root. Does nothing and returns
// true when the process is not root (its ids are then kept). Returns false with
// errno set when a call fails. Async-signal-safe: for use between fork and exec.
bool BecomeRootForGood();

// The ids of an account a service runs as, looked up before fork so that the
// child only has to make system calls.
struct Account {
  uid_t uid = 0;
  gid_t gid = 0;              // the primary group
  std::vector<gid_t> groups;  // every group of the account, the primary one too
};

// Looks up account `name` and its groups in the user and group databases.
// Returns true with the ids in `account`; false when there is no such account
// (errno 0) or the databases can't be read (errno set).
bool LookUpAccount(const std::string& name, Account& account);

// Gives up root for good for `account`: sets the groups, then the real,
// effective and saved group ids, then the user ids, checks every call, verifies
// the ids and that root can't be regained. Does nothing and returns true when
// the process is not root (its ids are then kept). Returns false with errno set
// (EPERM when a check doesn't hold) on failure, and the process must not go on
// to run the service. Async-signal-safe: for use between fork and exec.
bool BecomeAccountForGood(const Account& account);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_PRIVILEGE_H_
