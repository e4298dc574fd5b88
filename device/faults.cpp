#include "device/faults.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <link.h>
#include <netinet/in.h>
#include <pthread.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

fault_board *g_board;

struct code_range {
    ElfW(Addr) begin;
    ElfW(Addr) end;
};
code_range g_program;
code_range g_cjson; /* where the program's own allocator is called from, too: its last step is a jump to malloc */

/* Whether this call has to fail; whose it is, of those that the order may be meant for only. */
bool strikes(fault_call what, int whose = 0)
{
    if (g_board == nullptr)
        return false;
    fault_order &order = g_board->call[what];
    if (order.only.load() != 0 && order.only.load() != whose)
        return false;
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
    const auto within = [at](const code_range &code) { return at >= code.begin && at < code.end; };
    return (within(g_program) || within(g_cjson)) && strikes(kFaultMemory);
}

/* The function that would be called but for this library. */
template <typename Function> Function *next(Function * /*same*/, const char *name)
{
    return reinterpret_cast<Function *>(dlsym(RTLD_NEXT, name));
}

template <typename Result> Result fails(fault_call what, Result result, int usual_error)
{
    const int error = g_board->call[what].error.load();
    errno = error != 0 ? error : usual_error;
    return result;
}

/* What getsockname or getpeername tells of a socket: its address family, its port. */
struct socket_name {
    socket_name(int fd, int (*get)(int, sockaddr *, socklen_t *))
    {
        socklen_t len = sizeof name;
        get(fd, reinterpret_cast<sockaddr *>(&name), &len);
    }
    int family() const { return name.sin6_family; }
    int port() const { return ntohs(name.sin6_port); } /* the same place in both families */
    sockaddr_in6 name{};
};

int find_code(dl_phdr_info *info, size_t /*size*/, void * /*nothing*/)
{
    const bool first = g_program.end == 0; /* the program is */
    if (!first && std::strstr(info->dlpi_name, "libcjson") == nullptr)
        return 0;
    for (int i = 0; i < info->dlpi_phnum; ++i) {
        const ElfW(Phdr) &part = info->dlpi_phdr[i];
        const ElfW(Addr) begin = info->dlpi_addr + part.p_vaddr;
        if (part.p_type == PT_LOAD && (part.p_flags & PF_X) != 0)
            (first ? g_program : g_cjson) = {begin, begin + part.p_memsz};
    }
    return first ? 0 : 1;
}

/* What the program starts is spared. */
__attribute__((constructor)) void load_board()
{
    unsetenv("LD_PRELOAD");
    dl_iterate_phdr(find_code, nullptr);
    const char *path = std::getenv("VEX_FAULTS");
    const int fd = path == nullptr ? -1 : open(path, O_RDWR | O_CLOEXEC);
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
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(kFaultMemory, nullptr, ENOMEM) : real(size);
}

void *calloc(size_t count, size_t size)
{
    static auto *const real = next(calloc, "calloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(kFaultMemory, nullptr, ENOMEM)
                                                       : real(count, size);
}

void *realloc(void *memory, size_t size)
{
    static auto *const real = next(realloc, "realloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(kFaultMemory, nullptr, ENOMEM)
                                                       : real(memory, size);
}

void *aligned_alloc(size_t alignment, size_t size)
{
    static auto *const real = next(aligned_alloc, "aligned_alloc");
    return strikes_memory(__builtin_return_address(0)) ? fails<void *>(kFaultMemory, nullptr, ENOMEM)
                                                       : real(alignment, size);
}

int pthread_create(pthread_t *thread, const pthread_attr_t *attributes, void *(*entry)(void *), void *argument)
{
    static auto *const real = next(pthread_create, "pthread_create");
    return strikes(kFaultThread) ? EAGAIN : real(thread, attributes, entry, argument);
}

int socket(int domain, int type, int protocol)
{
    static auto *const real = next(socket, "socket");
    return strikes(kFaultSocket, domain) ? fails(kFaultSocket, -1, EMFILE) : real(domain, type, protocol);
}

int bind(int fd, const sockaddr *address, socklen_t len)
{
    static auto *const real = next(bind, "bind");
    return strikes(kFaultBind, address->sa_family) ? fails(kFaultBind, -1, EADDRINUSE) : real(fd, address, len);
}

int listen(int fd, int backlog)
{
    static auto *const real = next(listen, "listen");
    return strikes(kFaultListen, socket_name(fd, getsockname).family()) ? fails(kFaultListen, -1, EADDRINUSE)
                                                                        : real(fd, backlog);
}

int accept4(int fd, sockaddr *address, socklen_t *len, int flags)
{
    static auto *const real = next(accept4, "accept4");
    return strikes(kFaultAccept, socket_name(fd, getsockname).family()) ? fails(kFaultAccept, -1, EMFILE)
                                                                        : real(fd, address, len, flags);
}

/* Programs that are built for large files call these; the libraries of others, those of the plain names. */
int open64(const char *path, int flags, ...)
{
    static auto *const real = next(open64, "open64");
    va_list rest;
    va_start(rest, flags);
    const auto mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
    va_end(rest);
    return strikes(kFaultOpen) ? fails(kFaultOpen, -1, EMFILE) : real(path, flags, mode);
}

FILE *fopen64(const char *path, const char *mode)
{
    static auto *const real = next(fopen64, "fopen64");
    return strikes(kFaultOpen) ? fails<FILE *>(kFaultOpen, nullptr, EMFILE) : real(path, mode);
}

int fsync(int fd)
{
    static auto *const real = next(fsync, "fsync");
    return strikes(kFaultFsync) ? fails(kFaultFsync, -1, EIO) : real(fd);
}

int posix_spawn(pid_t *child, const char *path, const posix_spawn_file_actions_t *actions,
                const posix_spawnattr_t *attributes, char *const *words, char *const *environment)
{
    static auto *const real = next(posix_spawn, "posix_spawn");
    return strikes(kFaultSpawn) ? EAGAIN : real(child, path, actions, attributes, words, environment);
}

ssize_t send(int fd, const void *bytes, size_t len, int flags)
{
    static auto *const real = next(send, "send");
    return strikes(kFaultSend, socket_name(fd, getpeername).port()) ? fails(kFaultSend, ssize_t{-1}, ECONNRESET)
                                                                    : real(fd, bytes, len, flags);
}

ssize_t recv(int fd, void *bytes, size_t len, int flags)
{
    static auto *const real = next(recv, "recv");
    return strikes(kFaultRecv, socket_name(fd, getpeername).port()) ? fails(kFaultRecv, ssize_t{-1}, ECONNRESET)
                                                                    : real(fd, bytes, len, flags);
}
}
