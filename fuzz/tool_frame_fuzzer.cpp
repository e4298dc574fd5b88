/*
 * What a device may send to the log tool: the frames in it are found as they were sent, one after the other, and
 * anything else is told from them. An answer that is no success has a reason that a terminal may show.
 */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"
#include "tools/tool_link.h"

namespace
{

std::string bytes_of(const tool_frame &frame)
{
    const auto put_u32 = [](std::size_t value) {
        const auto digit = [value](int shift) { return static_cast<char>(value >> shift & 255); };
        return std::string{digit(24), digit(16), digit(8), digit(0)};
    };
    std::string bytes = PKG_HEAD + put_u32(frame.control.size()) + frame.control + put_u32(frame.data.size());
    bytes.append(frame.data.begin(), frame.data.end());
    return bytes + PKG_TAIL;
}

void check_answer(const std::string &control)
{
    const tool_answer answer = tool_read_answer(control, tool_msgid(control));
    promise((answer.verdict == tool_verdict::refused) == control.empty(), "an empty answer is a refusal");
    promise((answer.verdict == tool_verdict::success) == answer.reason.empty(), "a reason for what is no success");
    promise(!commands_terminal(answer.reason), "which cannot command a terminal");
    promise(!commands_terminal(tool_answer_text(answer, nullptr, "Result")), "and no more can a value");
    promise((answer.verdict == tool_verdict::success) == (tool_answer_text(answer, nullptr, "Result") == "Success"),
            "only Success is success");
    promise(!commands_terminal(tool_answer_text(answer, "bsp", "level")), "nor one in a group");
    if (answer.verdict != tool_verdict::success)
        return;
    const auto verdict = tool_read_answer(control, tool_msgid(control) + '0').verdict;
    promise(verdict == tool_verdict::garbled, "the answer to another command is none");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    int ends[2];
    if (size > 100000 || socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends) != 0)
        return 0;
    unique_fd device{ends[1]};
    tool_link link{.fd = unique_fd{ends[0]}, .where = "device", .limits = {}, .held = {}};
    promise(send(device.get(), data, size, MSG_NOSIGNAL) == static_cast<ssize_t>(size) || size == 0, "it is sent");
    device.reset();
    std::string why;
    std::string_view sent = text_of(data, size);
    while (const auto frame = tool_receive(link, link.limits.reply, why)) {
        promise(frame->control.size() <= kPkgControlMax, "a bounded control text");
        const std::string bytes = bytes_of(*frame);
        promise(sent.starts_with(bytes), "a frame is what was sent");
        sent.remove_prefix(bytes.size());
        check_answer(frame->control);
    }
    promise(!why.empty() && !commands_terminal(why), "a reason for the end");
    const auto msg = std::make_unique<log_msg>();
    for (std::size_t at = 0; (at = sent.find(PKG_TAIL, at)) != sent.npos && at < kPkgMax;) {
        at += kPkgTagLen;
        log_msg_clear(msg.get());
        promise(log_decode_msg(data + size - sent.size(), at, msg.get()) != 0,
                "what is left does not begin with a frame");
    }
    return 0;
}
