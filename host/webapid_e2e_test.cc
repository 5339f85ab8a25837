// kova-webapid started for real on a free port over a temporary system root,
// called over HTTP like a browser would.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "host/testdata/pattern.h"
#include "test_support/daemon_service.h"
#include "test_support/host_call.h"
#include "test_support/raw_http.h"
#include "test_support/test_root.h"
#include "test_support/webapid.h"

namespace {

using kova_test::Code;
using kova_test::Form;
using kova_test::ParseJson;
using kova_test::Reply;
using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr char kAdminPassword[] = "admin pw: 5ecret!";
constexpr char kGuestPassword[] = "guest-pw";

// The performance-event daemon as a script that only waits.
constexpr char kDaemon[] = "trap 'exit 0' TERM\nwhile :; do sleep 0.05; done\n";

class WebApidTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.InstallTexts(KOVA_TEXTS_DIR);
    root_.Write("/opt/kovaperfeventd.sh", kDaemon, 0755);
    root_.Write("/etc/kova/services/kovaperfeventd.conf",
                "command=\"/bin/sh " + root_.Path("/opt/kovaperfeventd.sh") + "\"\n");
    root_.Write("/etc/kova/services/pkgctl-MediaServer.conf", "command=\"/bin/sleep 300\"\n");
    root_.Write("/var/packages/MediaServer/INFO",
                "displayname=\"Media Server\"\ndisplayname_ger=\"Medienserver\"\n");
    root_.Write("/etc/kovainfo.conf", "support_performance_event_internal=\"yes\"\n");
    std::filesystem::create_directories(root_.Path("/modules"));
    std::filesystem::create_directories(root_.Path("/run/kova"));
    AddModule(KOVA_MODULE_PATH);
    Kova("user add admin --admin", kAdminPassword);
    Kova("user add guest", kGuestPassword);
    Kova("lun add --size-mb 2048 lun-uuid-1 'Backup LUN'");
    Kova("log write Warning 'CPU of smb at 93%'");
    Kova("log write Critical 'Memory at 99%, swapping'");
  }
  void TearDown() override {
    host_.reset();
    Kova("service stop kovaperfeventd");
    if (std::filesystem::exists(root_.Path("/etc/kova/services/burner.conf"))) {
      Kova("service stop burner");
    }
  }

  void AddModule(const std::string& path) {
    std::filesystem::create_symlink(
        path, root_.Path("/modules/") + std::filesystem::path(path).filename().string());
  }

  void Kova(const std::string& args, const std::string& input = "") {
    ASSERT_NE(kova_test::RunKova(KOVA_TOOL_PATH, args, input), -1);
  }

  void Start(const std::vector<std::string>& args = {}) {
    std::vector<std::string> all = {"--modules", root_.Path("/modules"), "--static", KOVA_WWW_DIR};
    all.insert(all.end(), args.begin(), args.end());
    host_ = std::make_unique<kova_test::WebApid>(KOVA_WEBAPID_PATH, root_.path(), all);
  }

  Reply Send(const std::string& method, const std::string& form, const httplib::Headers& headers) {
    return host_->Send(method, form, headers);
  }
  Reply Call(const std::string& api, const std::string& method, kova_test::Params params = {},
             const std::string& sid = "", const httplib::Headers& headers = {}) {
    return host_->Call(api, method, std::move(params), sid, headers);
  }
  Reply SignIn(const std::string& account, const std::string& password) {
    return host_->SignIn(account, password);
  }
  std::string Sid(const std::string& account, const std::string& password) {
    return host_->Sid(account, password);
  }

  // The host started with the test module, signed in, and the descriptors its
  // front-end and the module's runner hold once the calls' connections closed.
  struct Idle {
    std::string sid;
    pid_t runner = -1;
    pid_t front_end = -1;
    size_t front_fds = 0;
    size_t runner_fds = 0;
  };
  Idle StartWithTestModule(const std::vector<std::string>& args = {});

  kova_test::TestRoot root_;
  std::unique_ptr<kova_test::WebApid> host_;
};

constexpr char kSetting[] = "KOVA.ResourceMonitor.Setting";
constexpr char kLog[] = "KOVA.ResourceMonitor.Log";
constexpr char kRule[] = "KOVA.ResourceMonitor.EventRule";

