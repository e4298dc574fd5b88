/* The device's own system log and the script that starts it. For any thread. */
#ifndef CORE_LOG_LOCAL_SYSLOG_H
#define CORE_LOG_LOCAL_SYSLOG_H

enum class log_script_wait {
    yes, /* for the script to end */
    no,  /* it runs in the background */
};

/* (Re)starts the local system log in the folder or file `path`, with the level and the size (KB) as its script takes
 * them. */
void log_run_syslog_script(const char *path, const char *level, const char *size, log_script_wait wait);

/* Restarts it in the background as the NV items `syslog_path`, `syslog_level` and `syslog_size` say. */
void log_restart_local_syslog();

/* Breaks such a restart off if it is still under way: its script would kill the log program that is about to be
 * started. */
void log_break_off_local_syslog();

/* Size of the partition that the NV item `syslog_path` lies on, in KB: the number that df shows for it in MB, times
 * 1024; 0 when df has no line for it. Runs df and waits for it. */
int log_syslog_size_max();

#endif
