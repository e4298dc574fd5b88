#include "client/log_stream.h"

#include "client/log_announce.h"
#include "client/log_connect.h"
#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_tools.h"
#include "protocol/log_pkg_send.h"
#include "protocol/log_recv.h"
#include "transport/log_intake.h"

#include <cstring>
#include <optional>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <utility>

enum class intake_state {
    none,     /* without TLS, and before it is started */
    starting, /* its thread is */
    waiting,  /* for the program */
    taken,    /* a program was told to connect to it */
    over,
};

struct log_stream {
    log_stream(log_kind its_kind, const char *ip, int port) : kind(its_kind)
    {
        std::strncpy(target.ip, ip, sizeof target.ip - 1);
        target.port = port;
    }

    const log_kind kind;
    log_target target;
    const unique_fd stop{eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)}; /* readable once nothing is to be waited for */

    std::shared_ptr<log_link> link LOG_GUARDED_BY(g_registry_lock);     /* once it is connected */
    std::shared_ptr<log_stream> before LOG_GUARDED_BY(g_registry_lock); /* whom it takes over from when announced */
    /* Our end of the program's connection to the intake. */
    std::shared_ptr<unique_fd> local LOG_GUARDED_BY(g_registry_lock);
    intake_state intake LOG_GUARDED_BY(g_registry_lock) = intake_state::none;
    bool announced LOG_GUARDED_BY(g_registry_lock) = false;
    bool ended LOG_GUARDED_BY(g_registry_lock) = false;       /* by whoever was first */
    bool owns_program LOG_GUARDED_BY(g_registry_lock) = true; /* the program that runs, if any, is for this stream */
};

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kAnnounceMax = 3;                      /* sends of the announcement until one succeeds */
constexpr int kUnreadMax = 100;                      /* pieces that are thrown away when a link is closed */
constexpr auto kDrainMax = std::chrono::seconds(2);  /* for what is on its way when a stream is stopped */
constexpr auto kEndAllMax = std::chrono::seconds(5); /* for all of it at the end of the process */

using shared_stream = std::shared_ptr<log_stream>;

/* What is different for the two logs. Their threads run the same bodies and have names of their own in the log. */
struct stream_names {
    const char *connect_type;
    const char *intake_path;
    const char *intake_starter;
    const char *intake_body;
    const char *link_starter;
    const char *link_body;
    log_target *target;
    int log_sock_fd::*fd;
    log_tls_session *log_sock_fd::*ssl;
    int *local_fd;
};

constexpr stream_names kNames[] = {
    {"syslog_connect", kSyslogIntake, "vex_log_recv_syslog_thread", "log_recv_syslog_thread_proc",
     "vex_log_client_syslog_thread", "log_client_syslog_thread_proc", &syslog_target, &log_sock_fd::syslog_fd,
     &log_sock_fd::syslog_ssl, &syslog_local_fd},
    {"modemlog_connect", kQxdmIntake, "vex_log_recv_qxdm_thread", "log_recv_qxdm_thread_proc",
     "vex_log_client_qxdm_thread", "log_client_qxdm_thread_proc", &qxdm_target, &log_sock_fd::qxdm_fd,
     &log_sock_fd::qxdm_ssl, &qxdm_local_fd},
};

shared_stream g_current[2] LOG_GUARDED_BY(g_registry_lock);
int g_at_work LOG_GUARDED_BY(g_registry_lock); /* links' threads, and ends of streams at the end of the process */
std::condition_variable g_change;              /* of an intake's state, or of those at work */

const stream_names &names_of(log_kind kind)
{
    return kNames[static_cast<std::size_t>(kind)];
}

shared_stream &current(log_kind kind) LOG_REQUIRES(g_registry_lock)
{
    return g_current[static_cast<std::size_t>(kind)];
}

/* The stream whose link is in use: an older one until the current one's link is announced. */
shared_stream used_stream(log_kind kind) LOG_REQUIRES(g_registry_lock)
{
    const shared_stream &newest = current(kind);
    return newest && !newest->announced && newest->before ? newest->before : newest;
}

