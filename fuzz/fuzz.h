/* What the fuzz targets have in common. A broken promise ends the process, which the fuzzer reports like a crash. */
#ifndef FUZZ_FUZZ_H
#define FUZZ_FUZZ_H

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <unistd.h>

/* One input; always 0. */
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size);

inline void promise(bool kept, const char *what)
{
    if (kept)
        return;
    dprintf(STDERR_FILENO, "broken promise: %s\n", what);
    std::abort();
}

inline std::string_view text_of(const std::uint8_t *data, std::size_t size)
{
    return {reinterpret_cast<const char *>(data), size};
}

/* Takes what stands before the first such character off the input, and the character with it. */
inline std::string_view take_field(std::string_view &input, char end)
{
    const std::string_view field = input.substr(0, input.find(end));
    input.remove_prefix(field.size() < input.size() ? field.size() + 1 : field.size());
    return field;
}

/* Whether a terminal would obey something in a text: a control character, but for those that may stand there, or one of
 * the second half of them, in UTF-8. */
inline bool commands_terminal(std::string_view text, std::string_view allowed = "")
{
    unsigned char last = 0;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (((byte < 0x20 || byte == 0x7f) && allowed.find(c) == allowed.npos) ||
            (last == 0xc2 && byte >= 0x80 && byte < 0xa0))
            return true;
        last = byte;
    }
    return false;
}

#endif
