#include "server/spool.h"

#include "server/fleet.h"

#include <filesystem>

namespace fs = std::filesystem;

namespace
{

using namespace std::chrono_literals;

constexpr char kStream[] = "vex_log";

constexpr auto kFlushEach = 200ms;
constexpr auto kAgainAfter = 1s;
constexpr auto kAskAgainAfter = 3s;     /* longer than an answer takes */
constexpr auto kSettleMax = 15s;        /* for a record, by which time the library has said that it is lost */
constexpr auto kTellEach = 10s;         /* that records fail */
constexpr int64_t kLookMax = 2000;      /* ms, for the bus to say what it has */
constexpr unsigned kUnderWayMost = 256; /* records: a few MB */
constexpr int64_t kSecond = 1'000'000'000;
constexpr int64_t kDuplicates = 300 * kSecond; /* for which JetStream knows a record that comes twice */

/* What JetStream has last of a subject. */
struct last_record {
    bool known = false; /* it has answered */
    std::string id;
    std::time_t time = 0; /* 0: it has nothing */
};

last_record look_up_last(nats_session &session, const std::string &subject)
{
    jsOptions options;
    jsOptions_Init(&options);
    options.Wait = kLookMax;
    natsMsg *message = nullptr;
    const natsStatus status =
        js_GetLastMsg(&message, session.stream.get(), kStream, subject.c_str(), &options, nullptr);
    const nats_message_ptr owned(message);
    last_record last{status == NATS_OK || status == NATS_NOT_FOUND, "", 0};
    const char *id = nullptr;
    if (status == NATS_OK) {
        last.time = static_cast<std::time_t>(natsMsg_GetTime(message) / kSecond);
        if (natsMsgHeader_Get(message, kMessageId, &id) == NATS_OK)
            last.id = id;
    }
    return last;
}

/* What JetStream has last of a subject, asked beside all else. */
task<last_record> last_of(nats_link &link, std::string subject)
{
    std::function<last_record(nats_session &)> look = [subject](nats_session &session) {
        return look_up_last(session, subject);
    };
    co_return co_await link.run<last_record>(std::move(look));
}

/* Makes the stream unless it is there. */
bool has_stream(nats_session &session, unsigned days)
{
    jsStreamInfo *info = nullptr;
    const natsStatus there = js_GetStreamInfo(&info, session.stream.get(), kStream, nullptr, nullptr);
    jsStreamInfo_Destroy(info);
    if (there == NATS_OK)
        return true;
    const char *subjects[] = {"vex.log.>"};
    jsStreamConfig config;
    jsStreamConfig_Init(&config);
    config.Name = kStream;
    config.Subjects = subjects;
    config.SubjectsLen = 1;
    config.Duplicates = kDuplicates;
    config.MaxAge = 86400 * kSecond * days;
    return nats_make_replicated([&](int replicas) {
        config.Replicas = replicas;
        return js_AddStream(nullptr, session.stream.get(), &config, nullptr, nullptr);
    });
}

} // namespace

bool spool::open(std::string &why)
{
    const server_options &options = home_.options;
    room_.limit = options.spool_limit;
    std::error_code error;
    fs::create_directories(options.spool, error);
    for (fs::directory_iterator file(options.spool, error), end; !error && file != end; file.increment(error)) {
        const std::string name = file->path().filename();
        const std::size_t dot = std::min(name.find('.'), name.size() - 1);
        const auto kind = log_kind_of(name.substr(dot + 1));
        if (kind && is_imei(name.substr(0, dot)))
            find(name.substr(0, dot), *kind).doubtful = true;
    }
    if (error) {
        why = "cannot use the spool folder " + options.spool + ": " + error.message();
        return false;
    }
    run_beside(home_.io, tick());
    return true;
}

spool::spooled &spool::find(const std::string &imei, log_kind kind)
{
    const std::string subject = "vex.log." + imei + '.' + log_name(kind);
    spooled &found = logs_[subject];
    if (found.stored != nullptr)
        return found;
    auto file = std::make_unique<spool_file>(room_, fs::path(home_.options.spool) / (imei + '.' + log_name(kind)));
    found.subject = subject;
    found.name = imei + '.' + log_name(kind) + '.' + home_.name + '.';
    found.file = file.get();
    found.stored = std::make_shared<stored_log>(home_, imei, kind, "bus", std::move(file), 0);
    return found;
}

std::shared_ptr<stored_log> spool::follow(const std::string &imei, log_kind kind)
{
    spooled &log = find(imei, kind);
    log.past_is_known = false;
    log.stored->await_past();
    send_next(log);
    return log.stored;
}