/* Shows in the registry which link is in use. */
void publish(log_kind kind) LOG_REQUIRES(g_registry_lock)
{
    const stream_names &names = names_of(kind);
    const shared_stream stream = used_stream(kind);
    g_sock_fd.*names.ssl = stream && stream->link ? stream->link->tls.get() : nullptr;
    g_sock_fd.*names.fd = stream && stream->announced ? stream->link->fd.get() : -1;
    *names.local_fd = stream && stream->local ? stream->local->get() : -1;
}

/* Ends all waits for a stream that has ended: its threads are done soon. */
void wake(const shared_stream &stream)
{
    if (!stream)
        return;
    eventfd_write(stream->stop.get(), 1);
    std::shared_ptr<log_link> link;
    {
        const log_lock hold{g_registry_lock};
        link = stream->link;
        stream->local.reset();
    }
    if (link)
        log_link_take_away(*link);
}

void set_intake(log_stream &stream, intake_state state)
{
    {
        const log_lock hold{g_registry_lock};
        stream.intake = state;
    }
    g_change.notify_all();
}

void count_at_work(int change)
{
    {
        const log_lock hold{g_registry_lock};
        g_at_work += change;
    }
    g_change.notify_all();
}

/* ---- The intake's thread ---- */

void run_intake(const shared_stream &stream)
{
    LOG_NOTE("enter %s.\n", names_of(stream->kind).intake_body);
    unique_fd listener;
    if (vex_create_unix_server_socket(names_of(stream->kind).intake_path, &listener) == 0) {
        set_intake(*stream, intake_state::waiting);
        log_server_handle_realtimelog(std::move(listener), static_cast<int>(stream->kind), stream->stop.get(), *stream);
    }
    set_intake(*stream, intake_state::over);
}

/* ---- The data link's thread ---- */

/* Tells the server which stream of which device the link is for. */
int announce(log_kind kind, const log_link &link)
{
    char text[kAnnouncementSize];
    log_print_announcement(text, "10", "DataLink", names_of(kind).connect_type);
    /* Nobody else sends on the link yet. */
    int result = log_send_pkg_msg(link.fd.get(), link.tls.get(), text, "", 0);
    for (int i = 1; result != 0 && i < kAnnounceMax; ++i) {
        LOG_NOTE("%s :try send pkg msg \n", names_of(kind).link_body);
        result = log_send_pkg_msg(link.fd.get(), link.tls.get(), text, "", 0);
    }
    return result;
}

/* Records a link that has been connected; false when the stream has ended meanwhile. */
bool record_connected(log_stream &stream, const std::shared_ptr<log_link> &link)
{
    const log_lock hold{g_registry_lock};
    if (stream.ended)
        return false;
    stream.link = link;
    publish(stream.kind);
    return true;
}

/* Records that the link has been announced, and takes over from the stream before; false when this one has ended. */
bool record_announced(log_stream &stream)
{
    shared_stream before;
    {
        const log_lock hold{g_registry_lock};
        if (stream.ended)
            return false;
        stream.announced = true;
        before = std::exchange(stream.before, nullptr);
        if (before)
            before->ended = true;
        publish(stream.kind);
    }
    wake(before);
    return true;
}

/* Waits until the intake has passed on what its program wrote before it was ended. */
void await_intake(const log_stream &stream, log_clock::time_point end)
{
    const log_lock hold{g_registry_lock};
    while (stream.intake > intake_state::none && stream.intake < intake_state::over && log_clock::now() < end)
        g_registry_lock.wait_until(g_change, end);
}

void close_link(log_link &link, log_clock::time_point end)
{
    vex_close_ssl(link.tls.get(), 0, end);
    shutdown(link.fd.get(), SHUT_RDWR); /* the server sees the end although a program may still have a copy */
    /* With bytes unread, closing the socket would take back what is still on its way to the server. */
    unsigned char unread[kLogPieceMax];
    for (int i = 0; i < kUnreadMax && recv(link.fd.get(), unread, sizeof unread, MSG_DONTWAIT) > 0; ++i) {
    }
}

