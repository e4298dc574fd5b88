/*
 * The thin layer between the daemon's logic and its device: NV items, shell commands, whole sends, threads,
 * address texts, hex dumps, platform messages, local sockets. Each has a source of its own, log_tools_*.cpp.
 *
 * Every service may be called from any thread, keeps no state and ends nothing on bad input: it reports by
 * its result, and logs what is said here as "log_tools". Pointers are borrowed for the call.
 */
#ifndef CORE_LOG_TOOLS_H
#define CORE_LOG_TOOLS_H

#include <chrono>
#include <cstdint>
#include <pthread.h>
#include <sys/types.h>

class log_tls_session;

/* ---- Threads ---- */

struct log_thread_task {
    void *(*entry)(void *); /* body of the thread to start */
    pthread_t thread_id;    /* the started thread */
};

/* Starts `task->entry` with `argument` as a detached thread of 256 KB of stack and stores its id in the task. 0
 * started, -1 failed; only a missing task is logged, the caller logs its own failure. */
int log_thread_create(log_thread_task *task, void *argument);

/* The same in one step: 0 started; -1 after a log line in the name of `starter`, as "vex_log_manage". */
int log_start_thread(const char *starter, void *(*entry)(void *), void *argument = nullptr);

/* ---- NV items ---- */

/* Reads the NV item `name` into `buffer`, which holds `size` bytes and which the caller has cleared: at most
 * size - 1 characters arrive. 0 read (and logged), -1 missing, unreadable or bad arguments. */
int vex_get_nv_item(const char *name, char *buffer, int size);

/* Writes `len` bytes of `value` as the NV item `name` and commits the store. 0 written, -1 failed (logged). */
int vex_set_nv_item(const char *name, const char *value, int len);

/* The NV item `name` as a decimal number; 0 when it is empty, unreadable or no number. */
int log_get_nv_int(const char *name);

/* Writes `value` as decimal text; results of vex_set_nv_item(). */
int log_set_nv_int(const char *name, int value);

/* The base-10 number at the start of `text`, blanks and a sign allowed: 0 without digits, the nearest int
 * where the number has no room in one. */
int log_text_to_int(const char *text);

/* ---- Programs ---- */

/* Runs the shell command line and waits for the shell, then flushes file systems to storage. 0 when it exited
 * with status 0, else -1 (logged). A line that ends in "&" leaves its program running and yields 0 at once. */
int log_exec_cmd(const char *cmdStr);

/* The same for a line whose program is told a descriptor by its number: it alone inherits `handed_fd`. */
int log_exec_cmd_with(const char *cmdStr, int handed_fd);

/* The same for a line that ends in "&" whose program is to be known: it is a child that is not waited for. Its number,
 * by which it must be asked for or ended one day; -1 when it could not be started. */
pid_t log_exec_cmd_behind(const char *cmdStr);

/* The same as log_exec_cmd() for one program that may hang, which is waited for so long at the most: -1, or its number
 * when it is left behind (logged), as above. */
pid_t log_exec_cmd_within(const char *cmdStr, std::chrono::seconds time);

/* Whether such a child has ended; then it is forgotten and its number must not be used any more. */
bool log_child_ended(pid_t child);

/* Waits until such a child has ended and forgets it. After 3 seconds it is asked to (SIGTERM), after 2 more killed, both
 * of which is logged; what it has started itself is left alone. */
void log_end_child(pid_t child);

/* Runs the shell command line and captures the first line of its output, without its newline and cut at size
 * - 1 characters, in `buffer` of `size` bytes, which is cleared first. 1 captured, 0 nothing to capture. */
int vex_popen(const char *cmd, char *buffer, int size);

/* ---- Sends ---- */

/*
 * Sends `len` bytes whole on the socket, or on the TLS session when the daemon runs over TLS. Returns `len`,
 * or -1 on the first failure, which is never retried; a negative length returns 0. Says on standard output,
 * not in the log, what became of it (core/log_stdout.h). The caller keeps other
 * senders off the connection meanwhile.
 */
int log_send_packet(int fd, log_tls_session *ssl, const void *buffer, int len);

/* Has a connection found dead after 90 seconds of silence: its peer is probed after 60 seconds, then three times 10
 * seconds apart. What a listener accepts inherits it. */
void log_set_keepalive(int fd);

/* ---- Texts ---- */

/* Writes `count` bytes as upper-case hex, two characters a byte and a NUL, to `out`, which has room for
 * 2 * count + 1. Returns 2 * count, or -1 on missing pointers or a negative count. */
int log_hex_encode(const void *data, char *out, int count);

/* Logs `count` bytes as hex under the name `tag`, 500 characters a line. */
void log_print_hex_buf(const void *data, int count, const char *tag);

/* 1 for "any", "any/0" or an IPv4 address, 2 for an IPv6 address, 0 (logged) for anything else, host names
 * too. */
int log_isValidIpOrUrl(const char *text);

/* Whether two IPv4 addresses, as texts, lie in one subnet of the netmask: 1 yes, 0 no (both logged), -1 when a text is
 * no IPv4 address. */
int ip_in_subnet(const char *address, const char *peer, const char *netmask);

/* Whether a text can be a word, or several, of a shell command line and nothing more: it has no control character and
 * none of ; & | < > ( ) $ ` " ' \ # * ? [ ~. */
bool log_is_plain_word(const char *text);

/* Copies the field number `n`, from 0, of a text of fields between delimiters to `out`, cut to size - 1
 * characters. 0 copied, -1 when there is no such field or on bad arguments; `out` is then as it was. */
int getNthValueSafe(int n, const char *text, char delimiter, char *out, int size);

/* ---- Platform messages and local sockets ---- */

constexpr int kMsgCmdMax = 0x2F00; /* highest command code that may be sent */
constexpr int kMsgDataMax = 1024;  /* bytes of payload */
constexpr std::uint16_t kMsgSelf = 8;

/* One message, as the platform delivers it: native byte order, zero where nothing is said. */
struct log_ipc_msg {
    std::uint16_t msg_cmd;
    std::uint16_t reserved_2;
    std::uint16_t dst_module;
    std::uint16_t src_module; /* always kMsgSelf */
    std::uint16_t data_len;   /* bytes of `data` in use */
    std::uint16_t reserved_10;
    unsigned char data[kMsgDataMax];
};
static_assert(sizeof(log_ipc_msg) == 1036);

/* Sends the command code to a module, with `len` bytes of payload where `payload` is not null. 1 sent; 0
 * refused or failed (logged): a code above kMsgCmdMax, a payload above kMsgDataMax, or nobody there. */
int log_send_msg(int dst_module, int msg_cmd, const void *payload, int len);

/* Whether the other end of a connected unix socket was made by a process of our own user. */
bool log_peer_is_ours(int fd);

/* Connects to the unix stream socket at `path`, which is not null. Returns the non-blocking, close-on-exec socket, with
 * a send time-out of 3 seconds; the caller closes it. -1 on failure, or when another user listens there
 * (logged). */
int log_connect_unix_socket(const char *path);

#endif
