#include "soak/tools.h"

#include "soak/peer.h"

#include <gtest/gtest.h>
#include <optional>
#include <vector>

namespace
{

constexpr char kPort[] = "48888";

/* Sends a package in frames of any size, each answered or not. */
bool upload(soak_peer &peer, dice &chance)
{
    const std::string package = random_package(chance);
    const std::string total =
        std::to_string(package.size() + static_cast<std::size_t>(chance.one_of({0, 0, 0, 1, 9999})));
    for (std::size_t at = 0; at < package.size();) {
        const std::string piece = package.substr(at, 1 + static_cast<std::size_t>(chance.below(9000)));
        if (!peer.say({"1", R"({"msgid":"1","conf_file":{"totalLength":")" + total + "\"}}", piece}) ||
            !peer.listen(20))
            return false;
        at += piece.size();
    }
    return true;
}

/* One thing that a tool does; false when it should connect again. */
bool act(soak_peer &peer, dice &chance)
{
    switch (chance.below(10)) {
    case 0:
        return peer.say(random_nonsense(chance));
    case 1:
        return upload(peer, chance);
    case 2: /* stalls, perhaps in the middle of a frame */
        return (chance.one_in(2) || peer.say(random_nonsense(chance).substr(0, 30))) && peer.listen(chance.below(60));
    case 3: /* asks for more than it wants to read */
        for (int i = chance.below(40); i > 0; --i)
            if (!peer.say(random_command(chance, "")))
                return false;
        return true;
    default:
        return peer.say(random_command(chance, "")) && peer.listen(chance.below(250));
    }
}

} // namespace

void run_random_tools(dice chance, soak_tally &tally, tool_clock::time_point end)
{
    std::vector<soak_peer> forgotten; /* connections that nobody uses or closes for a while */
    std::string why;
    while (tool_clock::now() < end && !testing::Test::HasFailure()) {
        const char *const host = chance.one_of({"127.0.0.1", "192.168.0.1", "::1"});
        std::optional<tool_link> link = tool_connect(host, kPort, {}, "", why);
        if (!link)
            continue;
        soak_peer peer{std::move(*link), tally};
        for (int steps = chance.below(12); steps > 0 && act(peer, chance);)
            --steps;
        switch (chance.below(4)) {
        case 0:
            peer.reset();
            break;
        case 1:
            shutdown(peer.link.fd.get(), SHUT_WR);
            forgotten.push_back(std::move(peer));
            break;
        case 2:
            forgotten.push_back(std::move(peer));
            break;
        default:
            break; /* closes it */
        }
        if (forgotten.size() > 8)
            forgotten.erase(forgotten.begin() + chance.below(8));
    }
}
