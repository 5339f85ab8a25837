// The static folder's files for GET and HEAD: a request path is resolved
// beneath the folder only, never through ".." or a link that leads out of it.

#ifndef KOVA_HOST_STATIC_FILES_H_
#define KOVA_HOST_STATIC_FILES_H_

#include <string>
#include <string_view>

namespace kova_host {

struct StaticFile {
  std::string content;
  std::string content_type;
};

class StaticFiles {
 public:
  StaticFiles() = default;
  ~StaticFiles();
  StaticFiles(const StaticFiles&) = delete;
  StaticFiles& operator=(const StaticFiles&) = delete;

  // Opens `folder`; false when it can't be read, and then nothing is found.
  bool Open(const std::string& folder);

  // The file of the request path `raw_path` (still percent-encoded); "/" and
  // paths that end in "/" name the folder's index.html. False when there is
  // no regular file to serve there. Safe from many threads.
  bool Find(std::string_view raw_path, StaticFile& file) const;

 private:
  int OpenBeneath(const std::string& relative) const;

  int folder_ = -1;
  std::string real_folder_;  // without links, for kernels without openat2
};

}  // namespace kova_host

#endif  // KOVA_HOST_STATIC_FILES_H_
