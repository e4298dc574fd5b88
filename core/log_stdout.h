/* Lines on standard output. Nobody waits for them: what its reader is too slow for is lost. For any thread. */
#ifndef CORE_LOG_STDOUT_H
#define CORE_LOG_STDOUT_H

#include <string_view>

/* Adds a line, with its newline, of up to 4096 bytes. It is shown once that many are held, at once on a terminal. */
void log_print(std::string_view line);

/* Shows what is held, and what libraries have printed. */
void log_print_flush();

#endif
