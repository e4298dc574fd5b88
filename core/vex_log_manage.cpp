/* The daemon's entry point: start-up, then the wait for its end. All work is done on the threads started
 * here. */
#include "client/log_client_ctl.h"
#include "client/log_stream.h"
#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_options.h"
#include "core/log_process.h"
#include "core/log_programs.h"
#include "core/log_registry.h"
#include "core/log_stdout.h"
#include "core/log_tools.h"
#include "handlers/bsp_module_level.h"
#include "platform/unique_fd.h"
#include "transport/log_server.h"

#include <charconv>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <optional>
#include <sys/file.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr auto kExitPoll =
    std::chrono::seconds(5); /* between two looks at exit_flag, which is also told when it is set */

constexpr auto kCounterMax = std::chrono::seconds(5); /* for another daemon to be done with the start counter */
constexpr useconds_t kCounterPoll = 1000;             /* microseconds */

/* So that two daemons that start at once take two units. The lock is on their own program, as that needs no file; one
 * that cannot be had in time is done without. */
unique_fd lock_counter()
{
    unique_fd program{open("/proc/self/exe", O_RDONLY | O_CLOEXEC)};
    const auto end = log_clock::now() + kCounterMax;
    while (program && flock(program.get(), LOCK_EX | LOCK_NB) != 0 && log_clock::now() < end)
        usleep(kCounterPoll);
    return program;
}

/* Takes one unit of the start counter; false when there is none left and the daemon is to stay off. */
bool consume_start()
{
    const unique_fd lock = lock_counter();
    char count[8] = {};
    vex_get_nv_item("log_manage_switch", count, sizeof count);
    const int starts = log_text_to_int(count);
    if (starts < 1) {
        LOG_NOTE("log_manage_switch disable \n");
        return false;
    }
    *std::to_chars(count, count + sizeof count - 1, starts - 1).ptr = '\0'; /* never more digits than were read */
    vex_set_nv_item("log_manage_switch", count, sizeof count);
    return true;
}

int read_run_mode()
{
    char mode[8] = {};
    vex_get_nv_item("log_manage_mode", mode, sizeof mode);
    return log_text_to_int(mode);
}

void run_server_mode()
{
    log_start_local_syslog();
    vex_log_server_thread();
    vex_log_server_thread_ipv6();
}

/* 0 when the control link was started, else the status to end with. */
int run_client_mode()
{
    char tls_off[8] = {};
    vex_get_nv_item("log_use_ssl_disable", tls_off, sizeof tls_off);
    if (std::strcmp(tls_off, "1") != 0) {
        const log_tls_result result = log_tls_start();
        if (result != log_tls_result::ready)
            return result == log_tls_result::no_context ? -1 : 1;
    }
    vex_log_client_ctl_thread();
    return 0;
}

/* Waits until the process is to end, for a while; then its status. */
std::optional<int> exit_status()
{
    const auto end = log_clock::now() + kExitPoll;
    const log_lock hold{g_daemon.exit_lock};
    while (g_daemon.exit_flag == 0 && log_clock::now() < end)
        g_daemon.exit_lock.wait_until(g_daemon.exit_change, end);
    return g_daemon.exit_flag != 0 ? std::optional{g_daemon.exit_status} : std::nullopt;
}

} // namespace

int main(int argc, char **argv)
{
    log_prepare_process();
    LOG_NOTE("start vex_log_manage...\n");
    if (log_parse_options(argc, argv) == log_options_result::help)
        return 0;
    if (!consume_start())
        return 0;
    log_restore_bsp_module_level();
    g_daemon.run_mode = read_run_mode();
    if (g_daemon.run_mode == 0)
        run_server_mode();
    else if (const int status = run_client_mode(); status != 0)
        return status;
    std::optional<int> status;
    while (!(status = exit_status())) {
        log_reap_programs();
        if (const std::shared_ptr<log_link> link = log_cmd_link())
            log_link_look_after(*link);
        log_streams_look_after();
    }
    log_streams_end_all();
    log_print_flush();
    _exit(*status); /* other threads still run: nothing that they use may be torn down */
}
