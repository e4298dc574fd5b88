/* Measures the daemon in client mode, on a simulated device: this program is the log server that it calls, over TLS. */
#include "bench/measure.h"
#include "tools/tool_tls.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <netinet/in.h>
#include <sys/socket.h>

namespace
{

constexpr std::uint16_t kPort = 5000;
constexpr std::uint16_t kLibraryPort = 5001; /* of the TLS library's own server */
constexpr int kProcesses = 5;
constexpr int kRounds = 3;
constexpr auto kPatience = std::chrono::seconds(10);

[[noreturn]] void give_up_tls(const std::string &why)
{
    std::fprintf(stderr, "%s\n", why.c_str());
    std::exit(1);
}

/* A receive buffer of one size for all: the kernel's own choice, made for each connection, may double the
 * speed. */
void fix_window(int fd)
{
    const int size = 1 << 20;
    setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
}

unique_fd listen_here()
{
    unique_fd listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const int on = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    fix_window(listener.get()); /* what it accepts inherits it */
    sockaddr_in at{};
    at.sin_family = AF_INET;
    at.sin_port = htons(kPort);
    at.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (bind(listener.get(), reinterpret_cast<const sockaddr *>(&at), sizeof at) != 0 || listen(listener.get(), 8) != 0)
        give_up("listen");
    return listener;
}

/* The server's certificates, and the socket at which it is called. */
struct log_server {
    tls_context context;
    unique_fd listener = listen_here();
};

struct tls_link {
    unique_fd fd;
    tls_session session;

