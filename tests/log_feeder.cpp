/*
 * A log program whose log is a file: under the name of syslogd or diag_mdlog it writes /tmp/feed to the descriptor that it
 * is given, as often as /tmp/feed.times says and /tmp/feed.size bytes at a time, and then stays until it is killed.
 *
 *   NAME ... -R tcp_fd=N ...    writes
 *   NAME -k                     kills the NAME that writes
 *   NAME ...                    does nothing
 */
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <poll.h>
#include <string>
#include <sys/socket.h>
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
    pid_file += basename(argv[0]);
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "-k") == 0)
            return kill(std::stoi(contents(pid_file)), SIGKILL);
        if (std::strncmp(argv[i], "tcp_fd=", 7) == 0) {
            std::ofstream(pid_file) << getpid();
            feed(std::atoi(argv[i] + 7));
        }
    }
    return 0;
}
