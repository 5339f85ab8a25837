// `kova user`: the accounts that may sign in to the web-API host.

#ifndef KOVA_PLATFORM_TOOLS_KOVA_USER_H_
#define KOVA_PLATFORM_TOOLS_KOVA_USER_H_

#include <string>
#include <vector>

// Runs `kova user ARGS...`; returns the command's exit status.
int UserCommand(const std::vector<std::string>& args);

#endif  // KOVA_PLATFORM_TOOLS_KOVA_USER_H_
