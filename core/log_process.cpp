#include "core/log_process.h"

#include "core/log_tools.h"

#include <csignal>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <malloc.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace
{

void open_standard_streams()
{
    int fd = 0;
    while (fd >= 0 && fd <= STDERR_FILENO)
        fd = open("/dev/null", O_RDWR);
    if (fd > STDERR_FILENO)
        close(fd);
}

/* At once where the kernel can, which needs no /proc. */
void close_inherited_on_exec()
{
#ifdef SYS_close_range
    constexpr unsigned kOnExec = 4; /* CLOSE_RANGE_CLOEXEC, which some headers lack */
    if (syscall(SYS_close_range, STDERR_FILENO + 1, ~0U, kOnExec) == 0)
        return;
#endif
    DIR *open_fds = opendir("/proc/self/fd");
    if (open_fds == nullptr)
        return;
    while (const dirent *entry = readdir(open_fds)) {
        const int fd = log_text_to_int(entry->d_name); /* 0 for "." and ".." */
        if (fd > STDERR_FILENO)
            fcntl(fd, F_SETFD, FD_CLOEXEC);
    }
    closedir(open_fds);
}

/* A connection takes up its frames' records when it comes and gives them back when it goes. Memory that the allocator
 * then returned to the system would be fetched again for the next one, which makes connecting a twentieth slower. */
#ifdef M_TRIM_THRESHOLD
void keep_freed_memory()
{
    mallopt(M_TRIM_THRESHOLD, 1 << 20);
}
#else
void keep_freed_memory() {}
#endif

/* A starter may have blocked signals or ignored them, which programs inherit: SIGTERM has to end them and this process, and
 * SIGCHLD to tell how they end. SIGHUP is left as it is, for the maker's log and nohup. */
void take_signals()
{
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    signal(SIGTERM, SIG_DFL);
    signal(SIGCHLD, SIG_DFL);
}

/* Unlike SIG_IGN, a handler is not inherited by the programs that the daemon starts. */
void on_broken_pipe(int /*signal*/) {}

} // namespace

void log_prepare_process()
{
    open_standard_streams();
    close_inherited_on_exec();
    keep_freed_memory();
    setenv("LC_ALL", "C", 1);
    take_signals();
    struct sigaction action {
    };
    action.sa_handler = on_broken_pipe;
    action.sa_flags = SA_RESTART;
    sigaction(SIGPIPE, &action, nullptr);
}
