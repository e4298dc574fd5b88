#include "client/log_connect.h"

#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_link.h"
#include "core/log_tools.h"
#include "platform/unique_fd.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kPause = 1 + 2000; /* milliseconds after a failed try */

struct address_list_deleter {
    void operator()(addrinfo *list) const { freeaddrinfo(list); }
};

using address_list = std::unique_ptr<addrinfo, address_list_deleter>;

/* A server as the log shows it. */
struct server_name {
    char address[64] = {};
    int port = 0;
};

address_list translate(const char *host, int port)
{
    LOG_NOTE("Translating address: %s\n", host);
    char service[16];
    std::snprintf(service, sizeof service, "%d", port);
    addrinfo hints{};
    hints.ai_flags = AI_PASSIVE;
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo *found = nullptr;
    const int result = getaddrinfo(host, service, &hints, &found);
    address_list list{result == 0 ? found : nullptr};
    if (list)
        return list;
    if (result == EAI_SYSTEM)
        LOG_FAULT("getaddrinfo error: %d, %s, errno: %d\n", result, gai_strerror(result), errno);
    else
        LOG_FAULT("getaddrinfo error: %d, %s\n", result, gai_strerror(result));
    LOG_FAULT("getaddrinfo did not return list of addrinfo structures.\n");
    return list;
}

void render(const addrinfo &server, server_name *name)
{
    if (server.ai_family == AF_INET)
        inet_ntop(AF_INET, &reinterpret_cast<const sockaddr_in *>(server.ai_addr)->sin_addr, name->address,
                  sizeof name->address);
    else
        inet_ntop(AF_INET6, &reinterpret_cast<const sockaddr_in6 *>(server.ai_addr)->sin6_addr, name->address,
                  sizeof name->address);
}

/* Logs a failed connect; false when it is of no use to try again. */
bool may_try_again(int error)
{
    LOG_FAULT("Error calling connect: %s, errno: %d\n", std::strerror(error), error);
    if (error == ENETUNREACH)
        LOG_FAULT("Network is unreachable,errno: %d Re-trying ...\n", error);
    else if (error == EINVAL)
        LOG_FAULT("Invalid argument.  Exiting... \n");
    else if (error == ECONNREFUSED)
        LOG_FAULT("Error is ECONNREFUSED - No one is listening on the remote ip address\n");
    return error != EINVAL;
}

void log_failure(const server_name &name)
{
    LOG_NOTE("fail connect to address: %s, port number: %d\n", name.address, name.port);
}

/* Whether the connection is not wanted any more, also within a time. */
bool is_stopped(int stop_fd, int milliseconds)
{
    return log_wait_ready(stop_fd, POLLIN, -1, milliseconds) != 0;
}

/* One try; 0, or the error. A call on a socket that is being connected tells what has come of it. */
int connect_once(int fd, const addrinfo &server, int stop_fd)
{
    while (connect(fd, server.ai_addr, server.ai_addrlen) != 0) {
        if (errno != EINPROGRESS && errno != EALREADY && errno != EINTR)
            return errno;
        if (log_wait_ready(fd, POLLOUT, stop_fd, -1) == 0)
            return ECANCELED;
    }
    return 0;
}

void set_non_blocking(int fd, bool on)
{
    const int flags = fcntl(fd, F_GETFL);
    fcntl(fd, F_SETFL, on ? flags | O_NONBLOCK : flags & ~O_NONBLOCK);
}

/* Connects the socket; false, after the log lines, when no try succeeded. */
bool try_to_connect(int fd, const addrinfo &server, const server_name &name, int stop_fd)
{
    for (int tries = 0; tries < g_daemon.retry_count && !is_stopped(stop_fd, 0); ++tries) {
        const int error = connect_once(fd, server, stop_fd);
        if (error == 0)
            return true;
        if (error == ECANCELED)
            break;
        if (error == EISCONN) {
            LOG_FAULT("Socket %d already connected, errno: %d\n", fd, error);
            return true;
        }
        if (!may_try_again(error))
            return false;
        is_stopped(stop_fd, kPause);
    }
    log_failure(name);
    return false;
}

} // namespace

int log_connect_server(const char *host, int port, std::unique_ptr<log_tls_session> *session, int stop_fd)
{
    const address_list server = translate(host, port);
    if (!server)
        return -1;
    unique_fd sock{socket(server->ai_family, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_FAULT("Error calling socket: %s, errno: %d\n", std::strerror(errno), errno);
        return -1;
    }
    log_set_keepalive(sock.get());
    server_name name;
    name.port = port;
    render(*server, &name);
    LOG_NOTE("Trying to connect to address: %s, port: %d\n", name.address, port);
    set_non_blocking(sock.get(), true);
    if (!try_to_connect(sock.get(), *server, name, stop_fd))
        return -1;
    set_non_blocking(sock.get(), false); /* a log program is given it, without TLS */
    if (vex_open_ssl(sock.get(), session, stop_fd) != 1) {
        log_failure(name);
        return -1;
    }
    LOG_NOTE("fd[%d] Successful connect to address: %s, port number: %d\n", sock.get(), name.address, port);
    return sock.release();
}
