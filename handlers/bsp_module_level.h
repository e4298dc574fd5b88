/*
 * The record of kernel-module log levels: every level that was ever set, in the NV item `bsplog_module_level`, so that
 * it can be set again at every start.
 *
 * The record is a text of up to 1023 characters, "NAME,LEVEL;NAME,LEVEL;". Only its first 32 pieces between ";" count,
 * and of each its first 63 characters. The level "info" is the modules' own and is never set at start.
 */
#ifndef HANDLERS_BSP_MODULE_LEVEL_H
#define HANDLERS_BSP_MODULE_LEVEL_H

#include <cstddef>

constexpr std::size_t kBspFieldSize = 32;    /* a name or a level with its NUL */
constexpr std::size_t kBspRecordSize = 1024; /* the record with its NUL */
constexpr char kBspDefaultLevel[] = "info";

/* Whether a name or a level may be kept: both become words of a shell command. They are up to 31 letters, digits,
 * '_', '-' and '.', and not nothing. */
bool log_bsp_text_allowed(const char *text);

/* Stores in `level` what the record says of the module; "info" where it says nothing. */
void log_get_bsp_module_level(const char *name, char (&level)[kBspFieldSize]);

/* Puts a module's level into the record: in its place, or at the end. 0 stored or not (logged by the NV services); -1
 * when the record would grow too long, which is logged and leaves it as it was. */
int log_set_bsp_module_level(const char *name, const char *level);

/* Sets a module's level now: runs the device's script and waits for it. */
void log_apply_bsp_module_level(const char *name, const char *level);

/* Sets every level of the record. Start-up calls it once. */
void log_restore_bsp_module_level();

#endif
