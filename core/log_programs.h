/*
 * What writes the device's two logs: every command line that starts or ends syslogd, diag_mdlog and the system log's
 * script, in both of the daemon's modes.
 *
 * Programs are changed by several threads, and a change takes a while. The newest one wins: an older one does nothing
 * more once a newer one has come. Before a change does anything, it ends what the ones before have left under way, so
 * that a program that hangs holds up nobody for long.
 */
#ifndef CORE_LOG_PROGRAMS_H
#define CORE_LOG_PROGRAMS_H

#include "core/log_lock.h"
#include "core/log_registry.h"

#include <atomic>
#include <sys/types.h>

enum class log_kind {
    syslog, /* the system log */
    qxdm,   /* the modem's log */
};

/* One change of what writes a log. While it lives it is the newest, or has been overtaken. For one thread. */
class log_program_change
{
public:
    /* From here on it is the newest one. It is wanted until a newer one has come or `*unwanted`, where there is one, is
     * set. */
    explicit log_program_change(log_kind kind, const std::atomic<bool> *unwanted = nullptr);
    log_program_change(const log_program_change &) = delete;
    log_program_change &operator=(const log_program_change &) = delete;

    /* Each of these first waits for what is under way: for a command that ends programs, then for a program that was
     * left behind, as long as log_end_child() gives it. It does nothing when the change is not wanted any more, which
     * is logged. */

    /* Runs a command that ends programs; one that hangs is left behind after 3 seconds. */
    void end_by(const char *cmd);

    /* Starts a program, which inherits `handed_fd` where that is not -1; whether it did. */
    bool launch(const char *cmd, int handed_fd = -1);

    /* Starts a program that is left behind. */
    void launch_behind(const char *cmd);

private:
    bool is_wanted() const;

    const log_kind kind_;
    const std::atomic<bool> *const unwanted_;
};

/* Forgets a program that was left behind and has ended by itself: nobody else would learn of it before the next change.
 * For start-up's loop. */
void log_reap_programs();

/* ---- The system log ---- */

/* The NV items `syslog_path`, `syslog_level` and `syslog_size`, as their script takes them. */
struct log_syslog_items {
    char path[32] = {};
    char level[32] = {};
    char size[32] = {};
};

/* Reads them, cut to `field_size` - 1 characters; `field_size` is up to 32. A level or size that is no
 * log_is_plain_word() is empty (logged). */
log_syslog_items log_read_syslog_items(int field_size);

/* Starts the device's own system log, and waits until its script has ended. Before there are any threads. */
void log_start_local_syslog();

/* Starts the device's own system log again, behind. */
void log_restart_local_syslog(log_program_change &change, const log_syslog_items &items);

/* Ends syslogd, which writes to whatever it was told. */
void log_end_syslog(log_program_change &change);

/* Has the system log sent to a log tool, over UDP. `ip_class` is that of log_isValidIpOrUrl(). */
constexpr int kLogSyslogPort = 1514; /* on the log tool */
void log_send_syslog_to_tool(log_program_change &change, const char *ip, int ip_class);

/* Has the system log written to a socket; false when its program was not started. */
bool log_write_syslog_to(log_program_change &change, int fd);

/* Size of the partition that the NV item `syslog_path` lies on, in KB: the number that df shows for it in MB, times
 * 1024; 0 when df has no line for it. Runs df and waits for it. */
int log_syslog_size_max();

/* ---- The modem's log ---- */

constexpr int kLogModemPort = 25555;                    /* TCP, on the device */
constexpr char kLogModemUsbAddress[] = "192.168.255.1"; /* the device, for a PC on its USB port */

/* How a new modem log may go on. */
enum class log_modem_start {
    ready,     /* to be started */
    no_config, /* it has no configuration (logged) */
    on_usb,    /* this is a plug-in module in a PC, which it can only go to: it has been started there */
};

/* Ends the modem's log and makes ready for a new one. */
log_modem_start log_prepare_modem(log_program_change &change);

/* Has the modem's log offered at the address, to whoever connects to it there. */
void log_offer_modem_at(log_program_change &change, const char *ip);

/* Makes ready to have the modem's log written to a socket: false without a configuration (logged). Then has it written
 * there: false when its program was not started. */
bool log_prepare_modem_socket(log_program_change &change);
bool log_write_modem_to(log_program_change &change, int fd);

#endif
