/* What every part of the server knows: how it was started, who is there, and where it is told. */
#ifndef SERVER_SERVER_H
#define SERVER_SERVER_H

#include "server/io.h"
#include "server/message.h"
#include "server/metrics.h"
#include "server/server_tls.h"

#include <memory>
#include <string>
#include <vector>

class bus;
class fleet;
class log_store;

struct server_options {
    std::string listen = "[::]:5000";
    std::string advertise; /* the address that devices are told to bring live logs to; empty: where they called */
    bool plain = false;    /* else TLS, with these PEM files */
    std::string cert;
    std::string key;
    std::string ca;
    bool imei_in_certificate = false;

    std::string tools = "/run/vex_log_server.sock"; /* a unix socket's path */
    std::string tools_listen;                       /* and a port, over TLS */
    std::string tools_ca;

    std::string store;                          /* a folder; empty: nothing is kept */
    std::uint64_t store_limit = 10'000'000'000; /* bytes */
    std::uint64_t rotate_size = 64 << 20;       /* bytes */
    unsigned store_days = 0;                    /* 0: no limit */
    bool compress = false;
    std::vector<std::string> streams; /* "syslog", "qxdm" */

    std::vector<std::string> nats; /* URLs of the message bus; empty: none */
    std::string nats_credentials;
    std::string nats_ca;
    std::string name;            /* of this server among those on the bus; empty: host and port */
    std::string advertise_tools; /* where tools reach it that another server sends; empty: where it listens for tools */
    std::string spool;           /* a folder for what the bus has not got yet */
    std::uint64_t spool_limit = 1'000'000'000; /* bytes */

    std::string metrics;

    std::chrono::seconds announce_limit{20};
    unsigned per_address = 1024; /* connections of devices */
};

struct server {
    explicit server(asio::io_context &context, const server_options &chosen);
    ~server();

    asio::io_context &io;
    const server_options &options;
    server_metrics metrics;
    tls_endpoint device_tls;
    tls_endpoint tool_tls;
    std::unique_ptr<log_store> store; /* none: nothing is kept; devices use it to their end */
    std::unique_ptr<fleet> devices;
    std::unique_ptr<class bus> bus; /* none: this is the only server */
    std::string port;               /* that devices call */
    std::string name;               /* of this server */
    std::string tools_address;      /* that tools reach it at */
};

/* Where the lines of the server's own log go. */
extern int server_log_fd; /* standard error, unless set otherwise */

/* Such a line: what happened, to whom. */
void server_log(const char *what, const tool_members &members);

/* The same of a device, whose IMEI is the first member; among the store's events, too, and on the bus. */
void server_event(server &server, const char *what, const tool_members &members);

#endif