/* Back to the device's local logging. */
void log_locally(log_kind kind, log_program_change &change)
{
    if (kind == log_kind::syslog) {
        log_restart_local_syslog(change, log_read_syslog_items(32));
    } else {
        change.settle();
        change.end_by("diag_mdlog -k ");
    }
}

/* A stream that has ended is not current any more: the one before is, or none. */
void give_way(log_stream &stream) LOG_REQUIRES(g_registry_lock)
{
    shared_stream &newest = current(stream.kind);
    if (newest.get() == &stream)
        newest = std::exchange(stream.before, nullptr);
    else if (newest && newest->before.get() == &stream)
        newest->before = nullptr;
    publish(stream.kind);
}

/* From now on nobody begins to send on the stream's link. */
void forget_link(log_stream &stream)
{
    const log_lock hold{g_registry_lock};
    stream.link = nullptr;
}

/* The link has ended: closes it and, unless somebody else has ended the stream, does what is to be done at its end. */
void end_link(const shared_stream &stream, log_link &link)
{
    std::optional<log_program_change> change; /* of the log's program, which is the stream's own */
    bool by_itself = false;
    {
        const log_lock hold{g_registry_lock};
        by_itself = !std::exchange(stream->ended, true);
        if (by_itself)
            give_way(*stream);
        if (by_itself && stream->owns_program)
            change.emplace(stream->kind);
    }
    const auto end = log_clock::now() + (by_itself ? std::chrono::seconds(0) : kDrainMax);
    if (by_itself)
        wake(stream);
    else
        await_intake(*stream, end);
    forget_link(*stream);
    close_link(link, end);
    if (change)
        log_locally(stream->kind, *change);
}

void take_piece(log_link &link, log_reassembly &state, std::span<const unsigned char> piece)
{
    constexpr char kName[] = "log_recv_server_msg";
    if (link.taken) {
        LOG_NOTE("%s: the stream was stopped or started again, what fd[%d] brought is dropped\n", kName, link.fd.get());
        return;
    }
    LOG_NOTE("%s:recvbuf=%.*s\n", kName, static_cast<int>(piece.size()), reinterpret_cast<const char *>(piece.data()));
    log_proc_tcp_pkg(state, piece);
}

/* Reads the link until it ends, and closes it. */
void log_recv_server_msg(const shared_stream &stream, log_link &link)
{
    const int fd = link.fd.get();
    LOG_NOTE("enter %s: fd=[%d]\n", __func__, fd);
    {
        const log_serving serving{link};
        if (const int error = log_recv_link(link, take_piece); error != 0)
            LOG_NOTE("%s:recvfrom error,errno msg=%s\n", __func__, std::strerror(error));
        else
            LOG_NOTE("%s:recvcount=0,client close fd[%d]\n", __func__, fd);
    }
    end_link(stream, link);
    LOG_NOTE("exit %s: fd=[%d]\n", __func__, fd);
}

/* Announces a link that has just been connected, and serves it. */
void serve_link(const shared_stream &stream, const std::shared_ptr<log_link> &link)
{
    const char *const body = names_of(stream->kind).link_body;
    const bool wanted = record_connected(*stream, link);
    const int announced = wanted ? announce(stream->kind, *link) : -1;
    if (wanted && stream->kind == log_kind::syslog)
        LOG_NOTE("g_sock_fd.syslog_ssl = [%p]\n", static_cast<void *>(link->tls.get()));
    if (announced == 0 && record_announced(*stream)) {
        log_recv_server_msg(stream, *link);
        return;
    }
    if (wanted && announced != 0)
        LOG_NOTE("%s :close(%d) syslog connect \n", body, link->fd.get());
    else
        LOG_NOTE("%s: the stream was stopped or started again, close(%d)\n", body, link->fd.get());
    close_link(*link, log_clock::now());
}

/* A stream whose link has come to nothing, or has ended, is over. */
void end_thread(const shared_stream &stream)
{
    {
        const log_lock hold{g_registry_lock};
        stream->ended = true;
        give_way(*stream);
        stream->before = nullptr;
    }
    wake(stream);
    count_at_work(-1);
}

