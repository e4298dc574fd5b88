/* Frames as a peer builds them, written without the daemon's codec so that both can be wrong only separately. */
#ifndef TESTS_FRAME_H
#define TESTS_FRAME_H

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

inline std::string big_endian(std::uint32_t n)
{
    return {static_cast<char>(n >> 24), static_cast<char>(n >> 16), static_cast<char>(n >> 8), static_cast<char>(n)};
}

inline std::string frame(const std::string &control, const std::string &data = "")
{
    std::string out = "#~";
    out += big_endian(static_cast<std::uint32_t>(control.size()));
    out += control;
    out += big_endian(static_cast<std::uint32_t>(data.size()));
    out += data;
    return out += "~#";
}

/* The big-endian number of 32 bits that the bytes hold there. */
inline std::uint32_t number_at(std::string_view bytes, std::size_t at)
{
    std::uint32_t n = 0;
    for (const char c : bytes.substr(at, 4))
        n = n << 8 | static_cast<unsigned char>(c);
    return n;
}

struct frame_parts {
    std::string_view control;
    std::string_view data;
    std::size_t size; /* of the whole frame */
};

/* The parts of the frame that the bytes begin with, whatever its tags are; none while it is not there whole. */
inline std::optional<frame_parts> parts_of(std::string_view bytes)
{
    if (bytes.size() < 12)
        return std::nullopt;
    const std::size_t control_len = number_at(bytes, 2);
    if (control_len > bytes.size() - 12)
        return std::nullopt;
    const std::size_t data_len = number_at(bytes, 6 + control_len);
    if (data_len > bytes.size() - 12 - control_len)
        return std::nullopt;
    return frame_parts{bytes.substr(6, control_len), bytes.substr(10 + control_len, data_len),
                       12 + control_len + data_len};
}

inline const unsigned char *bytes(const std::string &text)
{
    return reinterpret_cast<const unsigned char *>(text.data());
}

#endif
