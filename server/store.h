/*
 * What the server keeps, in a folder: a folder for each device, with its live logs, a file a day and after `rotate_size`
 * bytes; and the server's events, as JSON lines. Never more than `store_limit` bytes: the oldest file goes first.
 */
#ifndef SERVER_STORE_H
#define SERVER_STORE_H

#include "server/live_log.h"
#include "server/server.h"
#include "server/stored_log.h"

#include <asio/thread_pool.hpp>
#include <filesystem>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>

class log_store;

/* A file that is written to, and the ones after it: NAME-DATE.SUFFIX, NAME-DATE.1.SUFFIX, ...; those before it may have
 * been compressed. */
class kept_file : public log_output
{
public:
    kept_file(log_store &store, std::filesystem::path folder, std::string name, std::string suffix);
    ~kept_file() override;
    kept_file(const kept_file &) = delete;

    /* Takes bytes, which are in the file within a second. */
    void append(std::string_view bytes) override;
    void flush() override;
    /* Goes on with another file. */
    void close() override;
    std::uint64_t take_lost() override { return std::exchange(lost_, 0); }
    std::string why_lost() const override { return why_lost_; }

private:
    bool open();

    log_store &store_;
    const std::filesystem::path folder_;
    const std::string name_;
    const std::string suffix_;
    std::filesystem::path path_; /* of the file that is open */
    int fd_ = -1;
    std::string day_;
    std::uint64_t size_ = 0;
    std::string waiting_;
    std::uint64_t lost_ = 0;
    const char *why_lost_ = "";
};

class log_store
{
public:
    /* None, and why, when the folder can't be used. */
    static std::unique_ptr<log_store> open(server &server, std::string &why);
    ~log_store();

    std::shared_ptr<stored_log> follow(const std::string &imei, log_kind kind);
    void event(const std::string &line);
    std::uint64_t total() const { return total_; }

    /* Removes what is too old, or has to go for so many bytes more. */
    void make_room(std::uint64_t bytes);
    /* Takes a finished file into account. */
    void add(const std::filesystem::path &path, std::uint64_t size);

    server &home;

private:
    friend class kept_file;

    struct kept {
        std::uint64_t size;
        std::filesystem::file_time_type time;
        kept_file *writer; /* none, when it is no longer written to */
    };

    explicit log_store(server &server);
    void scan();
    task<void> tick();
    void grew(const std::filesystem::path &path, std::uint64_t bytes, kept_file *writer);
    void closed(const std::filesystem::path &path);
    void remove_oldest();
    void enter(const std::filesystem::path &path, std::uint64_t size, std::filesystem::file_time_type time);
    void forget(const std::filesystem::path &path);
    void compress_next();
    void compressed(const std::filesystem::path &path, const std::string &why);
    std::time_t last_write(const std::string &imei, log_kind kind) const;

    const std::filesystem::path folder_;
    std::map<std::filesystem::path, kept> files_;
    std::set<std::pair<std::filesystem::file_time_type, std::filesystem::path>> by_age_;
    std::set<kept_file *> waiting_; /* with bytes to write */
    std::uint64_t total_ = 0;
    asio::thread_pool compressor_{1};
    bool compressing_ = false;
    server_clock::time_point looked_{}; /* for something to compress */
    std::unique_ptr<kept_file> events_;
    std::map<std::pair<std::string, log_kind>, std::shared_ptr<stored_log>> logs_;
};

#endif
