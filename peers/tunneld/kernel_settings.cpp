#include "peers/tunneld/kernel_settings.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <optional>

#include "peers/tunneld/link_names.h"

namespace {

constexpr char CONF_DIRECTORY[] = "/proc/sys/net/ipv4/conf/";
constexpr char STATE_DIRECTORY[] = "/run/tunneld", STATE_FILE[] = "/run/tunneld/settings",
               NEW_STATE_FILE[] = "/run/tunneld/settings.new";
constexpr char STATE_HEADING[] = "tunneld settings 1: path, value before, value now";
constexpr size_t STATE_BYTES = 1 << 20;
constexpr const char *KEYS[] = {"rp_filter", "accept_local", "send_redirects", "forwarding"};

struct descriptor {
    explicit descriptor(int opened) : fd(opened) {}
    ~descriptor() {
        if (fd >= 0)
            close(fd);
    }
    descriptor(const descriptor &) = delete;
    descriptor &operator=(const descriptor &) = delete;
    const int fd;
};

struct changed_setting {
    std::string before, now;
};
// By path. Read from the state file when first needed, and written to it before a setting is changed.
using changed_settings = std::map<std::string, changed_setting>;
std::optional<changed_settings> changed;
bool unsaved;

struct setting_path {
    std::string interface, key;
};
std::optional<setting_path> split_path(const std::string &path) {
    const size_t slash = path.find('/');
    if (slash == std::string::npos)
        return std::nullopt;
    return setting_path{path.substr(0, slash), path.substr(slash + 1)};
}

bool is_our_path(const std::string &path) {
    const auto parts = split_path(path);
    // The paths are read from a file and will be written to: one that leads elsewhere is not accepted.
    return parts &&
           (is_interface_name(parts->interface) || parts->interface == "all" ||
            parts->interface == "default") &&
           std::find(std::begin(KEYS), std::end(KEYS), parts->key) != std::end(KEYS);
}

bool is_value(const std::string &text) {
    return !text.empty() && text.size() <= 3 &&
           std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// Keeps the first error.
void note_error(const std::string &text, std::string *out_error) {
    if (out_error->empty())
        *out_error = text + ": " + strerror(errno);
}

std::optional<std::string> read_file(const std::string &path, size_t most) {
    const descriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (file.fd < 0)
        return std::nullopt;
    // One byte more than allowed, which shows that the file is too long.
    std::string text(most + 1, '\0');
    size_t length = 0;
    for (ssize_t got = 1; got != 0 && length < text.size(); length += static_cast<size_t>(got)) {
        got = read(file.fd, text.data() + length, text.size() - length);
        if (got < 0)
            return std::nullopt;
    }
    if (length > most) {
        errno = EFBIG;
        return std::nullopt;
    }
    text.resize(length);
    return text;
}

bool write_file(const std::string &path, int flags, const std::string &text) {
    const descriptor file(open(path.c_str(), O_WRONLY | O_CLOEXEC | O_NOFOLLOW | flags, 0644));
    if (file.fd < 0)
        return false;
    const ssize_t written = write(file.fd, text.data(), text.size());
    if (written >= 0 && static_cast<size_t>(written) != text.size())
        errno = ENOSPC;
    return written == static_cast<ssize_t>(text.size());
}

// Nothing when there is no such setting, or its value is not a number of at most three digits.
std::optional<std::string> read_setting(const std::string &path) {
    auto text = read_file(CONF_DIRECTORY + path, 64);
    if (!text)
        return std::nullopt;
    while (!text->empty() && text->back() == '\n')
        text->pop_back();
    if (is_value(*text))
        return text;
    errno = EINVAL;
    return std::nullopt;
}

// Lines that tunneld does not write are ignored.
changed_settings parse_changed_settings(const std::string &text) {
    changed_settings settings;
    size_t start = 0;
    for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
        const std::string line = text.substr(start, end - start);
        // `more` is read only if something follows the third word. The heading does not match either.
        char path[40], before[5], now[5], more;
        if (sscanf(line.c_str(), "%39s %4s %4s%c", path, before, now, &more) == 3 && is_our_path(path) &&
            is_value(before) && is_value(now))
            settings[path] = {before, now};
    }
    return settings;
}

void load_changed_settings(std::string *out_error) {
    if (changed)
        return;
    const auto text = read_file(STATE_FILE, STATE_BYTES);
    if (!text && errno != ENOENT)
        note_error(std::string("cannot read ") + STATE_FILE, out_error);
    changed = text ? parse_changed_settings(*text) : changed_settings{};
}

void save_changed_settings(std::string *out_error) {
    if (!unsaved)
        return;
    // A file that could not be saved is tried again by the next call.
    std::string text = std::string(STATE_HEADING) + "\n";
    for (const auto &[path, setting] : *changed)
        text += path + " " + setting.before + " " + setting.now + "\n";
    bool saved;
    if (changed->empty())
        saved = unlink(STATE_FILE) == 0 || errno == ENOENT;
    else
        saved = (mkdir(STATE_DIRECTORY, 0755) == 0 || errno == EEXIST) &&
                write_file(NEW_STATE_FILE, O_CREAT | O_TRUNC, text) &&
                rename(NEW_STATE_FILE, STATE_FILE) == 0;
    if (!saved)
        note_error(std::string("cannot write ") + STATE_FILE, out_error);
    unsaved = !saved;
}

bool write_setting(const std::string &path, const std::string &value, std::string *out_error) {
    if (write_file(CONF_DIRECTORY + path, 0, value))
        return true;
    note_error("cannot set " + (CONF_DIRECTORY + path) + " to " + value, out_error);
    return false;
}

std::vector<std::string> configured_interfaces() {
    std::vector<std::string> names;
    const std::unique_ptr<DIR, int (*)(DIR *)> directory(opendir(CONF_DIRECTORY), closedir);
    while (const dirent *entry = directory ? readdir(directory.get()) : nullptr)
        if (is_interface_name(entry->d_name) || strcmp(entry->d_name, "default") == 0)
            names.emplace_back(entry->d_name);
    return names;
}

// Null when the setting is not among the wanted ones.
const wanted_setting *find_wanted_setting(const std::vector<wanted_setting> &wanted,
                                          const std::string &path) {
    const auto found = std::find_if(wanted.begin(), wanted.end(),
                                    [&](const wanted_setting &setting) { return setting.path == path; });
    return found == wanted.end() ? nullptr : &*found;
}

void note_change(const std::string &path, const std::string &before, const std::string &now) {
    // An earlier entry has the original value, which a second change must not replace.
    if (changed->insert({path, {before, now}}).second)
        unsaved = true;
}

// `before`: the old value of `all`, which interfaces get that have less, unless `wanted` has their own
// setting.
void note_raised(const std::vector<wanted_setting> &wanted, const std::string &key,
                 const std::string &before) {
    for (const auto &interface : configured_interfaces()) {
        const std::string path = interface + "/" + key;
        const auto own = find_wanted_setting(wanted, path) ? std::nullopt : read_setting(path);
        if (own && std::stoi(*own) < std::stoi(before))
            note_change(path, *own, before);
    }
}

// Whether the setting was raised because one of `all` that is still wanted was lowered.
bool is_raised(const std::vector<wanted_setting> &wanted, const std::string &path) {
    const auto parts = split_path(path);
    return parts && !find_wanted_setting(wanted, path) && find_wanted_setting(wanted, "all/" + parts->key);
}

} // namespace

