#include "server/stored_archive.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

namespace fs = std::filesystem;

stored_archive::stored_archive(log_store &store, const std::string &imei)
    : store_(store), imei_(imei),
      path_(fs::path(store.home.options.store) / imei / ("archive-" + utc_text("%Y-%m-%dT%H%M%SZ") + ".tgz"))
{
    std::error_code ignored;
    fs::create_directories(path_.parent_path(), ignored);
    fd_.reset(open(part().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0640));
    if (!fd_)
        why_ = std::strerror(errno);
}

stored_archive::~stored_archive()
{
    std::error_code ignored;
    if (!finished_)
        fs::remove(part(), ignored);
}

void stored_archive::append(std::span<const unsigned char> bytes)
{
    if (!why_.empty())
        return;
    size_ += bytes.size();
    if (size_ > store_.home.options.store_limit)
        why_ = "it is larger than all that may be kept";
    else if (store_.make_room(size_);
             write(fd_.get(), bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()))
        why_ = std::strerror(errno);
}

void stored_archive::finish()
{
    std::error_code error;
    if (why_.empty())
        fs::rename(part(), path_, error);
    if (error)
        why_ = error.message();
    finished_ = why_.empty();
    if (finished_)
        store_.add(path_, size_);
    server_event(store_.home, finished_ ? "archive kept" : "archive not kept",
                 {{"imei", imei_}, {finished_ ? "file" : "why", finished_ ? path_.string() : why_}});
}
