/* What a device may send to the log tool: the frames in it are found, and anything else is told from them. */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"
#include "tools/tool_link.h"

#include <sys/socket.h>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    int ends[2];
    if (size > 100000 || socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends) != 0)
        return 0;
    unique_fd device{ends[1]};
    tool_link link{.fd = unique_fd{ends[0]}, .where = "device", .limits = {}, .held = {}};
    const auto sent = send(device.get(), data, size, MSG_NOSIGNAL);
    device.reset();
    std::string why;
    std::size_t received = 0;
    while (const auto frame = tool_receive(link, link.limits.reply, why)) {
        promise(frame->control.size() <= kPkgControlMax, "a bounded control text");
        received += frame->control.size() + frame->data.size() + kPkgMin;
        const tool_answer answer = tool_read_answer(frame->control, tool_msgid(frame->control));
        promise(answer.verdict == tool_verdict::success || !answer.reason.empty(), "a reason for what is no success");
    }
    promise(!why.empty(), "a reason for the end");
    promise(received <= static_cast<std::size_t>(sent > 0 ? sent : 0), "no frame that was not sent");
    return 0;
}
