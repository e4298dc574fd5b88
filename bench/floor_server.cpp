/*
 * The floors that the daemon is measured against.
 *
 *   floor_server echo PORT            a thread for each connection sends back what it reads
 *   floor_server archive PORT FILE    sends a file as frames of 51200 bytes for each command that it reads
 *   floor_server upload PORT FILE     appends the data of each frame of 50000 bytes to a file, syncs it and answers
 *   floor_server shell PORT CMD...    captures what shell commands print and answers, for each command that it reads
 *   floor_server system CMD           runs a shell command and syncs, as the daemon does with each of its commands
 */
#include "bench/archive_frames.h"
#include "platform/unique_fd.h"

#include <arpa/inet.h>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <pthread.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr std::size_t kUploadSize = 50000; /* data bytes of an upload's frame */
constexpr std::size_t kReadSize = 2000;

char **g_words; /* what follows the port */

bool send_whole(int fd, const char *bytes, std::size_t len)
{
    return send(fd, bytes, len, 0) == static_cast<ssize_t>(len);
}

/* What one connection is served with, until it ends. */
using service = void (*)(int fd);

void echo(int fd)
{
    char piece[kReadSize];
    for (ssize_t n = 0; (n = recv(fd, piece, sizeof piece, 0)) > 0;)
        if (!send_whole(fd, piece, static_cast<std::size_t>(n)))
            break;
}

void send_archive(int fd)
{
    char command[kReadSize];
    while (recv(fd, command, sizeof command, 0) > 0)
        if (!send_archive_file(g_words[0],
                               [fd](const char *bytes, std::size_t len) { return send_whole(fd, bytes, len); }))
            return;
}

bool append_synced(const char *data)
{
    const unique_fd file{open(g_words[0], O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644)};
    return write(file.get(), data, kUploadSize) == static_cast<ssize_t>(kUploadSize) && fsync(file.get()) == 0;
}

/* Answers, as the daemon does, when the file is synced and closed. */
void take_upload(int fd)
{
    static char held[2 * 61440];
    const char reply[] = "#~\0\0\0\0\0\0\0\0~#";
    std::size_t len = 0;
    for (ssize_t n = 0; (n = recv(fd, held + len, kReadSize, 0)) > 0;) {
        len += static_cast<std::size_t>(n);
        const std::size_t control_len = static_cast<unsigned char>(held[5]);
        if (len < 6 + control_len + 4 + kUploadSize + 2)
            continue;
        if (!append_synced(held + 6 + control_len + 4) || !send_whole(fd, reply, sizeof reply - 1))
            return;
        len = 0;
    }
}

void run_shell(int fd)
{
    char line[kReadSize];
    while (recv(fd, line, sizeof line, 0) > 0) {
        for (char **command = g_words; *command != nullptr; ++command) {
            FILE *output = popen(*command, "re");
            if (output == nullptr || std::fgets(line, sizeof line, output) == nullptr)
                line[0] = '\0';
            pclose(output);
        }
        if (!send_whole(fd, "#", 1))
            return;
    }
}

const struct {
    const char *name;
    service serve;
} kServices[] = {{"echo", echo}, {"archive", send_archive}, {"upload", take_upload}, {"shell", run_shell}};

service g_service;

void *serve_connection(void *connection)
{
    const unique_fd fd{static_cast<int>(reinterpret_cast<std::intptr_t>(connection))};
    g_service(fd.get());
    return nullptr;
}

int serve(std::uint16_t port)
{
    const unique_fd listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const int on = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    setsockopt(listener.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    setsockopt(listener.get(), SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on); /* a timer for each connection */
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
        if (!fd || pthread_create(&thread, &detached, serve_connection,
                                  reinterpret_cast<void *>(std::intptr_t{fd.get()})) != 0)
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
    if (argc == 3 && std::strcmp(argv[1], "system") == 0)
        return run_command(argv[2]);
    for (const auto &[name, wanted] : kServices) {
        if (argc < 3 || std::strcmp(argv[1], name) != 0)
            continue;
        g_service = wanted;
        g_words = argv + 3;
        return serve(static_cast<std::uint16_t>(std::atoi(argv[2])));
    }
    return 2;
}
