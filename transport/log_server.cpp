#include "transport/log_server.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"
#include "core/log_tools.h"
#include "platform/unique_fd.h"
#include "protocol/log_recv.h"

#include <arpa/inet.h>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kPort = 48888;
constexpr int kBacklog = 1;
constexpr unsigned kAcceptPause = 1; /* seconds after a failed accept */
constexpr int kNoListener = 1;       /* the process's status */

std::atomic<int> g_families{2}; /* that have a listener, or may get one */

/* A listener's address family and its words; a line that is empty is not logged. */
struct listener_family {
    int family;
    int level; /* the option that is switched on */
    int option;

    const char *create; /* the routine that makes the socket */
    const char *created;
    const char *option_set;
    const char *bind_failed; /* with errno and its text */
    const char *bound;
    const char *done;

    const char *accept; /* the routine that accepts; the first argument of all lines below */
    const char *listens;
    const char *accept_before;
    const char *accept_after;
    const char *closes; /* with the old descriptor */
    bool closes_unlogged;
    const char *client; /* with the peer's address and the new descriptor */
};

constexpr listener_family kIpv4{
    .family = AF_INET,
    .level = SOL_SOCKET,
    .option = SO_REUSEADDR,
    .create = "vex_create_server_socket",
    .created = "after create_server_socket \n",
    .option_set = "",
    .bind_failed = "[error]can not bind socket! errno=%d,%s",
    .bound = "after create_server_socket bind \n",
    .done = "create_server_socket ok end\n",
    .accept = "log_server_handle_tcp_msg",
    .listens = "",
    .accept_before = "",
    .accept_after = "",
    .closes = "%s:close old fd[%d]",
    .closes_unlogged = true, /* and logs it then */
    .client = "%s: client ip[%s],fd=[%d]",
};

/* For IPv6 and nothing but IPv6, so that both families can listen on one port. */
constexpr listener_family kIpv6{
    .family = AF_INET6,
    .level = IPPROTO_IPV6,
    .option = IPV6_V6ONLY,
    .create = "vex_create_server_socket_ipv6",
    .created = "after create_server_socket ipv6 \n",
    .option_set = "bind ipv6 enter \n",
    .bind_failed = "[error]can not bind socket ipv6! errno=%d,%s",
    .bound = "after create_server_socket ipv6 bind \n",
    .done = "create_server_socket ipv6 ok end\n",
    .accept = "log_server_handle_tcp_msg_ipv6",
    .listens = "%s listen ",
    .accept_before = "%s accept before ",
    .accept_after = "%s accept after",
    .closes = "%s:close fd[%d]",
    .closes_unlogged = false,
    .client = "%s: client ipv6[%s],fd[%d] ",
};

/* An address of either family. */
union socket_address {
    sockaddr any;
    sockaddr_in v4;
    sockaddr_in6 v6;
};

void log_unless_empty(const char *text, const char *name)
{
    if (*text != '\0')
        LOG_NOTE(text, name);
}

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

int bind_to_any(int fd, int family, int port)
{
    socket_address any{};
    any.any.sa_family = static_cast<sa_family_t>(family);
    socklen_t len = sizeof any.v4;
    if (family == AF_INET) {
        any.v4.sin_port = htons(static_cast<std::uint16_t>(port));
    } else {
        any.v6.sin6_port = htons(static_cast<std::uint16_t>(port));
        len = sizeof any.v6;
    }
    return bind(fd, &any.any, len);
}

