// kovastatd as the platform's service with the real "pgsql" service, the host
// and both modules, called over HTTP like the web app calls them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>

#include "test_support/daemon_service.h"
#include "test_support/host_call.h"
#include "test_support/test_root.h"
#include "test_support/webapid.h"

namespace {

using kova_test::Code;
using kova_test::ParseJson;
using kova_test::Reply;

constexpr char kPassword[] = "admin password";
constexpr char kSetting[] = "KOVA.ResourceMonitor.Setting";
constexpr char kUsage[] = "KOVA.ResourceMonitor.Usage";

class UsageOverHttp : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.InstallTexts(KOVA_TEXTS_DIR);
    root_.Write("/etc/kovainfo.conf",
                "resourcemonitor_realtime_max=\"15\"\nresourcemonitor_history=\"no\"\n");
    std::filesystem::create_directories(root_.Path("/modules"));
    for (const char* module : {KOVA_MODULE_PATH, KOVA_USAGE_MODULE_PATH}) {
      std::filesystem::create_symlink(
          module, root_.Path("/modules/") + std::filesystem::path(module).filename().string());
    }
    ASSERT_EQ(Kova("user add admin --admin", kPassword), 0);
  }
  void TearDown() override {
    host_.reset();
    Kova("service stop kovastatd");
    Kova("service stop pgsql");
  }

  int Kova(const std::string& args, const std::string& input = "") {
    return kova_test::RunKova(KOVA_TOOL_PATH, args, input);
  }

  // kovastatd as the service, with `options`, started.
  void StartCollector(const std::string& options) {
    ASSERT_TRUE(kova_test::InstallDaemonService(KOVA_INSTALL_SERVICE, root_.path(), "kovastatd",
                                                KOVASTATD_PATH, options, root_.Path("/statd.err")));
    ASSERT_EQ(Kova("service start kovastatd"), 0);
  }

  // The real PostgreSQL as the service "pgsql", started; its program copied
  // into the root, where its account can reach it.
  void StartDatabase() {
    std::filesystem::create_directories(root_.Path("/usr/sbin"));
    std::filesystem::copy_file(KOVA_PGSQL_PROGRAM, root_.Path("/usr/sbin/kova-pgsql"));
    ASSERT_EQ(std::system((std::string(KOVA_PGSQL_INSTALL) + " " + root_.path()).c_str()), 0);
    ASSERT_EQ(Kova("service start pgsql"), 0);
  }

  // Starts the host and signs in.
  void SignIn() {
    host_ = std::make_unique<kova_test::WebApid>(
        KOVA_WEBAPID_PATH, root_.path(),
        std::vector<std::string>{"--modules", root_.Path("/modules")});
    sid_ = host_->Sid("admin", kPassword);
    ASSERT_FALSE(sid_.empty()) << host_->Log();
  }

  Reply Call(const std::string& api, const std::string& method, kova_test::Params params = {}) {
    return host_->Call(api, method, std::move(params), sid_);
  }

  // Calls Usage `method` until `done` holds of the answer, for up to `limit`.
  Reply CallUntil(const std::string& method, const kova_test::Params& params,
                  const std::function<bool(const Reply&)>& done,
                  std::chrono::seconds limit = std::chrono::seconds(30)) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    Reply reply = Call(kUsage, method, params);
    while (!done(reply) && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(200));
      reply = Call(kUsage, method, params);
    }
    return reply;
  }

  std::string Errors() const {
    return root_.Read("/statd.err") + root_.Read("/var/log/kova/pgsql.log");
  }

  kova_test::TestRoot root_;
  std::unique_ptr<kova_test::WebApid> host_;
  std::string sid_;
};