void run_link(const shared_stream &stream)
{
    LOG_NOTE("enter %s.\n", names_of(stream->kind).link_body);
    std::unique_ptr<log_tls_session> session;
    unique_fd fd{log_connect_server(stream->target.ip, stream->target.port, &session, stream->stop.get())};
    if (fd) {
        if (const auto link = log_make_shared<log_link>(std::move(fd), std::move(session)))
            serve_link(stream, link);
    }
    end_thread(stream);
}

/* ---- Their starts ---- */

void *intake_thread_proc(void *stream)
{
    run_intake(log_take_share<log_stream>(stream));
    return nullptr;
}

void *link_thread_proc(void *stream)
{
    run_link(log_take_share<log_stream>(stream));
    return nullptr;
}

/* Starts a thread that has a share in the stream; false when it cannot be (logged). */
bool start_thread(const char *starter, void *(*body)(void *), const shared_stream &stream)
{
    void *const share = log_give_share(stream);
    if (share != nullptr && log_start_thread(starter, body, share) == 0)
        return true;
    if (share != nullptr)
        log_take_share<log_stream>(share);
    else
        LOG_NOTE("%s  FAIL\n", starter);
    return false;
}

/* Starts the intake and waits until it listens, or cannot: the server may confirm the link as soon as it is there. */
void start_intake(const shared_stream &stream)
{
    set_intake(*stream, intake_state::starting);
    if (!start_thread(names_of(stream->kind).intake_starter, intake_thread_proc, stream))
        set_intake(*stream, intake_state::over);
    const log_lock hold{g_registry_lock};
    while (stream->intake == intake_state::starting)
        g_registry_lock.wait(g_change);
}

void start_link(const shared_stream &stream)
{
    count_at_work(+1);
    if (!start_thread(names_of(stream->kind).link_starter, link_thread_proc, stream))
        end_thread(stream);
}

/* ---- The confirmation ---- */

/* The stream whose data link is in use; none without one. */
shared_stream linked_stream(log_kind kind)
{
    const log_lock hold{g_registry_lock};
    const shared_stream stream = used_stream(kind);
    return stream && stream->announced ? stream : nullptr;
}

bool has_program(const shared_stream &stream)
{
    const log_lock hold{g_registry_lock};
    return stream && stream->intake == intake_state::taken;
}

/* What a log program is told to write to. */
struct program_socket {
    int fd = -1;
    std::shared_ptr<const void> owner; /* keeps it open until the program has it */
};

/* Over TLS, a socket that is connected to the stream's intake, and is kept by the stream; else the data link; none when
 * there is none (logged). */
program_socket socket_for_program(log_kind kind, const shared_stream &stream)
{
    if (g_daemon.use_ssl != 1) {
        const log_lock hold{g_registry_lock};
        return stream && stream->link ? program_socket{stream->link->fd.get(), stream->link} : program_socket{};
    }
    const auto local = log_make_shared<unique_fd>(log_connect_unix_socket(names_of(kind).intake_path));
    if (!local || !*local)
        return {};
    const log_lock hold{g_registry_lock};
    if (!stream || stream->ended)
        return {};
    stream->local = local;
    if (stream->intake == intake_state::waiting)
        stream->intake = intake_state::taken;
    publish(kind);
    return {local->get(), local};
}

/* One change of a log's program for the stream, which may be none; nothing when it has ended meanwhile. */
bool begin_change(log_kind kind, const shared_stream &stream, std::optional<log_program_change> &change)
{
    const log_lock hold{g_registry_lock};
    if (stream && stream->ended)
        return false;
    change.emplace(kind);
    return true;
}

void confirm_syslog(const shared_stream &stream)
{
    if (!stream)
        return;
    const program_socket socket = socket_for_program(log_kind::syslog, stream);
    std::optional<log_program_change> change;
    if (socket.fd != -1 && begin_change(log_kind::syslog, stream, change))
        log_write_syslog_to(*change, socket.fd);
}

