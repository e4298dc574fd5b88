#include "core/log_tools.h"

#include "core/log_line.h"
#include "core/log_link.h"
#include "core/log_registry.h"
#include "platform/unique_fd.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "log_tools";

/* A child that is in the way has so long to end by itself, then to end when it is asked to, then when it is killed. */
constexpr auto kEndsMax = std::chrono::seconds(3);
constexpr auto kTerminatesMax = std::chrono::seconds(2);
constexpr auto kDiesMax = std::chrono::seconds(1);
constexpr useconds_t kLookAgain = 1000; /* microseconds */

/* Milliseconds between two looks at whether somebody still waits for a shell. */
constexpr int kStillWanted = 500;

/* Whether it runs in the background of its shell. */
bool is_behind(const char *cmdStr)
{
    const std::size_t len = std::strlen(cmdStr);
    return len > 0 && cmdStr[len - 1] == '&';
}

/* What a shell is started with, piece by piece; `error` is the first that there was. */
struct shell_start {
    shell_start()
    {
        posix_spawn_file_actions_init(&actions); /* neither fails here */
        posix_spawnattr_init(&attributes);
    }
    ~shell_start()
    {
        posix_spawn_file_actions_destroy(&actions);
        posix_spawnattr_destroy(&attributes);
    }
    shell_start(const shell_start &) = delete;
    shell_start &operator=(const shell_start &) = delete;

    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
};

/* Starts a shell for the line. `handed_fd`: a descriptor that its programs inherit under its number; `output`: where
 * its standard output goes; -1 for neither. `alone`: with its programs, in a process group of its own. -1 on failure. */
pid_t start_shell(const char *line, bool alone, int handed_fd = -1, int output = -1)
{
    /* A copy is put in the number's place, which clears the mark that closes it, in the child only. */
    const unique_fd copy{handed_fd != -1 ? fcntl(handed_fd, F_DUPFD_CLOEXEC, 0) : -1};
    if (handed_fd != -1 && !copy)
        return -1;
    shell_start start;
    int error = posix_spawnattr_setflags(&start.attributes, alone ? POSIX_SPAWN_SETPGROUP : 0);
    if (error == 0 && copy)
        error = posix_spawn_file_actions_adddup2(&start.actions, copy.get(), handed_fd);
    if (error == 0 && output != -1)
        error = posix_spawn_file_actions_adddup2(&start.actions, output, STDOUT_FILENO);
    const char *const words[] = {"sh", "-c", line, nullptr};
    pid_t shell = -1;
    if (error == 0)
        error = posix_spawn(&shell, "/bin/sh", &start.actions, &start.attributes, const_cast<char *const *>(words),
                            environ);
    return error == 0 ? shell : -1;
}

/* Starts the program of a simple command line, in its shell's place. */
pid_t start_program(const char *cmdStr, std::size_t len)
{
    char line[512];
    std::snprintf(line, sizeof line, "exec %.*s", static_cast<int>(len), cmdStr);
    return start_shell(line, false);
}

/* Whether the shell line must not be run, as nobody waits for it any more (logged). */
bool is_skipped(const char *cmdStr)
{
    if (!log_served_given_up())
        return false;
    LOG_NOTE("[%s] is skipped, nobody waits for it any more\n", cmdStr);
    return true;
}

/* Whether the child ends in that time. Then it is forgotten, and its status stored. */
bool ends_within(pid_t child, std::chrono::seconds time, int *status = nullptr)
{
    const auto end = log_clock::now() + time;
    while (waitpid(child, status, WNOHANG) == 0) {
        if (log_clock::now() >= end)
            return false;
        usleep(kLookAgain);
    }
    return true;
}

/* Ends a shell with all that it runs, as nobody waits for them any more; its status. */
int end_group(pid_t shell)
{
    LOG_NOTE("process group %d is asked to end, nobody waits for it any more\n", static_cast<int>(shell));
    kill(-shell, SIGTERM);
    int status = -1;
    bool ended = false; /* the shell: what it has started may take longer */
    for (const auto end = log_clock::now() + kTerminatesMax; log_clock::now() < end; usleep(kLookAgain)) {
        ended = ended || waitpid(shell, &status, WNOHANG) != 0;
        if (ended && kill(-shell, 0) != 0)
            return status;
    }
    LOG_NOTE("process group %d does not end and is killed\n", static_cast<int>(shell));
    kill(-shell, SIGKILL);
    if (!ended)
        ends_within(shell, kDiesMax, &status);
    return status;
}

/* Waits for the shell; for one with a process group of its own, as long as somebody waits for it. Its status as system()
 * has it. */