    ssize_t read(void *bytes, std::size_t len) const { return SSL_read(session.get(), bytes, static_cast<int>(len)); }
    void write(const std::string &bytes) const
    {
        if (SSL_write(session.get(), bytes.data(), static_cast<int>(bytes.size())) <= 0)
            give_up("SSL_write");
    }
};

tls_link accept_call(const log_server &server)
{
    tls_link link{unique_fd{accept4(server.listener.get(), nullptr, nullptr, SOCK_CLOEXEC)}, nullptr};
    std::string why;
    link.session = tool_tls_accept(server.context.get(), link.fd.get(), tool_clock::now() + kPatience, why);
    if (!link.session)
        give_up_tls(why);
    return link;
}

/* Reads a frame, with nothing behind it. */
void read_frame(const tls_link &link)
{
    std::string frame;
    char piece[2000];
    while (!frame.ends_with("~#")) {
        const ssize_t n = link.read(piece, sizeof piece);
        if (n <= 0)
            give_up("frame");
        frame.append(piece, static_cast<std::size_t>(n));
    }
}

/* The device's link, its announcement read. */
tls_link accept_device(const log_server &server)
{
    tls_link link = accept_call(server);
    read_frame(link);
    return link;
}

tls_link call_library_server()
{
    static const tls_context context{SSL_CTX_new(TLS_client_method())};
    tls_link link{connect_to(kLibraryPort), tls_session{SSL_new(context.get())}};
    fix_window(link.fd.get());
    SSL_set_fd(link.session.get(), link.fd.get());
    if (SSL_connect(link.session.get()) != 1)
        give_up_tls("the TLS library's own server does not answer");
    return link;
}

/* What a sender took, from the first byte on. */
struct sending_cost {
    double seconds;
    double processor;
};

/*
 * Takes a session's records off its socket until they have brought so many bytes. They are not decrypted, which
 * would cost more than all that the sender does but the same for every sender: the session cannot be read from any
 * more.
 */
sending_cost take_records(const tls_link &link, std::size_t content, pid_t sender)
{
    constexpr std::size_t kHeader = 5;
    constexpr std::size_t kOverhead = 17; /* of a record in TLS 1.3: the type and the tag */
    static unsigned char piece[1 << 18];
    std::size_t at = 0; /* of the next record's header, from the start of the piece */
    std::size_t held = 0;
    sending_cost start{0, 0};
    while (content > 0) {
        const ssize_t n = recv(link.fd.get(), piece + held, sizeof piece - held, 0);
        if (n <= 0)
            give_up("archive");
        if (start.seconds == 0)
            start = {seconds_now(), processor_time(sender)};
        held += static_cast<std::size_t>(n);
        for (; at + kHeader <= held; at += kHeader + (piece[at + 3] << 8 | piece[at + 4]))
            content -= std::min(content, static_cast<std::size_t>(piece[at + 3] << 8 | piece[at + 4]) - kOverhead);
        const std::size_t rest = at < held ? held - at : 0;
        std::memmove(piece, piece + held - rest, rest);
        at -= held - rest;
        held = rest;
    }
    return {seconds_now() - start.seconds, processor_time(sender) - start.processor};
}

double fetch_from_library_server(pid_t server)
{
    const tls_link link = call_library_server();
    link.write("GET /big HTTP/1.0\r\n\r\n");
    return take_records(link, kArchiveSize, server).seconds;
}

double fetch_archive(const tls_link &link, pid_t sender)
{
    constexpr std::size_t kFrames = (kArchiveSize + 51199) / 51200;
    const std::size_t control =
        sizeof R"({"msgid":"2","GetLocalLog":{"totalLength":"268435456"},"Result":"Success"})" - 1;
    link.write(make_frame(R"({"msgid":"2"})"));
    return take_records(link, kArchiveSize + kFrames * (12 + control), sender).seconds;
}

void print_rates(const char *beside, const comparison &s)
{
    std::printf("archive of 256 MB over TLS     %8.0f MB/s   %-17s%8.0f MB/s   ratio %.3f\n",
                kArchiveSize / s.daemon / 1e6, beside, kArchiveSize / s.floor / 1e6, 1 / s.ratio);
}

/* Anew in each round of processes, as what a process happens to have where in memory makes some quicker than others. */
void measure_archive(const log_server &server, const char *floor_client)
{
    stand_in_for_tar();
    const program library_process({"sh", "-c",
                                   "cd /tmp && exec openssl s_server -WWW -quiet -num_tickets 0 -accept " +
                                       std::to_string(kLibraryPort) +
                                       " -cert /tmp/certs/server.crt -key /tmp/certs/server.key"});
    paired_rounds beside_floor;
    paired_rounds beside_library;
    long peak = 0;
    for (int i = 0; i < kProcesses; ++i) {
        const program floor_process({floor_client, "archive", std::to_string(kPort), "/tmp/big"});
        const tls_link floor = accept_call(server);
        const program daemon_process({"vex_log_manage", "-a", "127.0.0.1", "-p", std::to_string(kPort)});
        const tls_link daemon = accept_device(server);
        const auto fetch = [&] { return fetch_archive(daemon, daemon_process.pid()); };
        beside_floor.add(kRounds, fetch, [&] { return fetch_archive(floor, floor_process.pid()); });
        beside_library.add(kRounds, fetch, [&] { return fetch_from_library_server(library_process.pid()); });
        peak = std::max(peak, peak_kib(daemon_process.pid()));
    }
    print_rates("plain program", beside_floor.medians());
    print_rates("openssl s_server", beside_library.medians());
    std::printf("  the daemon's peak memory     %8ld KiB\n", peak);
    restore_tar();
}

/* ---- The relay of a live log, from a local socket to TLS ---- */

constexpr std::size_t kLogSize = 64 << 20;
constexpr char kFloorSocket[] = "/tmp/floor.sock";
constexpr char kCert[] = "/usr/vex/vex_conf/logcert/logclient_cert.crt";
constexpr char kKey[] = "/usr/vex/vex_conf/logcert/logkey.pem";

std::string stream_command(const std::string &action)
{
    return make_frame(R"({"msgid":"6","realtimeLog":{"LogType":"syslog","Action":")" + action +
                      R"(","ip":"127.0.0.1","port":"5000"}})");
}

