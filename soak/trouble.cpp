#include "soak/trouble.h"

#include "platform/unique_fd.h"
#include "tests/daemon.h"

#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <thread>
#include <unistd.h>

namespace
{

constexpr char kFill[] = "/logfs/fill";
const std::string kOverrides = "/usr/vex/override/";
/* By their own path: no program of the device is to be relied on meanwhile. */
const std::string kKill = "/usr/bin/busybox killall -9 ";

} // namespace

device_trouble::device_trouble(soak_tally &tally) : tally_(tally) {}

void device_trouble::run(dice chance, tool_clock::time_point end)
{
    while (tool_clock::now() < end && !testing::Test::HasFailure()) {
        switch (chance.below(5)) {
        case 0:
            program(chance);
            break;
        case 1:
            disk(chance);
            break;
        default:
            call(chance);
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(chance.below(60))); /* trouble comes unannounced */
    }
    mend();
}

void device_trouble::program(dice &chance)
{
    const std::string name =
        chance.one_of({"df", "tar", "cat", "awk", "rm", "mkdir", "sh", "tcpdump", "syslogd", "diag_mdlog", "killall"});
    if (chance.one_in(2)) {
        std::filesystem::remove(kOverrides + name);
        return;
    }
    ++tally_.programs;
    const std::string instead =
        chance.one_of({"exit 1", "exit 0", "kill -9 $$", "exec /usr/bin/head -c 100000 /dev/urandom",
                       "exec /usr/bin/yes 'more than one line, and none of them is what was asked for' 2>/dev/null | "
                       "/usr/bin/head -500",
                       "exec /usr/bin/sleep 1000"});
    hangs_ = hangs_ || instead.ends_with("sleep 1000");
    install_program(name, instead);
}

void device_trouble::disk(dice &chance)
{
    if (chance.one_in(2)) {
        std::filesystem::remove(kFill);
        return;
    }
    ++tally_.disks;
    const unique_fd fill{open(kFill, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600)};
    const std::string block(1 << 16, 'x');
    while (write(fill.get(), block.data(), block.size()) > 0) {
    }
}

void device_trouble::call(dice &chance)
{
    const auto which = static_cast<fault_call>(chance.below(kFaultCalls));
    if (which == kFaultAccept && !chance.one_in(5)) /* the daemon pauses for a second */
        return;
    tally_.calls += failed(which);
    let_fail({.call = which,
              .times = chance.one_in(4) ? 1 + chance.below(3) : 1,
              .error = which == kFaultRecv && chance.one_in(2) ? EINTR : 0,
              .pass = chance.below(chance.one_in(2) ? 3 : 40)});
}

void device_trouble::mend()
{
    for (int call = 0; call < kFaultCalls; ++call) {
        tally_.calls += failed(static_cast<fault_call>(call));
        let_fail({.call = static_cast<fault_call>(call), .times = 0});
    }
    for (const auto &entry : std::filesystem::directory_iterator(kOverrides))
        std::filesystem::remove(entry.path());
    std::filesystem::remove(kFill);
}

void device_trouble::clear_away()
{
    hangs_ = false;
    for (const char *name : {"sleep", "yes", "syslogd", "diag_mdlog", "tcpdump"})
        run_command(kKill + name);
}
