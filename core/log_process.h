/* What the daemon asks of its process before anything else runs in it. */
#ifndef CORE_LOG_PROCESS_H
#define CORE_LOG_PROCESS_H

/*
 * Opens /dev/null as every standard stream that the starter left closed, so that no socket can become one; keeps
 * whatever else the starter left open from the programs that the daemon starts; makes a write to a peer that went
 * away fail instead of killing the process, which is not passed on to those programs; has the other signals do what they
 * do by default, whatever the starter made of them, so that the end of programs can be asked for and waited for; has
 * those programs print as in the C locale, as some of it is parsed; and has freed memory kept for the next connection.
 * Called first in main(), once.
 */
void log_prepare_process();

#endif
