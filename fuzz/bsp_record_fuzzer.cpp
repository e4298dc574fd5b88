/*
 * The record of kernel-module levels, whatever it held before: a level that has room is stored and found, the other
 * modules keep theirs, and nothing in the record commands the shell when the levels are restored. An input is the name
 * of a module and its level, with a ';' behind each, and the record.
 */
#include "fuzz/fuzz.h"
#include "handlers/bsp_module_level.h"
#include "tests/memory_platform.h"

#include <cstring>
#include <spawn.h>

namespace
{

constexpr char kItem[] = "bsplog_module_level";
constexpr std::string_view kScript = "sh /usr/vex/vex_conf/scripts/klog_mod.sh ";
constexpr std::size_t kRestored = 32; /* pieces of the record that count */

int g_restored = 0;

std::string level_of(const std::string &name)
{
    char level[kBspFieldSize];
    log_get_bsp_module_level(name.c_str(), level);
    promise(std::memchr(level, '\0', sizeof level) != nullptr, "a level is a text");
    return level;
}

/* Stores a level in a record of up to 31 pieces that a module's name and level fit into. */
void check_store(const std::string &name, const std::string &level, std::string_view record)
{
    std::string others[kRestored];
    std::string levels[kRestored];
    bool comparable = true; /* a name that is too long may be taken for the one that it begins with */
    std::size_t most = name.size() + level.size() + 2; /* bytes that the new record takes */
    std::size_t count = 0;
    for (; !record.empty() && count < kRestored; ++count) {
        const std::string_view piece = take_field(record, ';');
        others[count] = piece.substr(0, piece.find(','));
        most += piece.size() + 1 + (others[count] == name ? level.size() : 0);
        comparable = comparable && others[count].size() < kBspFieldSize;
        if (!log_bsp_text_allowed(others[count].c_str()) || piece.size() >= 64 || piece.find(',') == piece.npos)
            others[count] = name; /* not one that has to be kept */
        levels[count] = level_of(others[count]);
    }
    const std::string before = g_platform.items[kItem];
    const std::string &stored = g_platform.items[kItem];
    if (log_set_bsp_module_level(name.c_str(), level.c_str()) != 0) {
        promise(most >= kBspRecordSize, "what has room is stored");
        promise(stored == before, "what has no room changes nothing");
        return;
    }
    promise(stored.size() < kBspRecordSize, "a record has room in its field");
    promise(stored.find(name + ',' + level + ';') != std::string::npos, "what was stored is in the record");
    promise(count == kRestored || !comparable || level_of(name) == level, "what was stored is found");
    for (std::size_t i = 0; i < count; ++i)
        promise(others[i] == name || level_of(others[i]) == levels[i], "other modules keep their levels");
}

} // namespace

extern "C" {
int __wrap_posix_spawn(pid_t *child, const char *, const posix_spawn_file_actions_t *, const posix_spawnattr_t *,
                       char *const *argv, char *const *)
{
    std::string_view words = argv[2];
    promise(words.starts_with(kScript), "a level is set by its script");
    words.remove_prefix(kScript.size());
    const std::string name(take_field(words, ' '));
    promise(log_bsp_text_allowed(name.c_str()), "a name is a word");
    promise(log_bsp_text_allowed(words.data()) && words != kBspDefaultLevel, "a level is a word");
    ++g_restored;
    *child = 1;
    return 0;
}
pid_t __wrap_waitpid(pid_t child, int *status, int)
{
    *status = 0;
    return child;
}
void __wrap_sync() {}
}

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    g_platform = {};
    g_platform.takes_line = [](const char *, const char *, va_list) {};
    std::string_view input = text_of(data, size);
    input = input.substr(0, input.find('\0'));
    const std::string name(take_field(input, ';'));
    const std::string level(take_field(input, ';'));
    const std::string record(input.substr(0, kBspRecordSize + 100)); /* a record that was not written by us */
    g_platform.items[kItem] = record;
    g_restored = 0;
    log_restore_bsp_module_level();
    promise(g_restored <= static_cast<int>(kRestored), "only so many pieces count");
    if (log_bsp_text_allowed(name.c_str()) && log_bsp_text_allowed(level.c_str()))
        check_store(name, level, input.substr(0, kBspRecordSize - 1));
    return 0;
}
