/* The maker's log on any Linux machine: a file named by VEX_LOG_FILE, else the system's log. */
#include "platform/host/log_sink.h"
#include "platform/vex_platform.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <ctime>

namespace
{

constexpr std::size_t kTextMax = 4096; /* longest text; the longest the daemon writes is a control text and a name */
constexpr std::size_t kStampMax = 64;
constexpr std::size_t kOriginMax = 64;                                      /* source and line */
constexpr std::size_t kLineMax = kStampMax + kOriginMax + 4 * kTextMax + 1; /* every byte as \xNN, newline */
constexpr int kDefaultLevel = 6;

int max_level()
{
    static const char *const level = std::getenv("VEX_LOG_LEVEL"); /* lines above it are dropped */
    static const int max = level != nullptr ? static_cast<int>(std::strtol(level, nullptr, 10)) : kDefaultLevel;
    return max;
}

/* Copies `text` to `out` so that a line stays a line, whatever it holds; returns the number of bytes written. */
std::size_t escape(const char *text, std::size_t len, char *out)
{
    constexpr char kHex[] = "0123456789abcdef";
    char *at = out;
    for (const char *p = text; p != text + len; ++p) {
        const auto byte = static_cast<unsigned char>(*p);
        if (byte >= 0x20 && byte != 0x7f && byte != '\\') {
            *at++ = *p;
            continue;
        }
        *at++ = '\\';
        *at++ = 'x';
        *at++ = kHex[byte >> 4];
        *at++ = kHex[byte & 15];
    }
    return static_cast<std::size_t>(at - out);
}

/* Writes "2026-11-22T19:50:01.123456Z 6 " to `out`; returns its length. */
std::size_t stamp(char *out, std::size_t size, int level)
{
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    tm utc{};
    gmtime_r(&now.tv_sec, &utc);
    const int n =
        std::snprintf(out, size, "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ %d ", utc.tm_year + 1900, utc.tm_mon + 1,
                      utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec, now.tv_nsec / 1000, level);
    return static_cast<std::size_t>(n);
}

std::size_t bounded(int printed, std::size_t size)
{
    if (printed < 0)
        return 0;
    return static_cast<std::size_t>(printed) < size ? static_cast<std::size_t>(printed) : size - 1;
}

/* Formats and writes one line. On its own, so that a line above the level costs no stack. */
[[gnu::noinline]] void append(int level, const char *source, int line, const char *format, va_list args)
{
    char text[kTextMax];
    std::size_t text_len = bounded(std::vsnprintf(text, sizeof text, format, args), sizeof text);
    if (text_len > 0 && text[text_len - 1] == '\n')
        --text_len;

    char out[kLineMax];
    std::size_t used = log_sink_is_file() ? stamp(out, sizeof out, level) : 0;
    used += bounded(std::snprintf(out + used, kOriginMax, "%s:%d ", source, line), kOriginMax);
    used += escape(text, text_len, out + used);
    out[used++] = '\n';
    log_sink_write(level, {out, used});
}

} // namespace

void vex_syslog_append(int level, const char *source, int line, int /*module*/, const char *format, ...)
{
    const int saved_errno = errno; /* the first line opens the sink */
    if (level <= max_level()) {
        va_list args;
        va_start(args, format);
        append(level, source, line, format, args);
        va_end(args);
    }
    errno = saved_errno;
}
