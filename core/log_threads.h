/* The start of the daemon's own threads, all detached: nobody joins them, they end with the process at the
 * latest. */
#ifndef CORE_LOG_THREADS_H
#define CORE_LOG_THREADS_H

/* Starts `entry` with the argument. 0 started; -1 after a log line in the name of `starter`. For any thread. */
int log_start_thread(const char *starter, void *(*entry)(void *), void *argument = nullptr);

#endif
