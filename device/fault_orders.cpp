#include "device/fault_orders.h"

#include "platform/unique_fd.h"

#include <cstdlib>
#include <fcntl.h>
#include <string>
#include <sys/mman.h>

namespace
{

constexpr char kFile[] = "/tmp/faults";

fault_board *g_faults; /* null until faults are prepared */

} // namespace

bool prepare_faults()
{
    const unique_fd file{open(kFile, O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600)};
    if (!file || ftruncate(file.get(), sizeof(fault_board)) != 0)
        return false;
    void *const shared = mmap(nullptr, sizeof(fault_board), PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
    g_faults = shared != MAP_FAILED ? static_cast<fault_board *>(shared) : nullptr;
    return g_faults != nullptr;
}

void join_faults()
{
    if (g_faults == nullptr)
        return;
    const char *const set = std::getenv("ASAN_OPTIONS");
    const std::string options = set != nullptr ? set : "";
    setenv("ASAN_OPTIONS", (options + ":verify_asan_link_order=0").c_str(), 1); /* it wants to be loaded first */
    setenv("VEX_FAULTS", kFile, 1);
    setenv("LD_PRELOAD", "/usr/vex/libexec/libfaults.so", 1);
}

void let_fail(const fault &what)
{
    fault_order &order = g_faults->call[what.call];
    order.fail = 0;
    order.only = what.only;
    order.error = what.error;
    order.pass = what.pass;
    order.failed = 0;
    order.fail = what.times;
}

int failed(fault_call call)
{
    return g_faults->call[call].failed;
}