/* Finds out when the bus had something of a log last, before it gets more. */
task<void> spool::ask_for_past(spooled &log)
{
    const last_record last = co_await last_of(link_, log.subject);
    if (last.known && !log.past_is_known) {
        log.past_is_known = true;
        log.stored->kept_last(last.time, last.id.starts_with(log.name));
        log.not_before = {};
    }
    send_next(log);
}

void spool::set_connected(bool connected)
{
    ready_ = false;
    if (connected && !std::exchange(making_, true))
        run_beside(home_.io, make_stream());
}

/* Sees to it that there is a stream, which may have to be waited for, and has the logs sent. */
task<void> spool::make_stream()
{
    asio::steady_timer pause(home_.io);
    while (!ready_ && link_.connected()) {
        std::function<bool(nats_session &)> make = [days = home_.options.store_days](nats_session &session) {
            return has_stream(session, days);
        };
        const bool made = co_await link_.run<bool>(std::move(make));
        ready_ = made && link_.connected();
        asio::error_code ignored;
        pause.expires_after(kAgainAfter);
        if (!ready_)
            co_await pause.async_wait(await_into(ignored));
    }
    making_ = false;
    for (auto &[subject, log] : logs_)
        send_next(log);
}

void spool::flush()
{
    for (auto &[subject, log] : logs_)
        log.file->flush();
}

/* Makes records of what was taken, and tries again what has failed. */
task<void> spool::tick()
{
    asio::steady_timer timer(home_.io);
    for (asio::error_code cancelled; !cancelled;) {
        timer.expires_after(kFlushEach);
        co_await timer.async_wait(await_into(cancelled));
        const auto now = server_clock::now();
        for (auto &[subject, log] : logs_) {
            if (log.file->has_waiting())
                log.file->flush();
            if (!log.under_way.empty() && now > log.deadline)
                failed(log, "JetStream does not answer");
            send_next(log);
        }
    }
}

/* Sends the oldest record of a log, unless one is under way. */
void spool::send_next(spooled &log)
{
    if (!ready_ || !log.under_way.empty() || server_clock::now() < log.not_before)
        return;
    if (!log.past_is_known) {
        log.not_before = server_clock::now() + kAskAgainAfter;
        run_beside(home_.io, ask_for_past(log));
        return;
    }
    if (!log.file->has_records())
        return;
    if (under_way_ >= kUnderWayMost) {
        if (!std::exchange(log.waiting, true))
            waiting_.push_back(&log);
        return;
    }
    const auto record = log.file->oldest();
    if (!record)
        return;
    log.under_way = log.name + std::to_string(record->number);
    log.deadline = server_clock::now() + kSettleMax;
    ++under_way_;
    if (log.doubtful)
        run_beside(home_.io, resolve(log, log.under_way));
    else if (!link_.keep(log.subject, log.under_way, record->bytes))
        failed(log, "there is no connection");
}

/* Finds out whether a record is there that was sent before, without an answer; if not, it is sent. */
task<void> spool::resolve(spooled &log, std::string id)
{
    const last_record last = co_await last_of(link_, log.subject);
    if (log.under_way != id)
        co_return;
    if (!last.known) {
        failed(log, "JetStream does not answer");
        co_return;
    }
    log.doubtful = false;
    if (last.id == id) {
        kept(log.subject, id, "");
        co_return;
    }
    settled(log);
    send_next(log);
}

void spool::kept(const std::string &subject, const std::string &id, const std::string &why)
{
    const auto found = logs_.find(subject);
    if (found == logs_.end() || found->second.under_way != id)
        return;
    if (!why.empty()) {
        failed(found->second, why);
        return;
    }
    ++home_.metrics.bus_records;
    found->second.file->remove_oldest();
    settled(found->second);
    if (!waiting_.empty()) {
        spooled &first = *waiting_.front();
        waiting_.pop_front();
        first.waiting = false;
        send_next(first);
    }
    send_next(found->second);
}

/* Nothing of the log is under way any more. */
void spool::settled(spooled &log)
{
    log.under_way.clear();
    --under_way_;
}

void spool::failed(spooled &log, const std::string &why)
{
    ++home_.metrics.bus_failures;
    log.doubtful = true;
    log.not_before = server_clock::now() + kAgainAfter;
    if (ready_ && server_clock::now() > told_ + kTellEach) {
        told_ = server_clock::now();
        server_log("the bus does not take a log", {{"subject", log.subject}, {"why", why}});
    }
    settled(log);
}
