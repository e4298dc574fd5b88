#include "soak/device.h"

#include "tests/frame.h"

#include <algorithm>
#include <fstream>
#include <sys/wait.h>

namespace
{

constexpr char kLogFile[] = "/tmp/daemon.log";
constexpr char kNvFile[] = "/etc/vex/nvconfig";

/* More than this, in kB, is a leak. */
const long kMemoryMax = kMemoryIsOurs ? 12 << 10 : 128 << 10;

/* Lines of NV items that commands and start-up write, with what those may hold. */
constexpr char kChanging[] = "^(log_manage_switch=[0-9]+|log_manage_mode=[01]|log_server_addr=[0-9.:]*|"
                             "log_server_port=[0-9]*|syslog_(level|size)=.{0,15}|log_use_ssl_disable=[01]|"
                             "bsplog_module_level=([A-Za-z0-9_.-]{1,31},[A-Za-z0-9_.-]{1,31};)*)$";
constexpr char kLogLine[] = "^[0-9T:.Z-]{27} [06] [a-z_]+:[0-9]+ [^[:cntrl:]]*$";

/* The lines of a file that no pattern is met by. */
std::string others(const char *pattern, const char *file)
{
    return run_command(std::string("LC_ALL=C grep -avE '") + pattern + "' " + file);
}

} // namespace

soak_device::soak_device() : settings_(others(kChanging, kNvFile))
{
    /* Connections leave no trace: the IPv6 listener of the next daemon would have to wait for them to be forgotten. */
    std::ofstream("/proc/sys/net/ipv4/tcp_max_tw_buckets") << 0;
    setenv("ASAN_OPTIONS", "quarantine_size_mb=8", 1);
}

void soak_device::start(const std::vector<std::string> &arguments)
{
    set_nv("log_manage_switch", "100"); /* it counts starts */
    daemon_.emplace(arguments);
}

void soak_device::start_server_mode()
{
    set_nv("log_manage_mode", "0");
    start({});
    daemon_->wait_listening();
    rests();
}

void soak_device::rests()
{
    rest_ = daemon_->used();
}

int soak_device::wait_exit()
{
    const int status = daemon_->wait_exit();
    daemon_.reset();
    return status;
}

bool soak_device::lives() const
{
    siginfo_t end{};
    waitid(P_PID, static_cast<id_t>(daemon_->pid), &end, WEXITED | WNOHANG | WNOWAIT);
    EXPECT_EQ(0, end.si_pid) << "the daemon has ended: " << end.si_code << ", status or signal " << end.si_status;
    return end.si_pid == 0;
}

void soak_device::check_answers()
{
    /* Connections that nobody has accepted so far take the daemon over when they are; these come behind them. */
    for (const char *address : {"127.0.0.1", "::1"})
        tool_connection(address).ask(kAskMode);
    for (const char *address : {"127.0.0.1", "::1"})
        EXPECT_EQ(kOnline, tool_connection(address).ask(kAskMode)) << address;
    const tool_connection tool;
    for (const char *request :
         {R"({"msgid":"1","conf_file":{"totalLength":"0"}})", R"({"msgid":"3"})",
          R"({"msgid":"4","syslogParaSet":{"sysloglevel":"","syslogsize":""}})",
          R"({"msgid":"5","tcpdump":{"InterfaceName":"lan","Action":"end"}})",
          R"({"msgid":"6","realtimeLog":{"LogType":"qxdm","Action":"end"}})",
          R"({"msgid":"8","bsp":{"module_name":"usb","level":""}})", R"({"msgid":"11","mode_lpm_online":"?"})"}) {
        const std::string reply = tool.ask(request);
        EXPECT_EQ(std::string(request, 12), reply.substr(0, 12)) << request << reply;
    }
    check_archive(tool);
}

void soak_device::check_archive(const tool_connection &tool)
{
    std::string data;
    tool.send(frame(R"({"msgid":"2"})"));
    const std::string control = tool.receive(&data);
    constexpr char kBegin[] = R"({"msgid":"2","GetLocalLog":{"totalLength":")";
    ASSERT_TRUE(control.starts_with(kBegin)) << control;
    const std::size_t total = std::stoul(control.substr(sizeof kBegin - 1));
    for (std::string piece; data.size() < total; data += piece)
        ASSERT_EQ(control, tool.receive(&piece));
    EXPECT_EQ(total, data.size());
    std::ofstream("/tmp/archive", std::ios::binary) << data;
    EXPECT_EQ("", total == 0 ? "" : run_command("gzip -t /tmp/archive"));
}

void soak_device::check_bounds()
{
    EXPECT_TRUE(daemon_->settles(rest_)) << run_command("ls -l " + daemon_->proc("fd"));
    memory_most_ = std::max(memory_most_, daemon_->memory());
    EXPECT_LE(daemon_->memory(), kMemoryMax);
}

void soak_device::check_nv() const
{
    EXPECT_EQ(settings_, others(kChanging, kNvFile));
    EXPECT_EQ("", run_command(std::string("grep -a = ") + kNvFile + " | cut -d= -f1 | sort | uniq -d"));
}

void soak_device::check_log() const
{
    EXPECT_EQ("", others(kLogLine, kLogFile));
    if (testing::Test::HasFailure())
        ADD_FAILURE() << run_command("tail -n 30 /tmp/daemon.log; tail -c 2000 /tmp/daemon.out");
    std::ofstream{kLogFile}; /* the next round's is empty */
}

long soak_device::memory() const
{
    return daemon_->memory();
}
