#include "protocol/log_pkg_send.h"

#include "core/log_block.h"
#include "core/log_line.h"
#include "core/log_tools.h"

#include <cstring>

namespace
{

constexpr char kLogSource[] = "log_pkg_codec";

constexpr char kName[] = "log_send_pkg_msg"; /* the routine that the log lines speak of */

} // namespace

int log_send_pkg_msg(int fd, SSL *ssl, const char *control, const void *data, int dataLen)
{
    if (fd < 0 || data == nullptr || control == nullptr)
        return -1;
    const auto outgoing = log_block_of<log_outgoing>();
    if (!outgoing) {
        LOG_NOTE("sendbuf malloc failed .\n");
        return -1;
    }
    if (dataLen > 0 && dataLen <= static_cast<int>(kPkgDataMax))
        std::memcpy(outgoing->msg.data, data, static_cast<std::size_t>(dataLen));
    return log_send_pkg_piece(fd, ssl, control, outgoing.get(), dataLen);
}

int log_send_pkg_piece(int fd, SSL *ssl, const char *control, log_outgoing *piece, int dataLen)
{
    if (fd < 0 || control == nullptr)
        return -1;
    log_msg_clear(&piece->msg);
    if (log_encode_fill_msg(control, piece->msg.data, dataLen, &piece->msg) != 0) {
        LOG_NOTE("%s: encode log msg fail\n", kName);
        return -1;
    }
    unsigned char *const frame = log_pkg_place(&piece->msg);
    int frame_len = kPkgSendBuf;
    if (log_encode_pkg_buf(frame, &frame_len, &piece->msg) != 0) {
        LOG_NOTE("%s: encode pkg buf fail\n", kName);
        return -1;
    }
    if (log_send_packet(fd, ssl, frame, frame_len) <= 0) {
        LOG_NOTE("%s: send pkg fail\n", kName);
        return -1;
    }
    LOG_NOTE("%s: send pkg success\n", kName);
    return 0;
}
