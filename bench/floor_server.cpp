/*
 * The floors that the daemon is measured against.
 *
 *   floor_server echo PORT      a thread for each connection sends back what it reads
 *   floor_server system CMD     runs a shell command and syncs, as the daemon does with each of its commands
 */
#include "platform/unique_fd.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <pthread.h>
#include <sys/socket.h>

namespace
{

void *echo(void *connection)
{
    const unique_fd fd{static_cast<int>(reinterpret_cast<std::intptr_t>(connection))};
    char piece[2000];
    for (ssize_t n = 0; (n = recv(fd.get(), piece, sizeof piece, 0)) > 0;)
        if (send(fd.get(), piece, static_cast<std::size_t>(n), 0) != n)
            break;
    return nullptr;
}

int serve_echo(std::uint16_t port)
{
    const unique_fd listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const int on = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    setsockopt(listener.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    sockaddr_in any{};
    any.sin_family = AF_INET;
    any.sin_port = htons(port);
    if (bind(listener.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any) != 0 ||
        listen(listener.get(), 1) != 0)
        return 1;
    pthread_attr_t detached;
    pthread_attr_init(&detached);
    pthread_attr_setdetachstate(&detached, PTHREAD_CREATE_DETACHED);
    for (;;) {
        unique_fd fd{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
        pthread_t thread;
        if (!fd || pthread_create(&thread, &detached, echo, reinterpret_cast<void *>(std::intptr_t{fd.get()})) != 0)
            continue;
        [[maybe_unused]] const int given_away = fd.release();
    }
}

int run_command(const char *command)
{
    const int status = std::system(command);
    sync();
    return status == 0 ? 0 : 1;
}

} // namespace

int main(int argc, char **argv)
{
    if (argc == 3 && std::strcmp(argv[1], "echo") == 0)
        return serve_echo(static_cast<std::uint16_t>(std::atoi(argv[2])));
    if (argc == 3 && std::strcmp(argv[1], "system") == 0)
        return run_command(argv[2]);
    return 2;
}
