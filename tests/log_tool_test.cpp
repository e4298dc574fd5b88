#include "tests/daemon.h"
#include "tests/frame.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <thread>

namespace
{

/* A device that takes one connection, reads a command, sends what it is told to, and stays or closes. */
struct fake_device {
    fake_device(const std::string &says, bool stays)
    {
        sockaddr_in any{};
        any.sin_family = AF_INET;
        socklen_t len = sizeof any;
        EXPECT_EQ(0, bind(listener.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any));
        EXPECT_EQ(0, listen(listener.get(), 1));
        getsockname(listener.get(), reinterpret_cast<sockaddr *>(&any), &len);
        port = std::to_string(ntohs(any.sin_port));
        thread = std::thread([this, says, stays] {
            const unique_fd fd{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
            char piece[4096];
            recv(fd.get(), piece, sizeof piece, 0);
            EXPECT_EQ(static_cast<ssize_t>(says.size()), send(fd.get(), says.data(), says.size(), MSG_NOSIGNAL));
            if (stays)
                recv(fd.get(), piece, sizeof piece, 0); /* until the tool gives up */
        });
    }
    ~fake_device() { thread.join(); }

    unique_fd listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    std::string port;
    std::thread thread;
};

TEST(LogTool, ShowsTheDeviceToPeopleAndScripts)
{
    daemon_process daemon;
    daemon.wait_listening();
    int status = -1;
    EXPECT_EQ(0u, run_command("vex_log_tool version --host ::1", &status)
                      .find("Device at ::1 port 48888\n  model             VX-520\n"));
    EXPECT_EQ(0, status);
    EXPECT_EQ(
        "{\"msgid\":\"11\",\"mode_lpm_online\":\"\",\"Result\":\"Fail:parameter error\"}\n"
        "vex_log_tool: the device answered \"Fail:parameter error\"\n",
        run_command(R"(vex_log_tool --host 127.0.0.1 --json raw '{"msgid":"11","mode_lpm_online":"up"}')", &status));
    EXPECT_EQ(1, status);
}

TEST(LogTool, SaysWhatWentWrongAndWhere)
{
    const std::string whole = frame(R"({"msgid":"3","Result":"Success"})");
    const struct {
        std::string says;
        int status;
        const char *words; /* %: the device's address and port */
    } cases[] = {
        {whole, 0, "Device at %"},
        {frame(R"({"msgid":"3","Result":"Fail:x"})"), 1, "the device answered \"Fail:x\""},
        {frame(""), 1, "the device refused the request"},
        {frame("no JSON"), 1, "the device's reply has no result"},
        {"", 2, "the connection to % ended before the answer was there"},
        {whole.substr(0, 20), 2, "another one may have taken it over"},
        {"HTTP/1.1 400 Bad Request\r\n\r\n", 2, "what % sent is not a frame"},
        {"#~" + big_endian(2049) + std::string(3000, 'c'), 2, "is not a frame"},
        {whole.substr(0, whole.size() - 1) + "!", 2, "is not a frame"},
        {frame(R"({"Result":"\u001b[2J"})"), 1, "answered \"\\x1b[2J\""},
    };
    for (const auto &c : cases) {
        const fake_device device(c.says, false);
        int status = -1;
        const std::string out = run_command("vex_log_tool --host 127.0.0.1 version --port " + device.port, &status);
        std::string words = c.words;
        if (words.find('%') != std::string::npos)
            words.replace(words.find('%'), 1, "127.0.0.1 port " + device.port);
        EXPECT_EQ(c.status, status) << c.words;
        EXPECT_NE(std::string::npos, out.find(words)) << c.words << '\n' << out;
    }
    const auto says = [](const std::string &options, const std::string &words) {
        const std::string out = run_command("vex_log_tool version " + options);
        EXPECT_NE(std::string::npos, out.find(words)) << out;
    };
    says("--host ::1 --port 9", "cannot connect to ::1 port 9: Connection refused");
    const fake_device mute("", true);
    says("--host 127.0.0.1 --reply-timeout 0.2 --port " + mute.port,
         "sent nothing for 0.200 s. Either it is still at work");
    const fake_device slow(whole.substr(0, 20), true);
    says("--host 127.0.0.1 --stall-timeout 0.1 --port " + slow.port,
         "sent nothing for 0.100 s in the middle of an answer");
}

} // namespace
