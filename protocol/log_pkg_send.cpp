#include "protocol/log_pkg_send.h"

#include "core/log_block.h"
#include "core/log_line.h"
#include "core/log_tools.h"

namespace
{

constexpr char kLogSource[] = "log_pkg_codec";

constexpr char kName[] = "log_send_pkg_msg"; /* the routine that the log lines speak of */

/* Encodes a frame in its record and sends it. The data may be in the record already. */
int encode_and_send(int fd, SSL *ssl, const char *control, const void *data, int dataLen, log_outgoing *outgoing)
{
    log_msg *const msg = &outgoing->msg;
    log_msg_clear(msg);
    if (log_encode_fill_msg(control, data, dataLen, msg) != 0) {
        LOG_NOTE("%s: encode log msg fail\n", kName);
        return -1;
    }
    unsigned char *const frame = log_pkg_place(msg);
    int frame_len = kPkgSendBuf;
    if (log_encode_pkg_buf(frame, &frame_len, msg) != 0) {
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
    return encode_and_send(fd, ssl, control, data, dataLen, outgoing.get());
}

int log_send_pkg_piece(int fd, SSL *ssl, const char *control, log_outgoing *piece, int dataLen)
{
    if (fd < 0 || control == nullptr)
        return -1;
    return encode_and_send(fd, ssl, control, piece->msg.data, dataLen, piece);
}
