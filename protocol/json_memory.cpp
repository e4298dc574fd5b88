#include "protocol/json_memory.h"

#include <cjson/cJSON.h>
#include <cstddef>
#include <cstdint>
#include <cstdlib>

namespace
{

/* Enough for the tree of a usual command. A thread's memory is taken up and zeroed with it, so no more than that. */
constexpr std::size_t kAreaSize = 2048;
constexpr std::size_t kAlignment = alignof(std::max_align_t);

struct json_area {
    alignas(kAlignment) unsigned char bytes[kAreaSize];
    std::size_t used; /* bytes, from the start; what lies below is never given out twice */
    std::size_t live; /* pieces given out and not yet given back */
};

thread_local json_area t_area{};

void *take(std::size_t size)
{
    const std::size_t room = kAreaSize - t_area.used;
    if (size >= room)
        return std::malloc(size);
    void *piece = t_area.bytes + t_area.used;
    const std::size_t rounded = (size + kAlignment - 1) / kAlignment * kAlignment;
    t_area.used += rounded < room ? rounded : room;
    ++t_area.live;
    return piece;
}

void give(void *piece)
{
    const auto at = reinterpret_cast<std::uintptr_t>(piece);
    const auto begin = reinterpret_cast<std::uintptr_t>(t_area.bytes);
    if (at < begin || at - begin >= kAreaSize) {
        std::free(piece);
    } else if (--t_area.live == 0) {
        t_area.used = 0;
    }
}

} // namespace

void json_memory_install()
{
    cJSON_Hooks hooks{take, give};
    cJSON_InitHooks(&hooks);
}
