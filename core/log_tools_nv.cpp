#include "core/log_tools.h"

#include "core/log_line.h"

#include <cstdio>

namespace
{

constexpr char kLogSource[] = "log_tools";

constexpr int kNvIntSize = 32;

} // namespace

int vex_get_nv_item(const char *name, char *buffer, int size)
{
    if (name == nullptr || buffer == nullptr || size < 2) {
        LOG_NOTE("vex_get_nv_item Para Error\n");
        return -1;
    }
    if (vex_nvconfig_read(name, buffer, size - 1) != 1)
        return -1;
    LOG_NOTE("vex_get_nv_item:nvItem = %s,buf = %s, bufLength=%d", name, buffer, size - 1);
    return 0;
}

int vex_set_nv_item(const char *name, const char *value, int len)
{
    if (name == nullptr || value == nullptr) {
        LOG_NOTE("vex_set_nv_item Para Error\n");
        return -1;
    }
    if (vex_nvconfig_write(name, value, len) != 1) {
        LOG_NOTE("vex_set_nv_item set Error\n");
        return -1;
    }
    LOG_NOTE("vex_set_nv_item: nvItem = %s,nvItemValue = %s\n", name, value);
    cfg_save();
    return 0;
}

int log_get_nv_int(const char *name)
{
    char text[kNvIntSize] = {};
    vex_get_nv_item(name, text, sizeof text);
    return log_text_to_int(text);
}

int log_set_nv_int(const char *name, int value)
{
    char text[kNvIntSize] = {};
    const int len = std::snprintf(text, sizeof text, "%d", value);
    LOG_NOTE("%s value=%s", name, text);
    return vex_set_nv_item(name, text, len);
}
