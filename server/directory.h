/*
 * Where the devices of all servers are: two buckets of JetStream's that every server writes and reads. An entry of the one
 * says which server has a device; one of the other, how tools reach a server, and is gone 15 seconds after that died.
 */
#ifndef SERVER_DIRECTORY_H
#define SERVER_DIRECTORY_H

#include "server/nats_link.h"
#include "server/server.h"

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

/* A server that has a device, or just a server. */
struct server_place {
    std::string name;
    std::string tools; /* the address at which tools reach it */
};

class directory
{
public:
    /* `ready` is called whenever JetStream has all that the servers need of it. */
    directory(server &server, nats_link &link, std::function<void()> ready)
        : home_(server), link_(link), ready_(std::move(ready)), changed_(server.io)
    {
    }

    /* Begins to keep it up to date. */
    void start();
    /* The bus is there, or not. */
    void set_connected(bool connected);
    /* A device has called this server, at that time; it has left. */
    void enter(const std::string &imei, std::time_t since);
    void leave(const std::string &imei);

    /* The other server that has a device, if there is one that lives. */
    task<std::optional<server_place>> find(std::string imei);
    /* All other servers that live. */
    task<std::vector<server_place>> others();
    /* Writes what is not written yet, and that this server is gone; no longer than a second. */
    task<void> end();

private:
    struct buckets {
        nats_bucket_ptr servers, devices;
        std::atomic<bool> answer = true; /* or else nobody waits for them any more: others are made */
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
    static void write_one(buckets &into, const std::string &name, update &update);
    std::vector<update> next_updates();
    void touch_all();

    server &home_;
    nats_link &link_;
    const std::function<void()> ready_;
    std::shared_ptr<buckets> buckets_; /* none, until they can be used */
    std::map<std::string, presence> here_;
    std::set<std::string> changes_; /* IMEIs */
    wake_up changed_;
    bool told_ = false; /* that JetStream does not answer */
    bool ending_ = false;
};

#endif