/* The daemon: a start, the log, an end. */
sending_cost relay_by_daemon(const log_server &server, const tls_link &control, pid_t daemon)
{
    control.write(stream_command("start"));
    const tls_link link = accept_device(server);
    read_frame(control);
    link.write(make_frame(R"({"msgid":"10","DataLink":{"imei":"356938035643809","ConnectType":"syslog_connect"}})"));
    const sending_cost cost = take_records(link, kLogSize, daemon);
    control.write(stream_command("end"));
    read_frame(control);
    return cost;
}

/* A program that listens at kFloorSocket and calls the server; either first, as it likes. */
sending_cost relay_by(const log_server &server, const std::vector<std::string> &words, const char *feeder)
{
    unlink(kFloorSocket);
    const program relay(words);
    const program log_program({feeder, "-R", std::string("unix=") + kFloorSocket});
    const tls_link link = accept_call(server);
    return take_records(link, kLogSize, relay.pid());
}

/* Installs the feeder in place of the device's system log program, and writes stunnel's configuration. */
void prepare_relays(const char *feeder, int write_size)
{
    shell((std::string("cp --remove-destination ") + feeder + " /usr/vex/override/syslogd").c_str());
    shell("head -c 1048576 /dev/urandom >/tmp/feed");
    std::ofstream("/tmp/feed.times") << kLogSize / (1 << 20);
    std::ofstream("/tmp/feed.size") << write_size;
    std::ofstream("/tmp/stunnel.conf") << "foreground=yes\npid=\n[relay]\nclient=yes\naccept=" << kFloorSocket
                                       << "\nconnect=127.0.0.1:" << kPort << "\ncert=" << kCert << "\nkey=" << kKey
                                       << '\n';
}

/* What the daemon is measured beside. */
struct rival {
    const char *name;
    std::vector<std::string> words;
    paired_rounds speed{};
    paired_rounds processor{};
};

void measure_relay(const log_server &server, const std::string &floor_client, const char *feeder, int write_size)
{
    const std::string port = std::to_string(kPort);
    const std::string to_server = "OPENSSL:127.0.0.1:" + port + ",verify=0,cert=" + kCert + ",key=" + kKey;
    rival rivals[] = {{"plain program", {floor_client, "relay", port, kFloorSocket}},
                      {"stunnel", {"stunnel", "/tmp/stunnel.conf"}},
                      {"socat", {"socat", "-u", std::string("UNIX-LISTEN:") + kFloorSocket, to_server}}};
    long peak = 0;
    prepare_relays(feeder, write_size);
    for (int i = 0; i < kProcesses; ++i) {
        const program daemon({"vex_log_manage", "-a", "127.0.0.1", "-p", port});
        const tls_link control = accept_device(server);
        for (int j = 0; j < kRounds; ++j)
            for (rival &other : rivals) {
                const sending_cost floor = relay_by(server, other.words, feeder);
                const sending_cost ours = relay_by_daemon(server, control, daemon.pid());
                other.speed.add(
                    1, [&] { return ours.seconds; }, [&] { return floor.seconds; });
                other.processor.add(
                    1, [&] { return ours.processor; }, [&] { return floor.processor; });
            }
        peak = std::max(peak, peak_kib(daemon.pid()));
    }
    for (const rival &other : rivals) {
        const comparison s = other.speed.medians();
        std::printf(
            "relay of writes of %4d bytes   %8.0f MB/s   %-17s%8.0f MB/s   ratio %.3f, of processor time %.3f\n",
            write_size, kLogSize / s.daemon / 1e6, other.name, kLogSize / s.floor / 1e6, 1 / s.ratio,
            other.processor.medians().ratio);
    }
    std::printf("  the daemon's peak memory     %8ld KiB\n", peak);
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 4)
        return 2;
    prepare_measuring();
    shell((std::string(argv[1]) + "/device/certificates /tmp/certs").c_str());
    log_server server;
    std::string why;
    server.context = tool_tls_server("/tmp/certs/server.crt", "/tmp/certs/server.key", "/tmp/certs/ca.crt", why);
    if (!server.context)
        give_up_tls(why);
    for (const int write_size : {2000, 200})
        measure_relay(server, argv[2], argv[3], write_size);
    measure_archive(server, argv[2]);
    return 0;
}
