/*
 * The live logs on their way to the bus, in a folder: a file for each, until JetStream has its records. One record of a log
 * is on its way at a time, so that they come in order, and each is known by a name, so that it is there once.
 */
#ifndef SERVER_SPOOL_H
#define SERVER_SPOOL_H

#include "server/nats_link.h"
#include "server/server.h"
#include "server/spool_file.h"
#include "server/stored_log.h"

#include <deque>
#include <map>
#include <memory>
#include <string>

class spool
{
public:
    spool(server &server, nats_link &link) : home_(server), link_(link) {}

    /* Takes up what is left in the folder; false, and why, when that can't be used. */
    bool open(std::string &why);
    /* The log of a device that has called. The bus is asked when it had something of it last. */
    std::shared_ptr<stored_log> follow(const std::string &imei, log_kind kind);
    std::uint64_t total() const { return room_.total; }

    /* The bus is there, or not. */
    void set_connected(bool connected);
    /* What came of a record. */
    void kept(const std::string &subject, const std::string &id, const std::string &why);
    /* Writes what was taken. */
    void flush();

private:
    struct spooled {
        std::string subject;
        std::string name; /* that its records' ids begin with */
        spool_file *file = nullptr;
        std::shared_ptr<stored_log> stored;    /* owns the file */
        std::string under_way;                 /* a record's id; empty: none is */
        bool doubtful = false;                 /* the oldest record may be there already */
        bool waiting = false;                  /* for others to come through */
        bool past_is_known = true;             /* or else nothing is sent */
        server_clock::time_point deadline{};   /* for what is under way */
        server_clock::time_point not_before{}; /* when it is tried again */
    };

    spooled &find(const std::string &imei, log_kind kind);
    task<void> make_stream();
    task<void> tick();
    void send_next(spooled &log);
    task<void> resolve(spooled &log, std::string id);
    task<void> ask_for_past(spooled &log);
    void settled(spooled &log);
    void failed(spooled &log, const std::string &why);

    server &home_;
    nats_link &link_;
    spool_room room_;
    std::map<std::string, spooled> logs_; /* by subject */
    std::deque<spooled *> waiting_;
    unsigned under_way_ = 0;
    bool ready_ = false; /* JetStream has the stream */
    bool making_ = false;
    server_clock::time_point told_{}; /* that records fail */
};

#endif
