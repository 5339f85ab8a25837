// kova: the operator's command for the platform on the system root
// ($KOVA_ROOT, "/" by default): configuration, services, logs and LUNs.

#include <errno.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "kova/conf.h"
#include "kova/error.h"
#include "kova/log.h"
#include "kova/service.h"
#include "src/conf_file.h"
#include "src/log_store.h"
#include "src/lun_registry.h"
#include "src/services.h"
#include "src/system_root.h"
#include "tools/kova_user.h"

namespace {

constexpr int kFailed = 1;
constexpr int kUsage = 2;
constexpr int kStopped = 3;  // `service status` of a service that is not running

using Args = std::vector<std::string>;

const char* ErrorText(int error) {
  switch (error) {
    case KOVA_ERR_INVALID:
      return "invalid argument";
    case KOVA_ERR_NOMEM:
      return "out of memory";
    case KOVA_ERR_IO:
      return "input/output error";
    case KOVA_ERR_PERMISSION:
      return "permission denied";
    case KOVA_ERR_NOT_FOUND:
      return "not found";
    case KOVA_ERR_FORMAT:
      return "malformed file or reply";
    case KOVA_ERR_SERVICE_UNKNOWN:
      return "no such service is described";
    case KOVA_ERR_SERVICE_FAILED:
      return "the service could not be started, stopped or signalled";
    case KOVA_ERR_CONNECT:
      return "the service could not be reached";
    case KOVA_ERR_TIMEOUT:
      return "the service did not answer in time";
    case KOVA_ERR_STORE:
      return "the store's database failed";
    case KOVA_ERR_PERFEVENT_DUPLICATE:
      return "a rule for the same object, resource and severity exists";
    default:
      return "failed";
  }
}

int Fail(const std::string& what) {
  fprintf(stderr, "kova: %s: %s\n", what.c_str(), ErrorText(QLIBCErrGet()));
  return kFailed;
}

int Usage(const char* text, bool asked) {
  fputs(text, asked ? stdout : stderr);
  return asked ? 0 : kUsage;
}

bool WantsHelp(const Args& args) {
  for (const std::string& arg : args) {
    if (arg == "--help" || arg == "-h") return true;
  }
  return false;
}

// Takes "--name VALUE" out of `args` into `value`. False when the option is
// given without a value.
bool TakeOption(Args& args, const std::string& name, std::string& value) {
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] != name) continue;
    if (i + 1 == args.size()) return false;
    value = args[i + 1];
    args.erase(args.begin() + static_cast<long>(i), args.begin() + static_cast<long>(i) + 2);
    return true;
  }
  return true;
}

bool HasUnknownOption(const Args& args) {
  for (const std::string& arg : args) {
    if (arg.size() > 1 && arg[0] == '-') {
      fprintf(stderr, "kova: unknown option %s\n", arg.c_str());
      return true;
    }
  }
  return false;
}

bool ParseNumber(const std::string& text, long long& number) {
  char* end = nullptr;
  errno = 0;
  number = strtoll(text.c_str(), &end, 10);
  return !text.empty() && *end == '\0' && errno == 0;
}

constexpr char kConfHelp[] =
    "usage: kova conf get [--file PATH] KEY\n"
    "       kova conf set [--file PATH] KEY VALUE\n"
    "Reads or writes a key of a configuration file of the system root\n"
    "(PATH is a system path, /etc/kovainfo.conf by default). `get` prints the\n"
    "value and fails when the key is absent.\n";

int Conf(Args args) {
  std::string file = kKovaInfoConf;
  if (WantsHelp(args)) return Usage(kConfHelp, true);
  if (!TakeOption(args, "--file", file) || HasUnknownOption(args) || args.empty() || file.empty() ||
      file[0] != '/') {
    return Usage(kConfHelp, false);
  }
  const std::string path = kova::RootPath(file);
  if (args[0] == "get" && args.size() == 2) {
    std::string value;
    const int found = kova::ConfRead(path, args[1], value);
    if (found < 0) return Fail("cannot read " + file);
    if (found == 0) {
      fprintf(stderr, "kova: %s has no key %s\n", file.c_str(), args[1].c_str());
      return kFailed;
    }
    printf("%s\n", value.c_str());
    return 0;
  }
  if (args[0] == "set" && args.size() == 3) {
    if (kova::ConfWrite(path, args[1], args[2]) != 0) return Fail("cannot set " + args[1]);
    return 0;
  }
  return Usage(kConfHelp, false);
}

constexpr char kServiceHelp[] =
    "usage: kova service list\n"
    "       kova service start|stop|reload|status NAME\n"
    "Services are described in /etc/kova/services/NAME.conf. `status` exits 0\n"
    "when the service runs and 3 when it doesn't.\n";

