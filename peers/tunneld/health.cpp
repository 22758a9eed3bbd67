// Each group has one check at a time, a connection or a process. The group's timer is the time limit while a
// check runs, and otherwise the wait for the next one.
//
// A command runs in a process group of its own, all of which is killed when the time limit is over. When the
// command ends, the rest of its group is killed before the command is reaped: until then its number cannot
// belong to another group. A killed process that does not end, for example on a file system that hangs, stays
// in `commands` until it does.
#include "peers/tunneld/health.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <list>
#include <memory>
#include <random>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h> // without extern "C" of its own in glibc 2.36
}

#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {
constexpr int64_t CHECK_MAX_MS = 10000;
constexpr int64_t KILL_MAX_MS = 1000;
constexpr int64_t STAGGER_MS = 2;         // between the first checks of many new ones
constexpr size_t ANSWER_MAX_BYTES = 4096; // read at most to find the first line
constexpr size_t LINGERING_MAX = 64;      // killed commands that have not ended
constexpr char COMMAND_PATH[] = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";

struct running_command {
    health_monitor *owner = nullptr;
    pid_t pid = 0;
    int pidfd = -1;
    loop_event *end = nullptr;
};

struct watched_proxy {
    health_monitor *owner = nullptr;
    uint8_t group = 0;
    health_check check;
    uint16_t port = 0;
    bool settled = false; // this check has had a result
    uint32_t row = 0;     // consecutive results that contradict the state
    loop_event *timer = nullptr, *socket = nullptr;
    int fd = -1;
    std::string unsent, answer;
    running_command *command = nullptr; // in the owner's list
    enum { waiting, checking } phase = waiting;
};
} // namespace

struct health_monitor {
    loop_context *loop = nullptr;
    std::function<void(uint8_t group)> changed;
    std::map<uint8_t, std::unique_ptr<watched_proxy>> checks;
    std::map<uint8_t, proxy_health> states;
    std::list<running_command> commands; // all that run, also killed ones that no check waits for
    std::minstd_rand random{static_cast<uint32_t>(lt_monotonic_ms())};
};

