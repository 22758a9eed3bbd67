// The management session on which alarms and state events are sent, and its thread.
//
// Alarms and state events are sent by the engine's timer and receive threads, which may not touch the
// daemon's working session; therefore they have a session of their own. The alarm thread only runs that
// session's loop: it reads acknowledgements, writes queued data when a full socket has room again, and
// notices a lost connection. Senders call the session directly, with the engine lock held, and take the locks
// of this client's own GCL instance. If a send needs a change of the loop's interest in a descriptor, the
// change is posted to the loop and made by the alarm thread, so that no sender waits for the loop's lock. No
// callback here takes the engine lock.
//
// Start. The main thread waits for the alarm thread, which waits for mgmtd. The main thread runs its own loop
// meanwhile, and the alarm thread's last step wakes it. An exit that begins in the meantime ends both waits;
// that of the alarm thread ends because of `qv_exiting`. The alarm thread creates its loop with loop_mutex
// held and checks `qv_exiting` there, so that an exit either finds the loop and can end it, or prevents it.
// Senders get the session only when it is open; earlier messages fail.
//
// End. qv_initiate_exit is called by the main thread at exit, and by the alarm thread when the session is
// lost; the thread does not join itself. A lost alarm session ends only this client. The daemon as a whole
// ends when its working session with the same peer is lost.
#include "engine/wccp_alarm_client.h"

#include <cerrno>
#include <csignal>
#include <cstring>

#include <pthread.h>
#include <semaphore.h>

#include "engine/cthread.h"
#include "engine/wccp_host.h"
#include "mgmt/client_session.h"
#include "runtime/logging.h"

namespace {

lew *qv_alm_lwc;
gcl_session *alarm_session; // senders use qv_alm_mgmt_session, which is set once it is open
mdc *qv_alm_mcc;
std::atomic<int32_t> qv_exiting;
gcl *qv_alm_instance;
fdic *qv_alm_interests;
fdic_libevent *qv_alm_bridge;
int32_t qv_response_expected;
int32_t qv_expected_request_id;
bn_response_msg *qv_captured_response;
mgmt_client qv_alm_client = {&qv_alm_lwc,
                             &alarm_session,
                             &qv_alm_mcc,
                             &qv_response_expected,
                             &qv_expected_request_id,
                             &qv_captured_response,
                             &qv_exiting,
                             "qv_alm_mgmt_handle_response :",
                             &qv_alm_instance,
                             &qv_alm_interests,
                             &qv_alm_bridge};

pthread_t alarm_thread;
std::atomic<bool> alarm_thread_runs; // the thread handle is set
sem_t start_semaphore;
bool start_semaphore_exists; // changes only before the thread is created and after it has posted or ended
pthread_mutex_t loop_mutex = PTHREAD_MUTEX_INITIALIZER; // guards qv_alm_lwc until the thread has ended

lc_status qv_alm_mgmt_handle_response(gcl_session *, bn_response_msg *response, void *) {
    CHECK_STATUS(mgmt_client_response(&qv_alm_client, response));
    return LC_OK;
}

lc_status qv_alm_mgmt_handle_event_response(gcl_session *, bn_response_msg *, void *) {
    return LC_OK;
}

lc_status qv_alm_mgmt_msg_handler(void *, gcl_session *, bn_request_msg *request,
                                  bn_response_msg **out_response) {
    return mgmt_client_request(&qv_alm_client, request, out_response);
}

lc_status qv_alm_mgmt_handle_session_close(int, uint32_t, void *, void *) {
    if (qv_exiting)
        return LC_OK;
    // Ends the wait for an answer, if there is one.
    qv_response_expected = 0;
    LC_LOG(LC_LOG_ERR, "Lost connection to mgmtd; exiting");
    CHECK_STATUS(qv_initiate_exit());
    return LC_OK;
}

lc_status qv_alm_mgmt_open_session(const char *client_name) {
    const lc_status status = mgmt_client_open(&qv_alm_client, client_name, qv_alm_mgmt_msg_handler);
    if (status != LC_OK && status != LC_CANCELLED)
        LC_LOG(LC_LOG_ERR, "Unable to connect to the management daemon");
    return status;
}

lew *get_alarm_loop() {
    const mutex_guard guard(&loop_mutex);
    return qv_alm_lwc;
}

lc_status create_alarm_loop() {
    const mutex_guard guard(&loop_mutex);
    if (qv_exiting) // the exit has found no loop to end
        return LC_CANCELLED;
    CHECK_STATUS(lew_init(&qv_alm_lwc));
    return LC_OK;
}

lc_status qv_alm_mgmt_init_client() {
    return mgmt_client_init(&qv_alm_client, qv_alm_mgmt_handle_session_close);
}

lc_status start_alarm_session(const char *client_name) {
    CHECK_STATUS(create_alarm_loop());
    CHECK_STATUS(qv_alm_mgmt_init_client());
    CHECK_STATUS(
        bn_set_global_callback_query_response_msg(qv_alm_instance, qv_alm_mgmt_handle_response, nullptr));
    CHECK_STATUS(
        bn_set_global_callback_action_response_msg(qv_alm_instance, qv_alm_mgmt_handle_response, nullptr));
    CHECK_STATUS(bn_set_global_callback_event_response_msg(qv_alm_instance, qv_alm_mgmt_handle_event_response,
                                                           nullptr));
    CHECK_STATUS(qv_alm_mgmt_open_session(client_name));
    const mutex_guard guard(&qv_alm_session_mutex);
    qv_alm_mgmt_session = alarm_session; // senders may use it from now on
    return LC_OK;
}

// Ends the wait of the main thread. It may be waiting in its loop; posting work that does nothing wakes it.
void report_start() {
    // Static, because it must exist until the main loop has run it.
    static loop_post wake = {nullptr, nullptr, [](loop_post *, int) {}};
    loop_context *main_loop = nullptr;
    if (!start_semaphore_exists)
        return;
    // First the post, then the wake-up: the main thread checks the semaphore when it wakes.
    sem_post(&start_semaphore);
    if (wccpd_lwc && lew_get_event_context(wccpd_lwc, &main_loop) == LC_OK)
        loop_post_work(main_loop, &wake);
}

void *qv_alm_thread(void *client_name) {
    const lc_status status = start_alarm_session(static_cast<const char *>(client_name));
    report_start();
    if (status != LC_OK) {
        if (status != LC_CANCELLED)
            LC_LOG(LC_LOG_ERR, "qv_alm_thread: failed to initialize alarm session");
        return nullptr;
    }
    LOG_STATUS(lew_dispatch(qv_alm_lwc, nullptr, nullptr));
    LC_LOG(LC_LOG_INFO, "qv_alm_thread: out of main loop, exiting...");
    return nullptr;
}

// With all signals blocked, which are for the main thread, and with a small stack, since all memory is
// locked.
int create_alarm_thread(const char *client_name) {
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setstacksize(&attributes, CTHREAD_STACK_BYTES);
    sigset_t all, previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous);
    const int result =
        pthread_create(&alarm_thread, &attributes, qv_alm_thread, const_cast<char *>(client_name));
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    pthread_attr_destroy(&attributes);
    return result;
}

