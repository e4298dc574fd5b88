#include "core/log_tools.h"

#include "core/log_line.h"

#include <algorithm>
#include <arpa/inet.h>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <netinet/in.h>

constexpr char kLogSource[] = "log_tools";

int log_text_to_int(const char *text)
{
    return static_cast<int>(std::clamp(std::strtol(text, nullptr, 10), long{INT_MIN}, long{INT_MAX}));
}

int log_isValidIpOrUrl(const char *text)
{
    if (text == nullptr)
        return 0;
    in_addr v4{};
    in6_addr v6{};
    if (std::strcmp(text, "any") == 0 || std::strcmp(text, "any/0") == 0 || inet_pton(AF_INET, text, &v4) == 1)
        return 1;
    if (inet_pton(AF_INET6, text, &v6) == 1)
        return 2;
    LOG_NOTE("log_isValidIpOrUrl(): %s is not a valid IP address.\n", text);
    return 0;
}

int ip_in_subnet(const char *address, const char *peer, const char *netmask)
{
    in_addr a{};
    in_addr p{};
    in_addr mask{};
    if (inet_aton(address, &a) == 0 || inet_aton(peer, &p) == 0 || inet_aton(netmask, &mask) == 0)
        return -1;
    const int result = ((a.s_addr ^ p.s_addr) & mask.s_addr) == 0 ? 1 : 0;
    LOG_NOTE("[%s, %s, %s, %d]", address, peer, netmask, result);
    return result;
}

bool log_is_plain_word(const char *text)
{
    for (; *text != '\0'; ++text)
        if (static_cast<unsigned char>(*text) < ' ' || *text == 0x7f ||
            std::strchr(";&|<>()$`\"'\\#*?[~", *text) != nullptr)
            return false;
    return true;
}

int getNthValueSafe(int n, const char *text, char delimiter, char *out, int size)
{
    if (text == nullptr || delimiter == '\0' || out == nullptr || size <= 0) {
        LOG_FAULT("getNthValueSafe: null in\n");
        return -1;
    }
    int passed = 0;
    const char *end = std::strchr(text, delimiter);
    while (end != nullptr && passed < n) {
        text = end + 1;
        ++passed;
        end = std::strchr(text, delimiter);
    }
    if (end == nullptr && passed != n)
        return -1;
    const std::size_t field = end != nullptr ? static_cast<std::size_t>(end - text) : std::strlen(text);
    const std::size_t len = std::min(field, static_cast<std::size_t>(size) - 1);
    std::memcpy(out, text, len);
    out[len] = '\0';
    return 0;
}
