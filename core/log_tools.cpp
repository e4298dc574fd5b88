#include "core/log_tools.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "platform/unique_fd.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>

namespace
{

constexpr char kLogSource[] = "log_tools";

constexpr int kNvIntSize = 32;

/* Bytes of stack for a thread. Frames live in blocks, so the deepest use is a JSON text of nothing but brackets, with
 * about 100 KB. The usual 8 MB would make the end of a thread dearer, as the kernel looks through all of it. */
constexpr std::size_t kStackSize = 256 * 1024;

constexpr std::size_t kHexPiece = 500; /* characters of a hex dump in one log line */
constexpr int kHexMax = INT_MAX / 4;   /* bytes of a hex dump whose text a 32-bit size can count */

struct free_deleter {
    void operator()(void *memory) const { std::free(memory); }
};

struct pipe_closer {
    void operator()(FILE *stream) const { pclose(stream); }
};

/* One write of what is left of a packet: bytes written, or 0 or less on failure. */
int write_some(int fd, SSL *ssl, const char *bytes, int len)
{
    if (g_daemon.use_ssl == 1)
        return g_daemon.ssl_write(ssl, bytes, len);
    return static_cast<int>(send(fd, bytes, static_cast<std::size_t>(len), 0));
}

/* Starts a shell for the line, in a process group of its own or with a descriptor that its programs inherit; -1 on
 * failure. */
pid_t start_shell(const char *cmdStr, bool own_group, int handed_fd)
{
    const pid_t shell = fork();
    if (shell != 0)
        return shell;
    if (own_group)
        setpgid(0, 0);
    if (handed_fd != -1)
        fcntl(handed_fd, F_SETFD, 0);
    execl("/bin/sh", "sh", "-c", cmdStr, nullptr);
    _exit(127);
}

/* Waits for the shell; its status as system() has it. */
int await_shell(pid_t shell)
{
    int status = -1;
    while (shell != -1 && waitpid(shell, &status, 0) == -1)
        if (errno != EINTR)
            return -1;
    return status;
}

/* Logs what became of a shell line, and flushes file systems to storage; 0 when it exited with status 0, else -1. */
int judge_cmd(const char *cmdStr, int status)
{
    int result = -1;
    if (status == -1) {
        LOG_FAULT("[%s] System error1\n", cmdStr);
    } else if ((status & 0x7f) != 0) {
        LOG_FAULT("[%s] System error2\n", cmdStr);
    } else if (((status >> 8) & 0xff) != 0) {
        LOG_FAULT("[%s] System error3\n", cmdStr);
    } else {
        LOG_NOTE("[%s] System ok\n", cmdStr);
        result = 0;
    }
    sync();
    return result;
}

/* By hand, as a relay says it 100,000 times a second. */
void print_sent(int len)
{
    constexpr char kWords[] = "log_send_packet complete, the write data size is ";
    char line[sizeof kWords + 16];
    std::memcpy(line, kWords, sizeof kWords - 1);
    char *const end = std::to_chars(line + sizeof kWords - 1, line + sizeof line, len).ptr;
    *end = '\n';
    std::fwrite(line, 1, static_cast<std::size_t>(end + 1 - line), stdout);
}

} // namespace

int log_thread_create(log_thread_task *task, void *argument)
{
    if (task == nullptr) {
        LOG_NOTE("input paramnet is error\n");
        return -1;
    }
    pthread_attr_t attributes;
    if (pthread_attr_init(&attributes) != 0)
        return -1;
    const bool started = pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED) == 0 &&
                         pthread_attr_setstacksize(&attributes, kStackSize) == 0 &&
                         pthread_create(&task->thread_id, &attributes, task->entry, argument) == 0;
    pthread_attr_destroy(&attributes);
    return started ? 0 : -1;
}

int vex_get_nv_item(const char *name, char *buffer, int size)
{
    if (name == nullptr || buffer == nullptr || size < 2) {
        LOG_NOTE("vex_get_nv_item Para Error\n");
        return -1;
    }
    if (vex_nvconfig_read(name, buffer, size - 1) != 1)
        return -1;
    LOG_NOTE("vex_get_nv_item:nvItem = %s,buf = %s, bufLength=%d", name, buffer, size - 1);
    return 0;
}