TEST_F(UsageOverHttp, RealtimeGrowsByOneSampleASecond) {
  StartCollector("");
  SignIn();
  const kova_test::Params first = {{"series", R"(["mem.used"])"}};
  const Reply start = CallUntil("realtime", first, [](const Reply& reply) {
    return reply.json["data"]["now"].asInt64() > 0;
  });
  ASSERT_EQ(start.json["success"], true) << start.body << Errors();
  const int64_t since = start.json["data"]["now"].asInt64();
  std::this_thread::sleep_for(std::chrono::milliseconds(3300));
  const Reply later =
      Call(kUsage, "realtime",
           {{"series", R"(["mem.used","nothing.here"])"}, {"since", std::to_string(since)}});
  const Json::Value& data = later.json["data"];
  const int64_t now = data["now"].asInt64();
  EXPECT_GE(now - since, 3);
  EXPECT_LE(now - since, 4);
  // One sample for each second after `since`, up to the newest.
  Json::Value expected(Json::arrayValue);
  for (int64_t t = since + 1; t <= now; ++t) expected.append(static_cast<Json::Int64>(t));
  EXPECT_EQ(data["series"][0]["times"], expected) << later.body;
  EXPECT_EQ(data["series"][0]["values"].size(), expected.size());
  EXPECT_EQ(data["unknown"], ParseJson(R"(["nothing.here"])"));

  // A stopped collector is a module error with its text.
  ASSERT_EQ(Kova("service stop kovastatd"), 0);
  const Reply stopped = Call(kUsage, "catalog");
  EXPECT_EQ(Code(stopped), 6201) << stopped.body;
  EXPECT_EQ(stopped.json["error"]["errors"]["err_key"], "collector_unavailable");
  EXPECT_FALSE(stopped.json["error"]["errors"]["err_msg"].asString().empty());
}

TEST_F(UsageOverHttp, HistorySwitchedOnReachesTheDatabaseAndComesBack) {
  // A minute of the collector's clock passes in 3 s.
  StartDatabase();
  StartCollector("--time-scale 0.05");
  SignIn();
  const Reply off =
      Call(kUsage, "history", {{"series", R"(["cpu.user"])"}, {"from", "0"}, {"to", "1"}});
  EXPECT_EQ(Code(off), 6202) << off.body;

  const Reply on = Call(kSetting, "set", {{"enable_history", "true"}});
  ASSERT_EQ(on.json, ParseJson(R"({"success":true})")) << on.body << Errors();
  const Reply catalog = CallUntil("catalog", {}, [](const Reply& reply) {
    return reply.json["data"]["history"]["state"] == "writing";
  });
  EXPECT_EQ(catalog.json["data"]["history"], ParseJson(R"({"enabled":true,"state":"writing"})"))
      << catalog.body << Errors();

  // The collector's clock runs ahead of the real one: ask a wide stretch.
  const int64_t now = std::chrono::duration_cast<std::chrono::seconds>(
                          std::chrono::system_clock::now().time_since_epoch())
                          .count();
  const kova_test::Params ask = {{"series", R"(["mem.used","cpu.idle"])"},
                                 {"from", std::to_string(now - 3600)},
                                 {"to", std::to_string(now + 86400)},
                                 {"points", "1000"}};
  const Reply history = CallUntil("history", ask, [](const Reply& reply) {
    return reply.json["data"]["series"][0]["times"].size() >= 2 &&
           reply.json["data"]["series"][1]["times"].size() >= 2;
  });
  const Json::Value& data = history.json["data"];
  ASSERT_EQ(data["series"].size(), 2u) << history.body << Errors();
  EXPECT_EQ(data["source"], "minute");
  EXPECT_EQ(data["series"][0]["id"], "mem.used");
  for (const Json::Value& series : data["series"]) {
    ASSERT_GE(series["times"].size(), 2u) << history.body << Errors();
    for (Json::ArrayIndex i = 0; i < series["times"].size(); ++i) {
      EXPECT_LE(series["min"][i].asDouble(), series["avg"][i].asDouble());
      EXPECT_LE(series["avg"][i].asDouble(), series["max"][i].asDouble());
    }
  }
  EXPECT_GT(data["series"][0]["avg"][0].asDouble(), 0);  // memory in use
}

}  // namespace
