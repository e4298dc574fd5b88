/* What a start or an end of a live log is in each of the daemon's modes. */
#ifndef HANDLERS_LIVE_LOG_H
#define HANDLERS_LIVE_LOG_H

#include "handlers/log_handler.h"

#include <optional>

/* What a request asks for. */
struct live_log_request {
    char log_type[32] = {};
    char action[32] = {};
    char ip[64] = {}; /* of the server, in client mode */
    char port[16] = {};

    bool asks(const char *of_type, const char *an_action) const
    {
        return std::strcmp(log_type, of_type) == 0 && std::strcmp(action, an_action) == 0;
    }
};

/* What it is answered with: where the peer finds the stream. */
struct live_log_answer {
    const char *protocol = "";
    int port = 0;
    char ip[64] = {};
    const char *result = kSuccess;
};

/* Server mode: the device's log programs talk to the log tool themselves. No answer when the request asks for nothing
 * that there is. */
std::optional<live_log_answer> live_log_serve_tool(const live_log_request &request);

/* Client mode: each stream gets a data link to the server; its log program is started when the server confirms that. */
std::optional<live_log_answer> live_log_serve_server(const live_log_request &request);

#endif
