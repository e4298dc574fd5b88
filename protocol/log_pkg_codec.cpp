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

/* Bytes may already be where they belong. */
void put(unsigned char *at, const void *bytes, std::size_t len)
{
    if (at != bytes)
        std::memmove(at, bytes, len);
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

/* Takes the control part, whose length stands at kPkgControlLenAt, into the record. */
bool decode_control(const unsigned char *frame, std::size_t len, log_msg *msg)
{
    const std::uint32_t control_len = log_pkg_get_u32(frame + kPkgControlLenAt);
    msg->controlLen = static_cast<std::int32_t>(control_len);
    if (control_len > kPkgControlMax) {
        LOG_NOTE("%s error control len = %d\n", "log_decode_fill_msg", msg->controlLen);
        return false;
    }
    if (control_len + kPkgControlAt + 4 + kPkgTagLen > len) {
        LOG_NOTE("%s error controlLen =%d\n", "log_decode_fill_msg", msg->controlLen);
        return false;
    }
    set_control(msg, frame + kPkgControlAt, control_len);
    return true;
}

/* Takes the data part, whose length stands at `at`, into the record. */
bool decode_data(const unsigned char *frame, std::size_t len, std::size_t at, log_msg *msg)
{
    const std::uint32_t data_len = log_pkg_get_u32(frame + at);
    msg->dataLen = static_cast<std::int32_t>(data_len);
    if (data_len >= kPkgDataMax || (data_len > 0 && at + 4 + data_len + kPkgTagLen > len)) {
        LOG_NOTE("%s error dataLen =%d\n", "log_decode_fill_msg", msg->dataLen);
        return false;
    }
    std::memcpy(msg->data, frame + at + 4, data_len);
    return true;
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

std::uint32_t log_pkg_get_u32(const unsigned char *at)
{
    return static_cast<std::uint32_t>(at[0]) << 24 | static_cast<std::uint32_t>(at[1]) << 16 |
           static_cast<std::uint32_t>(at[2]) << 8 | static_cast<std::uint32_t>(at[3]);
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
    if (!decode_control(frame, len, msg))
        return 1;
    std::size_t at = kPkgControlAt + static_cast<std::size_t>(msg->controlLen);
    if (!decode_data(frame, len, at, msg))
        return 1;
    at += 4 + static_cast<std::size_t>(msg->dataLen);
    std::memcpy(msg->tailTag, frame + at, kPkgTagLen);
    at += kPkgTagLen;
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
    if (control_len > kPkgControlMax) {
        LOG_NOTE("%s: controlLen=%d error\n", __func__, msg->controlLen);
        return 1;
    }
    set_control(msg, control, control_len);
    msg->dataLen = dataLen;
    if (dataLen < 0 || dataLen > static_cast<std::int32_t>(kPkgDataMax)) {
        LOG_NOTE("%s: dataLen=%d error\n", __func__, dataLen);
        return 1;
    }
    put(msg->data, data, static_cast<std::size_t>(dataLen));
    std::memcpy(msg->tailTag, PKG_TAIL, sizeof PKG_TAIL);
    return 0;
}

unsigned char *log_pkg_place(log_msg *msg)
{
    return reinterpret_cast<unsigned char *>(msg) + offsetof(log_msg, data) - 4 - msg->controlLen - kPkgControlAt;
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
    /* From back to front, so that the frame may overwrite the record that it is made of. */
    put(data + data_len, PKG_TAIL, sizeof PKG_TAIL);
    put(data, msg->data, data_len);
    put_u32(data - 4, static_cast<std::uint32_t>(data_len));
    put(out + kPkgControlAt, msg->control, control_len);
    put_u32(out + kPkgControlLenAt, static_cast<std::uint32_t>(control_len));
    put(out, PKG_HEAD, kPkgTagLen);
    *sendLen = static_cast<std::int32_t>(kPkgMin + control_len + data_len);
    return 0;
}