namespace {
// --- Results

int64_t next_wait_ms(watched_proxy *self) {
    const auto interval = static_cast<int64_t>(self->check.interval_s) * 1000;
    // Up to 5 % earlier or later, so that checks that begin together drift apart.
    std::uniform_int_distribution<int64_t> spread(-interval / 20, interval / 20);
    return interval + spread(self->owner->random);
}

int64_t time_limit_ms(const watched_proxy *self) {
    return std::min(static_cast<int64_t>(self->check.interval_s) * 1000, CHECK_MAX_MS);
}

void take_command_end(int fd, short flags, void *data);

// Resets the connection: it leaves neither a half-open connection in the proxy nor a port in TIME_WAIT here.
void close_check_socket(watched_proxy *self) {
    loop_event_free(&self->socket);
    if (self->fd < 0)
        return;
    const linger reset = {1, 0};
    (void)setsockopt(self->fd, SOL_SOCKET, SO_LINGER, &reset, sizeof reset);
    close(self->fd);
    self->fd = -1;
}

void stop_check(watched_proxy *self) {
    close_check_socket(self);
    self->unsent.clear();
    self->answer.clear();
    if (self->command) // it is reaped by take_command_end()
        kill(-self->command->pid, SIGKILL);
    self->command = nullptr;
}

// `failure` is "" for a successful check.
void finish_check(watched_proxy *self, const std::string &failure) {
    health_monitor *monitor = self->owner;
    stop_check(self);
    self->phase = watched_proxy::waiting;
    // The interval counts from the end of a check, whatever its result.
    if (loop_event_set_timer(self->timer, next_wait_ms(self)) != LC_OK)
        LC_LOG(LC_LOG_ERR, "The proxy of group %d is no longer checked: no timer", self->group);
    proxy_health &health = monitor->states[self->group];
    const bool good = failure.empty();
    health.checks++;
    if (!good) {
        health.failures++;
        health.reason = failure;
    }
    const auto wanted = good ? proxy_health::up : proxy_health::down;
    // A result that agrees with the state ends a series of contrary ones.
    self->row = health.state == wanted ? 0 : self->row + 1;
    const bool enough = !self->settled || self->row >= (good ? self->check.rise : self->check.fall);
    self->settled = true;
    if (health.state == wanted || !enough)
        return;
    self->row = 0;
    health.state = wanted;
    health.since_ms = lt_monotonic_ms();
    monitor->changed(self->group); // may replace this check: `self` is not used after it
}

std::string describe_socket_error(int error) {
    switch (error) {
    case ECONNREFUSED:
        return "connection refused";
    case ECONNRESET:
    case EPIPE:
        return "connection reset";
    default:
        return strerror(error);
    }
}

// --- Connections

void judge_answer(watched_proxy *self, bool ended) {
    const size_t line = self->answer.find('\n');
    // The status is in the first line. The rest of the answer is not read.
    if (line == std::string::npos && !ended && self->answer.size() < ANSWER_MAX_BYTES)
        return;
    int major = 0, minor = 0, status = 0;
    if (sscanf(self->answer.substr(0, std::min<size_t>(line, 64)).c_str(), "HTTP/%1d.%1d %3d", &major, &minor,
               &status) != 3 ||
        status < 100)
        finish_check(self, self->answer.empty() ? "connection closed without an answer" : "no HTTP answer");
    else if (status < 200 || status > 399)
        finish_check(self, "status " + std::to_string(status));
    else
        finish_check(self, "");
}

void read_http_answer(watched_proxy *self) {
    char bytes[1024];
    const ssize_t count = recv(self->fd, bytes, sizeof bytes, 0);
    if (count < 0 && (errno == EAGAIN || errno == EINTR))
        return;
    if (count < 0) {
        finish_check(self, describe_socket_error(errno));
        return;
    }
    self->answer.append(bytes, static_cast<size_t>(count));
    judge_answer(self, count == 0);
}

void send_http_request(watched_proxy *self) {
    const ssize_t count = send(self->fd, self->unsent.data(), self->unsent.size(), MSG_NOSIGNAL);
    if (count < 0 && errno != EAGAIN && errno != EINTR) {
        finish_check(self, describe_socket_error(errno));
        return;
    }
    // The socket may take only a part; the rest is sent when it is writable again.
    self->unsent.erase(0, static_cast<size_t>(std::max<ssize_t>(count, 0)));
    if (self->unsent.empty() && loop_event_set_fd(self->socket, self->fd, LOOP_READ) != LC_OK)
        finish_check(self, "no room for a check");
}

void take_socket_event(int, short flags, void *data) {
    auto *self = static_cast<watched_proxy *>(data);
    int error = 0;
    socklen_t length = sizeof error;
    // The first event is the end of connect(), whose result the socket keeps as its error.
    (void)getsockopt(self->fd, SOL_SOCKET, SO_ERROR, &error, &length);
    if (error)
        finish_check(self, describe_socket_error(error));
    else if (self->check.kind == check_kind::tcp)
        finish_check(self, "");
    else if (flags & LOOP_WRITE && !self->unsent.empty())
        send_http_request(self);
    else
        read_http_answer(self);
}

std::string begin_connection(watched_proxy *self) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(self->port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    self->fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (self->fd < 0)
        return std::string("no socket: ") + strerror(errno);
    // On the loopback interface the connection can be made or refused at once.
    if (connect(self->fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0 &&
        errno != EINPROGRESS)
        return describe_socket_error(errno);
    if (self->check.kind == check_kind::http)
        self->unsent = "GET " + self->check.argument +
                       " HTTP/1.0\r\nHost: 127.0.0.1:" + std::to_string(self->port) +
                       "\r\nUser-Agent: tunneld\r\nConnection: close\r\n\r\n";
    if (loop_event_new(self->owner->loop, take_socket_event, self, &self->socket) != LC_OK ||
        loop_event_set_fd(self->socket, self->fd, LOOP_WRITE) != LC_OK)
        return "no room for a check";
    return "";
}

// --- Commands

// The command inherits nothing but standard descriptors, which are /dev/null.
int spawn_command(const std::string &file, pid_t *out_pid) {
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    sigset_t none, all;
    sigemptyset(&none);
    sigfillset(&all);
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attributes);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1);
    // A process group of its own, with which the command's children can be killed. Signals that this program
    // ignores or blocks would be inherited otherwise.
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setsigdefault(&attributes, &all);
    posix_spawnattr_setflags(&attributes,
                             POSIX_SPAWN_SETPGROUP | POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    char *arguments[] = {const_cast<char *>(file.c_str()), nullptr};
    // The environment consists of pointers to writable text.
    char path[sizeof COMMAND_PATH];
    memcpy(path, COMMAND_PATH, sizeof path);
    char *environment[] = {path, nullptr};
    const int error = posix_spawn(out_pid, file.c_str(), &actions, &attributes, arguments, environment);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    return error;
}

// Reaps a killed command if it ends before the deadline. Otherwise init reaps it after this program's end.
void wait_for_killed(pid_t pid, int pidfd, int64_t deadline_ms) {
    pollfd end = {pidfd, POLLIN, 0};
    if (pidfd >= 0) // poll() ignores -1 and would sleep until the deadline
        (void)poll(&end, 1, static_cast<int>(std::max<int64_t>(deadline_ms - lt_monotonic_ms(), 0)));
    (void)waitpid(pid, nullptr, WNOHANG);
    if (pidfd >= 0)
        close(pidfd);
}

std::string begin_command(watched_proxy *self) {
    health_monitor *monitor = self->owner;
    // Besides one command for each check, the list has those that were killed and have not ended.
    if (monitor->commands.size() >= LINGERING_MAX + monitor->checks.size())
        return "too many earlier checks have not ended";
    pid_t pid = 0;
    if (const int error = spawn_command(self->check.argument, &pid))
        return self->check.argument + ": " + strerror(error);
    // The event keeps a pointer to the element, which a list does not move.
    running_command &command = monitor->commands.emplace_back();
    command.owner = monitor;
    command.pid = pid;
    command.pidfd = pidfd_open(pid, 0);
    if (command.pidfd < 0 ||
        loop_event_new(monitor->loop, take_command_end, &command, &command.end) != LC_OK ||
        loop_event_set_fd(command.end, command.pidfd, LOOP_READ) != LC_OK) {
        loop_event_free(&command.end);
        kill(-pid, SIGKILL);
        wait_for_killed(pid, command.pidfd, lt_monotonic_ms() + KILL_MAX_MS);
        monitor->commands.pop_back();
        return "no room for a check";
    }
    self->command = &command;
    return "";
}

// "" for success.
std::string describe_exit(const siginfo_t &info) {
    if (info.si_code != CLD_EXITED)
        return std::string("ended by ") + lc_signal_num_to_name(info.si_status);
    return info.si_status ? "exit status " + std::to_string(info.si_status) : "";
}

void take_command_end(int, short, void *data) {
    auto *command = static_cast<running_command *>(data);
    health_monitor *monitor = command->owner;
    kill(-command->pid, SIGKILL); // processes that it has left; the number is reserved until waitid()
    siginfo_t info = {};
    const bool known = waitid(P_PIDFD, static_cast<id_t>(command->pidfd), &info, WEXITED | WNOHANG) == 0;
    if (known && info.si_pid == 0)
        return; // it has not ended yet
    // A command that was killed because its time was up has no check any more.
    watched_proxy *check = nullptr;
    for (const auto &[group, each] : monitor->checks)
        if (each->command == command)
            check = each.get();
    loop_event_free(&command->end);
    close(command->pidfd);
    monitor->commands.remove_if([&](const running_command &each) { return &each == command; });
    if (!check)
        return;
    check->command = nullptr;
    finish_check(check, known ? describe_exit(info) : "its exit status was lost");
}

// --- Checks

void begin_check(watched_proxy *self) {
    self->phase = watched_proxy::checking;
    const std::string failure =
        self->check.kind == check_kind::command ? begin_command(self) : begin_connection(self);
    if (!failure.empty())
        finish_check(self, failure);
    else if (loop_event_set_timer(self->timer, time_limit_ms(self)) != LC_OK)
        finish_check(self, "no room for a check");
}

void take_check_timer(int, short, void *data) {
    auto *self = static_cast<watched_proxy *>(data);
    if (self->phase == watched_proxy::waiting)
        begin_check(self);
    else
        finish_check(self, "no answer in " + std::to_string(time_limit_ms(self)) + " ms");
}

void end_watching(watched_proxy *self) {
    stop_check(self);
    loop_event_free(&self->timer);
}

bool is_same_check(const watched_proxy *self, const intercept &rules) {
    return self->check == rules.check && self->port == rules.to;
}

// Until the first result of a changed check, the state that the earlier check has found stays.
void begin_watching(health_monitor *monitor, uint8_t group, const intercept &rules, int64_t delay_ms) {
    std::unique_ptr<watched_proxy> &place = monitor->checks[group];
    if (place)
        end_watching(place.get());
    place = std::make_unique<watched_proxy>();
    place->owner = monitor;
    place->group = group;
    place->check = rules.check;
    place->port = rules.to;
    monitor->states.try_emplace(group);
    if (loop_event_new(monitor->loop, take_check_timer, place.get(), &place->timer) != LC_OK ||
        loop_event_set_timer(place->timer, delay_ms) != LC_OK)
        LC_LOG(LC_LOG_ERR, "The proxy of group %d cannot be checked: no timer", group);
}
} // namespace

