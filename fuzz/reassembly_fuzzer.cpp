/*
 * What is fed whole comes out whole and in order, in whatever pieces it came, and reaches the handler that it is for.
 * Said twice: by the reassembler and dispatch, and by a model over strings, which takes them at their headers' word.
 *
 * The first four bytes of an input are the sizes of the pieces, in turn, so squeezed that small ones are frequent.
 * After a fifth of 0xff the bytes come again and again, in large pieces, until the buffer has been full.
 */
#include "core/log_link.h"
#include "fuzz/fuzz.h"
#include "protocol/json_tree.h"
#include "protocol/log_json_codec.h"
#include "protocol/log_reassembly.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"
#include "tests/recording_handlers.h"

#include <algorithm>
#include <cstring>

namespace
{

constexpr std::size_t kSizes = 4;
constexpr int kFramesMax = 200; /* more of them are only slow */
constexpr std::size_t kFedMax = LOG_RECV_PKG_LEN + 2 * kLogPieceMax;

/* Whether an escaped NUL would cut a text off. */
bool hides_nul(std::string json)
{
    for (std::size_t at = 0; (at = json.find("\\\\", at)) != std::string::npos;)
        json[at] = json[at + 1] = ' ';
    return json.find("\\u0000") != std::string::npos;
}

/* What a frame's command does to the record of commands. */
std::string command_of(std::string_view control, std::string_view data)
{
    const std::string text(control.substr(0, control.find('\0')));
    const json_tree tree{cJSON_Parse(text.c_str())};
    const char *const id = cJSON_GetStringValue(cJSON_GetObjectItem(tree.get(), "msgid"));
    const long number = id != nullptr ? std::strtol(id, nullptr, 10) : -1;
    if (number < 1 || number > 11 || number == 9 || hides_nul(text))
        return "";
    return std::to_string(number) + ':' + text + ':' + std::string(data) + ';';
}

/* Takes the first frame off the held bytes, and adds what it commands; false when none is there yet. */
bool model_take(std::string &held, std::string &commands)
{
    const auto parts = parts_of(held);
    if (!parts || !held.starts_with(PKG_HEAD) || held.compare(parts->size - kPkgTagLen, kPkgTagLen, PKG_TAIL) != 0)
        return false;
    if (parts->control.size() <= kPkgControlMax && parts->data.size() < kPkgDataMax)
        commands += command_of(parts->control, parts->data);
    held.erase(0, parts->size);
    return true;
}

/* A connection's reassembler beside the model of it. */
struct connection {
    log_reassembly state;
    std::string held;
    std::string commands;
    int frames = 0;

    void feed(std::string_view piece)
    {
        const auto *const at = reinterpret_cast<const unsigned char *>(piece.data());
        promise(log_proc_tcp_pkg(state, {at, piece.size()}) == 0, "a piece is taken");
        if (held.size() + piece.size() >= LOG_RECV_PKG_LEN)
            held.clear();
        held += piece.size() < LOG_RECV_PKG_LEN ? piece : "";
        while (model_take(held, commands))
            ++frames;
        promise(state.recv_pkg_len == held.size(), "as much is held as is not yet a frame");
        promise(g_commands == commands, "commands come out whole and in order");
        g_commands.clear(); /* so that many commands are not compared over and over */
        commands.clear();
    }
};

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    g_platform.takes_line = [](const char *, const char *, va_list) {};
    if (size < kSizes + 2)
        return 0;
    const std::string_view input = text_of(data + kSizes + 1, size - kSizes - 1);
    std::string fed(input.substr(0, kFedMax));
    const bool again = data[kSizes] == 0xff;
    while (again && fed.size() < kFedMax)
        fed += fed.substr(0, kFedMax - fed.size());
    std::string_view bytes = fed;
    connection in_pieces;
    for (std::size_t i = 0; !bytes.empty() && in_pieces.frames < kFramesMax; ++i) {
        const std::size_t squeezed = data[i % kSizes] * data[i % kSizes] / 32u + (again ? 1000 : 1);
        const std::string_view piece = bytes.substr(0, std::min(squeezed, kLogPieceMax));
        in_pieces.feed(piece);
        bytes.remove_prefix(piece.size());
    }
    connection{}.feed(fed);
    return 0;
}
