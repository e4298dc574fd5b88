/*
 * Many servers as one, over NATS: each knows where the devices of the others are, passes commands on that come over the
 * bus for its own, tells what happens there, and hands the live logs over to JetStream. The bus need not be there: it is
 * looked for, and what it is to have is kept meanwhile.
 */
#ifndef SERVER_BUS_H
#define SERVER_BUS_H

#include "server/device.h"
#include "server/directory.h"
#include "server/nats_link.h"
#include "server/server.h"
#include "server/spool.h"

#include <functional>
#include <map>
#include <memory>
#include <string>

class bus
{
public:
    /* None, and why, when it can't be used as it was asked for. */
    static std::unique_ptr<bus> open(server &server, std::string &why);

    /* Whether a device may be taken that has called: another server that has it is asked to give it up. */
    task<bool> may_take(std::string imei, std::string identity);
    /* A device has called this server, or left it. */
    void called(const device &device);
    void left(const device &device);

    /* The address for tools of the other server that has a device; empty when none has. */
    task<std::string> find(std::string imei);
    /* The devices of all other servers, a line of JSON each; `missing`: which are not known, if so. */
    task<std::string> list(std::string &missing);

    /* Tells what has happened, as JSON. */
    void tell(const std::string &imei, const std::string &event);
    /* Has devices that call other servers and leave them told, as JSON, for as long as the returned handle lives. */
    std::shared_ptr<nats_subscription> watch(std::function<void(const std::string &event)> told);

    /* A device's log, to be appended to. */
    std::shared_ptr<stored_log> follow(const std::string &imei, log_kind kind) { return spool_.follow(imei, kind); }

    bool connected() const { return link_->connected(); }
    std::uint64_t spooled() const { return spool_.total(); }
    /* Puts into the spool what was taken of the logs. */
    void flush() { spool_.flush(); }
    /* Tells the others that this server is gone. Takes a few seconds at most. */
    task<void> end() { return directory_.end(); }

private:
    bus(server &server, std::unique_ptr<nats_link> link);
    /* Which other server has a device, as that says itself. */
    struct place {
        std::string server;
        std::string tools; /* its address for tools */
    };
    task<place> place_of(std::string imei);
    void changed(bool connected, const std::string &why);
    task<bool> list_server(std::string name, std::string &lines);
    task<void> carry_out(nats_message request, std::string imei);
    task<std::string> command(std::string imei, std::string control);
    task<void> answer(nats_message request);
    std::string list_after(const std::string &imei) const;

    server &home_;
    std::unique_ptr<nats_link> link_;
    directory directory_;
    spool spool_;
    std::map<std::string, std::shared_ptr<nats_subscription>> commands_; /* by IMEI */
    std::map<std::string, unsigned> under_way_;                          /* commands, by IMEI */
    std::shared_ptr<nats_subscription> questions_;                       /* of other servers */
};

#endif
