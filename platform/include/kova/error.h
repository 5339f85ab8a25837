// The platform's last error.
//
// A platform call that fails records an error number and the platform source
// file and line where it failed, for the calling thread; the next failure of the
// thread replaces it and a success leaves it as it was.

#ifndef KOVA_ERROR_H_
#define KOVA_ERROR_H_

#include "kova/export.h"

// Platform error numbers.
enum KOVAPlatformError : int {
  KOVA_ERR_NONE = 0x0000,             // nothing has failed on this thread
  KOVA_ERR_INVALID = 0x0100,          // a null, empty or malformed argument, or a buffer too small
  KOVA_ERR_NOMEM = 0x0200,            // out of memory
  KOVA_ERR_IO = 0x0300,               // a file could not be read or written
  KOVA_ERR_PERMISSION = 0x0400,       // the process lacks the rights for the work
  KOVA_ERR_NOT_FOUND = 0x0500,        // the named file, key, log, rule or LUN does not exist
  KOVA_ERR_FORMAT = 0x0600,           // a file or a reply is not in the expected form
  KOVA_ERR_SERVICE_UNKNOWN = 0x1000,  // no service of that name is described
  KOVA_ERR_SERVICE_FAILED = 0x1001,   // a service could not be started, stopped or signalled
  KOVA_ERR_CONNECT = 0x1100,          // a local service could not be reached
  KOVA_ERR_TIMEOUT = 0x1101,          // a local service did not answer in time
  KOVA_ERR_STORE = 0x2000,            // a store's database failed
  KOVA_ERR_PERFEVENT_DUPLICATE = 0x2300,  // a rule would repeat another rule's object,
                                          // resource and severity
};

// The calling thread's last error number, KOVA_ERR_NONE when none was recorded.
KOVA_API int QLIBCErrGet();
// The platform source file that recorded it, "" when none.
KOVA_API const char* QLIBCErrorGetFile();
// The line in that file, 0 when none.
KOVA_API int QLIBCErrorGetLine();

// Records `error` at `file`:`line` as the calling thread's last error. `file`
// must stay valid for the life of the process (a string literal).
KOVA_API void QLIBCErrSet(int error, const char* file, int line);

// Records `error` at the place where the macro is used.
#define KOVA_SET_ERROR(error) QLIBCErrSet((error), __FILE_NAME__, __LINE__)

#endif  // KOVA_ERROR_H_