TEST_F(WebApidTest, ServesEveryMethodOfTheModule) {
  Start();
  const Reply info = Call("KOVA.API.Info", "query");  // no sign-in needed
  EXPECT_THAT(info.body, HasSubstr(R"({"admin":true,"api":"KOVA.ResourceMonitor.EventRule",)"
                                   R"("versions":[{"methods":["delete","get","list","onoff",)"
                                   R"("set"],"version":1}]})"));
  EXPECT_THAT(info.body, HasSubstr(R"("api":"KOVA.Core.ISCSI.LUN")"));

  const std::string sid = Sid("admin", kAdminPassword);
  ASSERT_FALSE(sid.empty());
  EXPECT_EQ(Call(kSetting, "get", {}, sid).json,
            ParseJson(R"({"success": true, "data": {"duration": 15, "enable_history": false,
                                                     "enable_event": false}})"));
  // "45" and "true" arrive as JSON values; "yes" stays text, which the module refuses.
  EXPECT_EQ(Call(kSetting, "set", {{"duration", "45"}, {"enable_event", "true"}}, sid).json,
            ParseJson(R"({"success": true})"));
  EXPECT_FALSE(Call(kSetting, "set", {{"enable_event", "yes"}}, sid).json["success"].asBool());
  EXPECT_EQ(Call(kSetting, "get", {}, sid).json["data"]["enable_event"], true);

  const Reply warnings =
      Call(kLog, "list", {{"filter", R"({"loglevel":"Warning"})"}, {"limit", "10"}}, sid);
  EXPECT_EQ(warnings.json["data"]["total"], 1);
  EXPECT_EQ(warnings.json["data"]["logs"][0]["event"], "CPU of smb at 93%");

  const Reply exported = Send(
      "GET",
      Form({{"api", kLog}, {"version", "1"}, {"method", "export"}, {"type", "csv"}, {"_sid", sid}}),
      {});
  EXPECT_EQ(exported.status, 200);
  EXPECT_EQ(exported.headers.find("Content-Type")->second, "text/csv");
  EXPECT_THAT(exported.headers.find("Content-Disposition")->second,
              ::testing::MatchesRegex(R"(attachment; filename="ResourceMonitor-.*\.csv")"));
  EXPECT_THAT(exported.body, ::testing::StartsWith("Time,Level,Event,\r\n"));
  EXPECT_EQ(Call(kLog, "clear", {}, sid).json, ParseJson(R"({"success": true})"));
  EXPECT_EQ(Call(kLog, "list", {}, sid).json["data"]["total"], 0);

  const std::vector<std::pair<std::string, std::string>> rule = {
      {"type", "2"},     {"service", "lun-uuid-1"}, {"severity", "1"},
      {"resource", "3"}, {"threshold", "80"},       {"enable", "true"}};
  EXPECT_EQ(Call(kRule, "set", rule, sid).json, ParseJson(R"({"success": true})"));
  const Reply rules = Call(kRule, "list", {}, sid);
  ASSERT_EQ(rules.json["data"]["total"], 1) << rules.body;
  const std::string id = rules.json["data"]["rules"][0]["id"].asString();
  // Ids are text: id=1 arrives as a number, which reads as its digits, and
  // id="1" as the text.
  EXPECT_EQ(Call(kRule, "get", {{"id", id}}, sid).json["data"]["threshold"], 80);
  EXPECT_EQ(Call(kRule, "get", {{"id", "\"" + id + "\""}}, sid).json["data"]["threshold"], 80);
  EXPECT_EQ(Call(kRule, "onoff", {{"id_list", R"([{"id":")" + id + R"(","enable":false}])"}}, sid)
                .json["success"],
            true);
  EXPECT_EQ(Call(kRule, "get", {{"id", "\"" + id + "\""}}, sid).json["data"]["enable"], false);
  EXPECT_EQ(Code(Call(kRule, "delete", {{"id_list", id}}, sid)), 101);  // a number, no list
  EXPECT_EQ(Call(kRule, "delete", {{"id_list", R"([")" + id + R"("])"}}, sid).json["success"],
            true);
  EXPECT_EQ(Call(kRule, "list", {}, sid).json["data"]["total"], 0);

  // The web app, under a policy that lets it load only from the host.
  httplib::Client client("127.0.0.1", host_->port());
  const httplib::Result page = client.Get("/");
  EXPECT_THAT(page->body, HasSubstr("KOVA Resource Monitor"));
  EXPECT_THAT(page->get_header_value("Content-Security-Policy"),
              AllOf(HasSubstr("default-src 'none'"), HasSubstr("script-src 'self'"),
                    Not(HasSubstr("unsafe-inline"))));
  EXPECT_EQ(client.Get("/js/app.js")->get_header_value("Content-Type"),
            "text/javascript; charset=utf-8");
  EXPECT_EQ(client.Get("/favicon.svg")->status, 200);

  const std::string log = host_->Log();
  EXPECT_THAT(log, HasSubstr("POST /webapi/entry.cgi 200 api=KOVA.ResourceMonitor.Setting "
                             "method=set user=admin code=0 ms="));
  EXPECT_THAT(log, Not(HasSubstr(sid)));
  EXPECT_THAT(log, Not(HasSubstr("5ecret")));
}

TEST_F(WebApidTest, ARuleMadeOverHttpRaisesAWarningFromTheRealDaemon) {
  // The real daemon as the service, on the live /proc, a cycle every 250 ms:
  // its 30 s window takes 1.5 s, with enough clock ticks for a CPU share to show.
  ASSERT_TRUE(kova_test::InstallDaemonService(KOVA_INSTALL_SERVICE, root_.path(), "kovaperfeventd",
                                              KOVAPERFEVENTD_PATH, "--time-scale 0.05",
                                              root_.Path("/daemon.err")));
  root_.Write("/etc/kova/services/burner.conf",
              "command=\"/bin/sh -c \"while :; do :; done\"\"\ndisplay_name=\"Burner\"\n");
  Kova("service start burner");
  Start();
  const std::string sid = Sid("admin", kAdminPassword);
  ASSERT_FALSE(sid.empty());
  // The rule comes first, so the daemon reads it at its start.
  ASSERT_EQ(Call(kRule, "set",
                 {{"type", "1"},
                  {"service", "burner"},
                  {"severity", "1"},
                  {"resource", "1"},
                  {"threshold", "2"},
                  {"enable", "true"}},
                 sid)
                .json,
            ParseJson(R"({"success": true})"));
  ASSERT_EQ(Call(kSetting, "set", {{"enable_event", "true"}}, sid).json,
            ParseJson(R"({"success": true})"));

  const std::string expected = "CPU use of service \"Burner\" has been above 2% for 30 seconds";
  const auto raised = [&](const char* level) {
    const Reply reply =
        Call(kLog, "list", {{"filter", std::string(R"({"loglevel":")") + level + "\"}"}}, sid);
    for (const Json::Value& entry : reply.json["data"]["logs"]) {
      if (entry["event"].asString().rfind(expected, 0) == 0) return true;
    }
    return false;
  };
  // Polled up to a deadline, for a machine under load.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  bool found = raised("Warning");
  while (!found && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    found = raised("Warning");
  }
  EXPECT_TRUE(found) << "the daemon's log:\n" << root_.Read("/daemon.err");
  EXPECT_FALSE(raised("Critical"));  // the rule's severity sets the level
}

