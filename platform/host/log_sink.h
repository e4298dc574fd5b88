/* Where log lines go. Nobody waits for it: lines that it does not take are lost, and a line says how many. */
#ifndef PLATFORM_HOST_LOG_SINK_H
#define PLATFORM_HOST_LOG_SINK_H

#include <string_view>

/* Whether it is the file that VEX_LOG_FILE names; else the socket /dev/log, whose daemon stamps the lines. Opened by the first
 * call. SIGHUP has the file opened again before the next line, for whoever has moved it away. */
bool log_sink_is_file();

/* Writes a line, with its newline, in one piece, so that lines of several threads and processes never mix. For any
 * thread. */
void log_sink_write(int level, std::string_view line);

#endif
