#include "tools/tool_config.h"

#include "tools/tool_progress.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

constexpr std::size_t kPieceSize = 50000;

constexpr char kLeftover[] =
    ". What it has received of the package stays in front of the next one: before the next try, "
    "delete it with the command clean, which deletes the logs too";

/* Sends a frame of the package and waits until the device has taken it; false, and why, when it has not. */
bool push(tool_device &device, std::uint64_t total, std::span<const unsigned char> data, int &status, std::string &why)
{
    const std::string command = tool_command("1", "conf_file", {{"totalLength", std::to_string(total)}});
    const std::optional<tool_answer> answer = tool_exchange(device, command, data, why);
    status = answer ? kDeviceSaidNo : kNoAnswer;
    if (answer)
        why = answer->reason;
    if (answer && answer->verdict == tool_verdict::success)
        status = kDone;
    return status == kDone;
}

/* Reads a piece whole, unless the file ends. */
std::span<const unsigned char> read_piece(int fd, std::span<unsigned char> buffer)
{
    std::size_t len = 0;
    while (len < buffer.size()) {
        const ssize_t n = read(fd, buffer.data() + len, buffer.size() - len);
        if (n == 0 || (n < 0 && errno != EINTR))
            break;
        len += static_cast<std::size_t>(std::max<ssize_t>(n, 0));
    }
    return buffer.first(len);
}

/* Sends the package's pieces. */
bool push_pieces(tool_device &device, int fd, std::uint64_t total, int &status, std::string &why)
{
    tool_progress progress("sent", total);
    unsigned char buffer[kPieceSize];
    for (std::uint64_t left = total; left > 0;) {
        const auto piece = read_piece(fd, std::span(buffer).first(std::min<std::uint64_t>(left, kPieceSize)));
        if (piece.empty()) {
            status = kNoAnswer;
            why = "the file became shorter while it was sent";
            return false;
        }
        if (!push(device, total, piece, status, why))
            return false;
        left -= piece.size();
        progress.advance(piece.size());
    }
    return true;
}

} // namespace

int tool_config(tool_device &device, const std::string &file)
{
    const unique_fd in{open(file.c_str(), O_RDONLY | O_CLOEXEC)};
    struct stat about {
    };
    if (!in || fstat(in.get(), &about) != 0)
        return tool_fail(kNoAnswer, "cannot read " + file + ": " + std::strerror(errno));
    if (!S_ISREG(about.st_mode) || about.st_size == 0 || about.st_size > INT_MAX)
        return tool_fail(kNoAnswer, file + " is no package: it is to be a tar file of up to 2 GB");
    const auto total = static_cast<std::uint64_t>(about.st_size);
    tool_catch_interrupts();
    int status = kDone;
    std::string why;
    if (!push(device, 0, {}, status, why)) /* forgets what another tool may have left half done */
        return tool_fail(status, why);
    if (!push_pieces(device, in.get(), total, status, why))
        return tool_fail(status, why + kLeftover);
    std::printf(device.json ? "{\"sent\":%llu,\"Result\":\"Success\"}\n"
                            : "The device has taken the package of %llu bytes. It unpacks it and starts its set-up "
                              "script; what comes of\nthat is in the device's own log only.\n",
                static_cast<unsigned long long>(total));
    return kDone;
}
