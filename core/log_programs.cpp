#include "core/log_programs.h"

#include "core/log_line.h"
#include "core/log_tools.h"

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdio>
#include <cstring>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "log_json_codec";

constexpr auto kEndMax = std::chrono::seconds(3); /* for a command that ends programs */
constexpr unsigned kModemStart = 2;               /* seconds until the modem's log program can be connected to */

constexpr char kModemConfig[] = "/logfs/logconf/Diag.cfg"; /* without it there is no modem log */
constexpr char kModemConfig2[] = "/logfs/logconf/Diag.cfg2";
constexpr char kUsbInterface[] = "/sys/class/net/usb0";

struct program_state {
    log_mutex run_lock LOG_ACQUIRED_BEFORE(g_registry_lock);
    std::atomic<const log_program_change *> newest{nullptr};
    pid_t child LOG_GUARDED_BY(run_lock) = -1;    /* what was left behind */
    bool ending LOG_GUARDED_BY(run_lock) = false; /* a command that ends programs is under way */
    std::condition_variable ended;
};

program_state g_programs[2];

program_state &state_of(log_kind kind)
{
    return g_programs[static_cast<std::size_t>(kind)];
}

/* Waits for what earlier changes have under way or left behind. */
void settle(program_state &state) LOG_REQUIRES(state.run_lock)
{
    while (state.ending)
        state.run_lock.wait(state.ended);
    if (const pid_t child = std::exchange(state.child, -1); child != -1)
        log_end_child(child);
}

/* Reads a level or a size. One that was kept when peers could still set any is not run: it counts as missing. */
void read_plain(const char *name, char (&value)[32], int size)
{
    vex_get_nv_item(name, value, size);
    if (log_is_plain_word(value))
        return;
    LOG_NOTE("%s = [%s] has a character that the shell would interpret, not used\n", name, value);
    value[0] = '\0';
}

bool has_config()
{
    if (access("/logfs/logconf//Diag.cfg", F_OK) == 0)
        return true;
    LOG_NOTE("qxdm Diag.cfg is not exisit\n");
    return false;
}

/* Whether this is a plug-in module in a PC, which reaches it by USB only. */
bool is_usb_module()
{
    char product_type[16] = {};
    vex_get_nv_item("product_type", product_type, sizeof product_type);
    return std::strcmp(product_type, "MODULE") == 0 && access(kUsbInterface, F_OK) == 0;
}

void print_script(char (&cmd)[256], const log_syslog_items &items, const char *end)
{
    std::snprintf(cmd, sizeof cmd, "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o %s -l %s -s %s %s", items.path,
                  items.level, items.size, end);
}

/* The modem's log program with one configuration, or with two. `blanks` is what its line has in front of its counts. */
void print_modem(char (&cmd)[256], const char *blanks, const char *to)
{
    if (access("/logfs/logconf//Diag.cfg2", F_OK) == 0)
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -m %s -o /tmp/diag_logs\t-n 2 -s 10 -R %s &", kModemConfig,
                      kModemConfig2, to);
    else
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -o /tmp/diag_logs%s-n 2 -s 10 -R %s &", kModemConfig, blanks,
                      to);
}

} // namespace

log_program_change::log_program_change(log_kind kind, const std::atomic<bool> *unwanted)
    : kind_(kind), unwanted_(unwanted)
{
    state_of(kind_).newest = this;
}

bool log_program_change::is_wanted() const
{
    if (state_of(kind_).newest == this && (unwanted_ == nullptr || !*unwanted_))
        return true;
    LOG_NOTE("a newer start or end of this log has come, nothing more is done\n");
    return false;
}

void log_program_change::end_by(const char *cmd)
{
    program_state &state = state_of(kind_);
    {
        const log_lock hold{state.run_lock};
        settle(state);
        if (!is_wanted())
            return;
        state.ending = true;
    }
    const pid_t left = log_exec_cmd_within(cmd, kEndMax);
    {
        const log_lock hold{state.run_lock};
        state.ending = false;
        state.child = left;
    }
    state.ended.notify_all();
}