// Waits until the alarm thread has posted or an exit has begun. Without a loop to run, waits for the post
// only.
void wait_for_start() {
    int no_events = 0;
    bool has_loop = wccpd_lwc != nullptr;
    while ((has_loop ? sem_trywait(&start_semaphore) : sem_wait(&start_semaphore)) != 0) {
        if (!has_loop)
            continue; // interrupted by a signal
        // The exit, nested in the dispatch below, has joined the alarm thread: nobody posts any more.
        if (wccpd_shutdown_in_progress())
            return;
        has_loop = lew_dispatch_once(wccpd_lwc, &no_events, nullptr) == LC_OK && !no_events;
    }
}

} // namespace

lc_status qv_alm_mgmt_init(const char *client_name) {
    start_semaphore_exists = sem_init(&start_semaphore, 0, 0) == 0;
    if (!start_semaphore_exists)
        LC_LOG(LC_LOG_ERR, "Failed to init alm semaphore (%s), proceeding without it...", strerror(errno));
    const int result = create_alarm_thread(client_name);
    alarm_thread_runs = result == 0;
    if (result != 0)
        LC_LOG(LC_LOG_ERR, "Failed to create alarm thread : %s ", strerror(result));
    if (start_semaphore_exists) {
        if (result == 0)
            wait_for_start();
        sem_destroy(&start_semaphore);
        start_semaphore_exists = false;
    }
    return result;
}

lc_status qv_alm_mgmt_shutdown() {
    LC_LOG(LC_LOG_INFO, "qv_alm_mgmt_shutdown: cancel alm thread");
    // The thread ends when its loop returns; it is not cancelled.
    if (lew *loop = get_alarm_loop())
        CHECK_STATUS(lew_escape_from_dispatch(loop));
    if (alarm_thread_runs && !pthread_equal(alarm_thread, pthread_self())) { // it cannot join itself
        const int result = pthread_join(alarm_thread, nullptr);
        if (result != 0 && result != ESRCH) {
            LC_LOG(LC_LOG_ERR, "qv_alm_mgmt_shutdown: failed to join thread : %s ", strerror(result));
            return result;
        }
        alarm_thread_runs = false;
    }
    LC_LOG(LC_LOG_INFO, "qv_alm_mgmt_shutdown: alm thread exited");
    if (qv_alm_instance)
        CHECK_STATUS(gcl_shutdown(qv_alm_instance));
    return LC_OK;
}

lc_status qv_initiate_exit() {
    qv_exiting = 1;
    CHECK_STATUS(qv_alm_mgmt_shutdown());
    if (lew *loop = get_alarm_loop())
        CHECK_STATUS(lew_escape_from_dispatch(loop));
    return LC_OK;
}

// The engine's threads are still running. A sender finds either a complete session or none.
lc_status qv_alm_mgmt_deinit() {
    const mutex_guard guard(&qv_alm_session_mutex);
    qv_alm_mgmt_session = nullptr;
    mgmt_client_deinit(&qv_alm_client);
    LOG_STATUS(lew_deinit(&qv_alm_lwc));
    return LC_OK;
}
