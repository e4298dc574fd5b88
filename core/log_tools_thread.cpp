#include "core/log_tools.h"

#include "core/log_line.h"

namespace
{

constexpr char kLogSource[] = "log_tools";

/* Bytes of stack for a thread. Frames live on the heap, so the deepest use is a JSON text of nothing but brackets, with
 * about 100 KB. The usual 8 MB would make the end of a thread dearer, as the kernel looks through all of it. */
constexpr std::size_t kStackSize = std::size_t{256} * 1024;

} // namespace

int log_thread_create(log_thread_task *task, void *argument)
{
    if (task == nullptr) {
        LOG_NOTE("input paramnet is error\n");
        return -1;
    }
    pthread_attr_t attributes;
    if (pthread_attr_init(&attributes) != 0)
        return -1;
    const bool started = pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED) == 0 &&
                         pthread_attr_setstacksize(&attributes, kStackSize) == 0 &&
                         pthread_create(&task->thread_id, &attributes, task->entry, argument) == 0;
    pthread_attr_destroy(&attributes);
    return started ? 0 : -1;
}

int log_start_thread(const char *starter, void *(*entry)(void *), void *argument)
{
    log_thread_task task{};
    task.entry = entry;
    if (log_thread_create(&task, argument) == 0)
        return 0;
    LOG_NOTE_AS("vex_log_manage", "%s  FAIL\n", starter);
    return -1;
}
