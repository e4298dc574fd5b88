/* An archive on its way into the store: there when it is whole, and gone when it never is. */
#ifndef SERVER_STORED_ARCHIVE_H
#define SERVER_STORED_ARCHIVE_H

#include "platform/unique_fd.h"
#include "server/store.h"

#include <filesystem>
#include <span>
#include <string>

/* What the name of one ends with that is not whole. */
constexpr char kPartSuffix[] = ".part";

class stored_archive
{
public:
    stored_archive(log_store &store, const std::string &imei);
    ~stored_archive();
    stored_archive(const stored_archive &) = delete;

    void append(std::span<const unsigned char> bytes);
    /* All of it has come. */
    void finish();

private:
    std::filesystem::path part() const { return path_.string() + kPartSuffix; }

    log_store &store_;
    const std::string imei_;
    const std::filesystem::path path_;
    unique_fd fd_;
    std::uint64_t size_ = 0;
    std::string why_; /* it is not kept */
    bool finished_ = false;
};

#endif