bool log_program_change::launch(const char *cmd, int handed_fd)
{
    program_state &state = state_of(kind_);
    const log_lock hold{state.run_lock};
    settle(state);
    return is_wanted() && log_exec_cmd_with(cmd, handed_fd) == 0;
}

void log_program_change::launch_behind(const char *cmd)
{
    program_state &state = state_of(kind_);
    const log_lock hold{state.run_lock};
    settle(state);
    if (is_wanted())
        state.child = log_exec_cmd_behind(cmd);
}

void log_reap_programs()
{
    for (program_state &state : g_programs) {
        if (!state.run_lock.try_acquire())
            continue;
        if (state.child != -1 && log_child_ended(state.child))
            state.child = -1;
        state.run_lock.release();
    }
}

log_syslog_items log_read_syslog_items(int field_size)
{
    log_syslog_items items;
    vex_get_nv_item("syslog_path", items.path, field_size);
    read_plain("syslog_level", items.level, field_size);
    read_plain("syslog_size", items.size, field_size);
    return items;
}

void log_start_local_syslog()
{
    char cmd[256];
    print_script(cmd, log_read_syslog_items(16), "");
    log_exec_cmd(cmd);
}

void log_restart_local_syslog(log_program_change &change, const log_syslog_items &items)
{
    char cmd[256];
    print_script(cmd, items, "&");
    change.launch_behind(cmd);
}

void log_end_syslog(log_program_change &change)
{
    change.end_by("killall -9 syslogd");
}

void log_send_syslog_to_tool(log_program_change &change, const char *ip, int ip_class)
{
    log_end_syslog(change);
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, ip_class == 2 ? "syslogd -R [%s]:%d &" : "syslogd -R %s:%d &", ip, kLogSyslogPort);
    change.launch(cmd);
}

bool log_write_syslog_to(log_program_change &change, int fd)
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "syslogd -R tcp_fd=%d &", fd);
    LOG_NOTE("cmd=[%s]\n", cmd);
    log_end_syslog(change);
    return change.launch(cmd, fd);
}

int log_syslog_size_max()
{
    char path[16] = {};
    vex_get_nv_item("syslog_path", path, sizeof path);
    char cmd[128];
    std::snprintf(cmd, sizeof cmd, "df -h | grep %s |awk '{print $2}' | cut -d 'M' -f 1", path);
    char size[128] = {};
    vex_popen(cmd, size, sizeof size);
    return std::clamp(log_text_to_int(size), 0, INT_MAX / 1024) * 1024;
}

log_modem_start log_prepare_modem(log_program_change &change)
{
    change.end_by("killall -9 diag_mdlog");
    change.end_by("killall -9 diag_socket_log");
    if (!has_config())
        return log_modem_start::no_config;
    if (is_usb_module()) {
        char cmd[256];
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -o /tmp/diag_logs -f %s -n 2 -s 10 -R %s -P %d &", kModemConfig,
                      kLogModemUsbAddress, kLogModemPort);
        change.launch(cmd);
        sleep(kModemStart);
        return log_modem_start::on_usb;
    }
    log_exec_cmd("echo 3 > /proc/sys/vm/drop_caches &");
    log_exec_cmd("rm /tmp/diag_logs &");
    return log_modem_start::ready;
}

void log_offer_modem_at(log_program_change &change, const char *ip)
{
    char cmd[256];
    char to[64];
    std::snprintf(to, sizeof to, "%s -P %d", ip, kLogModemPort);
    print_modem(cmd, "  ", to);
    change.launch(cmd);
    sleep(kModemStart);
}

bool log_prepare_modem_socket(log_program_change &change)
{
    change.end_by("killall -9 diag_mdlog");
    if (!has_config())
        return false;
    log_exec_cmd("echo 3 > /proc/sys/vm/drop_caches");
    log_exec_cmd("rm /tmp/diag_logs");
    return true;
}

bool log_write_modem_to(log_program_change &change, int fd)
{
    char cmd[256];
    char to[32];
    std::snprintf(to, sizeof to, "tcp_fd=%d", fd);
    print_modem(cmd, " ", to);
    return change.launch(cmd, fd);
}
