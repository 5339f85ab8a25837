// The rules as the rule store holds them, and whether the store has changed
// since they were read.

#ifndef KOVA_DAEMONS_PERFEVENTD_RULE_LOADER_H_
#define KOVA_DAEMONS_PERFEVENTD_RULE_LOADER_H_

#include <sys/types.h>

#include <ctime>
#include <string>
#include <vector>

#include "perfeventd/rule.h"
#include "src/file_stamp.h"

namespace perfeventd {

// Replaces `rules` with the enabled rules of the store, in its order. False
// when the store can't be read; `rules` is then left as it was.
bool LoadEnabledRules(std::vector<Rule>& rules);

// Notices writes to the rule store that came without a reload signal: the
// store's files (the database and its write-ahead log) changed since Mark.
class StoreWatch {
 public:
  // Takes the files' state as the one the rules were read from.
  void Mark();
  bool Changed() const;

 private:
  kova::FileStamp database_;
  kova::FileStamp journal_;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_RULE_LOADER_H_