const std::vector<std::pair<std::string, std::string>> kMethods = {
    {kSetting, "set"}, {kSetting, "get"}, {kLog, "list"}, {kLog, "clear"},   {kLog, "export"},
    {kRule, "list"},   {kRule, "get"},    {kRule, "set"}, {kRule, "delete"}, {kRule, "onoff"},
};

TEST_F(WebApidTest, EveryMethodNeedsASignedInAdministrator) {
  Start({"--idle-timeout", "2"});
  const std::string expired = Sid("admin", kAdminPassword);
  std::this_thread::sleep_for(std::chrono::milliseconds(2200));
  const Reply wrong = SignIn("admin", "not the password");
  EXPECT_EQ(Code(wrong), 108);
  EXPECT_FALSE(wrong.json["data"].isMember("sid"));

  const Reply admin = SignIn("admin", kAdminPassword);
  const std::string cookie = "kova_sid=" + admin.json["data"]["sid"].asString();
  const std::string token = admin.json["data"]["token"].asString();
  EXPECT_EQ(admin.headers.find("Set-Cookie")->second,
            cookie + "; Path=/; HttpOnly; SameSite=Strict");
  const std::string guest = Sid("guest", kGuestPassword);

  const struct {
    const char* what;
    std::string sid;
    httplib::Headers headers;
    int code;
  } cases[] = {
      {"no session", "", {}, 106},
      {"an unknown session", "0123abcd", {}, 106},
      {"the cookie without its token", "", {{"Cookie", cookie}}, 107},
      {"the cookie with a wrong token",
       "",
       {{"Cookie", cookie}, {"X-KOVA-Token", "x" + token}},
       107},
      {"the cookie cut by an encoded NUL",
       "",
       {{"Cookie", cookie + "%00junk"}, {"X-KOVA-Token", token}},
       106},
      {"an expired session", expired, {}, 106},
      {"a user who is no administrator", guest, {}, 105},
  };
  for (const auto& c : cases) {
    for (const auto& [api, method] : kMethods) {
      EXPECT_EQ(Code(Call(api, method, {}, c.sid, c.headers)), c.code)
          << c.what << ": " << api << " " << method;
    }
  }
  // The cookie with its token, as header or parameter, passes.
  EXPECT_TRUE(Call(kSetting, "get", {}, "", {{"Cookie", cookie}, {"X-KOVA-Token", token}})
                  .json["success"]
                  .asBool());
  EXPECT_TRUE(Call(kSetting, "get", {{"_token", token}}, "", {{"Cookie", cookie}})
                  .json["success"]
                  .asBool());
  const Reply out =
      Call("KOVA.API.Auth", "logout", {}, "", {{"Cookie", cookie}, {"X-KOVA-Token", token}});
  EXPECT_TRUE(out.json["success"].asBool());
  EXPECT_THAT(out.headers.find("Set-Cookie")->second, HasSubstr("Max-Age=0"));
  EXPECT_EQ(Code(Call(kSetting, "get", {}, "", {{"Cookie", cookie}, {"X-KOVA-Token", token}})),
            106);
}

TEST_F(WebApidTest, RepeatedFailedSignInsAreSlowedDown) {
  Start();
  // Sent at once, wrong passwords get five checks, and one more for each wait
  // (1 s, then 2 s, 4 s...) that runs out while the burst is still answered.
  std::atomic<int> checked = 0;
  std::vector<std::thread> guesses;
  const auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < 16; ++i) {
    guesses.emplace_back(
        [&, i] { checked += Code(SignIn("admin", "guess " + std::to_string(i))) == 108; });
  }
  for (std::thread& guess : guesses) guess.join();
  const auto took = std::chrono::steady_clock::now() - start;
  int allowed = 5;
  for (auto wait = std::chrono::seconds(1), end = wait; end <= took; wait *= 2, end += wait) {
    ++allowed;
  }
  EXPECT_GE(checked, 5);
  EXPECT_LE(checked, allowed);
  const Reply throttled = SignIn("admin", kAdminPassword);
  EXPECT_EQ(Code(throttled), 109);
  EXPECT_GE(throttled.json["error"]["errors"]["retry_after"].asInt(), 1);
  EXPECT_EQ(throttled.headers.find("Retry-After")->second,
            throttled.json["error"]["errors"]["retry_after"].asString());
  std::this_thread::sleep_for(
      std::chrono::seconds(throttled.json["error"]["errors"]["retry_after"].asInt()) +
      std::chrono::milliseconds(100));
  EXPECT_TRUE(SignIn("admin", kAdminPassword).json["success"].asBool());
}

