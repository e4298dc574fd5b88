#include "server/frame_link.h"

#include "tools/tls_context.h"

#include <algorithm>
#include <array>
#include <asio/post.hpp>
#include <cstring>
#include <netdb.h>

namespace
{

constexpr auto kSendMax = std::chrono::seconds(60);
constexpr std::size_t kReadMax = 65536;
constexpr unsigned kReadsAtOnce = 4; /* of a peer that has always more, before it is somebody else's turn */
constexpr std::size_t kKept = 4096;  /* bytes of room that a link keeps while it says nothing */

/* Where bytes are received: every link's, as nobody waits while something is in it. */
std::array<unsigned char, kReadMax> g_piece;

void put_u32(std::string &out, std::size_t value)
{
    for (const int shift : {24, 16, 8, 0})
        out += static_cast<char>(value >> shift & 0xff);
}

/* Whether the bytes can be the start of a frame. */
bool may_be_frame(std::span<const unsigned char> held, const log_pkg_header &header)
{
    return std::equal(held.begin(), held.begin() + static_cast<std::ptrdiff_t>(std::min(held.size(), kPkgTagLen)),
                      PKG_HEAD) &&
           header.control_len <= kPkgControlMax && header.data_len <= kPkgDataMax;
}

} // namespace

std::string make_frame(std::string_view control, std::string_view data)
{
    std::string out;
    out.reserve(kPkgMin + control.size() + data.size());
    out += PKG_HEAD;
    put_u32(out, control.size());
    out += control;
    put_u32(out, data.size());
    out += data;
    out += PKG_TAIL;
    return out;
}

frame_link::frame_link(socket connected, ssl_session session)
    : socket_(std::move(connected)), session_(std::move(session)), read_timer_(socket_.get_executor()),
      send_timer_(socket_.get_executor())
{
    asio::error_code ignored;
    socket_.non_blocking(true, ignored);
    if (session_)
        SSL_set_fd(session_.get(), socket_.native_handle());
}

frame_link::~frame_link()
{
    end("");
}

/* Waits until an operation can go on that failed with `error`: SSL_get_error()'s, or as poll() names what it waits for. */
task<bool> frame_link::wait_for(int error)
{
    asio::error_code failure;
    if (ended_)
        co_return false;
    reads_ = 0;
    co_await socket_.async_wait(error == SSL_ERROR_WANT_WRITE ? socket::wait_write : socket::wait_read,
                                await_into(failure));
    co_return !ended_ && !stopped_;
}

task<bool> frame_link::shake_hands()
{
    const auto alive = shared_from_this();
    while (session_ && !ended_) {
        ERR_clear_error();
        const int result = SSL_do_handshake(session_.get());
        if (result == 1)
            co_return true;
        const int error = SSL_get_error(session_.get(), result);
        if (error != SSL_ERROR_WANT_READ && error != SSL_ERROR_WANT_WRITE) {
            const long verified = SSL_get_verify_result(session_.get());
            end(verified != X509_V_OK
                    ? std::string("its certificate is not accepted: ") + X509_verify_cert_error_string(verified)
                    : "no TLS session: " + tls_last_error("hung up"));
        } else {
            const bool ready = co_await wait_for(error);
            if (!ready)
                break;
        }
    }
    co_return !ended_;
}

/* As recv(), over TLS or not: bytes; 0 at the end of the link, which has ended then; -SSL_ERROR_WANT_... */
ssize_t frame_link::read_some(std::span<unsigned char> into)
{
    if (session_) {
        ERR_clear_error();
        const int n = SSL_read(session_.get(), into.data(), static_cast<int>(into.size()));
        if (n > 0)
            return n;
        const int error = SSL_get_error(session_.get(), n);
        if (error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE)
            return -error;
        end(error == SSL_ERROR_ZERO_RETURN ? "it hung up" : "the TLS session broke: " + tls_last_error("hung up"));
        return 0;
    }
    const ssize_t n = recv(socket_.native_handle(), into.data(), into.size(), 0);
    if (n > 0)
        return n;
    if (n < 0 && (errno == EAGAIN || errno == EINTR))
        return -SSL_ERROR_WANT_READ;
    end(n == 0 ? "it hung up" : std::strerror(errno));
    return 0;
}

/* Lets all others that can go on do so, if this link has had its share. */
task<void> frame_link::be_fair()
{
    if (++reads_ < kReadsAtOnce)
        co_return;
    reads_ = 0;
    co_await asio::post(socket_.get_executor(), asio::use_awaitable);
}

task<bool> frame_link::fill()
{
    const auto alive = shared_from_this();
    stopped_ = false;
    co_await be_fair();
    held_.erase(held_.begin(), held_.begin() + static_cast<std::ptrdiff_t>(taken_));
    taken_ = 0;
    if (held_.empty() && held_.capacity() > kKept)
        std::vector<unsigned char>().swap(held_);
    while (!ended_ && !stopped_) {
        const ssize_t n = read_some(g_piece);
        if (n > 0) {
            received_ += static_cast<std::uint64_t>(n);
            held_.insert(held_.end(), g_piece.data(), g_piece.data() + n);
            co_return true;
        }
        const bool ready = co_await wait_for(static_cast<int>(-n));
        if (!ready)
            break;
    }
    co_return false;
}

