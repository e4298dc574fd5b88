/*
 * What a caller may send to the log server: its first byte says when. The frames of an answer reach the tool that has
 * given the command as they were sent, and in their order; the caller's words command no terminal; and with its links
 * all that was held for it goes.
 */
#include "fuzz/server_world.h"
#include "tests/frame.h"

namespace
{

/* A device has called, and a tool has it carry out a command. The answer is `sent`. */
void answer(server_world &world, const std::string &command, const std::string &sent)
{
    unique_fd device = world.call();
    world.send(device, frame(R"({"msgid":"9","ControlLink":{"imei":"1111","projectName":"VX"}})"));
    world.settle();
    const unique_fd tool = world.connect_tool();
    world.send(tool, frame(R"({"msgid":"device","imei":"1111"})") + frame(command));
    world.settle();
    promise(world.receive(device) == frame(command), "the device is given the command as it is");
    world.send(device, sent);
    device.reset();
    world.settle();
    const std::string got = world.receive(tool);
    std::string_view rest = got;
    std::size_t at = 0;
    for (auto parts = parts_of(rest); parts; parts = parts_of(rest)) {
        const std::string_view passed = rest.substr(0, parts->size);
        rest.remove_prefix(parts->size);
        if (parts->control.starts_with(R"({"msgid":"device","Result":")")) /* the server's own word */
            continue;
        at = sent.find(passed, at);
        promise(at != sent.npos, "the tool gets what the device has sent");
        at += passed.size();
    }
    promise(rest.empty(), "whole frames");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    static server_world world;
    if (size == 0 || size > 100000)
        return 0;
    const std::string sent(text_of(data, size).substr(1));
    if (data[0] == 'm') {
        answer(world, R"({"msgid":"11"})", sent);
    } else if (data[0] == 'a') {
        answer(world, R"({"msgid":"2"})", sent);
    } else {
        const unique_fd caller = world.call();
        world.send(caller, sent);
        world.settle();
        const unique_fd tool = world.connect_tool();
        world.send(tool, frame(R"({"msgid":"devices"})"));
        world.settle();
        const std::string list = world.receive(tool);
        promise(list.ends_with(frame(R"({"msgid":"devices","Result":"Success"})")), "the others are served");
    }
    world.settle();
    promise(world.home.devices->all().empty(), "nothing stays of a caller that has gone");
    promise(!commands_terminal(world.take_log(), "\n"), "the log cannot command a terminal");
    return 0;
}
