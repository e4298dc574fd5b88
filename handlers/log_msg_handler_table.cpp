#include "handlers/handlers.h"
#include "protocol/log_json_codec.h"

namespace
{

#define LOG_HANDLER_ROW(msgid, handler, alone) {handler, msgid, alone},
#define LOG_HANDLER_NONE(msgid) {nullptr, msgid},
constexpr log_msg_handler_entry kTable[] = {LOG_MSG_HANDLERS(LOG_HANDLER_ROW, LOG_HANDLER_NONE)};

} // namespace

const std::span<const log_msg_handler_entry> log_msg_handler_table{kTable};
