#include "core/log_tls_library.h"

#include <cstdint>
#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

namespace
{

/* Gives back the memory of an object's pages that are as in its file; they come back when they are used. */
int give_back(dl_phdr_info *object, std::size_t /*size*/, void * /*unused*/)
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

log_tls_calls g_tls;

void log_tls_library_settle()
{
    dl_iterate_phdr(give_back, nullptr);
}
