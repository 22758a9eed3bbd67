// Single steps of the start: the pid file, the encapsulation ranges, signals, and the service manager.
#include "daemon/wccpd_main.h"

#include <csignal>

#include <sys/socket.h>
#include <sys/un.h>

#include "daemon/wccpd_service.h"
#include "engine/wccp_host.h"
#include "platform/limits.h"
#include "runtime/service_notify.h"
#include "tests/support/daemon_engine.h"
#include "tests/support/texts.h"

namespace {

constexpr const char *PID_FILE = "/var/run/wccpd.pid";

using DaemonMain = daemon_test;

TEST_F(DaemonMain, ThePidFile) {
    std::ofstream(PID_FILE) << "an earlier text that is longer than any number";
    EXPECT_TRUE(wccpd_pid_init() == LC_OK && text_of_file(PID_FILE) == std::to_string(getpid()) + "\n");
    unlink(PID_FILE);
    std::ofstream("/tmp/precious") << "kept";
    ASSERT_TRUE(symlink("/tmp/precious", PID_FILE) == 0 && wccpd_pid_init() == LC_BAD_FILE);
    EXPECT_EQ(said("Writing /var/run/wccpd.pid: Too many levels of symbolic links"), 1);
    EXPECT_EQ(text_of_file("/tmp/precious"), "kept");
    unlink(PID_FILE);
}

TEST_F(DaemonMain, EncapsulationRanges) {
    std::ofstream(PLATFORM_CONF_PATH) << "max_user_tunnels 78\n"; // 100 with the 22 of the system
    EXPECT_EQ(qv_encap_setup_entries(), 184u);
    EXPECT_EQ(std::tuple(g_qv_encap_wccp_first, g_qv_encap_wccp_last, g_qv_encap_clstr_first,
                         g_qv_encap_clstr_last),
              std::tuple(110, 141, 151, 182));
}

TEST_F(DaemonMain, SignalsThatDoNotEndIt) {
    for (const int number : {SIGPIPE, SIGUSR1, SIGUSR2, SIGCHLD})
        EXPECT_EQ(wccpd_handle_signal(number, 0, nullptr, nullptr), LC_OK);
    EXPECT_EQ(wccpd_shutdown_in_progress(), 0);
    for (const char *line : {"Received SIGPIPE", "Received SIGUSR2", "Got unexpected signal SIGCHLD"})
        EXPECT_EQ(said(line), 1) << line;
}

// Keep-alive messages stop while the engine lock is held.
TEST_F(DaemonMain, ReportsToItsServiceManager) {
    const int manager = socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK, 0);
    sockaddr_un address = {AF_UNIX, "\0manager"};
    ASSERT_EQ(bind(manager, reinterpret_cast<sockaddr *>(&address), sizeof(sa_family_t) + 8), 0);
    const auto received = [&] {
        char text[64] = "";
        (void)recv(manager, text, sizeof text - 1, 0);
        return std::string(text);
    };
    setenv("NOTIFY_SOCKET", "@manager", 1);
    setenv("WATCHDOG_USEC", "48000", 1);
    setenv("WATCHDOG_PID", std::to_string(getpid()).c_str(), 1);
    service_open();
    ASSERT_TRUE(!getenv("NOTIFY_SOCKET") && service_watchdog_ms() == 48 && lew_init(&wccpd_lwc) == LC_OK);
    ASSERT_EQ(wccpd_service_ready(), LC_OK);
    for (const char *message : {"READY=1", "WATCHDOG=1"})
        EXPECT_EQ(received(), message);
    (void)lew_dispatch_once(wccpd_lwc, nullptr, nullptr);
    EXPECT_EQ(received(), "WATCHDOG=1");
    pthread_mutex_lock(&wccp_g.lock);
    (void)lew_dispatch_once(wccpd_lwc, nullptr, nullptr);
    EXPECT_EQ(received(), "");
    pthread_mutex_unlock(&wccp_g.lock);
    wccpd_service_deinit();
    EXPECT_EQ(lew_deinit(&wccpd_lwc), LC_OK);
    close(manager);
}

} // namespace
