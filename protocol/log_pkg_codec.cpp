#include "protocol/log_pkg_codec.h"

#include "core/log_line.h"

#include <cstddef>
#include <cstring>

namespace
{

constexpr char kLogSource[] = "log_pkg_codec";

bool tag_stands(const char *tag, const unsigned char *at, const unsigned char *end)
{
    return static_cast<std::size_t>(end - at) >= kPkgTagLen && std::memcmp(at, tag, kPkgTagLen) == 0;
}

std::uint32_t get_u32(const unsigned char *at)
{
    return static_cast<std::uint32_t>(at[0]) << 24 | static_cast<std::uint32_t>(at[1]) << 16 |
           static_cast<std::uint32_t>(at[2]) << 8 | static_cast<std::uint32_t>(at[3]);
}

void put_u32(unsigned char *at, std::uint32_t value)
{
    at[0] = static_cast<unsigned char>(value >> 24);
    at[1] = static_cast<unsigned char>(value >> 16);
    at[2] = static_cast<unsigned char>(value >> 8);
    at[3] = static_cast<unsigned char>(value);
}

/* Stores a text of at most kPkgControlMax characters, with its NUL where the field has room for one. */
void set_control(log_msg *msg, const void *text, std::size_t len)
{
    std::memcpy(msg->control, text, len);
    if (len < sizeof msg->control)
        msg->control[len] = '\0';
}

/* Takes the control part into the record. */
bool decode_control(const unsigned char *frame, std::size_t len, const log_pkg_header &header, log_msg *msg)
{
    msg->controlLen = static_cast<std::int32_t>(header.control_len);
    if (header.control_len > kPkgControlMax) {
        LOG_NOTE("%s error control len = %d\n", "log_decode_fill_msg", msg->controlLen);
        return false;
    }
    if (header.control_len + kPkgMin > len) {
        LOG_NOTE("%s error controlLen =%d\n", "log_decode_fill_msg", msg->controlLen);
        return false;
    }
    set_control(msg, frame + kPkgControlAt, header.control_len);
    return true;
}

/* Takes the data part, behind the control part, into the record. */
bool decode_data(const unsigned char *frame, std::size_t len, const log_pkg_header &header, log_msg *msg)
{
    msg->dataLen = static_cast<std::int32_t>(header.data_len);
    if (header.data_len >= kPkgDataMax || (header.data_len > 0 && header.frame_len() > len)) {
        LOG_NOTE("%s error dataLen =%d\n", "log_decode_fill_msg", msg->dataLen);
        return false;
    }
    std::memcpy(msg->data, frame + kPkgControlAt + header.control_len + 4, header.data_len);
    return true;
}

/* Whether a frame of these lengths can be encoded (logged when it cannot). */
bool lengths_fit(std::size_t control_len, std::int32_t dataLen)
{
    if (control_len > kPkgControlMax) {
        LOG_NOTE("%s: controlLen=%d error\n", "log_encode_fill_msg", static_cast<int>(control_len));
        return false;
    }
    if (dataLen < 0 || dataLen > static_cast<std::int32_t>(kPkgDataMax)) {
        LOG_NOTE("%s: dataLen=%d error\n", "log_encode_fill_msg", dataLen);
        return false;
    }
    return true;
}

/* Writes what comes before the data, which ends there; then what comes behind it, with a NUL. */
void put_around(unsigned char *data, const char *control, std::size_t control_len, std::size_t data_len)
{
    unsigned char *const frame = data - 4 - control_len - kPkgControlAt;
    std::memcpy(frame, PKG_HEAD, kPkgTagLen);
    put_u32(frame + kPkgControlLenAt, static_cast<std::uint32_t>(control_len));
    std::memcpy(frame + kPkgControlAt, control, control_len);
    put_u32(data - 4, static_cast<std::uint32_t>(data_len));
    std::memcpy(data + data_len, PKG_TAIL, sizeof PKG_TAIL);
}

} // namespace

void log_msg_clear(log_msg *msg)
{
    std::memset(msg->headTag, 0, sizeof msg->headTag);
    msg->controlLen = 0;
    msg->control[0] = '\0';
    msg->dataLen = 0;
    std::memset(msg->tailTag, 0, sizeof msg->tailTag);
}

log_pkg_header log_pkg_read_header(const unsigned char *frame, std::size_t held)
{
    log_pkg_header header{};
    header.has_control_len = held > kPkgControlAt;
    if (!header.has_control_len)
        return header;
    header.control_len = get_u32(frame + kPkgControlLenAt);
    header.has_data_len = held > std::uint64_t{header.control_len} + kPkgControlAt + 4;
    if (header.has_data_len)
        header.data_len = get_u32(frame + kPkgControlAt + header.control_len);
    return header;
}

const unsigned char *log_FindHead_pkg(const unsigned char *at, const unsigned char *end)
{
    if (at == nullptr || end == nullptr || at >= end)
        return nullptr;
    if (tag_stands(PKG_HEAD, at, end)) {
        LOG_NOTE("%s,find PKG_HEAD", __func__);
        return at;
    }
    LOG_NOTE("%s,cannot find PKG_HEAD", __func__);
    return nullptr;
}

