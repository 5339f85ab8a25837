// Folders that the monitor mounts over a runner's view of the system's
// temporary folder, so that the temporary files of a call that was killed go
// with its runner and touch no one else's.

#ifndef KOVA_HOST_PRIVATE_TMP_H_
#define KOVA_HOST_PRIVATE_TMP_H_

#include <string>

namespace kova_host {

// Makes `tmp`/kova-webapid-XXXXXX (mode 0700) holding "tmp" (mode 1777, like
// /tmp itself). On success sets `root` to the outer folder and returns the
// inner one; on failure returns "" with `error`.
std::string MakePrivateTmp(const std::string& tmp, std::string& root, std::string& error);

// Removes `root` and everything in it without following symbolic links, so
// nothing outside it is touched. False when something stays.
bool RemovePrivateTmp(const std::string& root);

}  // namespace kova_host

#endif  // KOVA_HOST_PRIVATE_TMP_H_