void confirm_modem(const shared_stream &stream)
{
    std::optional<log_program_change> change;
    if (!begin_change(log_kind::qxdm, stream, change) || !log_prepare_modem_socket(*change))
        return;
    const program_socket socket = socket_for_program(log_kind::qxdm, stream);
    if (socket.fd != -1 || g_daemon.use_ssl != 1)
        log_write_modem_to(*change, socket.fd);
}

/* ---- The end of the process ---- */

void *end_thread_proc(void *kind)
{
    log_stream_end(*static_cast<const log_kind *>(kind));
    count_at_work(-1);
    return nullptr;
}

bool is_streamed(log_kind kind)
{
    const log_lock hold{g_registry_lock};
    return current(kind) != nullptr;
}

} // namespace

void log_stream_start(log_kind kind, const char *ip, int port)
{
    const auto stream = log_make_shared<log_stream>(kind, ip, port);
    if (!stream || !stream->stop) {
        LOG_FAULT("%s: no memory or descriptor for a stream\n", __func__);
        return;
    }
    shared_stream given_up;
    {
        const log_lock hold{g_registry_lock};
        *names_of(kind).target = stream->target;
        const shared_stream last = std::exchange(current(kind), stream);
        if (last && !last->announced) {
            given_up = last;
            given_up->ended = true;
            stream->before = std::exchange(given_up->before, nullptr);
        } else {
            stream->before = last;
        }
        publish(kind);
    }
    wake(given_up);
    if (g_daemon.use_ssl == 1)
        start_intake(stream);
    start_link(stream);
}

void log_stream_confirm(log_kind kind)
{
    const shared_stream stream = linked_stream(kind);
    if (log_served() != nullptr && log_served()->taken)
        LOG_NOTE("the data link was stopped before it was confirmed\n");
    else if (has_program(stream))
        LOG_NOTE("the data link has been confirmed before and its program writes, refused\n");
    else if (kind == log_kind::syslog)
        confirm_syslog(stream);
    else
        confirm_modem(stream);
}

void log_stream_end(log_kind kind)
{
    shared_stream newest;
    shared_stream before;
    std::optional<log_program_change> change;
    {
        const log_lock hold{g_registry_lock};
        newest = std::exchange(current(kind), nullptr);
        if (newest) {
            newest->ended = true;
            before = std::exchange(newest->before, nullptr);
        }
        if (before)
            before->ended = true;
        change.emplace(kind);
    }
    if (kind == log_kind::syslog) {
        log_end_syslog(*change);
    } else {
        change->settle();
        change->end_by("diag_mdlog -k");
    }
    {
        const log_lock hold{g_registry_lock};
        publish(kind);
    }
    wake(newest);
    wake(before);
    if (kind == log_kind::syslog) {
        g_daemon.syslog_realtime_on = 0;
        log_restart_local_syslog(*change, log_read_syslog_items(32));
    }
}

void log_stream_disown_program(log_kind kind)
{
    const log_lock hold{g_registry_lock};
    if (const shared_stream stream = current(kind)) {
        stream->owns_program = false;
        if (stream->before)
            stream->before->owns_program = false;
    }
}

void log_streams_end_all()
{
    const auto end = log_clock::now() + kEndAllMax;
    static log_kind kinds[] = {log_kind::syslog, log_kind::qxdm};
    for (log_kind &kind : kinds) {
        if (!is_streamed(kind))
            continue;
        count_at_work(+1);
        if (log_start_thread(__func__, end_thread_proc, &kind) != 0)
            count_at_work(-1);
    }
    const log_lock hold{g_registry_lock};
    while (g_at_work > 0 && log_clock::now() < end)
        g_registry_lock.wait_until(g_change, end);
}

void log_stream_send(log_stream &stream, const unsigned char *piece, int len)
{
    std::shared_ptr<log_link> link;
    {
        const log_lock hold{g_registry_lock};
        link = stream.announced ? stream.link : nullptr;
    }
    if (link)
        log_send_packet(link->fd.get(), link->tls.get(), piece, len);
}
