#include "tools/kova_user.h"

#include <termios.h>
#include <unistd.h>

#include <cstdio>
#include <iostream>

#include "kova/error.h"
#include "src/accounts.h"

namespace {

constexpr char kHelp[] =
    "usage: kova user add NAME [--admin]\n"
    "       kova user passwd NAME\n"
    "       kova user remove NAME\n"
    "       kova user list\n"
    "Keeps the accounts that may sign in to the web-API host, /etc/kova/accounts.\n"
    "`add` and `passwd` read the password, one line, from standard input.\n"
    "Administrators may call every method of the modules.\n";

int Usage(bool asked) {
  fputs(kHelp, asked ? stdout : stderr);
  return asked ? 0 : 2;
}

// Reads one line from standard input, without echo on a terminal.
bool ReadPassword(std::string& password) {
  const bool terminal = isatty(STDIN_FILENO) != 0;
  termios saved{};
  if (terminal && tcgetattr(STDIN_FILENO, &saved) == 0) {
    termios quiet = saved;
    quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet);
    fputs("Password: ", stderr);
  }
  const bool got = static_cast<bool>(std::getline(std::cin, password));
  if (terminal) {
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &saved);
    fputs("\n", stderr);
  }
  if (!password.empty() && password.back() == '\r') password.pop_back();
  return got;
}

int Failed(const char* what, const std::string& name) {
  const int error = QLIBCErrGet();
  const char* why = error == KOVA_ERR_INVALID      ? "invalid name or password"
                    : error == KOVA_ERR_PERMISSION ? "permission denied"
                    : error == KOVA_ERR_FORMAT     ? "the accounts file is malformed"
                                                   : "input/output error";
  fprintf(stderr, "kova: cannot %s %s: %s\n", what, name.c_str(), why);
  return 1;
}

}  // namespace

int UserCommand(const std::vector<std::string>& args) {
  for (const std::string& arg : args) {
    if (arg == "--help" || arg == "-h") return Usage(true);
  }
  if (args.size() == 1 && args[0] == "list") {
    std::vector<kova::AccountEntry> accounts;
    if (!kova::ListAccounts(accounts)) return Failed("list", "the accounts");
    for (const kova::AccountEntry& account : accounts) {
      printf("%s\t%s\n", account.name.c_str(), account.admin ? "admin" : "user");
    }
    return 0;
  }
  const bool add = !args.empty() && args[0] == "add";
  const bool admin = add && args.size() == 3 && args[2] == "--admin";
  if (args.size() != 2 && !admin) return Usage(false);
  const std::string& name = args[1];
  if (!kova::IsAccountName(name)) {
    fprintf(stderr, "kova: %s can't name an account\n", name.c_str());
    return 1;
  }
  if (args[0] == "remove") {
    const int result = kova::RemoveAccount(name);
    if (result == 1) fprintf(stderr, "kova: no account %s\n", name.c_str());
    return result == 0 ? 0 : result == 1 ? 1 : Failed("remove", name);
  }
  if (!add && args[0] != "passwd") return Usage(false);
  std::string password;
  if (!ReadPassword(password) || password.empty()) {
    fputs("kova: no password on standard input\n", stderr);
    return 1;
  }
  const int result =
      add ? kova::AddAccount(name, password, admin) : kova::SetAccountPassword(name, password);
  if (result == 1) {
    fprintf(stderr, add ? "kova: account %s exists\n" : "kova: no account %s\n", name.c_str());
    return 1;
  }
  return result == 0 ? 0 : Failed(add ? "add" : "change the password of", name);
}
