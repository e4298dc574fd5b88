/* How a live log is kept, wherever that is: its lines get the time at which they came, and what is missing is told. */
#ifndef SERVER_STORED_LOG_H
#define SERVER_STORED_LOG_H

#include "server/live_log.h"

#include <ctime>
#include <memory>
#include <string>
#include <string_view>

struct server;

/* A time as strftime() writes it, in UTC. */
std::string utc_text(const char *format, std::time_t when = std::time(nullptr));

/* Where a kept log goes. */
class log_output
{
public:
    virtual ~log_output() = default;

    /* Takes bytes, which are written within a second. */
    virtual void append(std::string_view bytes) = 0;
    /* Writes what was taken. Bytes that find no room are counted. */
    virtual void flush() = 0;
    /* Nothing comes for now, and perhaps never again. */
    virtual void close() = 0;
    /* The bytes that found no room since this was asked last, and why. */
    virtual std::uint64_t take_lost() = 0;
    virtual std::string why_lost() const = 0;
};

/* A live log that is kept, over all the links that bring it. Each line of the system log gets the time at which it
 * came. */
class stored_log
{
public:
    /* `place`: where it is kept, as events tell it. `last`: when something was kept last, by this server or another; 0:
     * never. */
    stored_log(server &server, std::string imei, log_kind kind, const char *place, std::unique_ptr<log_output> output,
               std::time_t last);

    log_output &output() { return *output_; }

    /* What came before is about to be found out: what is missing is told when it is. */
    void await_past() { past_is_known_ = false; }
    /* When something of it was kept last; 0: never. `ours`: by this server, or one before it of the same name. */
    void kept_last(std::time_t when, bool ours);
    void append(std::string_view bytes);
    /* The log has begun again, from that source; it has ended, unless another source has begun meanwhile. What is missing
     * in between is told. */
    void resumed(const live_log *source);
    void interrupted(const live_log *source, const std::string &why);

private:
    void append_lines(std::string_view bytes);
    void tell(const std::string &what);
    void tell_lost();
    void tell_gap();

    server &home_;
    const std::string imei_;
    const log_kind kind_;
    const char *const place_;
    const std::unique_ptr<log_output> output_;
    std::string line_;                 /* that is not whole yet, with its time */
    const live_log *source_ = nullptr; /* that brings it now */
    std::time_t since_;                /* of an interruption; 0: there is none */
    std::time_t began_ = 0;            /* after it */
    bool past_is_known_ = true;
    std::string why_ = "the server was not there";
};

#endif
