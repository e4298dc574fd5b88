/*
 * An archive as a device sends it to the log tool: frame after frame, of which any may be wrong. A file comes to stand
 * under its name only when the tool says so, and holds then what the frames brought; else nothing is left behind.
 */
#include "fuzz/fuzz.h"
#include "tests/frame.h"
#include "tools/tool_archive.h"

#include <filesystem>
#include <fstream>

namespace
{

/* A folder of this process, for the archive alone. */
const std::filesystem::path &folder()
{
    static const std::filesystem::path path = [] {
        char name[] = "/tmp/tool_archive_fuzzer.XXXXXX";
        promise(mkdtemp(name) != nullptr, "a folder for the archive");
        return std::filesystem::path(name);
    }();
    return path;
}

/* What the tool says is not looked at here; a broken promise bypasses these. */
void silence()
{
    static const bool silenced = (stdout = std::fopen("/dev/null", "w")) && (stderr = std::fopen("/dev/null", "w"));
    promise(silenced, "nothing is shown");
}

/* Whether frames that each announce so many bytes begin what was sent, and bring just these. */
bool brings(std::string_view sent, std::string_view stored)
{
    const std::size_t total = stored.size();
    while (!stored.empty()) {
        const auto parts = parts_of(sent);
        if (!parts)
            return false;
        const tool_answer answer = tool_read_answer(std::string(parts->control), "2");
        if (std::strtoull(tool_answer_text(answer, "GetLocalLog", "totalLength").c_str(), nullptr, 10) != total ||
            !stored.starts_with(parts->data))
            return false;
        stored.remove_prefix(parts->data.size());
        sent.remove_prefix(parts->size);
    }
    return true;
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    int ends[2];
    if (size > 100000 || socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends) != 0)
        return 0;
    silence();
    const unique_fd peer{ends[1]};
    promise(send(peer.get(), data, size, MSG_NOSIGNAL) == static_cast<ssize_t>(size) || size == 0, "it is sent");
    shutdown(peer.get(), SHUT_WR);
    tool_device device;
    device.link = tool_link{.fd = unique_fd{ends[0]}, .where = "device", .limits = {}, .held = {}};
    const std::filesystem::path file = folder() / "logs.tar.gz";
    const bool done = tool_archive(device, file, 1) == kDone;
    promise(std::filesystem::exists(file) == done, "the archive stands there if the tool says so");
    if (done) {
        std::ifstream in(file, std::ios::binary);
        const std::string stored{std::istreambuf_iterator<char>(in), {}};
        promise(brings(text_of(data, size), stored), "it is what the device sent");
        std::filesystem::remove(file);
    }
    promise(std::filesystem::is_empty(folder()), "nothing is left behind");
    return 0;
}
