#include "statd/volume_probe.h"

#include <algorithm>
#include <condition_variable>
#include <mutex>
#include <system_error>
#include <thread>

namespace statd {

struct VolumeProbe::Shared {
  std::mutex mutex;
  std::condition_variable wake;  // a call was asked for, or a thread told to end
  std::condition_variable done;  // a call returned
};

// A volume and its thread; what follows the thread is under Shared::mutex.
struct VolumeProbe::Volume {
  std::string path;
  std::thread thread;
  bool requested = false;  // a call is asked for and not yet begun
  bool busy = false;       // in a call
  bool stop = false;       // the thread is to end
  bool answered = false;   // the call asked for last has returned
  std::optional<VolumeSpace> space;
};

namespace {

VolumeSpace SpaceOf(const struct statvfs& info) {
  const uint64_t unit = info.f_frsize != 0 ? info.f_frsize : info.f_bsize;
  const uint64_t blocks = info.f_blocks;
  return VolumeSpace{blocks * unit, (blocks - std::min<uint64_t>(info.f_bfree, blocks)) * unit,
                     static_cast<uint64_t>(info.f_bavail) * unit};
}

}  // namespace

VolumeProbe::VolumeProbe(StatVfs statvfs)
    : statvfs_(statvfs ? std::move(statvfs) : StatVfs(::statvfs)),
      shared_(std::make_shared<Shared>()) {}

VolumeProbe::~VolumeProbe() {
  std::vector<std::pair<std::shared_ptr<Volume>, bool>> ending;
  {
    std::lock_guard<std::mutex> lock(shared_->mutex);
    for (auto& [path, volume] : volumes_) {
      volume->stop = true;
      ending.emplace_back(volume, volume->busy);
    }
  }
  shared_->wake.notify_all();
  for (auto& [volume, busy] : ending) End(*volume, busy);
}

void VolumeProbe::Serve(std::shared_ptr<Shared> shared, std::shared_ptr<Volume> volume,
                        StatVfs call) {
  std::unique_lock<std::mutex> lock(shared->mutex);
  for (;;) {
    shared->wake.wait(lock, [&] { return volume->stop || volume->requested; });
    if (volume->stop) return;
    volume->requested = false;
    volume->busy = true;
    const std::string path = volume->path;
    lock.unlock();
    struct statvfs info {};
    const bool read = call(path.c_str(), &info) == 0;
    lock.lock();
    volume->busy = false;
    volume->answered = true;
    volume->space = read ? std::optional<VolumeSpace>(SpaceOf(info)) : std::nullopt;
    shared->done.notify_all();
  }
}

void VolumeProbe::End(Volume& volume, bool busy) {
  if (!volume.thread.joinable()) return;
  if (busy) {
    volume.thread.detach();
  } else {
    volume.thread.join();
  }
}

void VolumeProbe::Start(const std::vector<std::string>& paths) {
  std::vector<std::pair<std::shared_ptr<Volume>, bool>> ending;
  {
    std::lock_guard<std::mutex> lock(shared_->mutex);
    for (auto it = volumes_.begin(); it != volumes_.end();) {
      if (std::find(paths.begin(), paths.end(), it->first) != paths.end()) {
        ++it;
        continue;
      }
      it->second->stop = true;
      ending.emplace_back(it->second, it->second->busy);
      it = volumes_.erase(it);
    }
    asked_.clear();
    for (const std::string& path : paths) {
      std::shared_ptr<Volume>& volume = volumes_[path];
      if (volume == nullptr) {
        volume = std::make_shared<Volume>();
        volume->path = path;
        try {
          volume->thread = std::thread(Serve, shared_, volume, statvfs_);
        } catch (const std::system_error&) {  // no thread now: tried again next time
          volumes_.erase(path);
          asked_.push_back(nullptr);
          continue;
        }
      }
      if (volume->busy || volume->requested) {  // the call before is still out
        asked_.push_back(nullptr);
        continue;
      }
      volume->requested = true;
      volume->answered = false;
      volume->space.reset();
      asked_.push_back(volume);
    }
  }
  shared_->wake.notify_all();
  for (auto& [volume, busy] : ending) End(*volume, busy);
}

std::vector<std::optional<VolumeSpace>> VolumeProbe::Collect(
    std::chrono::steady_clock::time_point deadline) {
  std::unique_lock<std::mutex> lock(shared_->mutex);
  shared_->done.wait_until(lock, deadline, [&] {
    return std::all_of(asked_.begin(), asked_.end(),
                       [](const std::shared_ptr<Volume>& v) { return !v || v->answered; });
  });
  std::vector<std::optional<VolumeSpace>> spaces;
  spaces.reserve(asked_.size());
  for (const std::shared_ptr<Volume>& volume : asked_) {
    spaces.push_back(volume && volume->answered ? volume->space : std::nullopt);
  }
  return spaces;
}

}  // namespace statd
