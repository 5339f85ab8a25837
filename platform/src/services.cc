// Services: descriptions, start, stop, reload and state.

#include "src/services.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "kova/error.h"
#include "kova/service.h"
#include "src/atomic_file.h"
#include "src/conf_file.h"
#include "src/privilege.h"
#include "src/service_process.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr char kServicesDir[] = "/etc/kova/services/";
constexpr char kRunDir[] = "/run/kova";
constexpr char kRuntimeParent[] = "/run";
constexpr mode_t kRuntimeFolderMode = 0750;
constexpr char kPackagesDir[] = "/var/packages/";
constexpr char kPackagePrefix[] = "pkgctl-";
constexpr int kDefaultStopTimeout = 5;  // seconds
constexpr int kMaxStopTimeout = 3600;

// The signals a description may name to stop its service.
constexpr struct {
  const char* name;
  int number;
} kStopSignals[] = {
    {"HUP", SIGHUP},   {"INT", SIGINT},   {"QUIT", SIGQUIT}, {"TERM", SIGTERM},
    {"USR1", SIGUSR1}, {"USR2", SIGUSR2}, {nullptr, 0},
};

// How a service is stopped: `signal` 0 is SIGTERM to its process group.
struct StopPolicy {
  int signal = 0;
  std::chrono::milliseconds grace{kDefaultStopTimeout * 1000};
};

std::string DescriptionPath(const std::string& name) {
  return RootPath(kServicesDir + name + ".conf");
}

std::string PidPath(const std::string& name) {
  return RootPath(std::string(kRunDir) + "/" + name + ".pid");
}

