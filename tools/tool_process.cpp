#include "tools/tool_process.h"

#include "tools/tool_device.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

void tool_prepare_process()
{
    int fd = 0;
    do
        fd = open("/dev/null", O_RDWR);
    while (fd >= 0 && fd <= STDERR_FILENO);
    close(fd);
    std::signal(SIGPIPE, SIG_IGN);
}

bool tool_write_whole(int fd, const void *bytes, std::size_t len)
{
    const auto *at = static_cast<const char *>(bytes);
    while (len > 0) {
        const ssize_t n = write(fd, at, len);
        if (n < 0 && errno != EINTR)
            return false;
        if (n > 0) {
            at += n;
            len -= static_cast<std::size_t>(n);
        }
    }
    return true;
}

int tool_exit_status(int status)
{
    if (std::fflush(stdout) == 0 && std::ferror(stdout) == 0)
        return status;
    return tool_fail(kNoAnswer, std::string("cannot write to standard output: ") + std::strerror(errno));
}
