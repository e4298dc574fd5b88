/*
 * A connection that frames travel over, with TLS or without: to a device or to a tool. What is held for one that says
 * nothing is small: there are thousands of them.
 *
 * One coroutine reads a link and one writes to it at a time. Failures are told by why().
 */
#ifndef SERVER_FRAME_LINK_H
#define SERVER_FRAME_LINK_H

#include "protocol/log_pkg_codec.h"
#include "server/io.h"

#include <asio/generic/stream_protocol.hpp>
#include <memory>
#include <openssl/ssl.h>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <vector>

/* A frame as it was received; the link's, until it is read again. */
struct frame_view {
    std::string_view control;
    std::span<const unsigned char> data;
    std::span<const unsigned char> bytes; /* all of it */
};

/* The bytes of a frame. The texts are the server's own and never longer than a frame takes. */
std::string make_frame(std::string_view control, std::string_view data = {});

struct ssl_deleter {
    void operator()(SSL *session) const { SSL_free(session); }
};
using ssl_session = std::unique_ptr<SSL, ssl_deleter>;

class frame_link : public std::enable_shared_from_this<frame_link>
{
public:
    using socket = asio::generic::stream_protocol::socket;

    /* Takes over a connected socket, and speaks TLS over it where there is a session. */
    frame_link(socket connected, ssl_session session);
    ~frame_link();

    /* Shakes hands, where there is TLS. */
    task<bool> shake_hands();

    /* Waits for bytes, and holds them behind those that are held; false at the end of the link. */
    task<bool> fill();
    /* Takes the frame that the held bytes begin with, if it is whole. Bytes that can't be a frame's end the link. */
    std::optional<frame_view> take();
    /* The next frame; none at the end of the link. */
    task<std::optional<frame_view>> receive();
    /* The next bytes, whatever they are: what is held first. They are there until something else is awaited; none at the
     * end of the link. */
    task<std::string_view> read();
    std::size_t held() const { return held_.size() - taken_; }

    /* Sends all of the bytes, which must stay until then; false at the end of the link, which a peer brings about that
     * takes nothing for a minute. */
    task<bool> send(std::span<const unsigned char> bytes);
    task<bool> send(std::string_view bytes);

    /* What the peer is to send from now on must have come by then, or the link ends; without a limit, for ever. */
    void limit(server_clock::duration time) { end_after(read_timer_, time, "it took too long"); }
    void unlimited() { read_timer_.cancel(); }

    /* Ends a fill() that is under way, but not the link. */
    void stop_waiting();
    /* Ends the link: whoever waits for it learns of it at once. The first reason is the one that is told. */
    void end(std::string_view why);
    bool ended() const { return ended_; }
    const std::string &why() const { return why_; }

    /* The addresses of its two ends as texts; of IPv4 ones as such, whatever the socket. "local" for a unix socket's. */
    std::string address() const { return address_of(getpeername); }
    std::string own_address() const { return address_of(getsockname); }

    SSL *session() const { return session_.get(); }
    int fd() { return socket_.native_handle(); }
    std::uint64_t received() const { return received_; }

private:
    std::string address_of(decltype(getsockname) *which) const;
    ssize_t read_some(std::span<unsigned char> into);
    task<bool> wait_for(int error);
    task<void> be_fair();
    void end_after(asio::steady_timer &timer, server_clock::duration time, const char *why);

    mutable socket socket_; /* which has no const native_handle() */
    ssl_session session_;
    asio::steady_timer read_timer_;
    asio::steady_timer send_timer_;
    std::vector<unsigned char> held_; /* received; the first taken_ bytes are done with */
    std::size_t taken_ = 0;
    std::uint64_t received_ = 0;
    std::string why_;
    unsigned reads_ = 0; /* since it has waited */
    bool ended_ = false;
    bool stopped_ = false; /* a fill() has to return */
};

#endif
