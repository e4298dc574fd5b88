/* The maker's log on any Linux machine: a file named by VEX_LOG_FILE, else syslog(3). */
#include "platform/vex_platform.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

namespace
{

constexpr std::size_t kTextMax = 4096; /* longest text; the longest the daemon writes is a control text and a name */
constexpr std::size_t kStampMax = 64;
constexpr std::size_t kOriginMax = 64;                                      /* source and line */
constexpr std::size_t kLineMax = kStampMax + kOriginMax + 4 * kTextMax + 1; /* every byte as \xNN, newline */
constexpr int kDefaultLevel = 6;

struct log_sink {
    int max_level; /* lines above it are dropped */
    int fd;        /* the log file, or -1: syslog(3) */
};

log_sink open_sink()
{
    const char *level = std::getenv("VEX_LOG_LEVEL");
    const char *path = std::getenv("VEX_LOG_FILE");
    log_sink sink{level != nullptr ? static_cast<int>(std::strtol(level, nullptr, 10)) : kDefaultLevel, -1};
    if (path != nullptr && *path != '\0')
        sink.fd = open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (sink.fd == -1)
        openlog("vex_log_manage", LOG_NDELAY, LOG_DAEMON);
    return sink;
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

/* The sink, opened by the first line. */
const log_sink &sink()
{
    static const log_sink opened = open_sink();
    return opened;
}

/* Formats and writes one line. On its own, so that a line above the level costs no stack. */
[[gnu::noinline]] void append(int level, const char *source, int line, const char *format, va_list args)
{
    char text[kTextMax];
    std::size_t text_len = bounded(std::vsnprintf(text, sizeof text, format, args), sizeof text);
    if (text_len > 0 && text[text_len - 1] == '\n')
        --text_len;

    char out[kLineMax];
    std::size_t used = sink().fd != -1 ? stamp(out, sizeof out, level) : 0;
    used += bounded(std::snprintf(out + used, kOriginMax, "%s:%d ", source, line), kOriginMax);
    used += escape(text, text_len, out + used);
    if (sink().fd == -1) {
        syslog(level == 0 ? LOG_ERR : LOG_INFO, "%.*s", static_cast<int>(used), out);
        return;
    }
    out[used++] = '\n';
    /* One write a line, so that lines of several threads and processes never mix. A log that can't be written
     * has nobody to tell. */
    [[maybe_unused]] const ssize_t written = write(sink().fd, out, used);
}

} // namespace

void vex_syslog_append(int level, const char *source, int line, int /*module*/, const char *format, ...)
{
    const int saved_errno = errno; /* the first line opens the sink */
    if (level <= sink().max_level) {
        va_list args;
        va_start(args, format);
        append(level, source, line, format, args);
        va_end(args);
    }
    errno = saved_errno;
}
