// Control of the in-memory test platform, libkova_fake.so.
//
// The fake implements every function of the platform headers over in-memory
// state. A test resets it, arranges configuration keys, services, replies and
// failures, runs the code under test, and then looks at the calls the platform
// received and the lines written to the system log.

#ifndef KOVA_FAKE_KOVA_FAKE_H_
#define KOVA_FAKE_KOVA_FAKE_H_

#include <json/value.h>

#include <optional>
#include <string>
#include <vector>

#include "kova/perfevent.h"

// The whole control API is exported from the fake library.
#pragma GCC visibility push(default)
namespace kova_fake {

// Forgets everything arranged and recorded; the registry of in-process web APIs
// is the common platform's and is not touched.
void Reset();

// Configuration files.
void SetConf(const std::string& file, const std::string& key, const std::string& value);
std::optional<std::string> GetConf(const std::string& file, const std::string& key);
// Reads of `key` in `file` (of every key when `key` is empty) return `result` (negative).
void FailConfRead(const std::string& file, int result, const std::string& key = "");
// Every write of `key` into the system settings file returns `result` (negative).
void FailConfWrite(const std::string& key, int result);

// Services: running state, display names, and failures of an operation
// ("start", "stop" or "reload") with `result`.
void SetServiceRunning(const std::string& name, bool running);
void SetServiceDisplayName(const std::string& name, const std::string& display);
void FailService(const std::string& name, const std::string& operation, int result);

// Shared folders: what KOVAShareServiceVolumeGetbyLink answers for `link`
// (0, not found, unless set).
void SetVolumeLookup(const std::string& link, int result, const std::string& volume);

// The statistics service: each Transmitor exchange takes the next queued one.
// With none queued, Transmit fails as if the service were absent.
struct Exchange {
  int transmit_result = 0;
  int get_result = 0;
  Json::Value reply;
};
void QueueExchange(const Exchange& exchange);

// Localised texts, looked up when StringBundle::Text is called.
void SetText(const std::string& section, const std::string& key, const std::string& text);

// The performance-event log: whether its file exists, the lines a fetch writes
// (each followed by a line feed), and a fetch, a path lookup or a clean that
// fails. KOVALogWrite appends a line. Fetch and clean are recorded with the
// effective user id they ran under, as in "KOVALogClean 18 euid=0".
void SetLogLines(const std::vector<std::string>& lines);
void FailLogFetch(bool fail);
void FailLogPath(bool fail);
void FailLogClean(bool fail);
// Paths handed out by QLIBCFileITmpName.
const std::vector<std::string>& TempFiles();

// The rule store. Ids are assigned "1", "2", ... on add. Adds and sets refuse
// what the platform's store refuses: a record that is none (KOVA_ERR_INVALID)
// and a repeated object, resource and severity (KOVA_ERR_PERFEVENT_DUPLICATE).
// A failing add or set arranged here returns -1 with `error` as the last
// platform error.
void FailRuleWrite(int error);
// Stores `rule` under the next id without recording a call or checking it, and
// returns the id.
std::string AddRule(KOVAPERFEVENT_CONF_SETTING rule);
std::vector<KOVAPERFEVENT_CONF_SETTING> Rules();
// What KOVAPerfEventConfListGet hands out for a stored id or for all rules.
enum class RuleListAnswer { kRules, kNull, kEmptyHead };
void SetRuleListAnswer(RuleListAnswer answer);
// Lists not yet freed; gets and frees are calls, a stray free "KOVAPerfEventConfListFree not open".
int OpenRuleLists();
// Adds, sets and deletes made while the effective user id was not 0.
int UnprivilegedRuleWrites();

// Platform calls that read or change state, one line each, such as
// "QLIBCINFOSetKeyValue resourcemonitor_history=yes" or "QLIBServiceStart kovaperfeventd".
const std::vector<std::string>& Calls();

// Lines written with syslog(3), with their priority (facility and level).
struct SyslogLine {
  int priority;
  std::string text;
  bool operator==(const SyslogLine&) const = default;
};
const std::vector<SyslogLine>& Syslog();

}  // namespace kova_fake
#pragma GCC visibility pop

#endif  // KOVA_FAKE_KOVA_FAKE_H_