int vex_set_nv_item(const char *name, const char *value, int len)
{
    if (name == nullptr || value == nullptr) {
        LOG_NOTE("vex_set_nv_item Para Error\n");
        return -1;
    }
    if (vex_nvconfig_write(name, value, len) != 1) {
        LOG_NOTE("vex_set_nv_item set Error\n");
        return -1;
    }
    LOG_NOTE("vex_set_nv_item: nvItem = %s,nvItemValue = %s\n", name, value);
    cfg_save();
    return 0;
}

int log_get_nv_int(const char *name)
{
    char text[kNvIntSize] = {};
    vex_get_nv_item(name, text, sizeof text);
    return log_text_to_int(text);
}

int log_set_nv_int(const char *name, int value)
{
    char text[kNvIntSize] = {};
    const int len = std::snprintf(text, sizeof text, "%d", value);
    LOG_NOTE("%s value=%s", name, text);
    return vex_set_nv_item(name, text, len);
}

int log_text_to_int(const char *text)
{
    return static_cast<int>(std::clamp(std::strtol(text, nullptr, 10), long{INT_MIN}, long{INT_MAX}));
}

int log_exec_cmd(const char *cmdStr)
{
    if (cmdStr == nullptr)
        return -1;
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    return judge_cmd(cmdStr, std::system(cmdStr));
}

int log_exec_cmd_with(const char *cmdStr, int handed_fd)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    return judge_cmd(cmdStr, await_shell(start_shell(cmdStr, false, handed_fd)));
}

pid_t log_exec_cmd_apart(const char *cmdStr)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const pid_t shell = start_shell(cmdStr, true, -1);
    judge_cmd(cmdStr, await_shell(shell));
    return std::max(shell, 0);
}

int vex_popen(const char *cmd, char *buffer, int size)
{
    if (cmd == nullptr || buffer == nullptr) {
        LOG_FAULT("vex_popen: cmd or buf ptr NULL\n");
        return 0;
    }
    std::memset(buffer, 0, static_cast<std::size_t>(std::max(size, 0)));
    /* "e": a program that another thread starts meanwhile must not inherit the pipe and keep it open. */
    const std::unique_ptr<FILE, pipe_closer> output{popen(cmd, "re")};
    if (!output || std::fgets(buffer, size, output.get()) == nullptr)
        return 0;
    buffer[std::strcspn(buffer, "\n")] = '\0';
    return 1;
}

int log_send_packet(int fd, SSL *ssl, const void *buffer, int len)
{
    if (fd < 0 || buffer == nullptr || len == 0)
        return -1;
    int sent = 0;
    while (sent < len) {
        if (g_daemon.use_ssl == 1 && ssl == nullptr)
            return -1;
        const int n = write_some(fd, ssl, static_cast<const char *>(buffer) + sent, len - sent);
        if (n <= 0) {
            std::printf("log_send_packet data fail  errno= %d (%s)\n", errno, std::strerror(errno));
            return -1;
        }
        sent += n;
        if (sent == len)
            print_sent(sent);
    }
    return sent;
}

void log_set_keepalive(int fd)
{
    const struct {
        int level;
        int option;
        int value;
    } settings[] = {{SOL_SOCKET, SO_KEEPALIVE, 1},
                    {IPPROTO_TCP, TCP_KEEPIDLE, 60},
                    {IPPROTO_TCP, TCP_KEEPINTVL, 10},
                    {IPPROTO_TCP, TCP_KEEPCNT, 3}};
    for (const auto &setting : settings)
        setsockopt(fd, setting.level, setting.option, &setting.value, sizeof setting.value);
}

int log_hex_encode(const void *data, char *out, int count)
{
    constexpr char kDigits[] = "0123456789ABCDEF";
    if (data == nullptr || out == nullptr || count < 0 || count > INT_MAX / 2)
        return -1;
    const auto *bytes = static_cast<const unsigned char *>(data);
    for (int i = 0; i < count; ++i) {
        *out++ = kDigits[bytes[i] >> 4];
        *out++ = kDigits[bytes[i] & 15];
    }
    *out = '\0';
    return 2 * count;
}

