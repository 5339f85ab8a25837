#include "host/sessions.h"

#include <sys/random.h>

#include <algorithm>
#include <stdexcept>

namespace kova_host {

std::string RandomHex(size_t bytes) {
  std::string random(bytes, '\0');
  for (size_t done = 0; done < bytes;) {
    const ssize_t got = getrandom(random.data() + done, bytes - done, 0);
    if (got < 0 && errno != EINTR) throw std::runtime_error("getrandom failed");
    if (got > 0) done += static_cast<size_t>(got);
  }
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (unsigned char byte : random) {
    hex += kDigits[byte >> 4];
    hex += kDigits[byte & 15];
  }
  return hex;
}

SessionStore::SessionStore(std::chrono::milliseconds idle_limit, size_t capacity)
    : idle_limit_(idle_limit), capacity_(capacity) {}

std::string SessionStore::Create(const std::string& account, bool admin,
                                 const std::string& language, TimePoint now, Session& created) {
  created = {account, admin, RandomHex(32), language, now};
  std::string sid = RandomHex(32);
  std::lock_guard lock(mutex_);
  std::erase_if(sessions_,
                [&](const auto& entry) { return now - entry.second.last_used > idle_limit_; });
  if (sessions_.size() >= capacity_) {
    sessions_.erase(std::min_element(sessions_.begin(), sessions_.end(), [](auto& a, auto& b) {
      return a.second.last_used < b.second.last_used;
    }));
  }
  sessions_[sid] = created;
  return sid;
}

std::optional<Session> SessionStore::Find(const std::string& sid, TimePoint now) {
  std::lock_guard lock(mutex_);
  auto it = sessions_.find(sid);
  if (it == sessions_.end()) return std::nullopt;
  if (now - it->second.last_used > idle_limit_) {
    sessions_.erase(it);
    return std::nullopt;
  }
  return it->second;
}

void SessionStore::Touch(const std::string& sid, TimePoint now) {
  std::lock_guard lock(mutex_);
  auto it = sessions_.find(sid);
  if (it != sessions_.end()) it->second.last_used = now;
}

void SessionStore::Remove(const std::string& sid) {
  std::lock_guard lock(mutex_);
  sessions_.erase(sid);
}

long long LoginThrottle::WaitLocked(const std::vector<std::string>& keys, TimePoint now) const {
  long long wait = 0;
  for (const std::string& key : keys) {
    auto it = records_.find(key);
    if (it == records_.end() || it->second.failures < kFreeFailures) continue;
    const int doublings = std::min(it->second.failures - kFreeFailures, 16);
    const auto delay =
        std::min<std::chrono::seconds>(std::chrono::seconds(1LL << doublings), kMaxWait);
    const auto left =
        std::chrono::ceil<std::chrono::seconds>(it->second.last + delay - now).count();
    wait = std::max<long long>(wait, left);
  }
  return wait;
}

int LoginThrottle::Reserve(const std::vector<std::string>& keys, TimePoint now) {
  std::lock_guard lock(mutex_);
  if (const long long wait = WaitLocked(keys, now); wait > 0) return static_cast<int>(wait);
  Forget(now);
  for (const std::string& key : keys) {
    Record& record = records_[key];
    ++record.failures;
    record.last = now;
  }
  return 0;
}

void LoginThrottle::Cancel(const std::vector<std::string>& keys) {
  std::lock_guard lock(mutex_);
  for (const std::string& key : keys) {
    auto it = records_.find(key);
    if (it != records_.end() && --it->second.failures <= 0) records_.erase(it);
  }
}

void LoginThrottle::Succeeded(const std::vector<std::string>& keys) {
  std::lock_guard lock(mutex_);
  for (const std::string& key : keys) records_.erase(key);
}

void LoginThrottle::Forget(TimePoint now) {
  std::erase_if(records_,
                [&](const auto& entry) { return now - entry.second.last > std::chrono::hours(1); });
  while (records_.size() >= kCapacity) {
    records_.erase(std::min_element(records_.begin(), records_.end(), [](auto& a, auto& b) {
      return a.second.last < b.second.last;
    }));
  }
}

}  // namespace kova_host
