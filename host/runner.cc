#include "host/runner.h"

#include <errno.h>
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <exception>

#include "common/answer_envelope.h"
#include "host/host_log.h"
#include "host/json_text.h"
#include "host/module_loader.h"
#include "host/taken_count.h"
#include "host/unique_fd.h"
#include "kova/webapi.h"

namespace kova_host {
namespace {

// Output up to this size is copied through the socket; larger output is handed
// over as the file that holds it.
constexpr off_t kInlineOutput = 64 * 1024;

// How much the last call wrote, -1 before the first.
off_t last_output = -1;
// Where standard output's files are made: the system's temporary folder.
std::string output_dir = "/tmp";

void ResetOutput() {
  fflush(stdout);
  if (last_output == 0) return;  // the file is empty still
  if (ftruncate(STDOUT_FILENO, 0) != 0 || lseek(STDOUT_FILENO, 0, SEEK_SET) != 0) {
    HostLog("runner: cannot reset the captured output");
  }
}

// A fresh, empty file without a name for standard output: O_TMPFILE in the
// temporary folder, else a file made there and unlinked at once, else a memory
// file. -1 when none can be made.
int NewOutputFile() {
  int fd = open(output_dir.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
  if (fd >= 0) return fd;
  std::string name = output_dir + "/kova-webapid-output.XXXXXX";
  fd = mkostemp(name.data(), O_CLOEXEC);
  if (fd >= 0) {
    unlink(name.c_str());
    return fd;
  }
  return memfd_create("kova-webapid-output", MFD_CLOEXEC);
}

// How much the call wrote to standard output, -1 when that can't be told.
off_t OutputSize() {
  fflush(stdout);
  last_output = lseek(STDOUT_FILENO, 0, SEEK_END);
  return last_output;
}

// The first `size` bytes of standard output into `answer`: copied when small,
// else the file itself, standard output going on in a fresh file. False when
// the output can't be handed over.
bool TakeOutput(off_t size, RunnerAnswer& answer) {
  if (size < 0) return false;
  if (size <= kInlineOutput) {
    answer.body.resize(static_cast<size_t>(size));
    size_t done = 0;
    while (done < answer.body.size()) {
      const ssize_t got = pread(STDOUT_FILENO, answer.body.data() + done, answer.body.size() - done,
                                static_cast<off_t>(done));
      if (got <= 0) return false;
      done += static_cast<size_t>(got);
    }
    return true;
  }
  UniqueFd next(NewOutputFile());
  UniqueFd taken(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 0));
  if (!next.valid() || !taken.valid() || dup2(next.get(), STDOUT_FILENO) < 0) return false;
  last_output = 0;
  answer.output = std::move(taken);
  answer.output_size = static_cast<uint64_t>(size);
  return true;
}

std::string Name(const RunnerCall& call) {
  return call.api + " v" + std::to_string(call.version) + " " + call.method;
}

Json::Value Reason(const char* text) {
  Json::Value errors;
  errors["reason"] = text;
  return errors;
}

RunnerAnswer Error(int code, const Json::Value& errors) {
  return {false, code, ToJson(kova::ErrorEnvelope(code, errors))};
}

}  // namespace

RunnerAnswer ExecuteCall(const RunnerCall& call) {
  KOVA::APIRequest request(call.params, call.user, call.language);
  KOVA::APIResponse response;
  ResetOutput();
  int refused = 0;
  const char* failure = nullptr;
  try {
    refused = KOVA::APIRunner::Call(call.api.c_str(), call.version, call.method.c_str(), request,
                                    response);
  } catch (const std::exception& e) {
    HostLog("runner: %s raised an exception: %s", Name(call).c_str(), e.what());
    failure = "the handler raised an exception";
  } catch (...) {
    HostLog("runner: %s raised an exception", Name(call).c_str());
    failure = "the handler raised an exception";
  }
  const off_t output_size = OutputSize();
  if (failure != nullptr) return Error(KOVA::kAPIErrorUnknown, Reason(failure));
  if (refused != 0) return Error(refused, Json::Value());
  if (!response.IsOutputEnabled()) {
    RunnerAnswer answer{true, 0, ""};
    if (TakeOutput(output_size, answer)) return answer;
    HostLog("runner: %s: cannot hand its output over: %s", Name(call).c_str(), strerror(errno));
    return Error(KOVA::kAPIErrorUnknown, Reason("the handler's output cannot be read"));
  }
  if (output_size > 0) {
    HostLog("runner: %s wrote %lld bytes to standard output with the envelope on; dropped",
            Name(call).c_str(), static_cast<long long>(output_size));
  }
  if (response.GetSettleCount() > 1) {
    HostLog("runner: %s settled its answer %d times; the last one counts", Name(call).c_str(),
            response.GetSettleCount());
  }
  switch (response.GetState()) {
    case KOVA::APIResponse::State::kSuccess:
      return {false, 0, ToJson(kova::SuccessEnvelope(response.GetData()))};
    case KOVA::APIResponse::State::kError:
      return Error(response.GetErrorCode(), response.GetData());
    case KOVA::APIResponse::State::kUnset:
      break;
  }
  HostLog("runner: %s returned without an answer", Name(call).c_str());
  return Error(KOVA::kAPIErrorUnknown, Reason("the handler gave no answer"));
}

namespace {

// Mounts `folder` over `tmp` in a mount namespace of the process's own.
bool MountPrivateTmp(const std::string& folder, const std::string& tmp, std::string& error) {
  if (unshare(CLONE_NEWNS) != 0 ||
      mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      mount(folder.c_str(), tmp.c_str(), nullptr, MS_BIND, nullptr) != 0) {
    error = strerror(errno);
    return false;
  }
  return true;
}

}  // namespace

int RunRunner(int fd, const RunnerSetup& setup) {
  const pid_t parent = getppid();
  signal(SIGINT, SIG_IGN);  // the monitor stops the runner
  output_dir = setup.tmp_dir;
  const int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
  const int output = NewOutputFile();
  if (null < 0 || output < 0 || dup2(null, STDIN_FILENO) < 0 || dup2(output, STDOUT_FILENO) < 0) {
    HostLog("runner: cannot set up standard input and output");
    return 1;
  }
  close(null);
  close(output);
  std::string error;
  if (!setup.private_tmp.empty() && !MountPrivateTmp(setup.private_tmp, setup.tmp_dir, error)) {
    HostLog("runner: no %s of its own (%s): files a killed call made there stay",
            setup.tmp_dir.c_str(), error.c_str());
  }
  if (setup.account != nullptr && !TakeEffectiveIds(*setup.account, error)) {
    HostLog("runner: cannot take the ids of %s: %s", setup.account->name.c_str(), error.c_str());
    return 1;
  }
  // Set after the ids changed, which clears it; the runner ends with the monitor.
  if (prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || getppid() != parent) return 1;
  const IdSnapshot ids = SnapshotIds();
  LoadedModule module;
  if (const std::string fault = LoadModule(setup.module_path, module); !fault.empty()) {
    HostLog("module %s left out: %s", setup.module_path.c_str(), fault.c_str());
  }
  if (SendReady(fd, KOVA::APIRunner::List()) != IoResult::kOk) return 1;
  FrameReader reader(fd);
  TakenCount taken(setup.taken_fd);
  for (;;) {
    RunnerCall call;
    const IoResult got = ReceiveCall(reader, call);
    if (got == IoResult::kClosed) return 0;
    if (got == IoResult::kOk || got == IoResult::kMalformed) taken.Add();
    if (got == IoResult::kMalformed) {
      // The frame was read whole, so the runner answers it and takes the next.
      HostLog("runner: refused a malformed call from the front-end");
      Json::Value errors;
      errors["reason"] = "the host could not read the call";
      if (SendAnswer(fd, Error(KOVA::kAPIErrorBadParameter, errors)) != IoResult::kOk) return 1;
      continue;
    }
    if (got != IoResult::kOk) {
      HostLog("runner: unreadable call from the front-end");
      return 1;
    }
    const RunnerAnswer answer = ExecuteCall(call);
    bool changed = false;
    const bool fit = RestoreIds(ids, changed, error);
    if (changed) {
      HostLog("warning: %s left the process's ids changed; %s", Name(call).c_str(),
              fit ? "put back" : ("cannot put them back: " + error).c_str());
    }
    if (SendAnswer(fd, answer) != IoResult::kOk) return 1;
    if (!fit) return 1;
  }
}

}  // namespace kova_host