void log_print_hex_buf(const void *data, int count, const char *tag)
{
    LOG_NOTE("%s enter\n", __func__);
    if (data == nullptr || count <= 0 || count > kHexMax || tag == nullptr) {
        LOG_NOTE("%s: param null\n", __func__);
        return;
    }
    /* One piece to spare, so that the last one is copied whole like the others; its tail is zeros. */
    const std::size_t text_size = 2 * static_cast<std::size_t>(count) + kHexPiece;
    const std::unique_ptr<char, free_deleter> text{static_cast<char *>(std::calloc(1, text_size))};
    if (!text) {
        LOG_NOTE("%s: malloc tmpBuf fail\n", __func__);
        return;
    }
    const auto text_len = static_cast<std::size_t>(log_hex_encode(data, text.get(), count));
    const std::size_t pieces = (text_len + kHexPiece - 1) / kHexPiece;
    LOG_NOTE("%s:%s print_count=%d\n", __func__, tag, static_cast<int>(pieces));
    for (std::size_t i = 0; i < pieces; ++i) {
        char line[512] = {};
        std::memcpy(line, text.get() + kHexPiece * i, kHexPiece);
        LOG_NOTE("%s:%s pieceBuf[%d]:%s.\n", __func__, tag, static_cast<int>(i), line);
    }
}

int log_isValidIpOrUrl(const char *text)
{
    if (text == nullptr)
        return 0;
    in_addr v4{};
    in6_addr v6{};
    if (std::strcmp(text, "any") == 0 || std::strcmp(text, "any/0") == 0 || inet_pton(AF_INET, text, &v4) == 1)
        return 1;
    if (inet_pton(AF_INET6, text, &v6) == 1)
        return 2;
    LOG_NOTE("log_isValidIpOrUrl(): %s is not a valid IP address.\n", text);
    return 0;
}

int ip_in_subnet(const char *address, const char *peer, const char *netmask)
{
    in_addr a{};
    in_addr p{};
    in_addr mask{};
    if (inet_aton(address, &a) == 0 || inet_aton(peer, &p) == 0 || inet_aton(netmask, &mask) == 0)
        return -1;
    const int result = ((a.s_addr ^ p.s_addr) & mask.s_addr) == 0 ? 1 : 0;
    LOG_NOTE("[%s, %s, %s, %d]", address, peer, netmask, result);
    return result;
}

int getNthValueSafe(int n, const char *text, char delimiter, char *out, int size)
{
    if (text == nullptr || delimiter == '\0' || out == nullptr || size <= 0) {
        LOG_FAULT("getNthValueSafe: null in\n");
        return -1;
    }
    int passed = 0;
    const char *end = std::strchr(text, delimiter);
    while (end != nullptr && passed < n) {
        text = end + 1;
        ++passed;
        end = std::strchr(text, delimiter);
    }
    if (end == nullptr && passed != n)
        return -1;
    const std::size_t field = end != nullptr ? static_cast<std::size_t>(end - text) : std::strlen(text);
    const std::size_t len = std::min(field, static_cast<std::size_t>(size) - 1);
    std::memcpy(out, text, len);
    out[len] = '\0';
    return 0;
}

int log_send_msg(int dst_module, int msg_cmd, const void *payload, int len)
{
    if (msg_cmd > kMsgCmdMax) {
        LOG_FAULT("log_send_msg: Msg cmd is >= MSG_CMD_SERVICE_REG, return!");
        return 0;
    }
    if (len < 0 || len > kMsgDataMax) {
        LOG_FAULT("%s: a payload of %d bytes does not fit a message\n", __func__, len);
        return 0;
    }
    log_ipc_msg msg{};
    msg.msg_cmd = static_cast<std::uint16_t>(msg_cmd);
    msg.dst_module = static_cast<std::uint16_t>(dst_module);
    msg.src_module = kMsgSelf;
    msg.data_len = static_cast<std::uint16_t>(len);
    if (payload != nullptr)
        std::memcpy(msg.data, payload, static_cast<std::size_t>(len));
    if (vex_msg_send(&msg) == 0)
        return 1;
    LOG_FAULT("%s: vex_msg_send err!", __func__);
    return 0;
}

int log_connect_unix_socket(const char *path)
{
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_FAULT("create socket error, errno: %d, pid=%d", errno, static_cast<int>(getpid()));
        return -1;
    }
    fcntl(sock.get(), F_SETFL, O_NONBLOCK);
    sockaddr_un to{};
    to.sun_family = AF_UNIX;
    std::memcpy(to.sun_path, path, strnlen(path, sizeof to.sun_path));
    if (connect(sock.get(), reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0) {
        LOG_FAULT("can not connect to:%s, errno: %d, pid=%d", path, errno, static_cast<int>(getpid()));
        return -1;
    }
    const timeval send_timeout{3, 0};
    setsockopt(sock.get(), SOL_SOCKET, SO_SNDTIMEO, &send_timeout, sizeof send_timeout);
    LOG_NOTE("connect[%s]------clientfd=[%d]\n", path, sock.get());
    return sock.release();
}
