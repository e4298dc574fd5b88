#include "handlers/bsp_module_level.h"

#include "core/log_line.h"
#include "core/log_lock.h"
#include "core/log_tools.h"
#include "handlers/log_handler.h"

#include <cstring>

namespace
{

constexpr char kItem[] = "bsplog_module_level";
constexpr int kPiecesMax = 32;

constexpr std::size_t kTextSize = 64; /* a piece with its NUL */

log_mutex bsp_record_lock; /* one change of the record at a time */

/* One piece of the record. There is room for one character more than counts, to tell what is too long. */
struct bsp_entry {
    char text[kTextSize + 1];
    char name[kBspFieldSize + 1];
    char level[kBspFieldSize + 1];
    bool has_level;
};

void read_record(char (&record)[kBspRecordSize])
{
    vex_get_nv_item(kItem, record, sizeof record);
}

/* Reads a piece, cut to `text_size` bytes, and its name and level, cut to `field_size`; false when there is no such
 * piece. */
bool read_entry(const char *record, int piece, std::size_t text_size, std::size_t field_size, bsp_entry *entry)
{
    *entry = {};
    if (getNthValueSafe(piece, record, ';', entry->text, static_cast<int>(text_size)) != 0)
        return false;
    const int size = static_cast<int>(field_size);
    getNthValueSafe(0, entry->text, ',', entry->name, size);
    entry->has_level = getNthValueSafe(1, entry->text, ',', entry->level, size) == 0;
    return true;
}

/* A record under construction; full() once something had no room. */
class record_text
{
public:
    void append(const char *name, const char *level)
    {
        const int n = std::snprintf(text_ + len_, sizeof text_ - len_, "%s,%s;", name, level);
        full_ = full_ || static_cast<std::size_t>(n) >= sizeof text_ - len_;
        ++entries_;
        if (!full_)
            len_ += static_cast<std::size_t>(n);
    }
    const char *text() const { return text_; }
    int length() const { return static_cast<int>(len_); }
    bool full() const { return full_; }
    int entries() const { return entries_; } /* that were appended */

private:
    char text_[kBspRecordSize] = {};
    std::size_t len_ = 0;
    int entries_ = 0;
    bool full_ = false;
};

/* Appends an entry to the new record, with the given level when it is the given module's: then true. */
bool rewrite_entry(const bsp_entry &entry, const char *name, const char *level, record_text *out)
{
    LOG_NOTE("bsp_moduleLogInfo =[%s][%d]\n", entry.text, static_cast<int>(std::strlen(entry.text)));
    if (!entry.has_level) {
        LOG_NOTE("%s: [%s] has no level, dropped\n", kItem, entry.text);
        return false;
    }
    LOG_NOTE("bsp bsp_moduleName =[%s]\n", entry.name);
    LOG_NOTE("bsp bsp_moduleLevel =[%s]\n", entry.level);
    const bool found = std::strcmp(entry.name, name) == 0;
    if (found)
        LOG_NOTE("find %s item\n", name);
    out->append(entry.name, found ? level : entry.level);
    return found;
}

} // namespace

bool log_bsp_text_allowed(const char *text)
{
    std::size_t len = 0;
    for (; text[len] != '\0'; ++len)
        if (len == kBspFieldSize - 1 ||
            std::strchr("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_-.", text[len]) == nullptr)
            return false;
    return len > 0;
}

void log_get_bsp_module_level(const char *name, char (&level)[kBspFieldSize])
{
    char record[kBspRecordSize] = {};
    read_record(record);
    level[0] = '\0';
    bsp_entry entry;
    for (int i = 0; i < kPiecesMax; ++i) {
        if (!read_entry(record, i, kTextSize, kBspFieldSize, &entry) || std::strcmp(entry.name, name) != 0)
            continue;
        LOG_NOTE("find %s item\n", entry.text);
        if (entry.has_level)
            log_keep_text(level, entry.level);
    }
    if (level[0] == '\0')
        log_keep_text(level, kBspDefaultLevel);
}

int log_set_bsp_module_level(const char *name, const char *level)
{
    const log_lock hold{bsp_record_lock};
    char record[kBspRecordSize] = {};
    read_record(record);
    record_text out;
    bool found = false;
    bsp_entry entry;
    for (int i = 0; i < kPiecesMax; ++i)
        if (read_entry(record, i, kTextSize, sizeof entry.name, &entry) && entry.text[0] != '\0')
            found = rewrite_entry(entry, name, level, &out) || found;
    if (!found)
        out.append(name, level);
    if (!found && out.entries() > kPiecesMax)
        LOG_NOTE("%s has no room for %s: only its first %d entries are looked at\n", kItem, name, kPiecesMax);
    if (out.full()) {
        LOG_NOTE("%s has no room for %s\n", kItem, name);
        return -1;
    }
    LOG_NOTE("bsp_moduleLogInfo = [%s] \n", out.text());
    vex_set_nv_item(kItem, out.text(), out.length());
    return 0;
}

void log_apply_bsp_module_level(const char *name, const char *level)
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "sh /usr/vex/vex_conf/scripts/klog_mod.sh %s %s", name, level);
    log_exec_cmd(cmd);
}

void log_restore_bsp_module_level()
{
    char record[kBspRecordSize] = {};
    read_record(record);
    bsp_entry entry;
    for (int i = 0; i < kPiecesMax; ++i) {
        if (!read_entry(record, i, sizeof entry.text, sizeof entry.name, &entry) || entry.text[0] == '\0')
            continue;
        if (!log_bsp_text_allowed(entry.name) || !log_bsp_text_allowed(entry.level))
            LOG_NOTE("%s: [%s] is skipped\n", kItem, entry.text);
        else if (std::strcmp(entry.level, kBspDefaultLevel) != 0)
            log_apply_bsp_module_level(entry.name, entry.level);
    }
}
