#include "device/faults.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <dlfcn.h>
#include <fcntl.h>
#include <link.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

fault_board *g_board;
ElfW(Addr) g_program_begin;
ElfW(Addr) g_program_end;

/* Whether this call has to fail. */
bool strikes(fault_call what)
{
    if (g_board == nullptr)
        return false;
    fault_order &order = g_board->call[what];
    const auto take_one = [](std::atomic<int> &left) {
        int count = left.load();
        while (count > 0 && !left.compare_exchange_weak(count, count - 1)) {
        }
        return count > 0;
    };
    if (order.fail.load() == 0 || take_one(order.pass) || !take_one(order.fail))
        return false;
    ++order.failed;
    return true;
}

bool strikes_memory(const void *caller)
{
    const auto at = reinterpret_cast<ElfW(Addr)>(caller);
    return at >= g_program_begin && at < g_program_end && strikes(kFaultMemory);
}

/* The function that would be called but for this library. */
template <typename Function> Function *next(Function * /*same*/, const char *name)
{
    return reinterpret_cast<Function *>(dlsym(RTLD_NEXT, name));
}

template <typename Result> Result fails(Result result, int error)
{
    errno = error;
    return result;
}

int find_program(dl_phdr_info *info, size_t /*size*/, void * /*nothing*/)
{
    for (int i = 0; i < info->dlpi_phnum; ++i) {
        const ElfW(Phdr) &part = info->dlpi_phdr[i];
        if (part.p_type == PT_LOAD && (part.p_flags & PF_X) != 0) {
            g_program_begin = info->dlpi_addr + part.p_vaddr;
            g_program_end = g_program_begin + part.p_memsz;
        }
    }
    return 1; /* the program is the first */
}

/* What the program starts is spared. */
__attribute__((constructor)) void load_board()
{
    unsetenv("LD_PRELOAD");
    dl_iterate_phdr(find_program, nullptr);
    const char *path = std::getenv("VEX_FAULTS");
    const int fd = path == nullptr ? -1 : next(open, "open")(path, O_RDWR | O_CLOEXEC);
    if (fd == -1)
        return;
    void *shared = mmap(nullptr, sizeof(fault_board), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    if (shared != MAP_FAILED)
        g_board = static_cast<fault_board *>(shared);
    close(fd);
}

} // namespace

extern "C" {

void *malloc(size_t size)
{
    static auto *const real = next(malloc, "malloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(nullptr, ENOMEM) : real(size);
}

void *calloc(size_t count, size_t size)
{
    static auto *const real = next(calloc, "calloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(nullptr, ENOMEM) : real(count, size);
}

void *aligned_alloc(size_t alignment, size_t size)
{
    static auto *const real = next(aligned_alloc, "aligned_alloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(nullptr, ENOMEM) : real(alignment, size);
}

int pthread_create(pthread_t *thread, const pthread_attr_t *attributes, void *(*entry)(void *), void *argument)
{
    static auto *const real = next(pthread_create, "pthread_create");
    return strikes(kFaultThread) ? EAGAIN : real(thread, attributes, entry, argument);
}

int socket(int domain, int type, int protocol)
{
    static auto *const real = next(socket, "socket");
    return strikes(kFaultSocket) ? fails(-1, EMFILE) : real(domain, type, protocol);
}

int bind(int fd, const sockaddr *address, socklen_t len)
{
    static auto *const real = next(bind, "bind");
    return strikes(kFaultBind) ? fails(-1, EADDRINUSE) : real(fd, address, len);
}

int listen(int fd, int backlog)
{
    static auto *const real = next(listen, "listen");
    return strikes(kFaultListen) ? fails(-1, EADDRINUSE) : real(fd, backlog);
}

int accept4(int fd, sockaddr *address, socklen_t *len, int flags)
{
    static auto *const real = next(accept4, "accept4");
    return strikes(kFaultAccept) ? fails(-1, EMFILE) : real(fd, address, len, flags);
}

int open(const char *path, int flags, ...)
{
    static auto *const real = next(open, "open");
    va_list rest;
    va_start(rest, flags);
    const auto mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
    va_end(rest);
    return strikes(kFaultOpen) ? fails(-1, EMFILE) : real(path, flags, mode);
}

FILE *fopen(const char *path, const char *mode)
{
    static auto *const real = next(fopen, "fopen");
    return strikes(kFaultOpen) ? fails<FILE *>(nullptr, EMFILE) : real(path, mode);
}

int fsync(int fd)
{
    static auto *const real = next(fsync, "fsync");
    return strikes(kFaultFsync) ? fails(-1, EIO) : real(fd);
}

int system(const char *command)
{
    static auto *const real = next(system, "system");
    return strikes(kFaultSystem) ? fails(-1, ENOMEM) : real(command);
}

FILE *popen(const char *command, const char *type)
{
    static auto *const real = next(popen, "popen");
    return strikes(kFaultPopen) ? fails<FILE *>(nullptr, ENOMEM) : real(command, type);
}

pid_t fork()
{
    static auto *const real = next(fork, "fork");
    return strikes(kFaultFork) ? fails(-1, EAGAIN) : real();
}
}
