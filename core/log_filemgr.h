/*
 * Files by C streams, for the handlers that store and send them.
 *
 * Every helper takes null arguments and reports everything by its result; none ends or throws. What is said here to
 * be logged is logged at level 6 as "log_filemgr". Sizes, counts and offsets are bytes. A stream belongs to whoever
 * opened it and is used by one thread at a time; otherwise any thread may call.
 */
#ifndef CORE_LOG_FILEMGR_H
#define CORE_LOG_FILEMGR_H

#include <cstdint>
#include <cstdio>

/* How log_open_file() opens. */
constexpr int kFileRead = 0;             /* "r" */
constexpr int kFileWrite = 1;            /* "w" */
constexpr int kFileWriteRead = 2;        /* "w+" */
constexpr int kFileAppendRead = 3;       /* "a+" */
constexpr int kFileReadBinary = 4;       /* "rb" */
constexpr int kFileWriteBinary = 5;      /* "wb" */
constexpr int kFileWriteReadBinary = 6;  /* "w+b" */
constexpr int kFileAppendReadBinary = 7; /* "a+b" */

/* The stream, which log_close_file() closes and programs do not inherit; null on failure. It has no buffer: what counts
 * as written is what the file has taken, so that a full disk is noticed at once, and pieces are not copied. */
FILE *log_open_file(const char *path, int mode);

/* Reads up to `count` bytes. Bytes read; 0 at the end, on failure, and for null arguments. */
std::int32_t log_read_file(FILE *stream, void *buffer, std::int32_t count);

/* Writes `count` bytes in one call. Bytes written, 0 for null arguments. */
std::int32_t log_write_file(FILE *stream, const void *buffer, std::int32_t count);

/* Writes `count` bytes, again after an interruption. `count`, or the bytes written before a failure; 0 for null
 * arguments; a count of 0 or less as it is. */
std::int32_t log_write_file_full(FILE *stream, const void *buffer, std::int32_t count);

/* 1 closed, 0 for null. */
int log_close_file(FILE *stream);

/* 1 when there is something at the path, else 0 (logged). */
int log_is_file_exist(const char *path);

/* Size of the file; 0 (logged) when it cannot be examined or has no room in the result; -1 for null. */
std::int32_t log_get_file_size(const char *path);

/* Reads up to `count` bytes of a file, or makes a file of `count` bytes. Bytes read or written, 0 when it cannot be
 * opened. */
std::int32_t log_read_whole_file(const char *path, void *buffer, std::int32_t count);
std::int32_t log_write_whole_file(const char *path, const void *buffer, std::int32_t count);

/* Moves to `offset` from the start (origin 0), from here (1) or from the end (any other). 1 moved, 0 not; a missing
 * stream is logged. */
int log_seek_file(FILE *stream, std::int32_t offset, int origin);

/* Removes a file or an empty folder (logged). 1 when it is gone or never was, 0 when it stays. */
int pel_remove_file(const char *path);

/* Removes whatever is at the path: a link itself, a folder with all in it (by a command). True when nothing is left
 * there; the path has up to 100 characters. */
bool log_clear_path(const char *path);

/* 1 renamed, 0 not; a missing path is logged. */
int pel_rename_file(const char *old_path, const char *new_path);

/* Brings what was written to storage. 1 done, 0 not. */
int log_sync_file(FILE *stream);

#endif
