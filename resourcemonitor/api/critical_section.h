// Privileged sections around work that needs root rights.
//
// ENTERCriticalSection raises the effective group and user ids of the whole
// process to 0; LEAVECriticalSection puts back the ids saved at entry. Both log
// to the authorisation facility as "<source>:<line> ...": a warning each time an
// id is raised to 0, an error line for a call that fails.

#ifndef RESOURCEMONITOR_API_CRITICAL_SECTION_H_
#define RESOURCEMONITOR_API_CRITICAL_SECTION_H_

#include <sys/types.h>

// The effective ids saved at entry.
struct CriticalSection {
  uid_t euid;
  gid_t egid;
};

// Saves the effective ids into `section`, then raises the group id and the user
// id to 0 where they are not. On success errno is 0. On a failed call it logs
// the call and "ERROR: ENTERCriticalSection", sets errno to 1 and returns with the
// ids it could get; the caller's work goes on all the same.
void ENTERCriticalSection(CriticalSection& section, const char* source, int line);

// Puts back the effective ids saved in `section`. On success errno is 0. On a
// failed call it logs the call and "ERROR: LEAVECriticalSection", sets errno to 1
// and skips the remaining steps.
void LEAVECriticalSection(const CriticalSection& section, const char* source, int line);

#endif  // RESOURCEMONITOR_API_CRITICAL_SECTION_H_
