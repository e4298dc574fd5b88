#include "server/compress.h"

#include "platform/unique_fd.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <unistd.h>
#include <vector>
#include <zstd.h>

namespace
{

struct zstd_deleter {
    void operator()(ZSTD_CCtx *context) const { ZSTD_freeCCtx(context); }
};

bool write_all(int fd, const char *bytes, std::size_t size)
{
    while (size > 0) {
        const ssize_t n = write(fd, bytes, size);
        if (n < 0 && errno != EINTR)
            return false;
        bytes += std::max<ssize_t>(n, 0);
        size -= static_cast<std::size_t>(std::max<ssize_t>(n, 0));
    }
    return true;
}

/* Compresses so much more, and with `mode` ZSTD_e_end what is held; false, and errno, on failure. */
bool compress_piece(ZSTD_CCtx *context, ZSTD_inBuffer input, ZSTD_EndDirective mode, std::vector<char> &room, int to)
{
    std::size_t left = 0;
    do {
        ZSTD_outBuffer output{room.data(), room.size(), 0};
        left = ZSTD_compressStream2(context, &output, &input, mode);
        errno = ENOMEM;
        if (ZSTD_isError(left) != 0 || !write_all(to, room.data(), output.pos))
            return false;
    } while (mode == ZSTD_e_end ? left > 0 : input.pos < input.size);
    return true;
}

/* False, and errno, on failure. */
bool compress(int from, int to)
{
    const std::unique_ptr<ZSTD_CCtx, zstd_deleter> context{ZSTD_createCCtx()};
    std::vector<char> in(ZSTD_CStreamInSize());
    std::vector<char> out(ZSTD_CStreamOutSize());
    errno = ENOMEM;
    while (context) {
        const ssize_t n = read(from, in.data(), in.size());
        const ZSTD_inBuffer input{in.data(), static_cast<std::size_t>(std::max<ssize_t>(n, 0)), 0};
        if (n < 0 || !compress_piece(context.get(), input, n == 0 ? ZSTD_e_end : ZSTD_e_continue, out, to))
            return false;
        if (n == 0)
            return true;
    }
    return false;
}

} // namespace

bool compress_file(const std::filesystem::path &path, std::string &why)
{
    std::error_code error;
    const std::filesystem::path made = path.string() + kCompressedSuffix;
    const auto time = std::filesystem::last_write_time(path, error);
    const unique_fd from{open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW)};
    const unique_fd to{open(made.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0640)};
    if (from && to && compress(from.get(), to.get())) {
        std::filesystem::last_write_time(made, time, error);
        return true;
    }
    why = std::strerror(errno);
    std::filesystem::remove(made, error);
    return false;
}