bool IsDirectory(const std::string& path) {
  struct stat info;
  return stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

// The recorded process of service `name`; false when none is recorded.
bool ReadPidFile(const std::string& name, ProcessIdentity& process) {
  std::string text;
  if (!ReadWholeFile(PidPath(name), text)) return false;
  long long pid = 0;
  return sscanf(text.c_str(), "%lld %llu", &pid, &process.start_time) == 2 && pid > 0 &&
         (process.pid = static_cast<pid_t>(pid)) == pid;
}

bool IsRunning(const std::string& name) {
  ProcessIdentity process;
  return ReadPidFile(name, process) && IsAlive(process);
}

// Reads the stop keys of `description` into `policy`. False, and `policy` left
// as it was, when a key holds something else than a known signal or a number of
// seconds in range.
bool ReadStopPolicy(const ServiceDescription& description, StopPolicy& policy) {
  StopPolicy read;
  if (!description.stop_signal.empty()) {
    std::string_view name = description.stop_signal;
    if (name.rfind("SIG", 0) == 0) name.remove_prefix(3);
    int row = 0;
    while (kStopSignals[row].name != nullptr && name != kStopSignals[row].name) ++row;
    if (kStopSignals[row].name == nullptr) return false;
    read.signal = kStopSignals[row].number;
  }
  if (!description.stop_timeout.empty()) {
    const std::string& text = description.stop_timeout;
    char* end = nullptr;
    const long seconds = strtol(text.c_str(), &end, 10);
    if (!isdigit(static_cast<unsigned char>(text[0])) || *end != '\0' || seconds < 1 ||
        seconds > kMaxStopTimeout) {
      return false;
    }
    read.grace = std::chrono::seconds(seconds);
  }
  policy = read;
  return true;
}

// The platform error for the errno of a failed file operation.
int ErrorOf(int number) {
  return number == EACCES || number == EPERM ? KOVA_ERR_PERMISSION : KOVA_ERR_IO;
}

// Opens the runtime folder of service `name`, made (mode 0700) when missing,
// without following a link, so that changes through the descriptor reach that
// folder alone. The descriptor, or -1 with the platform error in `error` and
// what went wrong in `why`.
int OpenRuntimeFolder(const std::string& name, int& error, std::string& why) {
  const int parent = open(RootPath(kRuntimeParent).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (parent < 0) {
    const int failed = errno;
    error = ErrorOf(failed);
    why = std::string("has no parent folder: ") + strerror(failed);
    return -1;
  }
  int fd = -1;
  if (mkdirat(parent, name.c_str(), 0700) != 0 && errno != EEXIST) {
    const int failed = errno;
    error = ErrorOf(failed);
    why = std::string("can't be made: ") + strerror(failed);
  } else if ((fd = openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC)) <
             0) {
    const int opened = errno;
    struct stat info;
    if (fstatat(parent, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) == 0 && !S_ISDIR(info.st_mode)) {
      error = KOVA_ERR_FORMAT;
      why = S_ISLNK(info.st_mode) ? "is a symbolic link" : "is no folder";
    } else {
      error = ErrorOf(opened);
      why = std::string("can't be opened: ") + strerror(opened);
    }
  }
  close(parent);
  return fd;
}

// Makes the runtime folder of service `name`, or takes the one there, and gives
// it to `uid`:`gid` with mode 0750. Returns 0, or the platform error, said in
// the system log: KOVA_ERR_FORMAT when the path is a symbolic link, no folder
// or the platform's own records; KOVA_ERR_PERMISSION or KOVA_ERR_IO when the
// folder can't be made or changed.
int MakeRuntimeFolder(const std::string& name, uid_t uid, gid_t gid) {
  const std::string folder = RuntimeFolder(name);
  int error = 0;
  std::string why;
  int fd = -1;
  if (folder == kRunDir) {
    error = KOVA_ERR_FORMAT;
    why = "holds the platform's records";
  } else {
    fd = OpenRuntimeFolder(name, error, why);
  }
  struct stat info;
  if (fd >= 0 &&
      (fstat(fd, &info) != 0 ||
       ((info.st_uid != uid || info.st_gid != gid) && fchown(fd, uid, gid) != 0) ||
       ((info.st_mode & 07777) != kRuntimeFolderMode && fchmod(fd, kRuntimeFolderMode) != 0))) {
    const int failed = errno;
    error = ErrorOf(failed);
    why = "can't be given to " + std::to_string(uid) + ":" + std::to_string(gid) +
          " with mode 0750: " + strerror(failed);
  }
  if (fd >= 0) close(fd);
  if (error != 0) {
    syslog(LOG_DAEMON | LOG_ERR, "kova: service %s: its runtime folder %s %s", name.c_str(),
           RootPath(folder).c_str(), why.c_str());
  }
  return error;
}

// Records `error` where it happened and fails with -1.
#define FAILED(error) (KOVA_SET_ERROR(error), -1)

// Checks the name and makes the directory of the records; the platform error
// when either fails.
int Prepare(const std::string& name) {
  if (!IsPlainName(name)) return KOVA_ERR_INVALID;
  if (!MakeDirectories(RootPath(kRunDir), 0755)) return KOVA_ERR_IO;
  return 0;
}

int Start(const std::string& name) {
  if (int error = Prepare(name)) return FAILED(error);
  FileLock lock(PidPath(name));
  if (!lock.locked()) return FAILED(KOVA_ERR_IO);
  if (IsRunning(name)) return 0;
  ServiceDescription description;
  const int known = DescribeService(name, description);
  if (known <= 0) return -1;
  std::vector<std::string> argv;
  if (description.command.empty() || !SplitCommand(description.command, argv) ||
      argv[0][0] != '/') {
    return FAILED(description.command.empty() ? KOVA_ERR_SERVICE_UNKNOWN : KOVA_ERR_FORMAT);
  }
  StopPolicy stop;
  if (!ReadStopPolicy(description, stop)) return FAILED(KOVA_ERR_FORMAT);
  Account account;
  if (!description.user.empty() && !LookUpAccount(description.user, account)) {
    const bool unknown = errno == 0 || errno == ENOENT;
    syslog(LOG_DAEMON | LOG_ERR, "kova: service %s: %s account \"%s\"", name.c_str(),
           unknown ? "no such" : "cannot look up the", description.user.c_str());
    return FAILED(unknown ? KOVA_ERR_NOT_FOUND : KOVA_ERR_IO);
  }
  if (!description.user.empty()) {
    // The folder belongs to the ids the service takes: the account's when this
    // process is root, this process's own otherwise.
    const bool root = geteuid() == 0;
    if (int error = MakeRuntimeFolder(name, root ? account.uid : geteuid(),
                                      root ? account.gid : getegid())) {
      return FAILED(error);
    }
  }
  const std::vector<std::string> env = {
      "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin", "LANG=C.UTF-8",
      "KOVA_ROOT=" + SystemRoot()};
  ProcessIdentity process;
  if (!LaunchDetached(argv, env, description.user.empty() ? nullptr : &account, process)) {
    return FAILED(KOVA_ERR_SERVICE_FAILED);
  }
  const std::string record =
      std::to_string(process.pid) + " " + std::to_string(process.start_time) + "\n";
  if (!ReplaceFile(PidPath(name), record, 0644)) {
    Terminate(process, stop.grace, stop.signal);
    return FAILED(KOVA_ERR_IO);
  }
  return 0;
}

int Stop(const std::string& name) {
  if (int error = Prepare(name)) return FAILED(error);
  FileLock lock(PidPath(name));
  if (!lock.locked()) return FAILED(KOVA_ERR_IO);
  ProcessIdentity process;
  const bool recorded = ReadPidFile(name, process);
  ServiceDescription description;
  if (!recorded && DescribeService(name, description) <= 0) return -1;
  // A service whose description is gone or broken since its start stops the usual way.
  StopPolicy stop;
  if (recorded && access(DescriptionPath(name).c_str(), F_OK) == 0 &&
      DescribeService(name, description) > 0) {
    ReadStopPolicy(description, stop);
  }
  if (recorded && !Terminate(process, stop.grace, stop.signal)) {
    return FAILED(errno == EPERM ? KOVA_ERR_PERMISSION : KOVA_ERR_SERVICE_FAILED);
  }
  if (unlink(PidPath(name).c_str()) != 0 && errno != ENOENT) return FAILED(KOVA_ERR_IO);
  return 0;
}

int Reload(const std::string& name) {
  if (!IsPlainName(name)) return FAILED(KOVA_ERR_INVALID);
  ServiceDescription description;
  if (DescribeService(name, description) <= 0) return -1;
  ProcessIdentity process;
  if (!ReadPidFile(name, process) || !IsAlive(process)) return FAILED(KOVA_ERR_SERVICE_FAILED);
  if (kill(process.pid, SIGHUP) != 0) {
    return FAILED(errno == EPERM ? KOVA_ERR_PERMISSION : KOVA_ERR_SERVICE_FAILED);
  }
  return 0;
}

}  // namespace

