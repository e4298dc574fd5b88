/*
 * A device that has called: its control link, and the commands that tools have carried out on it, one at a time.
 */
#ifndef SERVER_DEVICE_H
#define SERVER_DEVICE_H

#include "server/frame_link.h"
#include "server/live_log.h"
#include "server/server.h"
#include "server/stored_archive.h"

#include <array>
#include <list>
#include <memory>
#include <string>

/* Who a device says it is. */
struct device_about {
    std::string imei, model, software, serial;
};

/* A command under way on a device. */
struct device_command {
    device_command(asio::io_context &io, std::string id, std::shared_ptr<frame_link> from)
        : done(io), msgid(std::move(id)), tool(std::move(from))
    {
    }

    wake_up done; /* all of its answer has come */
    const std::string msgid;
    std::shared_ptr<frame_link> tool;     /* gets the answer; none when nobody does, or nobody any more */
    std::string reply;                    /* the newest frame's control text */
    std::uint64_t archived = 0;           /* bytes of an archive that have come */
    std::unique_ptr<stored_archive> kept; /* which is kept, too */
};

class device : public std::enable_shared_from_this<device>
{
public:
    static std::shared_ptr<device> make(server &server, std::shared_ptr<frame_link> link, device_about about,
                                        std::string identity, std::string address);

    /* Reads the control link until it ends. */
    task<void> serve();

    /* Waits, by `turn`, until it is the caller's turn to give commands; false when that is given up, has not come by
     * `end`, or the device is gone. Whoever has got it gives it back. */
    task<bool> take_turn(std::string who, std::shared_ptr<wake_up> turn,
                         server_clock::time_point end = server_clock::time_point::max());
    void give_turn();
    bool is_busy() const { return busy_; }
    /* Who has the turn, and with what. */
    std::string at_work() const;

    /* Has the frame of a command carried out, in the caller's turn, and waits for what it comes to; with a tool, until
     * that is gone and the device's answer too. False when there is no answer. */
    task<bool> run(const std::shared_ptr<device_command> &command, std::span<const unsigned char> frame);
    /* The same for a command of the server's own: the reply's control text; none when there is no answer. */
    task<std::optional<std::string>> ask(std::string control);

    /* What is told of the device, with what has happened to it: a JSON object. */
    std::string describe(const char *event) const;
    /* The address at which the device reaches this server. */
    std::string called_address() const;

    live_log &log(log_kind kind) { return *logs_[static_cast<std::size_t>(kind)]; }

    server &home;
    const std::shared_ptr<frame_link> link;
    const device_about about;
    const std::string identity; /* what its data links must have in common with it */
    const std::string address;
    const std::time_t since;
    std::string last_command = "-"; /* what it was and what came of it */

private:
    device(server &server, std::shared_ptr<frame_link> link, device_about about, std::string identity,
           std::string address);
    task<void> take_reply(const frame_view &frame);
    void note_end(const device_command &command, server_clock::time_point begun);

    std::array<std::shared_ptr<live_log>, kLogKinds> logs_;
    std::shared_ptr<device_command> current_;
    std::list<std::shared_ptr<wake_up>> queue_; /* of those who wait for their turn */
    bool busy_ = false;
    std::string holder_;              /* who has the turn */
    bool has_spoken_unasked_ = false; /* which is told once */
};

#endif
