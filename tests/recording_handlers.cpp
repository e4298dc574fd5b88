#include "tests/recording_handlers.h"

#include "protocol/log_json_codec.h"

#include <array>
#include <utility>

std::string g_commands;

namespace
{

template <int msgid> int record(const char *control, const unsigned char *data, std::int32_t dataLen)
{
    g_commands += std::to_string(msgid) + ':' + control + ':';
    g_commands.append(reinterpret_cast<const char *>(data), static_cast<std::size_t>(dataLen)) += ';';
    return 0;
}

template <int... n> std::array<log_msg_handler_entry, 11> all(std::integer_sequence<int, n...> /*rows*/)
{
    return {{{n == 8 ? nullptr : record<n + 1>, n + 1}...}};
}

const auto kTable = all(std::make_integer_sequence<int, 11>());

} // namespace

const std::span<const log_msg_handler_entry> log_msg_handler_table{kTable};
