// Metrics of the appliance, made from the state nodes of the daemons, as OpenMetrics text or in the older
// text format that textfile collectors read.
#pragma once

#include <array>
#include <functional>
#include <string>
#include <vector>

#include "peers/mgmtctl/link.h"
#include "peers/mgmtctl/metrics_table.h"

// The lines of samples, indexed like metric_families.
using metric_lines = std::array<std::string, std::size(metric_families)>;

// Queries several nodes or walks in one request. False: no answer.
using metric_source =
    std::function<bool(ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out)>;
// False: mgmtd did not answer, and the only sample is that it is down. A daemon that does not answer has no
// samples but wccp_daemon_up, which is 0.
bool gather_metrics(const metric_source &source, metric_lines *out);

enum class metric_format { openmetrics, text };
// The pieces of the text, one after the other.
std::vector<std::string> metrics_text(metric_lines samples, metric_format format);
const char *metrics_content_type(metric_format format);

// Answers one HTTP request, GET or HEAD of /metrics, from standard input on standard output: a socket unit
// starts the program for each connection. The format is OpenMetrics if the request accepts it. Size and time
// of the request are limited.
int serve_metrics_request(const ctl_link &link);
