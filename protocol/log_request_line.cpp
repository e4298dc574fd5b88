#include "protocol/log_request_line.h"

#include "protocol/log_pkg_codec.h"

#include <cstring>
#include <string_view>

namespace
{

using part = log_request_line::part;

constexpr std::string_view kVersion = "HTTP/";

bool is_method_byte(unsigned char byte)
{
    return byte != '\0' && std::strchr("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789!#$%&'*+-.^_`|~",
                                       byte) != nullptr;
}

/* Goes on with the next part behind a blank, when this one is not empty. */
part behind(log_request_line &line, part next)
{
    if (line.matched == 0)
        return part::none;
    line.matched = 0;
    return next;
}

part take_byte(log_request_line &line, unsigned char byte)
{
    switch (line.at) {
    case part::method:
        if (byte == ' ')
            return behind(line, part::target);
        if (!is_method_byte(byte) || (line.matched == 0 && byte == PKG_HEAD[0]))
            return part::none;
        line.matched = 1;
        return part::method;
    case part::target:
        if (byte == ' ')
            return behind(line, part::version);
        line.matched = 1;
        return byte < ' ' || byte == 0x7f ? part::none : part::target;
    case part::version:
        return byte == static_cast<unsigned char>(kVersion[line.matched++]) ? part::version : part::none;
    case part::none:
        break;
    }
    return part::none;
}

} // namespace

bool log_take_request_line(log_request_line &line, std::span<const unsigned char> piece)
{
    for (const unsigned char byte : piece) {
        line.at = take_byte(line, byte);
        if (line.at == part::none)
            return false;
        if (line.at == part::version && line.matched == kVersion.size())
            return true;
    }
    return false;
}
