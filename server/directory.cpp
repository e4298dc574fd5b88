#include "server/directory.h"

#include "server/fleet.h"

namespace
{

using namespace std::chrono_literals;

constexpr auto kAlive = 5s;             /* from one sign of life to the next */
constexpr int64_t kForget = 15;         /* s after which a server without is dead */
constexpr auto kRefresh = 20min;        /* from one time that a device's entry is written to the next */
constexpr int64_t kForgetDevice = 3600; /* s after which one is gone that nobody writes */
constexpr auto kAgainAfter = 1s;        /* when something could not be written */
constexpr int kKeysTries = 3;           /* to list the servers, which fails while JetStream elects a leader */
constexpr std::size_t kAtOnce = 64;     /* devices */
constexpr int64_t kSecond = 1'000'000'000;

/* Makes a bucket unless it is there. */
nats_bucket_ptr bucket(nats_session &session, const char *name, int64_t forget)
{
    kvStore *made = nullptr;
    if (js_KeyValue(&made, session.stream.get(), name) == NATS_OK)
        return nats_bucket_ptr(made);
    kvConfig config;
    kvConfig_Init(&config);
    config.Bucket = name;
    config.TTL = forget * kSecond;
    config.History = 1;
    nats_make_replicated([&](int replicas) {
        config.Replicas = replicas;
        return js_CreateKeyValue(&made, session.stream.get(), &config);
    });
    return nats_bucket_ptr(made);
}

/* Whether a bucket has answered, whatever it was, and not just the question been lost. */
bool is_final(natsStatus status)
{
    return status == NATS_OK || status == NATS_ERR || status == NATS_MISMATCH || status == NATS_NOT_FOUND ||
           status == NATS_INVALID_ARG;
}

/* What a bucket says of a key. */
natsStatus look_up(kvStore *store, const std::string &key, std::string &value)
{
    kvEntry *found = nullptr;
    const natsStatus status = kvStore_Get(&found, store, key.c_str());
    const nats_entry_ptr owned(found);
    if (status == NATS_OK)
        value.assign(static_cast<const char *>(kvEntry_Value(found)),
                     static_cast<std::size_t>(kvEntry_ValueLen(found)));
    return status;
}

} // namespace

void directory::start()
{
    run_beside(home_.io, write_changes());
    run_beside(home_.io, stay_alive());
}

void directory::set_connected(bool connected)
{
    told_ = false;
    if (!connected)
        buckets_.reset();
    changed_.set();
}

void directory::enter(const std::string &imei, std::time_t since)
{
    presence &here = here_[imei];
    here.since = since;
    here.there = true;
    changes_.insert(imei);
    changed_.set();
}

void directory::leave(const std::string &imei)
{
    here_[imei].there = false;
    changes_.insert(imei);
    changed_.set();
}

/* Has every entry written once more: JetStream forgets those that are not. */
void directory::touch_all()
{
    for (const auto &[imei, here] : here_)
        changes_.insert(imei);
    changed_.set();
}

/* Makes the buckets; nothing, when that does not answer. */
task<std::shared_ptr<directory::buckets>> directory::prepare()
{
    using result = std::shared_ptr<buckets>;
    std::function<result(nats_session &)> make = [](nats_session &session) {
        auto made = std::make_shared<buckets>();
        made->servers = bucket(session, "vex_servers", kForget);
        if (made->servers != nullptr)
            made->devices = bucket(session, "vex_devices", kForgetDevice);
        return made->devices != nullptr ? made : nullptr;
    };
    co_return co_await link_.run<result>(std::move(make));
}

/* Tells JetStream that this server lives, as long as it does. */
task<void> directory::stay_alive()
{
    asio::steady_timer timer(home_.io);
    auto refreshed = server_clock::now();
    for (asio::error_code cancelled; !cancelled;) {
        if (buckets_ == nullptr && link_.connected()) {
            auto made = co_await prepare();
            if (made != nullptr && link_.connected()) {
                buckets_ = std::move(made);
                touch_all();
            } else if (!std::exchange(told_, true)) {
                server_log("JetStream does not answer", {});
            }
        }
        if (const auto into = buckets_; into != nullptr && !ending_) {
            std::function<bool(nats_session &)> write = [into, name = home_.name,
                                                         tools = home_.tools_address](nats_session &) {
                return kvStore_PutString(nullptr, into->servers.get(), name.c_str(), tools.c_str()) == NATS_OK;
            };
            co_await link_.run<bool>(std::move(write));
        }
        if (server_clock::now() > refreshed + kRefresh) {
            refreshed = server_clock::now();
            touch_all();
        }
        timer.expires_after(buckets_ == nullptr ? kAgainAfter : kAlive);
        co_await timer.async_wait(await_into(cancelled));
    }
}

