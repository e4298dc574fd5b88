#include "tools/tool_archive.h"

#include "tools/tool_progress.h"

#include <archive.h>
#include <archive_entry.h>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

constexpr auto kPackAgain = std::chrono::seconds(1); /* after the device failed to pack */
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

    bool opened() const { return static_cast<bool>(fd_); }
    int fd() const { return fd_.get(); }
    bool write(std::span<const unsigned char> bytes) const
    {
        while (!bytes.empty()) {
            const ssize_t n = ::write(fd_.get(), bytes.data(), bytes.size());
            if (n < 0 && errno != EINTR)
                return false;
            bytes = bytes.subspan(static_cast<std::size_t>(std::max<ssize_t>(n, 0)));
        }
        return true;
    }
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

struct archive_deleter {
    void operator()(archive *reader) const { archive_read_free(reader); }
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

/* The number that a text is, from 1 on; 0 for any other. */
std::uint64_t total_of(const tool_answer &answer)
{
    const std::string text = tool_answer_text(answer, "GetLocalLog", "totalLength");
    std::uint64_t total = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), total);
    return error == std::errc() && end == text.data() + text.size() ? total : 0;
}

/* Receives pieces until their lengths add up to the length that each of them announces. */
fetch_result receive_pieces(tool_link &link, const part_file &out)
{
    std::optional<tool_progress> progress;
    std::uint64_t total = 0;
    std::uint64_t received = 0;
    do {
        std::string why;
        const std::optional<tool_frame> frame = tool_receive(link, why);
        if (!frame)
            return failed(kNoAnswer, why);
        const tool_answer answer = tool_read_answer(frame->control);
        if (answer.verdict != tool_verdict::success)
            return {kDeviceSaidNo, answer.reason, frame->control, answer.reason.find(kNotPacked) != std::string::npos};
        const std::uint64_t announced = total_of(answer);
        if (total == 0 && announced != 0) {
            total = announced;
            progress.emplace("received", total);
        }
        received += frame->data.size();
        if (announced != total || frame->data.empty() || received > total)
            return failed(kDeviceSaidNo, "the pieces of the archive do not fit together: " + std::to_string(received) +
                                             " bytes of " + std::to_string(total) + ". Try again");
        if (!out.write(frame->data))
            return failed(kNoAnswer, std::string("cannot store the archive: ") + std::strerror(errno));
        progress->advance(frame->data.size());
        if (received == total)
            return {kDone, "", frame->control, false};
    } while (true);
}

/* Reads the whole archive as a gzip tar and lists the captures in it; false, and why, when it is none. */
bool check(int fd, std::string &contents, std::string &why)
{
    const std::unique_ptr<archive, archive_deleter> reader{archive_read_new()};
    archive_read_support_filter_gzip(reader.get());
    archive_read_support_format_tar(reader.get());
    lseek(fd, 0, SEEK_SET);
    int result = archive_read_open_fd(reader.get(), fd, 65536);
    int files = 0;
    std::string captures;
    archive_entry *entry = nullptr;
    while (result == ARCHIVE_OK && (result = archive_read_next_header(reader.get(), &entry)) == ARCHIVE_OK) {
        const std::string name = archive_entry_pathname(entry) != nullptr ? archive_entry_pathname(entry) : "";
        files += archive_entry_filetype(entry) == AE_IFREG ? 1 : 0;
        if (name.ends_with(".pcap"))
            captures += "  capture " + tool_printable(name) + ", " +
                        tool_bytes(static_cast<std::uint64_t>(archive_entry_size(entry))) +
                        (archive_entry_size(entry) == 0 ? ": nothing is in it yet\n" : "\n");
        result = archive_read_data_skip(reader.get());
    }
    contents = std::to_string(files) + " files\n" + captures;
    if (result == ARCHIVE_EOF)
        return true;
    why = std::string("what the device sent is no readable gzip tar: ") + archive_error_string(reader.get());
    return false;
}

fetch_result fetch(tool_device &device, const std::string &file, std::string &contents)
{
    std::string why;
    part_file out(file);
    if (!out.opened())
        return failed(kNoAnswer, "cannot write " + file + ": " + std::strerror(errno));
    if (!tool_reach(device, why) ||
        !tool_send(*device.link, tool_command("2", nullptr, {{"GetLocalLog", ""}}), {}, why))
        return failed(kNoAnswer, why);
    fetch_result result = receive_pieces(*device.link, out);
    if (result.status != kDone)
        return result;
    if (!check(out.fd(), contents, why))
        return failed(kDeviceSaidNo, why);
    if (!out.keep())
        return failed(kNoAnswer, "cannot store " + file + ": " + std::strerror(errno));
    return result;
}

/* Gives the device's logs a moment to calm down; false when the user wants to end. */
bool let_calm_down()
{
    return tool_wait_for({}, tool_clock::now() + kPackAgain) != tool_wait::interrupted;
}

} // namespace

int tool_archive(tool_device &device, const std::string &file, int tries)
{
    tool_catch_interrupts();
    std::string contents;
    fetch_result result;
    for (int i = 1;; ++i) {
        result = fetch(device, file, contents);
        if (!result.not_packed)
            break;
        result.why = "the device could not pack its logs. Most likely one of them changed while it was packed";
        if (i >= tries)
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
