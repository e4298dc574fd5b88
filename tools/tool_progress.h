/* How far a long transfer is, on standard error: a bar on a terminal, a plain line for each tenth elsewhere. */
#ifndef TOOLS_TOOL_PROGRESS_H
#define TOOLS_TOOL_PROGRESS_H

#include "tools/tool_wait.h"

#include <cstdint>

class tool_progress
{
public:
    /* `what` is said in front: "received", "sent". */
    tool_progress(const char *what, std::uint64_t total);
    ~tool_progress(); /* leaves the last state standing */
    tool_progress(const tool_progress &) = delete;
    tool_progress &operator=(const tool_progress &) = delete;

    void advance(std::uint64_t bytes);

private:
    void draw_bar() const;
    void print_line() const;

    const char *what_;
    std::uint64_t total_;
    std::uint64_t done_ = 0;
    bool terminal_;
    tool_clock::time_point start_ = tool_clock::now();
    tool_clock::time_point next_draw_ = start_;
};

/* A number of bytes as text, such as "12.3 MB". */
std::string tool_bytes(std::uint64_t bytes);

#endif