/* Stores a socket bound to the port on every address of the family. 0, or -1 and nothing stored. */
int create_server_socket(const listener_family &words, int port, unique_fd *listener)
{
    if (listener == nullptr)
        return -1;
    LOG_NOTE("%s enter\n", words.create);
    unique_fd sock{socket(words.family, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_NOTE("[error]can not create tcp server socket !");
        return -1;
    }
    LOG_NOTE("%s", words.created);
    set_option(sock.get(), words.level, words.option, 1);
    log_unless_empty(words.option_set, "");
    set_connection_options(sock.get());
    if (bind_to_any(sock.get(), words.family, port) != 0) {
        LOG_NOTE(words.bind_failed, errno, std::strerror(errno));
        return -1;
    }
    LOG_NOTE("%s", words.bound);
    *listener = std::move(sock);
    LOG_NOTE("%s", words.done);
    return 0;
}

void close_nothing(log_link & /*link*/) {} /* its socket is closed with it */

void *receive_thread_proc(void *argument)
{
    const std::shared_ptr<log_link> link = log_take_share<log_link>(argument);
    log_recv_tcp_msg(*link, close_nothing);
    return nullptr;
}

/* Starts the receive thread of the command connection; `before` is the one whose connection was taken over. It is not
 * cancelled, as the line has it: it ends by itself now that its socket is shut down. */
void vex_log_recv_thread(const std::shared_ptr<log_link> &link, pthread_t before) LOG_REQUIRES(g_takeover_lock)
{
    const auto number = [](pthread_t thread) { return static_cast<unsigned long long>(thread); };
    if (before != 0)
        LOG_NOTE("%s:pthread_cancel threadID=[%llu]\n", __func__, number(before));
    log_thread_task task{};
    task.entry = receive_thread_proc;
    void *const share = log_give_share(link);
    if (share == nullptr || log_thread_create(&task, share) != 0) {
        LOG_NOTE("[failed creat log_recv_tcp_msg \n");
        task.thread_id = 0;
        if (share != nullptr)
            log_take_share<log_link>(share);
    }
    LOG_NOTE("%s threadID=[%llu]\n", __func__, number(task.thread_id));
}

/* Waits for the next connection of the listener. None, after a log line and a pause, when accept failed. */
unique_fd accept_next(const char *name, int listener, socket_address *peer)
{
    socklen_t len = sizeof *peer;
    unique_fd client{accept4(listener, &peer->any, &len, SOCK_CLOEXEC)};
    if (!client) {
        LOG_NOTE("%s accept error %s(errno: %d) ", name, std::strerror(errno), errno);
        sleep(kAcceptPause);
    }
    return client;
}

/* An IPv6 address is written as all eight groups, in lower-case hex without leading zeros: no "::". */
void print_address(const socket_address &peer, char (&text)[kClientIpSize])
{
    if (peer.any.sa_family == AF_INET) {
        inet_ntop(AF_INET, &peer.v4.sin_addr, text, sizeof text);
        return;
    }
    unsigned group[8];
    const auto &bytes = peer.v6.sin6_addr.s6_addr;
    for (std::size_t i = 0; i < 8; ++i)
        group[i] = static_cast<unsigned>(bytes[2 * i] << 8 | bytes[2 * i + 1]);
    std::snprintf(text, sizeof text, "%x:%x:%x:%x:%x:%x:%x:%x", group[0], group[1], group[2], group[3], group[4],
                  group[5], group[6], group[7]);
}

/* Makes the connection the command connection and takes it over from the one before. */
void take_over(const listener_family &words, unique_fd client, const socket_address &peer)
{
    char ip[kClientIpSize] = {};
    print_address(peer, ip);
    const auto link = log_make_shared<log_link>(std::move(client), nullptr, ip);
    if (!link) {
        LOG_FAULT("%s: no memory for the connection of %s\n", words.accept, ip);
        return;
    }
    const log_lock turn{g_takeover_lock};
    const int old_fd = log_cmd_fd();
    if (old_fd != -1 && !words.closes_unlogged)
        LOG_NOTE(words.closes, words.accept, old_fd);
    const log_cmd_taken old = log_cmd_take_away();
    if (old.fd != -1 && words.closes_unlogged)
        LOG_NOTE(words.closes, words.accept, old.fd);
    log_cmd_record(link);
    LOG_NOTE(words.client, words.accept, ip, link->fd.get());
    vex_log_recv_thread(link, old.reader);
}

/* Accepts for ever; returns only when listen fails. */
void handle_tcp_msg(const listener_family &words, int listener)
{
    LOG_NOTE("%s enter ", words.accept);
    if (listen(listener, kBacklog) != 0) {
        LOG_NOTE("%s listen failed ", words.accept);
        return;
    }
    log_unless_empty(words.listens, words.accept);
    for (;;) {
        log_unless_empty(words.accept_before, words.accept);
        socket_address peer{};
        unique_fd client = accept_next(words.accept, listener, &peer);
        if (!client)
            continue;
        log_unless_empty(words.accept_after, words.accept);
        take_over(words, std::move(client), peer);
    }
}

void run_listener(const char *body, const listener_family &words)
{
    LOG_NOTE("enter %s.\n", body);
    unique_fd listener;
    if (create_server_socket(words, kPort, &listener) == 0)
        handle_tcp_msg(words, listener.get());
}

/* A family has no listener. Without any, nobody would ever reach the daemon. */
void lose_family()
{
    if (--g_families > 0)
        return;
    LOG_FAULT("nobody can connect, on IPv4 or IPv6: vex_log_manage exit \n");
    log_end_process(kNoListener);
}

void *log_server_thread_proc(void * /*unused*/)
{
    run_listener(__func__, kIpv4);
    lose_family();
    return nullptr;
}

void *log_server_thread_proc_ipv6(void * /*unused*/)
{
    run_listener(__func__, kIpv6);
    lose_family();
    return nullptr;
}

int start_listener(const char *starter, void *(*entry)(void *))
{
    const int result = log_start_thread(starter, entry, nullptr);
    if (result != 0)
        lose_family();
    return result;
}

} // namespace

int vex_log_server_thread()
{
    return start_listener(__func__, log_server_thread_proc);
}

int vex_log_server_thread_ipv6()
{
    return start_listener(__func__, log_server_thread_proc_ipv6);
}
