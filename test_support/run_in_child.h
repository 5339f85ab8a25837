// Runs part of a test in a forked child process: for changes that can't be
// undone (giving up root) or for behaviour of a fresh process.

#ifndef KOVA_TEST_SUPPORT_RUN_IN_CHILD_H_
#define KOVA_TEST_SUPPORT_RUN_IN_CHILD_H_

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <functional>

namespace kova_test {

// Runs `body` in a child and returns true when it ended without a test failure.
// The child's failures are printed as usual.
inline bool RunInChild(const std::function<void()>& body) {
  fflush(stdout);
  fflush(stderr);
  const pid_t pid = fork();
  if (pid == 0) {
    body();
    fflush(stdout);
    fflush(stderr);
    _exit(::testing::Test::HasFailure() ? 1 : 0);
  }
  int status = 0;
  if (pid < 0 || waitpid(pid, &status, 0) != pid) return false;
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_RUN_IN_CHILD_H_
