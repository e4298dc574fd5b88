#include "core/log_threads.h"

#include "core/log_line.h"
#include "core/log_tools.h"

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

} // namespace

int log_start_thread(const char *starter, void *(*entry)(void *), void *argument)
{
    log_thread_task task{};
    task.entry = entry;
    if (log_thread_create(&task, argument) == 0)
        return 0;
    LOG_NOTE("%s  FAIL\n", starter);
    return -1;
}
