#include "tools/tool_archive.h"

#include "tools/tool_process.h"
#include "tools/tool_progress.h"
#include "tools/tool_tar.h"

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

constexpr auto kPackAgain = std::chrono::seconds(1); /* after the device failed to pack */
constexpr char kMsgid[] = "2";
constexpr char kNotPacked[] = "Fail:Compressed logfs error";

/* A file under a temporary name, which is removed unless it was given its own. */
class part_file
{
public:
    explicit part_file(const std::string &file) : file_(file), part_(file + ".XXXXXX")
    {
        fd_.reset(mkostemp(part_.data(), O_CLOEXEC));
    }
    ~part_file()
    {
        if (fd_ && !kept_)
            unlink(part_.c_str());
    }
    part_file(const part_file &) = delete;
    part_file &operator=(const part_file &) = delete;

    std::string cannot_store() const { return "cannot store " + file_ + ": " + std::strerror(errno); }
    bool opened() const { return static_cast<bool>(fd_); }
    int fd() const { return fd_.get(); }
    /* Brings it to storage under its own name. */
    bool keep()
    {
        const mode_t mask = umask(0);
        umask(mask);
        kept_ =
            fchmod(fd_.get(), 0666 & ~mask) == 0 && fsync(fd_.get()) == 0 && rename(part_.c_str(), file_.c_str()) == 0;
        return kept_;
    }

private:
    std::string file_;
    std::string part_;
    unique_fd fd_;
    bool kept_ = false;
};

/* How one fetch ended. */
struct fetch_result {
    int status = kNoAnswer;
    std::string why;     /* after a failure */
    std::string control; /* the device's last reply as it came */
    bool not_packed = false;
};

fetch_result failed(int status, const std::string &why)
{
    return {status, why, "", false};
}

/* The same where the device may still be sending pieces, which would be taken for its next answer. */
fetch_result broken_off(tool_device &device, int status, const std::string &why)
{
    device.link.reset();
    return failed(status, why);
}

/* The length that a piece announces; 0 where it is none: a device counts in 32 bits. */
std::uint64_t total_of(const tool_answer &answer)
{
    const std::string text = tool_answer_text(answer, "GetLocalLog", "totalLength");
    std::uint64_t total = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), total);
    return error == std::errc() && end == text.data() + text.size() && total <= INT32_MAX ? total : 0;
}

/* Receives pieces until their lengths add up to the length that each of them announces. */
fetch_result receive_pieces(tool_device &device, const part_file &out)
{
    std::optional<tool_progress> progress;
    std::uint64_t total = 0;
    std::uint64_t received = 0;
    for (;;) {
        std::string why;
        const auto limit = received == 0 ? device.limits.reply : device.limits.stall;
        const std::optional<tool_frame> frame = tool_receive(*device.link, limit, why);
        if (!frame)
            return broken_off(device, kNoAnswer, why);
        const tool_answer answer = tool_read_answer(frame->control, kMsgid);
        if (answer.verdict != tool_verdict::success)
            return {kDeviceSaidNo, tool_said(device, answer), frame->control,
                    tool_answer_text(answer, nullptr, "Result") == kNotPacked};
        const std::uint64_t announced = total_of(answer);
        if (total == 0 && announced != 0) {
            total = announced;
            progress.emplace("received", total);
        }
        received += frame->data.size();
        if (announced != total || frame->data.empty() || received > total)
            return broken_off(device, kDeviceSaidNo,
                              "the pieces of the archive that " + device.link->where +
                                  " sent do not fit together. Try again");
        if (!tool_write_whole(out.fd(), frame->data.data(), frame->data.size()))
            return broken_off(device, kNoAnswer, out.cannot_store());
        progress->advance(frame->data.size());
        if (received == total)
            return {kDone, "", frame->control, false};
    }
}

fetch_result fetch(tool_device &device, const std::string &file, std::string &contents)
{
    std::string why;
    part_file out(file);
    if (!out.opened())
        return failed(kNoAnswer, out.cannot_store());
    if (!tool_send(*device.link, tool_command(kMsgid, nullptr, {{"GetLocalLog", ""}}), {}, why))
        return broken_off(device, kNoAnswer, why);
    if (isatty(STDERR_FILENO) == 1)
        std::fprintf(stderr, "The device packs its logs...\n");
    fetch_result result = receive_pieces(device, out);
    if (result.status != kDone)
        return result;
    if (!tool_check_tar(out.fd(), tool_packing::gzip, contents, why))
        return failed(kDeviceSaidNo,
                      "what " + device.link->where + " sent is no whole gzip tar: " + why + ". Try again");
    if (!out.keep())
        return failed(kNoAnswer, out.cannot_store());
    return result;
}

/* Whether a file may be put there: nothing but another plain file is replaced. */
bool replaceable(const std::string &file, std::string &why)
{
    struct stat about {
    };
    if (lstat(file.c_str(), &about) == 0 && !S_ISREG(about.st_mode)) {
        why = file + " is there already and is no plain file";
        return false;
    }
    const std::string::size_type slash = file.rfind('/');
    const std::string dir = slash == std::string::npos ? "." : file.substr(0, slash + 1);
    if (!file.empty() && slash != file.size() - 1 && access(dir.c_str(), W_OK | X_OK) == 0)
        return true;
    why = "cannot write " + file + ": " + std::strerror(file.empty() || errno == 0 ? EINVAL : errno);
    return false;
}

/* Today, as part of a file's name. */
std::string date()
{
    char text[16];
    const std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    std::strftime(text, sizeof text, "%Y%m%d", &local);
    return text;
}

/* Gives the device's logs a moment to calm down; false when the user wants to end. */
bool let_calm_down()
{
    return tool_wait_for({}, tool_clock::now() + kPackAgain) != tool_wait::interrupted;
}

} // namespace

int tool_archive(tool_device &device, const std::string &place, int tries)
{
    const std::string file = device.one_of_many ? place + '/' + device.imei + '-' + date() + ".tgz" : place;
    fetch_result result;
    std::string contents;
    if (!replaceable(file, result.why) || !tool_reach(device, result.why))
        return tool_fail(kNoAnswer, result.why);
    tool_catch_interrupts();
    for (int i = 1;; ++i) {
        result = fetch(device, file, contents);
        if (!result.not_packed || i >= tries)
            break;
        std::fprintf(stderr, "%s; trying again (%d of %d)\n", result.why.c_str(), i + 1, tries);
        if (!let_calm_down())
            break;
    }
    if (device.json && !result.control.empty())
        std::printf("%s\n", result.control.c_str());
    if (result.status != kDone)
        return tool_fail(result.status, result.why);
    if (!device.json)
        std::printf("Log archive stored as %s: %s", file.c_str(), contents.c_str());
    return kDone;
}
