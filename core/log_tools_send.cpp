#include "core/log_tools.h"

#include "core/daemon_state.h"
#include "core/log_stdout.h"
#include "core/log_tls_session.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <sys/socket.h>

namespace
{

/* One write of what is left of a packet: bytes written, or 0 or less on failure. */
int write_some(int fd, log_tls_session *ssl, const char *bytes, int len)
{
    if (g_daemon.use_ssl == 1)
        return ssl->write(bytes, len);
    return static_cast<int>(send(fd, bytes, static_cast<std::size_t>(len), 0));
}

/* By hand, as a relay says it 100,000 times a second. */
void print_sent(int len)
{
    constexpr char kWords[] = "log_send_packet complete, the write data size is ";
    char line[sizeof kWords + 16];
    std::memcpy(line, kWords, sizeof kWords - 1);
    char *const end = std::to_chars(line + sizeof kWords - 1, line + sizeof line, len).ptr;
    *end = '\n';
    log_print({line, end + 1});
}

void print_failure(int error)
{
    char line[128];
    const int len =
        std::snprintf(line, sizeof line, "log_send_packet data fail  errno= %d (%s)\n", error, std::strerror(error));
    log_print({line, std::min(static_cast<std::size_t>(len), sizeof line - 1)});
}

} // namespace

int log_send_packet(int fd, log_tls_session *ssl, const void *buffer, int len)
{
    if (fd < 0 || buffer == nullptr || len == 0)
        return -1;
    int sent = 0;
    while (sent < len) {
        if (g_daemon.use_ssl == 1 && ssl == nullptr)
            return -1;
        const int n = write_some(fd, ssl, static_cast<const char *>(buffer) + sent, len - sent);
        if (n <= 0) {
            print_failure(errno);
            return -1;
        }
        sent += n;
        if (sent == len)
            print_sent(sent);
    }
    return sent;
}
