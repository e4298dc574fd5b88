/* The control link: the one connection on which a device in client mode serves its log server. */
#ifndef CLIENT_LOG_CLIENT_CTL_H
#define CLIENT_LOG_CLIENT_CTL_H

/* Starts the thread that connects, announces the device, serves the server's commands, and sets the daemon's exit_flag
 * when the link is over. 0; -1 when the thread cannot be started (logged). Start-up calls it once. */
int vex_log_client_ctl_thread();

#endif
