// Metrics of the appliance, from the states that the daemons answer for, as OpenMetrics text or in the older
// text format that a textfile collector reads.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/nodes.h"

enum class metric_kind { gauge, counter, info };
// One sample. `family` is its name without the suffix that its kind adds ("_total", "_info").
struct metric_sample {
    std::string family;
    metric_kind kind;
    std::string help;
    std::string labels; // group="51",router="10.0.0.1"; values are escaped
    std::string value;
};
// False: mgmtd did not answer, and the samples only say that it is down. A daemon that does not answer leaves
// its samples out, and wccp_daemon_up is 0 for it.
bool gather_metrics(const ctl_ask &ask, std::vector<metric_sample> *out);

enum class metric_format { openmetrics, text };
// Families in the order in which they first occur, the samples of each together.
std::string metrics_text(const std::vector<metric_sample> &samples, metric_format format);
const char *metrics_content_type(metric_format format);

// One HTTP request on standard input, its answer on standard output, as a socket unit starts it for each
// connection: GET or HEAD of /metrics, in OpenMetrics when the request accepts that. Bounded in size and
// time.
struct ctl_link;
int serve_metrics_request(const ctl_link &link);
