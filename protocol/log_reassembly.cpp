#include "protocol/log_reassembly.h"

#include "core/log_line.h"
#include "protocol/log_json_codec.h"

#include <cstddef>
#include <cstring>
#include <optional>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";
constexpr char kName[] = "log_proc_tcp_pkg"; /* the routine that the log lines speak of */

void append(log_reassembly &state, std::span<const unsigned char> piece)
{
    if (piece.size() >= LOG_RECV_PKG_LEN - state.recv_pkg_len) {
        state.recv_pkg_len = 0;
        LOG_NOTE("%s: tmpbuf small,drop old content.\n", kName);
    }
    if (piece.size() >= LOG_RECV_PKG_LEN)
        return;
    std::memcpy(state.incoming->recv_pkg_buf + state.recv_pkg_len, piece.data(), piece.size());
    state.recv_pkg_len += piece.size();
}

/* Whether the held bytes begin with a frame that can be handled; says nothing in the log. */
bool frame_is_whole(const log_reassembly &state)
{
    const unsigned char *held = state.incoming->recv_pkg_buf;
    const log_pkg_header header = log_pkg_read_header(held, state.recv_pkg_len);
    return header.has_data_len && state.recv_pkg_len >= header.frame_len() &&
           std::memcmp(held, PKG_HEAD, kPkgTagLen) == 0 &&
           std::memcmp(held + header.frame_len() - kPkgTagLen, PKG_TAIL, kPkgTagLen) == 0;
}

/* Counts small pieces that complete no frame. False for one that has to be passed over in silence. */
bool is_worth_telling(log_reassembly &state, std::size_t piece_len)
{
    if (piece_len >= kLogSmallPiece || frame_is_whole(state)) {
        if (state.is_silent())
            LOG_NOTE("%s: [%u] small pieces were not logged\n", kName, state.small_pieces - kLogSmallPiecesTold);
        state.small_pieces = 0;
        return true;
    }
    if (++state.small_pieces == kLogSmallPiecesTold + 1)
        LOG_NOTE("%s: small pieces are not logged until a frame is whole\n", kName);
    return !state.is_silent();
}

/* Length of the frame at the start of the held bytes, once it is known and held whole. */
std::optional<std::size_t> whole_frame(const log_reassembly &state, std::size_t piece_len)
{
    const log_pkg_header header = log_pkg_read_header(state.incoming->recv_pkg_buf, state.recv_pkg_len);
    if (!header.has_control_len) {
        LOG_FAULT("%s: recv data too small=%d", kName, static_cast<int>(piece_len));
        return std::nullopt;
    }
    LOG_NOTE("%s: controlLen =%d", kName, static_cast<int>(header.control_len));
    if (header.has_data_len)
        LOG_NOTE("%s: dataLen =%d", kName, static_cast<int>(header.data_len));
    if (!header.has_data_len || state.recv_pkg_len < header.frame_len()) {
        LOG_NOTE("%s: continue recv data, Received =%d", kName, static_cast<int>(state.recv_pkg_len));
        return std::nullopt;
    }
    return static_cast<std::size_t>(header.frame_len());
}

/* Decodes the frame at the start of the held bytes and runs its command. */
void handle_frame(log_incoming &incoming, std::size_t len)
{
    log_msg &msg = incoming.msg;
    log_msg_clear(&msg);
    if (log_decode_msg(incoming.recv_pkg_buf, len, &msg) != 0) {
        LOG_NOTE("%s: decode log msg error,drop this piece data\n", kName);
        return;
    }
    LOG_NOTE("%s: decode success\n", kName);
    /* The longest control text fills its field and has no NUL there; from here on every text has one. */
    char control[kPkgControlMax + 1];
    std::memcpy(control, msg.control, static_cast<std::size_t>(msg.controlLen));
    control[msg.controlLen] = '\0';
    log_dl_msg_handle_cmd(control, msg.data, msg.dataLen);
}

/* Removes the first `len` bytes, a frame, and moves what follows to the start. */
void drop_frame(log_reassembly &state, std::size_t len)
{
    const std::size_t rest = state.recv_pkg_len - len;
    unsigned char *held = state.incoming->recv_pkg_buf;
    std::memmove(held, held + len, rest);
    held[rest] = '\0';
    state.recv_pkg_len = rest;
    LOG_NOTE("%s: tmp_buf remaining len =[%d] \n", kName, static_cast<int>(state.recv_pkg_len));
}

} // namespace

int log_proc_tcp_pkg(log_reassembly &state, std::span<const unsigned char> piece)
{
    if (!state.is_silent())
        LOG_NOTE("enter %s len = [%d]\n", __func__, static_cast<int>(piece.size()));
    if (!state.incoming)
        state.incoming = log_allocate<log_incoming>();
    if (!state.incoming) {
        LOG_NOTE("LOG_RECV_PKG_LEN malloc failed.\n");
        return -1;
    }
    append(state, piece);
    if (!is_worth_telling(state, piece.size()))
        return 0;
    while (state.recv_pkg_len > 0) {
        const unsigned char *held = state.incoming->recv_pkg_buf;
        const unsigned char *end = held + state.recv_pkg_len;
        if (log_FindHead_pkg(held, end) == nullptr)
            return 0;
        const std::optional<std::size_t> len = whole_frame(state, piece.size());
        if (!len)
            return 0;
        LOG_NOTE("%s:A complete packet of data received  =%d", __func__, static_cast<int>(state.recv_pkg_len));
        if (log_FindTail_pkg(held + *len - kPkgTagLen, end) == nullptr)
            return 0;
        handle_frame(*state.incoming, *len);
        drop_frame(state, *len);
    }
    return 0;
}
