#include "core/log_block.h"

#include "core/log_registry.h"

#include <cstdlib>

namespace
{

/* One for the command connection's reader and one for its sender; more are rarely in use at once. */
constexpr std::size_t kKept = 2;

void *g_kept[kKept] LOG_GUARDED_BY(g_block_lock);
std::size_t g_kept_count LOG_GUARDED_BY(g_block_lock);

} // namespace

void *log_block_take()
{
    {
        const log_lock hold{g_block_lock};
        if (g_kept_count > 0)
            return g_kept[--g_kept_count];
    }
    return std::aligned_alloc(64, kLogBlockSize);
}

void log_block_give(void *block)
{
    if (block == nullptr)
        return;
    {
        const log_lock hold{g_block_lock};
        if (g_kept_count < kKept) {
            g_kept[g_kept_count++] = block;
            return;
        }
    }
    std::free(block);
}
