/* The TLS library as it is loaded when client mode begins. */
#include "core/log_tls_library.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <dlfcn.h>

#define VEX_TLS_TEXT_OF(name) #name
#define VEX_TLS_TEXT(name) VEX_TLS_TEXT_OF(name)

namespace
{

/* Tells packagers, who look for it in programs, which library will be loaded: an ELF note as systemd has made known. */
constexpr char kDlopenJson[] = "[{\"soname\":[\"" VEX_TLS_LIBRARY "\"],\"feature\":\"client-mode-tls\","
                               "\"description\":\"TLS to the log server\",\"priority\":\"recommended\"}]";

struct dlopen_note {
    std::uint32_t name_size = sizeof name;
    std::uint32_t text_size = sizeof kDlopenJson;
    std::uint32_t type = 0x407c0c0a;
    char name[4] = {'F', 'D', 'O', '\0'};
    char text[(sizeof kDlopenJson + 3) / 4 * 4] = {};
    constexpr dlopen_note() { std::copy_n(kDlopenJson, sizeof kDlopenJson, text); }
};

[[gnu::section(".note.dlopen"), gnu::used]] alignas(4) constexpr dlopen_note kDlopenNote;

/* Finds a call in the library; false, and why, when it has none of that name. */
template <typename Call> bool find(void *library, const char *name, Call &call, std::string &why)
{
    void *const address = dlsym(library, name);
    std::memcpy(&call, &address, sizeof call);
    if (address == nullptr)
        why = std::string(VEX_TLS_LIBRARY " has no ") + name;
    return address != nullptr;
}

} // namespace

bool log_tls_library_load(std::string &why)
{
    void *const library = dlopen(VEX_TLS_LIBRARY, RTLD_NOW | RTLD_LOCAL); /* stays for the life of the process */
    if (library == nullptr) {
        why = std::string("cannot load the TLS library: ") + dlerror();
        return false;
    }
#define VEX_TLS_FIND(name) &&find(library, VEX_TLS_TEXT(name), g_tls.name, why)
    return true VEX_TLS_CALLS(VEX_TLS_FIND);
#undef VEX_TLS_FIND
}
