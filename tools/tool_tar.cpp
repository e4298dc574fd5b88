#include "tools/tool_tar.h"

#include "platform/unique_fd.h"
#include "tools/tool_answer.h"
#include "tools/tool_progress.h"

#include <archive.h>
#include <archive_entry.h>
#include <cerrno>
#include <fcntl.h>
#include <memory>
#include <string_view>
#include <zlib.h>

namespace
{

struct archive_deleter {
    void operator()(archive *reader) const { archive_read_free(reader); }
};

struct gzip_closer {
    void operator()(gzFile file) const { gzclose(file); }
};

/* The bytes that a tar is made of. They come from zlib, which checks its checksums. */
struct unpacked_bytes {
    std::unique_ptr<std::remove_pointer_t<gzFile>, gzip_closer> file;
    unsigned char piece[65536];
    std::string error; /* why there are no more, unless the file has just ended */
};

la_ssize_t read_unpacked(archive *reader, void *context, const void **bytes)
{
    auto *source = static_cast<unpacked_bytes *>(context);
    *bytes = source->piece;
    int error = Z_OK;
    const int n = tool_interrupted() ? -1 : gzread(source->file.get(), source->piece, sizeof source->piece);
    const std::string_view text = gzerror(source->file.get(), &error); /* "FILE: what is wrong" */
    if (n > 0 || (n == 0 && error == Z_OK))
        return n;
    const auto colon = text.find(": ");
    source->error = error == Z_OK ? "interrupted" : text.substr(colon != text.npos ? colon + 2 : 0);
    archive_set_error(reader, EIO, "%s", source->error.c_str());
    return ARCHIVE_FATAL;
}

/* A line about a packet capture; nothing for any other file. */
std::string about_capture(archive_entry *entry)
{
    const char *name = archive_entry_pathname(entry);
    if (name == nullptr || !std::string_view(name).ends_with(".pcap"))
        return "";
    const auto size = static_cast<std::uint64_t>(archive_entry_size(entry));
    return "  capture " + tool_printable(name) + ", " + tool_bytes(size) +
           (size == 0 ? ": nothing is in it yet\n" : "\n");
}

/* A warning is about a name or a time, not about what is in a file. */
bool readable(int result)
{
    return result == ARCHIVE_OK || result == ARCHIVE_WARN;
}

} // namespace

bool tool_check_tar(int fd, tool_packing packing, std::string &contents, std::string &why)
{
    lseek(fd, 0, SEEK_SET);
    const auto source = std::make_unique<unpacked_bytes>();
    source->file.reset(gzdopen(fcntl(fd, F_DUPFD_CLOEXEC, 0), "rb"));
    if (!source->file || gzdirect(source->file.get()) != (packing == tool_packing::plain ? 1 : 0)) {
        why = packing == tool_packing::gzip ? "it is not packed with gzip" : "it is packed, a plain tar is wanted";
        return false;
    }
    const std::unique_ptr<archive, archive_deleter> reader{archive_read_new()};
    archive_read_support_format_tar(reader.get());
    int result = archive_read_open(reader.get(), source.get(), nullptr, read_unpacked, nullptr);
    int files = 0;
    std::string captures;
    archive_entry *entry = nullptr;
    while (readable(result) && readable(result = archive_read_next_header(reader.get(), &entry))) {
        files += archive_entry_filetype(entry) == AE_IFREG ? 1 : 0;
        captures += about_capture(entry);
        result = archive_read_data_skip(reader.get());
    }
    contents = std::to_string(files) + (files == 1 ? " file\n" : " files\n") + captures;
    const void *rest = nullptr; /* what follows the tar's end belongs to the checksum too */
    la_ssize_t n = 0;
    while (result == ARCHIVE_EOF && (n = read_unpacked(reader.get(), source.get(), &rest)) > 0)
        continue;
    if (result == ARCHIVE_EOF && n == 0)
        return true;
    const char *error = archive_error_string(reader.get());
    why = !source->error.empty() ? source->error : error != nullptr ? error : "its tar is damaged";
    return false;
}
