// The methods of "KOVA.ResourceMonitor.Usage": the statistics that kovastatd
// collects, as it answers them.
//
// Each method sends one request to the collector and answers its DATA
// unchanged; a parameter refused answers 101 with {"param": NAME} and sends
// nothing. See query/query_params.h for the parameters and
// query/collector_exchange.h for the errors.

#ifndef USAGE_QUERY_USAGE_API_H_
#define USAGE_QUERY_USAGE_API_H_

#include "kova/webapi.h"

// The collector's series, its interval and the state of its history.
void usage_catalog_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// The recent samples of "series" after "since".
void usage_realtime_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// "series" between "from" and "to" from the history database, reduced to at
// most "points" points each.
void usage_history_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

#endif  // USAGE_QUERY_USAGE_API_H_
