/* The tool as a process: its standard streams and how it ends. */
#ifndef TOOLS_TOOL_PROCESS_H
#define TOOLS_TOOL_PROCESS_H

#include <cstddef>

/* To be called first: descriptors 0 to 2 are open, so that no socket or file can become a standard stream, and a reader
 * of the output that goes away is an error like any other. */
void tool_prepare_process();

/* Writes bytes whole; false, with errno, when that fails. */
bool tool_write_whole(int fd, const void *bytes, std::size_t len);

/* The exit status, unless what was said could not be written to standard output. */
int tool_exit_status(int status);

#endif
