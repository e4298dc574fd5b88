/* A log tool that has connected: what it asks of the server, and the commands that it gives devices. */
#ifndef SERVER_TOOL_SESSION_H
#define SERVER_TOOL_SESSION_H

#include "server/frame_link.h"
#include "server/server.h"

#include <asio/ip/tcp.hpp>
#include <asio/local/stream_protocol.hpp>

/* Serves one tool until it leaves. `who`: its user. */
task<void> serve_tool(server &server, std::shared_ptr<frame_link> link, std::string who);

/* Serve the tools that connect to a unix socket, or over TLS to a port, for ever. */
task<void> serve_local_tools(server &server, asio::local::stream_protocol::acceptor listener);
task<void> serve_remote_tools(server &server, asio::ip::tcp::acceptor listener);

#endif
