#include "core/log_filemgr.h"
#include "core/log_line.h"
#include "core/log_record.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"
#include "platform/unique_fd.h"
#include "protocol/log_pkg_send.h"

#include <cerrno>
#include <fcntl.h>

namespace
{

constexpr char kName[] = "log_msg_get_log_file";

constexpr char kArchive[] = "/tmp/MBBlogfs.tar.gz";
constexpr char kLogDir[] = "/logfs/";

constexpr int kFullPercent = 95;  /* a log partition fuller than this gives up its system log */
constexpr int kPieceSize = 51200; /* bytes of the archive in a frame */
constexpr int kSendAttempts = 3;  /* of each frame */

void reply_failure(const char *result)
{
    log_reply("{\"msgid\":\"2\",\"GetLocalLog\":{\"totalLength\":\"0\"},\"Result\":\"%s\"}", result);
}

/* Packing needs room: deletes the system log when the log partition is nearly full. */
void make_room()
{
    char path[16] = {};
    vex_get_nv_item("syslog_path", path, sizeof path);
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "df -h | grep %s |awk '{print $5}' | cut -d \"%%\" -f 1", path);
    char used[16] = {};
    vex_popen(cmd, used, sizeof used);
    LOG_NOTE("%s: the used space of %s is %s \n", kName, path, used);
    if (log_text_to_int(used) <= kFullPercent)
        return;
    log_exec_cmd("rm -rf /logfs/syslog*");
    LOG_NOTE("%s:God !!! the space of %s is no enough, del syslog file \n", kName, kLogDir);
}

/* Puts an empty archive of our own in place, for tar to write into: others can neither read it nor lay something there
 * beforehand. */
bool create_archive()
{
    const unique_fd archive{
        log_clear_path(kArchive) ? open(kArchive, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600) : -1};
    if (!archive)
        LOG_FAULT("%s: can not create %s, errno: %d\n", kName, kArchive, errno);
    return static_cast<bool>(archive);
}

/* Packs the log partition. The archive's size; 0 or less when there is none to be sent. */
std::int32_t pack()
{
    if (!create_archive())
        return 0;
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "tar -czvf %s %s", kArchive, kLogDir);
    LOG_NOTE("%s:[%s] start\n", kName, cmd);
    const int packed = log_exec_cmd(cmd);
    LOG_NOTE("%s:[%s] end\n", kName, cmd);
    const std::int32_t size = log_get_file_size(kArchive);
    return packed == 0 ? size : 0;
}

bool send_piece(const char *control, log_outgoing *piece, std::int32_t len)
{
    for (int attempt = 0; attempt < kSendAttempts; ++attempt)
        if (log_cmd_send_piece(control, piece, len) == 0)
            return true;
    return false;
}

/* Sends `size` bytes of the archive, or as much of them as can be read and sent. */
void send_archive(FILE *archive, std::int32_t size, log_outgoing *piece)
{
    char control[1024];
    std::snprintf(control, sizeof control,
                  "{\"msgid\":\"2\",\"GetLocalLog\":{\"totalLength\":\"%d\"},\"Result\":\"Success\"}", size);
    std::int32_t remaining = size;
    while (remaining > 0) {
        const std::int32_t len = log_read_file(archive, piece->data(), kPieceSize);
        if (len == 0 || !send_piece(control, piece, len)) {
            LOG_NOTE("%s:send data fail\n", kName);
            return;
        }
        remaining -= len;
    }
    if (remaining == 0)
        LOG_NOTE("%s:read file all data, complete\n", kName);
}

void remove_archive()
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "rm -rf %s", kArchive);
    log_exec_cmd(cmd);
}

} // namespace

int log_msg_get_log_file(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    if (!log_handler_entered(kName, control, data))
        return -1;
    log_handler_received(kName, control);
    make_room();
    log_exec_cmd("sh /usr/vex/vex_conf/scripts/vex_debug.sh get_status");
    const std::int32_t size = pack();
    if (size <= 0) {
        reply_failure("Fail:Compressed logfs error");
        return -1;
    }
    const auto piece = log_allocate<log_outgoing>();
    FILE *archive = piece ? log_open_file(kArchive, kFileReadBinary) : nullptr;
    if (archive == nullptr) {
        reply_failure("Fail:Open log file error");
        return -1;
    }
    send_archive(archive, size, piece.get());
    log_close_file(archive);
    remove_archive();
    return 0;
}
