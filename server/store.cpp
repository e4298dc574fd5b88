#include "server/store.h"

#include "server/compress.h"
#include "server/stored_archive.h"

#include <algorithm>
#include <asio/post.hpp>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace
{

using namespace std::chrono_literals;

constexpr auto kCompressLook = 60s; /* from one look for something to compress to the next */
constexpr std::size_t kFlushAt = 65536;

std::time_t to_time(fs::file_time_type time)
{
    return std::chrono::system_clock::to_time_t(
        std::chrono::time_point_cast<std::chrono::system_clock::duration>(std::chrono::file_clock::to_sys(time)));
}

} // namespace

kept_file::kept_file(log_store &store, fs::path folder, std::string name, std::string suffix)
    : store_(store), folder_(std::move(folder)), name_(std::move(name)), suffix_(std::move(suffix))
{
}

kept_file::~kept_file()
{
    flush();
    close();
    store_.waiting_.erase(this);
}

void kept_file::append(std::string_view bytes)
{
    waiting_ += bytes;
    if (waiting_.size() >= kFlushAt)
        flush();
    else
        store_.waiting_.insert(this);
}

bool kept_file::open()
{
    std::error_code ignored;
    fs::create_directories(folder_, ignored);
    day_ = utc_text("%Y-%m-%d");
    for (unsigned number = 0;; ++number) {
        path_ = folder_ / (name_ + '-' + day_ + (number > 0 ? '.' + std::to_string(number) : "") + suffix_);
        if (fs::exists(path_.string() + kCompressedSuffix, ignored))
            continue;
        size_ = fs::exists(path_, ignored) ? fs::file_size(path_, ignored) : 0;
        if (size_ < store_.home.options.rotate_size)
            break;
    }
    fd_ = ::open(path_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW, 0640);
    return fd_ != -1;
}

void kept_file::flush()
{
    if (waiting_.empty())
        return;
    if (fd_ != -1 && (size_ >= store_.home.options.rotate_size || day_ != utc_text("%Y-%m-%d")))
        close();
    store_.make_room(waiting_.size());
    std::size_t done = 0;
    if (fd_ != -1 || open()) {
        while (done < waiting_.size()) {
            const ssize_t n = write(fd_, waiting_.data() + done, waiting_.size() - done);
            if (n < 0 && errno != EINTR)
                break;
            done += static_cast<std::size_t>(std::max<ssize_t>(n, 0));
        }
    }
    if (done < waiting_.size()) {
        why_lost_ = std::strerror(errno);
        lost_ += waiting_.size() - done;
        store_.home.metrics.store_bytes_lost += waiting_.size() - done;
    }
    size_ += done;
    waiting_.clear();
    if (fd_ != -1)
        store_.grew(path_, done, this);
}

void kept_file::close()
{
    if (fd_ == -1)
        return;
    ::close(fd_);
    fd_ = -1;
    store_.closed(path_);
}

log_store::log_store(server &server) : home(server), folder_(server.options.store) {}

log_store::~log_store()
{
    for (kept_file *const file : std::exchange(waiting_, {}))
        file->flush();
}

std::unique_ptr<log_store> log_store::open(server &server, std::string &why)
{
    std::error_code error;
    const fs::path folder = server.options.store;
    fs::create_directories(folder, error);
    if (error || access(folder.c_str(), R_OK | W_OK | X_OK) != 0) {
        why = "cannot keep anything in " + folder.string() + ": " + (error ? error.message() : std::strerror(errno));
        return nullptr;
    }
    std::unique_ptr<log_store> store(new log_store(server));
    store->scan();
    store->events_ = std::make_unique<kept_file>(*store, folder, "events", ".jsonl");
    run_beside(server.io, store->tick());
    return store;
}

void log_store::scan()
{
    std::error_code error;
    for (fs::recursive_directory_iterator at(folder_, error), end; at != end; at.increment(error)) {
        if (error || !at->is_regular_file(error))
            continue;
        if (at->path().extension() == kPartSuffix) /* of a server that was killed */
            fs::remove(at->path(), error);
        else
            enter(at->path(), at->file_size(error), at->last_write_time(error));
    }
    make_room(0);
}

/* Writes once a second what waits. */
task<void> log_store::tick()
{
    asio::steady_timer timer(home.io);
    for (asio::error_code cancelled; !cancelled;) {
        timer.expires_after(1s);
        co_await timer.async_wait(await_into(cancelled));
        for (kept_file *const file : std::exchange(waiting_, {}))
            file->flush();
        make_room(0);
        compress_next();
    }
}

