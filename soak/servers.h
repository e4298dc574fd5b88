/* A log server that a device calls, and that is not in its right mind. */
#ifndef SOAK_SERVERS_H
#define SOAK_SERVERS_H

#include "soak/peer.h"
#include "device/log_server.h"

#include <optional>
#include <vector>

class random_server
{
public:
    random_server(const tool_listener &listener, dice chance, soak_tally &tally);
    /* Waits until `end` for the device's call. */
    bool is_called(tool_clock::time_point end);
    /* Serves it until `end`, or until either has had enough of the other. */
    void serve(tool_clock::time_point end);
    /* Hangs up on all streams and ends them, and asks once more. */
    daemon_says calm(int milliseconds);

private:
    void take_call();
    void use_link();
    bool command();

    const tool_listener &listener_;
    dice chance_;
    soak_tally &tally_;
    std::optional<soak_peer> control_;
    std::vector<soak_peer> links_; /* for data */
};

#endif
