/* The log server without a network, for the fuzz targets: devices and tools are at the other ends of socket pairs. */
#ifndef FUZZ_SERVER_WORLD_H
#define FUZZ_SERVER_WORLD_H

#include "fuzz/fuzz.h"
#include "platform/unique_fd.h"
#include "server/fleet.h"
#include "server/tool_session.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>

class server_world
{
public:
    server_world() : home(io_, options_)
    {
        options_.plain = true;
        home.port = "5000";
        server_log_fd = memfd_create("log", MFD_CLOEXEC);
    }

    /* The other end of a connection that a device, or a tool, has made. */
    unique_fd call()
    {
        return connect([this](auto socket) { return home.devices->take_call(std::move(socket)); });
    }
    unique_fd connect_tool()
    {
        return connect([this](auto socket) {
            return serve_tool(home, std::make_shared<frame_link>(std::move(socket), nullptr), "user");
        });
    }

    /* Goes on until everybody waits. */
    void settle()
    {
        while (io_.poll() > 0) {
        }
        io_.restart();
    }

    /* What the server has written into its log since this was asked last. */
    std::string take_log()
    {
        std::string text(static_cast<std::size_t>(lseek(server_log_fd, 0, SEEK_CUR)), '\0');
        promise(pread(server_log_fd, text.data(), text.size(), 0) == static_cast<ssize_t>(text.size()), "a log");
        promise(ftruncate(server_log_fd, 0) == 0 && lseek(server_log_fd, 0, SEEK_SET) == 0, "an empty log");
        return text;
    }

    static void send(const unique_fd &to, std::string_view bytes)
    {
        promise(bytes.empty() || ::send(to.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT) != 0,
                "sent");
    }

    /* All that has come there. */
    static std::string receive(const unique_fd &from)
    {
        std::string all;
        char piece[65536];
        for (ssize_t n = 0; (n = recv(from.get(), piece, sizeof piece, MSG_DONTWAIT)) > 0;)
            all.append(piece, static_cast<std::size_t>(n));
        return all;
    }

private:
    template <class Serve> unique_fd connect(Serve serve)
    {
        int ends[2];
        promise(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == 0, "a connection");
        const int room = 1 << 20;
        setsockopt(ends[1], SOL_SOCKET, SO_SNDBUF, &room, sizeof room);
        frame_link::socket socket(io_, asio::generic::stream_protocol(AF_UNIX, 0), ends[0]);
        run_beside(io_, serve(std::move(socket)));
        return unique_fd{ends[1]};
    }

    asio::io_context io_{1};
    server_options options_;

public:
    server home;
};

#endif
