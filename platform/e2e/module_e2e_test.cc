// The module KOVA.ResourceMonitor.so loaded with dlopen over the real platform
// (libkova.so, linked into this program) in a temporary system root: its
// methods write the configuration, start and stop the daemon, read the log and
// keep the rules for real. Each test runs the module in a child process with
// the host's ids: unprivileged effective ids, saved ids 0.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "kova/conf.h"
#include "kova/log.h"
#include "kova/service.h"
#include "kova/webapi.h"
#include "test_support/host_call.h"
#include "test_support/module_host.h"
#include "test_support/test_root.h"

namespace {

using kova_test::ParseJson;
using ::testing::HasSubstr;

constexpr char kSetting[] = "KOVA.ResourceMonitor.Setting";
constexpr char kLog[] = "KOVA.ResourceMonitor.Log";
constexpr char kRule[] = "KOVA.ResourceMonitor.EventRule";

// The performance-event daemon as a script: it notes its user and reloads.
constexpr char kDaemon[] = R"sh(trap 'echo reload >> "$KOVA_ROOT/daemon.log"' HUP
trap 'exit 0' TERM
echo "uid $(id -u)" >> "$KOVA_ROOT/daemon.log"
while :; do sleep 0.05; done
)sh";

// The statistics service: answers every request line with {"success": true}
// and counts the requests.
class StatisticsService {
 public:
  explicit StatisticsService(const std::string& path) {
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    EXPECT_EQ(listen(listener_, 4), 0);
    chmod(path.c_str(), 0666);
    thread_ = std::thread([this] {
      for (int fd; (fd = accept(listener_, nullptr, nullptr)) >= 0;) {
        char buffer[512];
        const ssize_t got = read(fd, buffer, sizeof(buffer));
        if (got > 0 && std::string(buffer, got) == "{\"request\":\"reload\"}\n") ++reloads_;
        constexpr char kReply[] = "{\"success\": true}\n";
        [[maybe_unused]] ssize_t ignored = write(fd, kReply, sizeof(kReply) - 1);
        close(fd);
      }
    });
  }
  ~StatisticsService() {
    shutdown(listener_, SHUT_RDWR);
    thread_.join();
    close(listener_);
  }
  int reloads() const { return reloads_; }

 private:
  int listener_;
  std::atomic<int> reloads_{0};
  std::thread thread_;
};

class ModuleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.InstallTexts(KOVA_TEXTS_DIR);
    root_.Write("/opt/kovaperfeventd.sh", kDaemon, 0755);
    root_.Write("/etc/kova/services/kovaperfeventd.conf",
                "command=\"/bin/sh " + root_.Path("/opt/kovaperfeventd.sh") +
                    "\"\ndisplay_name=\"Performance events\"\n");
    root_.Write("/etc/kova/services/pgsql.conf", "command=\"/bin/sleep 300\"\n");
    std::filesystem::create_directories(root_.Path("/volume1/@database/pgsql"));
    std::filesystem::create_directories(root_.Path("/var/services"));
    symlink("/volume1/@database/pgsql", root_.Path("/var/services/pgsql").c_str());
    chmod(root_.Path("/var/services").c_str(), 0777);  // a test removes the link as the host
    std::filesystem::create_directories(root_.Path("/run/kova"));
  }
  void TearDown() override {
    for (const char* service : {"kovaperfeventd", "pgsql"}) QLIBServiceStop(service, 0);
  }

  // Runs `body` in a child with the host's ids, over the loaded module.
  bool AsHost(const std::function<void()>& body) {
    return host_.Run(KOVA_MODULE_PATH, [&] {
      body();
      EXPECT_EQ(geteuid(), 1000u);  // every privileged step gave root back
      EXPECT_EQ(getegid(), 1000u);
    });
  }

  KOVA::APIResponse Call(const char* api, const char* method, const std::string& params = "{}",
                         const std::string& language = "enu") {
    return host_.Call(api, method, params, language);
  }

  std::string Conf(const char* key) {
    char value[1024] = "";
    return QLIBCFileGetKeyValue(kKovaInfoConf, key, value, sizeof(value), 0) > 0 ? value : "-";
  }

  kova_test::TestRoot root_;
  kova_test::ModuleHost host_;
};

