// The last platform error of each thread.

#include "kova/error.h"

namespace {

struct LastError {
  int error = KOVA_ERR_NONE;
  const char* file = "";
  int line = 0;
};

thread_local LastError last_error;

}  // namespace

int QLIBCErrGet() { return last_error.error; }

const char* QLIBCErrorGetFile() { return last_error.file; }

int QLIBCErrorGetLine() { return last_error.line; }

void QLIBCErrSet(int error, const char* file, int line) {
  last_error = {error, file != nullptr ? file : "", line};
}
