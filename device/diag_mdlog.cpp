/*
 * The device's modem log program.
 *
 *   diag_mdlog -f CONFIG [-m CONFIG2] -R ADDRESS -P PORT   listens there and streams to whoever connects
 *   diag_mdlog -f CONFIG [-m CONFIG2] -R tcp_fd=N          streams on the descriptor that it was given
 *   diag_mdlog -k                                          ends the one that runs
 *
 * The options for its local files (-o FOLDER, -n FILES, -s SIZE) are taken and passed over.
 */
#include "device/diag_record.h"
#include "platform/unique_fd.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kPidFile[] = "/run/diag_mdlog.pid";
constexpr char kGivenSocket[] = "tcp_fd=";
constexpr useconds_t kRecordInterval = 10000; /* microseconds */

struct options {
    bool end = false;
    const char *config = "";
    const char *to = "";
    const char *port = "";
};

/* Sends a record whole, also on a socket that does not block; false when the peer is gone. */
bool send_record(int fd, const diag_record &record)
{
    for (std::size_t sent = 0; sent < record.size();) {
        pollfd entry{fd, POLLOUT, 0};
        poll(&entry, 1, -1);
        const ssize_t n = send(fd, record.data() + sent, record.size() - sent, MSG_NOSIGNAL);
        if (n < 0 && errno != EAGAIN)
            return false;
        sent += static_cast<std::size_t>(n > 0 ? n : 0);
    }
    return true;
}

/* Streams from the first record on until the peer is gone. */
void stream(int fd)
{
    for (std::uint32_t number = 0;; ++number) {
        if (!send_record(fd, make_diag_record(number)))
            return;
        usleep(kRecordInterval);
    }
}

int serve(const char *address, const char *port)
{
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    hints.ai_flags = AI_NUMERICHOST | AI_PASSIVE;
    addrinfo *at = nullptr;
    if (getaddrinfo(address, port, &hints, &at) != 0)
        return 1;
    const unique_fd listener{socket(at->ai_family, SOCK_STREAM, 0)};
    const int on = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    const bool listens = bind(listener.get(), at->ai_addr, at->ai_addrlen) == 0 && listen(listener.get(), 1) == 0;
    freeaddrinfo(at);
    while (listens) {
        const unique_fd peer{accept(listener.get(), nullptr, nullptr)};
        stream(peer.get());
    }
    std::perror("diag_mdlog");
    return 1;
}

int end_running()
{
    pid_t pid = 0;
    std::ifstream(kPidFile) >> pid;
    return pid > 0 && kill(pid, SIGTERM) == 0 ? 0 : 1;
}

options read_options(int argc, char **argv)
{
    options given;
    for (int option = 0; (option = getopt(argc, argv, "kf:m:o:n:s:R:P:")) != -1;) {
        switch (option) {
        case 'k':
            given.end = true;
            break;
        case 'f':
            given.config = optarg;
            break;
        case 'R':
            given.to = optarg;
            break;
        case 'P':
            given.port = optarg;
            break;
        default:
            break;
        }
    }
    return given;
}

} // namespace

int main(int argc, char **argv)
{
    const options given = read_options(argc, argv);
    if (given.end)
        return end_running();
    if (!std::ifstream(given.config)) {
        std::fprintf(stderr, "diag_mdlog: cannot read the configuration \"%s\"\n", given.config);
        return 1;
    }
    std::ofstream(kPidFile) << getpid() << '\n';
    if (std::strncmp(given.to, kGivenSocket, std::strlen(kGivenSocket)) != 0)
        return serve(given.to, given.port);
    stream(std::atoi(given.to + std::strlen(kGivenSocket)));
    return 0;
}
