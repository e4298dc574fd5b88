/*
 * Where the devices of all servers are, for anybody to read: two buckets of JetStream's. An entry of the one says which
 * server has a device; one of the other, how tools reach a server, and is gone 15 seconds after that died.
 */
#ifndef SERVER_DIRECTORY_H
#define SERVER_DIRECTORY_H

#include "server/nats_link.h"
#include "server/server.h"

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

class directory
{
public:
    directory(server &server, nats_link &link) : home_(server), link_(link), changed_(server.io) {}

    /* Begins to keep it up to date. */
    void start();
    /* The bus is there, or not. */
    void set_connected(bool connected);
    /* A device has called this server, at that time; it has left. */
    void enter(const std::string &imei, std::time_t since);
    void leave(const std::string &imei);

    /* The names of all other servers that live; none when nobody says. */
    task<std::optional<std::vector<std::string>>> others();
    /* Writes what is not written yet, and that this server is gone; no longer than a second. */
    task<void> end();

private:
    struct buckets {
        nats_bucket_ptr servers, devices;
    };
    struct presence {
        std::time_t since = 0;
        bool there = true;
        std::uint64_t revision = 0; /* of what was written last; 0: nothing was */
    };
    /* What is to be written of a device, and what came of it. */
    struct update {
        std::string imei;
        presence what;
        bool written = false;
        bool is_elsewhere = false; /* it has called another server since */
    };

    task<void> write_changes();
    task<void> stay_alive();
    task<std::shared_ptr<buckets>> prepare();
    bool note(const std::vector<update> &updates);
    static bool write_one(const buckets &into, const std::string &name, update &update);
    std::vector<update> next_updates();
    void touch_all();

    server &home_;
    nats_link &link_;
    std::shared_ptr<buckets> buckets_; /* none, until they can be used */
    std::map<std::string, presence> here_;
    std::set<std::string> changes_; /* IMEIs */
    wake_up changed_;
    bool told_ = false; /* that JetStream does not answer */
    bool ending_ = false;
};

#endif
