/*
 * A live log of a device: started when somebody wants it, over a data link that the device makes for it, and passed on to
 * all who want it and to the store, until nobody does.
 */
#ifndef SERVER_LIVE_LOG_H
#define SERVER_LIVE_LOG_H

#include "server/frame_link.h"
#include "server/io.h"

#include <deque>
#include <memory>
#include <string>
#include <vector>

class device;
class stored_log;

enum class log_kind : std::uint8_t { syslog, qxdm };
constexpr std::size_t kLogKinds = 2;

/* What the kind is called, and its data links. */
const char *log_name(log_kind kind);
const char *log_connect_type(log_kind kind);
std::optional<log_kind> log_kind_of(std::string_view name);
std::optional<log_kind> log_kind_of_link(std::string_view connect_type);

/* A tool that follows a log. What it does not take in time is left out, and counted: nobody waits for it. */
class log_follower
{
public:
    log_follower(asio::io_context &io, std::shared_ptr<frame_link> tool)
        : started(io), tool_(std::move(tool)), more_(io)
    {
    }

    /* The log has begun, with the device's reply; or it has not, and why. */
    wake_up started;
    std::string reply;
    std::string why;
    bool wanted = true; /* the tool still wants it */

    void push(std::string_view bytes);
    void end(const std::string &reason);
    /* Sends what is pushed until the end, and that. */
    task<void> pass_on();

private:
    std::shared_ptr<frame_link> tool_;
    std::deque<std::string> queue_;
    std::size_t queued_ = 0;
    std::uint64_t missed_ = 0;
    bool ended_ = false;
    wake_up more_;
};

class live_log : public std::enable_shared_from_this<live_log>
{
public:
    live_log(device &device, log_kind kind);
    ~live_log();

    /* Has a tool follow the log, until it leaves or the log ends. */
    void join(const std::shared_ptr<log_follower> &follower);
    void leave(const std::shared_ptr<log_follower> &follower);
    /* Has the store and the bus follow it for as long as the device is there. */
    void keep();

    /* Takes a data link that the device has made; false when none is waited for. */
    bool take(const std::shared_ptr<frame_link> &link);
    void device_left();
    bool running() const { return link_ != nullptr; }

private:
    bool wanted() const;
    task<void> run();
    task<std::string> begin();
    task<void> relay();
    task<void> stop();
    void tell_started(const std::string &reply);
    void tell_ended(const std::string &why, bool to_all);

    std::weak_ptr<device> device_;
    asio::io_context &io_;
    const log_kind kind_;
    std::vector<std::shared_ptr<log_follower>> followers_;
    std::vector<std::shared_ptr<stored_log>> stored_; /* where it is kept */
    std::shared_ptr<frame_link> link_;                /* the data link */
    std::string reply_;                               /* to the start that it comes from */
    wake_up called_;                                  /* the data link has come */
    wake_up left_;                                    /* the device */
    bool running_ = false;
    bool expecting_ = false; /* the data link */
    bool stopping_ = false;  /* the device was told to end the log that link_ brings */
};

#endif
