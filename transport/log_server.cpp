#include "transport/log_server.h"

#include "core/log_line.h"
#include "core/log_registry.h"
#include "core/log_threads.h"
#include "core/log_tools.h"
#include "platform/unique_fd.h"
#include "protocol/log_recv.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kPort = 48888;
constexpr int kBacklog = 1;
constexpr unsigned kAcceptPause = 1; /* seconds after a failed accept */

void set_option(int fd, int level, int option, int value)
{
    setsockopt(fd, level, option, &value, sizeof value);
}

/* Options that every accepted connection inherits. Each frame is one send: nothing is gained by holding it
 * back. */
void set_connection_options(int fd)
{
    log_set_keepalive(fd);
    set_option(fd, IPPROTO_TCP, TCP_NODELAY, 1);
}

/* Stores a socket bound to the port on every IPv4 address. 0, or -1 and nothing stored. */
int vex_create_server_socket(int port, unique_fd *listener)
{
    if (listener == nullptr)
        return -1;
    LOG_NOTE("%s enter\n", __func__);
    unique_fd sock{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_NOTE("[error]can not create tcp server socket !");
        return -1;
    }
    LOG_NOTE("after create_server_socket \n");
    set_option(sock.get(), SOL_SOCKET, SO_REUSEADDR, 1);
    set_connection_options(sock.get());
    sockaddr_in any{};
    any.sin_family = AF_INET;
    any.sin_port = htons(static_cast<std::uint16_t>(port));
    any.sin_addr.s_addr = htonl(INADDR_ANY);
    if (bind(sock.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any) != 0) {
        LOG_NOTE("[error]can not bind socket! errno=%d,%s", errno, std::strerror(errno));
        return -1;
    }
    LOG_NOTE("after create_server_socket bind \n");
    *listener = std::move(sock);
    LOG_NOTE("create_server_socket ok end\n");
    return 0;
}

/* The same for IPv6 and for nothing but IPv6, so that both families can listen on one port. */
int vex_create_server_socket_ipv6(int port, unique_fd *listener)
{
    if (listener == nullptr)
        return -1;
    LOG_NOTE("%s enter\n", __func__);
    unique_fd sock{socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_NOTE("[error]can not create tcp server socket !");
        return -1;
    }
    LOG_NOTE("after create_server_socket ipv6 \n");
    set_option(sock.get(), IPPROTO_IPV6, IPV6_V6ONLY, 1);
    LOG_NOTE("bind ipv6 enter \n");
    set_connection_options(sock.get());
    sockaddr_in6 any{};
    any.sin6_family = AF_INET6;
    any.sin6_port = htons(static_cast<std::uint16_t>(port));
    any.sin6_addr = in6addr_any;
    if (bind(sock.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any) != 0) {
        LOG_NOTE("[error]can not bind socket ipv6! errno=%d,%s", errno, std::strerror(errno));
        return -1;
    }
    LOG_NOTE("after create_server_socket ipv6 bind \n");
    *listener = std::move(sock);
    LOG_NOTE("create_server_socket ipv6 ok end\n");
    return 0;
}

/* Starts the receive thread of the command connection; `before` is the one that was cancelled for it. */
void vex_log_recv_thread(int cmd_fd, pthread_t before) LOG_REQUIRES(g_takeover_lock)
{
    const auto number = [](pthread_t thread) { return static_cast<unsigned long long>(thread); };
    if (before != 0)
        LOG_NOTE("%s:pthread_cancel threadID=[%llu]\n", __func__, number(before));
    log_thread_task task{};
    task.entry = log_recv_tcp_msg;
    if (log_thread_create(&task, log_recv_argument(cmd_fd)) != 0) {
        LOG_NOTE("[failed creat log_recv_tcp_msg \n");
        log_cmd_disown();
        task.thread_id = 0;
    }
    LOG_NOTE("%s threadID=[%llu]\n", __func__, number(task.thread_id));
}

