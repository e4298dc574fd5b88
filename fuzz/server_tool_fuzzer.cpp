/*
 * What a log tool may send to the log server. Its device is given the commands in it as they were sent, one at a time and
 * in their order, and only when the tool has asked for that device; and the device is free again when the tool has gone.
 */
#include "fuzz/server_world.h"
#include "tests/frame.h"

namespace
{

/* Answers the command that has come, if there is one: it has to be in what the tool has sent, from `at` on. */
bool answer(const unique_fd &device, const std::string &sent, std::size_t &at)
{
    const std::string command = server_world::receive(device);
    if (command.empty())
        return false;
    const auto parts = parts_of(command);
    promise(parts && parts->size == command.size(), "one command at a time");
    at = sent.find(command, at);
    const bool is_streams = command.find("realtimeLog") != command.npos; /* of the server's own, for a tool's request */
    promise(at != sent.npos || is_streams, "the device is given what the tool has sent");
    at = at == sent.npos ? 0 : at + command.size();
    server_world::send(device, frame(R"({"msgid":")" + message(parts->control).msgid() + R"(","Result":"Success"})"));
    return true;
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    static server_world world;
    if (size > 100000)
        return 0;
    const std::string sent(text_of(data, size));
    unique_fd device = world.call();
    world.send(device, frame(R"({"msgid":"9","ControlLink":{"imei":"1111"}})"));
    world.settle();
    unique_fd tool = world.connect_tool();
    world.send(tool, sent);
    world.settle();
    std::size_t at = 0;
    while (answer(device, sent, at))
        world.settle();
    const std::string got = world.receive(tool);
    std::string_view rest = got;
    for (auto parts = parts_of(rest); parts; parts = parts_of(rest)) {
        promise(json_tree{cJSON_ParseWithLength(parts->control.data(), parts->control.size())} != nullptr, "JSON");
        rest.remove_prefix(parts->size);
    }
    promise(rest.empty(), "whole frames");
    tool.reset();
    world.settle();
    promise(!world.home.devices->find("1111")->is_busy() || !world.receive(device).empty(), "the device is free again");
    device.reset();
    world.settle();
    promise(world.home.devices->all().empty(), "nothing stays of a device that has gone");
    promise(!commands_terminal(world.take_log(), "\n"), "the log cannot command a terminal");
    return 0;
}
