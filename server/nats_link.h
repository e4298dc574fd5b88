/*
 * The connection to the message bus, NATS, by its C library. That has threads of its own and may wait: what it reports is
 * posted to the server's thread, and whatever can wait is done by threads of the link's. It lives as long as the process.
 */
#ifndef SERVER_NATS_LINK_H
#define SERVER_NATS_LINK_H

#include "server/io.h"

#include <asio/thread_pool.hpp>
#include <atomic>
#include <functional>
#include <memory>
#include <nats/nats.h>
#include <optional>
#include <string>
#include <vector>

/* What the library gives away, owned. */
template <auto destroy> struct nats_deleter {
    template <class T> void operator()(T *object) const { destroy(object); }
};
using nats_message_ptr = std::unique_ptr<natsMsg, nats_deleter<natsMsg_Destroy>>;
using nats_options_ptr = std::unique_ptr<natsOptions, nats_deleter<natsOptions_Destroy>>;
using nats_connection_ptr = std::unique_ptr<natsConnection, nats_deleter<natsConnection_Destroy>>;
using nats_stream_ptr = std::unique_ptr<jsCtx, nats_deleter<jsCtx_Destroy>>;
using nats_bucket_ptr = std::unique_ptr<kvStore, nats_deleter<kvStore_Destroy>>;
using nats_entry_ptr = std::unique_ptr<kvEntry, nats_deleter<kvEntry_Destroy>>;

/* The header that a record's id is in. */
constexpr char kMessageId[] = "Nats-Msg-Id";

struct nats_settings {
    std::vector<std::string> urls;
    std::string name;        /* of this client */
    std::string credentials; /* a file; empty: the URL has them, or none are wanted */
    std::string ca;          /* a PEM file; empty: no TLS, unless the URL says so */
};

/* One connection, which the library makes again whenever it is lost, and its JetStream. Any thread may use it. */
struct nats_session {
    nats_connection_ptr connection;
    nats_stream_ptr stream;
};

/* Makes something of JetStream's with three replicas, or one where NATS is no cluster; whether it is there. While a cluster
 * is not complete it is not. */
template <class Make> bool nats_make_replicated(Make make)
{
    if (make(3) == NATS_OK)
        return true;
    const bool is_alone = std::string(nats_GetLastError(nullptr)).find("non-clustered") != std::string::npos;
    return is_alone && make(1) == NATS_OK;
}

struct nats_message {
    std::string subject, reply, data;
};

class nats_link;

/* What comes for a subject, for as long as this lives. */
class nats_subscription
{
public:
    ~nats_subscription();

private:
    friend class nats_link;
    struct held; /* what the library knows of it */

    nats_link *link_ = nullptr;
    std::string subject_, queue_;
    std::function<void(const nats_message &)> receive_;
    std::shared_ptr<held> held_;
};

class nats_link
{
public:
    /* Told on the server's thread: whether there is a connection, whenever that changes; whether JetStream has a record, or
     * else why not. */
    struct listener {
        std::function<void(bool connected, const std::string &why)> changed;
        std::function<void(const std::string &subject, const std::string &id, const std::string &why)> kept;
    };

    /* None, and why, when the settings can't be used. Otherwise it connects by itself, for as long as it takes. */
    static std::unique_ptr<nats_link> open(asio::io_context &io, nats_settings settings, listener told,
                                           std::string &why);
    nats_link(const nats_link &) = delete;

    bool connected() const { return connected_; }

    /* Sends, if there is a connection; nobody is told when it gets lost. */
    void publish(std::string subject, std::string data);
    /* Has JetStream keep a record, which it knows by its `id` if it should come twice. False when that can't be tried. */
    bool keep(std::string subject, std::string id, std::string data);
    /* With a queue's name, one of those who have the same gets each message. */
    std::shared_ptr<nats_subscription> subscribe(std::string subject, std::string queue,
                                                 std::function<void(const nats_message &)> receive);
    /* The answer to a request; none when nobody gives one in that time. */
    task<std::optional<std::string>> request(std::string subject, std::string data, std::chrono::milliseconds limit);

    /* Has a procedure that may wait called by another thread, with the session: what it returns, or T() without a
     * connection. */
    template <class T> task<T> run(std::function<T(nats_session &)> procedure)
    {
        const std::shared_ptr<nats_session> session = session_;
        if (session == nullptr)
            co_return T();
        auto call = [](std::shared_ptr<nats_session> with, std::function<T(nats_session &)> what) -> task<T> {
            co_return what(*with);
        };
        co_return co_await asio::co_spawn(workers_, call(session, std::move(procedure)), asio::use_awaitable);
    }

private:
    friend class nats_subscription;

    nats_link(asio::io_context &io, listener told) : io_(io), listener_(std::move(told)) {}
    bool prepare(const nats_settings &settings, std::string &why);
    void connect();
    void connected(std::shared_ptr<nats_session> session, const std::string &why);
    void change(bool connected, std::string why);
    bool send(std::function<void(nats_session &)> what);
    void hold(const std::shared_ptr<nats_subscription> &subscription);
    void post(const std::weak_ptr<nats_subscription> &to, nats_message message);

    static void on_connect(natsConnection *connection, void *link);
    static void on_disconnect(natsConnection *connection, void *link);
    static void on_closed(natsConnection *connection, void *link);
    static void on_message(natsConnection *connection, natsSubscription *from, natsMsg *message, void *held);
    static void on_kept(jsCtx *stream, natsMsg *message, jsPubAck *good, jsPubAckErr *bad, void *link);

    asio::io_context &io_;
    const listener listener_;
    nats_options_ptr options_;
    std::shared_ptr<nats_session> session_; /* none until the library has tried to connect */
    bool connected_ = false;
    std::vector<std::weak_ptr<nats_subscription>> subscriptions_;
    std::atomic<unsigned> sending_ = 0;   /* jobs that wait for the sender */
    std::atomic<unsigned> receiving_ = 0; /* messages that wait for the server's thread */
    asio::thread_pool sender_{1};         /* in order */
    asio::thread_pool workers_{4};
};

#endif
