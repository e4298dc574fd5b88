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

#include <atomic>
#include <cstring>
#include <optional>
#include <span>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <utility>

enum class intake_state {
    none,    /* without TLS */
    idle,    /* until the link is connected */
    opening, /* is asked to listen */
    waiting, /* for the program */
    taken,   /* a confirmation has its program connected to it */
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
    bool drains LOG_GUARDED_BY(g_registry_lock) = false;      /* its program has been ended: the intake ends, too */
    bool owns_program LOG_GUARDED_BY(g_registry_lock) = true; /* the program that runs, if any, is for this stream */
    std::atomic<bool> ended{false}; /* by whoever was first; is set while g_registry_lock is held */
};

namespace
{

constexpr char kLogSource[] = "vex_log_manage";
constexpr char kConfirmSource[] = "log_json_codec"; /* of the confirmation's handler */

constexpr std::size_t kLinks = 0;
constexpr std::size_t kEnds = 1;

constexpr int kAnnounceMax = 3; /* sends of the announcement until one succeeds */
constexpr int kUnreadMax = 100; /* pieces that are thrown away when a link is closed */
/* For what is on its way when a stream is stopped; at the end of it the intake sends no more. */
constexpr auto kDrainMax = std::chrono::milliseconds(2000);
constexpr auto kGoodByeMax = std::chrono::milliseconds(500);
/* For the ends of both streams at the end of the process; then for their links alone. */
constexpr auto kEndAllMax = std::chrono::milliseconds(3500);
constexpr auto kLinksEndMax = std::chrono::milliseconds(2500);

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
log_mutex g_intake_lock LOG_ACQUIRED_BEFORE(g_registry_lock); /* one intake at a time is put at its path */
int g_threads[2] LOG_GUARDED_BY(g_registry_lock);             /* of links; that end a stream as the process ends */
std::condition_variable g_change;                             /* of an intake, of a stream's end, of those counts */

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
    g_change.notify_all();
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

void count(std::size_t which, int change)
{
    {
        const log_lock hold{g_registry_lock};
        g_threads[which] += change;
    }
    g_change.notify_all();
}

/* ---- The intake's thread ---- */

/* Waits until the stream's link is connected: the path still belongs to an older stream until then. Puts the intake
 * there, but never for a stream that has ended. */
unique_fd open_intake(log_stream &stream)
{
    {
        const log_lock hold{g_registry_lock};
        while (stream.intake == intake_state::idle && !stream.ended)
            g_registry_lock.wait(g_change);
    }
    const log_lock hold{g_intake_lock};
    unique_fd listener;
    if (!stream.ended && vex_create_unix_server_socket(names_of(stream.kind).intake_path, &listener) == 0)
        set_intake(stream, intake_state::waiting);
    return listener;
}

void run_intake(const shared_stream &stream)
{
    LOG_NOTE("enter %s.\n", names_of(stream->kind).intake_body);
    if (unique_fd listener = open_intake(*stream))
        log_server_handle_realtimelog(std::move(listener), static_cast<int>(stream->kind), stream->stop.get(), *stream);
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

/* Waits until the intake listens, or cannot: the server may confirm the link as soon as it is announced. */
void await_open_intake(log_stream &stream)
{
    {
        const log_lock hold{g_registry_lock};
        if (stream.intake != intake_state::idle)
            return;
        stream.intake = intake_state::opening;
    }
    g_change.notify_all();
    const log_lock hold{g_registry_lock};
    while (stream.intake == intake_state::opening)
        g_registry_lock.wait(g_change);
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

/* Where its program was ended, waits until the intake has passed on what it wrote before. */
void await_intake(const log_stream &stream, log_clock::time_point end)
{
    const log_lock hold{g_registry_lock};
    while (stream.drains && stream.intake == intake_state::taken && log_clock::now() < end)
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
        by_itself = !stream->ended.exchange(true);
        if (by_itself)
            give_way(*stream);
        if (by_itself && stream->owns_program)
            change.emplace(stream->kind);
    }
    const auto end = log_clock::now() + (by_itself ? std::chrono::milliseconds(0) : kDrainMax);
    if (by_itself)
        wake(stream);
    else
        await_intake(*stream, end - kGoodByeMax);
    forget_link(*stream);
    close_link(link, end);
    if (change)
        log_locally(stream->kind, *change);
}

bool take_piece(log_link &link, log_reassembly &state, std::span<const unsigned char> piece)
{
    constexpr char kName[] = "log_recv_server_msg";
    if (link.taken) {
        LOG_NOTE("%s: the stream was stopped or started again, what fd[%d] brought is dropped\n", kName, link.fd.get());
        return true;
    }
    if (!state.is_silent())
        LOG_NOTE("%s:recvbuf=%.*s\n", kName, static_cast<int>(piece.size()), reinterpret_cast<const char *>(piece.data()));
    log_proc_tcp_pkg(state, piece);
    return true;
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
    if (wanted)
        await_open_intake(*stream);
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
        LOG_NOTE("%s: the stream was stopped or started anew, close(%d)\n", body, link->fd.get());
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
    count(kLinks, -1);
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

void start_intake(const shared_stream &stream)
{
    set_intake(*stream, intake_state::idle);
    if (!start_thread(names_of(stream->kind).intake_starter, intake_thread_proc, stream))
        set_intake(*stream, intake_state::over);
}

void start_link(const shared_stream &stream)
{
    count(kLinks, +1);
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

/* Over TLS, has the intake taken by this confirmation: false when it was by one before, or a newer start has its own at
 * the path by now. */
bool take_intake(log_kind kind, const shared_stream &stream)
{
    const log_lock hold{g_registry_lock};
    const shared_stream &newest = current(kind);
    const bool moved =
        newest && newest != stream && newest->intake >= intake_state::opening && newest->intake < intake_state::over;
    if (stream && (moved || stream->intake == intake_state::taken))
        return false;
    if (stream && stream->intake == intake_state::waiting)
        stream->intake = intake_state::taken;
    return true;
}

/* No program was connected to it. */
void give_back_intake(const shared_stream &stream)
{
    const log_lock hold{g_registry_lock};
    if (stream && stream->intake == intake_state::taken)
        stream->intake = intake_state::waiting;
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
    publish(kind);
    return {local->get(), local};
}

/* The program that the socket was for was not started: the intake ends. */
void drop_local(const shared_stream &stream)
{
    const log_lock hold{g_registry_lock};
    if (stream)
        stream->local.reset();
}

/* One change of a log's program for the stream, which may be none; nothing when it has ended meanwhile. */
bool begin_change(log_kind kind, const shared_stream &stream, std::optional<log_program_change> &change)
{
    const log_lock hold{g_registry_lock};
    if (stream && stream->ended)
        return false;
    if (stream)
        stream->owns_program = true;
    change.emplace(kind, stream ? &stream->ended : nullptr);
    return true;
}

/* Whether a program could be connected; also below. */
bool confirm_syslog(const shared_stream &stream)
{
    if (!stream)
        return false;
    const program_socket socket = socket_for_program(log_kind::syslog, stream);
    if (socket.fd == -1)
        return false;
    std::optional<log_program_change> change;
    if (!begin_change(log_kind::syslog, stream, change) || !log_write_syslog_to(*change, socket.fd))
        drop_local(stream);
    return true;
}

bool confirm_modem(const shared_stream &stream)
{
    std::optional<log_program_change> change;
    if (!begin_change(log_kind::qxdm, stream, change) || !log_prepare_modem_socket(*change))
        return false;
    const program_socket socket = socket_for_program(log_kind::qxdm, stream);
    if (socket.fd == -1 && g_daemon.use_ssl == 1)
        return false;
    if (!log_write_modem_to(*change, socket.fd))
        drop_local(stream);
    return true;
}

/* ---- The end of the process ---- */

void *end_thread_proc(void *kind)
{
    log_stream_end(*static_cast<const log_kind *>(kind));
    count(kEnds, -1);
    return nullptr;
}

/* Ends the stream behind, with the one before it; the two, or none. */
void end_behind(log_kind &kind, std::span<shared_stream, 2> streams)
{
    {
        const log_lock hold{g_registry_lock};
        streams[0] = current(kind);
        streams[1] = streams[0] ? streams[0]->before : nullptr;
    }
    if (!streams[0])
        return;
    count(kEnds, +1);
    if (log_start_thread("log_streams_end_all", end_thread_proc, &kind) != 0)
        count(kEnds, -1);
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
        LOG_NOTE_AS(kConfirmSource, "the data link was stopped before it was confirmed\n");
    else if (!take_intake(kind, stream))
        LOG_NOTE_AS(kConfirmSource, "the data link has been confirmed before, refused\n");
    else if (!(kind == log_kind::syslog ? confirm_syslog(stream) : confirm_modem(stream)))
        give_back_intake(stream);
}

void log_stream_end(log_kind kind)
{
    shared_stream newest;
    shared_stream before;
    bool is_announced = false;
    std::optional<log_program_change> change;
    {
        const log_lock hold{g_registry_lock};
        newest = std::exchange(current(kind), nullptr);
        if (newest) {
            is_announced = newest->announced;
            before = std::exchange(newest->before, nullptr);
        }
        for (const shared_stream &stream : {newest, before})
            if (stream)
                stream->ended = stream->drains = true;
        change.emplace(kind);
    }
    if (!is_announced)
        wake(newest); /* nothing is on its way there */
    if (kind == log_kind::syslog)
        log_end_syslog(*change);
    else
        change->end_by("diag_mdlog -k");
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

void log_stream_own_program(log_kind kind, bool owns)
{
    const log_lock hold{g_registry_lock};
    if (const shared_stream stream = current(kind)) {
        stream->owns_program = owns;
        if (stream->before)
            stream->before->owns_program = owns;
    }
}

void log_streams_look_after()
{
    for (const log_kind kind : {log_kind::syslog, log_kind::qxdm}) {
        std::shared_ptr<log_link> link;
        {
            const log_lock hold{g_registry_lock};
            if (const shared_stream stream = used_stream(kind))
                link = stream->link;
        }
        if (!link)
            continue;
        log_link_look_after(*link);
        if (link->taken || !link->has_stalled())
            continue;
        LOG_NOTE("%s: the server of fd[%d] takes nothing any more, the stream ends\n", names_of(kind).link_body,
                 link->fd.get());
        shutdown(link->fd.get(), SHUT_RDWR);
    }
}

void log_streams_end_all()
{
    static log_kind kinds[] = {log_kind::syslog, log_kind::qxdm};
    shared_stream streams[2][2];
    for (std::size_t i = 0; i < 2; ++i)
        end_behind(kinds[i], streams[i]);
    {
        const auto end = log_clock::now() + kEndAllMax;
        const log_lock hold{g_registry_lock};
        while (g_threads[kLinks] + g_threads[kEnds] > 0 && log_clock::now() < end)
            g_registry_lock.wait_until(g_change, end);
    }
    for (const auto &pair : streams)
        for (const shared_stream &stream : pair)
            wake(stream); /* its program hangs: the link ends without it */
    const auto end = log_clock::now() + kLinksEndMax;
    const log_lock hold{g_registry_lock};
    while (g_threads[kLinks] > 0 && log_clock::now() < end)
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
