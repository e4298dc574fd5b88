/* Texts from outside, through the services that look at them, beside what those services are said to do. */
#include "core/log_tools.h"
#include "fuzz/fuzz.h"
#include "tests/memory_platform.h"

#include <arpa/inet.h>
#include <climits>
#include <cstring>
#include <optional>

namespace
{

/* The field at a place of a text, by hand. */
std::optional<std::string> field_of(std::string_view text, int place)
{
    while (place > 0 && text.find(';') != text.npos) {
        take_field(text, ';');
        --place;
    }
    return place == 0 ? std::optional<std::string>(take_field(text, ';')) : std::nullopt;
}

void check_fields(const std::string &text)
{
    for (int place = 0; place < 5; ++place) {
        char field[16];
        std::memset(field, 'x', sizeof field);
        const bool found = getNthValueSafe(place, text.c_str(), ';', field, sizeof field) == 0;
        const auto expected = field_of(text, place);
        promise(found == expected.has_value(), "a field that is there is found");
        promise(!found || (std::memchr(field, '\0', sizeof field) != nullptr &&
                           field == expected->substr(0, sizeof field - 1)),
                "as much of it as has room");
    }
}

void check_addresses(const std::string &text)
{
    in6_addr address{};
    const int kind = log_isValidIpOrUrl(text.c_str());
    const bool any = text == "any" || text == "any/0";
    promise((kind == 1) == (any || inet_pton(AF_INET, text.c_str(), &address) == 1), "an IPv4 address is one");
    promise((kind == 2) == (inet_pton(AF_INET6, text.c_str(), &address) == 1), "an IPv6 address is one");
    const int same = ip_in_subnet(text.c_str(), text.c_str(), "255.255.255.0");
    promise(same == 1 || same == -1, "an address is in its own subnet");
    const int in_subnet = ip_in_subnet(text.c_str(), "192.168.0.7", "255.255.255.0");
    if (kind == 1 && !any && text.find_first_not_of("0123456789.") == text.npos)
        promise((in_subnet == 1) == text.starts_with("192.168.0."), "addresses of a subnet begin alike");
}

void check_hex(const std::uint8_t *data, std::size_t size)
{
    const int count = static_cast<int>(size);
    std::string hex(2 * size + 1, '?');
    promise(log_hex_encode(data, hex.data(), count) == 2 * count && hex.back() == '\0', "two digits a byte");
    for (std::size_t i = 0; i < size; ++i)
        promise(std::stoul(hex.substr(2 * i, 2), nullptr, 16) == data[i], "which are the byte's");
    log_print_hex_buf(data, count, "fuzz");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    g_platform.takes_line = [](const char *, const char *, va_list) {};
    const std::string text(text_of(data, size).substr(0, text_of(data, size).find('\0')));
    check_fields(text);
    check_addresses(text);
    const long long number = std::strtoll(text.c_str(), nullptr, 10);
    promise(log_text_to_int(text.c_str()) == (number > INT_MAX   ? INT_MAX
                                              : number < INT_MIN ? INT_MIN
                                                                 : number),
            "a number is its value or the nearest that there is");
    check_hex(data, size);
    return 0;
}
