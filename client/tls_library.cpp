#include "client/tls_library.h"

#include "core/log_line.h"

#include <cstdint>
#include <cstring>
#include <dlfcn.h>
#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

/* Finds a call in the library; false, after a log line, when it has none of that name. */
template <typename Call> bool find(void *library, const char *name, Call &call)
{
    void *const address = dlsym(library, name);
    std::memcpy(&call, &address, sizeof call);
    if (address == nullptr)
        LOG_FAULT("%s has no %s", VEX_TLS_LIBRARY, name);
    return address != nullptr;
}

/* Gives back the memory of an object's pages that are as in its file; they come back when they are used. */
int give_back(dl_phdr_info *object, size_t, void *)
{
    const auto page = static_cast<std::uintptr_t>(sysconf(_SC_PAGESIZE));
    for (int i = 0; i < object->dlpi_phnum; ++i) {
        const ElfW(Phdr) &segment = object->dlpi_phdr[i];
        if (segment.p_type != PT_LOAD || (segment.p_flags & PF_W) != 0)
            continue;
        const std::uintptr_t start = object->dlpi_addr + segment.p_vaddr;
        const std::uintptr_t first = start / page * page;
        madvise(reinterpret_cast<void *>(first), start + segment.p_memsz - first, MADV_DONTNEED);
    }
    return 0;
}

} // namespace

tls_calls g_tls;

void tls_library_settle()
{
    dl_iterate_phdr(give_back, nullptr);
}

bool tls_library_load()
{
    void *const library = dlopen(VEX_TLS_LIBRARY, RTLD_NOW | RTLD_LOCAL); /* stays for the life of the process */
    if (library == nullptr) {
        LOG_FAULT("cannot load the TLS library: %s", dlerror());
        return false;
    }
/* In two steps, as some of the names are macros that stand for another one. */
#define VEX_TLS_TEXT(name) #name
#define VEX_TLS_FIND(name) &&find(library, VEX_TLS_TEXT(name), g_tls.name)
    return true VEX_TLS_CALLS(VEX_TLS_FIND);
#undef VEX_TLS_FIND
#undef VEX_TLS_TEXT
}
