#include "server/nats_link.h"

#include <asio/post.hpp>

namespace
{

using namespace std::chrono_literals;

/* What the library waits for, in ms. */
constexpr int64_t kConnectMax = 2000;
constexpr int64_t kWriteMax = 5000;
constexpr int64_t kPing = 5000; /* twice without an answer, and the connection is lost */
constexpr int64_t kReconnect = 500;
constexpr int64_t kAskMax = 2000;         /* for JetStream to answer */
constexpr int64_t kAcknowledgeMax = 5000; /* for it to keep a record */

constexpr auto kAgainAfter = 5s;         /* when the library has given up: it was refused twice, say */
constexpr unsigned kWaitingMost = 20000; /* jobs, and messages: what comes beyond them is lost */

} // namespace

struct nats_subscription::held {
    ~held() { natsSubscription_Destroy(subscription); }

    nats_link *link = nullptr;
    std::weak_ptr<nats_subscription> owner;
    natsSubscription *subscription = nullptr; /* used by the sender only */
};

nats_subscription::~nats_subscription()
{
    link_->send([held = held_](nats_session &) { natsSubscription_Unsubscribe(held->subscription); });
}

std::unique_ptr<nats_link> nats_link::open(asio::io_context &io, nats_settings settings, listener told,
                                           std::string &why)
{
    std::unique_ptr<nats_link> link(new nats_link(io, std::move(told)));
    if (!link->prepare(settings, why))
        return nullptr;
    link->connect();
    return link;
}

bool nats_link::prepare(const nats_settings &settings, std::string &why)
{
    natsOptions *made = nullptr;
    natsStatus status = natsOptions_Create(&made);
    options_.reset(made);
    std::vector<const char *> urls;
    for (const std::string &url : settings.urls)
        urls.push_back(url.c_str());
    const auto set = [&status](natsStatus next) { status = status == NATS_OK ? next : status; };
    set(natsOptions_SetServers(made, urls.data(), static_cast<int>(urls.size())));
    set(natsOptions_SetName(made, settings.name.c_str()));
    set(natsOptions_SetTimeout(made, kConnectMax));
    set(natsOptions_SetWriteDeadline(made, kWriteMax));
    set(natsOptions_SetPingInterval(made, kPing));
    set(natsOptions_SetMaxPingsOut(made, 2));
    set(natsOptions_SetMaxReconnect(made, -1));
    set(natsOptions_SetReconnectWait(made, kReconnect));
    set(natsOptions_SetReconnectBufSize(made, 0)); /* what was not sent is known best here */
    set(natsOptions_SetFailRequestsOnDisconnect(made, true));
    set(natsOptions_UseGlobalMessageDelivery(made, true)); /* else each subscription has a thread */
    set(natsOptions_SetRetryOnFailedConnect(made, true, on_connect, this));
    set(natsOptions_SetReconnectedCB(made, on_connect, this));
    set(natsOptions_SetDisconnectedCB(made, on_disconnect, this));
    set(natsOptions_SetClosedCB(made, on_closed, this));
    if (!settings.credentials.empty())
        set(natsOptions_SetUserCredentialsFromFiles(made, settings.credentials.c_str(), nullptr));
    if (!settings.ca.empty()) {
        set(natsOptions_SetSecure(made, true));
        set(natsOptions_LoadCATrustedCertificates(made, settings.ca.c_str()));
    }
    if (status != NATS_OK)
        why = std::string("cannot use NATS as it was asked for: ") + nats_GetLastError(nullptr);
    return status == NATS_OK;
}

