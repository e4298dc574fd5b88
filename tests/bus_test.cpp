#include "tests/daemon.h"

#include <array>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <map>
#include <nats/nats.h>
#include <set>
#include <sys/wait.h>
#include <thread>

namespace
{

constexpr char kUrls[] = "nats://127.0.0.1:4221,nats://127.0.0.1:4222,nats://127.0.0.1:4223";
constexpr int kDevices = 50;
constexpr std::uint64_t kFirst = 100'000'000'000'000; /* IMEI */

/* A program that runs beside the test until it is killed. */
class program
{
public:
    explicit program(std::string line) : line_(std::move(line)) { start(); }
    ~program() { end(SIGKILL); }
    program(const program &) = delete;

    void start()
    {
        pid_ = fork();
        if (pid_ == 0) {
            execl("/bin/sh", "sh", "-c", ("exec " + line_).c_str(), nullptr);
            _exit(127);
        }
    }
    int end(int signal)
    {
        int status = 0;
        if (pid_ != -1) {
            kill(pid_, signal);
            waitpid(pid_, &status, 0);
        }
        pid_ = -1;
        return status;
    }

private:
    const std::string line_;
    pid_t pid_ = -1;
};

program nats_node(int i)
{
    const std::string number = std::to_string(i);
    return program("nats-server -n n" + number + " -a 127.0.0.1 -p 422" + number + " -js -sd /tmp/js" + number +
                   " --cluster_name c --cluster nats://127.0.0.1:522" + number +
                   " --routes nats://127.0.0.1:5221,nats://127.0.0.1:5222,nats://127.0.0.1:5223 >>/tmp/nats" + number +
                   " 2>&1");
}

program log_server(int i)
{
    const std::string number = std::to_string(i);
    return program("vex_log_server --plain --listen 127.0.0.1:500" + number + " --tools /tmp/s" + number + " --nats " +
                   kUrls + " --nats-name s" + number + " --spool /tmp/spool" + number + " --stream syslog 2>>/tmp/log" +
                   number);
}

/* A client of the bus in no language of ours. */
struct bus_client {
    bus_client()
    {
        natsOptions *options = nullptr;
        natsOptions_Create(&options);
        const char *urls[] = {"nats://127.0.0.1:4221", "nats://127.0.0.1:4222", "nats://127.0.0.1:4223"};
        natsOptions_SetServers(options, urls, 3);
        natsOptions_SetMaxReconnect(options, -1);
        natsOptions_SetReconnectWait(options, 100);
        EXPECT_EQ(NATS_OK, natsConnection_Connect(&connection, options));
        natsConnection_JetStream(&stream, connection, nullptr);
        natsOptions_Destroy(options);
    }
    ~bus_client()
    {
        jsCtx_Destroy(stream);
        natsConnection_Destroy(connection);
    }
    /* The answer to a request, or what became of it. */
    std::string ask(const std::string &subject, const std::string &text) const
    {
        natsMsg *reply = nullptr;
        const natsStatus status = natsConnection_RequestString(&reply, connection, subject.c_str(), text.c_str(), 2000);
        std::string said = status != NATS_OK ? natsStatus_GetText(status)
                                             : std::string(natsMsg_GetData(reply),
                                                           static_cast<std::size_t>(natsMsg_GetDataLength(reply)));
        natsMsg_Destroy(reply);
        return said;
    }
    /* How many records the stream has had. */
    std::uint64_t records() const
    {
        jsStreamInfo *info = nullptr;
        const std::uint64_t last =
            js_GetStreamInfo(&info, stream, "vex_log", nullptr, nullptr) == NATS_OK ? info->State.LastSeq : 0;
        jsStreamInfo_Destroy(info);
        return last;
    }
    natsConnection *connection = nullptr;
    jsCtx *stream = nullptr;
};

/* Waits until something is so. */
template <class Condition> bool comes_true(Condition condition)
{
    bool is_true = condition();
    for (int tries = 0; tries < 2 * kPatience / 50 && !is_true; ++tries) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        is_true = condition();
    }
    return is_true;
}

bool is_empty(const char *folder)
{
    return std::filesystem::is_empty(folder);
}

/* What the stream has of the devices' lines. */
struct kept_lines {
    std::map<std::string, std::map<std::uint64_t, int>> times; /* by subject and number */
    std::map<std::string, int> gaps;                           /* told, by subject */
    int all_gaps = 0;
    std::map<std::pair<std::string, std::string>, std::uint64_t> newest; /* number, by subject and server */
    int out_of_order = 0;

    void take(const std::string &subject, const std::string &id, std::string_view lines)
    {
        const std::string server = id.substr(id.find(".s") == id.npos ? 0 : id.rfind(".s"), 3);
        for (std::size_t end; (end = lines.find('\n')) != lines.npos; lines.remove_prefix(end + 1)) {
            const std::string line(lines.substr(0, end));
            if (line.find("# vex_log_server: nothing came for") != line.npos) {
                ++gaps[subject];
                ++all_gaps;
                continue;
            }
            const std::uint64_t number = std::strtoull(line.substr(line.rfind(' ') + 1).c_str(), nullptr, 10);
            EXPECT_NE(0U, number) << line;
            ++times[subject][number];
            std::uint64_t &before = newest[{subject, server}];
            out_of_order += number <= before ? 1 : 0;
            before = number;
        }
    }
};