bool apply_settings(const std::vector<wanted_setting> &wanted, std::string *out_error) {
    std::string error;
    load_changed_settings(&error);
    std::vector<const wanted_setting *> differing;
    for (const auto &setting : wanted) {
        const auto now = read_setting(setting.path);
        if (!now)
            note_error("cannot read " + (CONF_DIRECTORY + setting.path), &error);
        if (!now || *now == setting.value)
            continue;
        differing.push_back(&setting);
        // Settings of tunneld's own links disappear with the link.
        if (!setting.restore)
            continue;
        // The other interfaces are raised only with the first change of `all`, which has its original value.
        const bool is_first = !changed->count(setting.path);
        note_change(setting.path, *now, setting.value);
        if (is_first && setting.path.starts_with("all/"))
            note_raised(wanted, setting.path.substr(4), *now);
    }
    // Before any setting is written: a tunneld that is killed in between must not lose the original values.
    save_changed_settings(&error);
    // First the raised interfaces, then `all`, so that no interface is without the setting in between. A
    // value other than the noted one was set by somebody else and stays.
    for (const auto &[path, setting] : *changed)
        if (is_raised(wanted, path) && read_setting(path) == setting.before)
            write_setting(path, setting.now, &error);
    for (const auto *setting : differing)
        write_setting(setting->path, setting->value, &error);
    if (out_error->empty())
        *out_error = error;
    return error.empty();
}

bool restore_settings(const std::vector<wanted_setting> &wanted, std::string *out_error) {
    std::string error;
    load_changed_settings(&error);
    std::vector<std::string> paths;
    for (const auto &[path, setting] : *changed)
        if (!find_wanted_setting(wanted, path) && !is_raised(wanted, path))
            paths.push_back(path);
    // `all` first: otherwise an interface would be unprotected for a moment.
    std::stable_partition(paths.begin(), paths.end(),
                          [](const std::string &path) { return path.starts_with("all/"); });
    for (const auto &path : paths) {
        const changed_setting &setting = changed->at(path);
        // A value that somebody else has changed stays and is forgotten, like that of an interface that is
        // gone. One that could not be written is tried again.
        if (read_setting(path) == setting.now && !write_setting(path, setting.before, &error))
            continue;
        changed->erase(path);
        unsaved = true;
    }
    save_changed_settings(&error);
    if (out_error->empty())
        *out_error = error;
    return error.empty();
}

void disable_ipv6(const std::string &interface) {
    // A host without IPv6 has no such file and needs none.
    write_file("/proc/sys/net/ipv6/conf/" + interface + "/disable_ipv6", 0, "1");
}