/* Waits for the next connection of the listener. None, after a log line and a pause, when accept failed. */
template <typename Address> unique_fd accept_next(const char *name, int listener, Address *peer)
{
    socklen_t len = sizeof *peer;
    unique_fd client{accept4(listener, reinterpret_cast<sockaddr *>(peer), &len, SOCK_CLOEXEC)};
    if (log_cmd_fd() != -1)
        sched_yield(); /* a tool that has just closed its connection need not be thrown out: its thread ends soon */
    if (!client) {
        LOG_NOTE("%s accept error %s(errno: %d) ", name, std::strerror(errno), errno);
        sleep(kAcceptPause);
    }
    return client;
}

void serve_ipv4(const char *name, int client, const sockaddr_in &peer)
{
    const log_lock turn{g_takeover_lock};
    const log_cmd_taken old = log_cmd_take_away();
    if (old.fd != -1)
        LOG_NOTE("%s:close old fd[%d]", name, old.fd);
    char ip[kClientIpSize] = {};
    inet_ntop(AF_INET, &peer.sin_addr, ip, sizeof ip);
    log_cmd_record(client, ip);
    LOG_NOTE("%s: client ip[%s],fd=[%d]", name, ip, client);
    vex_log_recv_thread(client, old.reader);
}

/* Writes all eight groups of the address, in lower-case hex without leading zeros: no "::". */
void print_ipv6(const in6_addr &address, char *text, std::size_t size)
{
    unsigned group[8];
    for (std::size_t i = 0; i < 8; ++i)
        group[i] = static_cast<unsigned>(address.s6_addr[2 * i] << 8 | address.s6_addr[2 * i + 1]);
    std::snprintf(text, size, "%x:%x:%x:%x:%x:%x:%x:%x", group[0], group[1], group[2], group[3], group[4], group[5],
                  group[6], group[7]);
}

void serve_ipv6(const char *name, int client, const sockaddr_in6 &peer)
{
    const log_lock turn{g_takeover_lock};
    if (const int old_fd = log_cmd_fd(); old_fd != -1)
        LOG_NOTE("%s:close fd[%d]", name, old_fd);
    const log_cmd_taken old = log_cmd_take_away();
    char ip[kClientIpSize] = {};
    print_ipv6(peer.sin6_addr, ip, sizeof ip);
    log_cmd_record(client, ip);
    LOG_NOTE("%s: client ipv6[%s],fd[%d] ", name, ip, client);
    vex_log_recv_thread(client, old.reader);
}

/* Accepts for ever; returns only when listen fails. */
void log_server_handle_tcp_msg(int listener)
{
    LOG_NOTE("%s enter ", __func__);
    if (listen(listener, kBacklog) != 0) {
        LOG_NOTE("%s listen failed ", __func__);
        return;
    }
    for (;;) {
        sockaddr_in peer{};
        unique_fd client = accept_next(__func__, listener, &peer);
        if (client)
            serve_ipv4(__func__, client.release(), peer);
    }
}

void log_server_handle_tcp_msg_ipv6(int listener)
{
    LOG_NOTE("%s enter ", __func__);
    if (listen(listener, kBacklog) != 0) {
        LOG_NOTE("%s listen failed ", __func__);
        return;
    }
    LOG_NOTE("%s listen ", __func__);
    for (;;) {
        LOG_NOTE("%s accept before ", __func__);
        sockaddr_in6 peer{};
        unique_fd client = accept_next(__func__, listener, &peer);
        if (!client)
            continue;
        LOG_NOTE("%s accept after", __func__);
        serve_ipv6(__func__, client.release(), peer);
    }
}

void *log_server_thread_proc(void * /*unused*/)
{
    LOG_NOTE("enter %s.\n", __func__);
    unique_fd listener;
    if (vex_create_server_socket(kPort, &listener) == 0)
        log_server_handle_tcp_msg(listener.get());
    return nullptr;
}

void *log_server_thread_proc_ipv6(void * /*unused*/)
{
    LOG_NOTE("enter %s.\n", __func__);
    unique_fd listener;
    if (vex_create_server_socket_ipv6(kPort, &listener) == 0)
        log_server_handle_tcp_msg_ipv6(listener.get());
    return nullptr;
}

} // namespace

int vex_log_server_thread()
{
    return log_start_thread(__func__, log_server_thread_proc);
}

int vex_log_server_thread_ipv6()
{
    return log_start_thread(__func__, log_server_thread_proc_ipv6);
}
