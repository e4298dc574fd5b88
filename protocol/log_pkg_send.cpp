#include "protocol/log_pkg_send.h"

#include "core/log_line.h"
#include "core/log_record.h"
#include "core/log_registry.h"
#include "core/log_tools.h"

#include <cstring>

namespace
{

constexpr char kLogSource[] = "log_pkg_codec";

constexpr char kName[] = "log_send_pkg_msg"; /* the routine that the log lines speak of */

/* Completes a frame whose data is in place, and sends it. */
int encode_and_send(int fd, log_tls_session *ssl, const char *control, log_outgoing *outgoing, int dataLen)
{
    int frame_len = 0;
    const unsigned char *const frame = log_encode_outgoing(control, dataLen, outgoing, &frame_len);
    if (frame == nullptr) {
        LOG_NOTE("%s: encode log msg fail\n", kName);
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

int log_send_pkg_msg(int fd, log_tls_session *ssl, const char *control, const void *data, int dataLen)
{
    if (fd < 0 || data == nullptr || control == nullptr)
        return -1;
    const auto outgoing = log_allocate<log_outgoing>();
    if (!outgoing) {
        LOG_NOTE("sendbuf malloc failed .\n");
        return -1;
    }
    if (dataLen > 0 && dataLen <= static_cast<int>(kPkgDataMax)) /* what is longer is refused */
        std::memcpy(outgoing->data(), data, static_cast<std::size_t>(dataLen));
    return encode_and_send(fd, ssl, control, outgoing.get(), dataLen);
}

int log_cmd_send_msg(const char *control)
{
    const std::shared_ptr<log_link> link = log_cmd_link();
    if (!link)
        return -1;
    const log_lock hold{link->sending};
    return log_send_pkg_msg(link->fd.get(), link->tls.get(), control, "", 0);
}

int log_cmd_send_piece(const char *control, log_outgoing *piece, int dataLen)
{
    const std::shared_ptr<log_link> link = log_cmd_link();
    if (!link)
        return -1;
    const log_lock hold{link->sending};
    return encode_and_send(link->fd.get(), link->tls.get(), control, piece, dataLen);
}
