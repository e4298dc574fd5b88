/*
 * What a device says, as it is shown on a terminal: nothing in it can command the terminal, and nothing else is
 * changed.
 */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"

#include <algorithm>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    const std::string text(text_of(data, size));
    const std::string shown = tool_printable(text);
    promise(!commands_terminal(shown), "no control character is shown");
    promise(commands_terminal(text) || shown == text, "what is harmless is shown as it is");
    const std::string lines = tool_printable_lines(text);
    promise(std::count(lines.begin(), lines.end(), '\n') == std::count(text.begin(), text.end(), '\n'),
            "lines stay lines");
    promise(!commands_terminal(lines, "\n"), "no control character but the ends of lines is shown");
    promise(commands_terminal(text, "\n") || lines == text, "harmless lines are shown as they are");
    return 0;
}
