// Sign-in sessions kept by the front-end, and the slowing down of repeated
// failed sign-ins.

#ifndef KOVA_HOST_SESSIONS_H_
#define KOVA_HOST_SESSIONS_H_

#include <chrono>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace kova_host {

using TimePoint = std::chrono::steady_clock::time_point;

// `bytes` random bytes from the kernel, as lower-case hex.
std::string RandomHex(size_t bytes);

struct Session {
  std::string account;
  bool admin = false;
  std::string token;     // must come with every call that relies on the cookie
  std::string language;  // the interface language of the session's calls
  TimePoint last_used;
};

class SessionStore {
 public:
  SessionStore(std::chrono::milliseconds idle_limit, size_t capacity);

  // A new session; returns its id. When the store is full, the session used
  // least recently makes room.
  std::string Create(const std::string& account, bool admin, const std::string& language,
                     TimePoint now, Session& created);
  // The session `sid`; none when it is unknown or was idle longer than the
  // limit at `now` (it is then removed).
  std::optional<Session> Find(const std::string& sid, TimePoint now);
  // Marks the session `sid` used at `now`.
  void Touch(const std::string& sid, TimePoint now);
  void Remove(const std::string& sid);

 private:
  const std::chrono::milliseconds idle_limit_;
  const size_t capacity_;
  std::mutex mutex_;
  std::map<std::string, Session> sessions_;
};

// Failed sign-ins counted per key (an account, an address). After kFreeFailures
// failures, the next attempt must wait 1 s, then 2 s, 4 s... up to kMaxWait
// after the last failure. A success clears the keys; a key with no failure
// for an hour is forgotten.
class LoginThrottle {
 public:
  static constexpr int kFreeFailures = 5;
  static constexpr std::chrono::seconds kMaxWait{300};

  // Reserves a sign-in attempt for `keys` at `now`: returns 0 and counts the
  // attempt as failed until Succeeded or Cancel says otherwise, or returns the
  // seconds to wait when any key must wait first, counting nothing. Checking and
  // counting under one lock keeps attempts sent at once from passing together.
  int Reserve(const std::vector<std::string>& keys, TimePoint now);
  // The reserved attempt succeeded: the keys start afresh.
  void Succeeded(const std::vector<std::string>& keys);
  // The reserved attempt checked no password (the accounts could not be read).
  void Cancel(const std::vector<std::string>& keys);

 private:
  struct Record {
    int failures = 0;
    TimePoint last;
  };
  static constexpr size_t kCapacity = 10000;
  long long WaitLocked(const std::vector<std::string>& keys, TimePoint now) const;
  void Forget(TimePoint now);

  std::mutex mutex_;
  std::map<std::string, Record> records_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_SESSIONS_H_
