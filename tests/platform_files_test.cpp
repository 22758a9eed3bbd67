// The platform's files: bad lines don't affect good ones; a file is written completely or not at all.

#include <signal.h>
#include <sys/resource.h>

#include <filesystem>

#include "platform/file_utils.h"
#include "platform/limits.h"
#include "tests/support/texts.h"

namespace fs = std::filesystem;

namespace {

void write_text(const fs::path &path, const std::string &text) {
    std::ofstream(path, std::ios::binary) << text;
}

size_t names_in(const fs::path &directory) {
    return static_cast<size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

using result = std::pair<lc_status, int>;
const result DONE = {LC_OK, 0};

struct Files : testing::Test {
    const fs::path dir = "/tmp/files";
    const mode_t umask_before = umask(077);
    Files() {
        fs::remove_all(dir);
        fs::create_directory(dir);
    }
    ~Files() override {
        umask(umask_before);
        fs::remove_all(dir);
    }
    // With errno if it fails.
    result write(const fs::path &path, const std::string &text, int overwrite = 1, mode_t mode = 0644) {
        const lc_status status =
            lf_write_file(path.c_str(), mode, text.data(), overwrite, static_cast<uint32_t>(text.size()));
        return {status, status == LC_OK ? 0 : errno};
    }
};

} // namespace

TEST_F(Files, LimitsComeFromTheGoodLines) {
    using numbers = std::pair<uint32_t, uint32_t>; // of tunnels and interfaces
    const auto limits_in = [](const fs::path &path) {
        const platform_limits limits = platform_limits_read(path.c_str());
        return numbers{limits.max_user_tunnels, limits.max_interfaces};
    };
    const std::pair<std::string, numbers> cases[] = {
        {"", {200, 128}},
        {"max_user_tunnels 17\nmax_interfaces 4\n", {17, 4}},
        {"# max_user_tunnels 5\n\n   \n\tmax_interfaces\t 127  ", {200, 127}},
        {"max_user_tunnels 0\nmax_interfaces 65535", {0, 65535}},
        {"max_user_tunnels 65000\r\nmax_interfaces 1\r\n", {65000, 1}},
        // bad lines, each with a good one
        {"max_user_tunnels 65001\nmax_interfaces 9", {200, 9}},
        {"max_interfaces 0\nmax_user_tunnels 3", {3, 128}},
        {"max_interfaces -1\nmax_interfaces +4\nmax_interfaces 0x10\nmax_interfaces 12 13\nmax_interfaces\n"
         "max_interfaces \nmax_interfaces twelve\nmax_interfaces 4294967424\nmax_interfaces "
         "99999999999999999999999\nmax_interfacesx 3\nMAX_INTERFACES 3\nmax_interface 3\nmax_user_tunnels 8",
         {8, 128}},
        // A line that is too long is one bad line, not several; a NUL does not hide what follows it.
        {"max_interfaces 5" + std::string(5000, ' ') + "\nmax_user_tunnels 6\n", {6, 128}},
        {std::string(126, '#') + "\nmax_user_tunnels 6\na" + '\0' + "b\nmax_interfaces 7\n", {6, 7}},
    };
    for (const auto &[text, expected] : cases) {
        write_text(dir / "conf", text);
        EXPECT_EQ(limits_in(dir / "conf"), expected) << text;
    }
    const numbers defaults = {200, 128};
    EXPECT_EQ(limits_in(dir / "none"), defaults);
    EXPECT_EQ(limits_in(dir), defaults);
    const char *shipped = WCCP_SOURCE_DIR "/packaging/platform.conf";
    EXPECT_TRUE(fs::exists(shipped) && limits_in(shipped) == defaults);
    // They are read once.
    fs::create_directories(fs::path(PLATFORM_CONF_PATH).parent_path());
    write_text(PLATFORM_CONF_PATH, "max_user_tunnels 30\n");
    EXPECT_EQ(get_max_tunnel_number(), 52u);
    write_text(PLATFORM_CONF_PATH, "max_user_tunnels 40\nmax_interfaces 2\n");
    EXPECT_EQ(get_max_user_tunnel_number(), 30u);
    EXPECT_EQ(qv_max_interfaces(), 128u);
}

TEST_F(Files, MissingDirectoriesAreCreatedWithTheMode) {
    const auto ensure = [](const fs::path &path) { return lf_ensure_dir_of_file(path.c_str(), 0755); };
    EXPECT_EQ(ensure(dir / "a//b/./c/file"), LC_OK);
    EXPECT_TRUE(mode_of(dir / "a") == 0755 && mode_of(dir / "a/b/c") == 0755) << "regardless of the umask";
    EXPECT_FALSE(fs::exists(dir / "a/b/c/file"));
    fs::permissions(dir / "a", fs::perms(0700));
    EXPECT_EQ(ensure(dir / "a/other"), LC_OK);
    EXPECT_EQ(mode_of(dir / "a"), 0700) << "an existing directory is not changed";
    fs::create_directory_symlink("a/b", dir / "link");
    EXPECT_EQ(ensure(dir / "link/d/file"), LC_OK);
    EXPECT_TRUE(fs::is_directory(dir / "a/b/d"));
    write_text(dir / "plain", "x");
    EXPECT_EQ(ensure(dir / "plain/file"), LC_BAD_PATH);
    EXPECT_EQ(errno, ENOTDIR);
    fs::current_path(dir);
    EXPECT_TRUE(ensure("here/file") == LC_OK && ensure("file") == LC_OK && fs::is_directory(dir / "here"));
    fs::current_path("/");
    EXPECT_EQ(ensure(std::string(5000, 'x')), LC_BAD_PATH);
}

TEST_F(Files, AFileHasExactlyTheBytesAndTheMode) {
    const fs::path path = dir / "file";
    const std::pair<std::string, mode_t> files[] = {{{"a\0b\n", 4}, 0644}, {"9", 0600}, {"", 0600}};
    for (const auto &[text, mode] : files) {
        EXPECT_EQ(write(path, text, 1, mode), DONE);
        EXPECT_EQ(text_of_file(path), text);
        EXPECT_EQ(mode_of(path), mode) << "regardless of the umask";
    }
    EXPECT_EQ(write(path, "new", 0), result(LC_IO_FILE_EXISTS, EEXIST));
    EXPECT_EQ(text_of_file(path), "");
    EXPECT_EQ(write(dir / "fresh", "new", 0), DONE);
    EXPECT_EQ(names_in(dir), 2u) << "and no temporary file";
    EXPECT_EQ(write(dir / "none/file", "x"), result(LC_FILE_NOT_FOUND, ENOENT));
}

TEST_F(Files, OnlyPlainFilesAreReplaced) {
    write_text(dir / "target", "old");
    fs::create_symlink(dir / "target", dir / "link");
    fs::create_symlink(dir / "nowhere", dir / "dangling");
    fs::create_hard_link(dir / "target", dir / "second");
    fs::create_directory(dir / "directory");
    ASSERT_EQ(mkfifo((dir / "pipe").c_str(), 0600), 0);
    const std::pair<const char *, int> refused[] = {
        {"link", ELOOP}, {"dangling", ELOOP}, {"second", EMLINK}, {"directory", EISDIR}, {"pipe", EINVAL}};
    for (const auto &[name, reason] : refused)
        EXPECT_EQ(write(dir / name, "new"), result(LC_BAD_FILE, reason)) << name;
    EXPECT_EQ(text_of_file(dir / "target"), "old");
    EXPECT_EQ(names_in(dir), 6u);
}

TEST_F(Files, AWriteThatFailsLosesNothing) {
    const fs::path path = dir / "file";
    EXPECT_EQ(write(path, "old"), DONE);
    rlimit before;
    getrlimit(RLIMIT_FSIZE, &before);
    const rlimit small = {4096, before.rlim_max};
    signal(SIGXFSZ, SIG_IGN);
    setrlimit(RLIMIT_FSIZE, &small);
    EXPECT_EQ(write(path, std::string(10000, 'x')), result(LC_IO_ERROR, EFBIG));
    setrlimit(RLIMIT_FSIZE, &before);
    EXPECT_EQ(text_of_file(path), "old");
    EXPECT_EQ(names_in(dir), 1u);
}
