#include "handlers/handlers.h"
#include "protocol/log_json_codec.h"

const std::array<log_msg_handler_entry, 11> log_msg_handler_table{{
    {1, nullptr},
    {2, nullptr},
    {3, log_msg_get_version_info},
    {4, nullptr},
    {5, nullptr},
    {6, nullptr},
    {7, nullptr},
    {8, nullptr},
    {9, nullptr}, /* the number of the announcement that the daemon itself sends as a client */
    {10, nullptr},
    {11, log_msg_mode_lpm_online},
}};
