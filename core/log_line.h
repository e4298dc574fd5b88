/*
 * How the daemon's modules write log lines. A source says who it is once, then logs:
 *
 *     constexpr char kLogSource[] = "log_tools";
 *     LOG_NOTE("%s enter\n", __func__);
 *
 * The level is checked before a line is formatted, errno survives it, and formats are checked by the
 * compiler.
 */
#ifndef CORE_LOG_LINE_H
#define CORE_LOG_LINE_H

#include "platform/vex_platform.h"

constexpr int kLogModule = 84; /* this daemon's code in the maker's log */

/* Progress, and errors that a peer can cause. */
#define LOG_NOTE(...) LOG_NOTE_AS(kLogSource, __VA_ARGS__)

/* A failure of the system or of TLS. */
#define LOG_FAULT(...) vex_syslog_append(0, kLogSource, __LINE__, kLogModule, __VA_ARGS__)

/* A line in the name of another source. */
#define LOG_NOTE_AS(source, ...) vex_syslog_append(6, source, __LINE__, kLogModule, __VA_ARGS__)

#endif
