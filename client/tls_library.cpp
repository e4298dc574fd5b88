#include "client/tls_library.h"

#include "core/log_line.h"

#include <cstring>
#include <dlfcn.h>

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

} // namespace

tls_calls g_tls;

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