int await_shell(pid_t shell, bool alone)
{
    if (shell == -1)
        return -1;
    const unique_fd end{static_cast<int>(syscall(SYS_pidfd_open, shell, 0))}; /* old kernels have none */
    int status = -1;
    for (pid_t ended = 0; ended != shell;) {
        ended = waitpid(shell, &status, WNOHANG);
        if (ended == -1 && errno != EINTR)
            return -1;
        if (ended == 0 && alone && log_served_given_up())
            return end_group(shell);
        if (ended == 0 && end)
            log_wait_ready(end.get(), POLLIN, -1, kStillWanted);
        else if (ended == 0)
            usleep(kLookAgain);
    }
    return status;
}

/* Logs what became of a shell line, and flushes file systems to storage; 0 when it exited with status 0, else -1. */
int judge_cmd(const char *cmdStr, int status)
{
    int result = -1;
    if (status == -1) {
        LOG_FAULT("[%s] System error1\n", cmdStr);
    } else if ((status & 0x7f) != 0) {
        LOG_FAULT("[%s] System error2\n", cmdStr);
    } else if (((status >> 8) & 0xff) != 0) {
        LOG_FAULT("[%s] System error3\n", cmdStr);
    } else {
        LOG_NOTE("[%s] System ok\n", cmdStr);
        result = 0;
    }
    sync();
    return result;
}

/* Reads up to `size` bytes, to the end of the first line at least, for as long as somebody waits for them; their
 * number. */
int read_line(int fd, char *buffer, int size)
{
    int held = 0;
    while (held < size && std::memchr(buffer, '\n', static_cast<std::size_t>(held)) == nullptr) {
        if (log_wait_ready(fd, POLLIN, -1, kStillWanted) == 0) {
            if (log_served_given_up())
                break;
            continue;
        }
        const ssize_t n = read(fd, buffer + held, static_cast<std::size_t>(size - held));
        if (n > 0)
            held += static_cast<int>(n);
        else if (n == 0 || errno != EINTR)
            break;
    }
    return held;
}

} // namespace

int log_exec_cmd(const char *cmdStr)
{
    return cmdStr != nullptr && !is_skipped(cmdStr) ? log_exec_cmd_with(cmdStr, -1) : -1;
}

int log_exec_cmd_with(const char *cmdStr, int handed_fd)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const bool alone = !is_behind(cmdStr);
    return judge_cmd(cmdStr, await_shell(start_shell(cmdStr, alone, handed_fd), alone));
}

pid_t log_exec_cmd_behind(const char *cmdStr)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const pid_t child = start_program(cmdStr, std::strlen(cmdStr) - 1); /* without the "&" */
    judge_cmd(cmdStr, child != -1 ? 0 : -1);
    return child;
}

pid_t log_exec_cmd_within(const char *cmdStr, std::chrono::seconds time)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const pid_t child = start_program(cmdStr, std::strlen(cmdStr));
    int status = -1;
    if (child != -1 && !ends_within(child, time, &status)) {
        LOG_FAULT("[%s] does not end, it is left behind\n", cmdStr);
        return child;
    }
    judge_cmd(cmdStr, status);
    return -1;
}

bool log_child_ended(pid_t child)
{
    return waitpid(child, nullptr, WNOHANG) != 0;
}

void log_end_child(pid_t child)
{
    if (ends_within(child, kEndsMax))
        return;
    LOG_NOTE("process %d is in the way and is asked to end\n", static_cast<int>(child));
    kill(child, SIGTERM);
    if (ends_within(child, kTerminatesMax))
        return;
    LOG_NOTE("process %d does not end and is killed\n", static_cast<int>(child));
    kill(child, SIGKILL);
    ends_within(child, kDiesMax);
}

int vex_popen(const char *cmd, char *buffer, int size)
{
    if (cmd == nullptr || buffer == nullptr) {
        LOG_FAULT("vex_popen: cmd or buf ptr NULL\n");
        return 0;
    }
    std::memset(buffer, 0, static_cast<std::size_t>(std::max(size, 0)));
    int ends[2];
    if (is_skipped(cmd))
        return 0;
    if (pipe2(ends, O_CLOEXEC) != 0) {
        LOG_FAULT("vex_popen: no pipe for [%s], errno: %d\n", cmd, errno);
        return 0;
    }
    unique_fd output{ends[0]};
    unique_fd input{ends[1]};
    const pid_t shell = start_shell(cmd, true, -1, input.get());
    if (shell == -1)
        LOG_FAULT("vex_popen: [%s] cannot be started\n", cmd);
    input.reset(); /* the shell has its own: the line ends with the programs that write it */
    const int len = read_line(output.get(), buffer, size - 1);
    output.reset();
    await_shell(shell, true);
    buffer[std::strcspn(buffer, "\n")] = '\0';
    return len > 0 ? 1 : 0;
}
