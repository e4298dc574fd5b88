/* What the server counts, and tells whoever asks for it over HTTP, in Prometheus' text form. */
#ifndef SERVER_METRICS_H
#define SERVER_METRICS_H

#include "server/io.h"

#include <asio/ip/tcp.hpp>
#include <cstdint>
#include <map>
#include <string>

struct server;

struct server_metrics {
    std::uint64_t handshakes = 0;
    std::map<std::string, std::uint64_t> refused;  /* calls, by the reason */
    std::map<std::string, std::uint64_t> commands; /* by the message id */
    double command_seconds = 0;
    std::uint64_t commands_failed = 0;
    std::uint64_t log_bytes = 0;
    std::uint64_t log_lines = 0; /* of system logs */
    std::uint64_t log_gaps = 0;
    std::uint64_t store_bytes_lost = 0;
    std::uint64_t bus_records = 0;  /* of live logs, that the bus has taken */
    std::uint64_t bus_failures = 0; /* records that have to be sent once more */
};

/* Answers every request with the counts until the server ends. */
task<void> serve_metrics(server &server, asio::ip::tcp::acceptor listener);

#endif
