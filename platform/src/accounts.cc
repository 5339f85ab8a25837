#include "src/accounts.h"

#include <crypt.h>
#include <errno.h>

#include <memory>
#include <mutex>

#include "kova/error.h"
#include "src/atomic_file.h"
#include "src/privilege.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr size_t kMaxPassword = 1024;

struct Record {
  std::string name;
  bool admin = false;
  std::string hash;
};

bool Fail(int error) {
  KOVA_SET_ERROR(error);
  return false;
}

int Failed(int error) {
  KOVA_SET_ERROR(error);
  return -1;
}

bool IsPassword(const std::string& password) {
  return !password.empty() && password.size() <= kMaxPassword &&
         password.find_first_of(std::string("\0\r\n", 3)) == std::string::npos;
}

// The crypt(3) hash of `password` under `setting` (a fresh salt or a stored
// hash), empty on failure.
std::string Crypt(const std::string& password, const char* setting) {
  auto data = std::make_unique<crypt_data>();
  const char* hash = crypt_rn(password.c_str(), setting, data.get(), sizeof(crypt_data));
  return hash != nullptr && hash[0] != '*' ? hash : "";
}

std::string Hash(const std::string& password) {
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  if (crypt_gensalt_rn(nullptr, 0, nullptr, 0, salt, sizeof(salt)) == nullptr) return "";
  return Crypt(password, salt);
}

// Compares in time that depends on the lengths only.
bool SameText(const std::string& a, const std::string& b) {
  unsigned char differ = a.size() != b.size();
  for (size_t i = 0; i < a.size() && i < b.size(); ++i) differ |= a[i] ^ b[i];
  return differ == 0;
}

bool Read(std::vector<Record>& records) {
  records.clear();
  std::string content;
  RootScope root;
  if (!ReadWholeFile(RootPath(kAccountsPath), content)) {
    return errno == ENOENT ? true : Fail(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
  }
  size_t start = 0;
  while (start < content.size()) {
    size_t end = content.find('\n', start);
    if (end == std::string::npos) end = content.size();
    const std::string line = content.substr(start, end - start);
    start = end + 1;
    if (line.empty()) continue;
    const size_t first = line.find(':');
    const size_t second = first == std::string::npos ? first : line.find(':', first + 1);
    if (second == std::string::npos) return Fail(KOVA_ERR_FORMAT);
    Record record{line.substr(0, first), false, line.substr(second + 1)};
    const std::string role = line.substr(first + 1, second - first - 1);
    if (!IsAccountName(record.name) || (role != "admin" && role != "user") || record.hash.empty()) {
      return Fail(KOVA_ERR_FORMAT);
    }
    record.admin = role == "admin";
    records.push_back(std::move(record));
  }
  return true;
}

bool Write(const std::vector<Record>& records) {
  std::string content;
  for (const Record& record : records) {
    content += record.name + (record.admin ? ":admin:" : ":user:") + record.hash + "\n";
  }
  if (!ReplaceFile(RootPath(kAccountsPath), content, 0600)) {
    return Fail(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
  }
  return true;
}

// Reads the accounts under the file's lock, lets `change` edit them and writes
// them back when it returns 0. Returns what `change` returned, or -1.
template <typename Change>
int Update(Change change) {
  RootScope root;
  return UpdateFile<std::vector<Record>>(RootPath(kAccountsPath), Read, change, Write);
}

std::vector<Record>::iterator Find(std::vector<Record>& records, const std::string& name) {
  for (auto it = records.begin(); it != records.end(); ++it) {
    if (it->name == name) return it;
  }
  return records.end();
}

}  // namespace

bool IsAccountName(std::string_view name) {
  if (name.empty() || name.size() > 32 || name.front() == '.' || name.front() == '-') return false;
  for (char c : name) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '.' || c == '_' || c == '-';
    if (!ok) return false;
  }
  return true;
}

int AddAccount(const std::string& name, const std::string& password, bool admin) {
  if (!IsAccountName(name) || !IsPassword(password)) return Failed(KOVA_ERR_INVALID);
  const std::string hash = Hash(password);
  if (hash.empty()) return Failed(KOVA_ERR_INVALID);
  return Update([&](std::vector<Record>& records) {
    if (Find(records, name) != records.end()) return 1;
    records.push_back({name, admin, hash});
    return 0;
  });
}

int SetAccountPassword(const std::string& name, const std::string& password) {
  if (!IsAccountName(name) || !IsPassword(password)) return Failed(KOVA_ERR_INVALID);
  const std::string hash = Hash(password);
  if (hash.empty()) return Failed(KOVA_ERR_INVALID);
  return Update([&](std::vector<Record>& records) {
    auto it = Find(records, name);
    if (it == records.end()) return 1;
    it->hash = hash;
    return 0;
  });
}

int RemoveAccount(const std::string& name) {
  if (!IsAccountName(name)) return Failed(KOVA_ERR_INVALID);
  return Update([&](std::vector<Record>& records) {
    auto it = Find(records, name);
    if (it == records.end()) return 1;
    records.erase(it);
    return 0;
  });
}

bool ListAccounts(std::vector<AccountEntry>& accounts) {
  accounts.clear();
  std::vector<Record> records;
  if (!Read(records)) return false;
  for (const Record& record : records) accounts.push_back({record.name, record.admin});
  return true;
}

int CheckAccountPassword(const std::string& name, const std::string& password, bool& admin) {
  admin = false;
  std::vector<Record> records;
  if (!Read(records)) return -1;
  auto it = Find(records, name);
  // An unknown account costs a hash too, so that timing doesn't tell which names exist.
  static std::once_flag once;
  static std::string decoy;
  std::call_once(once, [] { decoy = Hash("decoy password"); });
  const std::string& stored = it != records.end() ? it->hash : decoy;
  const std::string hash = stored.empty() ? "" : Crypt(password, stored.c_str());
  if (it == records.end() || hash.empty() || !SameText(hash, stored)) return 0;
  admin = it->admin;
  return 1;
}

}  // namespace kova
