#include "platform/vex_platform.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <random>
#include <sched.h>
#include <sstream>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace
{

/* A folder of the test's own, where the platform finds its files. */
class HostPlatform : public testing::Test
{
protected:
    void SetUp() override
    {
        dir_ = "/tmp/host_platform_test." + std::to_string(getpid()); /* found out once, by the first call */
        std::filesystem::create_directory(dir_);
        nv_ = dir_ + "/nvconfig";
        setenv("VEX_NV_FILE", nv_.c_str(), 1);
        setenv("VEX_LOG_FILE", (dir_ + "/log").c_str(), 1);
        setenv("VEX_MSG_DIR", dir_.c_str(), 1);
    }
    void TearDown() override { std::filesystem::remove_all(dir_); }

    static std::string read_file(const std::string &path)
    {
        std::ostringstream text;
        text << std::ifstream(path).rdbuf();
        return text.str();
    }

    static void set(const std::string &name, const std::string &value)
    {
        ASSERT_EQ(1, vex_nvconfig_write(name.c_str(), value.data(), static_cast<int>(value.size())));
        ASSERT_EQ(0, cfg_save());
    }

    static std::string get(const std::string &name)
    {
        char value[256] = {};
        return vex_nvconfig_read(name.c_str(), value, sizeof value - 1) == 1 ? value : "(none)";
    }

    /* Name of the item number n. */
    static std::string item(int n)
    {
        std::string name = "item";
        return name += std::to_string(n);
    }

    std::string dir_;
    std::string nv_;
};

TEST_F(HostPlatform, NvFileKeepsWhatItDoesNotChange)
{
    std::ofstream(nv_) << "# a comment\nimei=1\n\nimei2=2\nbroken line\nimei=3\nlast=no newline";
    set("imei", "356");
    set("new", "");
    EXPECT_EQ("# a comment\nimei=356\n\nimei2=2\nbroken line\nlast=no newline\nnew=\n", read_file(nv_));
    EXPECT_EQ("", get("new"));
    EXPECT_EQ("(none)", get("# a comment\nimei"));
    EXPECT_EQ("(none)", get("broken line"));
    for (const char *name : {"", "a=b", "#a", "a\nb"})
        EXPECT_EQ(0, vex_nvconfig_write(name, "x", 1)) << name;
}

TEST_F(HostPlatform, NvValuesComeBackAsTheyWere)
{
    const std::string value = "a=b\\n\r\n#\\\\ \"'%s\t\xff";
    set("odd", value);
    EXPECT_EQ(value, get("odd"));
    EXPECT_EQ("odd=a=b\\\\n\\r\\n#\\\\\\\\ \"'%s\t\xff\n", read_file(nv_));
    ASSERT_EQ(1, vex_nvconfig_write("cut", "ab\0cd", 5));
    ASSERT_EQ(1, vex_nvconfig_write("short", "abcd", 2));
    EXPECT_EQ("ab", get("cut")); /* also before it is committed */
    cfg_save();
    EXPECT_EQ("ab", get("cut"));
    EXPECT_EQ("ab", get("short"));

    char few[4] = {'x', 'x', 'x', 'x'};
    set("long", "1234567");
    EXPECT_EQ(1, vex_nvconfig_read("long", few, 3));
    EXPECT_EQ("123x", std::string(few, 4));
    EXPECT_EQ(0, vex_nvconfig_read("missing", few, 3));
    EXPECT_EQ("123x", std::string(few, 4));
}

TEST_F(HostPlatform, NvReadsSeeWhatAnOperatorEdits)
{
    set("item", "one");
    for (const char *value : {"two", "six", "ten"}) {
        std::ofstream(nv_) << "item=" << value << "\n";
        EXPECT_EQ(value, get("item"));
    }
    std::filesystem::remove(nv_);
    EXPECT_EQ("(none)", get("item"));
}

TEST_F(HostPlatform, NvWriteThatFindsNoRoomIsCommittedLater)
{
    set("item", "old");
    signal(SIGXFSZ, SIG_IGN);
    rlimit limit{};
    getrlimit(RLIMIT_FSIZE, &limit);
    const rlimit full{4, limit.rlim_max};
    setrlimit(RLIMIT_FSIZE, &full);
    ASSERT_EQ(1, vex_nvconfig_write("item", "new", 3));
    EXPECT_EQ(-1, cfg_save());
    setrlimit(RLIMIT_FSIZE, &limit);
    EXPECT_EQ("item=old\n", read_file(nv_));
    EXPECT_EQ("new", get("item"));
    EXPECT_EQ(0, cfg_save());
    EXPECT_EQ("item=new\n", read_file(nv_));
    EXPECT_FALSE(std::filesystem::exists(nv_ + ".new"));
}

TEST_F(HostPlatform, NvWritersLoseNothingToEachOther)
{
    const auto write_items = [](int first) {
        for (int n = first; n < first + 25; ++n)
            set(item(n), std::to_string(n));
    };
    const pid_t child = fork();
    if (child == 0) {
        write_items(0);
        _exit(HasFailure() ? 1 : 0);
    }
    std::thread other(write_items, 25);
    write_items(50);
    other.join();
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_EQ(0, status);
    for (int n = 0; n < 75; ++n)
        EXPECT_EQ(std::to_string(n), get(item(n)));
}

TEST_F(HostPlatform, NvItemsAreOldOrNewWhenKilled)
{
    constexpr int kItems = 8;
    constexpr int kWrites = 1000;
    constexpr int kWritesOfOne = 30; /* of a process, before it waits for its end */
    /* Value of an item after the write number n; lengths differ, so that a mix of two would show. */
    const auto value = [](int n) { return std::to_string(n) + std::string(static_cast<std::size_t>(n) % 97, 'v'); };
    struct progress {
        std::atomic<int> begun;
        std::atomic<int> done;
    };
    auto *shared = static_cast<progress *>(
        mmap(nullptr, sizeof(progress), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    ASSERT_NE(MAP_FAILED, static_cast<void *>(shared));
    std::mt19937 random(20261122);
    std::vector<std::string> stored(kItems, "(none)");
    int kills = 0;
    while (shared->done < kWrites) {
        const int first = shared->done + 1;
        const pid_t child = fork();
        if (child == 0) {
            for (int n = first; n <= std::min(first + kWritesOfOne, kWrites); ++n) {
                shared->begun = n;
                const std::string text = value(n);
                vex_nvconfig_write(item(n % kItems).c_str(), text.data(), static_cast<int>(text.size()));
                if (cfg_save() != 0)
                    _exit(1);
                shared->done = n;
            }
            for (;;)
                pause();
        }
        const int last = first + static_cast<int>(random() % kWritesOfOne);
        while (shared->begun < last && shared->done < kWrites)
            sched_yield();
        usleep(static_cast<useconds_t>(random() % 1000)); /* into the middle of a write, wherever that is */
        kill(child, SIGKILL);
        int status = 0;
        waitpid(child, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status));
        ++kills;

        for (int n = first; n <= shared->done; ++n)
            stored[static_cast<std::size_t>(n % kItems)] = value(n);
        for (int i = 0; i < kItems; ++i) {
            std::string &old = stored[static_cast<std::size_t>(i)];
            const std::string now = get(item(i));
            const bool in_flight = shared->begun > shared->done && shared->begun % kItems == i;
            ASSERT_TRUE(now == old || (in_flight && now == value(shared->begun))) << i << ' ' << now << ' ' << old;
            old = now;
        }
    }
    EXPECT_GE(kills, kWrites / (kWritesOfOne + 1));
    munmap(shared, sizeof(progress));
}

TEST_F(HostPlatform, LogLinesAreLinesWhateverTheyHold)
{
    errno = EXDEV;
    vex_syslog_append(6, "log_tools", 123, 84, "the text\n");
    vex_syslog_append(0, "vex_log_manage", 7, 84, "%s|%d\n\n", "a\x1b[0m\r\n\x7f\\b\xc3\xa4", -5);
    vex_syslog_append(7, "log_tools", 1, 84, "above the level");
    vex_syslog_append(6, "log_tools", 3, 84, "%s", std::string(9000, '\n').c_str());
    EXPECT_EQ(EXDEV, errno);
    std::string log = read_file(dir_ + "/log");
    for (char &c : log)
        c = c >= '0' && c <= '9' ? '9' : c;
    std::string escaped;
    for (int i = 0; i < 4094; ++i)
        escaped += "\\x9a";
    const std::string stamp = "9999-99-99T99:99:99.999999Z ";
    EXPECT_EQ(stamp + "9 log_tools:999 the text\n" + stamp +
                  "9 vex_log_manage:9 a\\x9b[9m\\x9d\\x9a\\x9f\\x9cb\xc3\xa4|-9\\x9a\n" + stamp + "9 log_tools:9 " +
                  escaped + "\n",
              log);
}

TEST_F(HostPlatform, MessagesReachWhoeverIsBound)
{
    unsigned char record[1036] = {};
    record[0] = 0x31;
    record[4] = 23;
    record[1035] = 0x7f;
    EXPECT_EQ(-1, vex_msg_send(record));
    const int receiver = socket(AF_UNIX, SOCK_DGRAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    (dir_ + "/23").copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(0, bind(receiver, reinterpret_cast<const sockaddr *>(&address), sizeof address));
    EXPECT_EQ(0, vex_msg_send(record));
    unsigned char got[2048];
    ASSERT_EQ(1036, recv(receiver, got, sizeof got, 0));
    EXPECT_EQ(0, std::memcmp(record, got, sizeof record));
    int sent = 0;
    while (sent < 100000 && vex_msg_send(record) == 0)
        ++sent;
    EXPECT_LT(sent, 100000); /* a full queue refuses instead of waiting */
    close(receiver);
}

} // namespace
