#include "tools/tool_link.h"

#include "tools/tool_answer.h"
#include "tools/tool_log.h"
#include "tools/tool_wait.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <sys/socket.h>

namespace
{

struct address_list_deleter {
    void operator()(addrinfo *list) const { freeaddrinfo(list); }
};

constexpr char kInterrupted[] = "interrupted";

using address_list = std::unique_ptr<addrinfo, address_list_deleter>;

/* Waits until the socket is ready for `events`; false, and `why` where it is not the time, when it is not. */
bool wait_ready(int fd, short events, tool_clock::time_point end, std::string &why)
{
    pollfd entry{fd, events, 0};
    const tool_wait event = tool_wait_for({&entry, 1}, end);
    if (event == tool_wait::interrupted)
        why = kInterrupted;
    return event == tool_wait::ready;
}

/* A connected non-blocking socket to one address; none on failure, and the error's text unless it was the time. */
unique_fd connect_one(const addrinfo &address, tool_clock::time_point end, std::string &error)
{
    unique_fd sock{socket(address.ai_family, address.ai_socktype | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    int failure = 0;
    if (!sock || (connect(sock.get(), address.ai_addr, address.ai_addrlen) != 0 && errno != EINPROGRESS)) {
        failure = errno;
    } else if (!wait_ready(sock.get(), POLLOUT, end, error)) {
        return {};
    } else {
        socklen_t len = sizeof failure;
        getsockopt(sock.get(), SOL_SOCKET, SO_ERROR, &failure, &len);
    }
    if (failure == 0)
        return sock;
    error = std::strerror(failure);
    return {};
}

/* Why a connection ended before the answer was there. */
std::string ended(const tool_link &link, const std::string &how)
{
    return "the connection to " + link.where + " ended before the answer was there: " + how +
           (link.server
                ? ". Why it ended is in the server's own log"
                : ". The device serves one log tool at a time, so another one may have taken it over; if not, "
                  "try again and look at the device's own log");
}

/* What to say of a device that sent nothing for so long. */
std::string silent(const tool_link &link, std::chrono::milliseconds limit, bool answer)
{
    const std::string fact = link.where + " sent nothing for " + tool_seconds(limit);
    if (answer)
        return fact +
               ". Either it is still at work, then try again with a larger --reply-timeout, or it does not know the "
               "command: such a one it leaves unanswered";
    return fact + " in the middle of an answer. Try again, or with a larger --stall-timeout";
}

/* Length of the frame that the held bytes begin with, 0 while that cannot be said; nothing when they are none. */
std::optional<std::size_t> frame_length(const std::vector<unsigned char> &held)
{
    if (!std::equal(held.begin(), held.begin() + static_cast<std::ptrdiff_t>(std::min(held.size(), kPkgTagLen)),
                    PKG_HEAD))
        return std::nullopt;
    const log_pkg_header header = log_pkg_read_header(held.data(), held.size());
    if (header.control_len > kPkgControlMax || header.data_len >= kPkgDataMax)
        return std::nullopt;
    return header.has_data_len ? static_cast<std::size_t>(header.frame_len()) : 0;
}

/* Takes the frame of `len` bytes off the held bytes. */
std::optional<tool_frame> take_frame(tool_link &link, std::size_t len)
{
    log_msg *const msg = link.msg.get();
    log_msg_clear(msg);
    if (log_decode_msg(link.held.data(), len, msg) != 0)
        return std::nullopt;
    link.held.erase(link.held.begin(), link.held.begin() + static_cast<std::ptrdiff_t>(len));
    return tool_frame{{msg->control, static_cast<std::size_t>(msg->controlLen)},
                      {msg->data, static_cast<std::size_t>(msg->dataLen)}};
}

/* As recv(), over TLS or not; with EAGAIN, `wanted` says what to wait for. */
ssize_t read_link(const tool_link &link, std::span<unsigned char> bytes, short &wanted)
{
    wanted = POLLIN;
    if (!link.session)
        return recv(link.fd.get(), bytes.data(), bytes.size(), 0);
    ERR_clear_error();
    errno = 0;
    const int n = SSL_read(link.session.get(), bytes.data(), static_cast<int>(bytes.size()));
    return tool_tls_result(link.session.get(), n, wanted);
}

/* As send(), in the same way. */
ssize_t write_link(const tool_link &link, std::span<const unsigned char> bytes, short &wanted)
{
    wanted = POLLOUT;
    if (!link.session)
        return send(link.fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    ERR_clear_error();
    errno = 0;
    const int n = SSL_write(link.session.get(), bytes.data(), static_cast<int>(bytes.size()));
    return tool_tls_result(link.session.get(), n, wanted);
}

/* Takes more bytes and holds them; false when there are none, and `why` when there will be none. */
bool take_some(tool_link &link, short &wanted, std::string &why)
{
    unsigned char piece[65536];
    const ssize_t n = read_link(link, piece, wanted);
    if (n > 0)
        link.held.insert(link.held.end(), piece, piece + n);
    else if (n == 0 || (errno != EAGAIN && errno != EINTR))
        why = ended(link, n == 0 ? (link.server ? "the server closed it" : "the device closed it")
                                 : std::strerror(errno));
    return n > 0;
}

/* Waits for more bytes and holds them; false, and why, when none come. */
bool receive_some(tool_link &link, std::chrono::milliseconds first, std::string &why)
{
    const bool answer = link.held.empty() && first == link.limits.reply;
    const auto limit = link.held.empty() ? first : link.limits.stall;
    const auto end = tool_clock::now() + limit;
    for (;;) {
        short wanted = 0;
        std::string lost;
        if (take_some(link, wanted, lost))
            return true;
        if (!lost.empty()) {
            why = lost;
            return false;
        }
        std::string interrupt;
        if (wait_ready(link.fd.get(), wanted, end, interrupt))
            continue;
        why = !interrupt.empty() ? interrupt : silent(link, limit, answer);
        return false;
    }
}

/* The frame that the held bytes begin with, if it is whole. `none`, and why, when there will be none: what came is no
 * frame, or the server's word that the device is gone. */
std::optional<tool_frame> held_frame(tool_link &link, bool &none, std::string &why)
{
    const std::optional<std::size_t> len = frame_length(link.held);
    if (len && (*len == 0 || link.held.size() < *len))
        return std::nullopt;
    std::optional<tool_frame> frame = len ? take_frame(link, *len) : std::nullopt;
    none = !frame;
    if (!frame) {
        why = "what " + link.where + " sent is not a frame. Is it a " +
              (link.server ? "log server?" : "device's log daemon that listens there?");
        return std::nullopt;
    }
    tool_log_frame("received", frame->control, frame->data.size());
    if (link.server && link.with_device && tool_msgid(frame->control) == "device") {
        none = true;
        why = "the log server says: " + tool_answer_text(tool_read_answer(frame->control, "device"), nullptr, "Result");
        return std::nullopt;
    }
    return frame;
}

} // namespace

std::optional<tool_link> tool_connect(const std::string &host, const std::string &port, const tool_limits &limits,
                                      const char *advice, std::string &why)
{
    const std::string where = host + " port " + port;
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo *found = nullptr;
    if (const int code = getaddrinfo(host.c_str(), port.c_str(), &hints, &found); code != 0) {
        why = "cannot find " + where + ": " + gai_strerror(code) + ". Check --host and --port";
        return std::nullopt;
    }
    const address_list addresses{found};
    long left = 0; /* addresses to try: each gets its share of the time that is left */
    for (const addrinfo *at = addresses.get(); at != nullptr; at = at->ai_next)
        ++left;
    const auto end = tool_clock::now() + limits.connect;
    std::string error;
    for (const addrinfo *at = addresses.get(); at != nullptr; at = at->ai_next, --left) {
        error = "no answer within " + tool_seconds(limits.connect);
        unique_fd sock = connect_one(*at, tool_clock::now() + (end - tool_clock::now()) / left, error);
        if (!sock)
            continue;
        const int on = 1;
        setsockopt(sock.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
        tool_set_keepalive(sock.get());
        return tool_link{.fd = std::move(sock), .where = where, .limits = limits, .held = {}};
    }
    why = error == kInterrupted ? error : "cannot connect to " + where + ": " + error + advice;
    return std::nullopt;
}

void tool_set_keepalive(int fd)
{
    const std::pair<int, int> settings[] = {{TCP_KEEPIDLE, 60}, {TCP_KEEPINTVL, 10}, {TCP_KEEPCNT, 3}};
    const int on = 1;
    setsockopt(fd, SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
    for (const auto &[name, value] : settings)
        setsockopt(fd, IPPROTO_TCP, name, &value, sizeof value);
}

std::string tool_address(int fd, decltype(getsockname) *end)
{
    sockaddr_storage address{};
    socklen_t len = sizeof address;
    char host[NI_MAXHOST] = {};
    end(fd, reinterpret_cast<sockaddr *>(&address), &len);
    getnameinfo(reinterpret_cast<const sockaddr *>(&address), len, host, sizeof host, nullptr, 0, NI_NUMERICHOST);
    const std::string text = host;
    return text.starts_with("::ffff:") ? text.substr(7) : text;
}

bool tool_send(tool_link &link, const std::string &control, std::span<const unsigned char> data, std::string &why)
{
    tool_log_frame("sent", control, data.size());
    std::vector<unsigned char> frame(kPkgSendBuf);
    auto len = static_cast<std::int32_t>(frame.size());
    const void *const bytes = data.empty() ? "" : static_cast<const void *>(data.data());
    log_msg_clear(link.msg.get());
    if (log_encode_fill_msg(control.c_str(), bytes, static_cast<std::int32_t>(data.size()), link.msg.get()) != 0 ||
        log_encode_pkg_buf(frame.data(), &len, link.msg.get()) != 0) {
        why = "the command is too long for a frame";
        return false;
    }
    for (std::span<const unsigned char> left(frame.data(), static_cast<std::size_t>(len)); !left.empty();) {
        short wanted = 0;
        const ssize_t n = write_link(link, left, wanted);
        if (n > 0) {
            left = left.subspan(static_cast<std::size_t>(n));
        } else if (n == 0 || (errno != EAGAIN && errno != EINTR)) {
            why = ended(link, std::strerror(errno));
            return false;
        } else if (!wait_ready(link.fd.get(), wanted, tool_clock::now() + link.limits.stall, why)) {
            if (why.empty())
                why = link.where + " took nothing for " + tool_seconds(link.limits.stall) +
                      ". It may be busy with another command: try again with a larger --stall-timeout";
            return false;
        }
    }
    return true;
}

std::optional<tool_frame> tool_receive(tool_link &link, std::chrono::milliseconds first, std::string &why)
{
    bool none = false;
    for (;;) {
        if (std::optional<tool_frame> frame = held_frame(link, none, why); frame || none)
            return frame;
        if (!receive_some(link, first, why))
            return std::nullopt;
    }
}

std::optional<tool_frame> tool_receive_now(tool_link &link, short &wanted, std::string &why)
{
    bool none = false;
    for (;;) {
        if (std::optional<tool_frame> frame = held_frame(link, none, why); frame || none)
            return frame;
        if (!take_some(link, wanted, why))
            return std::nullopt;
    }
}

ssize_t tool_read_some(tool_link &link, std::span<unsigned char> bytes, short &wanted)
{
    if (link.held.empty())
        return read_link(link, bytes, wanted);
    const std::size_t n = std::min(bytes.size(), link.held.size());
    std::copy_n(link.held.begin(), n, bytes.begin());
    link.held.erase(link.held.begin(), link.held.begin() + static_cast<std::ptrdiff_t>(n));
    return static_cast<ssize_t>(n);
}

bool tool_still_there(tool_link &link)
{
    unsigned char byte = 0;
    short wanted = 0;
    return read_link(link, {&byte, 1}, wanted) < 0 && (errno == EAGAIN || errno == EINTR);
}