std::optional<frame_view> frame_link::take()
{
    const std::span<const unsigned char> held(held_.data() + taken_, held_.size() - taken_);
    if (held.empty())
        return std::nullopt;
    const log_pkg_header header = log_pkg_read_header(held.data(), held.size());
    if (!may_be_frame(held, header)) {
        end("what it sends is no frame");
        return std::nullopt;
    }
    if (!header.has_data_len || held.size() < header.frame_len())
        return std::nullopt;
    const std::span<const unsigned char> bytes = held.first(static_cast<std::size_t>(header.frame_len()));
    if (std::memcmp(bytes.data() + bytes.size() - kPkgTagLen, PKG_TAIL, kPkgTagLen) != 0) {
        end("what it sends is no frame");
        return std::nullopt;
    }
    taken_ += bytes.size();
    return frame_view{{reinterpret_cast<const char *>(bytes.data()) + kPkgControlAt, header.control_len},
                      bytes.subspan(kPkgControlAt + header.control_len + 4, header.data_len),
                      bytes};
}

task<std::optional<frame_view>> frame_link::receive()
{
    for (;;) {
        const std::optional<frame_view> frame = take();
        if (frame)
            co_return frame;
        const bool more = co_await fill();
        if (!more)
            co_return std::nullopt;
    }
}

task<std::string_view> frame_link::read()
{
    const auto alive = shared_from_this();
    stopped_ = false;
    co_await be_fair();
    if (held() > 0) {
        const std::string_view rest(reinterpret_cast<const char *>(held_.data()) + taken_, held_.size() - taken_);
        taken_ = held_.size();
        co_return rest;
    }
    while (!ended_ && !stopped_) {
        const ssize_t n = read_some(g_piece);
        if (n > 0) {
            received_ += static_cast<std::uint64_t>(n);
            co_return std::string_view(reinterpret_cast<const char *>(g_piece.data()), static_cast<std::size_t>(n));
        }
        const bool ready = co_await wait_for(static_cast<int>(-n));
        if (!ready)
            break;
    }
    co_return std::string_view();
}

task<bool> frame_link::send(std::span<const unsigned char> bytes)
{
    const auto alive = shared_from_this();
    while (!bytes.empty() && !ended_) {
        ssize_t n = 0;
        int error = SSL_ERROR_WANT_WRITE;
        if (session_) {
            ERR_clear_error();
            n = SSL_write(session_.get(), bytes.data(), static_cast<int>(bytes.size()));
            error = n > 0 ? SSL_ERROR_NONE : SSL_get_error(session_.get(), static_cast<int>(n));
        } else {
            n = ::send(socket_.native_handle(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
            if (n < 0 && errno != EAGAIN && errno != EINTR)
                error = SSL_ERROR_SYSCALL;
        }
        if (n > 0)
            bytes = bytes.subspan(static_cast<std::size_t>(n));
        else if (error != SSL_ERROR_WANT_WRITE && error != SSL_ERROR_WANT_READ)
            end(session_ ? "the TLS session broke: " + tls_last_error("hung up") : std::strerror(errno));
        else {
            end_after(send_timer_, kSendMax, "it takes nothing");
            co_await wait_for(error);
            send_timer_.cancel();
        }
    }
    co_return !ended_;
}

task<bool> frame_link::send(std::string_view bytes)
{
    return send(std::span(reinterpret_cast<const unsigned char *>(bytes.data()), bytes.size()));
}

std::string frame_link::address_of(decltype(getsockname) *which) const
{
    sockaddr_storage address{};
    socklen_t len = sizeof address;
    char host[NI_MAXHOST] = {};
    which(socket_.native_handle(), reinterpret_cast<sockaddr *>(&address), &len);
    if (address.ss_family == AF_UNIX)
        return "local";
    getnameinfo(reinterpret_cast<const sockaddr *>(&address), len, host, sizeof host, nullptr, 0, NI_NUMERICHOST);
    const std::string_view text = host;
    return std::string(text.starts_with("::ffff:") ? text.substr(7) : text);
}

void frame_link::end_after(asio::steady_timer &timer, server_clock::duration time, const char *why)
{
    timer.expires_after(time);
    timer.async_wait([link = weak_from_this(), why](asio::error_code cancelled) {
        if (const auto self = link.lock(); self && !cancelled)
            self->end(why);
    });
}

void frame_link::stop_waiting()
{
    stopped_ = true;
    asio::error_code ignored;
    socket_.cancel(ignored);
}

void frame_link::end(std::string_view why)
{
    if (ended_)
        return;
    ended_ = true;
    why_ = why;
    read_timer_.cancel();
    send_timer_.cancel();
    if (session_ && SSL_is_init_finished(session_.get()) == 1) {
        ERR_clear_error();
        SSL_shutdown(session_.get()); /* close_notify, as far as the socket takes it at once */
        ERR_clear_error();
    }
    asio::error_code ignored;
    socket_.shutdown(socket::shutdown_both, ignored);
    socket_.cancel(ignored); /* closed with the link: its number must not be another's while somebody waits */
}
