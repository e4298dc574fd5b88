#include "server/spool_file.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace
{

constexpr std::size_t kRecordFull = 65536; /* bytes; the bus takes a megabyte */
constexpr std::uint64_t kRecordMost = 1 << 20;

/* What the file begins with: where its oldest record is, as this machine writes numbers. */
constexpr std::uint64_t kFirst = sizeof(std::uint64_t);

/* And each record. */
struct record_head {
    std::uint64_t number;
    std::uint64_t size;
};

bool read_at(int fd, std::uint64_t at, void *into, std::size_t size)
{
    return pread(fd, into, size, static_cast<off_t>(at)) == static_cast<ssize_t>(size);
}

bool write_at(int fd, std::uint64_t at, const void *from, std::size_t size)
{
    const ssize_t n = pwrite(fd, from, size, static_cast<off_t>(at));
    if (n >= 0 && n != static_cast<ssize_t>(size))
        errno = ENOSPC;
    return n == static_cast<ssize_t>(size);
}

} // namespace

spool_file::spool_file(spool_room &room, fs::path path) : room_(room), path_(std::move(path))
{
    fd_.reset(::open(path_.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW));
    if (fd_)
        recover();
}

/* Begins a file, unless there is one. */
bool spool_file::open()
{
    if (fd_)
        return true;
    fd_.reset(::open(path_.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0640));
    head_ = end_ = kFirst;
    if (fd_ && write_at(fd_.get(), 0, &kFirst, sizeof kFirst))
        return true;
    fd_.reset();
    return false;
}

/* Finds the records that an earlier process has left. One that is not whole was never taken. */
void spool_file::recover()
{
    std::error_code ignored;
    const std::uint64_t size = fs::file_size(path_, ignored);
    if (!read_at(fd_.get(), 0, &head_, sizeof head_) || head_ < kFirst || head_ > size)
        head_ = kFirst;
    end_ = head_;
    record_head record{};
    while (read_at(fd_.get(), end_, &record, sizeof record) && record.size > 0 && record.size <= kRecordMost &&
           end_ + sizeof record + record.size <= size) {
        end_ += sizeof record + record.size;
        last_number_ = record.number;
    }
    room_.total += end_ - head_;
    if (head_ == end_)
        remove_file();
}

void spool_file::append(std::string_view bytes)
{
    waiting_ += bytes;
    if (waiting_.size() >= kRecordFull)
        flush();
}

void spool_file::lose(std::string_view bytes, std::string why)
{
    lost_ += bytes.size();
    why_lost_ = std::move(why);
}

void spool_file::flush()
{
    if (waiting_.empty())
        return;
    const std::string bytes = std::exchange(waiting_, {});
    const auto now = std::chrono::system_clock::now().time_since_epoch();
    const auto us = static_cast<std::uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(now).count());
    const record_head head{std::max(us, last_number_ + 1), bytes.size()};
    std::string record(reinterpret_cast<const char *>(&head), sizeof head);
    record += bytes;
    if (room_.total + record.size() > room_.limit) {
        lose(bytes, "the spool is full");
        return;
    }
    if (!open() || !write_at(fd_.get(), end_, record.data(), record.size())) {
        lose(bytes, std::strerror(errno));
        if (fd_) /* no part of a record stays */
            static_cast<void>(!ftruncate(fd_.get(), static_cast<off_t>(end_)));
        return;
    }
    end_ += record.size();
    room_.total += record.size();
    last_number_ = head.number;
}

std::optional<spool_record> spool_file::oldest()
{
    record_head head{};
    spool_record record{};
    if (read_at(fd_.get(), head_, &head, sizeof head) && head.size <= kRecordMost) {
        record.number = head.number;
        record.bytes.resize(head.size);
        if (read_at(fd_.get(), head_ + sizeof head, record.bytes.data(), head.size))
            return record;
    }
    lost_ += end_ - head_;
    why_lost_ = "the spool cannot be read";
    room_.total -= end_ - head_;
    remove_file();
    return std::nullopt;
}

void spool_file::remove_oldest()
{
    record_head head{};
    if (head_ < end_ && read_at(fd_.get(), head_, &head, sizeof head)) {
        head_ += sizeof head + head.size;
        room_.total -= sizeof head + head.size;
    }
    if (head_ < end_)
        static_cast<void>(!pwrite(fd_.get(), &head_, sizeof head_, 0)); /* else it is sent twice, and taken once */
    else
        remove_file();
}

void spool_file::remove_file()
{
    std::error_code ignored;
    fs::remove(path_, ignored);
    fd_.reset();
    head_ = end_ = 0;
}