TEST_F(ModuleTest, SettingsAreWrittenAndTheDaemonRuns) {
  StatisticsService statistics(root_.Path("/run/kova/statd.sock"));
  EXPECT_TRUE(AsHost([&] {
    EXPECT_EQ(Call(kSetting, "get").GetData(),
              ParseJson(R"({"duration": 15, "enable_history": false, "enable_event": false})"));

    KOVA::APIResponse set = Call(kSetting, "set", R"({"enable_event": true, "duration": 45})");
    EXPECT_EQ(set.GetState(), KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(Conf("resourcemonitor_performance_event"), "yes");
    EXPECT_EQ(Conf("resourcemonitor_realtime_max"), "30");
    EXPECT_EQ(QLIBServiceIsRunning("kovaperfeventd"), 1);

    // The database is down but its volume is there.
    KOVA::APIResponse history = Call(kSetting, "set", R"({"enable_history": true})");
    EXPECT_EQ(history.GetErrorCode(), 6104);
    EXPECT_EQ(history.GetData()["err_line"].asInt(), 143);
    ASSERT_EQ(QLIBServiceStart("pgsql", 0), 0);
    EXPECT_EQ(Call(kSetting, "set", R"({"enable_history": true})").GetState(),
              KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(Conf("resourcemonitor_history"), "yes");

    EXPECT_EQ(Call(kSetting, "get").GetData(),
              ParseJson(R"({"duration": 30, "enable_history": true, "enable_event": true})"));

    EXPECT_EQ(Call(kSetting, "set", R"({"enable_event": false})").GetState(),
              KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(QLIBServiceIsRunning("kovaperfeventd"), 0);
    EXPECT_EQ(Conf("resourcemonitor_performance_event"), "no");

    // Without the database and its volume.
    ASSERT_EQ(QLIBServiceStop("pgsql", 0), 0);
    ASSERT_EQ(unlink(root_.Path("/var/services/pgsql").c_str()), 0) << strerror(errno);
    EXPECT_EQ(Call(kSetting, "set", R"({"enable_history": true})").GetErrorCode(), 6103);
  }));
  EXPECT_EQ(statistics.reloads(), 1);
  EXPECT_EQ(root_.Read("/daemon.log"), "uid 0\n");  // the daemon ran fully as root
  struct stat info;
  ASSERT_EQ(stat(root_.Path(kKovaInfoConf).c_str(), &info), 0);
  EXPECT_EQ(info.st_uid, 0u);
}

// Waits up to three seconds for `done` to hold.
template <typename Done>
bool Eventually(Done done) {
  for (int i = 0; i < 150 && !done(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return done();
}

// Runs the kova command with `args` on the test's root.
int Kova(const std::vector<std::string>& args) {
  std::string command = KOVA_TOOL_PATH;
  for (const std::string& arg : args) command += " '" + arg + "'";
  return system(command.c_str());
}

TEST_F(ModuleTest, LogIsListedFilteredExportedAndCleared) {
  ASSERT_EQ(Kova({"log", "write", "Warning", "CPU of smb at 93%"}), 0);
  ASSERT_EQ(Kova({"log", "write", "Critical", "Memory at 99%, swapping"}), 0);
  ASSERT_EQ(Kova({"log", "write", "Warning", "I/O latency of lun-1 at 40 ms"}), 0);
  EXPECT_TRUE(AsHost([&] {
    KOVA::APIResponse all = Call(kLog, "list");
    ASSERT_EQ(all.GetState(), KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(all.GetData()["total"].asInt(), 3);
    std::vector<std::string> events;
    for (const Json::Value& entry : all.GetData()["logs"]) {
      EXPECT_EQ(entry["time"].asString().size(), 19u);
      events.push_back(entry["level"].asString() + " " + entry["event"].asString());
    }
    EXPECT_THAT(events, ::testing::UnorderedElementsAre("Warning CPU of smb at 93%",
                                                        "Critical Memory at 99%, swapping",
                                                        "Warning I/O latency of lun-1 at 40 ms"));

    KOVA::APIResponse page = Call(kLog, "list", R"({"offset": 1, "limit": 1,
                                                   "filter": {"loglevel": "Warning"}})");
    EXPECT_EQ(page.GetData()["total"].asInt(), 2);
    EXPECT_EQ(page.GetData()["logs"].size(), 1u);
    KOVA::APIResponse keyword = Call(kLog, "list", R"({"filter": {"keyword": "MEMORY"}})");
    EXPECT_EQ(keyword.GetData()["total"].asInt(), 1);
    const std::string later = std::to_string(time(nullptr) + 3600);
    KOVA::APIResponse future = Call(kLog, "list", R"({"filter": {"datefrom": )" + later + "}}");
    EXPECT_EQ(future.GetData()["total"].asInt(), 0);

    // The export writes its download to standard output.
    fflush(stdout);
    const int saved = dup(STDOUT_FILENO);
    const std::string download = root_.Path("/tmp/download");
    FILE* file = fopen(download.c_str(), "w");
    ASSERT_NE(file, nullptr);
    dup2(fileno(file), STDOUT_FILENO);
    KOVA::APIResponse exported =
        Call(kLog, "export", R"({"type": "csv", "filter": {"loglevel": "Critical"}})");
    fflush(stdout);
    dup2(saved, STDOUT_FILENO);
    fclose(file);
    EXPECT_FALSE(exported.IsOutputEnabled());
    const std::string body = root_.Read("/tmp/download");
    EXPECT_THAT(body, HasSubstr("Content-Type: text/csv\r\n"));
    EXPECT_THAT(body, HasSubstr("\r\n\r\nTime,Level,Event,\r\n"));  // the shipped English texts
    EXPECT_THAT(body, HasSubstr(",Critical,\"Memory at 99%, swapping\",\r\n"));
    EXPECT_THAT(body, ::testing::Not(HasSubstr("Warning")));

    EXPECT_EQ(Call(kLog, "clear").GetState(), KOVA::APIResponse::State::kSuccess);
    KOVA::APIResponse cleared = Call(kLog, "list");
    EXPECT_EQ(cleared.GetData()["total"].asInt(), 0);
    EXPECT_EQ(cleared.GetData()["logs"], Json::Value(Json::arrayValue));
  }));
  // The copies the module read the log through are gone.
  std::vector<std::string> left;
  for (const auto& entry : std::filesystem::directory_iterator(root_.Path("/tmp"))) {
    if (entry.path().filename() != "download") left.push_back(entry.path().filename());
  }
  EXPECT_THAT(left, ::testing::IsEmpty());
}

// The display name of each rule's object, the names of rules listed in order.
std::vector<std::string> Names(const KOVA::APIResponse& list) {
  std::vector<std::string> names;
  for (const Json::Value& rule : list.GetData()["rules"]) {
    names.push_back(rule["id"].asString() + " " + rule["name"].asString());
  }
  return names;
}

TEST_F(ModuleTest, RulesAreStoredNamedSwitchedAndDeleted) {
  root_.Write("/etc/kova/services/smb.conf",
              "command=\"/bin/sleep 300\"\ndisplay_name=\"Windows file service\"\n");
  root_.Write("/var/packages/photos/INFO", "displayname=\"Photos\"\ndisplayname_ger=\"Fotos\"\n");
  ASSERT_EQ(Kova({"lun", "add", "lun-1", "Backup LUN"}), 0);
  ASSERT_EQ(Kova({"conf", "set", "support_performance_event_internal", "yes"}), 0);
  ASSERT_EQ(QLIBServiceStart("kovaperfeventd", 0), 0);
  ASSERT_TRUE(Eventually([&] { return root_.Read("/daemon.log") == "uid 0\n"; }));
  EXPECT_TRUE(AsHost([&] {
    for (const char* rule : {
             R"({"service": "smb", "type": 1, "resource": 1, "severity": 1, "threshold": 80,
                 "enable": true})",
             R"({"service": "lun-1", "type": 2, "resource": 3, "severity": 2, "threshold": 5000,
                 "enable": false})",
             R"({"service": "pkgctl-photos", "type": 1, "resource": 2, "severity": 1,
                 "threshold": 90, "enable": true})",
         }) {
      EXPECT_EQ(Call(kRule, "set", rule).GetState(), KOVA::APIResponse::State::kSuccess) << rule;
    }
    EXPECT_EQ(Call(kRule, "set", R"({"service": "smb", "type": 1, "resource": 1, "severity": 1,
                                     "threshold": 50, "enable": true})")
                  .GetErrorCode(),
              6106);
    EXPECT_EQ(Call(kRule, "set", R"({"id": "99", "service": "smb", "type": 1, "resource": 1,
                                     "severity": 2})")
                  .GetErrorCode(),
              6107);

    KOVA::APIResponse list = Call(kRule, "list");
    EXPECT_EQ(list.GetData()["total"].asInt(), 3);
    EXPECT_EQ(list.GetData()["support_internal"].asInt(), 1);
    EXPECT_EQ(Names(list),
              (std::vector<std::string>{"1 Windows file service", "2 Backup LUN", "3 Photos"}));
    EXPECT_EQ(Names(Call(kRule, "list", R"({"offset": 2})", "ger")),
              std::vector<std::string>{"3 Fotos"});

    EXPECT_EQ(Call(kRule, "get", R"({"id": "2"})").GetData(),
              ParseJson(R"({"id": "2", "enable": false, "service": "lun-1", "name": "Backup LUN",
                            "type": 2, "severity": 2, "resource": 3, "threshold": 5000})"));
    EXPECT_EQ(Call(kRule, "onoff", R"({"id_list": [{"id": "2", "enable": true}]})").GetState(),
              KOVA::APIResponse::State::kSuccess);
    EXPECT_TRUE(Call(kRule, "get", R"({"id": "2"})").GetData()["enable"].asBool());

    EXPECT_EQ(Call(kRule, "delete", R"({"id_list": ["1", "3", "77"]})").GetState(),
              KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(Names(Call(kRule, "list")), std::vector<std::string>{"2 Backup LUN"});
    EXPECT_EQ(Call(kRule, "get", R"({"id": "1"})").GetErrorCode(), 6102);
  }));
  // Every change asked the running daemon to reload (signals in a burst may merge).
  EXPECT_TRUE(
      Eventually([&] { return root_.Read("/daemon.log").find("reload") != std::string::npos; }));
  struct stat info;
  ASSERT_EQ(stat(root_.Path("/var/lib/kova/perfevent/rules.db").c_str(), &info), 0);
  EXPECT_EQ(info.st_uid, 0u);
}

}  // namespace
