/* The record of kernel-module levels: a level that was stored is found, whatever the record held before. */
#include "fuzz/fuzz.h"
#include "handlers/bsp_module_level.h"
#include "tests/memory_platform.h"

#include <cstring>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    g_platform = {};
    g_platform.items["bsplog_module_level"] = std::string(text_of(data, size).substr(0, kBspRecordSize + 100));
    char level[kBspFieldSize];
    log_get_bsp_module_level("wlan", level);
    promise(memchr(level, '\0', sizeof level) != nullptr, "a level is a text");
    if (log_set_bsp_module_level("wlan", "debug") != 0)
        return 0;
    const std::string &record = g_platform.items["bsplog_module_level"];
    promise(record.size() < kBspRecordSize, "a record has room in its field");
    promise(record.find("wlan,debug;") != std::string::npos, "what was stored stands in the record");
    return 0;
}
