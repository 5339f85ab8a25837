// The accounts that may sign in to the web-API host: /etc/kova/accounts under
// the system root, mode 0600, one account a line as NAME:ROLE:HASH, ROLE being
// "admin" or "user" and HASH a salted crypt(3) hash of the password.

#ifndef KOVA_PLATFORM_SRC_ACCOUNTS_H_
#define KOVA_PLATFORM_SRC_ACCOUNTS_H_

#include <string>
#include <string_view>
#include <vector>

#include "kova/export.h"

namespace kova {

inline constexpr char kAccountsPath[] = "/etc/kova/accounts";

struct AccountEntry {
  std::string name;
  bool admin = false;
};

// Whether `name` can name an account: 1 to 32 of A-Z a-z 0-9 . _ -, not
// starting with a dot or a dash.
KOVA_API bool IsAccountName(std::string_view name);

// Adds an account. Returns 0; 1 when the name is taken; -1 with the last
// platform error set when the name or password is unacceptable (a password is
// 1 to 1024 bytes without NUL or line breaks) or the file can't be written.
KOVA_API int AddAccount(const std::string& name, const std::string& password, bool admin);

// Gives an account a new password. Returns 0; 1 when there is no such account;
// -1 with the last platform error set on failure.
KOVA_API int SetAccountPassword(const std::string& name, const std::string& password);

// Removes an account. Returns 0; 1 when there is no such account; -1 on failure.
KOVA_API int RemoveAccount(const std::string& name);

// The accounts in file order. False with the last platform error set when the
// file can't be read or is malformed; a missing file holds no accounts.
KOVA_API bool ListAccounts(std::vector<AccountEntry>& accounts);

// Checks a password. Returns 1 when it is the account's, filling `admin`; 0
// when it is not or there is no such account (both take about as long); -1
// with the last platform error set when the file can't be read.
KOVA_API int CheckAccountPassword(const std::string& name, const std::string& password,
                                  bool& admin);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_ACCOUNTS_H_
