// "mgmtctl metrics": to standard output, or as the answer to one HTTP request (RFC 9112) that a socket unit
// has accepted.
#include <cerrno>
#include <cstring>

#include <poll.h>
#include <unistd.h>

#include "peers/mgmtctl/commands.h"
#include "peers/mgmtctl/metrics.h"
#include "peers/mgmtctl/render.h"
#include "runtime/ttime.h"

namespace {

constexpr size_t REQUEST_MAX = 8192;
constexpr int64_t REQUEST_MS = 5000;

// The request with its headers, or the part of it that arrived within the limits of time and size.
std::string read_request() {
    std::string request;
    const int64_t until = lt_monotonic_ms() + REQUEST_MS;
    // GET and HEAD have no body: the request ends with the empty line after the headers.
    while (request.size() < REQUEST_MAX && request.find("\r\n\r\n") == std::string::npos) {
        pollfd in = {STDIN_FILENO, POLLIN, 0};
        const int64_t left = until - lt_monotonic_ms();
        if (left <= 0 || poll(&in, 1, static_cast<int>(left)) <= 0)
            break;
        char some[1024];
        const ssize_t got = read(STDIN_FILENO, some, sizeof some);
        if (got <= 0)
            break;
        request.append(some, static_cast<size_t>(got));
    }
    return request;
}

int answer_request(const char *status, const char *type, const std::vector<std::string> &body, bool with_body,
                   int code) {
    size_t length = 0;
    for (const std::string &piece : body)
        length += piece.size();
    write_output("HTTP/1.1 " + std::string(status) + "\r\nContent-Type: " + type +
                 "\r\nContent-Length: " + std::to_string(length) + "\r\nConnection: close\r\n\r\n");
    for (const std::string &piece : body)
        // The answer to HEAD has the length of the body, but not the body.
        if (with_body)
            write_output(piece);
    return code;
}

metric_source make_metric_source(const ctl_link &link) {
    return [link](ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out) {
        std::string reason;
        return link.query_all(walk, names, out, &reason);
    };
}

} // namespace

int serve_metrics_request(const ctl_link &link) {
    static constexpr char PLAIN[] = "text/plain; charset=utf-8";
    const std::string request = read_request();
    const size_t end = request.find("\r\n");
    if (end == std::string::npos || request.find("\r\n\r\n") == std::string::npos)
        return answer_request("400 Bad Request", PLAIN, {"no complete request\n"}, true, CTL_USAGE);
    const std::string first = request.substr(0, end);
    const bool head = first.starts_with("HEAD ");
    if (!head && !first.starts_with("GET "))
        return answer_request("405 Method Not Allowed", PLAIN, {"GET and HEAD only\n"}, true, CTL_USAGE);
    const size_t from = first.find(' ') + 1, to = first.find(' ', from);
    if (first.substr(from, to - from) != "/metrics")
        return answer_request("404 Not Found", PLAIN, {"the metrics are at /metrics\n"}, !head, CTL_USAGE);
    // Any mention of the modern format selects it; the weights of an Accept header are not compared.
    const metric_format format = request.find("application/openmetrics-text") != std::string::npos
                                     ? metric_format::openmetrics
                                     : metric_format::text;
    // If mgmtd does not answer, the samples report that.
    metric_lines samples;
    (void)gather_metrics(make_metric_source(link), &samples);
    return answer_request("200 OK", metrics_content_type(format), metrics_text(std::move(samples), format),
                          !head, CTL_OK);
}

int ctl_metrics(const ctl_options &options, bool text, bool http) {
    const ctl_link link = link_to_mgmtd(options);
    if (http)
        return serve_metrics_request(link);
    metric_lines samples;
    const bool answered = gather_metrics(make_metric_source(link), &samples);
    for (const std::string &piece :
         metrics_text(std::move(samples), text ? metric_format::text : metric_format::openmetrics))
        write_output(piece);
    return answered ? CTL_OK : CTL_UNREACHABLE;
}
