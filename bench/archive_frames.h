/* The floors' way to send an archive: the least that can be done to a file to have it in frames. */
#ifndef BENCH_ARCHIVE_FRAMES_H
#define BENCH_ARCHIVE_FRAMES_H

#include "platform/unique_fd.h"

#include <arpa/inet.h>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>

/* Sends a file as frames of 51200 bytes by `send`, which sends so many bytes whole or returns false. */
template <typename Send> bool send_archive_file(const char *path, const Send &send)
{
    constexpr std::size_t kPieceSize = 51200;
    static char frame[kPieceSize + 2048];
    const unique_fd file{open(path, O_RDONLY | O_CLOEXEC)};
    struct stat about {
    };
    fstat(file.get(), &about);
    const int control_len = std::snprintf(
        frame + 6, 2000, "{\"msgid\":\"2\",\"GetLocalLog\":{\"totalLength\":\"%d\"},\"Result\":\"Success\"}",
        static_cast<int>(about.st_size));
    const auto put_length = [](char *at, std::size_t len) {
        const std::uint32_t big_endian = htonl(static_cast<std::uint32_t>(len));
        std::memcpy(at, &big_endian, 4);
    };
    char *const data = frame + 6 + control_len + 4;
    std::memcpy(frame, "#~", 2);
    put_length(frame + 2, static_cast<std::size_t>(control_len));
    for (ssize_t n = 0; (n = read(file.get(), data, kPieceSize)) > 0;) {
        put_length(data - 4, static_cast<std::size_t>(n));
        std::memcpy(data + n, "~#", 2);
        if (!send(frame, static_cast<std::size_t>(data + n + 2 - frame)))
            return false;
    }
    return true;
}

#endif
