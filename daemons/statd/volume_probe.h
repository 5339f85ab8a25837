// The space of volumes, read with statvfs on helper threads, one per volume:
// a hung mount holds only its own thread, never the cycle that asked, and a
// volume whose call hasn't returned gets no second one.

#ifndef KOVA_DAEMONS_STATD_VOLUME_PROBE_H_
#define KOVA_DAEMONS_STATD_VOLUME_PROBE_H_

#include <sys/statvfs.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace statd {

// statvfs(2), or a stand-in with its form.
using StatVfs = std::function<int(const char* path, struct statvfs* out)>;

// A volume's space in bytes, as df(1) counts it: used is what is taken,
// free what an unprivileged user can still take, so that used + free falls
// short of size by the blocks kept for root.
struct VolumeSpace {
  uint64_t size = 0;
  uint64_t used = 0;
  uint64_t free = 0;
};

class VolumeProbe {
 public:
  explicit VolumeProbe(StatVfs statvfs);
  // Ends the threads; one held in a call is left to end when the call returns.
  ~VolumeProbe();
  VolumeProbe(const VolumeProbe&) = delete;
  VolumeProbe& operator=(const VolumeProbe&) = delete;

  // Starts a call on each of the real paths `paths` whose call before has
  // returned. The threads of volumes no longer given end.
  void Start(const std::vector<std::string>& paths);

  // The space of each path of the last Start, in its order, after waiting
  // until `deadline` at most for the calls started: nullopt for a call that
  // failed or hasn't returned, and for a path skipped because its call before
  // still hadn't.
  std::vector<std::optional<VolumeSpace>> Collect(std::chrono::steady_clock::time_point deadline);

 private:
  struct Shared;
  struct Volume;

  // The loop of a volume's thread: a call each time one is asked, until told to end.
  static void Serve(std::shared_ptr<Shared> shared, std::shared_ptr<Volume> volume, StatVfs call);
  // Ends the thread of `volume`, told to end already: joined when idle, left
  // to end alone when held in a call. Called without the lock.
  static void End(Volume& volume, bool busy);

  StatVfs statvfs_;
  std::shared_ptr<Shared> shared_;
  std::map<std::string, std::shared_ptr<Volume>> volumes_;
  std::vector<std::shared_ptr<Volume>> asked_;  // the last Start's, in its order; null when skipped
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_VOLUME_PROBE_H_
