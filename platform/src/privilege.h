// Raising the effective ids to root around work that changes system state.
//
// The host runs modules with unprivileged effective ids and saved ids 0. A
// platform call that writes system files or controls services raises the
// effective ids to root for just that work, when the process may, and puts the
// previous ids back before it returns, whatever happens.

#ifndef KOVA_PLATFORM_SRC_PRIVILEGE_H_
#define KOVA_PLATFORM_SRC_PRIVILEGE_H_

#include <sys/types.h>

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

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_PRIVILEGE_H_
