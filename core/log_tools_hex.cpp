#include "core/log_tools.h"

#include "core/log_line.h"
#include "core/log_record.h"

#include <climits>
#include <cstdlib>
#include <cstring>

namespace
{

constexpr char kLogSource[] = "log_tools";

constexpr std::size_t kHexPiece = 500; /* characters of a hex dump in one log line */
constexpr int kHexMax = INT_MAX / 4;   /* bytes of a hex dump whose text a 32-bit size can count */

} // namespace

int log_hex_encode(const void *data, char *out, int count)
{
    constexpr char kDigits[] = "0123456789ABCDEF";
    if (data == nullptr || out == nullptr || count < 0 || count > INT_MAX / 2)
        return -1;
    const auto *bytes = static_cast<const unsigned char *>(data);
    for (int i = 0; i < count; ++i) {
        *out++ = kDigits[bytes[i] >> 4];
        *out++ = kDigits[bytes[i] & 15];
    }
    *out = '\0';
    return 2 * count;
}

void log_print_hex_buf(const void *data, int count, const char *tag)
{
    LOG_NOTE("%s enter\n", __func__);
    if (data == nullptr || count <= 0 || count > kHexMax || tag == nullptr) {
        LOG_NOTE("%s: param null\n", __func__);
        return;
    }
    /* One piece to spare, so that the last one is copied whole like the others; its tail is zeros. */
    const std::size_t text_size = 2 * static_cast<std::size_t>(count) + kHexPiece;
    const std::unique_ptr<char, log_free> text{static_cast<char *>(std::calloc(1, text_size))};
    if (!text) {
        LOG_NOTE("%s: malloc tmpBuf fail\n", __func__);
        return;
    }
    const auto text_len = static_cast<std::size_t>(log_hex_encode(data, text.get(), count));
    const std::size_t pieces = (text_len + kHexPiece - 1) / kHexPiece;
    LOG_NOTE("%s:%s print_count=%d\n", __func__, tag, static_cast<int>(pieces));
    for (std::size_t i = 0; i < pieces; ++i) {
        char line[512] = {};
        std::memcpy(line, text.get() + kHexPiece * i, kHexPiece);
        LOG_NOTE("%s:%s pieceBuf[%d]:%s.\n", __func__, tag, static_cast<int>(i), line);
    }
}