health_monitor *health_new(loop_context *loop, std::function<void(uint8_t group)> changed) {
    auto *monitor = new health_monitor;
    monitor->loop = loop;
    monitor->changed = std::move(changed);
    return monitor;
}

void health_free(health_monitor *monitor) {
    if (!monitor)
        return;
    for (const auto &[group, check] : monitor->checks)
        end_watching(check.get());
    // All have been killed by now, and wait together.
    const int64_t deadline_ms = lt_monotonic_ms() + KILL_MAX_MS;
    for (running_command &command : monitor->commands) {
        loop_event_free(&command.end);
        wait_for_killed(command.pid, command.pidfd, deadline_ms);
    }
    delete monitor;
}

void health_set_checks(health_monitor *monitor, const std::map<uint8_t, intercept> &intercepts) {
    for (auto at = monitor->checks.begin(); at != monitor->checks.end();) {
        if (intercepts.contains(at->first)) {
            ++at;
            continue;
        }
        end_watching(at->second.get());
        monitor->states.erase(at->first);
        at = monitor->checks.erase(at);
    }
    int64_t delay_ms = 0;
    for (const auto &[group, rules] : intercepts) {
        const auto found = monitor->checks.find(group);
        if (found != monitor->checks.end() && is_same_check(found->second.get(), rules))
            continue;
        begin_watching(monitor, group, rules, delay_ms);
        delay_ms += STAGGER_MS;
    }
}

const std::map<uint8_t, proxy_health> &health_states(const health_monitor *monitor) {
    return monitor->states;
}
