/* Tools that give each of many devices one command through the log server: many_tools SOCKET FIRST_IMEI COUNT AT_ONCE */
#include "server/frame_link.h"

#include <asio/local/stream_protocol.hpp>
#include <cstdio>
#include <cstdlib>

namespace
{

struct commands {
    asio::io_context io{1};
    std::string server;
    std::uint64_t next;
    std::uint64_t end;
    unsigned failed = 0;
};

/* One tool after the other: each has its device say which version it is. */
task<void> work(commands &all)
{
    while (all.next < all.end) {
        const std::string imei = std::to_string(all.next++);
        asio::local::stream_protocol::socket socket(all.io);
        asio::error_code error;
        const asio::local::stream_protocol::endpoint to(all.server);
        co_await socket.async_connect(to, await_into(error));
        const auto link = std::make_shared<frame_link>(std::move(socket), nullptr);
        const std::string request =
            make_frame(R"({"msgid":"device","imei":")" + imei + "\"}") + make_frame(R"({"msgid":"3"})");
        co_await link->send(request);
        const auto given = co_await link->receive();
        bool done = given && given->control.find("Success") != std::string_view::npos;
        const auto reply = co_await link->receive();
        done = done && reply && reply->control.find(imei) != std::string_view::npos;
        all.failed += done ? 0 : 1;
    }
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 5)
        return 2;
    commands all;
    all.server = argv[1];
    all.next = std::strtoull(argv[2], nullptr, 10);
    all.end = all.next + std::strtoull(argv[3], nullptr, 10);
    for (int i = std::atoi(argv[4]); i > 0; --i)
        run_beside(all.io, work(all));
    all.io.run();
    if (all.failed > 0)
        std::fprintf(stderr, "many_tools: %u commands failed\n", all.failed);
    return all.failed == 0 ? 0 : 1;
}
