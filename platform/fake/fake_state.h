// The in-memory state behind the test platform, shared by its sources.

#ifndef KOVA_FAKE_FAKE_STATE_H_
#define KOVA_FAKE_FAKE_STATE_H_

#include <deque>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "fake/kova_fake.h"

namespace kova_fake {

struct Service {
  bool running = false;
  std::optional<std::string> display;
  std::map<std::string, int> failures;  // operation -> result
};

struct State {
  std::map<std::string, std::map<std::string, std::string>> conf;         // file -> key -> value
  std::map<std::pair<std::string, std::string>, int> conf_read_failures;  // file, key -> result
  std::map<std::string, int> conf_write_failures;                         // key -> result
  std::map<std::string, Service> services;
  std::map<std::string, std::pair<int, std::string>> volumes;
  std::deque<Exchange> exchanges;
  std::map<std::string, std::map<std::string, std::string>> texts;  // section -> key -> text
  std::optional<std::string> log_text;  // every line and its line feed; absent: no log file
  int log_records = 0;
  bool log_fetch_fails = false;
  bool log_path_fails = false;
  bool log_clean_fails = false;
  std::vector<std::string> temp_files;
  std::vector<KOVAPERFEVENT_CONF_SETTING> rules;
  int next_rule_id = 1;
  int rule_write_error = 0;
  RuleListAnswer rule_list_answer = RuleListAnswer::kRules;
  std::set<const KovaPerfEventConfSettingNode*> open_rule_lists;
  int unprivileged_rule_writes = 0;
  std::vector<std::string> calls;
  std::vector<SyslogLine> syslog;
};

State& TheState();

// Records a platform call.
void Record(const std::string& call);

// Creates or removes the file that stands for the performance-event log, so
// that existence tests on its path see what was arranged.
void SyncLogFile();
// Its path.
const std::string& LogFilePath();

}  // namespace kova_fake

#endif  // KOVA_FAKE_FAKE_STATE_H_
