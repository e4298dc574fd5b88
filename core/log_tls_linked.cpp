/* The TLS library as a part of the program, for systems that load none: a static build, say. */
#include "core/log_tls_library.h"

bool log_tls_library_load(std::string & /*why*/)
{
#define VEX_TLS_ADDRESS(name) &::name,
    g_tls = {VEX_TLS_CALLS(VEX_TLS_ADDRESS)};
#undef VEX_TLS_ADDRESS
    return true;
}
