/* How large the system log may grow. */
#ifndef HANDLERS_SYSLOG_SIZE_H
#define HANDLERS_SYSLOG_SIZE_H

/*
 * Size of the partition that the NV item `syslog_path` lies on, in KB: the number that df shows for it in MB,
 * times 1024; 0 when df has no line for it. Runs df and waits for it. For any thread.
 */
int log_syslog_size_max();

#endif