TEST_F(WebApidTest, AModuleThatCrashesOrHangsDoesNotTakeTheHostDown) {
  AddModule(KOVA_CRASH_MODULE_PATH);
  Start({"--call-timeout", "1"});
  const std::string sid = Sid("admin", kAdminPassword);
  const auto pid = [&] { return Call("KOVA.Test.Crash", "echo", {}, sid).json["data"]["pid"]; };
  const Json::Value first = pid();
  ASSERT_TRUE(first.isInt());

  // Calls that wait behind the one that crashes are answered by a fresh runner.
  std::thread crash([&] {
    EXPECT_EQ(Code(Call("KOVA.Test.Crash", "abort", {{"delay_ms", "300"}}, sid)), 100);
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  std::vector<std::thread> waiting;
  for (int i = 0; i < 3; ++i) {
    waiting.emplace_back(
        [&] { EXPECT_TRUE(Call("KOVA.Test.Crash", "echo", {}, sid).json["success"].asBool()); });
  }
  crash.join();
  for (std::thread& thread : waiting) thread.join();
  const Json::Value second = pid();
  EXPECT_NE(second, first);  // a fresh runner

  const auto start = std::chrono::steady_clock::now();
  const Reply late = Call("KOVA.Test.Crash", "sleep", {{"seconds", "30"}}, sid);
  EXPECT_EQ(Code(late), 100);
  EXPECT_THAT(late.json["error"]["errors"]["reason"].asString(), HasSubstr("time limit"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  EXPECT_NE(pid(), second);

  const Reply raw = Call("KOVA.Test.Crash", "raw", {}, sid);
  EXPECT_EQ(raw.status, 202);
  EXPECT_EQ(raw.body, "hello\n");
  EXPECT_EQ(raw.headers.find("X-Test")->second, "yes");
  EXPECT_EQ(raw.headers.find("Content-Type")->second, "text/plain");
  const struct {
    const char* method;
    int code;
  } failures[] = {{"garbage", 100}, {"throw", 100}, {"refused", 105}};
  for (const auto& c : failures) {
    EXPECT_EQ(Code(Call("KOVA.Test.Crash", c.method, {}, sid)), c.code) << c.method;
  }

  // Parameters reach the handler decoded, without the host's own.
  const Reply echo = Call("KOVA.Test.Crash", "echo", {{"value", R"({"a":[1,"b"]})"}}, sid);
  EXPECT_EQ(echo.json["data"]["value"], ParseJson(R"({"a": [1, "b"]})"));
  EXPECT_EQ(echo.json["data"]["user"], "admin");
  EXPECT_EQ(echo.json["data"]["has_sid"], false);
  EXPECT_EQ(echo.json["data"]["language"], "enu");
  const Reply german =
      Call("KOVA.API.Auth", "login", {{"account", "admin"}, {"password", kAdminPassword}}, "",
           {{"Accept-Language", "de-DE,de;q=0.9,en;q=0.5"}});
  EXPECT_EQ(Call("KOVA.Test.Crash", "echo", {}, german.json["data"]["sid"].asString())
                .json["data"]["language"],
            "ger");
  EXPECT_EQ(Call("KOVA.Test.Crash", "echo", {{"value", "csv"}}, sid).json["data"]["value"], "csv");
  EXPECT_THAT(host_->Log(), HasSubstr("killed by signal 6"));
}

// The number of descriptors process `pid` holds open.
size_t OpenDescriptors(pid_t pid) {
  std::error_code error;
  size_t count = 0;
  for (std::filesystem::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", error), end;
       !error && it != end; it.increment(error)) {
    ++count;
  }
  return count;
}

// The descriptors `pid` holds once they are `want` again, or after `wait`.
size_t SettledDescriptors(pid_t pid, size_t want,
                          std::chrono::milliseconds wait = std::chrono::seconds(5)) {
  const auto deadline = std::chrono::steady_clock::now() + wait;
  size_t count = OpenDescriptors(pid);
  while (count != want && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    count = OpenDescriptors(pid);
  }
  return count;
}

// The front-end: the monitor's child started first, before any runner.
pid_t FrontEnd(pid_t monitor) {
  std::pair<unsigned long long, pid_t> first{~0ULL, -1};  // start time, pid
  for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
    const std::string name = entry.path().filename().string();
    if (name.find_first_not_of("0123456789") != std::string::npos) continue;
    std::ifstream in(entry.path() / "stat");
    const std::string stat(std::istreambuf_iterator<char>(in), {});
    const size_t end = stat.rfind(')');
    if (end == std::string::npos) continue;
    // Past the name: state (field 3), parent (4), ..., start time (22).
    std::istringstream fields(stat.substr(end + 1));
    std::string field;
    long parent = 0;
    unsigned long long start = 0;
    fields >> field >> parent;
    for (int i = 5; i < 22; ++i) fields >> field;
    fields >> start;
    if (parent == monitor) first = std::min(first, {start, static_cast<pid_t>(std::stoi(name))});
  }
  return first.second;
}

// Where `body` first differs from the test module's pattern; its size when nowhere.
size_t FirstDifference(const std::string& body) {
  for (size_t i = 0; i < body.size(); ++i) {
    if (body[i] != kova_test::PatternByte(i)) return i;
  }
  return body.size();
}

std::string BigForm(uint64_t size, const std::string& sid) {
  return Form({{"api", "KOVA.Test.Crash"},
               {"version", "1"},
               {"method", "big"},
               {"size", std::to_string(size)},
               {"_sid", sid}});
}

WebApidTest::Idle WebApidTest::StartWithTestModule(const std::vector<std::string>& args) {
  AddModule(KOVA_CRASH_MODULE_PATH);
  Start(args);
  Idle idle;
  idle.sid = Sid("admin", kAdminPassword);
  const Json::Value runner = Call("KOVA.Test.Crash", "echo", {}, idle.sid).json["data"]["pid"];
  idle.runner = runner.isInt() ? runner.asInt() : -1;
  idle.front_end = FrontEnd(host_->pid());
  std::this_thread::sleep_for(std::chrono::milliseconds(300));  // the calls' connections close
  if (idle.front_end > 0) idle.front_fds = OpenDescriptors(idle.front_end);
  if (idle.runner > 0) idle.runner_fds = OpenDescriptors(idle.runner);
  return idle;
}

TEST_F(WebApidTest, RawOutputOfAnySizeArrivesWholeAndItsFileIsClosed) {
  const auto [sid, runner, front_end, front_fds, runner_fds] = StartWithTestModule();
  ASSERT_GT(runner, 0);
  ASSERT_GT(front_end, 0);

  // Either side of what travels inline (64 KiB with the headers), either side
  // of one part sent from the file, and more than any buffer on the way.
  for (const uint64_t size : {0, 65000, 70000, 262143, 262145, 20000000}) {
    const Reply got = Send("GET", BigForm(size, sid), {});
    EXPECT_EQ(got.status, 200) << size;
    EXPECT_EQ(got.headers.find("Content-Type")->second, "application/octet-stream") << size;
    EXPECT_EQ(got.headers.find("Content-Disposition")->second, "attachment; filename=\"big.bin\"");
    EXPECT_EQ(got.headers.find("Content-Length")->second, std::to_string(size));
    EXPECT_EQ(got.headers.find("X-Content-Type-Options")->second, "nosniff");
    ASSERT_EQ(got.body.size(), size);
    EXPECT_EQ(FirstDifference(got.body), size) << size;
  }
  httplib::Client client("127.0.0.1", host_->port());
  const httplib::Result head =
      client.Head(std::string("/webapi/entry.cgi?") + BigForm(300000, sid));
  ASSERT_TRUE(head);
  EXPECT_EQ(head->get_header_value("Content-Length"), "300000");
  EXPECT_TRUE(head->body.empty());

  EXPECT_EQ(SettledDescriptors(front_end, front_fds), front_fds);
  EXPECT_EQ(OpenDescriptors(runner), runner_fds);
  EXPECT_EQ(Call("KOVA.Test.Crash", "echo", {}, sid).json["data"]["pid"], runner);
}

TEST_F(WebApidTest, ADownloadDroppedOrNoLongerTakenIsClosedAndOthersGoOn) {
  const auto [sid, runner, front_end, front_fds, runner_fds] =
      StartWithTestModule({"--send-timeout", "4"});
  ASSERT_GT(runner, 0);
  ASSERT_GT(front_end, 0);
  const std::string request =
      "GET /webapi/entry.cgi?" + BigForm(20000000, sid) + " HTTP/1.1\r\nHost: x\r\n\r\n";
  const struct {
    const char* what;
    bool drop;  // closes after the first megabyte, else takes nothing
  } cases[] = {{"a client that goes away", true}, {"a client that stops taking", false}};
  for (const auto& c : cases) {
    auto client = std::make_unique<kova_test::RawConnection>(host_->port());
    ASSERT_TRUE(client->Send(request));
    // The download is under way: its socket and file are open.
    EXPECT_GE(SettledDescriptors(front_end, front_fds + 2), front_fds + 2) << c.what;
    if (c.drop) {
      EXPECT_GE(client->ReadAtLeast(1 << 20, std::chrono::seconds(10)).size(), size_t{1} << 20);
      client.reset();
    }
    // The runner is free while the client holds the download.
    EXPECT_TRUE(Call("KOVA.Test.Crash", "echo", {}, sid).json["success"].asBool()) << c.what;
    // One that went away is seen at once, before its send time would run out.
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(SettledDescriptors(front_end, front_fds, std::chrono::seconds(c.drop ? 3 : 15)),
              front_fds)
        << c.what;
    if (!c.drop) {
      EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(2)) << c.what;
    }
  }
  EXPECT_EQ(OpenDescriptors(runner), runner_fds);
  const Reply again = Send("GET", BigForm(3000000, sid), {});
  EXPECT_EQ(FirstDifference(again.body), 3000000u);
}

TEST_F(WebApidTest, ModulesRunApartAndAFullQueueIsRefusedUntilItDrains) {
  AddModule(KOVA_CRASH_MODULE_PATH);
  Start({"--max-waiting", "1"});
  const std::string sid = Sid("admin", kAdminPassword);
  std::mutex mutex;
  std::vector<std::string> finished;
  const auto note = [&](const std::string& what) {
    std::lock_guard lock(mutex);
    finished.push_back(what);
  };
  std::thread slow([&] {
    EXPECT_TRUE(Call("KOVA.Test.Crash", "sleep", {{"seconds", "3"}}, sid).json["success"].asBool());
    note("slow");
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  // Another module's runner answers while the slow call runs.
  EXPECT_TRUE(Call(kSetting, "get", {}, sid).json["success"].asBool());
  note("setting");
  // Behind the slow call, one call may wait in the queue (and one in the
  // runner's socket); the others are refused at once.
  std::vector<Reply> replies(4);
  std::vector<std::thread> behind;
  for (Reply& reply : replies) {
    behind.emplace_back([&] { reply = Call("KOVA.Test.Crash", "echo", {}, sid); });
  }
  for (std::thread& thread : behind) thread.join();
  slow.join();
  EXPECT_EQ(finished, (std::vector<std::string>{"setting", "slow"}));
  int refused = 0;
  for (const Reply& reply : replies) {
    if (reply.status != 503) {
      EXPECT_TRUE(reply.json["success"].asBool()) << reply.body;
      continue;
    }
    ++refused;
    EXPECT_EQ(Code(reply), 100);
    EXPECT_THAT(reply.json["error"]["errors"]["reason"].asString(),
                HasSubstr("too many calls wait for the module"));
    EXPECT_EQ(reply.headers.find("Retry-After")->second, "1");
  }
  EXPECT_GE(refused, 1);
  EXPECT_TRUE(Call("KOVA.Test.Crash", "echo", {}, sid).json["success"].asBool());
}

TEST_F(WebApidTest, ACallKilledInTheMiddleLeavesNoTemporaryFileBehind) {
  if (geteuid() != 0) GTEST_SKIP() << "NOT RUN: a runner's own temporary folder needs root";
  AddModule(KOVA_CRASH_MODULE_PATH);
  root_.Write("/tmp/kovalog-of-someone-else", "keep me");
  Start();
  const std::string sid = Sid("admin", kAdminPassword);
  EXPECT_EQ(Code(Call("KOVA.Test.Crash", "leave_temp", {}, sid)), 100);
  EXPECT_TRUE(Call("KOVA.Test.Crash", "echo", {}, sid).json["success"].asBool());
  const auto left = [&] {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(root_.Path("/tmp"))) {
      names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
  };
  // Beside the running runners' own folders, only the other file is there.
  std::vector<std::string> running = left();
  std::erase_if(running,
                [](const std::string& name) { return name.rfind("kova-webapid-", 0) == 0; });
  EXPECT_EQ(running, std::vector<std::string>{"kovalog-of-someone-else"});
  host_.reset();  // the runners' folders go with them
  EXPECT_EQ(left(), std::vector<std::string>{"kovalog-of-someone-else"});
}

TEST_F(WebApidTest, RefusesToStartWithAModulesFolderItCannotRead) {
  if (geteuid() != 0) GTEST_SKIP() << "NOT RUN: needs root to give root up";
  chmod(root_.Path("/modules").c_str(), 0700);
  const std::string log = root_.Path("/refused.log");
  const pid_t pid = fork();
  if (pid == 0) {
    freopen(log.c_str(), "w", stderr);
    execl(KOVA_WEBAPID_PATH, KOVA_WEBAPID_PATH, "--port", "0", "--modules",
          root_.Path("/modules").c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  for (int i = 0; i < 200 && waitpid(pid, &status, WNOHANG) == 0; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  if (waitpid(pid, &status, WNOHANG) == 0) {
    kill(pid, SIGKILL);
    waitpid(pid, &status, 0);
    ADD_FAILURE() << "the host went on serving";
  }
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) != 0);
  std::ifstream in(log);
  const std::string text(std::istreambuf_iterator<char>(in), {});
  EXPECT_THAT(text, HasSubstr("cannot open the modules folder " + root_.Path("/modules") +
                              ": Permission denied"));
  EXPECT_THAT(text, Not(HasSubstr("listening")));
}

TEST_F(WebApidTest, IdsThatAModuleLeavesRaisedDoNotReachTheNextCall) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root";
  AddModule(KOVA_IDS_MODULE_PATH);
  Start();
  const std::string sid = Sid("admin", kAdminPassword);
  const passwd* nobody = getpwnam("nobody");
  ASSERT_NE(nobody, nullptr);
  const Json::Value before = Call("KOVA.Test.Ids", "ids", {}, sid).json["data"];
  EXPECT_EQ(before["euid"].asUInt(), nobody->pw_uid);
  EXPECT_EQ(before["ruid"], 0);
  EXPECT_EQ(before["suid"], 0);
  EXPECT_EQ(Call("KOVA.Test.Ids", "raise", {}, sid).json["data"]["euid"], 0);
  EXPECT_EQ(Call("KOVA.Test.Ids", "ids", {}, sid).json["data"], before);
  EXPECT_THAT(host_->Log(), HasSubstr("warning: KOVA.Test.Ids v1 raise left the process's ids "
                                      "changed; put back"));
}

TEST_F(WebApidTest, RefusesBadInputWithAClearError) {
  Start();
  const std::string sid = Sid("admin", kAdminPassword);
  std::string many = "api=KOVA.API.Info&version=1&method=query";
  for (int i = 0; i < 100; ++i) many += "&p" + std::to_string(i) + "=1";
  const std::string big =
      "api=KOVA.API.Info&version=1&method=query&pad=" + std::string((1 << 20) + 1, 'a');
  const struct {
    const char* what;
    std::string method;
    std::string form;
    int status;
    int code;
  } cases[] = {
      {"a body over 1 MiB", "POST", big, 413, 101},
      {"broken percent-encoding", "GET", "api=KOVA.API.Info&version=1&method=%zz", 400, 101},
      {"too many parameters", "POST", many, 400, 101},
      {"a parameter twice", "GET", "api=KOVA.API.Info&api=x&version=1&method=query", 400, 101},
      {"a version that is no number", "GET", "api=KOVA.API.Info&version=one&method=query", 200,
       101},
      {"no api", "GET", "version=1&method=query", 200, 101},
      {"no method", "GET", "api=KOVA.API.Info&version=1", 200, 101},
      {"an unknown API", "GET", "api=KOVA.Nothing&version=1&method=get", 200, 102},
      {"an unknown method", "GET", Form({{"api", kSetting}, {"version", "1"}, {"method", "drop"}}),
       200, 103},
      {"an unknown version", "GET", Form({{"api", kSetting}, {"version", "2"}, {"method", "get"}}),
       200, 104},
      {"a sign-in by GET", "GET",
       Form({{"api", "KOVA.API.Auth"},
             {"version", "1"},
             {"method", "login"},
             {"account", "admin"},
             {"password", kAdminPassword}}),
       200, 101},
  };
  for (const auto& c : cases) {
    const Reply reply = Send(c.method, c.form, {});
    EXPECT_EQ(reply.status, c.status) << c.what;
    EXPECT_EQ(Code(reply), c.code) << c.what;
    EXPECT_TRUE(reply.json["error"]["errors"]["reason"].isString()) << c.what;
  }
  httplib::Client client("127.0.0.1", host_->port());
  EXPECT_EQ(client.Post(kova_test::kEntryPath, "{}", "application/json")->status, 415);

  // Nesting that the runner once failed to read is taken up to the front-end's
  // limit and refused beyond it, and the runner goes on.
  const auto nested = [](int depth) {
    return std::string(depth, '[') + "1" + std::string(depth, ']');
  };
  EXPECT_TRUE(Call(kSetting, "get", {{"x", nested(50)}}, sid).json["success"].asBool());
  const Reply deep = Call(kSetting, "get", {{"x", nested(62)}}, sid);
  EXPECT_EQ(Code(deep), 101) << deep.body;
  // A form body of almost 1 MiB of control bytes, which JSON escapes sixfold.
  const std::string controls =
      Form({{"api", kSetting}, {"version", "1"}, {"method", "get"}, {"_sid", sid}}) +
      "&pad=" + std::string((1 << 20) - 200, '\x01');
  const Reply escaped = Send("POST", controls, {});
  EXPECT_TRUE(escaped.json["success"].asBool()) << escaped.status << " " << escaped.body;
  EXPECT_TRUE(Call(kSetting, "get", {}, sid).json["success"].asBool());  // still serving
  EXPECT_THAT(host_->Log(), Not(HasSubstr("malformed call")));
}

// A request for the host's own API, which the front-end answers alone.
constexpr char kInfoRequest[] =
    "GET /webapi/entry.cgi?api=KOVA.API.Info&version=1&method=query HTTP/1.1\r\n"
    "Host: 127.0.0.1\r\n\r\n";

TEST_F(WebApidTest, IdleAndSlowClientsDoNotHoldUpOtherCalls) {
  // A header time longer than the test, so that every client stays connected.
  Start({"--header-timeout", "120", "--max-per-address", "1000"});
  const std::string sid = Sid("admin", kAdminPassword);
  ASSERT_FALSE(sid.empty());
  std::vector<kova_test::RawConnection> idle, slow;
  for (int i = 0; i < 200; ++i) idle.emplace_back(host_->port());
  for (int i = 0; i < 50; ++i) slow.emplace_back(host_->port());
  // Each slow client sends one byte of its request a second.
  std::atomic<bool> stop = false;
  std::thread trickle([&] {
    const std::string request = kInfoRequest;
    for (size_t i = 0; i < request.size() && !stop; ++i) {
      for (const kova_test::RawConnection& client : slow) client.Send(request.substr(i, 1));
      for (int tick = 0; tick < 10 && !stop; ++tick) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
      }
    }
  });
  std::this_thread::sleep_for(std::chrono::seconds(2));
  for (int i = 0; i < 3; ++i) {
    const Reply reply = Call(kSetting, "get", {}, sid);
    EXPECT_TRUE(reply.json["success"].asBool()) << reply.status << " " << reply.body;
    if (!reply.json["success"].asBool()) break;
  }
  httplib::Client client("127.0.0.1", host_->port());
  client.set_read_timeout(std::chrono::seconds(30));
  const httplib::Result page = client.Get("/");
  EXPECT_TRUE(page && page->status == 200);
  int open = 0;
  for (const auto* clients : {&idle, &slow}) {
    for (const kova_test::RawConnection& connection : *clients) open += connection.Open();
  }
  EXPECT_EQ(open, 250);
  stop = true;
  trickle.join();
}

TEST_F(WebApidTest, ClientsThatSendTooSlowlyOrIdleAreCutOff) {
  Start({"--header-timeout", "2", "--body-timeout", "3", "--keepalive-timeout", "6"});
  using std::chrono::seconds;
  const struct {
    const char* what;
    std::string first;  // sent at once
    std::string drip;   // sent again about every second after
    bool answered;      // `first` is a whole request
    seconds open;       // it stays open at least this long: its own limit, less a second
  } cases[] = {
      {"a connection that sends nothing", "", "", false, seconds(1)},
      {"a header line about every second", "GET / HTTP/1.1\r\n", "X-Slow: 1\r\n", false,
       seconds(1)},
      {"a byte of the target about every second", "GET /", "a", false, seconds(1)},
      {"a body that trickles in",
       "POST /webapi/entry.cgi HTTP/1.1\r\nHost: x\r\n"
       "Content-Type: application/x-www-form-urlencoded\r\nContent-Length: 1000\r\n\r\n",
       "a", false, seconds(2)},
      // Past its header time too: an idle connection waits for its keep-alive time.
      {"a kept-alive connection left idle", kInfoRequest, "", true, seconds(5)},
  };
  std::vector<kova_test::RawConnection> clients;
  std::vector<std::chrono::steady_clock::time_point> since;
  for (const auto& c : cases) {
    clients.emplace_back(host_->port());
    ASSERT_TRUE(clients.back().ok());
    clients.back().Send(c.first);
    if (c.answered) {
      // Answered twice on the same connection: it is kept alive.
      for (int i = 0; i < 2; ++i) {
        if (i > 0) clients.back().Send(c.first);
        EXPECT_THAT(clients.back().ReadAnswer(seconds(30)), ::testing::StartsWith("HTTP/1.1 200 "))
            << c.what;
      }
    }
    since.push_back(std::chrono::steady_clock::now());
  }
  // Each close is seen within a tenth of a second or so, never before it happened.
  std::vector<std::optional<std::chrono::steady_clock::duration>> open_for(clients.size());
  const auto start = std::chrono::steady_clock::now();
  while (std::chrono::steady_clock::now() - start < seconds(40) &&
         std::find(open_for.begin(), open_for.end(), std::nullopt) != open_for.end()) {
    for (size_t i = 0; i < clients.size(); ++i) {
      if (open_for[i]) continue;
      if (!cases[i].drip.empty()) clients[i].Send(cases[i].drip);
      if (clients[i].ClosedWithin(std::chrono::milliseconds(100))) {
        open_for[i] = std::chrono::steady_clock::now() - since[i];
      }
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(400));
  }
  for (size_t i = 0; i < clients.size(); ++i) {
    ASSERT_TRUE(open_for[i]) << cases[i].what << ": never closed";
    EXPECT_GE(*open_for[i], cases[i].open) << cases[i].what << ": closed too early";
  }
}

TEST_F(WebApidTest, ConnectionsOverACapAreRefusedUntilSomeClose) {
  const struct {
    const char* option;
    const char* reason;
  } caps[] = {
      {"--max-per-address", "too many connections from your address"},
      {"--max-connections", "the host has too many connections"},
  };
  for (const auto& cap : caps) {
    Start({cap.option, "4", "--header-timeout", "120"});
    std::vector<kova_test::RawConnection> held;
    for (int i = 0; i < 4; ++i) held.emplace_back(host_->port());
    kova_test::RawConnection extra(host_->port());
    extra.Send(kInfoRequest);
    std::string answer;
    EXPECT_TRUE(extra.ClosedWithin(std::chrono::seconds(30), &answer)) << cap.option;
    EXPECT_THAT(answer, ::testing::StartsWith("HTTP/1.1 503 ")) << cap.option;
    EXPECT_THAT(answer, HasSubstr("\r\nConnection: close\r\n")) << cap.option;
    EXPECT_THAT(answer, ::testing::EndsWith("\r\n\r\n"
                                            R"({"error":{"code":100,"errors":{"reason":")" +
                                            std::string(cap.reason) + R"("}},"success":false})"))
        << cap.option;
    EXPECT_THAT(answer, HasSubstr("\r\nX-Content-Type-Options: nosniff\r\n")) << cap.option;

    // Once two close, the host serves again.
    held.erase(held.begin() + 2, held.end());
    bool served = false;
    const auto start = std::chrono::steady_clock::now();
    while (!served && std::chrono::steady_clock::now() - start < std::chrono::seconds(30)) {
      kova_test::RawConnection client(host_->port());
      client.Send(kInfoRequest);
      served = client.ReadAnswer(std::chrono::seconds(10)).rfind("HTTP/1.1 200 ", 0) == 0;
      if (!served) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    EXPECT_TRUE(served) << cap.option;
    host_.reset();
  }
}

TEST_F(WebApidTest, StaticFilesAreServedFromInsideTheirFolderOnly) {
  std::filesystem::copy(KOVA_WWW_DIR, root_.Path("/www"), std::filesystem::copy_options::recursive);
  root_.Write("/secret.txt", "not for the web\n");
  std::filesystem::create_symlink(root_.Path("/secret.txt"), root_.Path("/www/leak.txt"));
  std::filesystem::create_symlink("../index.html", root_.Path("/www/js/home.html"));
  Start({"--static", root_.Path("/www")});
  const struct {
    const char* path;
    int status;
    const char* content_type;
  } cases[] = {
      {"/", 200, "text/html; charset=utf-8"},
      {"/js/app.js", 200, "text/javascript; charset=utf-8"},
      {"/texts/enu.json", 200, "application/json; charset=utf-8"},
      {"/favicon.svg", 200, "image/svg+xml"},
      {"/js/home.html", 200, "text/html; charset=utf-8"},  // a link that stays inside
      {"/leak.txt", 404, "application/json; charset=utf-8"},
      {"/js/../leak.txt", 404, "application/json; charset=utf-8"},
      {"/%2e%2e/secret.txt", 404, "application/json; charset=utf-8"},
      {"/js", 404, "application/json; charset=utf-8"},  // a folder
      {"/nothing.html", 404, "application/json; charset=utf-8"},
  };
  httplib::Client client("127.0.0.1", host_->port());
  for (const auto& c : cases) {
    const httplib::Result got = client.Get(c.path);
    ASSERT_TRUE(got) << c.path;
    EXPECT_EQ(got->status, c.status) << c.path;
    EXPECT_EQ(got->get_header_value("Content-Type"), c.content_type) << c.path;
    EXPECT_EQ(got->get_header_value("Referrer-Policy"), "no-referrer") << c.path;
    EXPECT_THAT(got->body, Not(HasSubstr("not for the web"))) << c.path;
    if (c.status == 404) {
      EXPECT_EQ(got->body,
                R"({"error":{"code":102,"errors":{"reason":"no such path"}},"success":false})")
          << c.path;
    }
  }
  const httplib::Result page = client.Get("/");
  const httplib::Result head = client.Head("/");
  ASSERT_TRUE(page && head);
  EXPECT_EQ(head->status, 200);
  EXPECT_EQ(head->get_header_value("Content-Length"), std::to_string(page->body.size()));
  EXPECT_EQ(head->body, "");
  EXPECT_THAT(host_->Log(), HasSubstr(" GET /%2e%2e/secret.txt 404 "));
}

}  // namespace
