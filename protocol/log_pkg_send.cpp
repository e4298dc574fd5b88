#include "protocol/log_pkg_send.h"

#include "core/log_block.h"
#include "core/log_line.h"
#include "core/log_tools.h"
#include "protocol/log_pkg_codec.h"

namespace
{

constexpr char kLogSource[] = "log_pkg_codec";

/* A frame on its way out. Not cleared: the encoder writes every byte that is sent. */
struct log_outgoing {
    log_msg msg;
    unsigned char frame[kPkgSendBuf];
};

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
    log_msg_clear(&outgoing->msg);
    if (log_encode_fill_msg(control, data, dataLen, &outgoing->msg) != 0) {
        LOG_NOTE("%s: encode log msg fail\n", __func__);
        return -1;
    }
    int frame_len = sizeof outgoing->frame;
    if (log_encode_pkg_buf(outgoing->frame, &frame_len, &outgoing->msg) != 0) {
        LOG_NOTE("%s: encode pkg buf fail\n", __func__);
        return -1;
    }
    if (log_send_packet(fd, ssl, outgoing->frame, frame_len) <= 0) {
        LOG_NOTE("%s: send pkg fail\n", __func__);
        return -1;
    }
    LOG_NOTE("%s: send pkg success\n", __func__);
    return 0;
}
