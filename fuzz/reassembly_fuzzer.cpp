/*
 * Frames come out whole and in order, in whatever pieces their bytes came in. The first byte of an input says how the rest
 * is cut into pieces. Only less than a buffer full is fed: how an overflow ends depends on the pieces.
 */
#include "fuzz/fuzz.h"
#include "protocol/log_reassembly.h"
#include "tests/memory_platform.h"
#include "tests/recording_handlers.h"

#include <algorithm>
#include <span>

namespace
{

/* What reaches the handlers when the bytes come in pieces of up to so many. */
std::string commands_of(std::span<const std::uint8_t> bytes, std::size_t piece_size)
{
    log_reassembly state;
    g_commands.clear();
    while (!bytes.empty()) {
        const std::span<const std::uint8_t> piece = bytes.first(std::min(piece_size, bytes.size()));
        promise(log_proc_tcp_pkg(state, piece) == 0, "a piece is taken");
        promise(state.recv_pkg_len < LOG_RECV_PKG_LEN, "what is held is less than the buffer");
        bytes = bytes.subspan(piece.size());
        g_platform.log.clear();
    }
    return g_commands;
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    if (size < 2 || size >= LOG_RECV_PKG_LEN)
        return 0;
    const std::span<const std::uint8_t> bytes(data + 1, size - 1);
    const std::string whole = commands_of(bytes, bytes.size());
    promise(whole == commands_of(bytes, data[0] + std::size_t{1}), "the pieces do not matter");
    return 0;
}
