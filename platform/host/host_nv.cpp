/*
 * The maker's NV library on any Linux machine: one text file, named by VEX_NV_FILE.
 *
 * A write waits in memory until cfg_save() commits it: under a lock file, so that two processes lose nothing,
 * the whole text goes into a new file, which is synced, renamed over the old one and synced in its folder. At
 * any instant, and whatever loses power, the name holds the old text or the new one, whole. A call that runs out of
 * memory has failed like any other: its callers are C, and an exception would end the process.
 */
#include "platform/host/nv_text.h"
#include "platform/unique_fd.h"
#include "platform/vex_platform.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <new>
#include <sys/file.h>
#include <sys/stat.h>
#include <vector>

namespace
{

struct nv_item {
    std::string name;
    std::string value;
};

constexpr off_t kSizeMax = 1 << 20;
constexpr auto kLockMax = std::chrono::seconds(5);
constexpr useconds_t kLockPoll = 1000; /* microseconds */

std::mutex g_mutex;
const char *g_told = ""; /* what was wrong with the file last, and is told; under g_mutex */

/* What was written since the last commit. Never destroyed: threads may use it while the process exits. */
std::vector<nv_item> &uncommitted()
{
    static auto *const items = new std::vector<nv_item>;
    return *items;
}

/* The NV file. Its name, too, is for as long as the process lives. */
const std::string &nv_path()
{
    static const auto *const path = [] {
        const char *set = std::getenv("VEX_NV_FILE");
        return new std::string(set != nullptr && *set != '\0' ? set : "/etc/vex/nvconfig");
    }();
    return *path;
}

/* Logs what is wrong with the file, when that is something else than before; false. Under g_mutex. */
bool complain(const char *what)
{
    if (std::strcmp(g_told, what) != 0)
        vex_syslog_append(0, "host_nv", __LINE__, 0, "%s: %s", nv_path().c_str(), what);
    g_told = what;
    return false;
}

/* Reads the whole file into `text`. A file that is not there is empty; false, and told, when it is there but can't be
 * read. One that is no plain file, or huge, is not waited for. */
bool read_text(const std::string &path, std::string &text)
{
    const unique_fd fd{open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC)};
    if (!fd)
        return errno == ENOENT || complain("cannot be opened");
    struct stat status {
    };
    if (fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size > kSizeMax)
        return complain("is not a plain file, or has more than 1 MB");
    char piece[4096];
    for (;;) {
        const ssize_t n = read(fd.get(), piece, sizeof piece);
        if (n == -1 && errno == EINTR)
            continue;
        if (n <= 0)
            return n == 0 || complain("cannot be read");
        text.append(piece, static_cast<std::size_t>(n));
    }
}

/* Waits for the lock of those that change the file, but not for ever. */
bool lock_out_others(int fd)
{
    const auto end = std::chrono::steady_clock::now() + kLockMax;
    while (flock(fd, LOCK_EX | LOCK_NB) != 0) {
        if (std::chrono::steady_clock::now() >= end)
            return false;
        usleep(kLockPoll);
    }
    return true;
}

bool write_all(int fd, std::string_view text)
{
    while (!text.empty()) {
        const ssize_t n = write(fd, text.data(), text.size());
        if (n == -1 && errno == EINTR)
            continue;
        if (n <= 0)
            return false;
        text.remove_prefix(static_cast<std::size_t>(n));
    }
    return true;
}

/* Writes and syncs the new text beside `path`, with the owner and rights that the old file has. */
bool write_beside(const std::string &path, const std::string &beside, std::string_view text)
{
    const unique_fd fd{open(beside.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NONBLOCK | O_CLOEXEC, 0644)};
    if (!fd)
        return false;
    struct stat old {
    };
    if (stat(path.c_str(), &old) == 0 &&
        (fchown(fd.get(), old.st_uid, old.st_gid) != 0 || fchmod(fd.get(), old.st_mode & 07777) != 0))
        return false;
    return write_all(fd.get(), text) && fsync(fd.get()) == 0;
}

bool sync_folder_of(const std::string &path)
{
    const std::size_t slash = path.rfind('/');
    const std::string folder = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    const unique_fd fd{open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)};
    return fd && fsync(fd.get()) == 0;
}

bool commit(const std::vector<nv_item> &items)
{
    const std::string &path = nv_path();
    const unique_fd lock{open((path + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644)};
    if (!lock || !lock_out_others(lock.get()))
        return complain("its lock file cannot be had");
    std::string text;
    if (!read_text(path, text))
        return false;
    for (const nv_item &item : items)
        text = nv_text_set(text, item.name, item.value);
    const std::string beside = path + ".new";
    if (!write_beside(path, beside, text) || std::rename(beside.c_str(), path.c_str()) != 0) {
        unlink(beside.c_str());
        return complain("cannot be written");
    }
    return sync_folder_of(path);
}

std::optional<std::string> get(std::string_view name)
{
    const std::lock_guard hold{g_mutex};
    for (const nv_item &item : uncommitted())
        if (item.name == name)
            return item.value;
    std::string text;
    return read_text(nv_path(), text) ? nv_text_get(text, name) : std::nullopt;
}

} // namespace

int vex_nvconfig_read(const char *name, char *value, int max_len)
try {
    if (name == nullptr || value == nullptr || max_len < 1 || !nv_name_ok(name))
        return 0;
    const std::optional<std::string> item = get(name);
    if (!item)
        return 0;
    const std::size_t room = static_cast<std::size_t>(max_len);
    const std::size_t len = item->copy(value, room);
    if (len < room)
        value[len] = '\0';
    return 1;
} catch (const std::bad_alloc &) {
    return 0;
}

int vex_nvconfig_write(const char *name, const char *value, int len)
try {
    if (name == nullptr || value == nullptr || len < 0 || !nv_name_ok(name))
        return 0;
    const std::string text{value, strnlen(value, static_cast<std::size_t>(len))};
    const std::lock_guard hold{g_mutex};
    auto &items = uncommitted();
    const auto same = std::find_if(items.begin(), items.end(), [name](const nv_item &i) { return i.name == name; });
    if (same != items.end())
        same->value = text;
    else
        items.push_back({name, text});
    return 1;
} catch (const std::bad_alloc &) {
    return 0;
}

int cfg_save()
try {
    const std::lock_guard hold{g_mutex};
    auto &items = uncommitted();
    if (items.empty())
        return 0;
    if (!commit(items)) /* a full disk, say: the items stay for the next commit, and reads see them */
        return -1;
    items.clear();
    g_told = "";
    return 0;
} catch (const std::bad_alloc &) {
    return -1;
}