void log_store::grew(const fs::path &path, std::uint64_t bytes, kept_file *writer)
{
    const auto [entry, fresh] = files_.try_emplace(path, kept{0, {}, nullptr});
    kept &file = entry->second;
    if (!fresh)
        by_age_.erase({file.time, path});
    file.time = fs::file_time_type::clock::now();
    file.size += bytes;
    file.writer = writer;
    by_age_.emplace(file.time, path);
    total_ += bytes;
}

void log_store::closed(const fs::path &path)
{
    if (const auto entry = files_.find(path); entry != files_.end())
        entry->second.writer = nullptr;
}

void log_store::make_room(std::uint64_t bytes)
{
    const auto oldest = [this](unsigned days) {
        return days > 0 && by_age_.begin()->first < fs::file_time_type::clock::now() - std::chrono::hours(24 * days);
    };
    while (!by_age_.empty() && (total_ + bytes > home.options.store_limit || oldest(home.options.store_days)))
        remove_oldest();
}

void log_store::add(const fs::path &path, std::uint64_t size)
{
    enter(path, size, fs::file_time_type::clock::now());
}

/* Takes a file that is there, and written to no more, into the books. */
void log_store::enter(const fs::path &path, std::uint64_t size, fs::file_time_type time)
{
    forget(path);
    files_[path] = {size, time, nullptr};
    by_age_.emplace(time, path);
    total_ += size;
}

/* Takes a file that is no more off the books. */
void log_store::forget(const fs::path &path)
{
    const auto entry = files_.find(path);
    if (entry == files_.end())
        return;
    by_age_.erase({entry->second.time, path});
    total_ -= entry->second.size;
    files_.erase(entry);
}

void log_store::remove_oldest()
{
    const fs::path path = by_age_.begin()->second;
    std::error_code error;
    if (kept_file *const writer = files_[path].writer; writer != nullptr)
        writer->close();
    fs::remove(path, error);
    forget(path);
}

/* Compresses one of the files that nothing will be added to, beside all else. */
void log_store::compress_next()
{
    if (compressing_ || !home.options.compress || server_clock::now() < looked_ + kCompressLook)
        return;
    looked_ = server_clock::now();
    const std::string today = '-' + utc_text("%Y-%m-%d");
    const auto ready = std::ranges::find_if(files_, [&](const auto &entry) {
        const std::string name = entry.first.filename();
        return entry.second.writer == nullptr && (name.ends_with(".log") || name.ends_with(".bin")) &&
               (entry.second.size >= home.options.rotate_size || name.find(today) == name.npos);
    });
    if (ready == files_.end())
        return;
    compressing_ = true;
    asio::post(compressor_, [this, path = ready->first] {
        std::string why;
        compress_file(path, why);
        asio::post(home.io, [this, path, why] { compressed(path, why); });
    });
}

void log_store::compressed(const fs::path &path, const std::string &why)
{
    compressing_ = false;
    const fs::path made = path.string() + kCompressedSuffix;
    const auto entry = files_.find(path);
    std::error_code error;
    if (!why.empty())
        server_log("not compressed", {{"file", path}, {"why", why}});
    else if (entry == files_.end())
        fs::remove(made, error); /* there was no room for it meanwhile */
    else {
        enter(made, fs::file_size(made, error), entry->second.time);
        fs::remove(path, error);
        forget(path);
        looked_ = {};
    }
}

/* When a log was written to last; 0 when nothing of it is kept. */
std::time_t log_store::last_write(const std::string &imei, log_kind kind) const
{
    const std::string start = (folder_ / imei / log_name(kind)).string() + '-';
    std::time_t last = 0;
    for (auto file = files_.lower_bound(start); file != files_.end() && file->first.string().starts_with(start); ++file)
        last = std::max(last, to_time(file->second.time));
    return last;
}

std::shared_ptr<stored_log> log_store::follow(const std::string &imei, log_kind kind)
{
    std::shared_ptr<stored_log> &log = logs_[{imei, kind}];
    if (!log)
        log = std::make_shared<stored_log>(home, imei, kind, "store",
                                           std::make_unique<kept_file>(*this, folder_ / imei, log_name(kind),
                                                                       kind == log_kind::syslog ? ".log" : ".bin"),
                                           last_write(imei, kind));
    return log;
}

void log_store::event(const std::string &line)
{
    events_->append(line + '\n');
}
