/*
 * The frame codec. What is a frame is decoded, and encoded to the same bytes again, from its record and in its place;
 * what is none is told from it. The other way round, a text and data that fit a frame come out of it as they went in.
 */
#include "fuzz/fuzz.h"
#include "protocol/log_pkg_codec.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"

#include <memory>
#include <vector>

namespace
{

/* What the codec has to take for a frame, by its description. */
bool is_frame(std::string_view bytes)
{
    const auto parts = parts_of(bytes);
    return parts && bytes.starts_with(PKG_HEAD) && bytes.ends_with(PKG_TAIL) && parts->size == bytes.size() &&
           parts->control.size() <= kPkgControlMax && parts->data.size() < kPkgDataMax;
}

std::string_view data_of(const log_msg &msg)
{
    return text_of(msg.data, static_cast<std::size_t>(msg.dataLen));
}

void check_decoding(const std::uint8_t *data, std::size_t size, log_msg *msg)
{
    const std::string_view frame = text_of(data, size);
    promise((log_FindHead_pkg(data, data + size) == data) == frame.starts_with(PKG_HEAD) &&
                (size < kPkgTagLen ||
                 (log_FindTail_pkg(data + size - kPkgTagLen, data + size) != nullptr) == frame.ends_with(PKG_TAIL)),
            "a tag is found where it is");
    log_msg_clear(msg);
    const bool decoded = log_decode_msg(data, size, msg) == 0;
    promise(decoded == is_frame(frame), "a frame is decoded, anything else is not");
    if (!decoded)
        return;
    std::vector<unsigned char> again(kPkgSendBuf);
    auto len = static_cast<std::int32_t>(again.size());
    promise(log_encode_pkg_buf(again.data(), &len, msg) == 0, "what was decoded can be encoded");
    promise(text_of(again.data(), static_cast<std::size_t>(len)) == frame, "to the same bytes");
}

/* The input as a control text, which its first NUL ends, and data. */
void check_encoding(std::string_view input, log_msg *msg)
{
    const std::string control(take_field(input, '\0'));
    const auto data_len = static_cast<std::int32_t>(input.size());
    log_msg_clear(msg);
    const bool fits = control.size() <= kPkgControlMax && input.size() <= kPkgDataMax;
    promise((log_encode_fill_msg(control.c_str(), input.data(), data_len, msg) == 0) == fits, "what fits is taken");
    if (!fits)
        return;
    static log_outgoing outgoing;
    std::int32_t len = 0;
    input.copy(reinterpret_cast<char *>(outgoing.data()), input.size());
    const unsigned char *const frame = log_encode_outgoing(control.c_str(), data_len, &outgoing, &len);
    promise(frame != nullptr, "what fits can be encoded where its data lies");
    std::int32_t record_len = kPkgSendBuf;
    std::vector<unsigned char> of_record(kPkgSendBuf);
    promise(log_encode_pkg_buf(of_record.data(), &record_len, msg) == 0 &&
                text_of(of_record.data(), static_cast<std::size_t>(record_len)) ==
                    text_of(frame, static_cast<std::size_t>(len)),
            "and from a record, to the same bytes");
    log_msg_clear(msg);
    const bool decoded = log_decode_msg(frame, static_cast<std::size_t>(len), msg) == 0;
    promise(decoded == (input.size() < kPkgDataMax), "what was encoded is decoded");
    promise(!decoded || (control == std::string_view(msg->control, static_cast<std::size_t>(msg->controlLen)) &&
                         input == data_of(*msg)),
            "text and data come out as they went in");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    static const auto msg = std::make_unique<log_msg>();
    g_platform.log.clear();
    check_decoding(data, size, msg.get());
    check_encoding(text_of(data, size), msg.get());
    return 0;
}
