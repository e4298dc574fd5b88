/* Frames as a peer builds them, written without the daemon's codec so that both can be wrong only separately. */
#ifndef TESTS_FRAME_H
#define TESTS_FRAME_H

#include <cstdint>
#include <string>

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

inline const unsigned char *bytes(const std::string &text)
{
    return reinterpret_cast<const unsigned char *>(text.data());
}

#endif
