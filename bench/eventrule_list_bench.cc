// Time of the EventRule "list" method (a page of 50) over 10^4 rules on the
// real platform, in a temporary system root: half of the rules watch services
// of 100 packages (a description and an INFO file each), half watch 1000 LUNs
// of the registry. Each rule's name costs the module a service look-up and two
// INFO reads, or a LUN look-up; the platform's file caches make those reads
// one per file. Cached/0 runs with the caches switched off, Cached/1 with them
// on; the ratio counter of the second is the time without over the time with.

#include <benchmark/benchmark.h>
#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "eventrule/EventRule.h"
#include "kova/perfevent.h"
#include "src/file_cache.h"
#include "src/lun_registry.h"
#include "test_support/host_call.h"
#include "test_support/perfevent_rule.h"
#include "test_support/temp_root.h"

namespace {

constexpr int kPackages = 100;
constexpr int kRulesPerPackage = 50;  // 10 resources x 5 severities
constexpr int kLuns = 1000;
constexpr int kRulesPerLun = 5;

void WriteFile(const std::string& path, const std::string& content) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path, std::ios::trunc) << content;
}

// Fills the root with the packages, their services, the LUNs and the rules.
bool FillRoot(const std::string& root) {
  std::string luns = "{\"luns\": [\n";
  for (int i = 0; i < kLuns; ++i) {
    luns += std::string(i == 0 ? "" : ",\n") + "{\"uuid\": \"lun-" + std::to_string(i) +
            "\", \"name\": \"Volume LUN " + std::to_string(i) +
            "\", \"size_mb\": 10240, \"location\": \"/volume1\"}";
  }
  WriteFile(root + "/etc/kova/iscsi/luns.json", luns + "\n]}\n");
  for (int i = 0; i < kPackages; ++i) {
    const std::string package = "pkg" + std::to_string(i);
    WriteFile(root + "/var/packages/" + package + "/INFO",
              "package=\"" + package + "\"\nversion=\"1.0." + std::to_string(i) +
                  "\"\ndisplayname=\"Package " + std::to_string(i) + "\"\ndisplayname_enu=\"" +
                  "Package " + std::to_string(i) + " (English)\"\nmaintainer=\"KOVA\"\n");
    WriteFile(root + "/etc/kova/services/pkgctl-" + package + ".conf",
              "command=\"/var/packages/" + package + "/target/bin/start\"\npackage=\"" + package +
                  "\"\n");
  }
  // One rule through the platform makes the store; the rest go in one transaction.
  KOVAPERFEVENT_CONF_SETTING first =
      kova_test::PerfEventRule(PERFEVENT_TYPE_ISCSI_LUN, "lun-0", 0, 0, 0);
  if (KOVAPerfEventConfAdd(&first) != 0) return false;
  sqlite3* db = nullptr;
  if (sqlite3_open((root + "/var/lib/kova/perfevent/rules.db").c_str(), &db) != SQLITE_OK) {
    return false;
  }
  std::string sql = "BEGIN;";
  const auto add = [&sql](int type, const std::string& service, int resource, int severity) {
    sql +=
        "INSERT INTO rules(type, service, resource, severity, threshold, preset_a, preset_b, "
        "enable) VALUES(" +
        std::to_string(type) + ", '" + service + "', " + std::to_string(resource) + ", " +
        std::to_string(severity) + ", 80, 5, 30, 1);";
  };
  for (int i = 0; i < kLuns; ++i) {
    for (int r = i == 0 ? 1 : 0; r < kRulesPerLun; ++r) {
      add(PERFEVENT_TYPE_ISCSI_LUN, "lun-" + std::to_string(i), r, 0);
    }
  }
  for (int i = 0; i < kPackages; ++i) {
    for (int r = 0; r < kRulesPerPackage; ++r) {
      add(PERFEVENT_TYPE_SERVICE, "pkgctl-pkg" + std::to_string(i), r / 5, r % 5);
    }
  }
  sql += "COMMIT;";
  const bool filled = sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK;
  sqlite3_close(db);
  // Files the caches may keep are a second old at least.
  std::this_thread::sleep_for(std::chrono::milliseconds(1200));
  return filled;
}

double uncached_seconds = 0;

void BM_RuleList(benchmark::State& state) {
  const bool cached = state.range(0) != 0;
  kova::SetFileCacheEnabled(cached);
  Json::UInt total = 0;
  const auto start = std::chrono::steady_clock::now();
  for (auto _ : state) {
    const KOVA::APIResponse response =
        kova_test::CallHandler(rule_list_v1, R"({"offset": 0, "limit": 50})");
    total = response.GetData()["total"].asUInt();
    benchmark::DoNotOptimize(total);
  }
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count() /
      static_cast<double>(std::max<int64_t>(state.iterations(), 1));
  kova::SetFileCacheEnabled(true);
  if (total != kPackages * kRulesPerPackage + kLuns * kRulesPerLun) {
    state.SkipWithError("the list is not the 10^4 rules");
    return;
  }
  if (!cached) uncached_seconds = seconds;
  if (cached && uncached_seconds > 0) state.counters["speedup"] = uncached_seconds / seconds;
}

// The floor under the list: reading the 10^4 rules from the store alone.
void BM_StoreRead(benchmark::State& state) {
  for (auto _ : state) {
    KovaPerfEventConfSettingNode* list = KOVAPerfEventConfListGet(nullptr);
    benchmark::DoNotOptimize(list);
    KOVAPerfEventConfListFree(list);
  }
}

}  // namespace

int main(int argc, char** argv) {
  kova_test::TempRoot temp("/tmp/kova_rule_bench");
  if (temp.path().empty() || !FillRoot(temp.path())) {
    fprintf(stderr, "could not fill the system root\n");
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RegisterBenchmark("RuleList/Cached", BM_RuleList)
      ->Arg(0)
      ->Arg(1)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("StoreRead", BM_StoreRead)->Unit(benchmark::kMillisecond);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