/* What is to be written next, and no longer among the changes. */
std::vector<directory::update> directory::next_updates()
{
    std::vector<update> updates;
    while (!changes_.empty() && updates.size() < kAtOnce) {
        const auto first = changes_.extract(changes_.begin());
        updates.push_back({first.value(), here_[first.value()]});
    }
    return updates;
}

/* Writes what has changed, for ever. */
task<void> directory::write_changes()
{
    for (;;) {
        co_await changed_.wait();
        changed_.reset();
        while (!changes_.empty() && buckets_ != nullptr) {
            std::function<std::vector<update>(nats_session &)> write = [into = buckets_, name = home_.name,
                                                                        updates = next_updates()](nats_session &) {
                std::vector<update> done = updates;
                for (auto each = done.begin(); each != done.end() && write_one(*into, name, *each); ++each) {
                }
                return done;
            };
            const std::vector<update> done = co_await link_.run<std::vector<update>>(std::move(write));
            const bool all = note(done);
            if (!all) {
                asio::steady_timer pause(home_.io, kAgainAfter);
                asio::error_code ignored;
                co_await pause.async_wait(await_into(ignored));
            }
        }
    }
}

/* Writes where a device is, or that it has left, unless another server has written about it since. False when nobody
 * answers: the rest would wait in vain, too. */
bool directory::write_one(const buckets &into, const std::string &name, update &update)
{
    kvStore *const devices = into.devices.get();
    const char *const key = update.imei.c_str();
    if (!update.what.there) {
        update.written = update.what.revision == 0 ||
                         is_final(kvStore_UpdateString(nullptr, devices, key, "{}", update.what.revision));
        return update.written;
    }
    std::string before;
    std::string ignored;
    if (!is_final(look_up(devices, update.imei, before)))
        return false;
    const message other(before);
    const std::string server = other.text("server");
    const bool is_newer = std::strtoll(other.text("since").c_str(), nullptr, 10) > update.what.since;
    update.is_elsewhere =
        !server.empty() && server != name && is_newer && look_up(into.servers.get(), server, ignored) == NATS_OK;
    const std::string value = tool_json({{"server", name}, {"since", std::to_string(update.what.since)}});
    update.written =
        update.is_elsewhere || kvStore_PutString(&update.what.revision, devices, key, value.c_str()) == NATS_OK;
    return update.written;
}

/* Notes what came of updates; false when some have to be written once more. */
bool directory::note(const std::vector<update> &updates)
{
    bool all = true;
    for (const update &done : updates) {
        const auto found = here_.find(done.imei);
        if (found == here_.end())
            continue;
        all = all && done.written;
        if (!done.written)
            changes_.insert(done.imei);
        if (done.what.there)
            found->second.revision = done.what.revision;
        if (const auto device = home_.devices->find(done.imei); device && done.is_elsewhere)
            device->link->end("it has called another server");
        if (done.written && !found->second.there && !done.what.there)
            here_.erase(found);
    }
    return all;
}

task<std::optional<std::vector<std::string>>> directory::others()
{
    using result = std::optional<std::vector<std::string>>;
    if (buckets_ == nullptr)
        co_return result();
    std::function<result(nats_session &)> look = [from = buckets_, own = home_.name](nats_session &) {
        kvKeysList keys{};
        for (int tries = 1; kvStore_Keys(&keys, from->servers.get(), nullptr) != NATS_OK; ++tries)
            if (tries == kKeysTries)
                return result();
        std::vector<std::string> found(keys.Keys, keys.Keys + keys.Count);
        kvKeysList_Destroy(&keys);
        std::erase(found, own);
        return result(std::move(found));
    };
    co_return co_await link_.run<result>(std::move(look));
}

task<void> directory::end()
{
    ending_ = true;
    asio::steady_timer pause(home_.io);
    for (const auto until = server_clock::now() + 1s; !changes_.empty() && server_clock::now() < until;) {
        asio::error_code ignored;
        pause.expires_after(10ms);
        co_await pause.async_wait(await_into(ignored));
    }
    if (buckets_ == nullptr)
        co_return;
    std::function<bool(nats_session &)> forget = [from = buckets_, name = home_.name](nats_session &) {
        return kvStore_Delete(from->servers.get(), name.c_str()) == NATS_OK;
    };
    co_await link_.run<bool>(std::move(forget));
}
