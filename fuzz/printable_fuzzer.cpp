/* What a device says, as it is shown on a terminal: nothing in it can command the terminal. */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"

#include <algorithm>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    const std::string text(text_of(data, size));
    const auto commands = [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7f; };
    const std::string shown = tool_printable(text);
    promise(std::none_of(shown.begin(), shown.end(), commands), "no control byte is shown");
    const std::string lines = tool_printable_lines(text);
    promise(std::count(lines.begin(), lines.end(), '\n') == std::count(text.begin(), text.end(), '\n'),
            "lines stay lines");
    promise(std::none_of(lines.begin(), lines.end(), [&](char c) { return c != '\n' && commands(c); }),
            "no control byte but the ends of lines is shown");
    return 0;
}
