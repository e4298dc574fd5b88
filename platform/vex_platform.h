/*
 * What the device's maker offers the daemon, as C calls. A device build links the maker's libraries, any
 * other build the working stand-in of platform/host; the daemon cannot tell them apart.
 *
 * Every call may be made from any thread at any time and blocks for no longer than the storage it touches.
 */
#ifndef VEX_PLATFORM_H
#define VEX_PLATFORM_H

#ifdef __cplusplus
extern "C" {
#endif

#if defined(__GNUC__)
#define VEX_PRINTF_CHECKED(format_at, args_at) __attribute__((format(printf, format_at, args_at)))
#else
#define VEX_PRINTF_CHECKED(format_at, args_at)
#endif

/*
 * Appends one line to the daemon's log.
 *   level   6 for progress and ordinary errors, 0 for failures of the system
 *   source  name of the module that speaks; borrowed for the call
 *   line    line in that module
 *   module  the maker's code for the speaking program
 *   format  printf format of the text; one trailing newline is dropped
 * errno is what it was when the call returns.
 */
void vex_syslog_append(int level, const char *source, int line, int module, const char *format, ...)
    VEX_PRINTF_CHECKED(5, 6);

/*
 * Copies the text of the NV item `name` into `value`, at most `max_len` bytes, with a NUL behind it where
 * there is room for one. Returns 1 when the item was read; anything else is a failure, which leaves `value`
 * as it was.
 */
int vex_nvconfig_read(const char *name, char *value, int max_len);

/*
 * Stores the text `value` as the NV item `name`. The text ends at its first NUL or after `len` bytes. Reads
 * see it at once; it survives a restart once cfg_save() has returned. Returns 1 when it was stored.
 */
int vex_nvconfig_write(const char *name, const char *value, int len);

/* Commits every stored item to permanent memory. Returns 0 when nothing is left uncommitted, else -1. */
int cfg_save(void);

/*
 * Delivers one 1036-byte message record to the module named in it (16-bit id at offset 4), without waiting
 * for it. The record is borrowed for the call. Returns 0 when it was delivered.
 */
int vex_msg_send(const void *record);

#ifdef __cplusplus
}
#endif

#endif
