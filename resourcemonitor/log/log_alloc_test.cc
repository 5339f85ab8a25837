// Reading the log while memory runs out. This program replaces the global
// operator new so that a test can make large allocations fail.

#include <dlfcn.h>
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <new>
#include <string>
#include <vector>

#include "fake/kova_fake.h"
#include "kova/log.h"
#include "log/log_handlers.h"
#include "test_support/host_call.h"

namespace {

// Allocations of at least this many bytes can be made to fail: those of the
// entries and the sort, not the small ones of the test's own machinery.
constexpr size_t kLarge = 64 * 1024;
// How many more large allocations succeed before every one fails; negative
// for no failure.
std::atomic<int> gLargeLeft{-1};

using New = void* (*)(size_t);

void* Allocate(New next, size_t size) {
  if (size >= kLarge && gLargeLeft.load() >= 0 && gLargeLeft.fetch_sub(1) <= 0) {
    throw std::bad_alloc();
  }
  return next(size);
}

}  // namespace

// Forwarded to the next definitions, so that the matching operator delete
// (the C++ library's or the sanitizer's) frees what they return.
void* operator new(size_t size) {
  static const auto next = reinterpret_cast<New>(dlsym(RTLD_NEXT, "_Znwm"));
  return Allocate(next, size);
}
void* operator new[](size_t size) {
  static const auto next = reinterpret_cast<New>(dlsym(RTLD_NEXT, "_Znam"));
  return Allocate(next, size);
}

namespace {

using kova_test::CallHandler;

int OpenDescriptors() {
  int count = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    ++count;
  }
  return count;
}

// Whichever large allocation of the read fails, the list answers the failure
// with no entries, and the log's copy is closed and deleted.
TEST(LogAllocationTest, AFailedAllocationAnywhereInTheReadAnswersNoEntries) {
  kova_fake::Reset();
  // About 3 MB in no order of time: a sort that can't just turn the entries
  // round, with a buffer as large as the entries.
  constexpr unsigned kLines = 6000;
  std::vector<std::string> lines;
  for (unsigned i = 0; i < kLines; ++i) {
    lines.push_back("1\tWarning\t" + KOVALogConvertTime1(1700000000 + (i * 7919) % kLines) +
                    "\tadmin\tkovaperfeventd\t" + std::string(500, 'e'));
  }
  kova_fake::SetLogLines(lines);
  const int descriptors = OpenDescriptors();
  int failed = 0;
  for (int succeeding = 0;; ++succeeding) {
    ASSERT_LT(succeeding, 100) << "the read never succeeds";
    gLargeLeft = succeeding;
    const KOVA::APIResponse response = CallHandler(log_list_v1, R"({"limit": 2})");
    gLargeLeft = -1;
    EXPECT_EQ(OpenDescriptors(), descriptors) << succeeding;
    for (const std::string& copy : kova_fake::TempFiles()) {
      EXPECT_FALSE(std::filesystem::exists(copy)) << succeeding;
    }
    if (response.GetState() == KOVA::APIResponse::State::kSuccess) {
      EXPECT_EQ(response.GetData()["total"], Json::Value(Json::UInt(kLines)));
      EXPECT_EQ(response.GetData()["logs"].size(), 2u);
      break;
    }
    ++failed;
    EXPECT_EQ(response.GetData()["total"], Json::Value(Json::UInt(0))) << succeeding;
    EXPECT_EQ(response.GetData()["logs"], Json::Value(Json::arrayValue)) << succeeding;
  }
  // At least the entries' room and the sort's buffer failed.
  EXPECT_GE(failed, 2);
}

}  // namespace
