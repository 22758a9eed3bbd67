// The platform's files: what is read is bounded and what is bad in them loses nothing else; what is written
// stands as a whole or not at all.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "platform/file_utils.h"
#include "platform/limits.h"

namespace fs = std::filesystem;

namespace {

void write_text(const fs::path &path, const std::string &text) {
    std::ofstream(path, std::ios::binary) << text;
}

std::string text_of(const fs::path &path) {
    std::stringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

mode_t mode_of(const fs::path &path) {
    struct stat found = {};
    EXPECT_EQ(stat(path.c_str(), &found), 0) << path;
    return found.st_mode & 07777;
}

size_t names_in(const fs::path &directory) {
    return static_cast<size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

struct Files : testing::Test {
    Files() : dir("/tmp/files"), umask_before(umask(077)) {
        fs::remove_all(dir);
        fs::create_directory(dir);
    }
    ~Files() override {
        umask(umask_before);
        fs::remove_all(dir);
    }
    lc_status write(const fs::path &path, const std::string &text, int overwrite = 1, mode_t mode = 0644) {
        errno = 0;
        return lf_write_file(path.c_str(), mode, text.data(), overwrite, static_cast<uint32_t>(text.size()));
    }
    fs::path dir;
    mode_t umask_before;
};

} // namespace

TEST_F(Files, LimitsComeFromTheLinesThatAreGood) {
    static const struct {
        const char *text;
        uint32_t tunnels, interfaces;
    } cases[] = {
        {"", 200, 128},
        {"max_user_tunnels 17\nmax_interfaces 4\n", 17, 4},
        {"# max_user_tunnels 5\n\n   \n\tmax_interfaces\t 127  ", 200, 127},
        {"max_user_tunnels 0\nmax_interfaces 65535", 0, 65535},
        {"max_user_tunnels 65000\r\nmax_interfaces 1\r\n", 65000, 1},
        // bad lines, each beside a good one
        {"max_user_tunnels 65001\nmax_interfaces 9", 200, 9},
        {"max_interfaces 0\nmax_user_tunnels 3", 3, 128},
        {"max_interfaces -1\nmax_interfaces +4\nmax_interfaces 0x10\nmax_interfaces 12 13\nmax_interfaces\n"
         "max_interfaces \nmax_interfaces twelve\nmax_interfaces 4294967424\nmax_interfaces "
         "99999999999999999999999\nmax_interfacesx 3\nMAX_INTERFACES 3\nmax_interface 3\nmax_user_tunnels 8",
         8, 128},
    };
    for (const auto &row : cases) {
        write_text(dir / "conf", row.text);
        const platform_limits limits = platform_limits_read((dir / "conf").c_str());
        EXPECT_EQ(limits.max_user_tunnels, row.tunnels) << row.text;
        EXPECT_EQ(limits.max_interfaces, row.interfaces) << row.text;
    }
    // A line longer than any good one is one bad line, not several; a NUL hides nothing behind it.
    write_text(dir / "conf", "max_interfaces 5" + std::string(5000, ' ') + "\nmax_user_tunnels 6\n");
    EXPECT_EQ(platform_limits_read((dir / "conf").c_str()).max_interfaces, 128u);
    EXPECT_EQ(platform_limits_read((dir / "conf").c_str()).max_user_tunnels, 6u);
    write_text(dir / "conf", std::string(126, '#') + "\nmax_user_tunnels 6\n" + std::string("a\0b\n", 4) +
                                 "max_interfaces 7\n");
    EXPECT_EQ(platform_limits_read((dir / "conf").c_str()).max_user_tunnels, 6u);
    EXPECT_EQ(platform_limits_read((dir / "conf").c_str()).max_interfaces, 7u);
    EXPECT_EQ(platform_limits_read((dir / "none").c_str()).max_interfaces, 128u);
    EXPECT_EQ(platform_limits_read(dir.c_str()).max_interfaces, 128u);
}

TEST_F(Files, LimitsAreReadOnce) {
    fs::create_directories(fs::path(PLATFORM_CONF_PATH).parent_path());
    write_text(PLATFORM_CONF_PATH, "max_user_tunnels 30\n");
    EXPECT_EQ(get_max_tunnel_number(), 52u);
    write_text(PLATFORM_CONF_PATH, "max_user_tunnels 40\nmax_interfaces 2\n");
    EXPECT_EQ(get_max_user_tunnel_number(), 30u);
    EXPECT_EQ(qv_max_interfaces(), 128u);
}

TEST_F(Files, TheShippedFileSaysWhatAMissingOneMeans) {
    const fs::path shipped = fs::path(WCCP_SOURCE_DIR) / "packaging/platform.conf";
    ASSERT_TRUE(fs::exists(shipped));
    const platform_limits with = platform_limits_read(shipped.c_str());
    const platform_limits without = platform_limits_read((dir / "none").c_str());
    EXPECT_EQ(with.max_user_tunnels, without.max_user_tunnels);
    EXPECT_EQ(with.max_interfaces, without.max_interfaces);
}

TEST_F(Files, MissingDirectoriesAreMadeWithTheMode) {
    EXPECT_EQ(lf_ensure_dir_of_file((dir / "a//b/./c/file").c_str(), 0755), 0);
    EXPECT_EQ(mode_of(dir / "a"), 0755u) << "whatever the umask says";
    EXPECT_EQ(mode_of(dir / "a/b/c"), 0755u);
    EXPECT_FALSE(fs::exists(dir / "a/b/c/file"));
    fs::permissions(dir / "a", fs::perms(0700));
    EXPECT_EQ(lf_ensure_dir_of_file((dir / "a/other").c_str(), 0755), 0);
    EXPECT_EQ(mode_of(dir / "a"), 0700u) << "what was there is left alone";
    fs::create_directory_symlink("a/b", dir / "link");
    EXPECT_EQ(lf_ensure_dir_of_file((dir / "link/d/file").c_str(), 0755), 0);
    EXPECT_TRUE(fs::is_directory(dir / "a/b/d"));
    write_text(dir / "plain", "x");
    EXPECT_NE(lf_ensure_dir_of_file((dir / "plain/file").c_str(), 0755), 0);
    EXPECT_EQ(errno, ENOTDIR);
    fs::current_path(dir);
    EXPECT_EQ(lf_ensure_dir_of_file("here/file", 0755), 0);
    EXPECT_EQ(lf_ensure_dir_of_file("file", 0755), 0);
    EXPECT_TRUE(fs::is_directory(dir / "here"));
    fs::current_path("/");
    EXPECT_NE(lf_ensure_dir_of_file(nullptr, 0755), 0);
    EXPECT_NE(lf_ensure_dir_of_file(std::string(5000, 'x').c_str(), 0755), 0);
}

TEST_F(Files, AFileHasExactlyTheBytesAndTheMode) {
    const fs::path path = dir / "file";
    const std::string binary("a\0b\n", 4);
    EXPECT_EQ(write(path, binary), 0);
    EXPECT_EQ(text_of(path), binary);
    EXPECT_EQ(mode_of(path), 0644u) << "whatever the umask says";
    EXPECT_EQ(write(path, "9", 1, 0600), 0);
    EXPECT_EQ(text_of(path), "9") << "nothing of a longer one is left";
    EXPECT_EQ(mode_of(path), 0600u);
    EXPECT_EQ(write(path, "", 1, 0600), 0);
    EXPECT_EQ(text_of(path), "");
    EXPECT_EQ(write(path, "new", 0), LC_IO_FILE_EXISTS);
    EXPECT_EQ(errno, EEXIST);
    EXPECT_EQ(text_of(path), "");
    EXPECT_EQ(write(dir / "fresh", "new", 0), 0);
    EXPECT_EQ(names_in(dir), 2u) << "and nothing else";
    EXPECT_EQ(write(dir / "none/file", "x"), LC_FILE_NOT_FOUND);
    EXPECT_EQ(errno, ENOENT);
}

TEST_F(Files, WhatIsNotAPlainFileIsRefused) {
    write_text(dir / "target", "old");
    fs::create_symlink(dir / "target", dir / "link");
    EXPECT_EQ(write(dir / "link", "new"), LC_BAD_FILE);
    EXPECT_EQ(errno, ELOOP);
    fs::create_symlink(dir / "nowhere", dir / "dangling");
    EXPECT_EQ(write(dir / "dangling", "new"), LC_BAD_FILE);
    EXPECT_FALSE(fs::exists(dir / "nowhere"));
    fs::create_hard_link(dir / "target", dir / "second");
    EXPECT_EQ(write(dir / "second", "new"), LC_BAD_FILE);
    EXPECT_EQ(errno, EMLINK);
    EXPECT_EQ(text_of(dir / "target"), "old");
    ASSERT_EQ(mkfifo((dir / "pipe").c_str(), 0600), 0);
    EXPECT_EQ(write(dir / "pipe", "new"), LC_BAD_FILE);
    fs::create_directory(dir / "directory");
    EXPECT_EQ(write(dir / "directory", "new"), LC_BAD_FILE);
    EXPECT_EQ(errno, EISDIR);
    EXPECT_EQ(names_in(dir), 6u);
}

TEST_F(Files, AWriteThatFailsLosesNothing) {
    const fs::path path = dir / "file";
    EXPECT_EQ(write(path, "old"), 0);
    rlimit before;
    getrlimit(RLIMIT_FSIZE, &before);
    const rlimit small = {4096, before.rlim_max};
    signal(SIGXFSZ, SIG_IGN);
    setrlimit(RLIMIT_FSIZE, &small);
    EXPECT_NE(write(path, std::string(10000, 'x')), 0);
    EXPECT_EQ(errno, EFBIG);
    setrlimit(RLIMIT_FSIZE, &before);
    EXPECT_EQ(text_of(path), "old");
    EXPECT_EQ(names_in(dir), 1u);
}
