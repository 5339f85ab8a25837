// A sample's metrics as Prometheus scrapes them: the text format 0.0.4, or
// OpenMetrics 1.0 for a scraper that asks for it. The machine's metrics carry
// node_exporter's names, labels and units, so that dashboards and alert rules
// made for it work; the system's own carry the prefix "kova_".

#ifndef KOVA_DAEMONS_STATD_METRICS_TEXT_H_
#define KOVA_DAEMONS_STATD_METRICS_TEXT_H_

#include <string>
#include <string_view>

#include "statd/metrics_sample.h"

namespace statd {

enum class MetricsFormat { kPrometheus, kOpenMetrics };

constexpr char kPrometheusContentType[] = "text/plain; version=0.0.4; charset=utf-8";
constexpr char kOpenMetricsContentType[] =
    "application/openmetrics-text; version=1.0.0; charset=utf-8";

// The format an Accept header asks for: OpenMetrics when it names
// application/openmetrics-text, the text format otherwise.
MetricsFormat FormatFor(std::string_view accept);

// Every metric of `sample` in `format`, each family with its HELP and TYPE
// lines; a family without a value is left out. OpenMetrics ends with "# EOF".
std::string RenderMetrics(const MetricsSample& sample, MetricsFormat format);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_METRICS_TEXT_H_
