/*
 * A live log on its way to the bus: records, in a file, from when they were taken until the bus has them. The file is
 * there only while it has any; a process that is killed loses none.
 */
#ifndef SERVER_SPOOL_FILE_H
#define SERVER_SPOOL_FILE_H

#include "platform/unique_fd.h"
#include "server/stored_log.h"

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

/* What all files have in common. */
struct spool_room {
    std::uint64_t limit = 0; /* bytes that may be there */
    std::uint64_t total = 0; /* that are */
};

struct spool_record {
    std::uint64_t number; /* no two of a log, and none of an earlier process, have the same */
    std::string bytes;
};

class spool_file : public log_output
{
public:
    /* Goes on with the file of an earlier process, if there is one. */
    spool_file(spool_room &room, std::filesystem::path path);

    /* Takes bytes, which become part of a record. */
    void append(std::string_view bytes) override;
    /* Makes a record of what was taken. */
    void flush() override;
    void close() override { flush(); }
    std::uint64_t take_lost() override { return std::exchange(lost_, 0); }
    std::string why_lost() const override { return why_lost_; }

    bool has_waiting() const { return !waiting_.empty(); }
    bool has_records() const { return head_ < end_; }
    /* The oldest record; none when it can't be read, which is told, and then all are given up. */
    std::optional<spool_record> oldest();
    /* The bus has it. */
    void remove_oldest();

private:
    bool open();
    void recover();
    void remove_file();
    void lose(std::string_view bytes, std::string why);

    spool_room &room_;
    const std::filesystem::path path_;
    unique_fd fd_;
    std::uint64_t head_ = 0; /* where the oldest record begins */
    std::uint64_t end_ = 0;  /* and where the file ends */
    std::uint64_t last_number_ = 0;
    std::string waiting_;
    std::uint64_t lost_ = 0;
    std::string why_lost_;
};

#endif
