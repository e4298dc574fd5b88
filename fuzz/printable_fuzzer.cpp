/*
 * What a device says, as it is shown on a terminal: nothing in it can command the terminal, and nothing else is
 * changed.
 */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"

#include <algorithm>

namespace
{

bool is_command(char c)
{
    return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
}

/* The second half of the control characters, in UTF-8. */
bool has_second_commands(const std::string &text)
{
    for (std::size_t at = 0; (at = text.find('\xc2', at)) != std::string::npos; ++at)
        if (at + 1 < text.size() && static_cast<unsigned char>(text[at + 1]) - 0x80u < 0x20)
            return true;
    return false;
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    const std::string text(text_of(data, size));
    const std::string shown = tool_printable(text);
    const bool plain = std::none_of(text.begin(), text.end(), is_command) && !has_second_commands(text);
    promise(std::none_of(shown.begin(), shown.end(), is_command), "no control byte is shown");
    promise(!has_second_commands(shown), "nor one of the second half");
    promise(!plain || shown == text, "what is harmless is shown as it is");
    const std::string lines = tool_printable_lines(text);
    promise(std::count(lines.begin(), lines.end(), '\n') == std::count(text.begin(), text.end(), '\n'),
            "lines stay lines");
    promise(std::none_of(lines.begin(), lines.end(), [](char c) { return c != '\n' && is_command(c); }) &&
                !has_second_commands(lines),
            "no control byte but the ends of lines is shown");
    return 0;
}