int Service(const Args& args) {
  if (WantsHelp(args)) return Usage(kServiceHelp, true);
  if (HasUnknownOption(args)) return Usage(kServiceHelp, false);
  if (args.size() == 1 && args[0] == "list") {
    for (const std::string& name : kova::ListServices()) {
      kova::ServiceDescription description;
      kova::DescribeService(name, description);
      printf("%s\t%s\t%s\n", name.c_str(),
             QLIBServiceIsRunning(name.c_str()) ? "running" : "stopped",
             description.display_name.c_str());
    }
    return 0;
  }
  if (args.size() != 2) return Usage(kServiceHelp, false);
  const std::string& verb = args[0];
  const char* name = args[1].c_str();
  if (verb == "status") {
    const bool running = QLIBServiceIsRunning(name) != 0;
    printf("%s %s\n", name, running ? "running" : "stopped");
    return running ? 0 : kStopped;
  }
  const std::map<std::string, std::function<int()>> actions = {
      {"start", [name] { return QLIBServiceStart(name, 0); }},
      {"stop", [name] { return QLIBServiceStop(name, 0); }},
      {"reload", [name] { return QLIBServiceReload(name); }},
  };
  auto action = actions.find(verb);
  if (action == actions.end()) return Usage(kServiceHelp, false);
  if (action->second() >= 0) return 0;
  // A service run as an account fails to start for want of the account or of
  // its runtime folder: say which.
  const int error = QLIBCErrGet();
  kova::ServiceDescription description;
  if (verb == "start" && kova::DescribeService(name, description) > 0 &&
      !description.user.empty()) {
    const std::string folder = kova::RuntimeFolder(name);
    struct stat info;
    if (error == KOVA_ERR_NOT_FOUND) {
      fprintf(stderr, "kova: cannot start %s: its account %s does not exist\n", name,
              description.user.c_str());
      return kFailed;
    }
    if (error == KOVA_ERR_FORMAT && lstat(kova::RootPath(folder).c_str(), &info) == 0 &&
        !S_ISDIR(info.st_mode)) {
      fprintf(stderr, "kova: cannot start %s: its runtime folder %s is %s\n", name, folder.c_str(),
              S_ISLNK(info.st_mode) ? "a symbolic link" : "no folder");
      return kFailed;
    }
  }
  KOVA_SET_ERROR(error);
  return Fail("cannot " + verb + " " + name);
}

constexpr char kLogHelp[] =
    "usage: kova log write [--type N] [--user USER] [--source SOURCE] LEVEL EVENT\n"
    "       kova log dump [--type N]\n"
    "       kova log clean [--type N]\n"
    "LEVEL is Info, Warning or Critical; the type is 18 (performance events) by\n"
    "default. `dump` prints one record a line: id, level, time, user, source and\n"
    "event, separated by tabs.\n";

std::string UserName() {
  const passwd* entry = getpwuid(getuid());
  return entry != nullptr && entry->pw_name[0] != '\0' ? entry->pw_name : "system";
}

int Log(Args args) {
  if (WantsHelp(args)) return Usage(kLogHelp, true);
  std::string type_text = std::to_string(kLogTypePerfEvent);
  std::string user = UserName();
  std::string source = "kova";
  long long type = 0;
  if (!TakeOption(args, "--type", type_text) || !TakeOption(args, "--user", user) ||
      !TakeOption(args, "--source", source) || HasUnknownOption(args) || args.empty() ||
      !ParseNumber(type_text, type) || type != static_cast<int>(type)) {
    return Usage(kLogHelp, false);
  }
  const int log_type = static_cast<int>(type);
  if (args[0] == "write" && args.size() == 3) {
    if (KOVALogWrite(log_type, args[1].c_str(), user.c_str(), source.c_str(), args[2].c_str()) !=
        0) {
      return Fail("cannot write the log record");
    }
    return 0;
  }
  if (args[0] == "dump" && args.size() == 1) {
    fflush(stdout);
    if (kova::DumpLogRecords(log_type, STDOUT_FILENO) != 0) return Fail("cannot dump the log");
    return 0;
  }
  if (args[0] == "clean" && args.size() == 1) {
    if (KOVALogClean(log_type) != 0) return Fail("cannot clean the log");
    return 0;
  }
  return Usage(kLogHelp, false);
}

constexpr char kLunHelp[] =
    "usage: kova lun add [--size-mb N] [--location PATH] UUID NAME\n"
    "       kova lun list\n"
    "       kova lun remove UUID\n"
    "Keeps the registry of iSCSI LUNs, /etc/kova/iscsi/luns.json. `list` prints\n"
    "one LUN a line: uuid, name, size in MiB and location, separated by tabs.\n";

int Lun(Args args) {
  if (WantsHelp(args)) return Usage(kLunHelp, true);
  std::string size_text = "0";
  std::string location;
  long long size = 0;
  if (!TakeOption(args, "--size-mb", size_text) || !TakeOption(args, "--location", location) ||
      HasUnknownOption(args) || args.empty() || !ParseNumber(size_text, size)) {
    return Usage(kLunHelp, false);
  }
  if (args[0] == "add" && args.size() == 3) {
    if (kova::AddLun({args[1], args[2], size, location}) != 0) return Fail("cannot add " + args[1]);
    return 0;
  }
  if (args[0] == "list" && args.size() == 1) {
    std::vector<kova::Lun> luns;
    if (kova::ReadLuns(luns) != 0) return Fail("cannot read the LUN registry");
    for (const kova::Lun& lun : luns) {
      printf("%s\t%s\t%lld\t%s\n", lun.uuid.c_str(), lun.name.c_str(),
             static_cast<long long>(lun.size_mb), lun.location.c_str());
    }
    return 0;
  }
  if (args[0] == "remove" && args.size() == 2) {
    if (kova::RemoveLun(args[1]) != 0) return Fail("cannot remove " + args[1]);
    return 0;
  }
  return Usage(kLunHelp, false);
}

constexpr char kHelp[] =
    "usage: kova conf|service|log|lun|user ... (each with --help)\n"
    "Works on the system under $KOVA_ROOT (\"/\" when unset).\n";

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return Usage(kHelp, false);
  const std::string group = argv[1];
  const Args args(argv + 2, argv + argc);
  if (group == "--help" || group == "-h" || group == "help") return Usage(kHelp, true);
  if (group == "conf") return Conf(args);
  if (group == "service") return Service(args);
  if (group == "log") return Log(args);
  if (group == "lun") return Lun(args);
  if (group == "user") return UserCommand(args);
  fprintf(stderr, "kova: unknown command %s\n", group.c_str());
  return Usage(kHelp, false);
}
