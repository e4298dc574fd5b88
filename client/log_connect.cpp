#include "client/log_connect.h"

#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_tools.h"
#include "platform/unique_fd.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <netdb.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr useconds_t kShortPause = 1000; /* microseconds after a failed try, */
constexpr unsigned kLongPause = 2;       /* and seconds more */

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

/* Connects the socket; false, after the log lines, when no try succeeded. */
bool try_to_connect(int fd, const addrinfo &server, const server_name &name, const log_link *link)
{
    const auto wanted = [link] { return link == nullptr || log_link_wanted(*link); };
    for (int tries = 0; tries < g_daemon.retry_count && wanted(); ++tries) {
        if (connect(fd, server.ai_addr, server.ai_addrlen) == 0)
            return true;
        const int error = errno;
        if (error == EISCONN) {
            LOG_FAULT("Socket %d already connected, errno: %d\n", fd, error);
            return true;
        }
        if (!may_try_again(error))
            return false;
        usleep(kShortPause);
        sleep(kLongPause);
    }
    log_failure(name);
    return false;
}

} // namespace

int log_connect_server(const char *host, int port, SSL **session, const log_link *link)
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
    if (!try_to_connect(sock.get(), *server, name, link))
        return -1;
    if (vex_open_ssl(sock.get(), session) != 1) {
        log_failure(name);
        return -1;
    }
    LOG_NOTE("fd[%d] Successful connect to address: %s, port number: %d\n", sock.get(), name.address, port);
    return sock.release();
}
