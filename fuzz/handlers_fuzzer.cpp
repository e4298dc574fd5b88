/*
 * Every handler's control text, on a device whose commands are written down instead of run. The first byte of an input says
 * which mode the daemon is in, the rest is the control text. No command line is longer than its buffer allows, and every
 * reply is a frame with a control text of at most its bound.
 */
#include "core/daemon_state.h"
#include "core/log_registry.h"
#include "core/log_streams.h"
#include "core/log_tools.h"
#include "fuzz/fuzz.h"
#include "platform/unique_fd.h"
#include "protocol/log_json_codec.h"
#include "protocol/log_pkg_codec.h"
#include "tests/memory_platform.h"

#include <cerrno>
#include <cstring>
#include <memory>
#include <pthread.h>
#include <sys/socket.h>

namespace
{

constexpr std::size_t kCommandMax = 512;
constexpr std::size_t kReplyMax = 1023;

void check_command(const char *command)
{
    promise(std::strlen(command) < kCommandMax, "a command line has room in its buffer");
}

/* The device's end of the command connection, and ours. */
struct connection {
    connection()
    {
        int ends[2] = {-1, -1};
        promise(socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends) == 0, "a socket pair");
        peer.reset(ends[1]);
        log_cmd_record_link(ends[0]);
        device = ends[0];
    }
    int device;
    unique_fd peer;
};

/* Takes the replies off the connection. */
void check_replies(const connection &link)
{
    static unsigned char bytes[1 << 20];
    static const auto msg = std::make_unique<log_msg>();
    std::size_t held = 0;
    for (ssize_t n = 0; (n = recv(link.peer.get(), bytes + held, sizeof bytes - held, 0)) > 0;)
        held += static_cast<std::size_t>(n);
    for (std::size_t at = 0; at < held;) {
        const std::uint32_t control_len = log_pkg_get_u32(bytes + at + kPkgControlLenAt);
        promise(at + kPkgMin + control_len <= held && control_len <= kReplyMax, "a reply is bounded");
        const std::uint32_t data_len = log_pkg_get_u32(bytes + at + kPkgControlAt + control_len);
        const std::size_t len = kPkgMin + control_len + data_len;
        log_msg_clear(msg.get());
        promise(at + len <= held && log_decode_msg(bytes + at, len, msg.get()) == 0, "a reply is a frame");
        at += len;
    }
}

} // namespace

extern "C" {
int __wrap_system(const char *command)
{
    check_command(command);
    return 0;
}
FILE *__wrap_popen(const char *command, const char *)
{
    check_command(command);
    return fopen("/dev/null", "r");
}
int __wrap_pclose(FILE *stream)
{
    return fclose(stream);
}
int __wrap_fork()
{
    return -1;
}
unsigned __wrap_sleep(unsigned)
{
    return 0;
}
void __wrap_sync() {}
int __wrap_pthread_create(pthread_t *, const pthread_attr_t *, void *(*)(void *), void *)
{
    return EAGAIN;
}
}

/* A start of a live log gets no threads: one of these two takes the place of what would make them. */
int refuse_thread(log_thread_task *task, void *argument) __asm__("__wrap__Z17log_thread_createP15log_thread_taskPv");
int refuse_thread(log_thread_task *, void *)
{
    return -1;
}

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    if (size < 1 || size > kPkgControlMax)
        return 0;
    static const connection link;
    g_platform = {};
    g_platform.items["imei"] = "356938035643809";
    g_daemon.run_mode = data[0] & 1;
    const std::string control(text_of(data + 1, size - 1));
    log_dl_msg_handle_cmd(control.c_str(), data, static_cast<std::int32_t>(size));
    log_stream_stop(log_stream::syslog);
    log_stream_stop(log_stream::qxdm);
    check_replies(link);
    return 0;
}
