/*
 * The reader of the archives that a device sends. Packed as they should be, they are read or refused for a reason; cut
 * anywhere or with a wrong checksum they are refused; and what is told of their files cannot command a terminal. The
 * first byte of an input says what comes: the file itself, or the tar that is packed here.
 */
#include "fuzz/fuzz.h"
#include "platform/unique_fd.h"
#include "tools/tool_tar.h"

#include <algorithm>
#include <cstring>
#include <sys/mman.h>
#include <zlib.h>

namespace
{

/* Packs as gzip does. */
std::string pack(std::string_view bytes)
{
    z_stream stream{};
    promise(deflateInit2(&stream, Z_NO_COMPRESSION, Z_DEFLATED, 9 + 16, 1, Z_DEFAULT_STRATEGY) == Z_OK, "zlib packs");
    std::string packed(deflateBound(&stream, bytes.size()), '\0');
    stream.next_in = reinterpret_cast<Bytef *>(const_cast<char *>(bytes.data()));
    stream.avail_in = static_cast<uInt>(bytes.size());
    stream.next_out = reinterpret_cast<Bytef *>(packed.data());
    stream.avail_out = static_cast<uInt>(packed.size());
    promise(deflate(&stream, Z_FINISH) == Z_STREAM_END, "zlib packs whole");
    packed.resize(stream.total_out);
    deflateEnd(&stream);
    return packed;
}

/* Whether the tar is taken. */
bool check(std::string_view file, tool_packing packing)
{
    static const unique_fd fd{memfd_create("archive", MFD_CLOEXEC)};
    promise(ftruncate(fd.get(), 0) == 0 && pwrite(fd.get(), file.data(), file.size(), 0) == ssize_t(file.size()),
            "a file of these bytes");
    std::string contents;
    std::string why;
    const bool taken = tool_check_tar(fd.get(), packing, contents, why);
    promise(taken || !why.empty(), "a reason for what is refused");
    promise(!taken || contents.substr(0, contents.find('\n')).find(" file") != std::string::npos, "files are counted");
    promise(!commands_terminal(contents, "\n"), "names cannot command a terminal");
    promise(std::count(contents.begin(), contents.end(), '\n') <= 1 + std::ptrdiff_t(file.size() * 1100 / 512 + 2),
            "a line at most for each file");
    return taken;
}

void check_packed(std::string_view tar)
{
    std::string packed = pack(tar);
    promise(!check(packed, tool_packing::plain), "a packed tar is no plain one");
    if (!check(packed, tool_packing::gzip))
        return;
    const std::size_t at = packed.size() * (tar.size() % 97) / 97;
    promise(!check(std::string_view(packed).substr(0, at), tool_packing::gzip), "an archive that is cut is refused");
    promise(!check(std::string_view(packed).substr(0, packed.size() - 1), tool_packing::gzip), "by one byte, too");
    packed[packed.size() - 5] = static_cast<char>(packed[packed.size() - 5] ^ 1);
    promise(!check(packed, tool_packing::gzip), "an archive with a wrong checksum is refused");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    if (size < 1)
        return 0;
    const std::string_view file = text_of(data + 1, size - 1);
    if ((data[0] & 1) != 0) {
        check_packed(file);
    } else {
        check(file, tool_packing::plain);
        check(file, tool_packing::gzip);
    }
    return 0;
}
