/* Texts from outside, through the services that look at them. */
#include "core/log_tools.h"
#include "fuzz/fuzz.h"
#include "tests/memory_platform.h"

#include <cstring>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    const std::string text(text_of(data, size));
    const int kind = log_isValidIpOrUrl(text.c_str());
    promise(kind >= 0 && kind <= 2, "an address is of one of three kinds");
    const int in_subnet = ip_in_subnet(text.c_str(), "192.168.0.7", "255.255.255.0");
    promise(in_subnet >= -1 && in_subnet <= 1, "a subnet is one of three answers");
    log_text_to_int(text.c_str());
    char field[16];
    std::memset(field, 'x', sizeof field);
    const int found = getNthValueSafe(static_cast<int>(size % 5), text.c_str(), ';', field, sizeof field);
    promise(found != 0 || strnlen(field, sizeof field) < sizeof field, "a field is a text");
    std::string hex(2 * size + 1, '?');
    promise(log_hex_encode(data, hex.data(), static_cast<int>(size)) == static_cast<int>(2 * size),
            "two digits a byte");
    g_platform.log.clear();
    return 0;
}
