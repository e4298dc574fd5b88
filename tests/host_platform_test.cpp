#include "device/operator.h"
#include "platform/unique_fd.h"
#include "platform/vex_platform.h"

#include <atomic>
#include <cerrno>
#include <csignal>
#include <ctime>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <random>
#include <sched.h>
#include <sstream>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/resource.h>
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
    }
    void TearDown() override { std::filesystem::remove_all(dir_); }

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

    std::string dir_;
    std::string nv_;
};

/* Nothing is waited for, whatever has the file's name or the one beside it, and it is told once. */
TEST_F(HostPlatform, NvFileThatCannotBeUsedIsTold)
{
    const auto told = [this](const std::string &what) {
        return run_command("cd " + dir_ + "; grep -c 'nvconfig: .*" + what + "' log; : >log; rm -rf nvconfig*");
    };
    for (const auto &[prepare, what] : {std::pair{"mkfifo nvconfig", "is not a plain file"},
                                        {"mkdir nvconfig", "is not a plain file"},
                                        {"truncate -s 1G nvconfig", "more than 1 MB"},
                                        {"echo a=1 >nvconfig; mkdir nvconfig.new", "cannot be written"}}) {
        run_command("cd " + dir_ + "; rm -rf nvconfig*; " + prepare);
        ASSERT_EQ(1, vex_nvconfig_write("b", "2", 1));
        EXPECT_EQ(-1, cfg_save()) << prepare;
        EXPECT_EQ(-1, cfg_save()) << prepare;
        EXPECT_EQ("2", get("b")) << "for as long as the process lives";
        EXPECT_EQ("1\n", told(what)) << prepare;
        EXPECT_EQ(0, cfg_save());
        EXPECT_EQ("2", get("b"));
    }
    const unique_fd lock{open((nv_ + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)};
    ASSERT_EQ(0, flock(lock.get(), LOCK_EX));
    ASSERT_EQ(1, vex_nvconfig_write("b", "3", 1));
    EXPECT_EQ(-1, cfg_save());
    EXPECT_EQ("1\n", told("lock file cannot be had"));
    EXPECT_EQ(0, cfg_save());
}

TEST_F(HostPlatform, NvCommitKeepsWhatItDoesNotChangeAndWaitsForRoom)
{
    const std::string old = "# a comment\nimei=1\n\nimei2=2\nbroken line\nimei=3\nlast=no newline";
    std::ofstream(nv_) << old;
    for (const char *name : {"", "a=b", "#a", "a\nb"})
        EXPECT_EQ(0, vex_nvconfig_write(name, "x", 1)) << name;
    EXPECT_EQ(1, vex_nvconfig_write("cut", "ab\0cd", 5) * vex_nvconfig_write("imei", "356 and more", 3));
    signal(SIGXFSZ, SIG_IGN);
    rlimit limit{};
    getrlimit(RLIMIT_FSIZE, &limit);
    const rlimit full{4, limit.rlim_max};
    setrlimit(RLIMIT_FSIZE, &full);
    EXPECT_EQ(-1, cfg_save());
    setrlimit(RLIMIT_FSIZE, &limit);
    EXPECT_EQ(old, read_file(nv_));
    EXPECT_EQ("ab", get("cut"));
    EXPECT_EQ(0, cfg_save());
    EXPECT_EQ("# a comment\nimei=356\n\nimei2=2\nbroken line\nlast=no newline\ncut=ab\n", read_file(nv_));
    EXPECT_FALSE(std::filesystem::exists(nv_ + ".new"));
    char few[] = "xxxx";
    EXPECT_EQ(0, vex_nvconfig_read("missing", few, 3));
    EXPECT_STREQ("xxxx", few);
    EXPECT_EQ(1, vex_nvconfig_read("imei", few, 2));
    EXPECT_STREQ("35xx", few);
}

TEST_F(HostPlatform, NvWritersLoseNothingToEachOther)
{
    const auto write_items = [](int first) {
        for (int n = first; n < first + 25; ++n)
            set(std::to_string(n), std::to_string(n));
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
        EXPECT_EQ(std::to_string(n), get(std::to_string(n)));
}

/* Processes that write one number after another into two items, each killed at some instant. */
TEST_F(HostPlatform, NvItemsAreOldOrNewWhenKilled)
{
    struct progress {
        std::atomic<int> begun;
        std::atomic<int> done;
    };
    auto *shared = static_cast<progress *>(
        mmap(nullptr, sizeof(progress), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    ASSERT_NE(MAP_FAILED, static_cast<void *>(shared));
    /* Lengths differ, so that a mix of two values would show. */
    const auto value = [](int n) { return std::to_string(n) + std::string(static_cast<std::size_t>(n) % 97, 'v'); };
    std::mt19937 random(20261122);
    set("0", value(0));
    set("1", value(0));
    for (std::string stored[] = {value(0), value(0)}; shared->done < 1000;) {
        const int first = shared->done + 1;
        const pid_t child = fork();
        if (child == 0) {
            for (int n = first;; ++n) {
                shared->begun = n;
                set(std::to_string(n % 2), value(n));
                shared->done = n;
            }
        }
        const int last = first + static_cast<int>(random() % 30);
        while (shared->begun < last) {
            ASSERT_EQ(0, waitpid(child, nullptr, WNOHANG)) << "it has ended by itself";
            sched_yield();
        }
        usleep(static_cast<useconds_t>(random() % 1000)); /* into the middle of a write, wherever that is */
        kill(child, SIGKILL);
        waitpid(child, nullptr, 0);
        for (int n = first; n <= shared->done; ++n)
            stored[n % 2] = value(n);
        for (int i = 0; i < 2; ++i) {
            const bool in_flight = shared->begun > shared->done && shared->begun % 2 == i;
            const std::string now = get(std::to_string(i));
            ASSERT_TRUE(now == stored[i] || (in_flight && now == value(shared->begun))) << now << ' ' << stored[i];
            stored[i] = now;
        }
    }
}

TEST_F(HostPlatform, LogGoesOnInANewFileAfterHangup)
{
    const auto lines = [this](const char *file) { return run_command("sed 's/.* //' " + dir_ + '/' + file); };
    vex_syslog_append(6, "test", 1, 0, "before\n");
    std::filesystem::rename(dir_ + "/log", dir_ + "/log.1");
    vex_syslog_append(6, "test", 1, 0, "moved\n");
    raise(SIGHUP);
    vex_syslog_append(6, "test", 1, 0, "after\n");
    EXPECT_EQ("before\nmoved\n", lines("log.1"));
    EXPECT_EQ("after\n", lines("log"));
}

TEST_F(HostPlatform, LogLinesAreLinesWhateverTheyHold)
{
    errno = EXDEV;
    vex_syslog_append(0, "vex_log_manage", 7, 84, "%s|%d\n\n", "a\x1b[0m\r\n\x7f\\b\xc3\xa4", -5);
    vex_syslog_append(7, "log_tools", 1, 84, "above the level");
    vex_syslog_append(6, "log_tools", 3, 84, "%s", std::string(9000, '\n').c_str());
    EXPECT_EQ(EXDEV, errno);
    std::istringstream lines(read_file(dir_ + "/log"));
    std::string line, longest("Z 6 log_tools:3 ");
    for (int i = 0; i < 4094; ++i)
        longest += "\\x0a";
    for (const std::string &expected :
         {std::string("Z 0 vex_log_manage:7 a\\x1b[0m\\x0d\\x0a\\x7f\\x5cb\xc3\xa4|-5\\x0a"), longest}) {
        tm utc{};
        ASSERT_TRUE(std::getline(lines, line) && strptime(line.c_str(), "%Y-%m-%dT%H:%M:%S.", &utc) != nullptr);
        EXPECT_GE(60, std::abs(std::time(nullptr) - timegm(&utc)));
        EXPECT_EQ(expected, line.substr(26)); /* behind the microseconds */
    }
    EXPECT_FALSE(std::getline(lines, line));
}

} // namespace
