// One page of a list the handlers answer: the entries from `offset`, at most
// `limit` of them when it is positive, all of them when it is negative.

#ifndef RESOURCEMONITOR_API_PAGE_H_
#define RESOURCEMONITOR_API_PAGE_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>

// `entry_at(i)` gives the JSON value of entry `i` of `count`; only the entries
// of the page are asked for. A negative offset or a zero limit gives an empty
// page, and so does an offset past the end.
template <typename EntryAt>
Json::Value Page(size_t count, int64_t offset, int64_t limit, EntryAt entry_at) {
  Json::Value page(Json::arrayValue);
  if (offset < 0 || limit == 0) return page;
  for (size_t i = static_cast<size_t>(offset); i < count; ++i) {
    if (limit > 0 && page.size() == static_cast<uint64_t>(limit)) break;
    page.append(entry_at(i));
  }
  return page;
}

#endif  // RESOURCEMONITOR_API_PAGE_H_