const unsigned char *log_FindTail_pkg(const unsigned char *at, const unsigned char *end)
{
    if (at == nullptr || end == nullptr || at >= end)
        return nullptr;
    if (tag_stands(PKG_TAIL, at, end)) {
        LOG_NOTE("%s,find PKG_TAIL", __func__);
        return at;
    }
    LOG_NOTE("%s,cannot find PKG_TAIL", __func__);
    return nullptr;
}

int log_decode_fill_msg(const unsigned char *frame, std::size_t len, log_msg *msg)
{
    LOG_NOTE("%s enter\n", __func__);
    if (frame == nullptr || msg == nullptr || len < kPkgMin) {
        LOG_NOTE("%s error:wrong para\n", __func__);
        return 1;
    }
    std::memcpy(msg->headTag, frame, kPkgTagLen);
    const log_pkg_header header = log_pkg_read_header(frame, len);
    if (!decode_control(frame, len, header, msg) || !decode_data(frame, len, header, msg))
        return 1;
    const auto at = static_cast<std::size_t>(header.frame_len());
    std::memcpy(msg->tailTag, frame + at - kPkgTagLen, kPkgTagLen);
    if (at != len) {
        LOG_NOTE("%s:error index %d != len %d\n", __func__, static_cast<int>(at), static_cast<int>(len));
        return 1;
    }
    LOG_NOTE("%s:log_msg->headTag=%s\n", __func__, msg->headTag);
    LOG_NOTE("%s:log_msg->controlLen=%d\n", __func__, msg->controlLen);
    LOG_NOTE("%s:log_msg->dataLen=%d\n", __func__, msg->dataLen);
    LOG_NOTE("%s:log_msg->tailTag=%s\n", __func__, msg->tailTag);
    return 0;
}

int log_decode_msg(const unsigned char *frame, std::size_t len, log_msg *msg)
{
    LOG_NOTE("%s enter\n", __func__);
    if (frame == nullptr || len == 0 || msg == nullptr)
        return 1;
    /* A frame is no C string: its text ends at its first NUL or with it, whichever comes first. */
    LOG_NOTE("%s: len=%d,buf=%.*s", __func__, static_cast<int>(len), static_cast<int>(len),
             reinterpret_cast<const char *>(frame));
    const int result = log_decode_fill_msg(frame, len, msg);
    if (result != 0)
        return result;
    if (std::strcmp(msg->headTag, PKG_HEAD) != 0)
        return 2;
    return std::strcmp(msg->tailTag, PKG_TAIL) != 0 ? 3 : 0;
}

int log_encode_fill_msg(const char *control, const void *data, std::int32_t dataLen, log_msg *msg)
{
    if (control == nullptr || data == nullptr || msg == nullptr)
        return 1;
    std::memcpy(msg->headTag, PKG_HEAD, sizeof PKG_HEAD);
    const std::size_t control_len = std::strlen(control);
    msg->controlLen = static_cast<std::int32_t>(control_len);
    msg->dataLen = dataLen;
    if (!lengths_fit(control_len, dataLen))
        return 1;
    set_control(msg, control, control_len);
    std::memcpy(msg->data, data, static_cast<std::size_t>(dataLen));
    std::memcpy(msg->tailTag, PKG_TAIL, sizeof PKG_TAIL);
    return 0;
}

int log_encode_pkg_buf(unsigned char *out, std::int32_t *sendLen, const log_msg *msg)
{
    LOG_NOTE("%s enter\n", __func__);
    if (out == nullptr || sendLen == nullptr || msg == nullptr) {
        LOG_NOTE("%s: param null\n", __func__);
        return 1;
    }
    if (*sendLen < static_cast<std::int32_t>(kPkgEncodeMin)) {
        LOG_NOTE("%s: sendLen=%d fail\n", __func__, *sendLen);
        return 1;
    }
    const auto control_len = static_cast<std::size_t>(msg->controlLen);
    const auto data_len = static_cast<std::size_t>(msg->dataLen);
    unsigned char *const data = out + kPkgControlAt + control_len + 4;
    std::memcpy(data, msg->data, data_len);
    put_around(data, msg->control, control_len, data_len);
    *sendLen = static_cast<std::int32_t>(kPkgMin + control_len + data_len);
    return 0;
}

const unsigned char *log_encode_outgoing(const char *control, std::int32_t dataLen, log_outgoing *outgoing,
                                         std::int32_t *frame_len)
{
    const std::size_t control_len = std::strlen(control);
    if (!lengths_fit(control_len, dataLen))
        return nullptr;
    LOG_NOTE("%s enter\n", "log_encode_pkg_buf");
    put_around(outgoing->data(), control, control_len, static_cast<std::size_t>(dataLen));
    *frame_len = static_cast<std::int32_t>(kPkgMin + control_len) + dataLen;
    return outgoing->data() - 4 - control_len - kPkgControlAt;
}
