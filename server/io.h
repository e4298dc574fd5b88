/*
 * What the server's coroutines are made of. There is one thread: whatever is written between two co_awaits happens at
 * once, and nothing needs a lock.
 *
 * GCC 12 is wrong about a co_await that is part of a condition with && or ||, or that is given an aggregate or a list
 * made in place: each is the whole of a statement, or of an initializer.
 */
#ifndef SERVER_IO_H
#define SERVER_IO_H

#include <asio/awaitable.hpp>
#include <asio/co_spawn.hpp>
#include <asio/detached.hpp>
#include <asio/io_context.hpp>
#include <asio/redirect_error.hpp>
#include <asio/steady_timer.hpp>
#include <asio/use_awaitable.hpp>

#include <chrono>
#include <utility>

template <class T> using task = asio::awaitable<T>;

using server_clock = std::chrono::steady_clock;

/* How a coroutine waits for an operation: its error is stored, not thrown. */
inline auto await_into(asio::error_code &error)
{
    return asio::redirect_error(asio::use_awaitable, error);
}

/* Runs a coroutine beside all others. Nothing here throws, so whatever comes out of one ends the process. */
template <class T> void run_beside(asio::io_context &io, task<T> work)
{
    asio::co_spawn(io, std::move(work), [](const std::exception_ptr &failure, auto &&...) {
        if (failure)
            std::rethrow_exception(failure);
    });
}

/* Something that one coroutine waits for and others bring about. */
class wake_up
{
public:
    explicit wake_up(asio::io_context &io) : timer_(io) {}

    void set()
    {
        is_set_ = true;
        timer_.cancel();
    }
    void reset() { is_set_ = false; }
    bool is_set() const { return is_set_; }

    /* Changes until when a wait that is under way goes on. */
    void wait_no_longer_than(server_clock::time_point end)
    {
        end_ = end;
        timer_.cancel();
    }

    /* Whether it is set, which is waited for until `end`. */
    task<bool> wait(server_clock::time_point end = server_clock::time_point::max())
    {
        end_ = end;
        while (!is_set_ && server_clock::now() < end_) {
            asio::error_code cancelled;
            timer_.expires_at(end_);
            co_await timer_.async_wait(await_into(cancelled));
        }
        co_return is_set_;
    }

private:
    asio::steady_timer timer_;
    server_clock::time_point end_{};
    bool is_set_ = false;
};

#endif
