#include "tools/tool_config.h"

#include "tools/tool_progress.h"
#include "tools/tool_tar.h"

#include <algorithm>
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

/* How a push is going. */
struct push_state {
    int status = kDone;
    std::string why;     /* after a failure */
    std::string control; /* the device's last reply as it came */
    bool begun = false;  /* whether the device may have data of this package */
};

/* Sends a frame of the package and waits until the device has taken it; false when it has not. */
bool push(tool_device &device, std::uint64_t total, std::span<const unsigned char> data, push_state &state)
{
    const std::string command = tool_command("1", "conf_file", {{"totalLength", std::to_string(total)}});
    const std::optional<tool_answer> answer = tool_exchange(device, command, data, state.why);
    if (!answer) {
        state.status = kNoAnswer;
        return false;
    }
    state.control = answer->control;
    if (answer->verdict == tool_verdict::success)
        return true;
    state.status = kDeviceSaidNo;
    state.why = tool_said(device, *answer);
    return false;
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

/* Sends the package's pieces; false when one could not be read or sent. */
bool push_pieces(tool_device &device, int fd, std::uint64_t total, push_state &state)
{
    tool_progress progress("sent", total);
    unsigned char buffer[kPieceSize];
    for (std::uint64_t left = total; left > 0;) {
        errno = 0;
        const auto size = static_cast<std::size_t>(std::min<std::uint64_t>(left, kPieceSize));
        const auto piece = read_piece(fd, std::span(buffer).first(size));
        if (piece.empty()) {
            state.status = kNoAnswer;
            state.why =
                std::string("cannot read the package: ") + (errno != 0 ? std::strerror(errno) : "it became shorter");
            return false;
        }
        state.begun = true;
        if (!push(device, total, piece, state))
            return false;
        left -= piece.size();
        progress.advance(piece.size());
    }
    return true;
}

/* Opens a package; none, and why, when it is no readable tar. */
unique_fd open_package(const std::string &file, std::uint64_t &total, std::string &why)
{
    unique_fd in{open(file.c_str(), O_RDONLY | O_CLOEXEC)};
    struct stat about {
    };
    std::string contents;
    if (!in || fstat(in.get(), &about) != 0) {
        why = "cannot read " + file + ": " + std::strerror(errno);
    } else if (!S_ISREG(about.st_mode) || about.st_size > INT_MAX) {
        why = file + " is no package: that is a tar file of up to 2 GB";
    } else if (!tool_check_tar(in.get(), tool_packing::plain, contents, why)) {
        why = file + " is no package, which is a plain tar file: " + why;
    } else {
        lseek(in.get(), 0, SEEK_SET);
        total = static_cast<std::uint64_t>(about.st_size);
        return in;
    }
    return {};
}

} // namespace

int tool_config(tool_device &device, const std::string &file)
{
    push_state state;
    std::uint64_t total = 0;
    const unique_fd in = open_package(file, total, state.why);
    if (!in || !tool_reach(device, state.why))
        return tool_fail(kNoAnswer, state.why);
    tool_catch_interrupts();
    /* The first frame has the device forget the count of a package that was broken off. */
    const bool done = push(device, 0, {}, state) && push_pieces(device, in.get(), total, state);
    if (device.json && !state.control.empty())
        std::printf("%s\n", state.control.c_str());
    if (!done)
        return tool_fail(state.status, state.why + (state.begun ? kLeftover : ""));
    if (!device.json)
        std::printf(
            "The device has taken the package of %llu bytes. It unpacks it and starts its set-up script; what comes "
            "of\nthat is in the device's own log only.\n",
            static_cast<unsigned long long>(total));
    return kDone;
}