int DescribeService(const std::string& name, ServiceDescription& description) {
  if (!IsPlainName(name)) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return 0;
  }
  description = ServiceDescription{name, "", name, "", "", "", ""};
  const std::string path = DescriptionPath(name);
  // One read of the description for all its keys; its existence is looked at
  // only when it can't be read.
  const std::shared_ptr<const ConfKeys> keys = ConfReadAll(path);
  const int read_error = errno;
  if (keys == nullptr && access(path.c_str(), F_OK) != 0) {
    const std::string package = name.substr(std::min(name.size(), sizeof(kPackagePrefix) - 1));
    if (name.rfind(kPackagePrefix, 0) == 0 && !package.empty() &&
        IsDirectory(RootPath(kPackagesDir + package))) {
      description.package = package;
      return 1;
    }
    KOVA_SET_ERROR(KOVA_ERR_SERVICE_UNKNOWN);
    return 0;
  }
  if (keys == nullptr && read_error != ENOENT) {
    KOVA_SET_ERROR(read_error == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  for (auto [key, field] :
       {std::pair{"command", &description.command},
        std::pair{"display_name", &description.display_name},
        std::pair{"package", &description.package}, std::pair{"user", &description.user},
        std::pair{"stop_signal", &description.stop_signal},
        std::pair{"stop_timeout", &description.stop_timeout}}) {
    if (keys == nullptr) break;
    const auto it = keys->find(key);
    if (it != keys->end()) *field = it->second;
  }
  if (description.display_name.empty()) description.display_name = name;
  return 1;
}

std::string RuntimeFolder(const std::string& name) { return kRuntimeParent + ("/" + name); }

std::vector<std::string> ListServices() {
  std::vector<std::string> names;
  DIR* dir = opendir(RootPath(kServicesDir).c_str());
  if (dir == nullptr) return names;
  while (const dirent* entry = readdir(dir)) {
    std::string_view file = entry->d_name;
    constexpr std::string_view kSuffix = ".conf";
    if (file.size() > kSuffix.size() && file.substr(file.size() - kSuffix.size()) == kSuffix) {
      const std::string name(file.substr(0, file.size() - kSuffix.size()));
      if (IsPlainName(name)) names.push_back(name);
    }
  }
  closedir(dir);
  std::sort(names.begin(), names.end());
  return names;
}

std::vector<std::string> ListKnownServices() {
  std::vector<std::string> names = ListServices();
  const std::string packages = RootPath(kPackagesDir);
  DIR* dir = opendir(packages.c_str());
  if (dir == nullptr) return names;
  while (const dirent* entry = readdir(dir)) {
    const std::string name = kPackagePrefix + std::string(entry->d_name);
    const bool directory = entry->d_type == DT_DIR ||
                           (entry->d_type == DT_UNKNOWN && IsDirectory(packages + entry->d_name));
    if (directory && IsPlainName(entry->d_name) && IsPlainName(name)) names.push_back(name);
  }
  closedir(dir);
  std::sort(names.begin(), names.end());
  names.erase(std::unique(names.begin(), names.end()), names.end());
  return names;
}

std::string ServiceDisplayName(const std::string& name) {
  ServiceDescription description;
  if (DescribeService(name, description) <= 0) return name;
  if (description.package.empty() || description.display_name != name ||
      !IsPlainName(description.package)) {
    return description.display_name;
  }
  const std::string info = RootPath(kPackagesDir + description.package + "/INFO");
  std::string package_name;
  for (const char* key : {"displayname_enu", "displayname"}) {
    if (ConfRead(info, key, package_name) > 0 && !package_name.empty()) return package_name;
  }
  return description.display_name;
}

}  // namespace kova

int QLIBServiceIsRunning(const char* name) {
  return name != nullptr && kova::IsPlainName(name) && kova::IsRunning(name) ? 1 : 0;
}

int QLIBServiceStart(const char* name, int) {
  if (name == nullptr) return FAILED(KOVA_ERR_INVALID);
  kova::RootScope root;
  return kova::Start(name);
}

int QLIBServiceStop(const char* name, int) {
  if (name == nullptr) return FAILED(KOVA_ERR_INVALID);
  kova::RootScope root;
  return kova::Stop(name);
}

int QLIBServiceReload(const char* name) {
  if (name == nullptr) return FAILED(KOVA_ERR_INVALID);
  kova::RootScope root;
  return kova::Reload(name) == 0 ? 0 : -1;
}

int QLIBServicecfgDisplayNameGet(const char* name, char* display, size_t size) {
  if (name == nullptr || display == nullptr || size == 0) return FAILED(KOVA_ERR_INVALID);
  kova::ServiceDescription description;
  if (kova::DescribeService(name, description) <= 0) return -1;
  if (description.display_name.size() >= size) return FAILED(KOVA_ERR_INVALID);
  memcpy(display, description.display_name.c_str(), description.display_name.size() + 1);
  return 0;
}