kept_lines read_all(const bus_client &client)
{
    kept_lines all;
    const std::uint64_t last = client.records();
    for (std::uint64_t number = 1; number <= last; ++number) {
        natsMsg *record = nullptr;
        EXPECT_EQ(NATS_OK, js_GetMsg(&record, client.stream, "vex_log", number, nullptr, nullptr));
        if (record == nullptr)
            break;
        const char *id = "";
        natsMsgHeader_Get(record, "Nats-Msg-Id", &id);
        all.take(natsMsg_GetSubject(record), id,
                 {natsMsg_GetData(record), static_cast<std::size_t>(natsMsg_GetDataLength(record))});
        natsMsg_Destroy(record);
    }
    return all;
}

/* Gives commands over the bus until it is told to stop. */
struct commander {
    explicit commander(const bus_client &client)
        : thread([this, &client] {
              for (std::uint64_t i = 0; !over; ++i) {
                  ++given;
                  const std::string said = client.ask("vex.command." + std::to_string(kFirst + i % kDevices),
                                                      R"({"msgid":"11","mode_lpm_online":""})");
                  ++(said.find("\"Success\"") != said.npos ? done : failed);
              }
          })
    {
    }
    ~commander()
    {
        over = true;
        thread.join();
    }
    std::atomic<bool> over = false;
    std::atomic<long> given = 0, done = 0, failed = 0;
    std::thread thread;
};

/* Every server of both kinds is killed while devices stream. */
TEST(Bus, LosesNothingThatItHasTaken)
{
    std::array<program, 3> nodes{nats_node(1), nats_node(2), nats_node(3)};
    written_log log1("/tmp/log1");
    written_log log2("/tmp/log2");
    std::array<program, 2> servers{log_server(1), log_server(2)};
    ASSERT_TRUE(log1.awaits("the bus is there") && log2.awaits("the bus is there")) << log1.text() << log2.text();
    const bus_client client;
    program devices(std::string(MANY_DEVICES) + " --port 5001 --other-port 5002 --rate 20 --count " +
                    std::to_string(kDevices) + " >/tmp/devices");
    ASSERT_TRUE(log1.awaits("called ", kDevices));
    const auto goes_on = [&client] {
        const std::uint64_t before = client.records();
        return comes_true([&] { return client.records() > before + 2 * kDevices; });
    };
    ASSERT_TRUE(goes_on());
    long given = 0;
    {
        const commander at_work(client);
        for (program &node : nodes) {
            node.end(SIGKILL);
            EXPECT_TRUE(goes_on());
            node.start();
            EXPECT_TRUE(goes_on());
        }
        for (int i : {0, 1}) {
            const written_log &next = i == 0 ? log2 : log1;
            servers[i].end(SIGKILL);
            ASSERT_TRUE(next.awaits("place=\"bus\" what=\"nothing came for", kDevices)) << next.text();
            servers[i].start();
            /* the next one would lose what it says of that in its first 200 ms */
            ASSERT_TRUE(comes_true([&] { return read_all(client).all_gaps >= (i + 1) * kDevices; }));
        }
        ASSERT_TRUE(comes_true([&] { return at_work.done > 2 * kDevices; }));
        given = at_work.given;
    }
    EXPECT_GE(given, log1.count("who=\"the bus\"") + log2.count("who=\"the bus\""));
    const std::string device = std::to_string(kFirst + 7);
    EXPECT_TRUE(comes_true(
        [&] { return run_command("vex_log_tool --server /tmp/s2 devices").find(device) != std::string::npos; }));
    const std::string ask = "vex_log_tool --server /tmp/s2 --device " + device + " raw '{\"msgid\":\"3\"}'";
    EXPECT_TRUE(comes_true([&] { return run_command(ask).find("Success") != std::string::npos; }));
    EXPECT_EQ("No responders available for request", client.ask("vex.command.1", R"({"msgid":"3"})"));

    devices.end(SIGKILL);
    ASSERT_TRUE(log1.awaits("left ", kDevices));
    ASSERT_TRUE(comes_true([] { return is_empty("/tmp/spool1") && is_empty("/tmp/spool2"); }));
    const kept_lines all = read_all(client);
    EXPECT_EQ(kDevices, static_cast<int>(all.times.size()));
    EXPECT_EQ(0, all.out_of_order);
    for (const auto &[subject, numbers] : all.times) {
        int holes = 0;
        std::uint64_t before = 0;
        for (const auto &[number, times] : numbers) {
            EXPECT_EQ(1, times) << subject << ' ' << number;
            holes += number != before + 1 ? 1 : 0;
            before = number;
        }
        EXPECT_GT(120, before - numbers.size()) << subject; /* what killed servers had in hand, and the links to them */
        EXPECT_LE(std::max(holes, 1), all.gaps.at(subject)) << subject;
    }
    EXPECT_EQ(0, servers[0].end(SIGTERM));
    EXPECT_EQ(0, servers[1].end(SIGTERM));
    EXPECT_EQ(0, log1.count("Sanitizer") + log2.count("Sanitizer")) << log1.text() << log2.text();
}

} // namespace
