/* A frame that is decoded is encoded to the same bytes again, and nothing else is taken for one. */
#include "fuzz/fuzz.h"
#include "protocol/log_pkg_codec.h"
#include "tests/memory_platform.h"

#include <memory>
#include <vector>

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    static const auto msg = std::make_unique<log_msg>();
    g_platform.log.clear();
    log_msg_clear(msg.get());
    if (log_decode_msg(data, size, msg.get()) != 0)
        return 0;
    promise(msg->controlLen >= 0 && static_cast<std::size_t>(msg->controlLen) <= kPkgControlMax,
            "a bounded control text");
    promise(msg->dataLen >= 0 && static_cast<std::size_t>(msg->dataLen) < kPkgDataMax, "bounded data");
    std::vector<unsigned char> again(kPkgSendBuf);
    auto len = static_cast<std::int32_t>(again.size());
    promise(log_encode_pkg_buf(again.data(), &len, msg.get()) == 0, "what was decoded can be encoded");
    promise(text_of(again.data(), static_cast<std::size_t>(len)) == text_of(data, size), "to the same bytes");
    return 0;
}
