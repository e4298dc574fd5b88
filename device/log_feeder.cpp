/*
 * A log program whose log is a file: under the name of syslogd or diag_mdlog it writes /tmp/feed to the descriptor
 * that it is given, as often as /tmp/feed.times says and /tmp/feed.size bytes at a time, and then stays until it is
 * killed.
 *
 *   NAME ... -R tcp_fd=N ...    writes
 *   NAME ... -R unix=PATH ...   writes to a socket that it connects to, as the daemon would for it
 *   NAME -k                     kills the NAME that writes
 *   NAME ...                    does nothing
 */
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <poll.h>
#include <sched.h>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace
{

std::string contents(const std::string &file)
{
    std::ifstream in(file, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

/* False when the peer is gone. */
bool send_whole(int fd, const char *bytes, std::size_t len)
{
    while (len > 0) {
        const ssize_t n = send(fd, bytes, len, MSG_NOSIGNAL);
        if (n < 0 && errno != EAGAIN)
            return false;
        if (n > 0) {
            bytes += n;
            len -= static_cast<std::size_t>(n);
        } else {
            pollfd entry{fd, POLLOUT, 0};
            poll(&entry, 1, -1);
        }
    }
    return true;
}

/* A non-blocking connection to a local socket, tried until somebody listens there. */
int connect_to(const char *path)
{
    sockaddr_un to{};
    to.sun_family = AF_UNIX;
    std::strncpy(to.sun_path, path, sizeof to.sun_path - 1);
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0);
    while (connect(fd, reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0)
        sched_yield();
    return fd;
}

void feed(int fd)
{
    const std::string log = contents("/tmp/feed");
    const auto size = static_cast<std::size_t>(std::stoul(contents("/tmp/feed.size")));
    for (int times = std::stoi(contents("/tmp/feed.times")); times > 0; --times)
        for (std::size_t at = 0; at < log.size(); at += size)
            if (!send_whole(fd, log.data() + at, std::min(size, log.size() - at)))
                return;
    pause();
}

} // namespace

int main(int argc, char **argv)
{
    std::string pid_file = "/tmp/pid.";
    pid_file += std::filesystem::path(argv[0]).filename();
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "-k") == 0)
            return kill(std::stoi(contents(pid_file)), SIGKILL);
        if (std::strncmp(argv[i], "unix=", 5) == 0)
            feed(connect_to(argv[i] + 5));
        if (std::strncmp(argv[i], "tcp_fd=", 7) == 0) {
            std::ofstream(pid_file) << getpid();
            feed(std::atoi(argv[i] + 7));
        }
    }
    return 0;
}
