#include "core/log_options.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_tools.h"

#include <cstdio>
#include <cstring>
#include <getopt.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

/* Characters: readers of these items have 64 bytes and 16 for them. */
constexpr std::size_t kAddressMax = 63;
constexpr std::size_t kPortMax = 15;

/* Whether an argument can be read back whole; one that cannot changes nothing, which is told. */
bool fits(const char *option, const char *argument, std::size_t max)
{
    const std::size_t len = std::strlen(argument);
    if (len <= max)
        return true;
    LOG_NOTE("%s: argument of %zu characters refused, %zu is the most\n", option, len, max);
    std::fprintf(stderr, "%s: the argument is longer than %zu characters, ignored\n", option, max);
    return false;
}

void set_address(const char *address)
{
    if (!fits("--address", address, kAddressMax))
        return;
    vex_set_nv_item("log_manage_mode", "1", 1);
    vex_set_nv_item("log_server_addr", address, static_cast<int>(std::strlen(address)));
    LOG_NOTE("set vex_log_manage client mode\n");
}

void set_port(const char *port)
{
    if (!fits("--port", port, kPortMax))
        return;
    vex_set_nv_item("log_server_port", port, static_cast<int>(std::strlen(port)));
}

void print_usage(const char *name)
{
    std::printf("\n Usage for %s:\n", name);
    std::puts("\n-a, --address:\t Server IP address");
    std::puts("\n-p, --port:\t Server Port number");
    std::puts("\n-r, --retry:\t Number of retries for connect");
    std::puts("\n-h, --help:\t usage help");
    std::puts("\ne.g. vex_log_manage -a <ip address> -p <port number> -r <num retries>");
}

} // namespace

log_options_result log_parse_options(int argc, char **argv)
{
    static constexpr option kLong[] = {{"address", required_argument, nullptr, 'a'},
                                       {"port", required_argument, nullptr, 'p'},
                                       {"retry", required_argument, nullptr, 'r'},
                                       {"help", no_argument, nullptr, 'h'},
                                       {nullptr, 0, nullptr, 0}};
    int found = 0;
    while ((found = getopt_long(argc, argv, "a:p:r:h", kLong, nullptr)) != -1) {
        if (found == 'a')
            set_address(optarg);
        else if (found == 'p')
            set_port(optarg);
        else if (found == 'r')
            g_daemon.retry_count = log_text_to_int(optarg);
        else if (found == 'h') {
            print_usage(argv[0]);
            return log_options_result::help;
        }
    }
    return log_options_result::run;
}
