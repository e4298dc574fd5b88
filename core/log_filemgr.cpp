#include "core/log_filemgr.h"

#include "core/log_line.h"
#include "core/log_tools.h"

#include <cerrno>
#include <climits>
#include <iterator>
#include <memory>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "log_filemgr";

/* By mode code. "e": a program that is started meanwhile must not inherit the file. */
constexpr const char *kModes[] = {"re", "we", "w+e", "a+e", "rbe", "wbe", "w+be", "a+be"};

struct file_closer {
    void operator()(FILE *stream) const { log_close_file(stream); }
};

using file_stream = std::unique_ptr<FILE, file_closer>;

} // namespace

FILE *log_open_file(const char *path, int mode)
{
    if (path == nullptr || mode < 0 || mode >= static_cast<int>(std::size(kModes)))
        return nullptr;
    FILE *stream = std::fopen(path, kModes[mode]);
    if (stream != nullptr)
        std::setvbuf(stream, nullptr, _IONBF, 0);
    return stream;
}

std::int32_t log_read_file(FILE *stream, void *buffer, std::int32_t count)
{
    if (stream == nullptr || buffer == nullptr || count <= 0)
        return 0;
    return static_cast<std::int32_t>(std::fread(buffer, 1, static_cast<std::size_t>(count), stream));
}

std::int32_t log_write_file(FILE *stream, const void *buffer, std::int32_t count)
{
    if (stream == nullptr || buffer == nullptr || count <= 0)
        return 0;
    return static_cast<std::int32_t>(std::fwrite(buffer, 1, static_cast<std::size_t>(count), stream));
}

std::int32_t log_write_file_full(FILE *stream, const void *buffer, std::int32_t count)
{
    if (stream == nullptr || buffer == nullptr)
        return 0;
    if (count <= 0)
        return count;
    std::int32_t written = 0;
    while (written < count) {
        const std::int32_t n = log_write_file(stream, static_cast<const char *>(buffer) + written, count - written);
        if (n == 0 && errno != EINTR)
            break;
        written += n;
    }
    return written;
}

int log_close_file(FILE *stream)
{
    if (stream == nullptr)
        return 0;
    std::fclose(stream);
    return 1;
}

int log_is_file_exist(const char *path)
{
    struct stat status;
    if (path != nullptr && stat(path, &status) == 0)
        return 1;
    LOG_NOTE("%s not exsit\n", path != nullptr ? path : "(null)");
    return 0;
}

std::int32_t log_get_file_size(const char *path)
{
    if (path == nullptr)
        return -1;
    struct stat status;
    if (stat(path, &status) == 0 && status.st_size <= INT32_MAX)
        return static_cast<std::int32_t>(status.st_size);
    LOG_NOTE("log_get_file_size get failed\n");
    return 0;
}

std::int32_t log_read_whole_file(const char *path, void *buffer, std::int32_t count)
{
    const file_stream file{log_open_file(path, kFileReadBinary)};
    return log_read_file(file.get(), buffer, count);
}

std::int32_t log_write_whole_file(const char *path, const void *buffer, std::int32_t count)
{
    const file_stream file{log_open_file(path, kFileWriteBinary)};
    return log_write_file(file.get(), buffer, count);
}

int log_seek_file(FILE *stream, std::int32_t offset, int origin)
{
    if (stream == nullptr) {
        LOG_NOTE("log_seek_file bad input,file pointer is error\n");
        return 0;
    }
    const int whence = origin == 0 ? SEEK_SET : origin == 1 ? SEEK_CUR : SEEK_END;
    return std::fseek(stream, offset, whence) == 0 ? 1 : 0;
}

int pel_remove_file(const char *path)
{
    if (path == nullptr) {
        LOG_NOTE("pel_remove_file bad input para");
        return 0;
    }
    LOG_NOTE("pel_remove_file name %s\n", path);
    if (log_is_file_exist(path) == 0)
        return 1;
    return std::remove(path) == 0 ? 1 : 0;
}

bool log_clear_path(const char *path)
{
    if (unlink(path) == 0 || errno == ENOENT)
        return true;
    char cmd[128];
    std::snprintf(cmd, sizeof cmd, "rm -rf %s", path);
    return log_exec_cmd(cmd) == 0;
}

int pel_rename_file(const char *old_path, const char *new_path)
{
    if (old_path == nullptr || new_path == nullptr) {
        LOG_NOTE("pel_rename_file bad input,filenames pointer are null");
        return 0;
    }
    return std::rename(old_path, new_path) == 0 ? 1 : 0;
}

int log_sync_file(FILE *stream)
{
    if (stream == nullptr || (std::fflush(stream) != 0 && errno != EBADF))
        return 0;
    const int fd = fileno(stream);
    return fd != -1 && fsync(fd) == 0 ? 1 : 0;
}
