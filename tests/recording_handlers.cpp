#include "tests/recording_handlers.h"

#include "protocol/log_json_codec.h"

std::string g_commands;

namespace
{

template <int msgid> int record(const char *control, const unsigned char *data, std::int32_t dataLen)
{
    g_commands += std::to_string(msgid) + ':' + control + ':';
    g_commands.append(reinterpret_cast<const char *>(data), static_cast<std::size_t>(dataLen)) += ';';
    return 0;
}

} // namespace

const std::array<log_msg_handler_entry, 11> log_msg_handler_table{{{1, record<1>},
                                                                   {2, record<2>},
                                                                   {3, record<3>},
                                                                   {4, record<4>},
                                                                   {5, record<5>},
                                                                   {6, record<6>},
                                                                   {7, record<7>},
                                                                   {8, record<8>},
                                                                   {9, nullptr},
                                                                   {10, record<10>},
                                                                   {11, record<11>}}};
