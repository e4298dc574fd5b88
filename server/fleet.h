/* All devices that are there, and the place at which they call. */
#ifndef SERVER_FLEET_H
#define SERVER_FLEET_H

#include "server/device.h"
#include "server/server.h"

#include <asio/ip/tcp.hpp>
#include <functional>
#include <map>
#include <memory>
#include <string>

/* Whether a device can be known by that: it becomes part of file names, and of the bus's subjects, too. */
bool is_imei(const std::string &text);

class fleet
{
public:
    explicit fleet(server &server) : server_(server) {}

    /* Takes the calls of devices, for ever. */
    task<void> listen(asio::ip::tcp::acceptor listener);
    /* Serves one caller until its link ends. */
    task<void> take_call(frame_link::socket socket);

    /* None when no such device is there. */
    std::shared_ptr<device> find(const std::string &imei) const;
    /* The same, when it comes to call until `end`, or as long as `called` is waited for. */
    task<std::shared_ptr<device>> await(std::string imei, server_clock::time_point end,
                                        std::shared_ptr<wake_up> called);
    const std::map<std::string, std::shared_ptr<device>> &all() const { return devices_; }

    /* Ends the link of a device that has called another server, where it proved to be that; false when it is another
     * device, which is still there. */
    task<bool> give_up(std::string imei, std::string identity);

    /* Who wants to be told of calls and departures, for as long as the returned handle lives. */
    using watcher = std::function<void(const device &, bool there)>;
    std::shared_ptr<watcher> watch(watcher who);

    /* Ends all links. */
    void end_all();

private:
    task<std::string> serve_call(std::shared_ptr<frame_link> link, std::string address);
    task<std::string> serve_device(std::shared_ptr<frame_link> link, const message &announcement, std::string address);
    std::string hand_over(const std::shared_ptr<frame_link> &link, const message &announcement,
                          const std::string &address);
    task<bool> may_replace(std::shared_ptr<device> older, const std::string &identity);
    void refuse(const std::string &address, const std::string &why);
    void enter(const std::shared_ptr<device> &device);
    void leave(const std::shared_ptr<device> &device);

    server &server_;
    std::map<std::string, std::shared_ptr<device>> devices_; /* by IMEI */
    std::map<std::string, unsigned> callers_;                /* connections, by address */
    std::vector<std::weak_ptr<watcher>> watchers_;
    server_clock::time_point refusals_since_{}; /* the second that refusals are counted in */
    unsigned refusals_ = 0;
};

#endif