/* Has the library connect, and go on until it has. */
void nats_link::connect()
{
    asio::post(workers_, [this] {
        auto session = std::make_shared<nats_session>();
        natsConnection *connection = nullptr;
        const natsStatus status = natsConnection_Connect(&connection, options_.get());
        session->connection.reset(connection);
        const char *reason = nullptr;
        natsConnection_GetLastError(connection, &reason);
        const std::string why = reason != nullptr && *reason != '\0' ? reason : natsStatus_GetText(status);
        jsOptions options;
        jsOptions_Init(&options);
        options.Wait = kAskMax;
        options.PublishAsync.AckHandler = on_kept;
        options.PublishAsync.AckHandlerClosure = this;
        jsCtx *stream = nullptr;
        if (connection != nullptr)
            natsConnection_JetStream(&stream, connection, &options);
        session->stream.reset(stream);
        asio::post(io_, [this, session, why] { connected(session, why); });
    });
}

void nats_link::connected(std::shared_ptr<nats_session> session, const std::string &why)
{
    if (session->stream == nullptr || natsConnection_Status(session->connection.get()) != NATS_CONN_STATUS_CONNECTED)
        listener_.changed(false, why);
    if (session->stream == nullptr) {
        on_closed(nullptr, this);
        return;
    }
    session_ = std::move(session);
    for (const auto &subscription : subscriptions_)
        if (const auto owner = subscription.lock())
            hold(owner);
    if (natsConnection_Status(session_->connection.get()) == NATS_CONN_STATUS_CONNECTED)
        change(true, "");
}

void nats_link::change(bool connected, std::string why)
{
    if (connected == connected_ || (connected && session_ == nullptr))
        return;
    connected_ = connected;
    listener_.changed(connected, why);
}

void nats_link::on_connect(natsConnection *, void *link)
{
    auto *const self = static_cast<nats_link *>(link);
    asio::post(self->io_, [self] { self->change(true, ""); });
}

void nats_link::on_disconnect(natsConnection *connection, void *link)
{
    auto *const self = static_cast<nats_link *>(link);
    const char *text = nullptr;
    natsConnection_GetLastError(connection, &text);
    asio::post(self->io_, [self, why = std::string(text != nullptr ? text : "")] { self->change(false, why); });
}

/* The library has given up. The connection is made once more, with all that is subscribed to. */
void nats_link::on_closed(natsConnection *connection, void *link)
{
    on_disconnect(connection, link);
    auto *const self = static_cast<nats_link *>(link);
    asio::post(self->io_, [self] {
        self->session_.reset();
        const auto pause = std::make_shared<asio::steady_timer>(self->io_, kAgainAfter);
        pause->async_wait([self, pause](asio::error_code) { self->connect(); });
    });
}

/* Has something done by the sender, in order. */
bool nats_link::send(std::function<void(nats_session &)> what)
{
    if (session_ == nullptr || sending_ > kWaitingMost)
        return false;
    ++sending_;
    asio::post(sender_, [this, session = session_, what = std::move(what)] {
        what(*session);
        --sending_;
    });
    return true;
}

void nats_link::publish(std::string subject, std::string data)
{
    if (connected_)
        send([subject = std::move(subject), data = std::move(data)](nats_session &session) {
            natsConnection_Publish(session.connection.get(), subject.c_str(), data.data(),
                                   static_cast<int>(data.size()));
        });
}

bool nats_link::keep(std::string subject, std::string id, std::string data)
{
    return send([this, subject = std::move(subject), id = std::move(id),
                 data = std::move(data)](nats_session &session) {
        jsPubOptions options;
        jsPubOptions_Init(&options);
        options.MsgId = id.c_str();
        options.MaxWait = kAcknowledgeMax;
        natsMsg *message = nullptr;
        natsStatus status =
            natsMsg_Create(&message, subject.c_str(), nullptr, data.data(), static_cast<int>(data.size()));
        if (status == NATS_OK)
            status = js_PublishMsgAsync(session.stream.get(), &message, &options);
        natsMsg_Destroy(message);
        if (status != NATS_OK)
            asio::post(io_, [this, subject, id, status] { listener_.kept(subject, id, natsStatus_GetText(status)); });
    });
}

