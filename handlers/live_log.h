/* What starting and stopping live logs has in common in both of the daemon's modes, and what it is in each. */
#ifndef HANDLERS_LIVE_LOG_H
#define HANDLERS_LIVE_LOG_H

#include "handlers/log_handler.h"

constexpr int kModemPort = 25555; /* TCP, on the device */

/* The modem log program's configurations; without the first there is no modem log. */
constexpr char kModemConfig[] = "/logfs/logconf/Diag.cfg";
constexpr char kModemConfig2[] = "/logfs/logconf/Diag.cfg2";
bool live_log_has_config();
bool live_log_has_config2();

/* Where the peer finds a stream. */
struct stream_place {
    const char *protocol;
    int port;
    const char *ip;
};

/* Answers a request. */
void live_log_reply(const stream_place &place, const char *result = kSuccess);

/* Runs the modem log program, which then listens at the address that the line names. */
void live_log_run_modem(const char *cmd);

/* Stops the modem log and makes ready for a new one. False when that one is not to come, as there is no
 * configuration, or has been started already, as this is a plug-in module in a PC, which it can only go to: then the
 * request is answered. */
bool live_log_prepare_modem();

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

/* Server mode: the device's log programs talk to the log tool themselves. Answers the request; false when it asks for
 * nothing that there is. */
bool live_log_serve_tool(const live_log_request &request);

/* Client mode: each stream gets a data link to the server; its log program is started when the server confirms that. */
bool live_log_serve_server(const live_log_request &request);

#endif
