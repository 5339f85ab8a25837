#include "src/service_process.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <thread>

#include "src/atomic_file.h"
#include "src/privilege.h"

namespace kova {
namespace {

// What the launching children tell the parent through the pipe.
struct Message {
  char tag;  // 'P': the service's pid; 'E': the errno of a failed step
  int value;
};

void Tell(int fd, char tag, int value) {
  const Message message{tag, value};
  // A write this small into a pipe is atomic; there is no one to tell of a failure.
  [[maybe_unused]] ssize_t ignored = write(fd, &message, sizeof(message));
}

[[noreturn]] void RunService(int report, char* const* argv, char* const* env,
                             const Account* account) {
  setsid();
  const int null = open("/dev/null", O_RDWR);
  if (null < 0 || dup2(null, 0) < 0 || dup2(null, 1) < 0 || dup2(null, 2) < 0 ||
      !(account != nullptr ? BecomeAccountForGood(*account) : BecomeRootForGood())) {
    Tell(report, 'E', errno);
    _exit(127);
  }
  if (null > 2) close(null);
  // Nothing of this process but the standard streams reaches the service.
  close_range(3, ~0U, CLOSE_RANGE_CLOEXEC);
  // Ignored signals would stay ignored in the service: SIGTERM and SIGHUP must work.
  for (int number = 1; number < NSIG; ++number) signal(number, SIG_DFL);
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  execve(argv[0], argv, env);
  Tell(report, 'E', errno);
  _exit(127);
}

// Waits up to `limit` for `process` to end; true when it has.
bool AwaitEnd(const ProcessIdentity& process, std::chrono::milliseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (IsAlive(process) && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return !IsAlive(process);
}

// Sends `number` to the process group that `pid` leads, or to the process alone
// when it leads none. False with errno set when neither could be signalled.
bool SignalGroup(pid_t pid, int number) {
  return kill(-pid, number) == 0 || kill(pid, number) == 0;
}

std::vector<char*> Pointers(const std::vector<std::string>& texts) {
  std::vector<char*> out;
  for (const std::string& text : texts) out.push_back(const_cast<char*>(text.c_str()));
  out.push_back(nullptr);
  return out;
}

}  // namespace

bool ReadProcessStart(pid_t pid, unsigned long long& start_time) {
  std::string stat;
  if (pid <= 0 || !ReadWholeFile("/proc/" + std::to_string(pid) + "/stat", stat)) return false;
  // The command name may hold blanks and parentheses; the fields after it don't.
  const size_t close = stat.rfind(')');
  if (close == std::string::npos) return false;
  char state = 0;
  // Fields after the name: state (3rd) ... starttime (22nd).
  if (sscanf(stat.c_str() + close + 1,
             " %c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %*u %*u %*d %*d "
             "%*d %*d %*d %*d %llu",
             &state, &start_time) != 2) {
    return false;
  }
  return state != 'Z' && state != 'X';
}

bool IsAlive(const ProcessIdentity& process) {
  unsigned long long start_time = 0;
  return ReadProcessStart(process.pid, start_time) && start_time == process.start_time;
}

bool LaunchDetached(const std::vector<std::string>& argv, const std::vector<std::string>& env,
                    const Account* account, ProcessIdentity& started) {
  if (argv.empty() || argv[0].empty() || argv[0][0] != '/') {
    errno = EINVAL;
    return false;
  }
  std::vector<char*> args = Pointers(argv);
  std::vector<char*> environment = Pointers(env);
  int pipe_fds[2];
  if (pipe2(pipe_fds, O_CLOEXEC) != 0) return false;
  const pid_t middle = fork();
  if (middle < 0) {
    const int saved = errno;
    close(pipe_fds[0]);
    close(pipe_fds[1]);
    errno = saved;
    return false;
  }
  if (middle == 0) {
    // The middle child forks the service and ends, so that the service is no
    // child of this process and init reaps it.
    close(pipe_fds[0]);
    const pid_t service = fork();
    if (service == 0) RunService(pipe_fds[1], args.data(), environment.data(), account);
    Tell(pipe_fds[1], service < 0 ? 'E' : 'P', service < 0 ? errno : service);
    _exit(0);
  }
  close(pipe_fds[1]);
  pid_t pid = 0;
  int failure = 0;
  Message message;
  ssize_t got;
  // The pipe ends when the middle child has gone and the service has exec'd.
  while ((got = read(pipe_fds[0], &message, sizeof(message))) != 0) {
    if (got < 0 && errno == EINTR) continue;
    if (got != static_cast<ssize_t>(sizeof(message))) {
      failure = EIO;
      break;
    }
    if (message.tag == 'P') pid = message.value;
    if (message.tag == 'E') failure = message.value;
  }
  close(pipe_fds[0]);
  while (waitpid(middle, nullptr, 0) < 0 && errno == EINTR) {
  }
  if (failure == 0 && pid <= 0) failure = ECHILD;
  if (failure == 0 && !ReadProcessStart(pid, started.start_time)) failure = ESRCH;  // ended at once
  if (failure != 0) {
    errno = failure;
    return false;
  }
  started.pid = pid;
  return true;
}

bool Terminate(const ProcessIdentity& process, std::chrono::milliseconds grace, int stop_signal) {
  if (!IsAlive(process)) return true;
  const bool sent =
      stop_signal == 0 ? SignalGroup(process.pid, SIGTERM) : kill(process.pid, stop_signal) == 0;
  if (!sent) return errno == ESRCH;
  if (AwaitEnd(process, grace)) {
    // The service leads its group; its pid names the group while members are left.
    if (stop_signal != 0) kill(-process.pid, SIGKILL);
    return true;
  }
  if (!SignalGroup(process.pid, SIGKILL)) return errno == ESRCH;
  if (AwaitEnd(process, std::chrono::milliseconds(2000))) return true;
  errno = ETIMEDOUT;
  return false;
}

bool SplitCommand(const std::string& line, std::vector<std::string>& words) {
  words.clear();
  std::string word;
  bool in_word = false;
  bool quoted = false;
  for (char c : line) {
    if (c == '"') {
      quoted = !quoted;
      in_word = true;
    } else if (!quoted && (c == ' ' || c == '\t')) {
      if (in_word) words.push_back(word);
      word.clear();
      in_word = false;
    } else {
      word += c;
      in_word = true;
    }
  }
  if (in_word) words.push_back(word);
  return !quoted && !words.empty();
}

}  // namespace kova
