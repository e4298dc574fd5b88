/* A connection to the daemon whose other end is up to something: it sends what it likes, and looks at what it gets. */
#ifndef SOAK_PEER_H
#define SOAK_PEER_H

#include "soak/commands.h"
#include "soak/tally.h"
#include "tools/tool_link.h"

#include <deque>
#include <string>

/* What a daemon has to say: a reply; nothing; or nothing, as it has hung up or was sent nonsense before. */
enum class daemon_says { a_reply, nothing, goodbye };

class soak_peer
{
public:
    soak_peer(tool_link link, soak_tally &tally);

    /* Sends a command, and remembers that a reply may come, if it has a msgid to tell that by. False when the daemon
     * takes nothing more for now, or is gone. */
    bool say(const soak_command &command);
    /* Sends any bytes; from then on nobody knows which replies will come, but that they are replies. */
    bool say(const std::string &bytes);
    /* Replies may come to what was said elsewhere. */
    void expect_anything() { orderly_ = false; }
    /* Takes the replies that come within so many milliseconds, until every command has one. What comes must be whole
     * frames, and answer what was said here, in that order. False when the daemon has hung up. */
    bool listen(int milliseconds);
    /* Takes a log that comes, anything but replies; false when the daemon has hung up. */
    bool take_bytes(int milliseconds);
    /* Asks once more, and waits so many milliseconds for the reply behind whatever else the daemon still has to say. */
    daemon_says answer(int milliseconds);
    /* Ends it without a word, which the daemon learns by a reset. */
    void reset();

    tool_link link;

private:
    bool write(const std::string &bytes);
    bool read(int milliseconds, std::string &into);
    bool take_frame();
    void judge(const std::string &control, std::size_t data_len);

    soak_tally *tally_;
    std::deque<std::string> asked_; /* the msgids of what is not answered yet */
    std::string last_;              /* msgid of the newest reply: an archive takes several */
    std::string held_;
    std::string said_;    /* the newest reply */
    bool orderly_ = true; /* replies are to what was asked here */
    bool in_step_ = true; /* the daemon takes what is sent for what it is */
};

#endif
