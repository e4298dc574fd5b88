#include "tools/tool_progress.h"

#include <algorithm>
#include <cstdio>
#include <unistd.h>

namespace
{

constexpr auto kRedraw = std::chrono::milliseconds(100);
constexpr int kBarWidth = 30;

double seconds_since(tool_clock::time_point start)
{
    return std::max(std::chrono::duration<double>(tool_clock::now() - start).count(), 1e-3);
}

} // namespace

std::string tool_bytes(std::uint64_t bytes)
{
    const auto size = static_cast<double>(bytes);
    char text[32];
    if (size < 1e3)
        std::snprintf(text, sizeof text, "%.0f bytes", size);
    else if (size < 1e6)
        std::snprintf(text, sizeof text, "%.1f kB", size / 1e3);
    else
        std::snprintf(text, sizeof text, "%.1f MB", size / 1e6);
    return text;
}

tool_progress::tool_progress(const char *what, std::uint64_t total)
    : what_(what), total_(total), terminal_(isatty(STDERR_FILENO) == 1)
{
}

tool_progress::~tool_progress()
{
    if (!terminal_)
        return;
    draw_bar();
    std::fputc('\n', stderr);
}

void tool_progress::advance(std::uint64_t bytes)
{
    const std::uint64_t tenths = done_ * 10 / total_;
    done_ += bytes;
    if (!terminal_) {
        if (done_ * 10 / total_ != tenths)
            print_line();
    } else if (tool_clock::now() >= next_draw_) {
        next_draw_ = tool_clock::now() + kRedraw;
        draw_bar();
    }
}

void tool_progress::draw_bar() const
{
    const double share = static_cast<double>(done_) / static_cast<double>(total_);
    const double rate = static_cast<double>(done_) / seconds_since(start_);
    const double seconds = static_cast<double>(total_ - std::min(done_, total_)) / std::max(rate, 1.0);
    const int left = static_cast<int>(std::min(seconds, 5999.0));
    const int filled = std::min(static_cast<int>(share * kBarWidth), kBarWidth);
    std::fprintf(stderr, "\r[%.*s%*s] %3.0f%%  %s  %s/s  %d:%02d left\033[K", filled, "##############################",
                 kBarWidth - filled, "", share * 100, tool_bytes(done_).c_str(),
                 tool_bytes(static_cast<std::uint64_t>(rate)).c_str(), left / 60, left % 60);
}

void tool_progress::print_line() const
{
    std::fprintf(stderr, "%s %s of %s\n", what_, tool_bytes(done_).c_str(), tool_bytes(total_).c_str());
}