void nats_link::on_kept(jsCtx *, natsMsg *message, jsPubAck *, jsPubAckErr *bad, void *link)
{
    auto *const self = static_cast<nats_link *>(link);
    const nats_message_ptr owned(message);
    const char *id = "";
    natsMsgHeader_Get(message, kMessageId, &id);
    std::string why;
    if (bad != nullptr)
        why = bad->ErrText != nullptr && *bad->ErrText != '\0' ? bad->ErrText : natsStatus_GetText(bad->Err);
    asio::post(self->io_, [self, subject = std::string(natsMsg_GetSubject(message)), known = std::string(id), why] {
        self->listener_.kept(subject, known, why);
    });
}

std::shared_ptr<nats_subscription> nats_link::subscribe(std::string subject, std::string queue,
                                                        std::function<void(const nats_message &)> receive)
{
    std::erase_if(subscriptions_, [](const auto &subscription) { return subscription.expired(); });
    const auto made = std::make_shared<nats_subscription>();
    made->link_ = this;
    made->subject_ = std::move(subject);
    made->queue_ = std::move(queue);
    made->receive_ = std::move(receive);
    subscriptions_.push_back(made);
    hold(made);
    return made;
}

/* Makes a subscription known to the library. */
void nats_link::hold(const std::shared_ptr<nats_subscription> &subscription)
{
    const auto held = std::make_shared<nats_subscription::held>();
    held->link = this;
    held->owner = subscription;
    subscription->held_ = held;
    send([held, subject = subscription->subject_, queue = subscription->queue_](nats_session &session) {
        auto *const closure = new std::shared_ptr(held); /* the library's, until it says that it is done with it */
        natsConnection *const connection = session.connection.get();
        const natsStatus status =
            queue.empty()
                ? natsConnection_Subscribe(&held->subscription, connection, subject.c_str(), on_message, closure)
                : natsConnection_QueueSubscribe(&held->subscription, connection, subject.c_str(), queue.c_str(),
                                                on_message, closure);
        if (status != NATS_OK) {
            delete closure;
            return;
        }
        natsSubscription_SetOnCompleteCB(
            held->subscription,
            [](void *done) { delete static_cast<std::shared_ptr<nats_subscription::held> *>(done); }, closure);
    });
}

void nats_link::on_message(natsConnection *, natsSubscription *, natsMsg *message, void *closure)
{
    const nats_message_ptr owned(message);
    const auto &held = *static_cast<std::shared_ptr<nats_subscription::held> *>(closure);
    const char *const reply = natsMsg_GetReply(message);
    nats_message copy{natsMsg_GetSubject(message), reply != nullptr ? reply : "",
                      std::string(natsMsg_GetData(message), static_cast<std::size_t>(natsMsg_GetDataLength(message)))};
    held->link->post(held->owner, std::move(copy));
}

void nats_link::post(const std::weak_ptr<nats_subscription> &to, nats_message message)
{
    if (receiving_ > kWaitingMost)
        return;
    ++receiving_;
    asio::post(io_, [this, to, message = std::move(message)] {
        --receiving_;
        if (const auto owner = to.lock())
            owner->receive_(message);
    });
}

task<std::optional<std::string>> nats_link::request(std::string subject, std::string data,
                                                    std::chrono::milliseconds limit)
{
    using answer = std::optional<std::string>;
    if (!connected_)
        co_return answer();
    std::function<answer(nats_session &)> ask = [subject, data, limit](nats_session &session) {
        natsMsg *reply = nullptr;
        const natsStatus status = natsConnection_Request(&reply, session.connection.get(), subject.c_str(), data.data(),
                                                         static_cast<int>(data.size()), limit.count());
        const nats_message_ptr owned(reply);
        return status == NATS_OK ? answer(std::in_place, natsMsg_GetData(reply),
                                          static_cast<std::size_t>(natsMsg_GetDataLength(reply)))
                                 : std::nullopt;
    };
    co_return co_await run<answer>(std::move(ask));
}
