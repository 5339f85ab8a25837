// The statistics service's request for a method of "KOVA.ResourceMonitor.Usage",
// built from the call's parameters.
//
// "series" is a JSON array of 1 to 64 series ids, each a string of 1 to 256
// bytes (64 of them stay far below the service's 64 KiB request line).
// "since", "from" and "to" are Unix seconds from 0 to 2^40; "points" is 1 to
// 10000. A whole number must come as a JSON number: 60 and 60.0 are taken, 60.5
// and the text "60" are refused. An optional number left out is sent with its
// default (since 0, points 600), so that the request says what was asked.
// Parameters the method doesn't know are ignored.

#ifndef USAGE_QUERY_QUERY_PARAMS_H_
#define USAGE_QUERY_QUERY_PARAMS_H_

#include <json/value.h>

#include <optional>
#include <string>

#include "kova/webapi.h"

// Builds the request object of `method` ("catalog", "realtime" or "history")
// from the call's parameters. On success returns it, {"request": METHOD, ...}.
// On failure returns nullopt and sets `refused` to the first parameter refused
// ("method" for a method that isn't one of the three).
std::optional<Json::Value> BuildCollectorRequest(const std::string& method,
                                                 const KOVA::APIRequest& call,
                                                 std::string& refused);

#endif  // USAGE_QUERY_QUERY_PARAMS_H_
