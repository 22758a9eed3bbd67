// Metrics of the appliance, from the states that the daemons answer for, as OpenMetrics text or in the older
// text format that a textfile collector reads.
#pragma once

#include <array>
#include <functional>
#include <string>
#include <vector>

#include "peers/mgmtctl/link.h"
#include "peers/mgmtctl/metrics_table.h"

// The lines of the samples by the place of their family.
using metric_lines = std::array<std::string, std::size(metric_families)>;

// Several nodes, or walks of several, in one request. False: no answer.
using metric_source =
    std::function<bool(ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out)>;
// False: mgmtd did not answer, and the samples only say that it is down. A daemon that does not answer leaves
// its samples out, and wccp_daemon_up is 0 for it.
bool gather_metrics(const metric_source &source, metric_lines *out);

enum class metric_format { openmetrics, text };
// The pieces of the text, one after the other.
std::vector<std::string> metrics_text(metric_lines samples, metric_format format);
const char *metrics_content_type(metric_format format);

// One HTTP request on standard input, its answer on standard output, as a socket unit starts it for each
// connection: GET or HEAD of /metrics, in OpenMetrics when the request accepts that. Bounded in size and
// time.
int serve_metrics_request(const ctl_link &link);
