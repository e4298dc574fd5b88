#include "handlers/handlers.h"
#include "protocol/log_json_codec.h"

const std::array<log_msg_handler_entry, 11> log_msg_handler_table{{
    {1, log_msg_set_config_file},
    {2, log_msg_get_log_file},
    {3, log_msg_get_version_info},
    {4, log_msg_set_syslog_para},
    {5, log_msg_set_tcpdump_log},
    {6, log_msg_set_realtime_log},
    {7, log_msg_clean_local_log},
    {8, log_msg_set_bsp_log},
    {9, nullptr},                        /* the number of the announcement that the daemon itself sends as a client */
    {10, log_msg_confirm_channel, true}, /* a stream begins although the control link is busy with an archive */
    {11, log_msg_mode_lpm_online},
}};
