/* The platform's third version: NV items, log lines and messages stay in memory, and calls fail on demand. */
#ifndef TESTS_MEMORY_PLATFORM_H
#define TESTS_MEMORY_PLATFORM_H

#include <cstdarg>
#include <map>
#include <string>
#include <utility>
#include <vector>

struct memory_platform {
    std::map<std::string, std::string> items;
    std::string log; /* "LEVEL SOURCE TEXT|", line after line, a newline at the end of TEXT as "$" */
    std::vector<std::string> messages;
    int saves = 0;
    bool fails = false;
    void (*takes_line)(const char *source, const char *format, va_list args) = nullptr; /* in place of `log` */

    bool logged(const std::string &text) const { return log.find(text) != std::string::npos; }
    /* What has been logged since the last call. */
    std::string take_log() { return std::exchange(log, ""); }
};

extern memory_platform g_platform;

#endif
