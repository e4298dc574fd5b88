#include "client/log_announce.h"

#include "core/log_tools.h"

#include <cstdio>

void log_print_announcement(char (&text)[kAnnouncementSize], const char *msgid, const char *member,
                            const char *connect_type)
{
    char version[64] = {};
    char model[64] = {};
    char imei[64] = {};
    char msn[64] = {};
    vex_get_nv_item("integrate_version", version, sizeof version);
    vex_get_nv_item("model_name", model, sizeof model);
    vex_get_nv_item("imei", imei, sizeof imei);
    vex_get_nv_item("modem_msn", msn, sizeof msn);
    char for_stream[64] = "";
    if (connect_type != nullptr)
        std::snprintf(for_stream, sizeof for_stream, ",\"ConnectType\":\"%s\"", connect_type);
    std::snprintf(text, sizeof text,
                  "{\"msgid\":\"%s\",\"%s\":{\"VersionInfo\":\"%s\",\"projectName\":\"%s\",\"imei\":\"%s\","
                  "\"modem_msn\":\"%s\"%s},\"Result\":\"\"}",
                  msgid, member, version, model, imei, msn, for_stream);
}
